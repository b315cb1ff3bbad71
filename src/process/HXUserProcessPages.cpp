// Page disposition queries.
#include "platform/HXPlatform.h"
#include "process/HXUserProcess.h"

#include <algorithm>

namespace {

constexpr uint64_t kChunkPages = 4096; // a buffer of 16 KiB

// What a page counts as; null: it is not resident.
using PageKind = uint64_t HXMemoryTotal::*;

PageKind kindOfPage(int32_t disposition, int32_t reclaimableMask) {
    if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT) return &HXMemoryTotal::swapped;
    if (disposition & VM_PAGE_QUERY_PAGE_DIRTY) return &HXMemoryTotal::dirty;
    if (disposition & reclaimableMask) return &HXMemoryTotal::reclaimable;
    return disposition & VM_PAGE_QUERY_PAGE_PRESENT ? &HXMemoryTotal::clean : nullptr;
}

// A run of pages of one kind, as it grows.
struct PageRun {
    HXMemoryRegion &region;
    uint32_t pageSize;
    uint64_t offset;
    PageKind kind = nullptr;
    uint64_t length = 0;

    void addPage(PageKind next) {
        if (length != 0 && kind != next) flush();
        kind = next;
        (kind ? length : offset) += pageSize;
    }
    void flush() {
        HXMemoryTotal total;
        total.*kind = length;
        if (region.wired()) total.wired = length;
        region.addSubrange({offset, length}, total, pageSize);
        offset += length;
        length = 0;
    }
};

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
        const kern_return_t error =
            platform.mach_vm_page_range_query(_task.get(), start + kChunkPages * chunk * pageSize(),
                                              asked * pageSize(), dispositions.data(), &count);
        if (error != KERN_SUCCESS) {
            platform.mach_error("mach_vm_page_range_query", error);
            _processMachVMError(error, KERN_INVALID_ARGUMENT);
            return false;
        }
        block(dispositions.data(), std::min(count, asked), chunk, chunkCount);
    }
    return true;
}

HXSharedRegionCutter::PageQuery HXUserProcess::pageQuery() {
    if (!_isAlive()) return nullptr;
    return [this](uint64_t start, uint64_t pages, const HXDispositionCallback &block) {
        return _enumerateDispositionChunksWithStartAddr(start, pages, block);
    };
}

void HXUserProcess::_addSubrangesForRegion(HXMemoryRegion &region, int32_t purgeState) {
    HXRequire(!region.ownedExclusivelyByParentProcess(), "_addSubrangesForRegion",
              "!region.ownedExclusivelyByParentProcess");
    const uint64_t pageMask = pageSize() - 1;
    const uint64_t start = region.start() & ~pageMask;
    const uint64_t end = (region.end() + pageMask) & ~pageMask;
    const int32_t reclaimableMask =
        purgeState == VM_PURGABLE_VOLATILE ? VM_PAGE_QUERY_PAGE_PRESENT : VM_PAGE_QUERY_PAGE_REUSABLE;
    PageRun run{.region = region, .pageSize = pageSize(), .offset = region.offset()};
    const bool complete = _enumerateDispositionChunksWithStartAddr(
        start, (end - start) / pageSize(),
        [&](const int32_t *dispositions, uint64_t count, uint64_t, uint64_t) {
            for (uint64_t i = 0; i < count; i++)
                run.addPage(kindOfPage(dispositions[i], reclaimableMask));
        });
    if (complete) run.addPage(nullptr);
}
