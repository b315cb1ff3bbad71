// The record of one analysed process: what every source of processes has in common.
#pragma once

#include "model/HXAuxData.h"
#include "model/HXMemoryRegion.h"
#include "model/HXRegionOwner.h"
#include "platform/HXHostRecords.h"

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

class HXProcessSnapshot;

enum HXIdleExitStatus : int32_t {
    HXIdleExitUnknown = 0,      // not determined
    HXIdleExitNotSupported = 1, // no idle-exit process
    HXIdleExitClean = 2,
    HXIdleExitDirty = 3,
};

// Gathered once by one worker; read afterwards.
class HXProcess : public HXRegionOwner {
  public:
    using Map = std::map<int32_t, std::unique_ptr<HXProcess>>;

    // A new record of the right kind, named by the snapshot that `info` comes from; null when the process
    // cannot be examined: a global error then says why, unless it has ended meanwhile. Main thread only.
    static std::unique_ptr<HXProcess> processWithBsdInfo(const proc_bsdinfo &info,
                                                         HXProcessSnapshot &snapshot);
    // The same by pid; null also when there is no such process.
    static std::unique_ptr<HXProcess> processWithPid(int32_t pid, HXProcessSnapshot &snapshot);

    // A record of the same process with nothing but an error: it does not answer. Reads only what gathering
    // does not write.
    static std::unique_ptr<HXProcess> unansweringProcess(const HXProcess &process);

    // Construction from process information: takes the task, the name and the page size. Without a snapshot
    // the name is the one in the record. False when the record cannot be; it must then be dropped.
    virtual bool initWithBsdInfo(const proc_bsdinfo &info, HXProcessSnapshot *snapshot);

    // Whether this is a process of the host, whose task is asked.
    virtual bool _isAlive() const { return false; }

    // Fills `memoryRegions`, the figures, errors and warnings. Never fails otherwise.
    virtual void gatherData() {}

    bool is64bit() const { return _is64bit; }
    void setIs64bit(bool is64bit) { _is64bit = is64bit; }
    HXIdleExitStatus idleExitStatus() const { return _idleExitStatus; }
    // Takes part in the analysis but gets no report of its own.
    bool hiddenFromDisplay() const { return _hiddenFromDisplay; }
    void setHiddenFromDisplay(bool hidden) { _hiddenFromDisplay = hidden; }
    const std::string &name() const { return _name; }
    void setName(std::string_view name) { _name = name; }
    // The regions in the order in which the source found them; empty until gathered.
    const HXMemoryRegionList &memoryRegions() const { return _memoryRegions; }
    HXMemoryRegionList &memoryRegions() { return _memoryRegions; }

    // The shared memory that it holds; empty until gathered. Where the whole machine is examined, without
    // what it has descriptors of alone.
    const std::vector<task_held_object> &heldObjects() const { return _heldObjects; }

    // A copy, as of now.
    std::vector<std::string> errors() const { return _errors; }
    // The list itself, which may still grow.
    const std::vector<std::string> &warnings() const { return _warnings; }
    bool hasErrors() const { return !_errors.empty(); }

    // The process's auxiliary figures; null when there are none.
    virtual HXAuxTree auxData() const { return std::make_shared<HXAuxDictionary>(); }
    // Unless the source of the process says otherwise, the run's mode.
    bool breakDownPhysHeft() const override;

    // ---- The run's list of global errors. Main thread only. ----
    static void _addGlobalError(std::string error);
    static void _clearGlobalErrors();
    static std::vector<std::string> globalErrors();

    // ---- Names ----
    // The last path component of what the process executes, else the name in its record.
    static std::string _nameForBsdInfo(const proc_bsdinfo &info);
    // The name in the record: the process name, else the command name, else "Unknown".
    static std::string _nameForBsdInfoCommName(const proc_bsdinfo &info);

    // Without the processes that are idle-exit clean.
    static Map removeIdleExitCleanProcessesFrom(Map processes);

  protected:
    // Hooks of construction and gathering.
    virtual uint32_t _gatherPageSize();
    virtual bool _populateTask(HXProcessSnapshot *) { return false; }

    HXMemoryRegionList _memoryRegions;
    std::vector<task_held_object> _heldObjects;
    std::string _name;
    std::vector<std::string> _errors;
    std::vector<std::string> _warnings;
    HXIdleExitStatus _idleExitStatus = HXIdleExitUnknown;

  private:
    bool _is64bit = false;
    bool _hiddenFromDisplay = false;
};

// The part of a path after its last slash; trailing slashes are ignored; of "/" it is "/".
std::string_view HXLastPathComponent(std::string_view path);
