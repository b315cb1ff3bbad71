#include "record/HXMachineRecorder.h"

#include "platform/HXRegionTags.h"
#include "platform/capture/HXFixedText.h"
#include "platform/capture/HXMachineFormat.h"
#include "record/HXAnswer.h"
#include "record/HXLedger.h"
#include "record/HXProcessRecorder.h"

#include <algorithm>

using namespace HXMachineFormat;

namespace {

constexpr int32_t kKernelPid = 0;

} // namespace

HXMachineRecorder::HXMachineRecorder(HXPlatform &host, std::FILE *out, bool anonymize)
    : _host(host), _out(out), _anonymize(anonymize), _writer(format) {}

bool HXMachineRecorder::write(const std::string &text) {
    return std::fwrite(text.data(), 1, text.size(), _out) == text.size();
}

bool HXMachineRecorder::record(const std::vector<int32_t> &pids) {
    HXRegionHeftSetting setting(_host);
    const bool withKernel = pids.empty() || std::find(pids.begin(), pids.end(), 0) != pids.end();
    _facts.ledger = HXLedgerNames(_host);
    _listed = listedPids();
    // The host's record comes first and says whether the kernel told of its memory.
    if (withKernel) recordKernel();
    const std::string kernel = _writer.written();
    _writer.clear();
    _writer.header();
    recordHost(setting.found());
    if (!write(_writer.written()) || !write(kernel)) return false;
    std::vector<int32_t> chosen = pids.empty() ? _listed.value_or(std::vector<int32_t>()) : pids;
    std::erase(chosen, _host.getpid());
    if (!recordProcesses(chosen, setting)) return false;
    _writer.clear();
    if (_hasKernel) recordHeldByKernel(pids.empty());
    recordTags(_tags);
    return write(_writer.written()) && std::fflush(_out) == 0;
}

bool HXMachineRecorder::recordProcesses(const std::vector<int32_t> &chosen, HXRegionHeftSetting &setting) {
    const auto newRecorder = [&] {
        return std::make_shared<HXProcessRecorder>(_host, _facts, setting,
                                                   _anonymize ? &_anonymizer : nullptr);
    };
    auto process = newRecorder();
    HXProcessSnapshot tasks(_host);
    const std::set<int32_t> unanswering = examineTogether(chosen, setting, tasks);
    for (const int32_t pid : chosen) {
        const bool listed = !_listed || std::binary_search(_sorted.begin(), _sorted.end(), pid);
        const auto isWhole = std::make_shared<bool>(false);
        const auto task = std::make_shared<HXTaskPort>(_host);
        const kern_return_t error =
            pid == kKernelPid ? kern_return_t{KERN_FAILURE} : tasks.takeTask(pid, task.get());
        if (error == KERN_OPERATION_TIMED_OUT || unanswering.contains(pid)) {
            std::fprintf(stderr, "heft-record: %d is left out: %s\n", pid, kNotAnswering);
            static std::vector<HXTaskPort> kept; // what somebody may still be using
            kept.push_back(std::move(*task));
            continue;
        }
        const bool isAnswered = HXIsAnswered(_host.services(), [process, isWhole, pid, listed, task, error] {
            *isWhole = process->record(pid, listed, std::move(*task), error);
        });
        if (!isAnswered || !*isWhole) {
            const char *problem = isAnswered ? process->problem().c_str() : kNotAnswering;
            std::fprintf(stderr, "heft-record: %d is left out: %s\n", pid, problem);
            if (isAnswered) continue;
            process->abandon();
            process = newRecorder();
            continue;
        }
        if (!write(process->head()) || !write(process->body())) return false;
        _tags.insert(process->tags().begin(), process->tags().end());
        _hasRecords = true;
        _hasKernel |= pid == kKernelPid;
        if (pid == kKernelPid) continue;
        _readCount += error == KERN_SUCCESS;
        _unreadableCount += error != KERN_SUCCESS && error != KERN_FAILURE; // which is that of a zombie
    }
    return true;
}

// Opens the tasks and lets the host find out what they share; the pids of those that do not answer. With
// what the memory objects see, which a host may have to read in another way.
std::set<int32_t> HXMachineRecorder::examineTogether(std::vector<int32_t> pids, HXRegionHeftSetting &setting,
                                                     HXProcessSnapshot &tasks) {
    std::erase(pids, kKernelPid);
    tasks.openTasks(pids);
    if (setting.found()) setting.set(0);
    const std::vector<int32_t> unanswering = _host.examineTogether([] { return false; });
    return {unanswering.begin(), unanswering.end()};
}

// The pids in the host's order; also sorted, in _sorted.
std::optional<std::vector<int32_t>> HXMachineRecorder::listedPids() {
    constexpr size_t spare = 64; // processes that come meanwhile
    std::vector<int32_t> pids;
    int32_t count = _host.proc_listallpids(nullptr, 0);
    while (count >= 0 && static_cast<size_t>(count) >= pids.size()) {
        pids.resize(static_cast<size_t>(count) + spare);
        count = _host.proc_listallpids(pids.data(), static_cast<uint32_t>(pids.size() * sizeof(int32_t)));
    }
    if (count < 0) return std::nullopt;
    pids.resize(static_cast<size_t>(count));
    _sorted = pids;
    std::sort(_sorted.begin(), _sorted.end());
    return pids;
}

void HXMachineRecorder::recordHost(const std::optional<int32_t> &selfRegionHeft) {
    constexpr int32_t argMaxName[] = {CTL_KERN, KERN_ARGMAX};
    size_t bytes = sizeof _facts.argMax;
    (void)_host.sysctl(argMaxName, 2, &_facts.argMax, &bytes); // else the default
    _facts.pageSize = _host.vm_kernel_page_size();
    _facts.pid = _host.getpid();
    _facts.euid = _host.geteuid();
    _facts.sharedRegion = _host.hasSharedRegion();
    _facts.listPidsError = !_listed;
    _writer.begin(hostRecord);
    _writer.numbers(&_facts);
    if (selfRegionHeft) _writer.number(Host::selfRegionHeft, *selfRegionHeft != 0);
    if (_facts.ledger) {
        std::string names;
        for (std::string name : *_facts.ledger) {
            std::replace(name.begin(), name.end(), ',', '?'); // the comma joins them
            names += (names.empty() ? "" : ",") + name;
        }
        _writer.text(Host::ledger, names);
    }
    _writer.end();
}

void HXMachineRecorder::recordKernel() {
    HXKernelArray<mach_zone_name> names(_host);
    HXKernelArray<mach_zone_info> zones(_host);
    HXKernelArray<mach_memory_info_record> sites(_host);
    _facts.memoryInfoError = _host.mach_memory_info(_host.mach_host_self(), &names.array, &names.count,
                                                    &zones.array, &zones.count, &sites.array, &sites.count);
    if (_facts.memoryInfoError != KERN_SUCCESS) return;
    for (uint32_t i = 0; i < std::min(names.count, zones.count); i++) {
        _writer.begin(zoneRecord);
        _writer.text(ZoneOrSite::name, HXTextOfField(names.array[i].mzn_name));
        _writer.numbers(&zones.array[i]);
        _writer.end();
    }
    std::set<uint64_t> code;
    for (const mach_memory_info_record &site : sites.records()) {
        _writer.begin(siteRecord);
        _writer.numbers(&site);
        _writer.text(ZoneOrSite::name, HXTextOfField(site.name));
        _writer.end();
        if ((site.flags & VM_KERN_SITE_TYPE) == VM_KERN_SITE_KERNEL) code.insert(site.site);
    }
    for (const OSKextInfo &kext : _host.OSKextCopyLoadedKextInfo()) {
        _writer.begin(kextRecord);
        _writer.number(Kext::loadTag, kext.OSBundleLoadTag);
        if (kext.CFBundleIdentifier) _writer.text(Kext::bundleID, *kext.CFBundleIdentifier);
        _writer.end();
    }
    recordSymbols(code);
}

// Of each symbol only the byte that is asked for is recorded: where it begins and ends the host does not say.
void HXMachineRecorder::recordSymbols(const std::set<uint64_t> &addresses) {
    const HXSymbolicatorGuard symbolicator =
        HXSymbolicatorOfKernel(_host, _host.RVSymbolicatorGetFlagsForNListOnlyData());
    if (symbolicator == nullptr) return;
    for (const uint64_t address : addresses) {
        const RVSymbol symbol =
            _host.RVSymbolicatorGetSymbolWithAddressAtTime(symbolicator.get(), address, kRVNow);
        const RVSourceInfo source =
            _host.RVSymbolicatorGetSourceInfoWithAddressAtTime(symbolicator.get(), address, kRVNow);
        const bool hasSource = !source.isNull && source.path != nullptr;
        if (symbol.name == nullptr && !hasSource) continue;
        _writer.begin(symbolRecord);
        _writer.number(Symbol::address, address);
        _writer.number(Symbol::size, 1);
        if (symbol.name != nullptr) _writer.text(Symbol::name, symbol.name);
        if (hasSource) {
            _writer.text(Symbol::path, source.path);
            _writer.number(Symbol::line, static_cast<uint32_t>(source.lineNumber));
        }
        _writer.end();
    }
}

// After all processes, whose places it is found in. What is left of the whole means nothing where processes
// are left out.
void HXMachineRecorder::recordHeldByKernel(bool isWholeMachine) {
    const auto held = std::make_shared<std::vector<task_held_object>>();
    if (!HXIsAnswered(_host.services(),
                      [held, &host = _host] { *held = host.host_held_objects(host.mach_host_self()); }))
        return;
    for (task_held_object &object : *held) {
        if (object.flags & TASK_HELD_WHOLE && !isWholeMachine) continue;
        const size_t path = object.name.find('/');
        if (_anonymize && path != std::string::npos)
            object.name = object.name.substr(0, path) + _anonymizer.path(object.name.substr(path));
        HXRecordHeld(object, 0, &_writer);
    }
}

void HXMachineRecorder::recordTags(const std::set<uint32_t> &tags) {
    for (const uint32_t tag : tags) {
        if (tag > HXHostTagLastNamed) break; // the rest are the program's own
        const auto name = _host.GXRegionTypeDescriptionForTagShareProtAndPager(tag, 0, 0, 0);
        if (!name) continue;
        const bool fromProgram = tag >= HXHostTagFirstNamed && tag <= HXHostTagLastNamed;
        _writer.begin(tagRecord);
        _writer.number(Tag::tag, tag);
        _writer.text(Tag::name, _anonymize && fromProgram ? _anonymizer.memoryName(*name) : *name);
        _writer.end();
    }
}
