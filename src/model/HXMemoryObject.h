// One kernel VM object (or one stretch of the shared cache, or one region that shares with nothing) as seen
// across all analysed processes.
#pragma once

#include "model/HXMemoryRegion.h"
#include "model/HXRangeList.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

class HXRegionOwner;

// The regions of an object, in the order in which they were added. Most objects have one: it takes no
// allocation.
class HXRegionSet {
  public:
    HXRegionSet() = default;
    HXRegionSet(const HXRegionSet &) = delete;
    HXRegionSet &operator=(const HXRegionSet &) = delete;

    // A region is added to one object once.
    void add(HXMemoryRegion *region);
    // Refers to the regions of `other` without copying them; `other` must outlive this.
    void borrow(const HXRegionSet &other) { _borrowed = &other; }
    std::span<HXMemoryRegion *const> regions() const;

  private:
    HXMemoryRegion *_first = nullptr;
    std::unique_ptr<std::vector<HXMemoryRegion *>> _all; // from the second region on
    const HXRegionSet *_borrowed = nullptr;
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
    // A view of an object: the object itself (not owned) or a new object.
    using View = std::shared_ptr<const HXMemoryObject>;

    HXMemoryObject() = default;
    HXMemoryObject(const HXMemoryObject &) = delete;
    HXMemoryObject &operator=(const HXMemoryObject &) = delete;

    // Totals in bytes, final once the object is finalised.
    uint64_t totalDirtySize() const { return _totalDirtySize; }
    uint64_t totalCleanSize() const { return _totalCleanSize; }
    uint64_t totalSwappedSize() const { return _totalSwappedSize; }
    uint64_t totalReclaimableSize() const { return _totalReclaimableSize; }
    uint64_t totalWiredSize() const { return _totalWiredSize; }

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
    // The merged page runs, or null: they exist from the second run on, until finalisation.
    const HXRangeList *rangeList() const { return _rangeList.get(); }

    // Adds a region of a process, or of none in particular. The region's page runs are handed over. Not after
    // finalisation.
    void addRegion(HXMemoryRegion &region, const HXRegionOwner &process);
    void addRegion(HXMemoryRegion &region, uint32_t pageSize);

    // Fixes the sizes. With `useRegionSizes` dirty and swapped are the regions' own, added up; otherwise
    // those of the merged runs. Once.
    void finalize() { finalizeUsingRegionDirtySize(false); }
    void finalizeUsingRegionDirtySize(bool useRegionSizes);
    bool accurateSizes() const { return _accurateSizes; }

    // A finalised object with the same sizes, owner and regions, but no per-process regions. This object must
    // outlive it.
    std::unique_ptr<HXMemoryObject> copy() const;

    // The part of the object that a process maps, or the whole as clean memory when another process owns it;
    // the object itself where there is no difference. Compare addresses to tell. This object must outlive the
    // view.
    View viewForProcess(const HXRegionOwner &process) const;

    bool containsFakeRegion() const;
    // Those of the region that names the object.
    HXString name() const { return _canonicalRegion()->name(); }
    HXString detailedName() const { return _canonicalRegion()->detailedName(); }
    std::string fullName() const { return _canonicalRegion()->fullName(); }

    const HXMemoryRegion *_canonicalRegion() const;

  private:
    void _addRegion(HXMemoryRegion &region, uint32_t pageSize, const HXRegionOwner *process);
    void addRuns(HXMemoryRegion &region, uint32_t pageSize);
    HXMemoryTotal sumOfRuns() const;
    void raiseToLargestProcess();
    bool processRegionsTellMore() const;
    void nameFakeRegions();
    // Calls `each` with the regions of every process of the map.
    template <typename Each>
    void forEachProcess(Each each) const;
    std::span<const ProcessRegion> regionsOfProcess(int32_t pid) const;
    std::unique_ptr<HXMemoryObject> viewOfRegions(std::span<const ProcessRegion> regions,
                                                  const HXRegionOwner &process) const;
    void showAsClean(const HXMemoryObject &whole);

    uint64_t _totalDirtySize = 0;
    uint64_t _totalCleanSize = 0;
    uint64_t _totalSwappedSize = 0;
    uint64_t _totalReclaimableSize = 0;
    uint64_t _totalWiredSize = 0;
    HXRegionSet _memoryRegions;
    std::unique_ptr<std::vector<ProcessRegion>> _processMemoryRegions;
    std::unique_ptr<HXRangeList> _rangeList;
    // While there is no range list: the one region that would be its only run, and its page size.
    const HXMemoryRegion *_onlyRun = nullptr;
    uint32_t _onlyRunPageSize = 0;
    int32_t _ownerPid = kNoOwner;
    uint32_t _index = 0;
    bool _accurateSizes = false;
};
