#include "model/HXRangeList.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <list>
#include <random>
#include <vector>

namespace {
// The merge as a plain linked list, scanned from its head: what the tree's results are compared with.
class LinkedRuns {
  public:
    void add(HXRangeListNode run, uint64_t page) {
        const uint64_t start = startOf(run, page), end = endOf(run, page);
        auto place = nodes.begin();
        while (place != nodes.end() && endOf(*place, page) < start)
            place++;
        while (place != nodes.end() && startOf(*place, page) <= end) {
            const uint64_t low = std::max(start, startOf(*place, page));
            const uint64_t high = std::min(end, endOf(*place, page));
            absorb(run, *place, high > low ? high - low : 0);
            place = nodes.erase(place);
        }
        nodes.insert(place, run);
    }
    std::list<HXRangeListNode> nodes;

  private:
    static uint64_t startOf(const HXRange &run, uint64_t page) { return run.location / page * page; }
    static uint64_t endOf(const HXRange &run, uint64_t page) {
        return (run.location + run.length + page - 1) / page * page;
    }
    static void absorb(HXRangeListNode &into, const HXRangeListNode &from, uint64_t overlap) {
        for (auto amount :
             {&HXSizes::dirty, &HXSizes::swapped, &HXSizes::clean, &HXSizes::reclaimable, &HXSizes::wired}) {
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

TEST(HXRangeListTest, AgreesWithALinkedListOnRandomRuns) {
    std::mt19937_64 random(20240501);
    const auto below = [&](uint64_t limit) { return random() % limit; };
    for (int round = 0; round < 2000; round++) {
        const uint32_t page = 4096u << below(3);
        const uint64_t span = page * (1 + below(60)), unit = below(2) == 0 ? page : 1;
        HXRangeList list;
        LinkedRuns expected;
        for (uint64_t count = 1 + below(24); count > 0; count--) {
            HXRangeListNode run{{below(span) / unit * unit, below(6 * page) / unit * unit}, {}};
            run.dirty = below(run.length + 1), run.swapped = below(page), run.clean = below(2 * page);
            run.reclaimable = below(page), run.wired = below(2) * run.length;
            list.addRange(run, page, run);
            expected.add(run, page);
        }
        ASSERT_EQ(nodesOf(list), std::vector<HXRangeListNode>(expected.nodes.begin(), expected.nodes.end()))
            << "round " << round << ", page size " << page;
        HXSizes sum;
        for (const HXRangeListNode &node : expected.nodes)
            sum += node;
        ASSERT_EQ(list.sum(), sum);
    }
}
