// The processes of the machine and what /proc tells of each without its address space.
#pragma once

#include "platform/HXAdaptiveMutex.h"
#include "platform/HXHostRecords.h"
#include "platform/linux/procfs/HXDescriptor.h"
#include "platform/linux/procfs/HXProcMount.h"
#include "platform/linux/procfs/HXProcText.h"

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

// A process that has been opened.
struct HXOpenProcess {
    // Its directory in /proc; of one whose leading thread has ended that of another thread, which shows the
    // same memory.
    HXDescriptor directory;
    HXStatRecord stat; // of its leading thread; the start time tells the process from others of its pid
};

class HXLinuxProcesses {
  public:
    // What `pid` of 0, the kernel, is called.
    static constexpr std::string_view kernelName = "kernel";

    // Calls `work` for all numbers below `count`, on several threads at once, and returns when all have
    // returned. Numbers that it left out are answered.
    using ForAll = std::function<std::vector<size_t>(size_t count, std::function<void(size_t)> work)>;

    HXLinuxProcesses(std::string procPath, ForAll forAll)
        : _procPath(std::move(procPath)), _forAll(std::move(forAll)) {}

    // None with errno set: ESRCH, EACCES or EPERM, or EMFILE when descriptors or memory do not suffice.
    // With `asListed` the first opening takes the record that the list read: it may be of a state before the
    // process ended or executed another program, or of an earlier process of that pid. The directory is
    // today's.
    std::optional<HXOpenProcess> open(int32_t pid, bool asListed = false);

    // The list of descriptors of `pid` alone, whatever has become of its leading thread; not open with errno
    // set.
    HXDescriptor openDescriptors(int32_t pid) const;

    // The number of the running process here, which need not be the one that getpid(2) tells: /proc may be
    // that of another pid namespace (pid_namespaces(7)). -1 when the process is not in it.
    int32_t ownPid();
    // As HXPlatform says.
    int32_t proc_listallpids(int32_t *pids, uint32_t bufferBytes);
    std::optional<std::string> notTold(bool ofAll) const { return HXProcessesNotTold(_procPath, ofAll); }
    int32_t proc_pidinfo(int32_t pid, int32_t flavor, void *buffer, uint32_t bufferBytes);
    // The argument area of sysctl(KERN_PROCARGS2): 0 on success. It counts one argument and has one path: the
    // folder of what the process executes, and as the name what ps calls it, the `comm`; where that is cut,
    // the whole name of the executable. Fails for a name that is empty or has a slash: only the record tells
    // it right. Nothing is read from the process's memory, as cmdline, environ and auxv partly are: a page of
    // it can make the reader wait for ever.
    int32_t copyArguments(int32_t pid, void *old, size_t *oldBytes);
    // Whether that area surely names the process of this record as the record does.
    static bool isNamedByRecord(const proc_bsdinfo &info);
    // Whether that area can name the process of this record so.
    static bool mayBeNamed(const proc_bsdinfo &info, std::string_view name);

  private:
    // A stat record read while processes were listed; good for one answer and for one opening, so that
    // listing, describing and opening a process costs one reading.
    struct Listed {
        HXStatRecord stat;
        bool isAnswered = false, isOpened = false;
    };

    std::string pathOf(int32_t pid, const char *file) const;
    HXDescriptor openDirectory(int32_t pid) const;
    std::optional<std::vector<int32_t>> findAll() const;
    HXDescriptor openThread(int32_t pid, const HXDescriptor &leader);
    bool is64bit(const HXStatRecord &stat);
    std::optional<HXStatRecord> readStat(int32_t pid) const;
    std::optional<std::vector<HXStatRecord>> readStats(std::vector<int32_t> pids);
    std::optional<HXStatRecord> takeListed(int32_t pid, bool Listed::*isUsed);
    std::optional<HXStatRecord> statOf(int32_t pid);
    std::optional<HXStatRecord> statForName(int32_t pid);

    const std::string _procPath;
    const ForAll _forAll;
    HXAdaptiveMutex _mutex;
    std::unordered_map<int32_t, Listed> _listed;
    std::optional<std::vector<int32_t>> _counted; // found to be counted: who counts them lists them next
};
