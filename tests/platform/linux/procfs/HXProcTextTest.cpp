#include "platform/linux/procfs/HXProcText.h"

#include <gtest/gtest.h>

#include <sstream>
#include <utility>
#include <vector>

namespace {

const std::string statTail = " S 1 77 78 0 -1 4194560 1 2 3 4 5 6 7 8 20 0 3 0 4242 1000 200 "
                             "18446744073709551615 1 2 140724000000000 0 0\n";

TEST(HXProcText, StatFindsTheNameWhateverItHolds) {
    const std::pair<std::string, std::string> cases[] = {{"bash", "bash"},
                                                         {"", ""},
                                                         {"a b) R 99 (c", "a b) R 99 (c"},
                                                         {"new\nline", "new\nline"},
                                                         {std::string(100, 'x'), std::string(64, 'x')}};
    for (const auto &item : cases) {
        const auto stat = HXParseStat("42 (" + item.first + ")" + statTail);
        ASSERT_TRUE(stat) << item.first;
        EXPECT_EQ(stat->comm(), item.second);
        EXPECT_EQ(stat->state, 'S');
        EXPECT_EQ((std::vector<uint64_t>{stat->pgid, stat->threadCount, stat->startTime, stat->startStack}),
                  (std::vector<uint64_t>{77, 3, 4242, 140724000000000}));
        EXPECT_FALSE(stat->isKernelThread());
    }
    EXPECT_TRUE(HXParseStat("2 (kthreadd) S 0 0 0 0 -1 2129984 0 0 0 0 0 0 0 0 20 0 1 0 0 0 0 0 0 0 0 0 0\n")
                    ->isKernelThread());
    for (const char *bad :
         {"", "42 bash S 1", "42 (bash", "42 )bash( S 1", "42 (a) S", "42 (a) S 1 2 3 4 5 6"})
        EXPECT_FALSE(HXParseStat(bad)) << bad;
}

TEST(HXProcText, StatusAddsUpTheCharge) {
    const HXStatusRecord status = HXParseStatus(
        "Name:\tVmSwap:\t999 kB\nVmLck:\t    20 kB\nVmHWM:\t     100 kB\nVmRSS:\t 90 kB\nRssAnon:\t 10 kB\n"
        "RssFile:\t 60 kB\nRssShmem:\t 20 kB\nVmPTE:\t 4 kB\nVmSwap:\t 8 kB\nHugetlbPages:\t 2048 kB\n"
        "Threads:\t12\n");
    EXPECT_EQ(status.heftSize(), (10u + 20 + 4 + 8 + 2048) * 1024);
    EXPECT_EQ(status.peakHeftSize(), (100u + 4 + 2048) * 1024);
    const std::string needed = "RssAnon: 500 kB\nRssShmem: 0 kB\nVmSwap: 0 kB\nVmPTE: 0 kB\n";
    EXPECT_EQ(HXParseStatus(needed + "VmHWM: 10 kB").peakHeftSize(), 500u * 1024);
    EXPECT_EQ(HXParseStatus(needed + "VmHWM: 900 kB").peakHeftSize(), 900u * 1024) << "no huge-page pool";
    EXPECT_EQ(HXParseStatus("Threads: 1").heftSize(), 0u) << "a zombie";
    EXPECT_EQ(HXParseStatus("Threads: 1").pageTablesHeld(), 0u);
    EXPECT_EQ(HXParseStatus("VmRSS: 5 kB").pageTablesHeld(), std::nullopt);
    for (const std::string figure : {"RssAnon:", "RssShmem:", "VmSwap:", "VmPTE:"}) {
        std::string text = needed;
        EXPECT_EQ(HXParseStatus(text.replace(text.find(figure), figure.size(), "x")).heftSize(), std::nullopt)
            << figure;
    }
    EXPECT_EQ(HXParseLabelled("xLazyFree: 1\nLazyFree:\n", "LazyFree:"), std::nullopt);
}

TEST(HXProcText, MountInfo) {
    std::vector<std::string> mounts;
    HXParseMountInfo("22 27 0:21 / /proc rw,relatime - proc proc rw\n"
                     "bad line\n36 35 98:0 /mnt1 /a\\040-\\040b rw master:1 shared:2 - ext3 /dev/root rw\n"
                     "37 1 0:1048575 / /x rw\n38 1 0:44 / /shm rw - tmpfs tmpfs rw,size=4k",
                     [&](const HXMount &mount) {
                         std::ostringstream text;
                         text << mount.identifier << ' ' << mount.device << ' ' << mount.point << ' '
                              << mount.type << ' ' << mount.options;
                         mounts.push_back(text.str());
                     });
    EXPECT_EQ(mounts, (std::vector<std::string>{"22 21 /proc proc rw", "36 102760448 /a\\040-\\040b ext3 rw",
                                                "38 44 /shm tmpfs rw,size=4k"}));
}

TEST(HXProcText, StackPointers) {
    const std::pair<const char *, std::optional<uint64_t>> cases[] = {
        {"running\n", std::nullopt},
        {"-1 0x7ffd00001000 0x7f0000001234\n", 0x7ffd00001000},
        {"7 0x1 0x2 0x3 0x4 0x5 0x6 0x7ffd00002000 0x7f0000001234\n", 0x7ffd00002000},
        {"-1 7 8\n", std::nullopt},
        {"-1 0x 0x1\n", std::nullopt}};
    for (const auto &item : cases)
        EXPECT_EQ(HXParseStackPointer(item.first), item.second) << item.first;
}

} // namespace
