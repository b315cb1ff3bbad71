// The record of one analysed process: what every source of processes has in common.
#pragma once

#include "model/HXAuxData.h"
#include "model/HXMemoryRegion.h"
#include "platform/HXHostRecords.h"

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
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
    void remove(int32_t pid);
    const std::vector<Entry> &entries() const { return _entries; }
    bool empty() const { return _entries.empty(); }

  private:
    std::vector<Entry> _entries;
    std::map<int32_t, size_t> _index;
};

enum HXIdleExitStatus : int32_t {
    HXIdleExitUnknown = 0,      // not determined
    HXIdleExitNotSupported = 1, // no idle-exit process
    HXIdleExitClean = 2,
    HXIdleExitDirty = 3,
};

// Gathered once by one worker; read afterwards. Records compare and hash by pid.
class HXProcess {
  public:
    using Map = std::map<int32_t, std::unique_ptr<HXProcess>>;

    HXProcess() = default;
    virtual ~HXProcess() = default;
    HXProcess(const HXProcess &) = delete;
    HXProcess &operator=(const HXProcess &) = delete;

    // A new record of the right kind, or null when the process cannot be examined (a global error then says
    // why). Main thread only.
    static std::unique_ptr<HXProcess> processWithBsdInfo(const proc_bsdinfo &info);
    // The same by pid; null also when there is no such process.
    static std::unique_ptr<HXProcess> processWithPid(int32_t pid);

    // Construction from process information: takes the task, the name and the page size. False when the
    // record cannot be; it must then be dropped.
    virtual bool initWithBsdInfo(const proc_bsdinfo &info);

    // Fills `memoryRegions`, the figures, errors and warnings. Never fails otherwise.
    virtual void gatherData() {}

    int32_t pid() const { return _pid; }
    void setPid(int32_t pid) { _pid = pid; }
    bool is64bit() const { return _is64bit; }
    void setIs64bit(bool is64bit) { _is64bit = is64bit; }
    HXIdleExitStatus idleExitStatus() const { return _idleExitStatus; }
    // Takes part in the analysis but gets no report of its own.
    bool hiddenFromDisplay() const { return _hiddenFromDisplay; }
    void setHiddenFromDisplay(bool hidden) { _hiddenFromDisplay = hidden; }
    const std::string &name() const { return _name; }
    void setName(std::string_view name) { _name = name; }
    // How reports name the process: "NAME [PID]".
    const std::string &displayString() const { return _displayString; }
    void setDisplayString(std::string_view text) { _displayString = text; }
    // Bytes in a page of the process, a power of two.
    uint32_t pageSize() const { return _pageSize; }
    void setPageSize(uint32_t size) { _pageSize = size; }
    // The regions in the order in which the source found them; empty until gathered.
    const HXMemoryRegionList &memoryRegions() const { return _memoryRegions; }
    HXMemoryRegionList &memoryRegions() { return _memoryRegions; }
    void setMemoryRegions(HXMemoryRegionList regions) { _memoryRegions = std::move(regions); }

    uint64_t hash() const { return static_cast<uint64_t>(static_cast<int64_t>(_pid)); }
    bool isEqual(const HXProcess &other) const { return _pid == other._pid; }
    // The pid, as the key in maps of processes.
    int32_t asNumber() const { return _pid; }
    // A copy, as of now.
    std::vector<std::string> errors() const { return _errors; }
    // The list itself, which may still grow.
    const std::vector<std::string> &warnings() const { return _warnings; }
    bool hasErrors() const { return !_errors.empty(); }
    // "HXProcess[PID]".
    std::string description() const;

    // The process's auxiliary figures; null when there are none.
    virtual HXAuxTree auxData() const { return std::make_shared<HXAuxDictionary>(); }
    // Whether dirty sizes of this process's regions are the kernel's charge.
    virtual bool breakDownPhysHeft() const;

    // ---- The run's list of global errors. Main thread only. ----
    static void _addGlobalError(std::string error);
    static void _clearGlobalErrors();
    static std::vector<std::string> globalErrors();

    // ---- Names ----
    // The last path component of what the process executes, else the name in its record.
    static std::string _nameForBsdInfo(const proc_bsdinfo &info);
    // The name in the record: the process name, else the command name, else "Unknown".
    static std::string _nameForBsdInfoCommName(const proc_bsdinfo &info);

    // ---- The process list ----
    // A record of every listed process whose pid is not in `excluded`; none when the list cannot be read. A
    // process that cannot be opened is left out.
    static std::optional<Map> allProcessesExcludingPids(const std::set<int32_t> &excluded);
    // The pids that names and numbers mean; none when the list cannot be read. What matches nothing is said
    // in `messages`, where given.
    static std::optional<HXPidDescriptions>
    pidsForStringDescriptions(const std::vector<std::string> &descriptions,
                              std::vector<std::string> *messages);
    // The given pids, then their children, then the children's children and so on; none when the list cannot
    // be read.
    static std::optional<std::vector<int32_t>> childPidsForPids(const std::vector<int32_t> &pids);
    // Without the processes that are idle-exit clean.
    static Map removeIdleExitCleanProcessesFrom(Map processes);

  protected:
    // Hooks of construction and gathering.
    virtual uint32_t _gatherPageSize();
    virtual bool _populateTask() { return false; }
    virtual bool _isAlive() const { return false; }

    HXMemoryRegionList _memoryRegions;
    std::string _name;
    std::string _displayString;
    std::vector<std::string> _errors;
    std::vector<std::string> _warnings;
    HXIdleExitStatus _idleExitStatus = HXIdleExitUnknown;

  private:
    int32_t _pid = 0;
    uint32_t _pageSize = 0;
    bool _is64bit = false;
    bool _hiddenFromDisplay = false;
};

// The part of a path after its last slash; trailing slashes are ignored; of "/" it is "/".
std::string_view HXLastPathComponent(std::string_view path);

// The BSD records of all processes that could be read, in list order; none when there are none.
std::optional<std::vector<proc_bsdinfo>> listAllBsdInfo();
