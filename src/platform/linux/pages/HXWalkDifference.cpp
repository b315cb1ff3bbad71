#include "platform/linux/pages/HXWalkDifference.h"

#include <algorithm>
#include <string_view>

namespace {

// Pages of the mappings that the counters have, and those that they may have: how much shared memory is
// swapped out they do not tell, and a driver's memory they count as shared memory or not at all.
struct Pages {
    uint64_t certain = 0;
    uint64_t possible = 0;
};

bool mayBeDrivers(const HXMapping &mapping, const HXAddressSpace &addressSpace) {
    if (!mapping.isFile()) return mapping.kind != HXPathKind::none;
    const std::string_view path = addressSpace.path(mapping.path).text;
    return !path.starts_with('/') || path.starts_with("/dev/");
}

Pages pagesOf(const HXAddressSpace &addressSpace) {
    Pages pages;
    for (size_t i = 0; i < addressSpace.count(); i++) {
        const HXMapping &mapping = addressSpace[i];
        const bool isSwapBacked = mapping.has(HXMappingSwapBacked);
        const uint64_t others =
            mapping.residentPages - std::min(mapping.residentPages, mapping.anonymousPages);
        pages.certain += uint64_t{mapping.anonymousPages} + mapping.hugePages;
        (isSwapBacked ? pages.possible : pages.certain) += mapping.swappedPages;
        if (isSwapBacked)
            pages.certain += others;
        else if (mayBeDrivers(mapping, addressSpace))
            pages.possible += others;
    }
    return pages;
}

std::optional<uint64_t> countersOf(const HXStatusRecord &status) {
    if (!status.rssAnonSize || !status.rssShmemSize || !status.swapSize) return std::nullopt;
    return *status.rssAnonSize + *status.rssShmemSize + *status.swapSize + status.hugePageSize.value_or(0);
}

} // namespace

std::optional<HXWalkDifference> HXFindWalkDifference(const HXAddressSpace &addressSpace,
                                                     const HXStatusRecord &before,
                                                     const HXStatusRecord &after,
                                                     const HXWalkTolerance &tolerance) {
    constexpr uint64_t leastSize = 1 << 20, leastShare = 100;
    const auto first = countersOf(before), last = countersOf(after);
    if (!first || !last) return std::nullopt;
    const auto [low, high] = std::minmax(*first, *last);
    const Pages pages = pagesOf(addressSpace);
    const uint64_t regions = pages.certain << tolerance.pageShift;
    const uint64_t mostRegions = regions + (pages.possible << tolerance.pageShift);
    const uint64_t tolerated = std::max(leastSize, high / leastShare) + tolerance.counterErrorSize;
    if (mostRegions + tolerated < low) return HXWalkDifference{mostRegions, low};
    if (regions > high + tolerated) return HXWalkDifference{regions, high};
    return std::nullopt;
}
