#include "output/HXOutputFormatterText.h"

#include "support/HXBarePlatform.h"
#include "support/HXBuilders.h"
#include "support/HXRun.h"

#include <gtest/gtest.h>
#include <sstream>

TEST(HXOutputFormatterTextTest, WritesSizesInTheChosenFormat) {
    const HXBarePlatform platform;
    struct {
        uint64_t size;
        const char *texts[3]; // by HXSummaryFormat
    } cases[] = {
        {0, {"0 B", "0 B", "0 pages"}},
        {9999, {"9999 B", "9999 B", "1 pages"}},
        {10000, {"10000 B", "10 KB", "1 pages"}},
        {16384, {"16384 B", "16 KB", "1 pages"}},
        {16385, {"16385 B", "16 KB", "2 pages"}},
        {10239487, {"10239487 B", "9999 KB", "625 pages"}}, // 9999.499 KB
        {10239488, {"10239488 B", "10 MB", "625 pages"}},   // 9999.5 KB would need five digits
        {uint64_t{1} << 40, {"1099511627776 B", "1024 GB", "67108864 pages"}},
    };
    for (const int32_t format : {HXFormatBytes, HXFormatFormatted, HXFormatPages}) {
        HXOutputFormatterText formatter(format, 0, "Dirty");
        (void)printedBy([&] { formatter.printProcessHeader(HXMadeUpProcess(1, "p")); });
        for (const auto &test : cases)
            EXPECT_EQ(formatter.formattedStringForSize(test.size), test.texts[format]);
    }
}

TEST(HXOutputFormatterTextTest, SortsRowsByEveryColumn) {
    // "d" and "e" tie in all but clean; "a" is dirty by its swapped bytes.
    const std::string machine =
        "host  self_region_heft=0\ntag  tag=200  name=a\ntag  tag=201  name=B\ntag  tag=202  name=c\n"
        "tag  tag=203  name=d\ntag  tag=204  name=e\nprocess  pid=5  name=p\n" +
        region(5, 0x100000, 0x100000, "tag=202  object_id=1  resident=13  dirtied=10  reusable=1") +
        region(5, 0x200000, 0x100000, "tag=204  object_id=2  resident=15  dirtied=10  reusable=2") +
        region(5, 0x300000, 0x100000, "tag=203  object_id=3  resident=14  dirtied=10  reusable=2") +
        region(5, 0x400000, 0x100000, "tag=200  object_id=4  resident=1  dirtied=1  swapped=40  wired=1") +
        region(5, 0x500000, 0x100000,
               "tag=201  object_id=5  resident=27  dirtied=14  reusable=6  swapped=3") +
        region(5, 0x600000, 0x4000, "tag=201") + region(5, 0x700000, 0x4000, "tag=203") +
        region(5, 0x704000, 0x4000, "tag=203") + region(5, 0x800000, 0x4000, "tag=202");
    const char *cases[][2] = {{"dirty", "aBedc"},       {"swapped", "aBcde"}, {"clean", "Becda"},
                              {"reclaimable", "Bdeca"}, {"wired", "aBcde"},   {"regions", "dBcae"},
                              {"category", "Bacde"}};
    for (const auto &[column, expected] : cases) {
        std::istringstream lines(run(machine, {"5", "--sort", column}).out);
        std::string order;
        for (std::string line; std::getline(lines, line);)
            if (line.size() > 5 && line.rfind("    ") == line.size() - 5) order += line.back();
        EXPECT_EQ(order, expected) << column; // ties by name
    }
}

// Twenty processes are named, twenty-one are only counted.
TEST(HXOutputFormatterTextTest, NamesTheMembersOfSmallGroups) {
    for (const int count : {3, 20, 21}) {
        std::string machine, names;
        for (int pid = 1; pid <= count; pid++) {
            machine += "process  pid=" + std::to_string(pid + 10) + "  name=p\n" +
                       region(pid + 10, 0x4000, 0x4000, "object_id=7  share_mode=4  resident=1  dirtied=1");
            if (pid > 1) names += (pid > 2 ? ", p [" : " p [") + std::to_string(pid + 10) + "]";
        }
        const HXRun result = report(machine, {"-a"});
        const std::string line = count <= 20 ? "Shared with" + names + ":\n" : "Shared with 21 processes:\n";
        EXPECT_NE(result.out.find("\n" + line), std::string::npos) << count << result.out;
        EXPECT_NE(result.out.find("Summary Heft: 16384 B\n"), std::string::npos);
    }
}
