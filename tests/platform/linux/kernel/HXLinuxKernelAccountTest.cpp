#include "platform/linux/kernel/HXLinuxKernelAccount.h"

#include "platform/linux/kernel/HXKernelRecord.h"

#include <gtest/gtest.h>

#include <cstring>

namespace {

std::string kibibytes(uint64_t size) {
    return " " + std::to_string((size + 512) / 1024) + "\n"; // shares of zones are rounded
}

std::string nameOf(const mach_memory_info_record &site) {
    const uint64_t type = site.flags & VM_KERN_SITE_TYPE;
    if (type == VM_KERN_SITE_TAG) return "tag " + std::to_string(site.site);
    if (type == VM_KERN_SITE_COUNTER) return "count " + std::to_string(site.site);
    if (type == VM_KERN_SITE_KMOD)
        return site.site == HXKernelLoadTagForModule("a") ? "module a" : "module b";
    if (!(site.flags & VM_KERN_SITE_NAMED)) return "address " + std::to_string(site.site);
    const std::string name = site.name;
    const size_t module = name.find(" [");
    const uint64_t known = module == std::string::npos
                               ? HXKernelSiteForFunction(name, "")
                               : HXKernelSiteForFunction(name.substr(0, module), name.substr(module + 2, 1));
    return site.site == known || name == "vmalloc" ? name : "wrong number of " + name;
}

// "DIRTY NAME KIBIBYTES" of every zone, "NAME KIBIBYTES" of every site, with "h" before a hidden one.
std::string textOf(const HXKernelRecord &record) {
    std::string text;
    for (size_t i = 0; i < record.zones.size(); i++)
        text += std::to_string((HXKernelRecord::dirtySize(record.zones[i]) + 512) / 1024) + " " +
                record.zoneNames.at(i).mzn_name + kibibytes(record.zones[i].mzi_cur_size);
    for (const mach_memory_info_record &site : record.records) {
        text += (site.flags & VM_KERN_SITE_HIDE ? "h " : "") + nameOf(site) + kibibytes(site.size);
        const bool isCounter = (site.flags & VM_KERN_SITE_TYPE) == VM_KERN_SITE_COUNTER;
        EXPECT_EQ((site.flags & VM_KERN_SITE_WIRED) == 0, isCounter) << text;
    }
    return text;
}

TEST(HXLinuxKernelAccountTest, zonesAddUpToTheKernelsSums) {
    const std::string slabinfo = // 40 KiB, 24 KiB, 16 KiB, none
        "dentry     10  210  192  21 1 : tunables 0 0 0 : slabdata 10 10 0\n"
        "kmalloc-1k 12   48 1024   8 2 : tunables 0 0 0 : slabdata  3  3 0\n"
        "odd_cache   1   10   64  64 1 : tunables 0 0 0 : slabdata  4  4 0\n"
        "empty       0    0   64  64 1 : tunables 0 0 0 : slabdata  0  0 0\n";
    const struct {
        const char *title, *meminfo;
        bool hasSlabinfo, hasKinds;
        uint64_t kmallocKiB;
        const char *expected; // up to the counters
    } cases[] = {
        {"as sysfs says", "SReclaimable: 56 kB\nSUnreclaim: 24 kB\n", true, true, 24,
         "0 dentry 40\n24 kmalloc-1k 24\n0 odd_cache 16\n"},
        {"large: in no cache", "SReclaimable: 56 kB\nSUnreclaim: 100 kB\n", true, true, 100,
         "0 dentry 40\n24 kmalloc-1k 24\n0 odd_cache 16\n76 kmalloc-large 76\n"},
        {"the sums lag", "SReclaimable: 48 kB\nSUnreclaim: 20 kB\n", true, true, 24,
         "0 dentry 40\n24 kmalloc-1k 24\n0 odd_cache 16\n"},
        {"by name", "SReclaimable: 40 kB\nSUnreclaim: 40 kB\n", true, false, 24,
         "0 dentry 40\n24 kmalloc-1k 24\n16 odd_cache 16\n"},
        {"names mislead", "SReclaimable: 60 kB\nSUnreclaim: 20 kB\n", true, false, 24,
         "0 dentry 40\n12 kmalloc-1k 24\n8 odd_cache 16\n"},
        {"names say more", "SReclaimable: 10 kB\nSUnreclaim: 70 kB\n", true, false, 24,
         "30 dentry 40\n24 kmalloc-1k 24\n16 odd_cache 16\n"},
        {"no slabinfo", "SReclaimable: 56 kB\nSUnreclaim: 24 kB\n", false, true, 0,
         "24 slab 24\n0 reclaimable slab 56\n"},
    };
    for (const auto &c : cases) {
        HXMadeUpKernel kernel{{"proc/meminfo", c.meminfo}};
        if (c.hasSlabinfo) kernel.root.write("proc/slabinfo", slabinfo);
        for (const std::string cache : {"dentry", "kmalloc-1k", "odd_cache"})
            if (c.hasKinds)
                kernel.root.write("sys/kernel/slab/" + cache + "/reclaim_account",
                                  cache == "kmalloc-1k" ? "0\n" : "1\n");
        const std::string text = textOf(kernel.record());
        EXPECT_EQ(text.substr(0, text.find("count")), c.expected) << c.title;
        EXPECT_EQ(text.find("count 8 " + std::to_string(c.kmallocKiB)) != std::string::npos, c.hasSlabinfo)
            << c.title;
    }
}

TEST(HXLinuxKernelAccountTest, everyPageHasOneSite) {
    const std::string stacks = // 3 of 16 KiB, with their guards
        "0x1-0x2   20480 copy_process.part.34+0x2d6/0x1c40 pages=4 vmalloc N0=4\n"
        "0x1-0x2   20480 kernel_clone+0x94/0x3e0 pages=4 vmalloc N0=4\n"
        "0x1-0x2   20480 alloc_thread_stack_node+0x4/0x8 pages=4 vmalloc N0=4\n";
    const std::string modules = // 24 KiB
        "0x1-0x2 24576 execmem_vmap+0x33/0x90 pages=4 vmalloc N0=4\n"
        "0x1-0x2 12288 move_module+0x33/0x90 pages=2 vmalloc N0=2\n";
    const struct {
        const char *title;
        std::string areas;
        const char *modules, *meminfo, *expected;
    } cases[] = {
        {"4.14 and before: stacks are pages of their own, Percpu and the pages of vmalloc are not told",
         "0x1-0x2 20480 load_module+0x17f6/0x2910 pages=4 vmalloc\n"
         "0x1-0x2 8192 bpf_prog_alloc+0x3a/0xb0 pages=1 vmalloc\n"
         "0x1-0x2 12288 bpf_prog_alloc+0x99/0xb0 pages=2 vmalloc\n"
         "0x1-0x2 1048576 hpet_enable+0x30/0x2c0 phys=fed00000 ioremap\n",
         "a 16384 1\n", "KernelStack: 400 kB\nPageTables: 90 kB\nMlocked: 50 kB\n",
         "tag 8 400\nh tag 11 90\ntag 24 50\nmodule a 16\nbpf_prog_alloc 12\n"
         "count 0 1\ncount 2 568\ncount 6 28\n"},
        {"a stack is kept for the next task; what per-CPU space itself takes is no vmalloc's",
         stacks +
             "0x1-0x2 1048576 pcpu_get_vm_areas+0x0/0x1050 vmalloc\n"
             "0x1-0x2 8192 f+0x21/0x80 [b] pages=1 vmalloc\n0x1-0x2 8192 f+0x21/0x80 [c] pages=1 vmalloc\n"
             "0x1-0x2 8192 0xffffffffc0001234 pages=1 vmalloc\n0x1-0x2 8192 pages=1 vmalloc\n",
         "", "KernelStack: 32 kB\nPercpu: 700 kB\nSecPageTables: 10 kB\nVmallocUsed: 70 kB\n",
         "tag 8 32\nfree kernel stacks 16\ntag 9 700\nh tag 10 10\n"
         "f [b] 4\nf [c] 4\naddress 18446744072635814452 4\nvmalloc 4\ncount 0 1\ncount 2 774\ncount 6 70\n"},
        {"a task began while the files were read", stacks, "", "KernelStack: 64 kB\n",
         "tag 8 48\ncount 0 1\ncount 2 48\ncount 6 48\n"},
        {"the pool of zswap and zram", "", "", "Zswap: 30 kB\n", "tag 14 35\ncount 0 1\ncount 2 35\n"},
        {"modules, and the rest of what was set aside for them", modules, "a 8192 0\nb 12288 0\n", "",
         "module a 8\nmodule b 12\nmodule memory 4\ncount 0 1\ncount 2 24\ncount 6 24\n"},
        {"areas of modules under other names: not charged again", modules, "a 8192 0\nb 122880 0\n", "",
         "h module a 8\nh module b 120\nexecmem_vmap 16\nmove_module 8\ncount 0 1\ncount 2 24\ncount 6 24\n"},
        {"what the machine has lost", "", "", "HardwareCorrupted: 4 kB\nBalloon: 8 kB\n",
         "count 0 1\ncount 4 12\n"},
    };
    for (const auto &c : cases) {
        HXMadeUpKernel kernel{
            {"proc/vmallocinfo", c.areas}, {"proc/modules", c.modules}, {"proc/meminfo", c.meminfo}};
        if (std::string(c.meminfo).starts_with("Zswap"))
            kernel.root.write("sys/block/zram0/mm_stat", "9 8 5120 6\n");
        kernel.root.write("sys/block/sda/mm_stat", "9 8 5120 6\n");
        EXPECT_EQ(textOf(kernel.record()), c.expected) << c.title;
    }
}

TEST(HXLinuxKernelAccountTest, namesAreSafeAndCut) {
    const std::string longName(100, 'x');
    HXMadeUpKernel kernel{
        {"proc/slabinfo", "a\"\\\x01" + longName + " 1 1 1 1 1 : tunables 0 0 0 : slabdata 1 1 0\n"},
        {"proc/vmallocinfo", "0x1-0x2 8192 " + longName + "+0x1/0x2 [m] pages=1 vmalloc\n"},
        {"proc/zoneinfo", " present 250000\n present 1\n"}};
    const HXKernelRecord record = kernel.record();
    EXPECT_EQ(std::string(record.zoneNames.at(0).mzn_name, 80), "a'??" + longName.substr(0, 76));
    EXPECT_EQ(std::string(record.records.at(0).name, 80), longName.substr(0, 80));
    EXPECT_EQ(record.records.at(2).size, 250001 * 4096 - 1024u) << "reserved: what is not managed";
}

} // namespace
