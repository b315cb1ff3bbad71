#include "platform/linux/HXLinuxKernelText.h"

#include <gtest/gtest.h>

#include <string>
#include <tuple>

namespace {

TEST(HXLinuxKernelTextTest, slabinfoOfEitherAllocator) {
    // SLUB, then SLAB with its statistics, then a cache whose module gave it an awkward name.
    const auto caches = HXParseSlabinfo(
        "slabinfo - version: 2.1 (statistics)\n"
        "# name            <active_objs> <num_objs> <objsize> <objperslab> <pagesperslab> : tunables <limit> "
        "<batchcount> <sharedfactor> : slabdata <active_slabs> <num_slabs> <sharedavail>\n"
        "dentry             18312  18333    192   21    1 : tunables    0    0    0 : slabdata    872    873 "
        "     0\n"
        "kmalloc-8k            40     44   8192    4    8 : tunables    8    4    0 : slabdata     10     11 "
        "     "
        "0 : globalstat      40     40    10    0    0    0    0    0    0 : cpustat      0     10      0    "
        "  0\n"
        "odd : name (1:a)       1      2      3    4    5 : tunables    0    0    0 : slabdata      6      7 "
        "     0\n"
        "no_numbers : tunables    0    0    0 : slabdata      6      7      0\n"
        "cut_short          18312  18333    192   21    1 : tunables    0    0    0 : slabdata    872\n");
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
        const char *line;
        const char *function = nullptr; // null: the area has no pages of its own
        const char *module = nullptr;
        uint64_t address = 0, pages = 0;
    } cases[] = {
        // 6.x: hashed addresses, pages by node; huge areas keep their page list in vmalloc space too
        {"0x00000000f1115795-0x00000000937ad095   20480 kernel_clone+0x94/0x3e0 pages=4 vmalloc N0=4",
         "kernel_clone", "", 0, 4},
        {"0x0000000011d2fd63-0x000000001e1f0d2d 7016448 htab_map_alloc+0x2e4/0x5a0 pages=1712 vmalloc vpages "
         "N0=900 "
         "N1=812",
         "htab_map_alloc", "", 0, 1712},
        {"0x000000005bc0ba5c-0x0000000055c5bae9    8192 nft_pipapo_init+0x21/0x80 [nf_tables] pages=1 "
         "vmalloc N0=1",
         "nft_pipapo_init", "nf_tables", 0, 1},
        // 5.10 and later: pages that came with the mapping and go with it
        {"0x000000005bc0ba5c-0x0000000055c5bae9   69632 dma_alloc_noncontig+0x1/0x2 pages=16 vmap",
         "dma_alloc_noncontig", "", 0, 16},
        // 4.19: the pointers' key not ready; functions copied by the compiler
        {"0x(____ptrval____)-0x(____ptrval____)   20480 copy_process.part.34+0x2d6/0x1c40 pages=4 vmalloc "
         "N0=4",
         "copy_process.part.34", "", 0, 4},
        {"0x(ptrval)-0x(ptrval)    8192 bpf_prog_alloc+0x3a/0xb0 pages=1 vmalloc N0=1", "bpf_prog_alloc", "",
         0, 1},
        // real addresses; callers without a symbol, or none at all
        {"0xffffb1c5c0000000-0xffffb1c5c0005000   20480 0xffffffffc0a1b2c3 pages=4 vmalloc N0=4", "", "",
         0xffffffffc0a1b2c3, 4},
        {"0xffffb1c5c0000000-0xffffb1c5c0005000   20480 pages=4 vmalloc", "", "", 0, 4},
        // no memory of their own
        {"0x0000000014803ddb-0x00000000c3a28be6    8192 acpi_os_map_iomem+0x1bc/0x1e0 "
         "phys=0x00000000000a0000 ioremap"},
        {"0x00000000b7439af8-0x0000000014803ddb   20480 irq_init_percpu_irqstack+0xca/0x100 vmap"},
        {"0x00000000b7439af8-0x0000000014803ddb 1048576 pcpu_get_vm_areas+0x0/0x1050 vmalloc"},
        {"0x00000000b7439af8-0x0000000014803ddb   20480 unpurged vm_area"},
        {"0xffffb1c5c0000000-0xffffb1c5c0400000 4194304 vm_map_ram"},
        // broken
        {"0x1-0x2    x kernel_clone+0x94/0x3e0 pages=4 vmalloc"},
        {"0x1-0x2 8192 kernel_clone+0x94/0x3e0 pages= vmalloc"},
        {" pages=4"},
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

TEST(HXLinuxKernelTextTest, meminfoOfOldAndNewKernels) {
    const auto old = HXParseKernelMeminfo("MemTotal:       16332304 kB\nSlab:            1032304 kB\n"
                                          "SReclaimable:     800000 kB\nSUnreclaim:       232304 kB\n"
                                          "KernelStack:       16400 kB\nPageTables:        56788 kB\n"
                                          "VmallocUsed:           0 kB\nHugePages_Total:       0\n");
    ASSERT_TRUE(old);
    EXPECT_EQ(old->totalSize, 16332304ull * 1024);
    EXPECT_EQ(old->slabUnreclaimableSize, 232304u * 1024);
    EXPECT_EQ(old->perCpuSize, 0u);
    const auto recent =
        HXParseKernelMeminfo("MemTotal:  100 kB\nPercpu:  688 kB\nZswap: 12 kB\nZswapped: 40 kB\n"
                             "SecPageTables: 8 kB\nMlocked: 4 kB\nBalloon: 20 kB\n");
    ASSERT_TRUE(recent);
    EXPECT_EQ(recent->perCpuSize, 688u * 1024);
    EXPECT_EQ(recent->zswapSize, 12u * 1024);
    EXPECT_EQ(recent->secondaryPageTableSize, 8u * 1024);
    EXPECT_EQ(recent->mlockedSize, 4u * 1024);
    EXPECT_EQ(recent->balloonSize, 20u * 1024);
    EXPECT_FALSE(HXParseKernelMeminfo(""));
    EXPECT_FALSE(HXParseKernelMeminfo("MemTotal: many kB\n"));
}

TEST(HXLinuxKernelTextTest, modulesZonesAndZram) {
    const auto modules = HXParseModules("nf_tables 303104 5 nft_ct,nft_chain_nat, Live 0xffffffffc0a4b000\n"
                                        "odd 16384 - - Unloading 0x0000000000000000 (OE-)\nbroken\n");
    ASSERT_EQ(modules.size(), 2u);
    EXPECT_EQ(modules[0].name, "nf_tables");
    EXPECT_EQ(modules[0].size, 303104u);
    EXPECT_EQ(modules[1].size, 16384u);

    EXPECT_EQ(
        HXParseZoneinfoPresentPages("Node 0, zone      DMA\n  pages free     2\n        present  3998\n"
                                    "        managed  3840\nNode 0, zone   Normal\n        present  10\n"),
        4008u);

    EXPECT_EQ(HXParseZramUsedSize("  4096000   74 1228800  0 2457600  0  0  0  0\n"), 1228800u);
    EXPECT_EQ(HXParseZramUsedSize("1 2\n3\n"), 0u);
    EXPECT_EQ(HXParseZramUsedSize(""), 0u);
}

TEST(HXLinuxKernelTextTest, allocinfo) {
    const auto sites =
        HXParseAllocinfo("allocinfo - version: 1.0\n#     <size>  <calls> <tag info>\n"
                         "    56373248     4737 mm/slub.c:2259 func:alloc_slab_page \n"
                         "     4136960     1010 drivers/staging/ctagmod/ctagmod.c:20 [ctagmod] "
                         "func:ctagmod_start accurate:no\n"
                         "           0        0 nowhere func:f\n           0        0 a.c:1 f\n");
    ASSERT_EQ(sites.size(), 2u);
    EXPECT_EQ(sites[0].size, 56373248u);
    EXPECT_EQ(sites[0].path, "mm/slub.c");
    EXPECT_EQ(sites[0].line, 2259);
    EXPECT_EQ(sites[0].function, "alloc_slab_page");
    EXPECT_EQ(sites[1].module, "ctagmod");
    EXPECT_EQ(sites[1].function, "ctagmod_start");
}

TEST(HXLinuxKernelTextTest, kallsyms) {
    const auto symbols = HXParseKallsyms("0000000000000000 A fixed_percpu_data\nffffffff81000000 T _text\n"
                                         "ffffffff81000000 T _stext\nffffffffc0002000 t late\t[mod]\n"
                                         "ffffffffc0001000 T early\t[mod]\nffffffff82000000 D jiffies\n"
                                         "x T broken\nffffffff82000000 T\n");
    ASSERT_EQ(symbols.size(), 6u);
    EXPECT_EQ(symbols[1].name, "_text"); // of several at one address the first stays first
    EXPECT_EQ(symbols[2].name, "_stext");
    EXPECT_FALSE(symbols[3].isCode);
    EXPECT_EQ(symbols[4].name, "early");
    EXPECT_EQ(symbols[4].module, "mod");
    EXPECT_EQ(symbols[5].address, 0xffffffffc0002000u);
    EXPECT_TRUE(HXParseKallsyms("0000000000000000 T _text\n0000000000000000 T f\n").empty());
}

} // namespace
