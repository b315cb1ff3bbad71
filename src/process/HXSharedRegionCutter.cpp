#include "process/HXSharedRegionCutter.h"

#include "platform/HXInternalError.h"

#include <algorithm>

namespace {

// By platform code.
constexpr HXSharedRegion kLayouts[] = {
    {0x90000000, 0x20000000},     // 32-bit Intel
    {0x7FFF00000000, 0xFFE00000}, // 64-bit Intel
    {0x40000000, 0x40000000},     // 32-bit ARM
    {0x180000000, 0x100000000},   // 64-bit ARM
    {0x1A000000, 0x40000000},     // 64-bit ARM with 32-bit pointers
};

// What segments are aligned to within the region, in bytes: less than a page of some machines.
constexpr uint64_t kAlignment = 0x1000;

// A present page without a pager is dirty, whatever its dirty bit.
bool countsAsDirty(int32_t disposition) {
    constexpr int32_t residence = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL;
    return disposition & VM_PAGE_QUERY_PAGE_DIRTY || (disposition & residence) == VM_PAGE_QUERY_PAGE_PRESENT;
}

// Adds the bytes that a region holds of pages.
void countPages(HXMemoryRegion &region, int32_t disposition, uint64_t bytes) {
    if (countsAsDirty(disposition))
        region.setDirtySize(region.dirtySize() + bytes);
    else if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT)
        region.setSwappedSize(region.swappedSize() + bytes);
}

} // namespace

std::optional<HXSharedRegion> HXSharedRegion::ofPlatform(int32_t platform) {
    if (platform < 0 || platform >= static_cast<int32_t>(std::size(kLayouts))) return std::nullopt;
    return kLayouts[platform];
}

vm_region_submap_info_64 HXInfoOfSharedRegionEntry(const vm_region_basic_info_64 &basic) {
    vm_region_submap_info_64 info{};
    info.protection = basic.protection;
    info.max_protection = basic.max_protection;
    info.inheritance = basic.inheritance;
    info.offset = basic.offset;
    info.behavior = basic.behavior;
    info.user_wired_count = basic.user_wired_count;
    info.external_pager = 1;
    info.share_mode = SM_COW;
    info.object_id = 1;
    info.object_id_full = 1;
    return info;
}

// The pages that a piece of an entry lies in, the first and the last of which it may share.
class HXSharedRegionCutter::Piece {
  public:
    Piece(const HXMemoryRegion &region, uint64_t pageSize)
        : _start(region.start()), _end(region.end()), _pageSize(pageSize),
          _firstPage(_start / pageSize * pageSize), _pagesEnd((_end + pageSize - 1) / pageSize * pageSize) {}
    uint64_t firstPage() const { return _firstPage; }
    uint64_t lastPage() const { return _pagesEnd - _pageSize; }
    uint64_t pages() const { return (_pagesEnd - _firstPage) / _pageSize; }
    bool startsWithinPage() const { return _start != _firstPage; }
    bool endsWithinPage() const { return _end != _pagesEnd; }
    uint64_t bytesInFirstPage() const { return std::min(_end, _firstPage + _pageSize) - _start; }

  private:
    uint64_t _start, _end, _pageSize, _firstPage, _pagesEnd;
};

bool HXSharedRegionCutter::_addRegionsToArray(uint64_t start, uint64_t size,
                                              const vm_region_submap_info_64 &info) {
    static const HXString sharedCache = HXString::intern("dyld shared cache");
    const uint64_t end = start + size;
    _pendingUnusedSharedRegion = nullptr;
    const HXImage *image = _images.nextImageForStart(start, end);
    for (uint64_t cursor = start; cursor < end;) {
        if (!image || cursor < image->start()) {
            const uint64_t gapEnd = image && image->start() < end ? image->start() : end;
            HXMemoryRegion &gap = append(cursor, gapEnd, start, info);
            gap.setName("unused dyld shared cache area");
            gap.setUnusedSharedCacheRegion(true);
            if ((cursor % _pageSize != 0 || gapEnd % _pageSize != 0) && !populate(gap, info)) return false;
            cursor = gapEnd;
            if (cursor >= end || !image) return true;
        }
        if (image->end() <= cursor) { // an image that overlaps the one before, and ends within it
            image = _images.nextImageForStart(cursor, end);
            continue;
        }
        HXMemoryRegion &piece = append(cursor, std::min(image->end(), end), start, info);
        const HXImage *next = _images.nextImageForStart(piece.end(), end);
        const uint64_t nextStart = next ? next->start() : 0;
        if (next != image && cursor % kAlignment == 0 && nextStart % kAlignment == 0)
            piece.setEnd((piece.end() + kAlignment - 1) / kAlignment * kAlignment);
        piece.setName(image->name());
        piece.setDetailedName(image->segment() == HXSegmentLinkedit ? sharedCache : image->ownerPath());
        piece.setSegment(image->segment());
        if (!populate(piece, info)) return false;
        cursor = piece.end();
        image = next;
    }
    return true;
}

// A region with the fields that all pieces of an entry have in common.
HXMemoryRegion &HXSharedRegionCutter::append(uint64_t start, uint64_t end, uint64_t entryStart,
                                             const vm_region_submap_info_64 &info) {
    HXMemoryRegion &region = _regions.emplace_back();
    region.setStart(start);
    region.setEnd(end);
    region.setUser_tag(info.user_tag);
    region.setObject_id(info.object_id_full);
    region.setShare_mode(info.share_mode);
    region.setOffset(info.offset + (start - entryStart));
    region.setInSharedCache(true);
    region.setWired(info.user_wired_count != 0);
    return region;
}

// The dirty and swapped bytes of the latest region, if it can have any. When they cannot be told it goes.
bool HXSharedRegionCutter::populate(HXMemoryRegion &region, const vm_region_submap_info_64 &info) {
    if (!(info.max_protection & VM_PROT_WRITE)) return true;
    if (!_query) {
        region.setDirtySize(info.pages_dirtied);
        region.setSwappedSize(info.pages_swapped_out);
        return true;
    }
    if (_populateMemoryRegionWithPageQueries(region)) return true;
    _regions.pop_back();
    _pendingUnusedSharedRegion = nullptr;
    return false;
}

bool HXSharedRegionCutter::_populateMemoryRegionWithPageQueries(HXMemoryRegion &region) {
    const Piece piece(region, _pageSize);
    const bool firstIsKnown = piece.pages() > 0 && _cachedDispositionAddress == piece.firstPage();
    if (firstIsKnown) countPages(region, _cachedDisposition, piece.bytesInFirstPage());
    if (!region.unusedSharedCacheRegion()) return queryPiece(region, piece, firstIsKnown);
    // Nobody has used an unused area's pages but by the pieces that share them, so no page is asked for.
    HXRequire(firstIsKnown || !piece.startsWithinPage(), "_populateMemoryRegionWithPageQueries",
              "Unused shared cache region has no cache entry for non-page-aligned start address");
    const bool lastIsKnown = firstIsKnown && piece.pages() == 1;
    if (piece.endsWithinPage() && !lastIsKnown) _pendingUnusedSharedRegion = &region;
    return true;
}

// Asks for the pages of a piece but the first where that is known from the piece before.
bool HXSharedRegionCutter::queryPiece(HXMemoryRegion &region, const Piece &piece, bool firstIsKnown) {
    const uint64_t first = piece.firstPage() + (firstIsKnown ? _pageSize : 0);
    const bool startsWithinPage = !firstIsKnown && piece.startsWithinPage();
    return _query(first, piece.pages() - (firstIsKnown ? 1 : 0),
                  [&](std::span<const vm_page_run> runs, uint64_t toldEnd) {
                      for (const vm_page_run &run : runs) {
                          const uint64_t start = std::max(run.address, region.start());
                          const uint64_t end = std::min(run.end(_pageSize), region.end());
                          if (start < end) countPages(region, run.disposition, end - start);
                      }
                      if (startsWithinPage && _pendingUnusedSharedRegion) {
                          // The unused area before this piece ends in this page, which nobody has asked for
                          // until now.
                          const bool hasFirst = !runs.empty() && runs.front().address == first;
                          countPages(*_pendingUnusedSharedRegion, hasFirst ? runs.front().disposition : 0,
                                     _pendingUnusedSharedRegion->end() - first);
                          _pendingUnusedSharedRegion = nullptr;
                      }
                      if (piece.endsWithinPage() && toldEnd > piece.lastPage()) {
                          const bool hasLast = !runs.empty() && runs.back().end(_pageSize) > piece.lastPage();
                          _cachedDispositionAddress = piece.lastPage();
                          _cachedDisposition = hasLast ? runs.back().disposition : 0;
                      }
                  });
}
