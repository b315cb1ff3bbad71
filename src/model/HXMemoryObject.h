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

// What is seen of an object: its sizes and the number of its regions.
struct HXMemoryObjectView : HXMemoryTotal {
    bool isWhole = true; // what everybody sees; otherwise one process's own view
};

// Open (regions may be added), then finalised (sizes fixed). Not owned: its regions, which belong to their
// processes. Created and filled by one thread; finalised by one, which may be another.
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
    HXSizes sizes() const;
    // In the order in which they were added.
    std::span<HXMemoryRegion *const> memoryRegions() const;
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

    bool containsFakeRegion() const { return _containsFakeRegion; }
    // The region that names the object.
    const HXMemoryRegion *_canonicalRegion() const;

  private:
    void _addRegion(HXMemoryRegion &region, uint32_t pageSize, const HXRegionOwner *process);
    void addToRegions(HXMemoryRegion &region, const HXRegionOwner *process);
    void addRuns(HXMemoryRegion &region, uint32_t pageSize);
    const HXMemoryRegion *onlyRun() const;
    HXSizes sumOfRuns() const;
    bool isMadeOfParts() const;
    void raiseToLargestProcess(std::span<const ProcessRegion> all, HXSizes *sizes) const;
    bool processRegionsTellMore(const HXSizes &sizes) const;
    void nameFakeRegions();
    template <typename Each>
    static void forEachProcess(std::span<const ProcessRegion> all, Each each);
    std::span<const ProcessRegion> regionsOfProcess(int32_t pid) const;

    // What most objects do without, having one region and its sizes.
    struct More {
        HXSizes sizes;                         // until finalisation what counts of parts alone
        std::vector<HXMemoryRegion *> regions; // all, from the second region on
        std::vector<ProcessRegion> processMemoryRegions;
        std::unique_ptr<HXRangeList> rangeList;  // the merged page runs, from the second run to finalisation
        const HXMemoryRegion *onlyRun = nullptr; // while there is no range list; null: the first region
    };
    More &more() {
        if (!_more) _more = std::make_unique<More>();
        return *_more;
    }

    HXMemoryRegion *_first = nullptr;
    std::unique_ptr<More> _more;
    int32_t _firstPid = 0;
    int32_t _ownerPid = kNoOwner;
    uint32_t _index = 0;
    uint8_t _runPageWidth = 0;          // of the first run: how many bits its page size has; 0: no run yet
    bool _isFirstByProcess : 1 = false; // the first region counts among those of its process, _firstPid
    bool _containsFakeRegion : 1 = false;
    bool _hasSizesOfFirst : 1 = false; // then there is no more
    bool _accurateSizes : 1 = false;   // finalised
};
