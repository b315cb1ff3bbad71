#include "process/HXImageEnumerator.h"
#include "process/HXImageStringCache.h"

#include <gtest/gtest.h>
#include <thread>

TEST(HXImageTest, LookupsOnlyMoveForward) {
    std::vector<HXImage> images(3);
    for (const uint64_t i : {0, 1, 2}) {
        images[i].setStart(i == 0 ? 0x1000 : 0x2000 + i * 0x1000);
        images[i].setSize(0x1000);
    }
    constexpr int none = -1;
    struct {
        const char *title;
        std::vector<std::array<uint64_t, 2>> ranges;
        std::vector<int> found;
    } cases[] = {
        {"inside, between, ending inside, and never back",
         {{0x1800, 0x1900}, {0x2000, 0x3000}, {0x2800, 0x3800}, {0x1800, 0x1900}},
         {0, none, 1, none}},
        {"an image answers every range it touches", {{0x1000, 0x1001}, {0x1fff, 0x3000}}, {0, 0}},
        {"a range around images finds the first", {{0, 0x10000}, {0x2000, 0x10000}}, {0, 1}},
        {"touching is not overlapping", {{0, 0x1000}, {0x2000, 0x2001}}, {none, none}},
        {"adjoining images", {{0x3800, 0x4800}, {0x4000, 0x4800}, {0x5000, 0x6000}}, {1, 2, none}},
    };
    for (const auto &test : cases) {
        HXImageEnumerator enumerator(images);
        for (size_t i = 0; i < test.ranges.size(); i++) {
            const HXImage *image = enumerator.nextImageForStart(test.ranges[i][0], test.ranges[i][1]);
            EXPECT_EQ(image == nullptr ? none : image - images.data(), test.found[i]) << test.title << i;
        }
    }
}

TEST(HXImageTest, NamesTellSegments) {
    struct {
        const char *name;
        HXSegment segment;
    } cases[] = {
        {"__TEXT", HXSegmentText},       {"__TEXT_EXEC", HXSegmentText}, {"__LINKEDIT", HXSegmentLinkedit},
        {"__DATA_CONST", HXSegmentData}, {"__", HXSegmentData},          {"unknown", HXSegmentUnset},
        {"_TEXT", HXSegmentUnset},       {"", HXSegmentUnset},
    };
    for (const auto &test : cases) {
        HXImage image;
        image.setName(HXString::intern(test.name));
        EXPECT_EQ(image.segment(), test.segment) << test.name;
    }
}

TEST(HXImageTest, CachedStringsAreTheSameInEveryThread) {
    HXStringSlots slots(5, 2);
    std::vector<std::vector<HXString>> found(4);
    std::vector<std::thread> threads;
    for (auto &mine : found)
        threads.emplace_back([&mine, &slots] {
            for (int i = 0; i < 500; i++)
                mine.push_back(slots.find(i % 5, "text " + std::to_string(i % 20)));
        });
    for (auto &thread : threads)
        thread.join();
    for (const auto &mine : found)
        for (size_t i = 0; i < mine.size(); i++) {
            ASSERT_EQ(mine[i].str(), "text " + std::to_string(i % 20));
            ASSERT_EQ(mine[i], found[0][i]); // full neighbourhoods included: equal strings are one string
        }
    // More images than the paths' cache has slots, on colliding bases.
    for (uint64_t i = 0; i < 3000; i++)
        ASSERT_EQ(HXSharedImagePath(0x180000000 + (i % 7 << 40), "/lib/" + std::to_string(i)).str(),
                  "/lib/" + std::to_string(i));
}
