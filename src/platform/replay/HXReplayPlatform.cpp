// HXReplayPlatform: processes, settings, images and the kernel's own memory.
#include "platform/replay/HXReplayPlatform.h"

#include "platform/HXSafeText.h"
#include "platform/capture/HXFixedText.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>

namespace {

int32_t failWith(int error) {
    errno = error;
    return -1;
}

// Hands out as much of a result as there is room for, the way sysctl(3) does: without a buffer its length.
int32_t handOut(const void *result, size_t bytes, void *old, size_t *oldBytes) {
    const size_t copied = old == nullptr ? bytes : std::min(bytes, *oldBytes);
    if (old != nullptr) std::memcpy(old, result, copied);
    *oldBytes = copied;
    return 0;
}

// Hands out a number, for which there must be room.
template <class Number>
int32_t handOutNumber(Number number, void *old, size_t *oldBytes) {
    if (oldBytes == nullptr) return 0;
    if (old != nullptr && *oldBytes < sizeof number) return failWith(ENOMEM);
    return handOut(&number, sizeof number, old, oldBytes);
}

// A copy of `records` that `vm_deallocate` gives back; null when there is no memory for it.
template <class Record>
void *copyOf(const std::vector<Record> &records) {
    const size_t bytes = records.size() * sizeof(Record);
    void *const copy = std::malloc(std::max<size_t>(bytes, 1));
    if (copy != nullptr && bytes > 0) std::memcpy(copy, records.data(), bytes);
    return copy;
}

// `process` is null for the kernel's.
class Symbolicator : public RVSymbolicator {
  public:
    explicit Symbolicator(const HXMachineProcess *ofProcess) : process(ofProcess) {}
    const HXMachineProcess *const process;
};

} // namespace

std::string_view HXReplayPlatform::text(uint32_t string) const {
    return string == kNoString ? std::string_view() : _machine.strings.text(string);
}

int32_t HXReplayPlatform::proc_listallpids(int32_t *pids, uint32_t bufferBytes) {
    if (_machine.host.listPidsError) return failWith(EPERM);
    const size_t room = pids == nullptr ? SIZE_MAX : bufferBytes / sizeof(int32_t);
    size_t count = 0;
    for (const HXMachineProcess &process : _machine.processes) {
        if (count == room) break;
        if (!process.listed) continue;
        if (pids != nullptr) pids[count] = process.pid;
        count++;
    }
    return static_cast<int32_t>(count);
}

int32_t HXReplayPlatform::proc_pidinfo(int32_t pid, int32_t flavor, uint64_t, void *buffer,
                                       uint32_t bufferBytes) {
    const HXMachineProcess *const process = _machine.process(pid);
    const auto failed = [](int error) {
        errno = error;
        return 0;
    };
    const auto answer = [&](const auto &info) {
        if (bufferBytes < sizeof info) return failed(ENOMEM);
        std::memcpy(buffer, &info, sizeof info);
        return static_cast<int32_t>(sizeof info);
    };
    if (process == nullptr) return failed(ESRCH);
    if (flavor == PROC_PIDTBSDINFO) {
        if (!process->readable) return failed(EPERM);
        proc_bsdinfo info{};
        info.pbi_flags = process->flags;
        info.pbi_status = process->status;
        info.pbi_pid = process->pid;
        info.pbi_ppid = process->ppid;
        HXFillText(info.pbi_comm, text(process->comm));
        HXFillText(info.pbi_name, text(process->name));
        return answer(info);
    }
    if (flavor != PROC_PIDT_SHORTBSDINFO) return failed(EINVAL);
    const HXMachineFate fate = stateOf(pid)->fate;
    if (fate == HXMachineFate::gone) return failed(ESRCH);
    proc_bsdshortinfo info{};
    info.pbsi_pid = process->pid;
    info.pbsi_ppid = process->ppid;
    info.pbsi_status = fate == HXMachineFate::zombie ? SZOMB : process->status;
    HXFillText(info.pbsi_comm, text(process->comm));
    info.pbsi_flags = process->flags;
    return answer(info);
}

int32_t HXReplayPlatform::proc_pid_rusage(int32_t pid, int32_t flavor, rusage_info_v4 *info) {
    const HXMachineProcess *const process = _machine.process(pid);
    if (process == nullptr) return failWith(ESRCH);
    if (flavor != RUSAGE_INFO_V4) return failWith(EINVAL);
    if (!process->heft) return failWith(EPERM);
    *info = {};
    info->ri_phys_heft = *process->heft;
    info->ri_lifetime_max_phys_heft = process->heftPeak;
    return 0;
}

int32_t HXReplayPlatform::proc_get_dirty(int32_t pid, uint32_t *flags) {
    const HXMachineProcess *const process = _machine.process(pid);
    if (process == nullptr) return failWith(ESRCH);
    if (!process->dirtyFlags) return failWith(ENOTSUP);
    *flags = *process->dirtyFlags;
    return 0;
}

int32_t HXReplayPlatform::sysctl(const int32_t *name, uint32_t nameLength, void *old, size_t *oldBytes) {
    if (nameLength == 2 && name[0] == CTL_KERN && name[1] == KERN_ARGMAX)
        return handOutNumber(_machine.host.argMax, old, oldBytes);
    if (nameLength == 3 && name[0] == CTL_KERN && name[1] == KERN_PROCARGS2)
        return argumentArea(name[2], old, oldBytes);
    return failWith(ENOENT);
}

int32_t HXReplayPlatform::argumentArea(int32_t pid, void *old, size_t *oldBytes) const {
    const HXMachineProcess *const process = _machine.process(pid);
    if (process == nullptr) return failWith(ESRCH);
    if (process->argsPath == kNoString) return failWith(EINVAL);
    std::string area(reinterpret_cast<const char *>(&process->argc), sizeof process->argc);
    area += text(process->argsPath);
    area += '\0';
    return handOut(area.data(), std::min<size_t>(area.size(), _machine.host.argMax), old, oldBytes);
}

int32_t HXReplayPlatform::sysctlbyname(const char *name, void *old, size_t *oldBytes, const void *newValue,
                                       size_t newBytes) {
    const std::string_view setting = name;
    if (setting == kSelfRegionHeftSetting) return selfRegionHeft(old, oldBytes, newValue, newBytes);
    if (setting == kOwnedObjectsSetting) return ownedObjects(old, oldBytes, newValue, newBytes);
    return failWith(ENOENT);
}

int32_t HXReplayPlatform::selfRegionHeft(void *old, size_t *oldBytes, const void *newValue, size_t newBytes) {
    if (!_machine.host.selfRegionHeft) return failWith(ENOENT);
    int32_t value = 0;
    if (newValue != nullptr && newBytes != sizeof value) return failWith(EINVAL);
    if (handOutNumber(_selfRegionHeft.load(), old, oldBytes) != 0) return -1;
    if (newValue == nullptr) return 0;
    std::memcpy(&value, newValue, sizeof value);
    _selfRegionHeft = value;
    return 0;
}

int32_t HXReplayPlatform::ownedObjects(void *old, size_t *oldBytes, const void *newValue, size_t newBytes) {
    mach_port_t task = 0;
    if (newValue == nullptr || newBytes != sizeof task || oldBytes == nullptr) return failWith(EINVAL);
    std::memcpy(&task, newValue, sizeof task);
    const HXMachineProcess *const process = taskOf(task).process;
    if (process == nullptr) return failWith(EINVAL);
    if (process->owned.empty() && !process->ownedNone) return failWith(static_cast<int>(process->ownedError));
    const uint64_t count = process->owned.size();
    std::vector<char> reply(sizeof count + count * sizeof(owned_vmobject));
    std::memcpy(reply.data(), &count, sizeof count);
    if (count > 0)
        std::memcpy(reply.data() + sizeof count, process->owned.data(), reply.size() - sizeof count);
    return handOut(reply.data(), reply.size(), old, oldBytes);
}

int32_t HXReplayPlatform::ledger(int32_t command, int32_t pid, void *buffer, int64_t *count) {
    if (!_machine.host.ledger) return failWith(ENOSYS);
    const std::vector<std::string> &names = *_machine.host.ledger;
    const size_t filled = std::min(names.size(), static_cast<size_t>(std::max<int64_t>(*count, 0)));
    if (command == LEDGER_TEMPLATE_INFO) {
        auto *const entries = static_cast<ledger_template_info *>(buffer);
        for (size_t i = 0; i < filled; i++) {
            entries[i] = {};
            HXFillText(entries[i].lti_name, HXCutText(names[i], sizeof entries[i].lti_name - 1));
        }
    } else if (command == LEDGER_ENTRY_INFO) {
        const HXMachineProcess *const process = _machine.process(pid);
        if (process == nullptr) return failWith(ESRCH);
        if (!process->pageTable) return failWith(EPERM);
        auto *const entries = static_cast<ledger_entry_info *>(buffer);
        for (size_t i = 0; i < filled; i++) {
            entries[i] = {};
            if (names[i] == kPageTableEntry) entries[i].lei_balance = *process->pageTable;
        }
    } else {
        return failWith(EINVAL);
    }
    *count = static_cast<int64_t>(filled);
    return 0;
}

RVSymbolicator *HXReplayPlatform::RVSymbolicatorCreateWithTaskFlagsAndNotification(mach_port_t task, uint32_t,
                                                                                   const void *) {
    const HXMachineProcess *const process = taskOf(task).process;
    return process == nullptr ? nullptr : new Symbolicator(process);
}

void HXReplayPlatform::RVSymbolicatorForeachSymbolOwnerAtTime(
    RVSymbolicator *symbolicator, uint64_t, const std::function<void(const RVSymbolOwner &)> &each) {
    const auto *const own = static_cast<const Symbolicator *>(symbolicator);
    if (own == nullptr || own->process == nullptr) return;
    const auto &images = own->process->images;
    const auto &segments = own->process->segments;
    std::vector<RVRegion> regions;
    for (size_t i = 0; i < images.size(); i++) {
        const size_t end = i + 1 < images.size() ? images[i + 1].firstSegment : segments.size();
        regions.clear();
        for (size_t k = images[i].firstSegment; k < end; k++)
            regions.push_back(
                {_machine.strings.zeroTerminated(segments[k].name), segments[k].start, segments[k].size});
        each({_machine.strings.zeroTerminated(images[i].path), images[i].base, regions.data(),
              regions.size()});
    }
}

RVSymbolicator *HXReplayPlatform::RVSymbolicatorCreateWithMachKernelFlagsAndNotification(uint32_t,
                                                                                         const void *) {
    return new Symbolicator(nullptr);
}

RVSymbol HXReplayPlatform::RVSymbolicatorGetSymbolWithAddressAtTime(RVSymbolicator *symbolicator,
                                                                    uint64_t address, uint64_t) {
    const HXMachineSymbol *const symbol = symbolicator == nullptr ? nullptr : _machine.symbol(address);
    if (symbol == nullptr || symbol->name == kNoString) return {nullptr};
    return {_machine.strings.zeroTerminated(symbol->name)};
}

RVSourceInfo HXReplayPlatform::RVSymbolicatorGetSourceInfoWithAddressAtTime(RVSymbolicator *symbolicator,
                                                                            uint64_t address, uint64_t) {
    const HXMachineSymbol *const symbol = symbolicator == nullptr ? nullptr : _machine.symbol(address);
    if (symbol == nullptr || symbol->path == kNoString) return {nullptr, 0, true};
    return {_machine.strings.zeroTerminated(symbol->path), symbol->line, false};
}

void HXReplayPlatform::RVRelease(RVSymbolicator *symbolicator) {
    delete symbolicator;
}

kern_return_t HXReplayPlatform::mach_memory_info(mach_port_t, mach_zone_name **names, uint32_t *nameCount,
                                                 mach_zone_info **zones, uint32_t *zoneCount,
                                                 mach_memory_info_record **records, uint32_t *recordCount) {
    if (_machine.host.memoryInfoError != KERN_SUCCESS) return _machine.host.memoryInfoError;
    void *const copies[] = {copyOf(_machine.zoneNames), copyOf(_machine.zones), copyOf(_machine.sites)};
    if (std::find(std::begin(copies), std::end(copies), nullptr) != std::end(copies)) {
        for (void *copy : copies)
            std::free(copy);
        return KERN_RESOURCE_SHORTAGE;
    }
    *names = static_cast<mach_zone_name *>(copies[0]);
    *zones = static_cast<mach_zone_info *>(copies[1]);
    *records = static_cast<mach_memory_info_record *>(copies[2]);
    *nameCount = *zoneCount = static_cast<uint32_t>(_machine.zones.size());
    *recordCount = static_cast<uint32_t>(_machine.sites.size());
    return KERN_SUCCESS;
}

kern_return_t HXReplayPlatform::vm_deallocate(mach_port_t, const void *address, uint64_t) {
    std::free(const_cast<void *>(address));
    return KERN_SUCCESS;
}
