#include "platform/linux/procfs/HXLinuxProcesses.h"

#include "platform/HXSafeText.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXTaskFiles.h"
#include "platform/linux/procfs/HXTextNumber.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstring>
#include <memory>
#include <mutex>
#include <utility>
#include <vector>

namespace {

constexpr std::string_view kDeletedSuffix = " (deleted)";
constexpr size_t kCommLength = 15; // what the kernel keeps of a program's name

// The pid that an entry of /proc is named by.
std::optional<int32_t> pidOf(const char *name) {
    int32_t pid = 0;
    if (*name < '1' || *name > '9' || !HXIsNumber(name, &pid)) return std::nullopt;
    return pid;
}

// Fills a field that needs no zero at its end.
template <size_t Size>
void copyName(char (&field)[Size], std::string_view name) {
    const std::string_view cut = HXCutText(name, Size);
    std::memcpy(field, cut.data(), cut.size());
}

proc_bsdinfo bsdInfo(const HXStatRecord &stat, uint32_t flags) {
    const std::string name = HXSafeName(stat.comm());
    proc_bsdinfo info{};
    info.pbi_flags = flags;
    info.pbi_pid = stat.pid;
    info.pbi_ppid = stat.ppid;
    info.pbi_pgid = stat.pgid;
    copyName(info.pbi_comm, name);
    copyName(info.pbi_name, name);
    return info;
}

proc_bsdshortinfo shortInfo(const HXStatRecord &stat, bool hasEnded, uint32_t flags) {
    proc_bsdshortinfo info{};
    info.pbsi_pid = stat.pid;
    info.pbsi_ppid = stat.ppid;
    info.pbsi_pgid = stat.pgid;
    info.pbsi_status = hasEnded ? SZOMB : 0;
    info.pbsi_flags = flags;
    copyName(info.pbsi_comm, HXSafeName(stat.comm()));
    return info;
}

HXStatRecord kernelStat() {
    HXStatRecord stat;
    stat.commLength = static_cast<uint8_t>(HXLinuxProcesses::kernelName.size());
    std::memcpy(stat.commBytes, HXLinuxProcesses::kernelName.data(), stat.commLength);
    stat.state = 'R';
    stat.virtualSize = 1; // of which nothing is told but that there is some
    return stat;
}

// What of `executable` (/proc/PID/exe) and `comm` names the program; none when only `comm` by itself does.
std::optional<std::string> programPath(std::string_view executable, std::string_view comm) {
    // As a path such names would say something else. The process's record has them as they are.
    if (comm.empty() || comm.find('/') != std::string_view::npos) return std::nullopt;
    if (executable.ends_with(kDeletedSuffix)) executable.remove_suffix(kDeletedSuffix.size());
    const size_t nameStart = executable.rfind('/') + 1; // 0 without a slash
    const bool isCut = comm.size() == kCommLength && executable.substr(nameStart).starts_with(comm);
    return std::string(executable.substr(0, nameStart)).append(isCut ? executable.substr(nameStart) : comm);
}

} // namespace

std::string HXLinuxProcesses::pathOf(int32_t pid, const char *file) const {
    return _procPath + '/' + std::to_string(pid) + '/' + file;
}

// By the number of any of its threads, too, /proc shows a process, though it does not list those; through
// each of them the memory that they share.
HXDescriptor HXLinuxProcesses::openThread(int32_t pid, const HXDescriptor &leader) {
    std::vector<int32_t> threads;
    {
        const HXDescriptor list = HXOpenAt(leader, "task", O_DIRECTORY);
        if (!list || !HXForEachEntry(list, [&](const char *name) {
                const auto thread = pidOf(name);
                if (thread && *thread != pid) threads.push_back(*thread);
                return true;
            }))
            return {};
    }
    for (const int32_t thread : threads) {
        HXDescriptor directory = openDirectory(thread);
        const auto stat = directory ? HXReadStat(directory) : std::nullopt;
        if (!stat || stat->isEnding()) continue;
        // The number may have gone to another process in between.
        const std::string name = "task/" + std::to_string(thread);
        if (::faccessat(leader.get(), name.c_str(), F_OK, 0) == 0) return directory;
    }
    errno = ESRCH;
    return {};
}

HXDescriptor HXLinuxProcesses::openDirectory(int32_t pid) const {
    return HXOpenAt(AT_FDCWD, pathOf(pid, "").c_str(), O_PATH | O_DIRECTORY);
}

HXDescriptor HXLinuxProcesses::openDescriptors(int32_t pid) const {
    return HXOpenAt(AT_FDCWD, pathOf(pid, "fd").c_str(), O_DIRECTORY);
}

std::optional<HXOpenProcess> HXLinuxProcesses::open(int32_t pid, bool asListed) {
    const HXShortageWatch watch;
    HXDescriptor directory = openDirectory(pid);
    auto stat = directory && asListed ? takeListed(pid, &Listed::isOpened) : std::nullopt;
    if (directory && !stat) stat = HXReadStat(directory);
    if (stat && stat->lacksLeader()) directory = openThread(pid, directory);
    if (stat && directory) return HXOpenProcess{std::move(directory), *stat};
    const bool isDenied = errno == EACCES || errno == EPERM;
    if (watch.seen() || !isDenied) errno = watch.seen() ? EMFILE : ESRCH;
    return std::nullopt;
}

int32_t HXLinuxProcesses::ownPid() {
    char buffer[32];
    const auto link = HXReadLink(AT_FDCWD, (_procPath + "/self").c_str(), buffer);
    int32_t pid = 0;
    return link && HXIsNumber(*link, &pid) ? pid : -1;
}

std::optional<HXStatRecord> HXLinuxProcesses::readStat(int32_t pid) const {
    char buffer[2048]; // 52 numbers and a short name
    const auto text = HXReadOnce(AT_FDCWD, pathOf(pid, "stat").c_str(), buffer);
    if (!text) {
        if (errno == ENOENT) errno = ESRCH;
        return std::nullopt;
    }
    const auto stat = HXParseStat(*text);
    if (!stat) errno = ESRCH;
    return stat;
}

std::optional<HXStatRecord> HXLinuxProcesses::takeListed(int32_t pid, bool Listed::*isUsed) {
    const std::lock_guard lock(_mutex);
    const auto found = _listed.find(pid);
    if (found == _listed.end() || found->second.*isUsed) return std::nullopt;
    found->second.*isUsed = true;
    return found->second.stat;
}

std::optional<HXStatRecord> HXLinuxProcesses::statOf(int32_t pid) {
    const auto listed = takeListed(pid, &Listed::isAnswered);
    return listed ? listed : readStat(pid);
}

// Those of the processes that are there, in the same order; none when there was no descriptor for one: a list
// that lacks it would be no list.
std::optional<std::vector<HXStatRecord>> HXLinuxProcesses::readStats(std::vector<int32_t> pids) {
    constexpr size_t piece = 32; // of the list, by one thread
    struct Reading {
        std::vector<int32_t> pids;
        std::vector<std::optional<HXStatRecord>> stats;
        std::atomic<bool> fellShort = false;
    };
    const auto reading = std::make_shared<Reading>();
    reading->stats.resize(pids.size());
    reading->pids = std::move(pids);
    const size_t pieces = (reading->pids.size() + piece - 1) / piece;
    const auto givenUp = _forAll(pieces, [this, reading](size_t number) {
        const size_t end = std::min((number + 1) * piece, reading->pids.size());
        for (size_t i = number * piece; i < end; i++) {
            reading->stats[i] = readStat(reading->pids[i]);
            if (!reading->stats[i] && HXShortageWatch::isShortage(errno)) reading->fellShort = true;
        }
    });
    if (reading->fellShort || !givenUp.empty()) return std::nullopt;
    std::vector<HXStatRecord> found;
    for (const auto &stat : reading->stats)
        if (stat) found.push_back(*stat);
    return found;
}

// The kernel, and what /proc shows; none with errno set.
std::optional<std::vector<int32_t>> HXLinuxProcesses::findAll() const {
    std::vector<int32_t> found = {0};
    {
        const HXDescriptor list = HXOpenAt(AT_FDCWD, _procPath.c_str(), O_DIRECTORY);
        if (!list || !HXForEachEntry(list, [&](const char *name) {
                const auto pid = pidOf(name);
                if (pid) found.push_back(*pid);
                return true;
            }))
            return std::nullopt;
    }
    if (found.size() > 1 || HXIsProcMounted(_procPath)) return found;
    errno = ENOENT;
    return std::nullopt;
}

int32_t HXLinuxProcesses::proc_listallpids(int32_t *pids, uint32_t bufferBytes) {
    std::optional<std::vector<int32_t>> all;
    {
        const std::lock_guard lock(_mutex);
        all = std::exchange(_counted, std::nullopt);
    }
    if (!all || pids == nullptr) all = findAll();
    if (!all) return -1;
    const std::vector<int32_t> &found = *all;
    if (pids == nullptr) {
        const auto count = static_cast<int32_t>(found.size());
        const std::lock_guard lock(_mutex);
        _counted = std::move(all);
        return count;
    }
    const uint32_t room = bufferBytes / sizeof(int32_t);
    if (room == 0) return 0;
    const auto stats = readStats({found.begin() + 1, found.end()});
    if (!stats) return -1;
    uint32_t count = 0;
    pids[count++] = 0;
    std::unordered_map<int32_t, Listed> listed;
    for (const HXStatRecord &stat : *stats) {
        if (count == room) break;
        if (stat.isKernelThread()) continue;
        listed.emplace(stat.pid, Listed{stat});
        pids[count++] = stat.pid;
    }
    const std::lock_guard lock(_mutex);
    _listed = std::move(listed);
    return static_cast<int32_t>(count);
}

// 64-bit programs have their stack far above what 32-bit ones can reach. Where the kernel does not tell the
// stack, the program counts as one of the kernel's own width.
bool HXLinuxProcesses::is64bit(const HXStatRecord &stat) {
    uint64_t stack = stat.startStack;
    if (stat.lacksLeader()) {
        const auto process = open(stat.pid);
        const auto thread = process ? HXReadStat(process->directory) : std::nullopt;
        stack = thread ? thread->startStack : 0;
    }
    return stack == 0 ? sizeof(void *) == 8 : stack > UINT32_MAX;
}

namespace {

template <typename Record>
int32_t answer(const Record &record, void *buffer, uint32_t bufferBytes) {
    if (bufferBytes < sizeof record) {
        errno = ENOMEM;
        return 0;
    }
    std::memcpy(buffer, &record, sizeof record);
    return sizeof record;
}

} // namespace

int32_t HXLinuxProcesses::proc_pidinfo(int32_t pid, int32_t flavor, void *buffer, uint32_t bufferBytes) {
    const bool isLong = flavor == PROC_PIDTBSDINFO;
    if (!isLong && flavor != PROC_PIDT_SHORTBSDINFO) {
        errno = EINVAL;
        return 0;
    }
    if (pid < 0) {
        errno = ESRCH;
        return 0;
    }
    // The short record tells whether a process has ended, so it is always read anew.
    const auto stat = pid == 0 ? kernelStat() : isLong ? statOf(pid) : readStat(pid);
    if (!stat) return 0;
    if (stat->isKernelThread() || (isLong && stat->hasEnded())) {
        errno = ESRCH;
        return 0;
    }
    // A 64-bit program runs on a 64-bit kernel alone.
    constexpr uint32_t kernelFlags = PROC_FLAG_SYSTEM | (sizeof(void *) == 8 ? PROC_FLAG_LP64 : 0);
    const bool hasEnded = pid != 0 && (stat->hasEnded() || (stat->lacksLeader() && !open(pid)));
    const bool isWide = pid != 0 && !hasEnded && is64bit(*stat);
    const uint32_t flags = pid == 0 ? kernelFlags : isWide ? PROC_FLAG_LP64 : 0;
    if (isLong) return answer(bsdInfo(*stat, flags), buffer, bufferBytes);
    return answer(shortInfo(*stat, hasEnded, flags), buffer, bufferBytes);
}

bool HXLinuxProcesses::isNamedByRecord(const proc_bsdinfo &info) {
    const std::string_view recorded(info.pbi_comm, ::strnlen(info.pbi_comm, sizeof info.pbi_comm));
    // A name that was not cut is whole. What stands for other bytes may have been longer.
    return recorded.size() < kCommLength && recorded.find('?') == std::string_view::npos;
}

bool HXLinuxProcesses::mayBeNamed(const proc_bsdinfo &info, std::string_view name) {
    constexpr size_t surelyWhole = kCommLength - 3; // behind them the cut may have split a character
    std::string_view recorded(info.pbi_comm, ::strnlen(info.pbi_comm, surelyWhole));
    while (recorded.ends_with('?')) // may stand for parts of a character that the cut has split
        recorded.remove_suffix(1);
    return recorded.empty() || name.starts_with(recorded);
}

std::optional<HXStatRecord> HXLinuxProcesses::statForName(int32_t pid) {
    {
        const std::lock_guard lock(_mutex);
        const auto found = _listed.find(pid);
        if (found != _listed.end()) return found->second.stat;
    }
    return readStat(pid);
}

int32_t HXLinuxProcesses::copyArguments(int32_t pid, void *old, size_t *oldBytes) {
    const auto stat = statForName(pid);
    if (!stat) return -1;
    char link[PATH_MAX];
    std::optional<std::string_view> executable;
    if (stat->lacksLeader()) {
        const auto process = open(pid);
        if (process) executable = HXReadLink(process->directory, "exe", link);
    } else {
        executable = HXReadLink(AT_FDCWD, pathOf(pid, "exe").c_str(), link);
    }
    if (!executable) return -1;
    const auto path = programPath(*executable, stat->comm());
    if (!path) {
        errno = ENOENT;
        return -1;
    }
    constexpr std::string_view oneArgument("\1\0\0\0", 4); // in little-endian order
    const std::string area = std::string(oneArgument) + HXSafeName(*path) + '\0';
    const size_t length = std::min(area.size(), *oldBytes);
    if (old != nullptr) std::memcpy(old, area.data(), length);
    *oldBytes = old == nullptr ? area.size() : length;
    return 0;
}
