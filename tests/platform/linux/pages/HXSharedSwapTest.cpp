#include "platform/linux/pages/HXSharedSwap.h"

#include <gtest/gtest.h>

#include <iterator>
#include <set>

namespace {

TEST(HXSharedSwap, FindsSwappedPagesByCounting) {
    using Spans = std::vector<HXPageSpan>;
    const std::set<uint64_t> swapped = {103, 104, 110, 163};
    const HXCountSwapped countSwapped = [&](const HXPageSpan &span) {
        const auto end = swapped.lower_bound(span.first + span.count);
        return std::optional<uint64_t>(std::distance(swapped.lower_bound(span.first), end));
    };
    constexpr uint32_t calls = 16384;
    HXSwapSearch search{10, calls};
    EXPECT_EQ(HXFindSwapped(countSwapped, {100, 64}, &search), (Spans{{103, 2}, {110, 1}, {163, 1}}));
    EXPECT_EQ(search.pagesLeft, 6u);
    EXPECT_EQ(HXFindSwapped(countSwapped, {0, uint64_t{1} << 34}, &search).size(), 3u) << "a wide hole";
    EXPECT_GT(search.callsLeft, calls - 300);
    search = {2, calls};
    EXPECT_EQ(HXFindSwapped(countSwapped, {100, 64}, &search), (Spans{{103, 2}})) << "no more than are left";
    // Every other page: not asked for one by one for ever.
    const HXCountSwapped scattered = [](const HXPageSpan &span) {
        return std::optional((span.count + 1) / 2);
    };
    search = {1 << 16, calls};
    HXFindSwapped(scattered, {0, 1 << 16}, &search);
    EXPECT_EQ(search.callsLeft, 0u);
    const HXCountSwapped unknown = [](const HXPageSpan &) { return std::nullopt; };
    search = {3, calls};
    EXPECT_EQ(HXFindSwapped(unknown, {7, 2}, &search), (Spans{{7, 2}}));
    EXPECT_EQ(HXFindSwapped(unknown, {20, 9}, &search), (Spans{{20, 1}}));
}

} // namespace
