#include "platform/linux/procfs/HXLinuxProcesses.h"

#include "platform/HXSafeText.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXTextNumber.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <bit>
#include <cerrno>
#include <climits>
#include <cstring>
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

proc_bsdshortinfo shortInfo(const HXStatRecord &stat, uint32_t flags) {
    proc_bsdshortinfo info{};
    info.pbsi_pid = stat.pid;
    info.pbsi_ppid = stat.ppid;
    info.pbsi_pgid = stat.pgid;
    info.pbsi_status = stat.isZombie() ? SZOMB : 0;
    info.pbsi_flags = flags;
    copyName(info.pbsi_comm, HXSafeName(stat.comm()));
    return info;
}

HXStatRecord kernelStat() {
    HXStatRecord stat;
    stat.commLength = static_cast<uint8_t>(HXLinuxProcesses::kernelName.size());
    std::memcpy(stat.commBytes, HXLinuxProcesses::kernelName.data(), stat.commLength);
    stat.state = 'R';
    return stat;
}

std::optional<HXAuxiliaryVector> readAuxiliaryVector(HXDirectoryView directory, const char *name) {
    char buffer[2048]; // some twenty entries of 16 bytes
    const auto bytes = HXReadOnce(directory, name, buffer);
    return bytes ? HXParseAuxiliaryVector(*bytes) : std::nullopt;
}

// Whether a page is in memory and no file's: reading another one might wait for a file system that the
// process mapped there, or for the process itself.
bool isPresentAndOwn(const HXDescriptor &pagemap, uint64_t page) {
    constexpr uint64_t present = uint64_t{1} << 63, ofFile = uint64_t{1} << 61; // pagemap of proc(5)
    std::array<char, sizeof(uint64_t)> bytes;
    if (pagemap.readAt(page * bytes.size(), bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size()))
        return false;
    return (std::bit_cast<uint64_t>(bytes) & (present | ofFile)) == present;
}

// The text at `address` of the process's memory up to its zero byte.
std::optional<std::string> readPresentText(const HXDescriptor &process, uint64_t address) {
    const HXDescriptor memory = HXOpenAt(process, "mem");
    const HXDescriptor pagemap = HXOpenAt(process, "pagemap");
    if (!memory || !pagemap) return std::nullopt;
    const auto pageSize = static_cast<uint64_t>(::sysconf(_SC_PAGESIZE));
    std::string text;
    char buffer[PATH_MAX];
    while (text.size() < PATH_MAX) {
        const size_t length = std::min<uint64_t>(pageSize - address % pageSize, sizeof buffer);
        if (!isPresentAndOwn(pagemap, address / pageSize) ||
            memory.readAt(address, buffer, length) != static_cast<ssize_t>(length))
            return std::nullopt;
        const std::string_view piece(buffer, length);
        const size_t end = piece.find('\0');
        text += piece.substr(0, end);
        if (end != std::string_view::npos) return text;
        address += length;
    }
    return std::nullopt;
}

// The path that was executed, from the process's own memory.
std::optional<std::string> readExecutedPath(const HXDescriptor &process) {
    const auto vector = readAuxiliaryVector(process, "auxv");
    if (!vector || !vector->execFileName) return std::nullopt;
    return readPresentText(process, *vector->execFileName);
}

bool isNamed(std::string_view path, std::string_view comm) {
    return HXBaseName(path).substr(0, kCommLength) == comm;
}

// The area in the layout that HXPlatform::sysctl tells.
std::string argumentArea(std::string_view path, std::string_view arguments) {
    // Readers find the path behind the first zero byte, which works for counts of one byte only.
    constexpr size_t maximumCount = 255;
    const auto count = static_cast<uint32_t>(std::min(HXSplitArguments(arguments).size(), maximumCount));
    std::string area(sizeof count, '\0');
    std::memcpy(area.data(), &count, sizeof count);
    area += HXSafeName(path);
    area += '\0';
    area += arguments;
    if (!arguments.empty() && arguments.back() != '\0') area += '\0';
    return area;
}

} // namespace

bool HXMayBeScript(const HXProgramName &name) {
    return !isNamed(name.executable, name.comm);
}

std::string_view HXExecutedPath(const HXProgramName &name) {
    if (!HXMayBeScript(name)) return name.executable;
    // The interpreter gets the script as an argument, behind at most one option of the #! line; its loader
    // may come before it.
    constexpr size_t reach = 10;
    const auto arguments = HXSplitArguments(name.arguments);
    for (size_t i = 1; i < std::min(arguments.size(), reach); i++) {
        if (name.executedPath ? arguments[i] == *name.executedPath
                              : i <= 2 && isNamed(arguments[i], name.comm))
            return arguments[i];
    }
    return name.executable;
}

HXDirectoryView HXLinuxProcesses::directory() {
    const std::lock_guard lock(_mutex);
    if (!_directory) _directory = HXOpenAt(AT_FDCWD, _procPath.c_str(), O_DIRECTORY);
    return _directory;
}

HXDescriptor HXLinuxProcesses::open(int32_t pid) {
    return HXOpenAt(directory(), std::to_string(pid).c_str(), O_PATH | O_DIRECTORY);
}

int32_t HXLinuxProcesses::ownPid() {
    char buffer[32];
    const auto link = HXReadLink(directory(), "self", buffer);
    int32_t pid = 0;
    return link && HXIsNumber(*link, &pid) ? pid : -1;
}

std::optional<HXStatRecord> HXLinuxProcesses::readStat(int32_t pid) {
    char buffer[2048]; // 52 numbers and a short name
    const auto text = HXReadOnce(directory(), (std::to_string(pid) + "/stat").c_str(), buffer);
    if (!text) {
        if (errno == ENOENT) errno = ESRCH;
        return std::nullopt;
    }
    const auto stat = HXParseStat(*text);
    if (!stat) errno = ESRCH;
    return stat;
}

std::optional<HXStatRecord> HXLinuxProcesses::takeListed(int32_t pid) {
    const std::lock_guard lock(_mutex);
    const auto found = _listed.find(pid);
    if (found == _listed.end() || found->second.isUsed) return std::nullopt;
    found->second.isUsed = true;
    return found->second.stat;
}

std::optional<HXStatRecord> HXLinuxProcesses::statOf(int32_t pid) {
    const auto listed = takeListed(pid);
    return listed ? listed : readStat(pid);
}

int32_t HXLinuxProcesses::proc_listallpids(int32_t *pids, uint32_t bufferBytes) {
    // A descriptor of its own: the place in the directory belongs to it.
    const HXDescriptor list = HXOpenAt(AT_FDCWD, _procPath.c_str(), O_DIRECTORY);
    if (!list) return -1;
    const uint32_t room = pids == nullptr ? UINT32_MAX : bufferBytes / sizeof(int32_t);
    uint32_t count = 0;
    std::unordered_map<int32_t, Listed> listed;
    if (room > 0) {
        if (pids != nullptr) pids[0] = 0;
        count = 1;
    }
    const bool done = HXForEachEntry(list, [&](const char *name) {
        const auto pid = pidOf(name);
        if (!pid) return true;
        if (count >= room) return false;
        if (pids != nullptr) {
            const auto stat = readStat(*pid);
            if (!stat || stat->isKernelThread()) return true;
            pids[count] = *pid;
            listed.emplace(*pid, Listed{*stat});
        }
        count++;
        return true;
    });
    if (!done) return -1;
    if (pids != nullptr) {
        const std::lock_guard lock(_mutex);
        _listed = std::move(listed);
    }
    return static_cast<int32_t>(std::min<uint32_t>(count, INT32_MAX));
}

namespace {

// 64-bit programs have their stack far above what 32-bit ones can reach. Where the kernel does not tell the
// stack, the width of the auxiliary vector's words does.
bool is64bit(const HXStatRecord &stat, HXDirectoryView directory) {
    if (stat.startStack > UINT32_MAX) return true;
    const auto vector = readAuxiliaryVector(directory, (std::to_string(stat.pid) + "/auxv").c_str());
    return vector ? vector->is64bit : sizeof(void *) == 8;
}

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
    if (stat->isKernelThread() || (isLong && stat->isZombie())) {
        errno = ESRCH;
        return 0;
    }
    // A 64-bit program runs on a 64-bit kernel alone.
    constexpr uint32_t kernelFlags = PROC_FLAG_SYSTEM | (sizeof(void *) == 8 ? PROC_FLAG_LP64 : 0);
    const bool isWide = pid != 0 && !stat->isZombie() && is64bit(*stat, directory());
    const uint32_t flags = pid == 0 ? kernelFlags : isWide ? PROC_FLAG_LP64 : 0;
    if (isLong) return answer(bsdInfo(*stat, flags), buffer, bufferBytes);
    return answer(shortInfo(*stat, flags), buffer, bufferBytes);
}

std::string HXLinuxProcesses::commOf(int32_t pid, const HXDescriptor &process) {
    {
        const std::lock_guard lock(_mutex);
        const auto found = _listed.find(pid);
        if (found != _listed.end()) return std::string(found->second.stat.comm());
    }
    char buffer[128];
    auto comm = HXReadOnce(process, "comm", buffer).value_or(std::string_view());
    if (comm.ends_with('\n')) comm.remove_suffix(1);
    return std::string(comm);
}

int32_t HXLinuxProcesses::copyArguments(int32_t pid, void *old, size_t *oldBytes) {
    const HXDescriptor process = open(pid);
    if (!process) {
        if (errno == ENOENT) errno = ESRCH;
        return -1;
    }
    char link[PATH_MAX];
    const auto executable = HXReadLink(process, "exe", link);
    if (!executable) return -1;
    HXProgramName name{*executable, {}, {}};
    if (name.executable.ends_with(kDeletedSuffix)) name.executable.remove_suffix(kDeletedSuffix.size());
    const std::string comm = commOf(pid, process);
    name.comm = comm;
    const std::span<char> scratch = HXScratchBuffer();
    name.arguments = HXReadOnce(process, "cmdline", scratch).value_or(std::string_view());
    if (HXMayBeScript(name)) name.executedPath = readExecutedPath(process);
    const std::string area = argumentArea(HXExecutedPath(name), name.arguments);
    const size_t length = std::min(area.size(), *oldBytes);
    if (old != nullptr) std::memcpy(old, area.data(), length);
    *oldBytes = old == nullptr ? area.size() : length;
    return 0;
}
