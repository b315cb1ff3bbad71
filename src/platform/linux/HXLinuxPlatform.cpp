// Everything of the live host but tasks, which are in HXLinuxPlatformTasks.cpp.
#include "platform/linux/HXLinuxPlatform.h"

#include "platform/HXRegionTags.h"
#include "platform/HXSafeText.h"
#include "platform/linux/HXStandardOutput.h"
#include "platform/linux/HXTemporaryFiles.h"
#include "platform/linux/procfs/HXTaskFiles.h"

#include <fcntl.h>
#include <malloc.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <sys/utsname.h>

#include <algorithm>
#include <bit>
#include <cerrno>
#include <cstring>
#include <new>

namespace {

// As long as the arguments of most systems may be together; more is cut (HXPlatform::sysctl).
constexpr uint32_t kArgumentAreaSize = 131072;

int32_t failed(int error) {
    errno = error;
    return -1;
}

// Copies a value of sysctl; fails with ENOMEM when there is no room for it.
template <typename Value>
int32_t copyOut(const Value &value, void *old, size_t *oldBytes) {
    if (oldBytes == nullptr) return 0;
    if (old != nullptr && *oldBytes < sizeof value) return failed(ENOMEM);
    if (old != nullptr) std::memcpy(old, &value, sizeof value);
    *oldBytes = sizeof value;
    return 0;
}

const char *programName = "";

// On whichever thread: what others do meanwhile is lost, like all that was not written yet.
[[noreturn]] void endOutOfMemory() {
    static char problem[] = ": out of memory\n";
    const iovec text[] = {{const_cast<char *>(programName), std::strlen(programName)},
                          {problem, sizeof problem - 1}};
    [[maybe_unused]] const ssize_t written = ::writev(STDERR_FILENO, text, std::size(text));
    HXRemoveTemporaryFiles();
    ::_exit(1);
}

} // namespace

HXLinuxPlatform::HXLinuxPlatform(const Setting &setting)
    : _pageSize(static_cast<uint32_t>(::sysconf(_SC_PAGESIZE))), _sysPath(setting.sysPath),
      _fileSystems(setting.procPath, setting.sharedMemoryDevice),
      _machine(setting.procPath), _readerSetting{&_fileSystems, &_machine, &namedTags(),
                                                 static_cast<uint32_t>(std::countr_zero(_pageSize)),
                                                 setting.mayScanPageTables},
      _imageHeaders(_fileSystems),
      _processes(setting.procPath,
                 [this](size_t count, std::function<void(size_t)> work) {
                     return _services.dispatch_apply(
                         count, _services.dispatch_queue_create("org.heft.list", QOS_CLASS_UTILITY),
                         std::move(work));
                 }),
      _kernelMemory(setting.procPath, setting.sysPath, _pageSize),
      _held(setting.procPath, _fileSystems, _machine, _identifiers) {}

void HXLinuxPlatform::prepareProcess(const char *program) {
    programName = program;
    std::set_new_handler(endOutOfMemory);
    for (int descriptor = 0; descriptor <= 2; descriptor++) {
        if (::fcntl(descriptor, F_GETFD) >= 0 || errno != EBADF) continue;
        // The lowest free descriptor is this one.
        [[maybe_unused]] const int opened = ::open("/dev/null", O_RDWR);
    }
    HXWatchStandardOutput();
    // The first heap grows in few steps, and all keep what is free in them (mallopt(3)): what one process
    // took serves for the next. Only pieces that hardly come twice are mapped by themselves; HXWorkLoop's
    // room for a thread must not be.
    constexpr int heapStep = 1 << 20, mappedAlone = 8 << 20, keptFree = 64 << 20;
    ::mallopt(M_TOP_PAD, heapStep);
    ::mallopt(M_MMAP_THRESHOLD, mappedAlone);
    ::mallopt(M_TRIM_THRESHOLD, keptFree);
    rlimit limit;
    if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return;
    limit.rlim_cur = limit.rlim_max;
    ::setrlimit(RLIMIT_NOFILE, &limit);
    // The table of descriptors grows without ado as long as there is one thread; later everybody who opens a
    // file then waits some milliseconds for each doubling, until no processor can be looking at the old one.
    constexpr rlim_t many = 8192; // 64 KiB: two for each of some thousand processes
    const int high = ::fcntl(0, F_DUPFD_CLOEXEC, static_cast<int>(std::min(limit.rlim_cur, many) - 1));
    if (high >= 0) ::close(high);
}

// ---- Processes

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
    errno = ESRCH;
    const auto process = pid > 0 ? _processes.open(pid) : std::nullopt;
    return process ? HXReadStatus(process->directory) : std::nullopt;
}

int32_t HXLinuxPlatform::ledger(int32_t command, int32_t pid, void *buffer, int64_t *count) {
    if (command != LEDGER_TEMPLATE_INFO && command != LEDGER_ENTRY_INFO) return failed(EINVAL);
    if (*count < 1) {
        *count = 0;
        return 0;
    }
    if (command == LEDGER_TEMPLATE_INFO) {
        ledger_template_info entry{};
        kPageTableEntry.copy(entry.lti_name, sizeof entry.lti_name);
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

std::string HXLinuxPlatform::hostDescription() {
    utsname names{};
    if (::uname(&names) != 0) return HXPlatform::hostDescription();
    return "Linux " + HXSafeText(names.release) + ", " + HXPlatform::hostDescription();
}

int32_t HXLinuxPlatform::sysctl(const int32_t *name, uint32_t nameLength, void *old, size_t *oldBytes) {
    if (nameLength < 2 || name[0] != CTL_KERN) return failed(ENOENT);
    if (nameLength == 2 && name[1] == KERN_ARGMAX) return copyOut(kArgumentAreaSize, old, oldBytes);
    if (nameLength != 3 || name[1] != KERN_PROCARGS2) return failed(ENOENT);
    if (name[2] <= 0) return failed(EINVAL);
    return _processes.copyArguments(name[2], old, oldBytes);
}

int32_t HXLinuxPlatform::sysctlbyname(const char *name, void *old, size_t *oldBytes, const void *newValue,
                                      size_t newBytes) {
    if (std::strcmp(name, kSelfRegionHeftSetting) != 0) return failed(ENOENT);
    uint32_t value = 0;
    if (newValue != nullptr && newBytes != sizeof value) return failed(EINVAL);
    if (copyOut(_reportsCharge.load(), old, oldBytes) != 0) return -1;
    if (newValue == nullptr) return 0;
    std::memcpy(&value, newValue, sizeof value);
    _reportsCharge = value;
    return 0;
}

std::optional<std::string>
HXLinuxPlatform::GXRegionTypeDescriptionForTagShareProtAndPager(uint32_t tag, uint8_t, int32_t, uint8_t) {
    const auto name = HXHostTagName(tag);
    if (name) return std::string(*name);
    return namedTags().nameForTag(tag);
}
