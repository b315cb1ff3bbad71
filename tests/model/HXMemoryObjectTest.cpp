#include "model/HXMemoryCategory.h"
#include "support/HXBarePlatform.h"
#include "support/HXBuilders.h"

#include "model/HXHeftSwitches.h"

#include <gtest/gtest.h>

namespace {
constexpr uint64_t kPage = 16384;

// Dirty, swapped, clean, reclaimable and wired bytes.
using Sizes = std::vector<uint64_t>;
Sizes sizesOf(const HXMemoryObject &object) {
    return {object.totalDirtySize(), object.totalSwappedSize(), object.totalCleanSize(),
            object.totalReclaimableSize(), object.totalWiredSize()};
}

class HXMemoryObjectTest : public testing::Test {
  protected:
    HXMemoryObjectTest() { HXHeftSwitches::setBreakDownPhysHeft(true); }

    // Adds a region; with pid 0 it is no process's.
    HXMemoryRegion &add(HXMemoryObject &object, int32_t pid, const HXRegionFacts &facts) {
        HXMemoryRegion &region = _regions.emplace_back(makeRegion(facts));
        if (pid == 0)
            object.addRegion(region, kPage);
        else
            object.addRegion(region, process(pid));
        return region;
    }
    const HXProcess &process(int32_t pid) {
        auto &entry = _processes[pid];
        if (!entry) entry = std::make_unique<HXMadeUpProcess>(pid, "p");
        return *entry;
    }

    HXBarePlatform _platform;

  private:
    HXMemoryRegionList _regions;
    std::map<int32_t, std::unique_ptr<HXMadeUpProcess>> _processes;
};
} // namespace

TEST_F(HXMemoryObjectTest, MergesRegionsAndKeepsViewsThatDiffer) {
    struct Mapping {
        int32_t pid;
        HXRegionFacts facts;
    };
    struct View {
        int32_t pid;
        Sizes sizes = {}; // none: it is the object itself
    };
    const HXRegionFacts all{.object = 7, .size = 4 * kPage, .dirty = 4 * kPage};
    const HXRegionFacts low{.object = 7, .size = 2 * kPage, .dirty = 2 * kPage};
    const HXRegionFacts high{
        .object = 7, .size = 2 * kPage, .offset = 2 * kPage, .dirty = kPage, .clean = kPage};
    HXRegionFacts wiredLow = low, priv = low, image = low, highOfImage = high;
    wiredLow.wired = true;
    priv.shareMode = SM_PRIVATE;
    image.segment = HXSegmentData;
    highOfImage.segment = HXSegmentData;
    struct {
        const char *title;
        std::vector<Mapping> mappings;
        Sizes sizes;
        size_t listed; // regions kept by process
        std::vector<View> views;
    } cases[] = {
        {"the same pages twice count once, and nobody's view differs",
         {{10, all}, {20, all}},
         {4 * kPage, 0, 0, 0, 0},
         0,
         {{10, {}}, {20, {}}}},
        {"one process maps both halves, one the first",
         {{10, low}, {10, high}, {20, low}},
         {3 * kPage, 0, kPage, 0, 0},
         3,
         {{10, {3 * kPage, 0, kPage, 0, 0}}, {20, {2 * kPage, 0, 0, 0, 0}}, {30, {}}}},
        {"one region each, one of them wired",
         {{10, wiredLow}, {20, low}},
         {2 * kPage, 0, 0, 0, 2 * kPage},
         2,
         {{10, {2 * kPage, 0, 0, 0, 2 * kPage}}, {20, {2 * kPage, 0, 0, 0, 0}}}},
        {"private mappings are not listed",
         {{10, priv}, {20, priv}, {20, highOfImage}},
         {3 * kPage, 0, kPage, 0, 0},
         0,
         {{20, {}}}},
        {"once one is listed, every later one is",
         {{10, image}, {20, low}, {30, highOfImage}},
         {3 * kPage, 0, kPage, 0, 0},
         2,
         {{10, {}}, {20, {2 * kPage, 0, 0, 0, 0}}, {30, {kPage, 0, kPage, 0, 0}}}},
        // Both copies of the first page are charged to process 10, whatever the merged runs say.
        {"no less than the largest process",
         {{10, low}, {10, low}, {20, low}},
         {4 * kPage, 0, 0, 0, 0},
         3,
         {{10, {4 * kPage, 0, 0, 0, 0}}, {20, {2 * kPage, 0, 0, 0, 0}}}},
    };
    for (const auto &test : cases) {
        HXMemoryObject object;
        for (const Mapping &mapping : test.mappings)
            add(object, mapping.pid, mapping.facts);
        object.finalize();
        EXPECT_EQ(sizesOf(object), test.sizes) << test.title;
        EXPECT_EQ(object.processMemoryRegions().size(), test.listed) << test.title;
        for (const View &expected : test.views) {
            const HXMemoryObject::View view = object.viewForProcess(process(expected.pid));
            EXPECT_EQ(view.get() == &object, expected.sizes.empty()) << test.title << expected.pid;
            EXPECT_TRUE(view.get() == &object || sizesOf(*view) == expected.sizes) << test.title;
        }
    }
}

TEST_F(HXMemoryObjectTest, SumsOfProcessesAndViewsFollowTheAnalysisMode) {
    HXHeftSwitches::setBreakDownPhysHeft(false);
    HXMemoryObject object;
    const HXRegionFacts low{.object = 7, .size = 2 * kPage, .dirty = 2 * kPage, .swapped = kPage};
    add(object, 10, low);
    add(object, 10, low);
    add(object, 20, low);
    object.finalize();
    // Merged: dirty 2, swapped max(1, 1, 1 + 1 − 2).
    EXPECT_EQ(sizesOf(object), (Sizes{2 * kPage, kPage, 0, 0, 0}));
    EXPECT_EQ(sizesOf(*object.viewForProcess(process(10))), (Sizes{2 * kPage, kPage, 0, 0, 0}));
}

TEST_F(HXMemoryObjectTest, PageRunsAreMergedAndDropped) {
    HXMemoryObject object;
    HXMemoryRegion first = makeRegion({.object = 7, .size = 4 * kPage, .dirty = 2 * kPage});
    first.addSubrange({0, 2 * kPage}, {2 * kPage, 0, 0, 0, 0, 0}, kPage);
    HXMemoryRegion second = makeRegion({.object = 7, .size = 4 * kPage, .dirty = 2 * kPage, .clean = kPage});
    second.addSubrange({kPage, 2 * kPage}, {2 * kPage, 0, 0, 0, 0, 0}, kPage);
    second.addSubrange({8 * kPage, kPage}, {0, 0, kPage, 0, 0, 0}, kPage);
    object.addRegion(first, process(10));
    object.addRegion(second, process(20));
    object.finalize();
    EXPECT_EQ(sizesOf(object), (Sizes{3 * kPage, 0, kPage, 0, 0}));
    // A view takes each region as one whole run: the page runs are gone by then.
    EXPECT_EQ(sizesOf(*object.viewForProcess(process(20))), (Sizes{2 * kPage, 0, kPage, 0, 0}));
}

TEST_F(HXMemoryObjectTest, OwnedMemoryShowsAsCleanToOthers) {
    HXMemoryObject object;
    add(object, 0, {.object = 7, .size = 2 * kPage, .dirty = 8192, .swapped = 4096, .clean = 100});
    object.setOwnerPid(10);
    object.finalize();
    EXPECT_EQ(object.viewForProcess(process(10)).get(), &object);
    const auto view = object.viewForProcess(process(20));
    EXPECT_EQ(sizesOf(*view), (Sizes{0, 0, 100 + 12288, 0, 0}));

    // With views of its own the whole object's dirty and swapped bytes turn clean, not the view's.
    HXMemoryObject shared;
    add(shared, 10, {.object = 8, .size = 4 * kPage, .dirty = 3 * kPage, .swapped = kPage});
    add(shared, 20, {.object = 8, .size = kPage, .clean = kPage});
    shared.setOwnerPid(10);
    shared.finalize();
    EXPECT_EQ(sizesOf(*shared.viewForProcess(process(20))), (Sizes{0, 0, kPage + 4 * kPage, 0, 0}));
    EXPECT_EQ(sizesOf(*shared.viewForProcess(process(10))), (Sizes{3 * kPage, kPage, 0, 0, 0}));
    // A process without regions of its own in it gets the object as it is, owned or not.
    EXPECT_EQ(shared.viewForProcess(process(30)).get(), &shared);
}

TEST_F(HXMemoryObjectTest, IsNamedAfterItsCanonicalRegion) {
    const HXRegionFacts fake{
        .object = 7, .start = kNoAddress, .size = 1, .tag = kFakeRegionTag, .name = "owned"};
    const HXRegionFacts image{.object = 7, .size = 1, .name = "__DATA", .detail = "/bin/a"};
    const HXRegionFacts unused{.object = 7, .size = 1, .name = "unused", .sharedCache = true, .unused = true};
    const HXRegionFacts used{.object = 7, .size = 1, .name = "__TEXT", .detail = "/lib", .sharedCache = true};
    struct {
        std::vector<HXRegionFacts> regions;
        int32_t owner;
        const char *fullName;
        const char *nameOfFirst; // after finalisation
    } cases[] = {
        {{fake, image}, 10, "__DATA /bin/a", "__DATA"}, {{fake, image}, -1, "owned", "owned"},
        {{fake, fake}, 10, "owned", "owned"},           {{unused, used}, -1, "__TEXT /lib", "unused"},
        {{unused, used}, 10, "__TEXT /lib", "unused"},  {{unused, unused}, -1, "unused", "unused"},
        {{image, fake}, -1, "__DATA /bin/a", "__DATA"},
    };
    for (const auto &test : cases) {
        HXMemoryObject object;
        for (const auto &facts : test.regions)
            add(object, 0, facts);
        object.setOwnerPid(test.owner);
        object.finalize();
        EXPECT_EQ(object.fullName(), test.fullName);
        EXPECT_EQ(object.memoryRegions().front()->name().str(), test.nameOfFirst) << test.fullName;
    }
}

TEST_F(HXMemoryObjectTest, CategoriesAddUpDifferentObjectsAndCountRegionsOnce) {
    HXMemoryObject first, second;
    add(first, 0, {.object = 1, .size = 4 * kPage, .dirty = kPage, .name = "libA", .detail = "/x/libA"});
    add(first, 0, {.object = 1, .size = kPage, .offset = 8 * kPage, .wired = true});
    add(second, 0,
        {.object = 2, .size = 4 * kPage, .swapped = 5, .clean = 6, .name = "libA", .detail = "/y/libA"});
    first.finalize();
    second.finalize();
    const auto unowned = [](const HXMemoryObject &object) {
        return HXMemoryObject::View(HXMemoryObject::View(), &object);
    };

    HXMemoryCategory category(HXSegmentData, false);
    const HXMemoryObject::View copy = first.copy();
    for (const auto &view : {unowned(first), unowned(second), unowned(first), copy, copy})
        category.addMemoryObject(view);
    EXPECT_EQ(category.totalDirtySize(), 2 * kPage); // the object and its copy
    EXPECT_EQ(category.totalWiredSize(), 2 * kPage);
    EXPECT_EQ(category.totalSwappedSize(), 5u);
    EXPECT_EQ(category.totalCleanSize(), 6u);
    EXPECT_EQ(category.totalRegions(), 3);

    for (const bool summarize : {true, false}) {
        HXCategoryMap map;
        for (const auto *object : {&first, &second, &first})
            map.categoryForObject(*object, HXSegmentData, summarize).addMemoryObject(unowned(*object));
        ASSERT_EQ(map.entries().size(), summarize ? 1u : 2u);
        const HXMemoryCategory &one = *map.entries()[0].category;
        EXPECT_EQ(map.entries()[0].key, summarize ? "libA" : "libA /x/libA");
        EXPECT_EQ(one.totalRegions(), summarize ? 3 : 2);
    }
}
