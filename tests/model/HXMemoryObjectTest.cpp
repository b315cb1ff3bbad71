#include "model/HXHeftSwitches.h"
#include "model/HXMemoryCategory.h"
#include "support/HXBarePlatform.h"
#include "support/HXBuilders.h"

#include <gtest/gtest.h>

namespace {
constexpr uint64_t kPage = 16384;

class HXMemoryObjectTest : public testing::Test {
  protected:
    HXMemoryObjectTest() { HXHeftSwitches::setBreakDownPhysHeft(true); }

    // Adds a region; with pid 0 it is no process's.
    void add(HXMemoryObject &object, int32_t pid, const HXRegionFacts &facts) {
        HXMemoryRegion &region = _regions.emplace_back(makeRegion(facts));
        if (pid == 0)
            object.addRegion(region, kPage);
        else
            object.addRegion(region, HXMadeUpProcess(pid, "p"));
    }
    static HXMemoryObjectView viewOf(const HXMemoryObject &object, int32_t pid) {
        return object.viewForProcess(HXMadeUpProcess(pid, "p"));
    }

    HXBarePlatform _platform;

  private:
    HXMemoryRegionList _regions;
};
} // namespace

TEST_F(HXMemoryObjectTest, MergesRegionsAndKeepsViewsThatDiffer) {
    struct Mapping {
        int32_t pid;
        HXRegionFacts facts;
    };
    struct View {
        int32_t pid;
        std::optional<HXMemoryTotal> own = {}; // none: it sees the whole object
    };
    const HXRegionFacts all{.object = 7, .size = 4 * kPage, .dirty = 4 * kPage};
    const HXRegionFacts low{.object = 7, .size = 2 * kPage, .dirty = 2 * kPage};
    const HXRegionFacts high{
        .object = 7, .size = 2 * kPage, .offset = 2 * kPage, .dirty = kPage, .clean = kPage};
    const HXRegionFacts swapped{.object = 7, .size = 2 * kPage, .dirty = 2 * kPage, .swapped = kPage};
    HXRegionFacts wiredLow = low, priv = low, image = low, highOfImage = high;
    wiredLow.wired = true;
    priv.shareMode = SM_PRIVATE;
    image.segment = HXSegmentData;
    highOfImage.segment = HXSegmentData;
    struct {
        const char *title;
        std::vector<Mapping> mappings;
        HXSizes sizes;
        std::vector<View> views;
        bool breakDown = true;
    } cases[] = {
        {"the same pages twice count once, and nobody's view differs",
         {{10, all}, {20, all}},
         {.dirty = 4 * kPage},
         {{10}, {20}}},
        {"one process maps both halves, one the first",
         {{10, low}, {10, high}, {20, low}},
         {.dirty = 3 * kPage, .clean = kPage},
         {{10, {{{3 * kPage, 0, kPage}, 2}}}, {20, {{{2 * kPage}, 1}}}, {30}}},
        {"one region each, one of them wired",
         {{10, wiredLow}, {20, low}},
         {.dirty = 2 * kPage, .wired = 2 * kPage},
         {{10, {{{2 * kPage, 0, 0, 0, 2 * kPage}, 1}}}, {20, {{{2 * kPage}, 1}}}}},
        {"private mappings are not listed",
         {{10, priv}, {20, priv}, {20, highOfImage}},
         {.dirty = 3 * kPage, .clean = kPage},
         {{20}}},
        {"one process alone sees the whole, however it maps it",
         {{10, low}, {10, high}},
         {.dirty = 3 * kPage, .clean = kPage},
         {{10}}},
        {"once one is listed, every later one is",
         {{10, image}, {20, low}, {30, highOfImage}},
         {.dirty = 3 * kPage, .clean = kPage},
         {{10}, {20, {{{2 * kPage}, 1}}}, {30, {{{kPage, 0, kPage}, 1}}}}},
        // Both copies of a page are charged to process 10, whatever the merged runs say.
        {"no less than the largest process",
         {{10, swapped}, {10, swapped}, {20, low}},
         {.dirty = 4 * kPage, .swapped = 2 * kPage},
         {{10, {{{4 * kPage, 2 * kPage}, 2}}}, {20, {{{2 * kPage}, 1}}}}},
        // Merged: dirty 2, swapped max(1, 1, 1 + 1 − 2).
        {"without the kernel's charge the merged runs count",
         {{10, swapped}, {10, swapped}, {20, low}},
         {.dirty = 2 * kPage, .swapped = kPage},
         {{10, {{{2 * kPage, kPage}, 2}}}, {20, {{{2 * kPage}, 1}}}},
         false},
    };
    for (const auto &test : cases) {
        HXHeftSwitches::setBreakDownPhysHeft(test.breakDown);
        HXMemoryObject object;
        for (const Mapping &mapping : test.mappings)
            add(object, mapping.pid, mapping.facts);
        object.finalize();
        EXPECT_EQ(object.sizes(), test.sizes) << test.title;
        for (const View &expected : test.views) {
            const HXMemoryObjectView view = viewOf(object, expected.pid);
            EXPECT_EQ(view.isWhole, !expected.own) << test.title << " as seen by " << expected.pid;
            EXPECT_TRUE(view == expected.own.value_or(object.wholeView())) << test.title << expected.pid;
        }
    }
}

TEST_F(HXMemoryObjectTest, PageRunsAreMergedAndDropped) {
    HXMemoryObject object;
    HXMemoryRegion first = makeRegion({.object = 7, .size = 4 * kPage, .dirty = 2 * kPage});
    first.addSubrange({0, 2 * kPage}, {.dirty = 2 * kPage}, kPage);
    HXMemoryRegion second = makeRegion({.object = 7, .size = 4 * kPage, .dirty = 2 * kPage, .clean = kPage});
    second.addSubrange({kPage, 2 * kPage}, {.dirty = 2 * kPage}, kPage);
    second.addSubrange({8 * kPage, kPage}, {.clean = kPage}, kPage);
    object.addRegion(first, HXMadeUpProcess(10, "p"));
    object.addRegion(second, HXMadeUpProcess(20, "p"));
    object.finalize();
    EXPECT_EQ(object.sizes(), (HXSizes{.dirty = 3 * kPage, .clean = kPage}));
    // A view takes each region as one whole run: the page runs are gone by then.
    EXPECT_EQ(viewOf(object, 20), (HXMemoryTotal{{2 * kPage, 0, kPage}, 1}));
    EXPECT_TRUE(!first.subrangeList() && !second.subrangeList());
}

TEST_F(HXMemoryObjectTest, OwnedMemoryShowsAsCleanToOthers) {
    HXMemoryObject object;
    add(object, 0, {.object = 7, .size = 2 * kPage, .dirty = 8192, .swapped = 4096, .clean = 100});
    object.setOwnerPid(10);
    object.finalize();
    EXPECT_TRUE(viewOf(object, 10).isWhole);
    EXPECT_FALSE(viewOf(object, 20).isWhole);
    EXPECT_EQ(viewOf(object, 20), (HXMemoryTotal{{0, 0, 100 + 12288}, 1}));

    // With views of its own the whole object's dirty and swapped bytes turn clean, not the view's.
    HXMemoryObject shared;
    add(shared, 10, {.object = 8, .size = 4 * kPage, .dirty = 3 * kPage, .swapped = kPage});
    add(shared, 20, {.object = 8, .size = kPage, .clean = kPage});
    shared.setOwnerPid(10);
    shared.finalize();
    EXPECT_EQ(viewOf(shared, 20), (HXMemoryTotal{{0, 0, kPage + 4 * kPage}, 1}));
    EXPECT_EQ(viewOf(shared, 10), (HXMemoryTotal{{3 * kPage, kPage}, 1}));
    // A process without regions of its own in it gets the object as it is, owned or not.
    EXPECT_TRUE(viewOf(shared, 30).isWhole);
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
        EXPECT_EQ(object._canonicalRegion()->fullName(), test.fullName);
        EXPECT_EQ(object.memoryRegions().front()->name().str(), test.nameOfFirst) << test.fullName;
    }
}

TEST_F(HXMemoryObjectTest, CategoriesAddUpObjectsOfOneName) {
    HXMemoryObject objects[3];
    add(objects[0], 0, {.object = 1, .size = 4 * kPage, .dirty = kPage, .name = "a", .detail = "/x"});
    add(objects[0], 0, {.object = 1, .size = kPage, .offset = 8 * kPage, .wired = true});
    add(objects[1], 0, {.object = 2, .size = 4 * kPage, .swapped = 5, .name = "a", .detail = "/y"});
    add(objects[2], 0,
        {.object = 3, .size = kPage, .clean = 6, .name = "a /x"}); // the same text in other parts
    HXCategoryMap summary(true), detailed(false);
    for (HXMemoryObject &object : objects) {
        object.finalize();
        for (HXCategoryMap *map : {&summary, &detailed})
            map->categoryForObject(object).addMemoryObject(object.wholeView());
    }
    using Expected = std::vector<std::pair<std::string, HXMemoryTotal>>;
    const auto totalsOf = [](const HXCategoryMap &map) {
        Expected totals;
        for (const HXMemoryCategory &category : map.categories())
            totals.emplace_back(category.fullName(), category.total());
        return totals;
    };
    EXPECT_EQ(totalsOf(summary), (Expected{{"a", {{kPage, 5, 0, 0, kPage}, 3}}, {"a /x", {{0, 0, 6}, 1}}}));
    EXPECT_EQ(totalsOf(detailed), (Expected{{"a /x", {{kPage, 0, 6, 0, kPage}, 3}}, {"a /y", {{0, 5}, 1}}}));
}
