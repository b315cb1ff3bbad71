#include "analysis/HXWorkAhead.h"

#include <gtest/gtest.h>

#include <thread>

TEST(HXWorkAheadTest, EachItemIsDoneOnceAndBeforeItIsUsed) {
    constexpr size_t count = 2000;
    for (const size_t helpers : {0, 1, 5}) {
        std::vector<int> done(count); // not atomic: the threads' order is to be seen by all
        HXWorkAhead work(count, [&](size_t item) { done[item]++; });
        std::vector<std::thread> threads;
        for (size_t i = 0; i < helpers; i++)
            threads.emplace_back([&] { work.help(); });
        for (size_t i = 0; i < count; i++) {
            work.need(i);
            ASSERT_EQ(done[i], 1) << i << " with " << helpers << " helpers";
        }
        work.need(count / 2);
        for (std::thread &thread : threads)
            thread.join();
        work.help(); // there is nothing left
        EXPECT_EQ(done, std::vector<int>(count, 1));
    }
}

TEST(HXWorkAheadTest, WhoNeedsAnItemWaitsForWhoHasBegunIt) {
    std::atomic<bool> hasBegun = false, mayEnd = false;
    HXWorkAhead work(2, [&](size_t item) {
        hasBegun = true;
        while (item == 0 && !mayEnd)
            std::this_thread::yield();
    });
    std::thread helper([&] { work.help(); });
    while (!hasBegun)
        std::this_thread::yield();
    work.need(1); // which the helper does not get to
    std::atomic<bool> isDone = false;
    std::thread waiting([&] {
        work.need(0);
        isDone = true;
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    EXPECT_FALSE(isDone);
    mayEnd = true;
    waiting.join();
    helper.join();
    EXPECT_TRUE(isDone);
}
