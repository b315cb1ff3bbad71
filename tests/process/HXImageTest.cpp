#include "process/HXImageEnumerator.h"
#include "process/HXImageStringCache.h"

#include <gtest/gtest.h>
#include <thread>

namespace {
HXImage imageAt(uint64_t start, uint64_t end) {
    HXImage image;
    image.setStart(start);
    image.setSize(end - start);
    return image;
}
} // namespace

TEST(HXImageTest, LookupsOnlyMoveForward) {
    const std::vector<HXImage> images = [] {
        std::vector<HXImage> list;
        list.push_back(imageAt(0x1000, 0x2000));
        list.push_back(imageAt(0x3000, 0x4000));
        list.push_back(imageAt(0x4000, 0x5000));
        return list;
    }();
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
    const std::vector<HXImage> empty;
    EXPECT_EQ(HXImageEnumerator(empty).nextImageForStart(0, UINT64_MAX), nullptr);
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
    HXImage image; // a name that tells nothing leaves the code
    image.setName(HXString::intern("__TEXT"));
    image.setName(HXString::intern("other"));
    EXPECT_EQ(image.segment(), HXSegmentText);
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
    EXPECT_EQ(HXSegmentName("__DATA"), HXSegmentName("__DATA"));
}
