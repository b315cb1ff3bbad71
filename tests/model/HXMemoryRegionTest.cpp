// Of tests/cases/regions.txt.
#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"
#include "support/HXMadeUpMachine.h"

#include <gtest/gtest.h>

namespace {
std::string called(const std::string &tag) {
    return HXMemoryRegion::categoryNameForTag(static_cast<uint32_t>(std::stoul(tag))).str();
}

std::string worth(const std::string &text) {
    const HXMemoryRegion region = makeRegion(text);
    const bool view = region.eligibleForProcessView(), runs = region.eligibleForSubrangesUsingPageSize(4096);
    return std::string(view ? "view" : "") + (view && runs ? " " : "") + (runs ? "runs" : "");
}

std::string merged(const std::string &runs) {
    HXRangeList list;
    for (const HXRangeListNode &run : runsOf(runs))
        list.addRange(run, 4096, run);
    return told(list);
}
} // namespace

TEST(HXMemoryRegionTest, IsWhatItsTableSays) {
    const HXMadeUpMachine machine("tag  tag=100  name=heap\ntag  tag=101  name=Memory Tag 101\n");
    const auto tables = HXReadCases("regions.txt");
    std::string (*const answers[])(const std::string &) = {called, worth, merged};
    ASSERT_EQ(tables.size(), std::size(answers));
    for (size_t i = 0; i < tables.size(); i++)
        EXPECT_EQ(HXAnswered(tables[i].input, answers[i]), tables[i].input) << tables[i].title;
}

TEST(HXMemoryRegionTest, StaysWhereItIsInItsList) {
    HXMemoryRegionList list;
    std::vector<const HXMemoryRegion *> places;
    for (uint64_t i = 0; i < 100; i++) {
        HXMemoryRegion region;
        region.setStart(i);
        places.push_back(&list.emplace_back(std::move(region)));
        list.emplace_back();
        list.pop_back(); // also where it was alone in its piece
    }
    const HXMemoryRegionList moved = std::move(list);
    ASSERT_EQ(moved.size(), places.size());
    uint64_t i = 0;
    for (const HXMemoryRegion &region : moved) {
        EXPECT_EQ(&region, places[i]);
        EXPECT_EQ(region.start(), i++);
    }
    EXPECT_EQ(i, places.size());
}
