// Everything of the live host but tasks, which are in HXLinuxPlatformTasks.cpp.
#include "platform/linux/HXLinuxPlatform.h"

#include "platform/HXRegionTags.h"
#include "platform/HXSafeText.h"

#include <fcntl.h>
#include <malloc.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/utsname.h>

#include <bit>
#include <cerrno>
#include <cstring>

namespace {

constexpr mach_port_t hostPort = 2;
constexpr int32_t kernelNamespace = 1, argumentMaximum = 8, processArguments = 49; // CTL_KERN, KERN_…
constexpr uint32_t argumentAreaSize = 131072;
constexpr const char *chargeSwitch = "vm.self_region_heft";
constexpr const char *pageTableEntry = "page_table";

uint32_t machinePageSize() {
    return static_cast<uint32_t>(::sysconf(_SC_PAGESIZE));
}

// Copies a value of sysctl; fails with ENOMEM when there is no room for it.
template <typename Value>
int32_t copyOut(const Value &value, void *old, size_t *oldBytes) {
    if (oldBytes == nullptr) return 0;
    if (old != nullptr) {
        if (*oldBytes < sizeof value) {
            errno = ENOMEM;
            return -1;
        }
        std::memcpy(old, &value, sizeof value);
    }
    *oldBytes = sizeof value;
    return 0;
}

int32_t failed(int error) {
    errno = error;
    return -1;
}

} // namespace

HXLinuxPlatform::HXLinuxPlatform(const Setting &setting)
    : _pageSize(machinePageSize()), _fileSystems(setting.sharedMemoryDevice),
      _machine(setting.procPath), _readerSetting{&_fileSystems, &_machine, &namedTags(),
                                                 static_cast<uint32_t>(std::countr_zero(_pageSize)),
                                                 setting.mayScanPageTables},
      _imageHeaders(_fileSystems, _pageSize), _processes(setting.procPath),
      _kernelMemory(setting.procPath, setting.sysPath, _pageSize) {}

void HXLinuxPlatform::prepareProcess() {
    for (int descriptor = 0; descriptor <= 2; descriptor++) {
        if (::fcntl(descriptor, F_GETFD) >= 0 || errno != EBADF) continue;
        // The lowest free descriptor is this one.
        [[maybe_unused]] const int opened = ::open("/dev/null", O_RDWR);
    }
    // Heaps of worker threads then grow in few steps, each of which is a system call that stops the others.
    constexpr int heapStep = 1 << 20;
    ::mallopt(M_TOP_PAD, heapStep);
    rlimit limit;
    if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return;
    limit.rlim_cur = limit.rlim_max;
    ::setrlimit(RLIMIT_NOFILE, &limit);
}

// ---- Processes

int32_t HXLinuxPlatform::proc_listallpids(int32_t *pids, uint32_t bufferBytes) {
    return _processes.proc_listallpids(pids, bufferBytes);
}

int32_t HXLinuxPlatform::proc_pidinfo(int32_t pid, int32_t flavor, uint64_t, void *buffer,
                                      uint32_t bufferBytes) {
    return _processes.proc_pidinfo(pid, flavor, buffer, bufferBytes);
}

int32_t HXLinuxPlatform::proc_pid_rusage(int32_t pid, int32_t flavor, rusage_info_v4 *info) {
    if (flavor != RUSAGE_INFO_V4) return failed(EINVAL);
    const auto status = statusOf(pid, HXLinuxTask::StatusUse::usage);
    if (!status) return -1;
    const auto size = status->heftSize(), peakSize = status->peakHeftSize();
    if (!size || !peakSize) return failed(ENODATA);
    *info = {};
    info->ri_phys_heft = *size;
    info->ri_lifetime_max_phys_heft = *peakSize;
    return 0;
}

int32_t HXLinuxPlatform::proc_get_dirty(int32_t, uint32_t *) {
    return failed(ENOTSUP); // no process says that it may be ended when idle
}

std::optional<HXStatusRecord> HXLinuxPlatform::statusOf(int32_t pid, HXLinuxTask::StatusUse use) {
    HXLinuxTask *task = _tasks.findByPid(pid);
    if (task != nullptr) return task->status(use);
    const HXDescriptor directory = pid > 0 ? _processes.open(pid) : HXDescriptor();
    if (!directory) {
        errno = ESRCH;
        return std::nullopt;
    }
    return HXReadStatus(directory.get());
}

int32_t HXLinuxPlatform::ledger(int32_t command, int32_t pid, void *buffer, int64_t *count) {
    if (command != LEDGER_TEMPLATE_INFO && command != LEDGER_ENTRY_INFO) return failed(EINVAL);
    if (*count < 1) {
        *count = 0;
        return 0;
    }
    if (command == LEDGER_TEMPLATE_INFO) {
        ledger_template_info entry{};
        std::strcpy(entry.lti_name, pageTableEntry);
        std::strcpy(entry.lti_group, "physmem");
        std::strcpy(entry.lti_units, "bytes");
        std::memcpy(buffer, &entry, sizeof entry);
    } else {
        const auto status = statusOf(pid, HXLinuxTask::StatusUse::ledger);
        if (!status) return -1;
        const auto pageTableSize = status->pageTablesHeld();
        if (!pageTableSize) return failed(ENODATA);
        ledger_entry_info entry{};
        entry.lei_balance = static_cast<int64_t>(*pageTableSize);
        std::memcpy(buffer, &entry, sizeof entry);
    }
    *count = 1;
    return 0;
}

int32_t HXLinuxPlatform::getpid() {
    return ::getpid();
}

std::string HXLinuxPlatform::hostDescription() {
    utsname names{};
    if (::uname(&names) != 0) return HXPlatform::hostDescription();
    return "Linux " + HXSafeText(names.release) + ", " + HXPlatform::hostDescription();
}

uint32_t HXLinuxPlatform::geteuid() {
    return ::geteuid();
}

int32_t HXLinuxPlatform::sysctl(const int32_t *name, uint32_t nameLength, void *old, size_t *oldBytes) {
    if (nameLength < 2 || name[0] != kernelNamespace) return failed(ENOENT);
    if (nameLength == 2 && name[1] == argumentMaximum) return copyOut(argumentAreaSize, old, oldBytes);
    if (nameLength != 3 || name[1] != processArguments) return failed(ENOENT);
    if (name[2] <= 0) return failed(EINVAL);
    return _processes.copyArguments(name[2], old, oldBytes);
}

int32_t HXLinuxPlatform::sysctlbyname(const char *name, void *old, size_t *oldBytes, const void *newValue,
                                      size_t newBytes) {
    if (std::strcmp(name, chargeSwitch) != 0) return failed(ENOENT);
    uint32_t value = 0;
    if (newValue != nullptr && newBytes != sizeof value) return failed(EINVAL);
    if (copyOut(_reportsCharge.load(), old, oldBytes) != 0) return -1;
    if (newValue == nullptr) return 0;
    std::memcpy(&value, newValue, sizeof value);
    _reportsCharge = value;
    return 0;
}

// ---- The kernel's own memory, and region types

RVSymbolicator *
HXLinuxPlatform::RVSymbolicatorCreateWithMachKernelFlagsAndNotification(uint32_t flags,
                                                                        const void *notification) {
    return _kernelMemory.RVSymbolicatorCreateWithMachKernelFlagsAndNotification(flags, notification);
}

RVSymbol HXLinuxPlatform::RVSymbolicatorGetSymbolWithAddressAtTime(RVSymbolicator *symbolicator,
                                                                   uint64_t address, uint64_t time) {
    return _kernelMemory.RVSymbolicatorGetSymbolWithAddressAtTime(symbolicator, address, time);
}

RVSourceInfo HXLinuxPlatform::RVSymbolicatorGetSourceInfoWithAddressAtTime(RVSymbolicator *symbolicator,
                                                                           uint64_t address, uint64_t time) {
    return _kernelMemory.RVSymbolicatorGetSourceInfoWithAddressAtTime(symbolicator, address, time);
}

void HXLinuxPlatform::RVRelease(RVSymbolicator *symbolicator) {
    _kernelMemory.RVRelease(symbolicator);
}

mach_port_t HXLinuxPlatform::mach_host_self() {
    return hostPort;
}

kern_return_t HXLinuxPlatform::mach_memory_info(mach_port_t host, mach_zone_name **names, uint32_t *nameCount,
                                                mach_zone_info **zones, uint32_t *zoneCount,
                                                mach_memory_info_record **records, uint32_t *recordCount) {
    return _kernelMemory.mach_memory_info(host, names, nameCount, zones, zoneCount, records, recordCount);
}

kern_return_t HXLinuxPlatform::vm_deallocate(mach_port_t task, const void *address, uint64_t bytes) {
    return _kernelMemory.vm_deallocate(task, address, bytes);
}

std::vector<OSKextInfo> HXLinuxPlatform::OSKextCopyLoadedKextInfo() {
    return _kernelMemory.OSKextCopyLoadedKextInfo();
}

std::optional<std::string>
HXLinuxPlatform::GXRegionTypeDescriptionForTagShareProtAndPager(uint32_t tag, uint8_t, int32_t, uint8_t) {
    const auto name = HXHostTagName(tag);
    if (name) return std::string(*name);
    return namedTags().nameForTag(tag);
}
