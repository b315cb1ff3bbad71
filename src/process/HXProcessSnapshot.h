// The machine's processes as one run sees them.
#pragma once

#include "platform/HXHostGuards.h"
#include "platform/HXPlatform.h"
#include "process/HXProcess.h"

#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

// Pids in the order in which they were first stored, each with the description that matched it by name, or
// none (the null marker) when it was given as a number.
class HXPidDescriptions {
  public:
    using Description = std::optional<std::string>;
    struct Entry {
        int32_t pid;
        Description description;
    };

    // Stores, replacing what the pid had.
    void set(int32_t pid, Description description);
    void remove(const std::set<int32_t> &pids);
    const std::vector<Entry> &entries() const { return _entries; }
    std::vector<int32_t> pids() const;
    bool empty() const { return _entries.empty(); }

  private:
    std::vector<Entry> _entries;
    std::map<int32_t, size_t> _index;
};

// The list of processes and the name of each are read once, when somebody first asks for them. Main thread
// only.
class HXProcessSnapshot {
  public:
    explicit HXProcessSnapshot(HXPlatform &host = HXPlatform::current()) : _host(host) {}

    // The records of all processes that could be read, in list order; null when there are none.
    const std::vector<proc_bsdinfo> *listAllBsdInfo();
    // The record of a process, listed or not; none when it cannot be read, with errno set.
    std::optional<proc_bsdinfo> bsdInfoOfPid(int32_t pid);
    // HXProcess::_nameForBsdInfo. Valid as long as the snapshot.
    const std::string &nameOf(const proc_bsdinfo &info);

    // Opens tasks, several at once, for `takeTask`, and asks for the names of those that are listed.
    void openTasks(const std::vector<int32_t> &pids);
    // Hands over the task of a process, opened now if not before; or answers the error of `task_for_pid`,
    // KERN_OPERATION_TIMED_OUT when opening was given up.
    kern_return_t takeTask(int32_t pid, HXTaskPort *task);

    // A record of every listed process whose pid is not in `excluded`; none when the list cannot be read. A
    // process that cannot be opened is left out.
    std::optional<HXProcess::Map> allProcessesExcludingPids(const std::set<int32_t> &excluded);
    // The pids that names and numbers mean; none when the list cannot be read. What matches nothing is said
    // in `messages`, where given.
    std::optional<HXPidDescriptions> pidsForStringDescriptions(const std::vector<std::string> &descriptions,
                                                               std::vector<std::string> *messages);
    // The given pids, then their children, then the children's children and so on; none when the list cannot
    // be read.
    std::optional<std::vector<int32_t>> childPidsForPids(const std::vector<int32_t> &pids);

  private:
    bool readList();
    bool matchDescription(const std::string &description, HXPidDescriptions &result);

    struct Opening {
        HXTaskPort task;
        kern_return_t error;
    };
    // Of a listed process whose name is not known yet.
    struct Naming {
        std::optional<proc_bsdinfo> info;
        std::string name;
    };

    HXPlatform &_host;
    std::optional<bool> _isListed; // none until somebody asks
    std::vector<proc_bsdinfo> _records;
    std::unordered_map<int32_t, size_t> _positions; // of pids in _records
    std::unordered_map<int32_t, std::string> _names;
    std::unordered_map<int32_t, Opening> _opened; // and not taken yet
};
