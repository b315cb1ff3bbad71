// Page disposition queries.
#include "platform/HXPlatform.h"
#include "process/HXUserProcess.h"

namespace {

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
    uint64_t offset; // of the run, in its object
    PageKind kind = nullptr;
    uint64_t length = 0;

    // Goes on to `next`, an offset not before the end of the run.
    void skipTo(uint64_t next) {
        if (next == offset + length) return;
        flush();
        offset = next;
    }
    void add(PageKind next, uint64_t bytes) {
        if (kind != next) flush();
        kind = next;
        (kind ? length : offset) += bytes;
    }
    void flush() {
        if (length == 0) return;
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
    std::vector<vm_page_run> runs;
    while (pages > 0) {
        uint64_t told = 0;
        const kern_return_t error =
            platform.mach_vm_page_range_query(_task.get(), start, pages * pageSize(), &runs, &told);
        if (error != KERN_SUCCESS) {
            platform.mach_error("mach_vm_page_range_query", error);
            _processMachVMError(error, KERN_INVALID_ARGUMENT);
            return false;
        }
        HXRequire(told > 0 && told <= pages, "_enumerateDispositionChunksWithStartAddr",
                  "a query goes on, and not too far");
        start += told * pageSize();
        pages -= told;
        block(runs, start);
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
    const auto offsetOf = [&](uint64_t address) { return region.offset() + (address - start); };
    const bool complete = _enumerateDispositionChunksWithStartAddr(
        start, (end - start) / pageSize(), [&](std::span<const vm_page_run> runs, uint64_t toldEnd) {
            for (const vm_page_run &found : runs) {
                run.skipTo(offsetOf(found.address));
                run.add(kindOfPage(found.disposition, reclaimableMask), found.pages * pageSize());
            }
            run.skipTo(offsetOf(toldEnd));
        });
    if (complete) run.flush();
}
