// The record of a live user process, whose address space is walked through its task port.
#pragma once

#include "platform/HXHostGuards.h"
#include "process/HXImage.h"
#include "process/HXImageEnumerator.h"
#include "process/HXOwnedVmObjects.h"
#include "process/HXProcess.h"
#include "process/HXSharedRegionCutter.h"

#include <functional>
#include <optional>
#include <string_view>
#include <vector>

// Called once per region in ascending order: start, size in bytes, the kernel's description (valid during the
// call), purge state (VM_PURGABLE_…), path of the mapped file or none. Returns true to stop the walk.
using HXRegionCallback =
    std::function<bool(uint64_t start, uint64_t size, const vm_region_submap_info_64 &info,
                       int32_t purgeState, std::optional<std::string_view> path)>;

class HXUserProcess : public HXProcess {
  public:
    bool initWithBsdInfo(const proc_bsdinfo &info, HXProcessSnapshot *snapshot) override;
    void gatherData() override;
    bool _isAlive() const override { return true; }
    // The current and the peak heft, neither aggregating; null when the heft is 0.
    HXAuxTree auxData() const override;

    // Bytes charged to the process now, and the most it ever was.
    uint64_t physHeft() const { return _phys_heft; }
    uint64_t physHeftPeak() const { return _phys_heft_peak; }
    const HXSharedRegion &sharedRegion() const { return _sharedRegion; }

    // Walks the address space. A failed kernel call ends the walk and becomes an error or warning.
    virtual void enumerateRegions(const HXRegionCallback &callback);

    // The start of the last mapping that begins below the shared region, to within 16 MiB; 0 when there is
    // none.
    uint64_t _lastNonSharedCacheRegion();
    // Takes the shared region from the platform's layout; false for an unknown one.
    bool _setSharedRegionFromPlatform(int32_t platform);
    // 3, 2 or 1 by the three dirty flags; see HXIdleExitStatus.
    void _setIdleExitStatusFromDirtyFlags(uint32_t flags);
    // Reports a failed kernel call: a warning when the process has exited or is a zombie, else an error.
    // `expected` is what the call gives once the process is gone.
    void _processMachVMError(kern_return_t error, kern_return_t expected);

  protected:
    bool _populateTask(HXProcessSnapshot *snapshot) override;
    // Whether the process's host has a shared region at all.
    virtual bool _hostHasSharedRegion() const;

    void _gatherImageData();
    virtual void _gatherPhysHeft();
    void _gatherLedgers();
    void _gatherIdleExitStatus();
    std::optional<HXOwnedVmObjects> _gatherOwnedVmObjects();
    void _gatherMemoryData();
    void _gatherHeldObjects();

    // Cuts a region into runs of pages of one kind.
    void _addSubrangesForRegion(HXMemoryRegion &region, int32_t purgeState);
    // Queries `pages` pages from the page-aligned `start` on, step by step; false when a query failed.
    bool _enumerateDispositionChunksWithStartAddr(uint64_t start, uint64_t pages,
                                                  const HXDispositionCallback &block);
    // Adds a warning with the text of the current errno and prints it.
    void _addErrnoWarningWithDescription(const std::string &description);

    uint64_t _phys_heft{};
    uint64_t _phys_heft_peak{};
    std::vector<HXImage> _images; // sorted by start

  private:
    struct Gathering;

    void walkEnded(const char *call, kern_return_t error);
    void printBailingOut() const;
    HXSharedRegionCutter::PageQuery pageQuery();
    bool handOverRegion(uint64_t address, uint64_t size, const vm_region_submap_info_64 &info,
                        const HXRegionCallback &callback);
    void addImage(const RVSymbolOwner &owner);

    bool addRegion(Gathering &gathering, uint64_t start, uint64_t size, const vm_region_submap_info_64 &info,
                   int32_t purgeState, std::optional<std::string_view> path);
    void setSizes(HXMemoryRegion &region, const Gathering &gathering,
                  const vm_region_submap_info_64 &info) const;
    void nameRegion(HXMemoryRegion &region, Gathering &gathering, const vm_region_submap_info_64 &info,
                    int32_t purgeState, std::optional<std::string_view> path);
    void takeParts(HXMemoryRegion &region, Gathering &gathering) const;
    void chargeOwnedObject(HXMemoryRegion &region, Gathering &gathering, const vm_region_submap_info_64 &info,
                           int32_t purgeState);
    void warnOfMovedMemory();
    void addUnmappedOwnedObjects(Gathering &gathering);
    void addUnmappedHeft(Gathering &gathering);
    void addPageTables(Gathering &gathering);

    HXTaskPort _task{HXPlatform::current()};
    HXSharedRegion _sharedRegion;
    uint64_t _ledgers[1] = {0}; // balance of the ledger entry "page_table", bytes
    std::optional<HXOwnedVmObjects> _ownedVmObjects;
};
