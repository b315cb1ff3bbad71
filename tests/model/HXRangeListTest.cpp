#include "model/HXRangeList.h"

#include <gtest/gtest.h>
#include <list>
#include <random>

namespace {
struct PageRun {
    HXRange range;
    HXMemoryTotal amounts;
};

// The merge as a plain linked list, scanned from its head: what the tree's results are compared with.
class LinkedRuns {
  public:
    void add(const PageRun &run, uint64_t page) {
        const uint64_t start = run.range.location & ~(page - 1);
        const uint64_t end = (run.range.location + run.range.length + page - 1) & ~(page - 1);
        HXRangeListNode merged{run.range.location, run.range.length,    run.amounts.clean,
                               run.amounts.dirty,  run.amounts.swapped, run.amounts.reclaimable,
                               run.amounts.wired};
        auto place = nodes.begin();
        while (place != nodes.end() && endOf(*place, page) < start)
            place++;
        while (place != nodes.end() && startOf(*place, page) <= end) {
            const uint64_t low = std::max(start, startOf(*place, page));
            const uint64_t high = std::min(end, endOf(*place, page));
            absorb(merged, *place, high > low ? high - low : 0);
            place = nodes.erase(place);
        }
        nodes.insert(place, merged);
    }
    std::list<HXRangeListNode> nodes;

  private:
    static uint64_t startOf(const HXRangeListNode &node, uint64_t page) {
        return node.location / page * page;
    }
    static uint64_t endOf(const HXRangeListNode &node, uint64_t page) {
        return (node.location + node.length + page - 1) / page * page;
    }
    static void absorb(HXRangeListNode &into, const HXRangeListNode &from, uint64_t overlap) {
        for (auto amount : {&HXRangeListNode::clean, &HXRangeListNode::dirty, &HXRangeListNode::swapped,
                            &HXRangeListNode::reclaimable, &HXRangeListNode::wired}) {
            const uint64_t both = into.*amount + from.*amount;
            into.*amount = std::max({into.*amount, from.*amount, both > overlap ? both - overlap : 0});
        }
        const uint64_t end = std::max(into.location + into.length, from.location + from.length);
        into.location = std::min(into.location, from.location);
        into.length = end - into.location;
    }
};

std::vector<HXRangeListNode> nodesOf(const HXRangeList &list) {
    std::vector<HXRangeListNode> nodes;
    for (const auto &[location, node] : list.nodes())
        nodes.push_back(node);
    return nodes;
}
} // namespace

TEST(HXRangeListTest, MergesRunsThatShareOrTouchPages) {
    constexpr uint64_t page = 4096;
    struct {
        const char *title;
        std::vector<PageRun> runs;
        std::vector<HXRangeListNode> nodes; // location, length, clean, dirty
    } cases[] = {
        {"touching runs add", {{{0, page}, {page}}, {{page, page}, {page}}}, {{0, 2 * page, 0, 2 * page}}},
        {"one page twice counts once", {{{0, page}, {page}}, {{0, page}, {page}}}, {{0, page, 0, page}}},
        {"two parts of one page", {{{0, 100}, {page}}, {{200, 100}, {page}}}, {{0, 300, 0, page}}},
        {"overlap beyond both amounts",
         {{{0, 4 * page}, {page}}, {{0, 4 * page}, {2 * page}}},
         {{0, 4 * page, 0, 2 * page}}},
        {"a gap is closed",
         {{{0, page}, {page}}, {{3 * page, page}, {page}}, {{page, 2 * page}, {2 * page}}},
         {{0, 4 * page, 0, 4 * page}}},
        {"a page between keeps runs apart",
         {{{2 * page, page}, {1}}, {{0, page}, {2}}, {{4 * page, 1}, {3}}},
         {{0, page, 0, 2}, {2 * page, page, 0, 1}, {4 * page, 1, 0, 3}}},
        {"absorbing measures overlap against the new run alone",
         {{{0, page}, {page}}, {{2 * page, page}, {page}}, {{0, 3 * page}, {3 * page}}},
         {{0, 3 * page, 0, 3 * page}}},
        {"each amount merges by itself",
         {{{0, 2 * page}, {page, 0, page}}, {{page, 2 * page}, {page, 0, 2 * page}}},
         {{0, 3 * page, 2 * page, page}}},
        {"an object larger than 4 GiB",
         {{{0x100000000, page}, {page}}, {{0, page}, {page}}},
         {{0, page, 0, page}, {0x100000000, page, 0, page}}},
    };
    for (const auto &test : cases) {
        HXRangeList list;
        for (const PageRun &run : test.runs)
            list.addRange(run.range, page, run.amounts);
        EXPECT_EQ(nodesOf(list), test.nodes) << test.title;
    }
}

TEST(HXRangeListTest, AgreesWithALinkedListOnRandomRuns) {
    std::mt19937_64 random(20240501);
    const auto below = [&](uint64_t limit) { return random() % limit; };
    for (int round = 0; round < 2000; round++) {
        const uint32_t page = 4096u << below(3);
        const uint64_t span = page * (1 + below(60));
        const bool aligned = below(2) == 0;
        HXRangeList list;
        LinkedRuns expected;
        for (uint64_t count = 1 + below(24); count > 0; count--) {
            PageRun run{{below(span), below(6 * page)}, {}};
            if (aligned) run.range = {run.range.location / page * page, run.range.length / page * page};
            run.amounts = {below(run.range.length + 1), below(page), below(2 * page), below(page), 0, 9};
            run.amounts.wired = below(2) * run.range.length;
            list.addRange(run.range, page, run.amounts);
            expected.add(run, page);
        }
        ASSERT_EQ(nodesOf(list), std::vector<HXRangeListNode>(expected.nodes.begin(), expected.nodes.end()))
            << "round " << round << ", page size " << page;
        HXMemoryTotal sum;
        for (const auto &node : expected.nodes) {
            sum.dirty += node.dirty, sum.swapped += node.swapped, sum.clean += node.clean;
            sum.reclaimable += node.reclaimable, sum.wired += node.wired;
        }
        ASSERT_EQ(list.sum(), sum);
    }
}

// A scan from the head would take 10^10 steps for one of the two.
TEST(HXRangeListTest, TakesManyRunsInEitherDirection) {
    constexpr uint64_t page = 4096, count = 100000;
    HXRangeList up, down;
    for (uint64_t i = 0; i < count; i++) {
        up.addRange({2 * page * i, page}, page, {page, 0, 0, 0, 0, 0});
        down.addRange({2 * page * (count - i), page}, page, {page, 0, 0, 0, 0, 0});
    }
    EXPECT_EQ(up.sum().dirty, count * page);
    EXPECT_EQ(down.sum().dirty, count * page);
}
