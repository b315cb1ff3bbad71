// Page disposition queries.
#include "platform/HXPlatform.h"
#include "process/HXUserProcess.h"

#include <algorithm>

namespace {

constexpr uint64_t kChunkPages = 4096;

enum PageState : uint8_t { none = 0, dirty = 1, swapped = 2, reclaimable = 3, clean = 4 };

PageState stateOfPage(int32_t disposition, int32_t reclaimableMask) {
    if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT) return swapped;
    if (disposition & VM_PAGE_QUERY_PAGE_DIRTY) return dirty;
    if (disposition & reclaimableMask) return reclaimable;
    return disposition & VM_PAGE_QUERY_PAGE_PRESENT ? clean : none;
}

// By the byte accounting a present page without a pager is dirty, whatever its dirty bit.
bool countsAsDirty(int32_t disposition) {
    constexpr int32_t residence = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL;
    return disposition & VM_PAGE_QUERY_PAGE_DIRTY || (disposition & residence) == VM_PAGE_QUERY_PAGE_PRESENT;
}

} // namespace

bool HXUserProcess::_enumerateDispositionChunksWithStartAddr(uint64_t start, uint64_t pages,
                                                             const HXDispositionCallback &block) {
    HXPlatform &platform = HXPlatform::current();
    const uint64_t chunkPages = std::min(pages, kChunkPages);
    const uint64_t chunkCount = pages / kChunkPages + (pages % kChunkPages != 0);
    std::vector<int32_t> dispositions(chunkPages);
    for (uint64_t chunk = 0; chunk < chunkCount; chunk++) {
        const uint64_t asked = std::min(pages - kChunkPages * chunk, chunkPages);
        uint64_t count = asked;
        const kern_return_t error = platform.mach_vm_page_range_query(
            _task, start + kChunkPages * chunk * pageSize(), asked * pageSize(), dispositions.data(), &count);
        if (error != KERN_SUCCESS) {
            platform.mach_error("mach_vm_page_range_query", error);
            _processMachVMError(error, KERN_INVALID_ARGUMENT);
            return false;
        }
        block(dispositions.data(), std::min(count, asked), chunk, chunkCount);
    }
    return true;
}

// The bytes of one piece of a mapping, counted page by page.
struct HXUserProcess::PieceAccount {
    const HXMemoryRegion &region;
    uint64_t pageSize;
    uint64_t alignedStart;
    uint64_t alignedEnd;
    uint64_t dirty = 0;
    uint64_t swapped = 0;

    PieceAccount(const HXMemoryRegion &piece, uint32_t size)
        : region(piece), pageSize(size), alignedStart(piece.start() & ~uint64_t{size - 1}),
          alignedEnd((piece.end() + size - 1) & ~uint64_t{size - 1}) {}
    bool startUnaligned() const { return region.start() != alignedStart; }
    bool endUnaligned() const { return region.end() != alignedEnd; }
    uint64_t bytesInFirstPage() const {
        return std::min(region.size(), alignedStart + pageSize - region.start());
    }
    uint64_t bytesInLastPage() const { return region.end() - (alignedEnd - pageSize); }
    void count(int32_t disposition, uint64_t bytes) {
        if (countsAsDirty(disposition))
            dirty += bytes;
        else if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT)
            swapped += bytes;
    }
};

void HXUserProcess::accountPage(PieceAccount &account, int32_t disposition, bool isFirst, bool isLast) {
    const uint64_t bytes = isFirst  ? account.bytesInFirstPage()
                           : isLast ? account.bytesInLastPage()
                                    : account.pageSize;
    account.count(disposition, bytes);
    if (isFirst && _pendingUnusedSharedRegion) {
        // The unused area before this piece ends in this page, which nobody has asked for until now.
        HXMemoryRegion &unused = *_pendingUnusedSharedRegion;
        const uint64_t unusedBytes = unused.end() - account.alignedStart;
        if (countsAsDirty(disposition))
            unused.setDirtySize(unused.dirtySize() + unusedBytes);
        else if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT)
            unused.setSwappedSize(unused.swappedSize() + unusedBytes);
        _pendingUnusedSharedRegion = nullptr;
    }
    if (isLast) {
        _cachedDispositionAddress = account.alignedEnd - account.pageSize;
        _cachedDisposition = disposition;
    }
}

bool HXUserProcess::_populateMemoryRegionWithPageQueries(HXMemoryRegion &region,
                                                         const vm_region_submap_info_64 &) {
    constexpr char operation[] = "_populateMemoryRegionWithPageQueries";
    HXRequire(region.dirtySize() == 0, operation, "memoryRegion.dirtySize == 0");
    HXRequire(region.swappedSize() == 0, operation, "memoryRegion.swappedSize == 0");
    PieceAccount account(region, pageSize());
    uint64_t pages = (account.alignedEnd - account.alignedStart) / pageSize();
    uint64_t queryStart = account.alignedStart;
    const bool cachedFirst = pages > 0 && _cachedDispositionAddress == account.alignedStart;
    if (cachedFirst) {
        account.count(_cachedDisposition, account.bytesInFirstPage());
        pages--;
        queryStart += pageSize();
    }
    if (region.unusedSharedCacheRegion()) {
        if (cachedFirst) {
            region.setDirtySize(account.dirty);
            region.setSwappedSize(account.swapped);
        } else {
            HXRequire(!account.startUnaligned(), operation,
                      "Unused shared cache region has no cache entry for non-page-aligned start address");
        }
        if (account.endUnaligned() && pages != 0) _pendingUnusedSharedRegion = &region;
        return true;
    }
    const bool complete = _enumerateDispositionChunksWithStartAddr(
        queryStart, pages,
        [&](const int32_t *dispositions, uint64_t count, uint64_t chunk, uint64_t chunkCount) {
            for (uint64_t i = 0; i < count; i++)
                accountPage(account, dispositions[i],
                            chunk == 0 && i == 0 && !cachedFirst && account.startUnaligned(),
                            chunk == chunkCount - 1 && i == count - 1 && account.endUnaligned());
        });
    region.setSwappedSize(account.swapped);
    region.setDirtySize(account.dirty);
    return complete;
}

// A run of pages of one state, as it grows.
struct HXUserProcess::PageRun {
    HXMemoryRegion &region;
    uint32_t pageSize;
    PageState state = none;
    uint64_t offset;
    uint64_t length = 0;

    void flush() {
        HXMemoryTotal total;
        switch (state) {
        case dirty:
            total.dirty = length;
            break;
        case swapped:
            total.swapped = length;
            break;
        case reclaimable:
            total.reclaimable = length;
            break;
        case clean:
            total.clean = length;
            break;
        case none:
            HXInternalError("_addSubrangesForRegion", "Tried to add an empty subrange");
        }
        if (region.wired()) total.wired = length;
        region.addSubrange({offset, length}, total, pageSize);
        offset += length;
        length = 0;
    }
    void addPage(PageState next) {
        if (state != next && state != none && length != 0) flush();
        state = next;
        if (state == none)
            offset += pageSize;
        else
            length += pageSize;
    }
};

void HXUserProcess::_addSubrangesForRegion(HXMemoryRegion &region, int32_t purgeState) {
    HXRequire(!region.ownedExclusivelyByParentProcess(), "_addSubrangesForRegion",
              "!region.ownedExclusivelyByParentProcess");
    const PieceAccount extent(region, pageSize());
    const int32_t reclaimableMask =
        purgeState == VM_PURGABLE_VOLATILE ? VM_PAGE_QUERY_PAGE_PRESENT : VM_PAGE_QUERY_PAGE_REUSABLE;
    PageRun run{.region = region, .pageSize = pageSize(), .offset = region.offset()};
    const bool complete = _enumerateDispositionChunksWithStartAddr(
        extent.alignedStart, (extent.alignedEnd - extent.alignedStart) / pageSize(),
        [&](const int32_t *dispositions, uint64_t count, uint64_t, uint64_t) {
            for (uint64_t i = 0; i < count; i++)
                run.addPage(stateOfPage(dispositions[i], reclaimableMask));
        });
    if (complete) run.addPage(none);
}
