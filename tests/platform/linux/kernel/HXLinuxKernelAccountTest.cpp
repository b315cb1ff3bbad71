#include "platform/linux/kernel/HXLinuxKernelAccount.h"

#include <gtest/gtest.h>

#include <cstring>
#include <map>
#include <string>

namespace {

constexpr uint64_t KiB = 1024;

// Accounts for the files of one kernel, and sums them up as the report does.
struct Account : HXLinuxKernelAccount {
    struct Files {
        std::string slabinfo, vmallocinfo, modules, meminfo;
        std::map<std::string, bool> kinds; // what sysfs says of a cache
        uint64_t zramSize = 0;
        uint64_t presentPages = 0;
    };

    explicit Account(const Files &files) {
        HXLinuxKernelReadings readings;
        readings.meminfo = HXParseKernelMeminfo("MemTotal: 1000000 kB\n" + files.meminfo).value();
        if (!files.slabinfo.empty()) readings.caches = HXParseSlabinfo(files.slabinfo);
        if (readings.caches)
            for (HXSlabCache &cache : *readings.caches)
                if (const auto kind = files.kinds.find(std::string(cache.name)); kind != files.kinds.end())
                    cache.reclaimable = kind->second;
        readings.areas = HXParseVmallocinfo(files.vmallocinfo);
        readings.modules = HXParseModules(files.modules);
        readings.zramSize = files.zramSize;
        readings.presentPages = files.presentPages;
        static_cast<HXLinuxKernelAccount &>(*this) = HXAccountForKernelMemory(readings);
    }

    // Dirty and reclaimable.
    std::pair<uint64_t, uint64_t> zonesSizes() const {
        uint64_t size = 0, dirty = 0;
        for (const mach_zone_info &zone : zones) {
            size += zone.mzi_cur_size;
            dirty += zone.mzi_collectable ? zone.mzi_count * zone.mzi_elem_size : zone.mzi_cur_size;
        }
        return {dirty, size - dirty};
    }
    // The sites that are charged to the kernel.
    uint64_t sitesDirtySize() const {
        uint64_t size = 0;
        for (const mach_memory_info_record &site : records)
            if ((site.flags & VM_KERN_SITE_WIRED) && !(site.flags & VM_KERN_SITE_HIDE) && site.site != 24)
                size += site.size;
        return size;
    }
    // The size of the site of that type and number; 0 when there is none.
    uint64_t siteSize(uint64_t type, uint64_t number, uint64_t flags) const {
        for (const mach_memory_info_record &site : records)
            if ((site.flags & ~VM_KERN_SITE_NAMED) == (type | flags) && site.site == number) return site.size;
        return 0;
    }
    uint64_t tagSize(uint64_t tag) const { return siteSize(VM_KERN_SITE_TAG, tag, VM_KERN_SITE_WIRED); }
    uint64_t functionSize(const char *function, const char *module = "") const {
        return siteSize(VM_KERN_SITE_KERNEL, HXKernelSiteForFunction(function, module), VM_KERN_SITE_WIRED);
    }
    uint64_t zoneSize(const std::string &name) const {
        for (size_t i = 0; i < zones.size(); i++)
            if (name == std::string(zoneNames[i].mzn_name, strnlen(zoneNames[i].mzn_name, 80)))
                return zones[i].mzi_cur_size;
        return 0;
    }
};

constexpr const char *kSlabinfo = // 40 KiB, 24 KiB, 16 KiB, none
    "dentry     10  210  192  21 1 : tunables 0 0 0 : slabdata 10 10 0\n"
    "kmalloc-1k 12   48 1024   8 2 : tunables 0 0 0 : slabdata  3  3 0\n"
    "odd_cache   1   10   64  64 1 : tunables 0 0 0 : slabdata  4  4 0\n"
    "empty       0    0   64  64 1 : tunables 0 0 0 : slabdata  0  0 0\n";

TEST(HXLinuxKernelAccountTest, zonesAddUpToTheKernelsSums) {
    const std::map<std::string, bool> kinds = {{"dentry", true}, {"kmalloc-1k", false}, {"odd_cache", true}};
    const struct {
        const char *title, *slabinfo, *meminfo;
        std::map<std::string, bool> kinds;
        uint64_t dirtyKiB, reclaimableKiB, largeKiB;
    } cases[] = {
        {"as sysfs says", kSlabinfo, "SReclaimable: 56 kB\nSUnreclaim: 24 kB\n", kinds, 24, 56, 0},
        {"large: in no cache", kSlabinfo, "SReclaimable: 56 kB\nSUnreclaim: 100 kB\n", kinds, 100, 56, 76},
        {"the sums lag", kSlabinfo, "SReclaimable: 48 kB\nSUnreclaim: 20 kB\n", kinds, 24, 56, 0},
        {"by name", kSlabinfo, "SReclaimable: 40 kB\nSUnreclaim: 40 kB\n", {}, 40, 40, 0},
        {"names mislead", kSlabinfo, "SReclaimable: 60 kB\nSUnreclaim: 20 kB\n", {}, 20, 60, 0},
        {"names say more", kSlabinfo, "SReclaimable: 10 kB\nSUnreclaim: 70 kB\n", {}, 70, 10, 0},
        {"no slabinfo", "", "SReclaimable: 56 kB\nSUnreclaim: 24 kB\n", {}, 24, 56, 0},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.title);
        const Account account({c.slabinfo, "", "", c.meminfo, c.kinds});
        ASSERT_EQ(account.zones.size(), account.zoneNames.size());
        EXPECT_NEAR(account.zonesSizes().first, c.dirtyKiB * KiB, 4);
        EXPECT_NEAR(account.zonesSizes().second, c.reclaimableKiB * KiB, 4);
        EXPECT_NEAR(account.zoneSize("kmalloc-large"), c.largeKiB * KiB, 4);
    }
}

TEST(HXLinuxKernelAccountTest, sitesOfAnOldKernelWithoutVmallocedStacks) {
    // 4.14 and before: stacks are pages of their own, Percpu and the pages of vmalloc are not told.
    const Account account({"",
                           "0x1-0x2   20480 load_module+0x17f6/0x2910 pages=4 vmalloc N0=4\n"
                           "0x1-0x2    8192 bpf_prog_alloc+0x3a/0xb0 pages=1 vmalloc N0=1\n"
                           "0x1-0x2   12288 bpf_prog_alloc+0x99/0xb0 pages=2 vmalloc N0=2\n"
                           "0x1-0x2 1048576 hpet_enable+0x30/0x2c0 phys=fed00000 ioremap\n",
                           "ext4 16384 1 - Live 0xffffffffc0000000\n",
                           "KernelStack: 400 kB\nPageTables: 90 kB\nMlocked: 50 kB\nVmallocUsed: 0 kB\n",
                           {}});
    EXPECT_EQ(account.tagSize(8), 400 * KiB);
    EXPECT_EQ(account.functionSize("bpf_prog_alloc"), 12 * KiB);
    EXPECT_EQ(account.siteSize(VM_KERN_SITE_KMOD, HXKernelLoadTagForModule("ext4"), VM_KERN_SITE_WIRED),
              16 * KiB);
    EXPECT_EQ(account.functionSize("load_module"), 0u);
    EXPECT_EQ(account.functionSize("hpet_enable"), 0u);
    // Page tables and locked user memory are shown but not charged.
    EXPECT_EQ(account.siteSize(VM_KERN_SITE_TAG, 11, VM_KERN_SITE_WIRED | VM_KERN_SITE_HIDE), 90 * KiB);
    EXPECT_EQ(account.tagSize(24), 50 * KiB);
    EXPECT_EQ(account.sitesDirtySize(), (400 + 16 + 12) * KiB);
}

// 4.19 to 6.x: three stacks of 16 KiB, one of them kept for the next task; per-CPU space and its bookkeeping.
constexpr const char *kRecentAreas =
    "0x1-0x2   20480 copy_process.part.34+0x2d6/0x1c40 pages=4 vmalloc N0=4\n"
    "0x1-0x2   20480 kernel_clone+0x94/0x3e0 pages=4 vmalloc N0=4\n"
    "0x1-0x2   20480 alloc_thread_stack_node+0x4/0x8 pages=4 vmalloc N0=4\n"
    "0x1-0x2 1048576 pcpu_get_vm_areas+0x0/0x1050 vmalloc\n"
    "0x1-0x2 2101248 pcpu_create_chunk+0x217/0x230 pages=512 vmalloc N0=512\n"
    "0x1-0x2    8192 f+0x21/0x80 [a] pages=1 vmalloc N0=1\n0x1-0x2    8192 f+0x21/0x80 [b] pages=1 vmalloc\n"
    "0x1-0x2    8192 0xffffffffc0001234 pages=1 vmalloc N0=1\n"
    "0x1-0x2   69632 irq_init_percpu_irqstack+0xca/0x100 vmap\n";

TEST(HXLinuxKernelAccountTest, vmallocedStacksAreCountedOnce) {
    const std::string meminfo = "Percpu: 700 kB\nZswap: 30 kB\nSecPageTables: 10 kB\n";
    static constexpr uint64_t otherKiB = 2048 + 4 + 4 + 4 + 700 + 30 + 5;
    static constexpr struct {
        uint64_t usedKiB, tagKiB, freeKiB;
    } cases[] = {
        {32, 32, 16}, {48, 48, 0}, {64, 48, 0} /* a task began while the files were read */, {0, 0, 48}};
    for (const auto &c : cases) {
        SCOPED_TRACE(c.usedKiB);
        const std::string stacks = "KernelStack: " + std::to_string(c.usedKiB) + " kB\n";
        const Account account({"", kRecentAreas, "", meminfo + stacks, {}, 5 * KiB});
        EXPECT_EQ(account.tagSize(8), c.tagKiB * KiB);
        EXPECT_EQ(account.functionSize("free kernel stacks"), c.freeKiB * KiB);
        EXPECT_EQ(account.tagSize(9), 700 * KiB);
        EXPECT_EQ(account.tagSize(14), 35 * KiB);
        EXPECT_EQ(account.functionSize("f", "a"), 4 * KiB);
        EXPECT_EQ(account.siteSize(VM_KERN_SITE_KERNEL, 0xffffffffc0001234, VM_KERN_SITE_WIRED), 4 * KiB);
        EXPECT_EQ(account.sitesDirtySize(), (48 + otherKiB) * KiB);
    }
}

TEST(HXLinuxKernelAccountTest, modulesAreCountedOnce) {
    const std::string execmem = // 6.10 and later: 24 KiB
        "0x1-0x2 24576 execmem_vmap+0x33/0x90 pages=4 vmalloc N0=4\n"
        "0x1-0x2 12288 move_module+0x33/0x90 pages=2 vmalloc N0=2\n"
        "0x1-0x2  8192 f+0x33/0x90 pages=1 vmalloc N0=1\n";
    const auto kmodSize = [](const Account &account, const char *name, uint64_t flags) {
        return account.siteSize(VM_KERN_SITE_KMOD, HXKernelLoadTagForModule(name),
                                VM_KERN_SITE_WIRED | flags);
    };
    const Account found({"", execmem, "a 8192 0 - Live 0x0\nb 12288 0 - Live 0x0\n", "", {}});
    EXPECT_EQ(kmodSize(found, "a", 0), 8 * KiB);
    EXPECT_EQ(kmodSize(found, "b", 0), 12 * KiB);
    EXPECT_EQ(found.functionSize("module memory"), 4 * KiB); // the rest of what was set aside for them
    EXPECT_EQ(found.sitesDirtySize(), 28 * KiB);

    // Areas under other names than expected stay where they are, and the modules are not charged again.
    const Account unknown({"", execmem, "a 8192 0 - Live 0x0\nb 122880 0 - Live 0x0\n", "", {}});
    EXPECT_EQ(kmodSize(unknown, "b", VM_KERN_SITE_HIDE), 120 * KiB);
    EXPECT_EQ(unknown.functionSize("execmem_vmap"), 16 * KiB);
    EXPECT_EQ(unknown.sitesDirtySize(), 28 * KiB);
}

TEST(HXLinuxKernelAccountTest, namesAreSafeAndCutAndCountersTold) {
    const std::string longName(100, 'x');
    const std::string slabinfo = "a\"\\\x01" + longName + " 1 1 1 1 1 : tunables 0 0 0 : slabdata 1 1 0\n";
    const std::string areas = "0x1-0x2 8192 " + longName + "+0x1/0x2 [m] pages=1 vmalloc\n";
    const std::string meminfo = "SReclaimable: 6 kB\nSUnreclaim: 4 kB\nHardwareCorrupted: 4 kB\n";
    const Account account({slabinfo, areas, "", meminfo, {}, 0, 250001});
    ASSERT_FALSE(account.zoneNames.empty());
    EXPECT_EQ(std::string(account.zoneNames[0].mzn_name, 80), "a'??" + longName.substr(0, 76));
    std::map<uint64_t, uint64_t> counters;
    for (const mach_memory_info_record &record : account.records) {
        if (record.flags == VM_KERN_SITE_COUNTER) counters[record.site] = record.mapped;
        EXPECT_EQ(std::string(record.name, strnlen(record.name, 80)),
                  record.flags & VM_KERN_SITE_NAMED ? longName.substr(0, 80) : "");
    }
    const std::map<uint64_t, uint64_t> expected = {{0, 1000000 * KiB}, {1, 4 * KiB}, {2, 8 * KiB},
                                                   {4, 4 * KiB},       {6, 4 * KiB}, {7, 10 * KiB}};
    EXPECT_EQ(counters, expected);
}

} // namespace
