// What pages are, one by one; and the figures of mappings that are counted from runs of pages.
#include "platform/linux/memory/HXPageReader.h"

#include "platform/linux/memory/HXScanFigures.h"
#include "platform/linux/memory/HXSharedSwap.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <set>
#include <sstream>

namespace {

constexpr uint8_t P = HXPageRun::present, F = HXPageRun::file, S = HXPageRun::swapped, N = HXPageRun::nothing;
constexpr int32_t kDirty = 0x9, kExternal = 0x81, kReusable = 0x801, kPagedOut = 0x10;
constexpr uint16_t kSharedMemory = HXMappingSwapBacked | HXMappingShared;

TEST(HXPageReader, TellsPagesByTheirMapping) {
    const struct {
        const char *what;
        uint16_t flags;
        uint32_t anonymousPages;
        uint8_t facts;
        HXPagesLeft left;
        int32_t disposition;
    } cases[] = {
        {"a file's page", 0, 0, P | F, {}, kExternal},
        {"a driver's page", 0, 0, P, {}, 0},
        {"swapped out", 0, 0, S, {2, 0}, kPagedOut},
        {"a mark without a page", 0, 0, S, {}, 0},
        {"its own copy", 0, 4, P, {}, kDirty},
        {"the page of zeros", 0, 4, P | N, {}, 0},
        {"shared memory", kSharedMemory, 0, P | F, {}, kDirty},
        {"of the huge-page pool", HXMappingHugePages, 0, P | F, {}, kDirty},
        {"missing in the pool", HXMappingHugePages, 0, 0, {}, 0},
        {"lazily freed", 0, 4, P, {0, 1}, kReusable},
        {"a guard", 0, 4, S | N, {1, 0}, 0},
        {"not there", 0, 4, 0, {1, 1}, 0},
    };
    for (const auto &item : cases) {
        HXMapping mapping;
        mapping.flags = item.flags;
        mapping.anonymousPages = item.anonymousPages;
        HXPagesLeft left = item.left;
        EXPECT_EQ(HXPageDisposition(mapping, item.facts, &left), item.disposition) << item.what;
        EXPECT_EQ(left.swapped, item.left.swapped - (item.disposition == kPagedOut)) << item.what;
        EXPECT_EQ(left.lazyFree, item.left.lazyFree - (item.disposition == kReusable)) << item.what;
    }
}

const struct {
    uint64_t start, end, inode;
    HXPathKind kind;
    uint16_t flags;
} kMappings[] = {
    {0x10000, 0x18000, 0, HXPathKind::none, 0},
    {0x18000, 0x20000, 7, HXPathKind::file, 0},
    {0x20000, 0x200000, 0, HXPathKind::none, 0}, // large enough for a request of its own
    {0x200000, 0x210000, 8, HXPathKind::memfd, kSharedMemory},
    {0x210000, 0x218000, 9, HXPathKind::file, HXMappingShared},
    {0x220000, 0x228000, 0, HXPathKind::none, HXMappingShared}, // a driver's
    {0xffffffffff600000, 0xffffffffff601000, 0, HXPathKind::special, 0},
};

// "RESIDENT,ANONYMOUS,SWAPPED" of every mapping when `pages` are there, told two at a time; before it, where
// it was looked for them, with a question mark where files were to be told.
std::string figuresOf(const std::vector<HXPageRun> &pages, uint64_t swappedSize) {
    HXAddressSpace addressSpace;
    for (const auto &item : kMappings) {
        HXMapping mapping;
        mapping.start = item.start;
        mapping.end = item.end;
        mapping.inode = item.inode;
        mapping.kind = item.kind;
        mapping.flags = item.flags;
        addressSpace.append(mapping);
    }
    std::ostringstream text;
    uint64_t lastEnd = 0;
    const HXFindRuns find = [&](bool tellsFiles, uint64_t start, uint64_t end, std::span<HXPageRun> runs) {
        if (end != std::exchange(lastEnd, end))
            text << std::hex << start << "-" << end << (tellsFiles ? "? " : " ");
        std::optional<HXPageScan::Walk> walk({0, end});
        for (const HXPageRun &page : pages) {
            if (page.end <= start || page.start >= end || walk->end != end) continue;
            if (walk->count == 2)
                walk->end = page.start;
            else
                runs[walk->count++] = {std::max(page.start, start), std::min(page.end, end), page.facts};
        }
        return pages.empty() || pages[0].start != 0 ? walk : std::nullopt;
    };
    if (!HXCountRuns(find, 12, swappedSize, &addressSpace)) return "no good";
    for (size_t i = 0; i < addressSpace.count(); i++)
        text << std::dec << addressSpace[i].residentPages << "," << addressSpace[i].anonymousPages << ","
             << addressSpace[i].swappedPages << " ";
    return text.str();
}

TEST(HXScanFigures, CountsRunsOfPages) {
    const std::string walks = "10000-20000? 20000-210000 210000-228000? ";
    EXPECT_EQ(figuresOf({{0x10000, 0x11000, P | N},
                         {0x12000, 0x14000, S},
                         {0x17000, 0x1a000, P}, // over two mappings
                         {0x1a000, 0x1b000, P | F},
                         {0x1b000, 0x1c000, S | F},
                         {0x1f000, 0x22000, P},
                         {0x1ff000, 0x203000, P},
                         {0x210000, 0x211000, P | F},
                         {0x211000, 0x212000, S},
                         {0x220000, 0x222000, P}},
                        0x2000),
              walks + "1,1,2 4,3,0 3,3,0 3,0,0 1,0,0 0,0,0 0,0,0 ");
    EXPECT_EQ(figuresOf({{0x20000, 0x21000, P | N}}, 0),
              walks + "0,0,0 0,0,0 0,0,0 0,0,0 0,0,0 0,0,0 0,0,0 ");
    EXPECT_EQ(figuresOf({}, 0), "no good") << "a process that has gone";
    EXPECT_EQ(figuresOf({{0x20000, 0x21000, S}}, 0), "no good") << "more swapped than the kernel says";
    EXPECT_EQ(figuresOf({{0, 1, P}}, 0), "no good") << "the kernel refuses";
}

TEST(HXSharedSwap, FindsSwappedPagesByCounting) {
    const std::set<uint64_t> swapped = {103, 104, 110, 163};
    const HXCountSwapped countSwapped = [&](uint64_t first, uint64_t count) {
        const auto found = std::distance(swapped.lower_bound(first), swapped.lower_bound(first + count));
        return std::optional<uint64_t>(found);
    };
    std::vector<int32_t> pages(64);
    EXPECT_EQ(HXMarkSwapped(countSwapped, 100, 10, pages), 4u);
    for (uint64_t i = 0; i < pages.size(); i++)
        EXPECT_EQ(pages[i], swapped.contains(100 + i) ? kPagedOut : 0) << i;
    std::vector<int32_t> few(64);
    EXPECT_EQ(HXMarkSwapped(countSwapped, 100, 2, few), 2u) << "no more than the mapping has";
    const HXCountSwapped unknown = [](uint64_t, uint64_t) { return std::nullopt; };
    std::vector<int32_t> mixed = {kDirty, 0, kDirty, 0, 0};
    EXPECT_EQ(HXMarkSwapped(unknown, 0, 2, mixed), 2u);
    EXPECT_EQ(mixed, (std::vector<int32_t>{kDirty, kPagedOut, kDirty, kPagedOut, 0}));
}

} // namespace
