// The shared region of libraries: where it lies, and how its entries are cut by the images in them.
#pragma once

#include "platform/HXHostRecords.h"
#include "process/HXImageEnumerator.h"

#include <cstdint>
#include <functional>
#include <optional>
#include <span>

// Address-space layouts of the shared region.
enum HXSharedRegionPlatform : int32_t {
    HXPlatformIntel32 = 0,
    HXPlatformIntel64 = 1,
    HXPlatformARM32 = 2,
    HXPlatformARM64 = 3,
    HXPlatformARM64_32 = 4,
    HXPlatformUnknown = 5,
};

// Addresses [base, base + size); empty where there is none.
struct HXSharedRegion {
    uint64_t base = 0;
    uint64_t size = 0;

    uint64_t end() const { return base + size; }
    bool contains(uint64_t address) const { return address >= base && address - base < size; }
    // By platform code (HXSharedRegionPlatform); none for an unknown one.
    static std::optional<HXSharedRegion> ofPlatform(int32_t platform);
};

// What the walk tells of an entry, which it does not descend into.
vm_region_submap_info_64 HXInfoOfSharedRegionEntry(const vm_region_basic_info_64 &basic);

// Runs of pages (valid during the call), each behind those of the call before, and the address up to which
// all pages have been told of by now.
using HXDispositionCallback = std::function<void(std::span<const vm_page_run> runs, uint64_t toldEnd)>;

// Serves the walk of one process, entry by entry in ascending order.
class HXSharedRegionCutter {
  public:
    // Tells of `pages` pages from the page-aligned `start` on; false when a query failed.
    using PageQuery = std::function<bool(uint64_t start, uint64_t pages, const HXDispositionCallback &block)>;

    // Cuts by `images` and appends to `regions`, which both belong to the caller and outlive the cutter.
    // Without a query the figures of writable pieces are those of their entry.
    HXSharedRegionCutter(uint32_t pageSize, HXImageEnumerator &images, HXMemoryRegionList &regions,
                         PageQuery query)
        : _pageSize(pageSize), _images(images), _regions(regions), _query(std::move(query)) {}

    // Appends the regions that cut one entry; false when a page query failed, at the piece that is then
    // missing.
    bool _addRegionsToArray(uint64_t start, uint64_t size, const vm_region_submap_info_64 &info);

  private:
    class Piece;

    HXMemoryRegion &append(uint64_t start, uint64_t end, uint64_t entryStart,
                           const vm_region_submap_info_64 &info);
    bool populate(HXMemoryRegion &region, const vm_region_submap_info_64 &info);
    bool _populateMemoryRegionWithPageQueries(HXMemoryRegion &region);
    bool queryPiece(HXMemoryRegion &region, const Piece &piece, bool firstIsKnown);

    const uint32_t _pageSize;
    HXImageEnumerator &_images;
    HXMemoryRegionList &_regions;
    const PageQuery _query;
    // The last page of the latest piece that ended within it: the next piece holds its other bytes.
    uint64_t _cachedDispositionAddress = 0;
    int32_t _cachedDisposition = 0;
    // An unused area that ends within a page that the next piece will ask for.
    HXMemoryRegion *_pendingUnusedSharedRegion = nullptr;
};
