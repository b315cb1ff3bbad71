// The processes of the machine and what /proc tells of each without its address space.
#pragma once

#include "platform/HXHostRecords.h"
#include "platform/linux/procfs/HXDescriptor.h"
#include "platform/linux/procfs/HXProcText.h"

#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

class HXLinuxProcesses {
  public:
    // What `pid` of 0, the kernel, is called.
    static constexpr std::string_view kernelName = "kernel";

    // Opens `procPath` on first need.
    explicit HXLinuxProcesses(std::string procPath) : _procPath(std::move(procPath)) {}

    // The directory of a process; not open with errno set.
    HXDescriptor open(int32_t pid);

    // The number of the running process here, which need not be the one that getpid(2) tells: /proc may be
    // that of another pid namespace (pid_namespaces(7)). -1 when the process is not in it.
    int32_t ownPid();
    // As HXPlatform says.
    int32_t proc_listallpids(int32_t *pids, uint32_t bufferBytes);
    int32_t proc_pidinfo(int32_t pid, int32_t flavor, void *buffer, uint32_t bufferBytes);
    // The argument area of sysctl(KERN_PROCARGS2): 0 on success.
    int32_t copyArguments(int32_t pid, void *old, size_t *oldBytes);

  private:
    // A stat record read while processes were listed; good for one answer, so that listing and describing a
    // process costs one reading.
    struct Listed {
        HXStatRecord stat;
        bool isUsed = false;
    };

    HXDirectoryView directory();
    std::optional<HXStatRecord> readStat(int32_t pid);
    std::optional<HXStatRecord> takeListed(int32_t pid);
    std::optional<HXStatRecord> statOf(int32_t pid);
    std::string commOf(int32_t pid, const HXDescriptor &process);

    const std::string _procPath;
    std::mutex _mutex;
    HXDescriptor _directory;
    std::unordered_map<int32_t, Listed> _listed;
};

// What names a running program: the path of its executable, or of the script that it runs.
struct HXProgramName {
    std::string_view executable; // /proc/PID/exe
    std::string_view comm;
    std::string_view arguments;                   // /proc/PID/cmdline
    std::optional<std::string> executedPath = {}; // AT_EXECFN; none when it cannot be read
};
// The path that was executed: the script's for a script started by its #! line.
std::string_view HXExecutedPath(const HXProgramName &name);
// Whether `executedPath` matters at all: it costs reading the process's memory.
bool HXMayBeScript(const HXProgramName &name);
