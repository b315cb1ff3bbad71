#include "platform/linux/kernel/HXLinuxKernelText.h"

#include <gtest/gtest.h>

#include <string>
#include <tuple>

namespace {

TEST(HXLinuxKernelTextTest, slabinfoOfEitherAllocator) {
    // SLUB, then SLAB with its statistics, then a cache whose module gave it an awkward name.
    const auto caches = HXParseSlabinfo(
        "slabinfo - version: 2.1 (statistics)\n# name            <active_objs> <num_objs> <objsize>\n"
        "dentry   18312  18333  192 21 1 : tunables  0  0  0 : slabdata  872  873   0\n"
        "kmalloc-8k  40     44 8192  4 8 : tunables  8  4  0 : slabdata   10   11   0 : globalstat 40 40 10 "
        "0\n"
        "odd : name (1:a)  1 2    3  4 5 : tunables  0  0  0 : slabdata    6    7   0\n"
        "no_numbers : tunables    0    0    0 : slabdata      6      7      0\n"
        "cut_short   18312  18333   192   21    1 : tunables    0    0    0 : slabdata    872\n");
    ASSERT_EQ(caches.size(), 3u);
    const auto facts = [](const HXSlabCache &c) {
        return std::tuple(std::string(c.name), c.activeObjects, c.objectSize, c.slabs, c.pagesPerSlab);
    };
    EXPECT_EQ(facts(caches[0]), std::tuple("dentry", 18312u, 192u, 873u, 1u));
    EXPECT_EQ(facts(caches[1]), std::tuple("kmalloc-8k", 40u, 8192u, 11u, 8u));
    EXPECT_EQ(facts(caches[2]), std::tuple("odd : name (1:a)", 1u, 3u, 7u, 5u));
}

TEST(HXLinuxKernelTextTest, vmallocAreas) {
    static constexpr struct {
        const char *line, *function = nullptr, *module = nullptr; // null: the area has no pages of its own
        uint64_t address = 0, pages = 0;
    } cases[] = {
        // 6.x: hashed addresses, pages by node; huge areas keep their page list in vmalloc space too
        {"0xf1-0x97 20480 kernel_clone+0x94/0x3e0 pages=4 vmalloc N0=4", "kernel_clone", "", 0, 4},
        {"0x1d-0x2d 7016448 htab_alloc+0x2/0x5 pages=1712 vmalloc vpages N0=900", "htab_alloc", "", 0, 1712},
        {"0x5b-0x55    8192 nft_init+0x21/0x80 [nf_tables] pages=1 vmalloc", "nft_init", "nf_tables", 0, 1},
        // 5.10 and later: pages that came with the mapping and go with it
        {"0x5b-0x55   69632 dma_alloc_noncontig+0x1/0x2 pages=16 vmap", "dma_alloc_noncontig", "", 0, 16},
        // 4.19: the pointers' key not ready; functions copied by the compiler
        {"0x(ptrval)-0x(ptrval) 8192 copy_process.part.34+0x2/0x1 pages=1 vmalloc", "copy_process.part.34",
         "", 0, 1},
        // callers without a symbol, or none at all
        {"0xff-0xff   20480 0xffffffffc0a1b2c3 pages=4 vmalloc N0=4", "", "", 0xffffffffc0a1b2c3, 4},
        {"0xff-0xff   20480 pages=4 vmalloc", "", "", 0, 4},
        // no memory of their own, and broken lines
        {"0x14-0xc3    8192 acpi_os_map_iomem+0x1bc/0x1e0 phys=0x00000000000a0000 ioremap"},
        {"0xb7-0x14 1048576 pcpu_get_vm_areas+0x0/0x1050 vmalloc"},
        {"0xb7-0x14   20480 unpurged vm_area"},
        {"0x1-0x2    x kernel_clone+0x94/0x3e0 pages=4 vmalloc"},
        {"0x1-0x2 8192 kernel_clone+0x94/0x3e0 pages= vmalloc"},
        {""},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.line);
        const auto areas = HXParseVmallocinfo(c.line);
        ASSERT_EQ(areas.size(), c.function ? 1u : 0u);
        if (!c.function) continue;
        EXPECT_EQ(areas[0].function, c.function);
        EXPECT_EQ(areas[0].module, c.module);
        EXPECT_EQ(areas[0].callerAddress, c.address);
        EXPECT_EQ(areas[0].pages, c.pages);
    }
}

TEST(HXLinuxKernelTextTest, meminfo) {
    const std::string whole =
        "MemTotal:       16332304 kB\nSReclaimable:     800000 kB\nSUnreclaim:       232304 kB\n"
        "KernelStack: 0 kB\nZswap: 12 kB\nZswapped: 40 kB\nHugePages_Total:       0\n";
    const auto found = HXParseKernelMeminfo(whole);
    ASSERT_TRUE(found);
    EXPECT_EQ(found->totalSize, 16332304ull * 1024);
    EXPECT_EQ(found->slabUnreclaimableSize, 232304u * 1024);
    EXPECT_EQ(found->zswapSize, 12u * 1024);
    EXPECT_EQ(found->kernelStackSize, 0u);
    EXPECT_EQ(found->perCpuSize, std::nullopt) << "a kernel that does not tell";
    for (const std::string needed : {"MemTotal:", "SReclaimable:", "SUnreclaim:", "KernelStack:"}) {
        std::string text = whole;
        EXPECT_FALSE(HXParseKernelMeminfo(text.replace(text.find(needed), needed.size(), needed + "x")))
            << needed;
    }
}

TEST(HXLinuxKernelTextTest, modulesZonesAndZram) {
    const auto modules = HXParseModules("nf_tables 303104 5 nft_ct,nft_chain_nat, Live 0xffffffffc0a4b000\n"
                                        "odd 16384 - - Unloading 0x0000000000000000 (OE-)\nbroken\n");
    ASSERT_EQ(modules.size(), 2u);
    EXPECT_EQ(modules[1].size, 16384u);

    EXPECT_EQ(
        HXParseZoneinfoPresentPages("Node 0, zone      DMA\n  pages free     2\n        present  3998\n"
                                    "        managed  3840\nNode 0, zone   Normal\n        present  10\n"),
        4008u);

    EXPECT_EQ(HXParseZramUsedSize("  4096000   74 1228800  0 2457600  0  0  0  0\n"), 1228800u);
    EXPECT_EQ(HXParseZramUsedSize("4096000   74 x\n"), std::nullopt);
    EXPECT_EQ(HXParseZoneinfoPresentPages("present x\n"), std::nullopt);
}

TEST(HXLinuxKernelTextTest, allocationSites) {
    const auto sites = HXParseAllocinfo("allocinfo - version: 1.0\n#     <size>  <calls> <tag info>\n"
                                        " 99 9 nowhere func:f\n 98 9 a.c:x func:f\n 97 9 a.c:1 f\n"
                                        " 96 x a.c:1 func:f\n 10 1 b.c:3 [m] func:g accurate:no\n");
    ASSERT_EQ(sites.size(), 1u);
    EXPECT_EQ(std::tuple(sites[0].size, sites[0].path, sites[0].line, sites[0].module, sites[0].function),
              std::tuple(10u, "b.c", 3, "m", "g"));
}

} // namespace
