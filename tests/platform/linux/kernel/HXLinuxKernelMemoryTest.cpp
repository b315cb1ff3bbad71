#include "platform/linux/kernel/HXLinuxKernelMemory.h"

#include "platform/linux/kernel/HXKernelRecord.h"

#include <gtest/gtest.h>

#include <unistd.h>

namespace {

TEST(HXLinuxKernelMemoryTest, sysfsCountsForMoreThanNames) {
    HXMadeUpKernel kernel{{"proc/slabinfo", "odd_inode_cache 1 1 1 1 1 : tunables 0 0 0 : slabdata 2 2 0\n"
                                            "odd 1 1 1 1 1 : tunables 0 0 0 : slabdata 1 1 0\n"
                                            "odd/../odd 1 1 1 1 1 : tunables 0 0 0 : slabdata 1 1 0\n"
                                            ". 1 1 1 1 1 : tunables 0 0 0 : slabdata 1 1 0\n"},
                          {"sys/kernel/slab/reclaim_account", "1\n"},
                          {"sys/kernel/slab/:0001/reclaim_account", "0\n"},
                          {"sys/kernel/slab/odd/reclaim_account", "1\n"}};
    kernel.root.link("sys/kernel/slab/odd_inode_cache", ":0001");
    const HXKernelRecord record = kernel.record();
    ASSERT_EQ(record.zones.size(), 4u);
    EXPECT_STREQ(record.zoneNames[0].mzn_name, "odd_inode_cache");
    for (size_t i = 0; i < record.zones.size(); i++)
        EXPECT_EQ(record.zones[i].mzi_collectable, i == 1 ? 1u : 0u) << i;
}

TEST(HXLinuxKernelMemoryTest, takesBackWhatItHandedOut) {
    HXMadeUpKernel kernel{{"proc/modules", "ext4 4096 1 - Live 0x0\n\"x 0 0 - Live 0x0\n"},
                          {"proc/meminfo", "SUnreclaim: 4 kB\n"}};
    const auto modules = kernel.memory.OSKextCopyLoadedKextInfo();
    ASSERT_EQ(modules.size(), 2u);
    EXPECT_EQ(modules[0].OSBundleLoadTag, HXKernelLoadTagForModule("ext4"));
    EXPECT_EQ(modules[1].CFBundleIdentifier, "'x");
    mach_zone_name *names = nullptr;
    mach_zone_info *zones = nullptr;
    mach_memory_info_record *sites = nullptr;
    uint32_t nameCount = 0, count = 0;
    kernel.memory.mach_memory_info(0, &names, &nameCount, &zones, &count, &sites, &count);
    ASSERT_EQ(nameCount, 1u);
    EXPECT_EQ(kernel.memory.vm_deallocate(0, names, 1), KERN_INVALID_ARGUMENT);
    EXPECT_EQ(kernel.memory.vm_deallocate(0, names, sizeof *names), KERN_SUCCESS);
    EXPECT_EQ(kernel.memory.vm_deallocate(0, names, sizeof *names), KERN_INVALID_ADDRESS);
    EXPECT_EQ(kernel.memory.vm_deallocate(0, nullptr, 1), KERN_SUCCESS);
    EXPECT_EQ(kernel.memory.vm_deallocate(0, names, 0), KERN_SUCCESS);
}

TEST(HXLinuxKernelMemoryTest, missingFilesAreNoErrorButMissingRightsAndFiguresAre) {
    HXMadeUpKernel kernel{{"proc/meminfo", "SReclaimable: 4 kB\nSUnreclaim: 8 kB\n"}};
    EXPECT_EQ(kernel.record().error, KERN_SUCCESS);
    EXPECT_EQ(kernel.record().zones.size(), 2u); // from meminfo alone
    EXPECT_TRUE(kernel.memory.OSKextCopyLoadedKextInfo().empty());
    const uid_t user = geteuid();
    constexpr uid_t nobody = 65534;
    for (const char *denied : {"proc/slabinfo", "proc/vmallocinfo"}) {
        kernel.root.write(denied, "");
        std::filesystem::permissions(kernel.root / denied, std::filesystem::perms::none);
        ASSERT_EQ(seteuid(user == 0 ? nobody : user), 0);
        EXPECT_EQ(kernel.record().error, KERN_NO_ACCESS) << denied;
        ASSERT_EQ(seteuid(user), 0);
        kernel.root.remove(denied);
    }
    kernel.root.write("proc/meminfo", "MemTotal: 1000 kB\nSReclaimable: 4 kB\nKernelStack: 16 kB\n");
    EXPECT_EQ(kernel.record().error, KERN_FAILURE);
    kernel.root.remove("proc/meminfo");
    EXPECT_EQ(kernel.record().error, KERN_FAILURE);
}

TEST(HXLinuxKernelMemoryTest, symbolsAndSources) {
    HXMadeUpKernel kernel{
        {"proc/kallsyms", "0000000000000000 A fixed_percpu_data\nx T broken\nffffffff82000000 T\n"
                          "ffffffffc0000000 t call\t[mod]\nffffffff81000000 T first\n"
                          "ffffffff81000000 T alias\nffffffff81000100 w second\nffffffff81000200 D data\n"},
        {"proc/allocinfo", " 10 1 mm/a.c:1 func:first \n 30 1 mm/a.c:3 func:first accurate:no\n"
                           " 20 1 mm/a.c:2 func:first\n 1 1 drivers/mod.c:7 [mod] func:call\n"}};
    const std::unique_ptr<RVSymbolicator> symbolicator(
        kernel.memory.RVSymbolicatorCreateWithMachKernelFlagsAndNotification(0, nullptr));
    const struct {
        uint64_t address;
        const char *name, *source; // null: none
        int32_t line;
    } cases[] = {
        {0xffffffff80ffffff, nullptr, nullptr, 0},
        {0xffffffff810000ff, "first", "mm/a.c", 3},
        {0xffffffff81000100, "second", nullptr, 0},
        {0xffffffff81000200, nullptr, nullptr, 0},
        {0xffffffffc003ffff, "call", "drivers/mod.c", 7},
        {0xffffffffc0040000, nullptr, nullptr, 0},                             // longer than any function
        {HXKernelSiteForFunction("call", "mod"), nullptr, "drivers/mod.c", 7}, // known by name alone
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.address);
        const auto at = symbolicator.get();
        EXPECT_STREQ(kernel.memory.RVSymbolicatorGetSymbolWithAddressAtTime(at, c.address, 0).name, c.name);
        const auto source = kernel.memory.RVSymbolicatorGetSourceInfoWithAddressAtTime(at, c.address, kRVNow);
        EXPECT_EQ(source.isNull, c.source == nullptr);
        EXPECT_STREQ(source.path, c.source);
        EXPECT_EQ(source.lineNumber, c.line);
    }
}

} // namespace
