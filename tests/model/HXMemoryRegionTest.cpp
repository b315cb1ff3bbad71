#include "support/HXBuilders.h"
#include "support/HXMadeUpMachine.h"

#include <gtest/gtest.h>

TEST(HXMemoryRegionTest, NamesCategoriesByTag) {
    const HXMadeUpMachine machine("tag  tag=100  name=heap\ntag  tag=101  name=Memory Tag 101\n");
    const std::pair<uint32_t, const char *> cases[] = {
        {0, "untagged (\"VM_ALLOCATE\")"},
        {2, "MALLOC_SMALL"},
        {7, "MALLOC_TINY"},
        {30, "stack"},
        {73, "os_alloc_once"},
        {91, "video bitstream"},
        {100, "heap"},
        {101, "tag 101"}, // the host's description tells nothing
        {239, "tag 239"},
        {240, "app-specific tag 1"},
        {255, "app-specific tag 16"},
        {256, "tag 256"},
        {0x80000000, "tag -2147483648"},
        {0xFFFFFFFF, "Owned physical heft (unmapped)"},
    };
    for (const auto &[tag, name] : cases)
        EXPECT_EQ(HXMemoryRegion::categoryNameForTag(tag).str(), name) << tag;
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
        {"fake", {.size = 4 * page, .dirty = page, .tag = kFakeRegionTag}, false, false},
        {"shared cache", {.size = 4 * page, .dirty = page, .sharedCache = true}, false, false},
        {"private", {.size = 4 * page, .dirty = page, .shareMode = SM_PRIVATE}, false, false},
        {"private aliased", {.size = 4 * page, .dirty = page, .shareMode = SM_PRIVATE_ALIASED}, false, false},
        {"text", {.size = 4 * page, .dirty = page, .segment = HXSegmentText}, false, false},
        {"linkedit", {.size = 4 * page, .dirty = page, .segment = HXSegmentLinkedit}, false, false},
        {"one page", {.size = page, .dirty = 1}, true, false},
        {"a byte more than a page", {.size = page + 1, .dirty = page}, true, true},
        {"owned", {.size = 4 * page, .dirty = page, .owned = true}, true, false},
        {"wholly dirty", {.size = 4 * page, .dirty = 4 * page, .clean = page}, true, false},
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
