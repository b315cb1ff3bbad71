#include "platform/linux/kernel/HXLinuxKernelText.h"

#include <gtest/gtest.h>

#include <sstream>

namespace {

// The facts of all records of a text, in the order of their declaration; "|" behind each record.
template <typename... Facts>
std::string row(const Facts &...facts) {
    std::ostringstream text;
    ((text << facts << ' '), ...);
    return text.str() + "|";
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
std::string show(const HXKernelSymbol &s) {
    return row(s.address, s.name, s.module, s.isCode);
}
template <auto parse>
std::string rows(const char *text) {
    std::string all;
    for (const auto &record : parse(text))
        all += show(record);
    return all;
}
constexpr auto slabs = rows<HXParseSlabinfo>, areas = rows<HXParseVmallocinfo>;
constexpr auto modules = rows<HXParseModules>, sites = rows<HXParseAllocinfo>;
constexpr auto symbols = rows<HXParseKallsyms>;

TEST(HXLinuxKernelTextTest, linesOfManyKernels) {
    static const struct {
        std::string (*parse)(const char *text);
        const char *text, *expected;
    } cases[] = {
        {slabs,
         "slabinfo - version: 2.1\n# name <active_objs> <num_objs> : tunables <limit> : slabdata <a>\n", ""},
        {slabs, "dentry 18312  18333  192 21 1 : tunables  0  0  0 : slabdata  872  873   0\n",
         "dentry 18312 192 873 1 |"},
        {slabs, "size-8k 40 44 8192 4 8 : tunables 8 4 0 : slabdata 10 11 0 : globalstat 40 40 10 0",
         "size-8k 40 8192 11 8 |"},
        {slabs, "odd : name (1:a)  1 2    3  4 5 : tunables  0  0  0 : slabdata    6    7   0\n",
         "odd : name (1:a) 1 3 7 5 |"},
        {slabs, "no_numbers : tunables    0    0    0 : slabdata      6      7      0\n", ""},
        {slabs, " 1 2    3  4 5 : tunables  0  0  0 : slabdata    6    7   0\n", ""},
        {slabs, "cut_short 1 1 192 21 1 : tunables 0 0 0 : slabdata    872\n", ""},
        // 6.x: hashed addresses, pages by node; huge areas keep their page list in vmalloc space too
        {areas, "0xf1-0x97 20480 kernel_clone+0x94/0x3e0 pages=4 vmalloc N0=4", "kernel_clone  0 4 |"},
        {areas, "0x1d-0x2d 7016448 htab+0x2/0x5 pages=1712 vmalloc vpages N0=900", "htab  0 1712 |"},
        {areas, "0x5b-0x55    8192 init+0x21/0x80 [nft] pages=1 vmalloc", "init nft 0 1 |"},
        // 5.10 and later: pages that came with the mapping and go with it
        {areas, "0x5b-0x55   69632 dma_alloc+0x1/0x2 pages=16 vmap", "dma_alloc  0 16 |"},
        // 4.19: the pointers' key not ready; functions copied by the compiler
        {areas, "0x(ptrval)-0x(ptrval) 8192 f.part.34+0x2/0x1 pages=1 vmalloc", "f.part.34  0 1 |"},
        // callers without a symbol, or none at all; a module's name needs a letter
        {areas, "0xff-0xff   20480 0xffff pages=4 vmalloc N0=4", "  65535 4 |"},
        {areas, "0xff-0xff   20480 [] mod] [mod pages=4 vmalloc", "  0 4 |"},
        // no memory of their own, and broken lines
        {areas, "0x14-0xc3    8192 acpi_map+0x1bc/0x1e0 phys=0x00000000000a0000 ioremap", ""},
        {areas, "0xb7-0x14 1048576 pcpu_get_vm_areas+0x0/0x1050 vmalloc\n0xb7-0x14 20480 unpurged vm_area",
         ""},
        {areas, "0x1-0x2    x f+0x94/0x3e0 pages=4 vmalloc\n0x1-0x2 8192 f+0x94/0x3e0 pages= vmalloc", ""},
        {areas, "0x1-0x2 8192 f+0x94/0x3e0 pages=0 vmalloc", ""},
        {modules,
         "nf_tables 303104 5 nft_ct, Live 0xffffffffc0a4b000\nbroken\nodd 16384 - - Unloading 0x0 (OE-)\n",
         "nf_tables 303104 |odd 16384 |"},
        {symbols, "ff t b\t[m]\n0a T a\n0b W w\n0c w v\n0d D d\n",
         "10 a  1 |11 w  1 |12 v  1 |13 d  0 |255 b m 1 |"},
        {symbols, "0f T a\nx T b\n1 T\n1 T \n1T  c\n1 TTd\n", "15 a  1 |"},
        {symbols, "00 T hidden\n00 T too\n", ""},
        {sites, "allocinfo - version: 1.0\n#     <size>  <calls> <tag info>\n 99 9 nowhere func:f\n", ""},
        {sites, " 98 9 a.c:x func:f\n 97 9 a.c:1 f\n 96 x a.c:1 func:f\n", ""},
        {sites, " 10 1 b.c:3 [m] func:g accurate:no\n 11 1 c.c:4 func:h", "10 b.c 3 m g |11 c.c 4  h |"},
    };
    for (const auto &c : cases)
        EXPECT_EQ(c.parse(c.text), c.expected) << c.text;
}

TEST(HXLinuxKernelTextTest, figures) {
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
    EXPECT_EQ(HXParseZoneinfoPresentPages("Node 0\n  pages free 2\n  present 3\n managed 4\n present 1\n"),
              4u);
    EXPECT_EQ(HXParseZoneinfoPresentPages("present x\n"), std::nullopt);
    EXPECT_EQ(HXParseZramUsedSize("  4096000   74 1228800  0 2457600  0  0  0  0\n"), 1228800u);
    EXPECT_EQ(HXParseZramUsedSize("4096000   74 x\n"), std::nullopt);
}

} // namespace
