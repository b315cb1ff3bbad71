#include "platform/linux/kernel/HXLinuxKernelText.h"

#include "support/HXCaseFile.h"

#include <gtest/gtest.h>

#include <map>
#include <sstream>
#include <utility>

namespace {

// The facts of all records of a text, a line each, in the order of their declaration; names behind a bar.
template <typename... Facts>
std::string row(const Facts &...facts) {
    std::ostringstream text;
    const char *separator = "";
    ((text << std::exchange(separator, "|") << facts), ...);
    return text.str() + "\n";
}
std::string show(const HXSlabCache &c) {
    return row(c.name, c.activeObjects, c.objectSize, c.slabs, c.pagesPerSlab);
}
std::string show(const HXVmallocArea &a) {
    return row(a.function, a.module, a.callerAddress, a.pages);
}
std::string show(const HXKernelModule &m) {
    return row(m.name, m.size);
}
std::string show(const HXAllocationSite &s) {
    return row(s.size, s.path, s.line, s.module, s.function);
}
std::string show(const HXZonePages &z) {
    return row(z.present, z.listed);
}
std::string show(const HXKernelSymbol &s) {
    return row(s.address, s.name, s.module, s.isCode);
}
template <auto parse>
std::string rows(std::string_view text) {
    std::string all;
    for (const auto &record : parse(text))
        all += show(record);
    return all;
}
template <auto parse>
std::string whole(std::string_view text) {
    return show(parse(text));
}
template <auto parse>
std::string figure(std::string_view text) {
    const std::optional<uint64_t> figure = parse(text);
    return figure ? std::to_string(*figure) + "\n" : "";
}

// A case's title begins with the name of the file.
TEST(HXLinuxKernelText, ReadsLinesOfManyKernels) {
    static const std::map<std::string, std::string (*)(std::string_view)> parsers = {
        {"slabinfo", rows<HXParseSlabinfo>},     {"vmallocinfo", rows<HXParseVmallocinfo>},
        {"modules", rows<HXParseModules>},       {"allocinfo", rows<HXParseAllocinfo>},
        {"kallsyms", rows<HXParseKallsyms>},     {"zoneinfo", whole<HXParseZoneinfo>},
        {"mm_stat", figure<HXParseZramUsedSize>}};
    for (const HXCase &each : HXReadCases("linux-kernel-text.txt")) {
        const auto parse = parsers.at(each.title.substr(0, each.title.find(':')));
        for (std::string_view text : {each.input, each.input.substr(0, each.input.size() - 1)})
            EXPECT_EQ(parse(text), each.expected.at(0).text) << each.title << "\n" << text;
    }
}

TEST(HXLinuxKernelText, NeedsSomeFiguresOfMeminfo) {
    const std::string whole = "MemTotal:       16332304 kB\nSReclaimable: 8 kB\nSUnreclaim:       232304 kB\n"
                              "KernelStack: 0 kB\nZswap: 12 kB\nZswapped: 40 kB\nHugePages_Total:       0\n";
    const auto found = HXParseKernelMeminfo(whole);
    ASSERT_TRUE(found);
    EXPECT_EQ(found->totalSize, 16332304ull * 1024);
    EXPECT_EQ(found->zswapSize, 12u * 1024);
    EXPECT_EQ(found->perCpuSize, std::nullopt) << "a kernel that does not tell";
    for (const std::string needed : {"MemTotal:", "SReclaimable:", "SUnreclaim:", "KernelStack:"}) {
        std::string text = whole;
        EXPECT_FALSE(HXParseKernelMeminfo(text.replace(text.find(needed), needed.size(), "x"))) << needed;
    }
}

} // namespace
