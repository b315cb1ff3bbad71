#include "process/HXImageEnumerator.h"
#include "process/HXImageStringCache.h"
#include "support/HXCaseFile.h"

#include <gtest/gtest.h>
#include <thread>

TEST(HXImageTest, LookupsOnlyMoveForward) {
    std::vector<HXImage> images(3);
    for (const uint64_t i : {0, 1, 2}) {
        images[i].setStart(i == 0 ? 0x1000 : 0x2000 + i * 0x1000);
        images[i].setSize(0x1000);
    }
    const auto answer = [&](const std::string &ranges) {
        std::string found;
        HXImageEnumerator enumerator(images);
        for (const std::string &range : HXWordsOf(ranges)) {
            const uint64_t start = std::stoull(range, nullptr, 16);
            const uint64_t end = std::stoull(range.substr(range.find('-') + 1), nullptr, 16);
            const HXImage *const image = enumerator.nextImageForStart(start, end);
            found += image ? std::to_string(image - images.data()) : "-";
        }
        return found;
    };
    const std::string rows = HXReadCases("images.txt")[0].input;
    EXPECT_EQ(HXAnswered(rows, answer), rows);
}

TEST(HXImageTest, NamesTellSegments) {
    const auto answer = [](const std::string &name) {
        HXImage image;
        image.setName(HXString::intern(name));
        return std::to_string(image.segment());
    };
    const std::string rows = HXReadCases("images.txt")[1].input;
    EXPECT_EQ(HXAnswered(rows, answer), rows);
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
