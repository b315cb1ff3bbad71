#include "platform/linux/kernel/HXLinuxKernelAccount.h"

#include "platform/linux/kernel/HXKernelRecord.h"

#include <gtest/gtest.h>

#include <cstring>
#include <map>

namespace {

constexpr uint64_t KiB = 1024;

HXKernelRecord recordOf(HXMadeUpKernel::Files files) {
    return HXMadeUpKernel(files).record();
}

TEST(HXLinuxKernelAccountTest, zonesAddUpToTheKernelsSums) {
    const std::string slabinfo = // 40 KiB, 24 KiB, 16 KiB, none
        "dentry     10  210  192  21 1 : tunables 0 0 0 : slabdata 10 10 0\n"
        "kmalloc-1k 12   48 1024   8 2 : tunables 0 0 0 : slabdata  3  3 0\n"
        "odd_cache   1   10   64  64 1 : tunables 0 0 0 : slabdata  4  4 0\n"
        "empty       0    0   64  64 1 : tunables 0 0 0 : slabdata  0  0 0\n";
    const struct {
        const char *title;
        bool hasSlabinfo, hasKinds;
        const char *meminfo;
        uint64_t dirtyKiB, reclaimableKiB, kmallocKiB;
        size_t zoneCount;
    } cases[] = {
        {"as sysfs says", true, true, "SReclaimable: 56 kB\nSUnreclaim: 24 kB\n", 24, 56, 24, 3},
        {"large: in no cache", true, true, "SReclaimable: 56 kB\nSUnreclaim: 100 kB\n", 100, 56, 100, 4},
        {"the sums lag", true, true, "SReclaimable: 48 kB\nSUnreclaim: 20 kB\n", 24, 56, 24, 3},
        {"by name", true, false, "SReclaimable: 40 kB\nSUnreclaim: 40 kB\n", 40, 40, 24, 3},
        {"names mislead", true, false, "SReclaimable: 60 kB\nSUnreclaim: 20 kB\n", 20, 60, 24, 3},
        {"names say more", true, false, "SReclaimable: 10 kB\nSUnreclaim: 70 kB\n", 70, 10, 24, 3},
        {"no slabinfo", false, true, "SReclaimable: 56 kB\nSUnreclaim: 24 kB\n", 24, 56, 0, 2},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.title);
        HXMadeUpKernel kernel{{"proc/meminfo", c.meminfo}};
        if (c.hasSlabinfo) kernel.root.write("proc/slabinfo", slabinfo);
        for (const char *cache : {"dentry", "kmalloc-1k", "odd_cache"})
            if (c.hasKinds)
                kernel.root.write(std::string("sys/kernel/slab/") + cache + "/reclaim_account",
                                  cache[0] == 'k' ? "0\n" : "1\n");
        const HXKernelRecord record = kernel.record();
        ASSERT_EQ(record.zones.size(), record.zoneNames.size());
        EXPECT_EQ(record.zones.size(), c.zoneCount);
        EXPECT_NEAR(record.zonesDirtySize(), c.dirtyKiB * KiB, 4); // rounding of shares
        EXPECT_EQ(record.zonesSize(), (c.dirtyKiB + c.reclaimableKiB) * KiB);
        const mach_memory_info_record &last = record.records.back(); // the counter of kmalloc, if any
        EXPECT_NEAR(last.site == 8 ? last.mapped : 0, c.kmallocKiB * KiB, 4);
    }
}

TEST(HXLinuxKernelAccountTest, sitesOfAnOldKernelWithoutVmallocedStacks) {
    // 4.14 and before: stacks are pages of their own, Percpu and the pages of vmalloc are not told.
    const HXKernelRecord record = recordOf(
        {{"proc/vmallocinfo", "0x1-0x2   20480 load_module+0x17f6/0x2910 pages=4 vmalloc N0=4\n"
                              "0x1-0x2    8192 bpf_prog_alloc+0x3a/0xb0 pages=1 vmalloc N0=1\n"
                              "0x1-0x2   12288 bpf_prog_alloc+0x99/0xb0 pages=2 vmalloc N0=2\n"
                              "0x1-0x2 1048576 hpet_enable+0x30/0x2c0 phys=fed00000 ioremap\n"},
         {"proc/modules", "ext4 16384 1 - Live 0xffffffffc0000000\n"},
         {"proc/meminfo", "KernelStack: 400 kB\nPageTables: 90 kB\nMlocked: 50 kB\nVmallocUsed: 0 kB\n"}});
    EXPECT_EQ(record.tagSize(8), 400 * KiB);
    EXPECT_EQ(record.functionSize("bpf_prog_alloc"), 12 * KiB);
    EXPECT_EQ(record.moduleSize("ext4"), 16 * KiB);
    EXPECT_EQ(record.functionSize("load_module"), 0u);
    // Page tables and locked user memory are shown but not charged.
    EXPECT_EQ(record.siteSize(VM_KERN_SITE_TAG | VM_KERN_SITE_HIDE, 11), 90 * KiB);
    EXPECT_EQ(record.tagSize(24), 50 * KiB);
    EXPECT_EQ(record.sitesDirtySize(), (400 + 16 + 12) * KiB);
}

// 4.19 to 6.x: three stacks of 16 KiB, one of them kept for the next task; per-CPU space and its bookkeeping.
TEST(HXLinuxKernelAccountTest, vmallocedStacksAreCountedOnce) {
    const std::string areas =
        "0x1-0x2   20480 copy_process.part.34+0x2d6/0x1c40 pages=4 vmalloc N0=4\n"
        "0x1-0x2   20480 kernel_clone+0x94/0x3e0 pages=4 vmalloc N0=4\n"
        "0x1-0x2   20480 alloc_thread_stack_node+0x4/0x8 pages=4 vmalloc N0=4\n"
        "0x1-0x2 1048576 pcpu_get_vm_areas+0x0/0x1050 vmalloc\n"
        "0x1-0x2 2101248 pcpu_create_chunk+0x217/0x230 pages=512 vmalloc N0=512\n"
        "0x1-0x2    8192 f+0x21/0x80 [a] pages=1 vmalloc\n0x1-0x2    8192 f+0x21/0x80 [b] pages=1 vmalloc\n"
        "0x1-0x2    8192 0xffffffffc0001234 pages=1 vmalloc N0=1\n";
    constexpr uint64_t otherKiB = 2048 + 4 + 4 + 4 + 700 + 30 + 5;
    constexpr struct {
        uint64_t usedKiB, tagKiB, freeKiB;
    } cases[] = {
        {32, 32, 16}, {48, 48, 0}, {64, 48, 0} /* a task began while the files were read */, {0, 0, 48}};
    for (const auto &c : cases) {
        SCOPED_TRACE(c.usedKiB);
        const std::string meminfo =
            "Percpu: 700 kB\nZswap: 30 kB\nSecPageTables: 10 kB\nKernelStack: " + std::to_string(c.usedKiB) +
            " kB\n";
        const HXKernelRecord record = recordOf({{"proc/vmallocinfo", areas},
                                                {"proc/meminfo", meminfo},
                                                {"sys/block/zram0/mm_stat", "9 8 5120 6\n"},
                                                {"sys/block/sda/mm_stat", "9 8 5120 6\n"}});
        EXPECT_EQ(record.tagSize(8), c.tagKiB * KiB);
        EXPECT_EQ(record.functionSize("free kernel stacks"), c.freeKiB * KiB);
        EXPECT_EQ(record.tagSize(9), 700 * KiB);
        EXPECT_EQ(record.tagSize(14), 35 * KiB);
        EXPECT_EQ(record.functionSize("f", "a"), 4 * KiB);
        EXPECT_EQ(record.siteSize(VM_KERN_SITE_KERNEL, 0xffffffffc0001234), 4 * KiB);
        EXPECT_EQ(record.sitesDirtySize(), (48 + otherKiB) * KiB);
    }
}

TEST(HXLinuxKernelAccountTest, modulesAreCountedOnce) {
    const std::string execmem = // 6.10 and later: 24 KiB
        "0x1-0x2 24576 execmem_vmap+0x33/0x90 pages=4 vmalloc N0=4\n"
        "0x1-0x2 12288 move_module+0x33/0x90 pages=2 vmalloc N0=2\n"
        "0x1-0x2  8192 f+0x33/0x90 pages=1 vmalloc N0=1\n";
    const HXKernelRecord found =
        recordOf({{"proc/vmallocinfo", execmem}, {"proc/modules", "a 8192 0\nb 12288 0\n"}});
    EXPECT_EQ(found.moduleSize("a"), 8 * KiB);
    EXPECT_EQ(found.moduleSize("b"), 12 * KiB);
    EXPECT_EQ(found.functionSize("module memory"), 4 * KiB); // the rest of what was set aside for them
    EXPECT_EQ(found.sitesDirtySize(), 28 * KiB);
    // Areas under other names than expected stay where they are, and the modules are not charged again.
    const HXKernelRecord unknown =
        recordOf({{"proc/vmallocinfo", execmem}, {"proc/modules", "a 8192 0\nb 122880 0\n"}});
    EXPECT_EQ(unknown.moduleSize("b", VM_KERN_SITE_HIDE), 120 * KiB);
    EXPECT_EQ(unknown.functionSize("execmem_vmap"), 16 * KiB);
    EXPECT_EQ(unknown.sitesDirtySize(), 28 * KiB);
}

TEST(HXLinuxKernelAccountTest, namesAreSafeAndCutAndCountersTold) {
    const std::string longName(100, 'x');
    const HXKernelRecord record = recordOf(
        {{"proc/slabinfo", "a\"\\\x01" + longName + " 1 1 1 1 1 : tunables 0 0 0 : slabdata 1 1 0\n"},
         {"proc/vmallocinfo", "0x1-0x2 8192 " + longName + "+0x1/0x2 [m] pages=1 vmalloc\n"},
         {"proc/zoneinfo", " present 250000\n present 1\n"},
         {"proc/meminfo", "SReclaimable: 6 kB\nSUnreclaim: 4 kB\nHardwareCorrupted: 4 kB\n"}});
    ASSERT_FALSE(record.zoneNames.empty());
    EXPECT_EQ(std::string(record.zoneNames[0].mzn_name, 80), "a'??" + longName.substr(0, 76));
    std::map<uint64_t, uint64_t> counters;
    for (const mach_memory_info_record &site : record.records) {
        if (site.flags == VM_KERN_SITE_COUNTER) counters[site.site] = site.mapped;
        EXPECT_EQ(std::string(site.name, strnlen(site.name, 80)),
                  site.flags & VM_KERN_SITE_NAMED ? longName.substr(0, 80) : "");
    }
    const std::map<uint64_t, uint64_t> expected = {{0, 1000000 * KiB}, {1, 4 * KiB}, {2, 8 * KiB},
                                                   {4, 4 * KiB},       {6, 4 * KiB}, {7, 10 * KiB}};
    EXPECT_EQ(counters, expected);
}

} // namespace
