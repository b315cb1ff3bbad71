// The record of a live user process, whose address space is walked through its task port.
#pragma once

#include "process/HXImage.h"
#include "process/HXImageEnumerator.h"
#include "process/HXOwnedVmObjects.h"
#include "process/HXProcess.h"

#include <functional>
#include <optional>
#include <string_view>
#include <vector>

// Called once per region in ascending order: start, size in bytes, the kernel's description (valid during the
// call), purge state (VM_PURGABLE_…), path of the mapped file or none. Returns true to stop the walk.
using HXRegionCallback =
    std::function<bool(uint64_t start, uint64_t size, const vm_region_submap_info_64 &info,
                       int32_t purgeState, std::optional<std::string_view> path)>;

// A chunk of page dispositions (valid during the call), the number of its entries, its index and the number
// of chunks.
using HXDispositionCallback =
    std::function<void(const int32_t *dispositions, uint64_t count, uint64_t chunk, uint64_t chunkCount)>;

// Address-space layouts of the shared region.
enum HXSharedRegionPlatform : int32_t {
    HXPlatformIntel32 = 0,
    HXPlatformIntel64 = 1,
    HXPlatformARM32 = 2,
    HXPlatformARM64 = 3,
    HXPlatformARM64_32 = 4,
    HXPlatformUnknown = 5,
};

class HXUserProcess : public HXProcess {
  public:
    HXUserProcess() = default;
    ~HXUserProcess() override;

    bool initWithBsdInfo(const proc_bsdinfo &info) override;
    void gatherData() override;
    // The current and the peak heft, neither aggregating; null when the heft is 0.
    HXAuxTree auxData() const override;

    // Bytes charged to the process now, and the most it ever was.
    uint64_t physHeft() const { return _phys_heft; }
    uint64_t physHeftPeak() const { return _phys_heft_peak; }
    uint64_t sharedRegionBase() const { return _sharedRegionBase; }
    uint64_t sharedRegionSize() const { return _sharedRegionSize; }
    const std::vector<HXImage> &images() const { return _images; }

    // Walks the address space. A failed kernel call ends the walk and becomes an error or warning.
    virtual void enumerateRegions(const HXRegionCallback &callback);

    // The start of the last mapping that begins below the shared region, to within 16 MiB; 0 when there is
    // none.
    uint64_t _lastNonSharedCacheRegion();
    // Takes base and size of the shared region from the platform's layout; false for an unknown one.
    bool _setSharedRegionFromPlatform(int32_t platform);
    // 3, 2 or 1 by the three dirty flags; see HXIdleExitStatus.
    void _setIdleExitStatusFromDirtyFlags(uint32_t flags);
    // Reports a failed kernel call: a warning when the process has exited or is a zombie, else an error.
    // `expected` is what the call gives once the process is gone.
    void _processMachVMError(kern_return_t error, kern_return_t expected);

  protected:
    bool _populateTask() override;
    bool _isAlive() const override { return true; }
    // Whether the process's host has a shared region at all.
    virtual bool _hostHasSharedRegion() const;

    virtual void _gatherImageData();
    virtual void _gatherPhysHeft();
    void _gatherLedgers();
    void _gatherIdleExitStatus();
    virtual std::optional<HXOwnedVmObjects> _gatherOwnedVmObjects();
    void _gatherMemoryData();

    // Fills the dirty and swapped sizes of one piece of a writable shared-cache mapping; false when a query
    // failed.
    virtual bool _populateMemoryRegionWithPageQueries(HXMemoryRegion &region,
                                                      const vm_region_submap_info_64 &info);
    // Cuts a region into runs of pages of one kind.
    virtual void _addSubrangesForRegion(HXMemoryRegion &region, int32_t purgeState);
    // Queries `pages` pages from the page-aligned `start` on, in chunks; false when a query failed.
    bool _enumerateDispositionChunksWithStartAddr(uint64_t start, uint64_t pages,
                                                  const HXDispositionCallback &block);
    // Appends the regions that cut one shared-region entry; false when a page query failed.
    bool _addRegionsToArray(HXMemoryRegionList &regions, uint64_t start, uint64_t size,
                            const vm_region_submap_info_64 &info, HXImageEnumerator &enumerator);
    // Adds a warning with the text of the current errno and prints it.
    void _addErrnoWarningWithDescription(const std::string &description);
    void setIdleExitStatus(HXIdleExitStatus status) { _idleExitStatus = status; }

    uint64_t _phys_heft = 0;
    uint64_t _phys_heft_peak = 0;
    std::vector<HXImage> _images; // sorted by start

  private:
    struct Gathering;
    struct PieceAccount;
    struct PageRun;

    bool inSharedRegion(uint64_t address) const {
        return address >= _sharedRegionBase && address - _sharedRegionBase < _sharedRegionSize;
    }
    void releaseTask();
    void walkFailed(const char *call, kern_return_t error);
    void printBailingOut() const;
    void handOverRegion(uint64_t address, uint64_t size, const vm_region_submap_info_64 &info,
                        const HXRegionCallback &callback, bool *stop);
    void addImage(const RVSymbolOwner &owner);

    bool addRegion(Gathering &gathering, uint64_t start, uint64_t size, const vm_region_submap_info_64 &info,
                   int32_t purgeState, std::optional<std::string_view> path);
    void setSizes(HXMemoryRegion &region, const Gathering &gathering,
                  const vm_region_submap_info_64 &info) const;
    void nameRegion(HXMemoryRegion &region, Gathering &gathering, const vm_region_submap_info_64 &info,
                    int32_t purgeState, std::optional<std::string_view> path);
    void chargeOwnedObject(HXMemoryRegion &region, Gathering &gathering, const vm_region_submap_info_64 &info,
                           int32_t purgeState);
    void addUnmappedOwnedObjects(Gathering &gathering);
    void addUnmappedHeft(Gathering &gathering);
    void addPageTables(Gathering &gathering);

    HXMemoryRegion &appendCut(HXMemoryRegionList &regions, uint64_t cursor, uint64_t entryStart,
                              const vm_region_submap_info_64 &info) const;
    void accountPage(PieceAccount &account, int32_t disposition, bool isFirst, bool isLast);

    mach_port_t _task = 0;
    uint64_t _sharedRegionBase = 0;
    uint64_t _sharedRegionSize = 0;
    uint32_t _sharedRegionAlignmentSize = 0;
    uint64_t _ledgers[1] = {0}; // balance of the ledger entry "page_table", bytes
    std::optional<HXOwnedVmObjects> _ownedVmObjects;
    uint64_t _cachedDispositionAddress = 0;
    int32_t _cachedDisposition = 0;
    HXMemoryRegion *_pendingUnusedSharedRegion = nullptr;
};
