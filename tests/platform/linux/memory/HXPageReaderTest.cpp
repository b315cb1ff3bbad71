#include "platform/linux/memory/HXPageReader.h"
#include "platform/linux/memory/HXSharedSwap.h"

#include <gtest/gtest.h>

#include <set>

namespace {

constexpr uint8_t P = HXPageRun::present, F = HXPageRun::file, S = HXPageRun::swapped, N = HXPageRun::nothing;
constexpr int32_t dirty = 0x9, external = 0x81, reusable = 0x801, pagedOut = 0x10;

TEST(HXPageReader, Dispositions) {
    HXMapping file, written, shared, huge, anonymous;
    written.anonymousPages = anonymous.anonymousPages = 4;
    shared.flags = HXMappingSwapBacked | HXMappingShared;
    huge.flags = HXMappingHugePages;
    const struct {
        const HXMapping &mapping;
        uint8_t facts;
        HXPagesLeft left;
        int32_t disposition;
    } cases[] = {
        {file, P | F, {}, external},      {file, P, {}, 0}, // a driver's
        {file, S, {2, 0}, pagedOut},      {file, S, {}, 0}, // a mark, no page
        {written, P, {}, dirty},          {written, P | N, {}, 0},
        {shared, P | F, {}, dirty},       {huge, P | F, {}, dirty},
        {anonymous, P, {0, 1}, reusable}, {anonymous, S | N, {1, 0}, 0},
    };
    for (size_t i = 0; i < std::size(cases); i++) {
        HXPagesLeft left = cases[i].left;
        EXPECT_EQ(HXPageDisposition(cases[i].mapping, cases[i].facts, &left), cases[i].disposition) << i;
        EXPECT_EQ(left.swapped, cases[i].left.swapped - (cases[i].disposition == pagedOut)) << i;
        EXPECT_EQ(left.lazyFree, cases[i].left.lazyFree - (cases[i].disposition == reusable)) << i;
    }
}

TEST(HXSharedSwap, FindsSwappedPagesByCounting) {
    const std::set<uint64_t> swapped = {103, 104, 110, 163};
    const HXCountSwapped countSwapped = [&](uint64_t first, uint64_t count, uint64_t *found) {
        *found = static_cast<uint64_t>(
            std::distance(swapped.lower_bound(first), swapped.lower_bound(first + count)));
        return true;
    };
    std::vector<int32_t> pages(64);
    EXPECT_EQ(HXMarkSwapped(countSwapped, 100, 10, pages), 4u);
    for (uint64_t i = 0; i < pages.size(); i++)
        EXPECT_EQ(pages[i], swapped.contains(100 + i) ? pagedOut : 0) << i;
    std::vector<int32_t> few(64);
    EXPECT_EQ(HXMarkSwapped(countSwapped, 100, 2, few), 2u) << "no more than the mapping has";
    const HXCountSwapped unknown = [](uint64_t, uint64_t, uint64_t *) { return false; };
    std::vector<int32_t> mixed = {dirty, 0, dirty, 0, 0};
    EXPECT_EQ(HXMarkSwapped(unknown, 0, 2, mixed), 2u);
    EXPECT_EQ(mixed, (std::vector<int32_t>{dirty, pagedOut, dirty, pagedOut, 0}));
}

} // namespace
