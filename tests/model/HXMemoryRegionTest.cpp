#include "support/HXBarePlatform.h"
#include "support/HXBuilders.h"

#include <gtest/gtest.h>

TEST(HXMemoryRegionTest, NamesCategoriesByTag) {
    const HXBarePlatform platform; // it describes tag 100, and tag 101 as "Memory Tag …"
    struct {
        uint32_t tag;
        const char *name;
    } cases[] = {
        {0, "untagged (\"VM_ALLOCATE\")"},
        {1, "malloc metadata"},
        {2, "MALLOC_SMALL"},
        {7, "MALLOC_TINY"},
        {11, "MALLOC_NANO"},
        {18, "system/kernel diagnostics"},
        {20, "Mach message"},
        {30, "stack"},
        {31, "guard"},
        {35, "unshared pmap"},
        {64, "JS JIT generated code"},
        {73, "os_alloc_once"},
        {80, "corpse info"},
        {91, "video bitstream"},
        {100, "heap"},
        {101, "tag 101"},
        {239, "tag 239"},
        {240, "app-specific tag 1"},
        {247, "app-specific tag 8"},
        {255, "app-specific tag 16"},
        {256, "tag 256"},
        {300, "tag 300"},
        {0x80000000, "tag -2147483648"},
        {0xFFFFFFFE, "tag -2"},
        {0xFFFFFFFF, "Owned physical heft (unmapped)"},
    };
    for (const auto &test : cases)
        EXPECT_EQ(HXMemoryRegion::categoryNameForTag(test.tag).str(), test.name) << test.tag;
}

TEST(HXMemoryRegionTest, TellsWhichRegionsAreWorthViewsAndPageRuns) {
    constexpr uint64_t page = 4096;
    struct {
        const char *title;
        HXRegionFacts facts;
        bool view;
        bool subranges;
    } cases[] = {
        {"shared, mixed", {.size = 4 * page, .dirty = page, .clean = page}, true, true},
        {"copy on write", {.size = 4 * page, .dirty = page, .shareMode = SM_COW}, true, true},
        {"large page", {.size = 4 * page, .dirty = page, .shareMode = SM_LARGE_PAGE}, true, true},
        {"no share mode", {.size = 4 * page, .dirty = page, .shareMode = 0}, true, true},
        {"image without a known segment",
         {.size = 4 * page, .dirty = page, .segment = HXSegmentUnset},
         true,
         true},
        {"fake", {.size = 4 * page, .dirty = page, .tag = kFakeRegionTag}, false, false},
        {"shared cache", {.size = 4 * page, .dirty = page, .sharedCache = true}, false, false},
        {"private", {.size = 4 * page, .dirty = page, .shareMode = SM_PRIVATE}, false, false},
        {"empty", {.size = 4 * page, .dirty = page, .shareMode = SM_EMPTY}, false, false},
        {"private aliased", {.size = 4 * page, .dirty = page, .shareMode = SM_PRIVATE_ALIASED}, false, false},
        {"text", {.size = 4 * page, .dirty = page, .segment = HXSegmentText}, false, false},
        {"data", {.size = 4 * page, .dirty = page, .segment = HXSegmentData}, false, false},
        {"linkedit", {.size = 4 * page, .dirty = page, .segment = HXSegmentLinkedit}, false, false},
        {"one page", {.size = page, .dirty = 1}, true, false},
        {"a byte more than a page", {.size = page + 1, .dirty = page}, true, true},
        {"owned", {.size = 4 * page, .dirty = page, .owned = true}, true, false},
        {"wholly dirty", {.size = 4 * page, .dirty = 4 * page, .clean = page}, true, false},
        {"wholly swapped", {.size = 4 * page, .swapped = 4 * page}, true, false},
        {"wholly clean", {.size = 4 * page, .dirty = 1, .clean = 4 * page}, true, false},
        {"wholly reclaimable", {.size = 4 * page, .reclaimable = 4 * page}, true, false},
        {"nothing resident", {.size = 4 * page, .wired = true}, true, false},
        {"only swapped", {.size = 4 * page, .swapped = page}, true, true},
    };
    for (const auto &test : cases) {
        const HXMemoryRegion region = makeRegion(test.facts);
        EXPECT_EQ(region.eligibleForProcessView(), test.view) << test.title;
        EXPECT_EQ(region.eligibleForSubrangesUsingPageSize(page), test.subranges) << test.title;
    }
}

TEST(HXMemoryRegionTest, DerivesEndsOrdersAndNames) {
    const auto at = [](uint64_t start, uint64_t size) { return makeRegion({.start = start, .size = size}); };
    EXPECT_LT(at(0x1000, 0x4000).compare(at(0x1000, 0x1000)), 0);
    EXPECT_GT(at(0x1000, 0x1000).compare(at(0x1000, 0x4000)), 0);
    EXPECT_LT(at(0, 1).compare(at(0x1000, 0x4000)), 0);
    EXPECT_LT(at(0x1000, 1).compare(at(0xFFFFFFFF00000000, 1)), 0);
    EXPECT_EQ(at(0x1000, 0x4000).compare(at(0x1000, 0x4000)), 0);

    EXPECT_EQ(at(0x1000, 0x4000).end(), 0x5000u);
    EXPECT_EQ(at(kNoAddress, 0x4000).end(), kNoAddress);
    HXMemoryRegion region = at(0x1000, 0);
    region.setEnd(0x3000);
    EXPECT_EQ(region.size(), 0x2000u);
    EXPECT_EQ(region.wiredSize(), 0u);
    region.setWired(true);
    EXPECT_EQ(region.wiredSize(), 0x2000u);
    EXPECT_DEATH(region.setEnd(0xFFF), "end >= self.start");

    // The four flags share a word: each setter leaves the others alone.
    region.setInSharedCache(true);
    region.setOwnedExclusivelyByParentProcess(true);
    region.setWired(false);
    EXPECT_TRUE(region.inSharedCache() && region.ownedExclusivelyByParentProcess());
    EXPECT_FALSE(region.wired() || region.unusedSharedCacheRegion());

    EXPECT_EQ(makeRegion({.name = "libfoo", .detail = "/usr/lib/libfoo"}).fullName(),
              "libfoo /usr/lib/libfoo");
    EXPECT_EQ(makeRegion({.name = "libfoo", .detail = ""}).fullName(), "libfoo");
    EXPECT_EQ(makeRegion({.name = "libfoo"}).fullName(), "libfoo");
}
