// The analysis: gathers all targets, merges their regions into memory objects, works out who shares what, and
// drives the report.
#pragma once

#include "analysis/HXHeftSharingData.h"
#include "analysis/HXObjectMap.h"
#include "analysis/HXOutputFormatter.h"
#include "analysis/HXWorkAhead.h"
#include "model/HXHeftSwitches.h"
#include "model/HXMemoryCategory.h"
#include "model/HXMemoryObject.h"
#include "platform/HXPlatform.h"
#include "process/HXProcess.h"

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <unordered_map>
#include <vector>

class HXHeft : public HXHeftSwitches {
  public:
    using ProcessList = std::vector<std::unique_ptr<HXProcess>>;
    using Processes = std::vector<const HXProcess *>;

    explicit HXHeft(ProcessList processes);
    ~HXHeft();

    // The targets, in the order given.
    const ProcessList &processes() const { return _processes; }

    // Gathers every process, several at once, merges them on the calling thread and finalises, several
    // objects at once. Once. A process whose gathering is given up has an error instead of regions.
    void gatherData();
    // Ends gathering early: processes not yet started are left out. Any thread.
    void cancel() { _isCancelled->store(true, std::memory_order_relaxed); }
    // Installs a handler of SIGINT that runs `callback` on a thread of its own; null when standard output is
    // a terminal (the signal then ends the program) and when there can be no source.
    static std::unique_ptr<HXDispatchSource> installCancelHandler(std::function<void()> callback);

    // Formatters are not owned and must outlive the report.
    void addOutputFormatter(HXOutputFormatter &formatter) { _outputFormatters.push_back(&formatter); }
    // Writes the report, with `verbose` after the full region listings; with `summarize` categories have no
    // detail. Not before gathering.
    void printOutputVerbose(bool verbose, bool summarize);
    void printAtlasLikeOutputForProcesses(const Processes &processes);

    // ---- Steps of the above ----
    void _addProcess(HXProcess &process);
    void finalizeObjects();
    // Adds what the targets hold of finalised objects without mapping it, as regions without an address in
    // objects of their own.
    void _addHeldObjects();
    void _buildProcessToHeftMap();
    uint64_t _calculateHeftForProcess(const HXProcess &process) const;
    // The shown processes, in target order.
    Processes _notHiddenProcesses() const;
    static std::vector<HXProcess *> _processesBySortingPidDesc(const ProcessList &processes);
    // By descending heft, then by descending pid.
    Processes _processesBySortingHeft(Processes processes) const;
    // Made anew on each call.
    HXHeftSharingData _sharingData() const;
    // The objects as one process sees them; *hasProcessView (may be null): whether that differs from the
    // whole objects anywhere.
    HXCategoryMap _categoriesForObjects(const HXHeftSharingData::Objects &objects, const HXProcess &viewedBy,
                                        bool *hasProcessView, bool summarize) const;
    // Each object that a shown process maps once, whole.
    HXCategoryMap _categoriesForAllProcessesShouldSummarize(bool summarize) const;
    static HXMemoryTotal _totalForCategories(const HXCategoryMap &categories);

    // The objects of the analysis, in the order in which they were made: those of the maps, and those that
    // share with nothing.
    const HXMemoryObjects &memoryObjects() const { return _objects; }

  private:
    // Where a region's object is found; without a map the region shares with nothing.
    struct Place {
        HXMemoryRegion *region = nullptr;
        HXObjectMap *map = nullptr;
        uint64_t key = 0;
    };
    struct Report;
    // What a report says of the objects that exactly one group maps, as one process sees them.
    struct GroupReport {
        const HXProcessGroup *group;
        std::shared_ptr<const HXCategoryMap> categories;
        HXMemoryTotal total;
        bool hasProcessView = false;
    };
    using GroupReports = std::vector<GroupReport>;

    // Calls `work` with all numbers below `count`, several at once where there are `leastObjects`: for fewer
    // threads cost more than they save.
    void forAll(size_t count, size_t leastObjects, std::function<void(size_t)> work) const;
    void examineTogether();
    void gatherProcesses();
    void setAside(const HXProcess &unanswering);
    void reserveMaps();
    HXObjectMap &mapForRegion(const HXMemoryRegion &region, const HXProcess &process);
    Place placeOf(HXMemoryRegion &region, const HXProcess &process);
    HXMemoryObject &objectAt(const Place &place);
    void merge(HXMemoryRegion &region, const HXProcess &process, HXMemoryObject &object);
    void reportProcesses(const Processes &processes, Report &report, const HXHeftSharingData &sharing,
                         bool summarize, HXWorkAhead &summing);
    void reportProcess(const HXProcess &process, Report &report, const GroupReports &groups);
    GroupReports groupReports(const HXProcess &process, const HXHeftSharingData &sharing,
                              bool summarize) const;
    void reportWholeGroups(const HXHeftSharingData &sharing, bool summarize);

    ProcessList _processes;
    std::unordered_map<int32_t, uint64_t> _pidToHeft;
    HXMemoryObjects _objects;
    // What merging looks objects up in. The maps only grow, and go together once all processes are merged.
    struct ObjectMaps {
        HXObjectMap _memoryObjects;
        HXObjectMap _sharedCache64MemoryObjects;
        HXObjectMap _sharedCache32MemoryObjects;
        HXObjectMap _textMemoryObjects;
        HXObjectMap _linkeditMemoryObjects;
    };
    std::unique_ptr<ObjectMaps> _maps;
    std::vector<HXOutputFormatter *> _outputFormatters;
    std::vector<std::string> _warnings; // of the analysis as a whole
    std::shared_ptr<std::atomic<bool>> _isCancelled = std::make_shared<std::atomic<bool>>(false);
};
