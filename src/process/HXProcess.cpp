#include "process/HXProcess.h"

#include "model/HXHeftSwitches.h"
#include "platform/HXPlatform.h"
#include "platform/capture/HXFixedText.h"
#include "process/HXKernelProcess.h"
#include "process/HXProcessSnapshot.h"
#include "process/HXUserProcess.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

namespace {

std::vector<std::string> &globalErrorList() {
    static std::vector<std::string> list;
    return list;
}

// The path in an argument area: after the count's first zero byte and the zeros that follow it. None when the
// area ends first. The count is a little-endian word, so for counts below 256 this is the executable's path.
std::optional<std::string_view> pathInArgumentArea(char *area, size_t length) {
    if (length == 0) return std::nullopt;
    area[length - 1] = '\0';
    const std::string_view text(area, length);
    const size_t path = text.find_first_not_of('\0', text.find('\0'));
    if (path == std::string_view::npos) return std::nullopt;
    return std::string_view(area + path);
}

} // namespace

std::string_view HXLastPathComponent(std::string_view path) {
    while (path.size() > 1 && path.back() == '/')
        path.remove_suffix(1);
    if (path == "/") return path;
    const size_t slash = path.rfind('/');
    return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

std::unique_ptr<HXProcess> HXProcess::processWithBsdInfo(const proc_bsdinfo &info,
                                                         HXProcessSnapshot &snapshot) {
    std::unique_ptr<HXProcess> process;
    if (info.pbi_flags & PROC_FLAG_SYSTEM)
        process = std::make_unique<HXKernelProcess>();
    else
        process = std::make_unique<HXUserProcess>();
    return process->initWithBsdInfo(info, &snapshot) ? std::move(process) : nullptr;
}

std::unique_ptr<HXProcess> HXProcess::processWithPid(int32_t pid, HXProcessSnapshot &snapshot) {
    const auto info = snapshot.bsdInfoOfPid(pid);
    return info ? processWithBsdInfo(*info, snapshot) : nullptr;
}

std::unique_ptr<HXProcess> HXProcess::unansweringProcess(const HXProcess &process) {
    auto record = std::make_unique<HXProcess>();
    record->setPid(process.pid());
    record->setName(process.name());
    record->setDisplayString(process.displayString());
    record->setPageSize(process.pageSize());
    record->setIs64bit(process.is64bit());
    record->setHiddenFromDisplay(process.hiddenFromDisplay());
    record->_errors.push_back(record->displayString() + ": not answering");
    return record;
}

bool HXProcess::initWithBsdInfo(const proc_bsdinfo &info, HXProcessSnapshot *snapshot) {
    setPid(info.pbi_pid);
    _is64bit = (info.pbi_flags & PROC_FLAG_LP64) != 0;
    if (!_populateTask(snapshot)) return false;
    _name = snapshot ? snapshot->nameOf(info) : _nameForBsdInfoCommName(info);
    _displayString = _name + " [" + std::to_string(pid()) + "]";
    setPageSize(_gatherPageSize());
    return true;
}

HXProcess::Map HXProcess::removeIdleExitCleanProcessesFrom(Map processes) {
    std::erase_if(processes,
                  [](const auto &entry) { return entry.second->idleExitStatus() == HXIdleExitClean; });
    return processes;
}

uint32_t HXProcess::_gatherPageSize() {
    return HXPlatform::current().vm_kernel_page_size();
}

bool HXProcess::breakDownPhysHeft() const {
    return HXHeftSwitches::breakDownPhysHeft();
}

void HXProcess::_addGlobalError(std::string error) {
    globalErrorList().push_back(std::move(error));
}

void HXProcess::_clearGlobalErrors() {
    globalErrorList().clear();
}

std::vector<std::string> HXProcess::globalErrors() {
    return globalErrorList();
}

std::string HXProcess::_nameForBsdInfoCommName(const proc_bsdinfo &info) {
    if (info.pbi_name[0] != '\0') return std::string(HXTextOfField(info.pbi_name));
    if (info.pbi_comm[0] != '\0') return std::string(HXTextOfField(info.pbi_comm));
    return "Unknown";
}

std::string HXProcess::_nameForBsdInfo(const proc_bsdinfo &info) {
    HXPlatform &platform = HXPlatform::current();
    if (platform.isNamedByRecord(info)) return _nameForBsdInfoCommName(info);
    const int32_t maximumName[] = {CTL_KERN, KERN_ARGMAX};
    int32_t maximum = 0;
    size_t length = sizeof maximum;
    if (platform.sysctl(maximumName, 2, &maximum, &length) != 0 || maximum <= 0)
        return _nameForBsdInfoCommName(info);

    // Not by new, for whose failures the programs end.
    const std::unique_ptr<char, decltype(&std::free)> area(
        static_cast<char *>(std::malloc(static_cast<size_t>(maximum))), std::free);
    if (!area) return _nameForBsdInfoCommName(info);
    const int32_t areaName[] = {CTL_KERN, KERN_PROCARGS2, info.pbi_pid};
    length = static_cast<size_t>(maximum);
    if (platform.sysctl(areaName, 3, area.get(), &length) != 0) return _nameForBsdInfoCommName(info);

    const auto path = pathInArgumentArea(area.get(), length);
    return path ? std::string(HXLastPathComponent(*path)) : _nameForBsdInfoCommName(info);
}
