// One kernel VM object (or one stretch of the shared cache, or one region that shares with nothing) as seen
// across all analysed processes.
#pragma once

#include "model/HXMemoryRegion.h"
#include "model/HXMemoryTotal.h"
#include "model/HXRangeList.h"

#include <cstdint>
#include <memory>
#include <span>
#include <vector>

class HXRegionOwner;

// The regions of an object, in the order in which they were added. Most objects have one: it takes no
// allocation.
class HXRegionSet {
  public:
    // A region is added to one object once.
    void add(HXMemoryRegion *region);
    std::span<HXMemoryRegion *const> regions() const;

  private:
    HXMemoryRegion *_first = nullptr;
    std::unique_ptr<std::vector<HXMemoryRegion *>> _all; // from the second region on
};

// What is seen of an object: its sizes and the number of its regions.
struct HXMemoryObjectView : HXMemoryTotal {
    bool isWhole = true; // what everybody sees; otherwise one process's own view
};

// Open (regions may be added), then finalised (sizes fixed). Not owned: its regions, which belong to their
// processes. Created, filled and finalised by one thread.
class HXMemoryObject {
  public:
    static constexpr int32_t kNoOwner = -1;
    // One region and the process that contributed it.
    struct ProcessRegion {
        int32_t pid;
        HXMemoryRegion *region;
    };

    HXMemoryObject() = default;
    HXMemoryObject(const HXMemoryObject &) = delete;
    HXMemoryObject &operator=(const HXMemoryObject &) = delete;

    // Final once the object is finalised.
    const HXSizes &sizes() const { return _sizes; }
    std::span<HXMemoryRegion *const> memoryRegions() const { return _memoryRegions.regions(); }
    // Pid of the owner, or kNoOwner.
    int32_t ownerPid() const { return _ownerPid; }
    void setOwnerPid(int32_t pid) { _ownerPid = pid; }
    // The position that the analysis gave the object among its objects.
    uint32_t index() const { return _index; }
    void setIndex(uint32_t index) { _index = index; }
    // The regions by process, where one process's view can differ from the whole: sorted by pid once
    // finalised.
    std::span<const ProcessRegion> processMemoryRegions() const;

    // Adds a region of a process, or of none in particular. The region's page runs are handed over. Not after
    // finalisation.
    void addRegion(HXMemoryRegion &region, const HXRegionOwner &process);
    void addRegion(HXMemoryRegion &region, uint32_t pageSize);
    // Fixes the sizes: those of the merged runs. Once.
    void finalize();

    HXMemoryObjectView wholeView() const;
    // The part of the object that a process maps, or the whole as clean memory when another process owns it.
    HXMemoryObjectView viewForProcess(const HXRegionOwner &process) const;

    bool containsFakeRegion() const;
    // The region that names the object.
    const HXMemoryRegion *_canonicalRegion() const;

  private:
    void _addRegion(HXMemoryRegion &region, uint32_t pageSize, const HXRegionOwner *process);
    void addRuns(HXMemoryRegion &region, uint32_t pageSize);
    HXSizes sumOfRuns() const;
    bool isMadeOfParts() const;
    void raiseToLargestProcess();
    bool processRegionsTellMore() const;
    void nameFakeRegions();
    // Calls `each` with the regions of every process of the map.
    template <typename Each>
    void forEachProcess(Each each) const;
    std::span<const ProcessRegion> regionsOfProcess(int32_t pid) const;

    HXSizes _sizes;
    HXRegionSet _memoryRegions;
    std::unique_ptr<std::vector<ProcessRegion>> _processMemoryRegions;
    std::unique_ptr<HXRangeList> _rangeList; // the merged page runs, from the second run to finalisation
    // While there is no range list: the one region that would be its only run, and its page size.
    const HXMemoryRegion *_onlyRun = nullptr;
    uint32_t _onlyRunPageSize = 0;
    int32_t _ownerPid = kNoOwner;
    uint32_t _index = 0;
    bool _accurateSizes = false; // finalised
};
