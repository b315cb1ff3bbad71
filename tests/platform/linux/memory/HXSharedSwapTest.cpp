#include "platform/linux/memory/HXSharedSwap.h"

#include <gtest/gtest.h>

#include <set>

namespace {

TEST(HXSharedSwap, FindsSwappedPagesByCounting) {
    constexpr int32_t dirty = 0x9, pagedOut = 0x10;
    const std::set<uint64_t> swapped = {103, 104, 110, 163};
    const HXCountSwapped countSwapped = [&](uint64_t first, uint64_t count) {
        const auto found = std::distance(swapped.lower_bound(first), swapped.lower_bound(first + count));
        return std::optional<uint64_t>(found);
    };
    std::vector<int32_t> pages(64);
    EXPECT_EQ(HXMarkSwapped(countSwapped, 100, 10, pages), 4u);
    for (uint64_t i = 0; i < pages.size(); i++)
        EXPECT_EQ(pages[i], swapped.contains(100 + i) ? pagedOut : 0) << i;
    std::vector<int32_t> few(64);
    EXPECT_EQ(HXMarkSwapped(countSwapped, 100, 2, few), 2u) << "no more than the mapping has";
    // Every other page: not asked for one by one for ever.
    uint32_t calls = 0;
    const HXCountSwapped scattered = [&](uint64_t, uint64_t count) {
        return calls++, std::optional((count + 1) / 2);
    };
    std::vector<int32_t> many(1 << 16);
    HXMarkSwapped(scattered, 0, many.size(), many);
    EXPECT_EQ(calls, 16384u);
    const HXCountSwapped unknown = [](uint64_t, uint64_t) { return std::nullopt; };
    std::vector<int32_t> mixed = {dirty, 0, dirty, 0, 0};
    EXPECT_EQ(HXMarkSwapped(unknown, 0, 2, mixed), 2u);
    EXPECT_EQ(mixed, (std::vector<int32_t>{dirty, pagedOut, dirty, pagedOut, 0}));
}

} // namespace
