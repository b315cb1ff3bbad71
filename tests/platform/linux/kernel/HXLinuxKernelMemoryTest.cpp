#include "platform/linux/kernel/HXLinuxKernelMemory.h"
#include "platform/linux/kernel/HXLinuxKernelAccount.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <unistd.h>

namespace {

// A made-up /proc and /sys in a directory of its own.
class HXLinuxKernelMemoryTest : public testing::Test {
  protected:
    void SetUp() override {
        std::string path = testing::TempDir() + "heft-kernel-XXXXXX";
        ASSERT_NE(mkdtemp(path.data()), nullptr);
        root = path;
        memory.emplace(path + "/proc", path + "/sys", 4096u);
        std::filesystem::permissions(root, std::filesystem::perms(0755)); // for the test of denied files
        write("proc/meminfo",
              "MemTotal: 1000 kB\nSReclaimable: 4 kB\nSUnreclaim: 8 kB\nKernelStack: 16 kB\n");
        write("proc/slabinfo", "misleading_inode_cache 1 1 1 1 1 : tunables 0 0 0 : slabdata 2 2 0\n"
                               "misleading 1 1 1 1 1 : tunables 0 0 0 : slabdata 1 1 0\n"
                               "../../../proc 1 1 1 1 1 : tunables 0 0 0 : slabdata 0 0 0\n");
        write("proc/vmallocinfo", "0x1-0x2 8192 load_module+0x1/0x2 pages=1 vmalloc\n");
        write("proc/modules", "ext4 4096 1 - Live 0x0\n\"x 0 0 - Live 0x0\n");
        write("sys/kernel/slab/:0001/reclaim_account", "0\n");
        std::filesystem::create_directory_symlink(":0001", root / "sys/kernel/slab/misleading_inode_cache");
        write("sys/kernel/slab/misleading/reclaim_account", "1\n");
        write("sys/block/zram0/mm_stat", "9 8 4096 6 5\n");
        write("sys/block/sda/mm_stat", "9 8 4096 6 5\n");
    }
    void TearDown() override { std::filesystem::remove_all(root); }

    void write(const std::string &path, const std::string &text) {
        std::filesystem::create_directories((root / path).parent_path());
        std::ofstream(root / path) << text;
    }
    kern_return_t read() {
        return memory->mach_memory_info(0, &names, &nameCount, &zones, &zoneCount, &records, &recordCount);
    }
    uint64_t siteSize(uint64_t site) const {
        for (uint32_t i = 0; i < recordCount; i++)
            if (records[i].site == site && (records[i].flags & VM_KERN_SITE_WIRED)) return records[i].size;
        return 0;
    }

    std::filesystem::path root;
    std::optional<HXLinuxKernelMemory> memory;
    mach_zone_name *names = nullptr;
    mach_zone_info *zones = nullptr;
    mach_memory_info_record *records = nullptr;
    uint32_t nameCount = 0, zoneCount = 0, recordCount = 0;
};

TEST_F(HXLinuxKernelMemoryTest, whatTheFilesSayIsHandedOutAndTakenBack) {
    ASSERT_EQ(read(), KERN_SUCCESS);
    ASSERT_EQ(zoneCount, 2u);
    EXPECT_EQ(nameCount, 2u);
    EXPECT_STREQ(names[0].mzn_name, "misleading_inode_cache");
    EXPECT_EQ(zones[0].mzi_collectable, 0u); // sysfs counts for more than the name
    EXPECT_EQ(zones[1].mzi_collectable, 1u);
    EXPECT_EQ(siteSize(8), 16384u);
    EXPECT_EQ(siteSize(14), 4096u); // of the zram device alone
    const auto modules = memory->OSKextCopyLoadedKextInfo();
    ASSERT_EQ(modules.size(), 2u);
    EXPECT_EQ(siteSize(modules[0].OSBundleLoadTag), 4096u);
    EXPECT_EQ(modules[1].CFBundleIdentifier, "'x");

    EXPECT_EQ(memory->vm_deallocate(0, names, 1), KERN_INVALID_ARGUMENT);
    EXPECT_EQ(memory->vm_deallocate(0, names, nameCount * sizeof *names), KERN_SUCCESS);
    EXPECT_EQ(memory->vm_deallocate(0, zones, zoneCount * sizeof *zones), KERN_SUCCESS);
    EXPECT_EQ(memory->vm_deallocate(0, records, recordCount * sizeof *records), KERN_SUCCESS);
    EXPECT_EQ(memory->vm_deallocate(0, this, 1), KERN_INVALID_ADDRESS);
}

TEST_F(HXLinuxKernelMemoryTest, missingFilesAreNoErrorButMissingRightsAre) {
    std::filesystem::remove_all(root / "sys");
    for (const char *missing : {"proc/slabinfo", "proc/vmallocinfo", "proc/modules"})
        std::filesystem::remove(root / missing);
    ASSERT_EQ(read(), KERN_SUCCESS);
    EXPECT_EQ(zoneCount, 2u); // from meminfo alone
    EXPECT_TRUE(memory->OSKextCopyLoadedKextInfo().empty());
    std::filesystem::remove(root / "proc/meminfo");
    EXPECT_EQ(read(), KERN_FAILURE);

    const uid_t user = geteuid();
    constexpr uid_t nobody = 65534;
    for (const char *denied : {"proc/slabinfo", "proc/vmallocinfo"}) {
        write(denied, "");
        std::filesystem::permissions(root / denied, std::filesystem::perms::none);
        ASSERT_EQ(seteuid(user == 0 ? nobody : user), 0);
        EXPECT_EQ(read(), KERN_NO_ACCESS) << denied;
        ASSERT_EQ(seteuid(user), 0);
        std::filesystem::remove(root / denied);
    }
}

TEST_F(HXLinuxKernelMemoryTest, symbolsAndSources) {
    write("proc/kallsyms", "0000000000000000 A fixed_percpu_data\nx T broken\nffffffff82000000 T\n"
                           "ffffffffc0000000 t call\t[mod]\nffffffff81000000 T first\n"
                           "ffffffff81000000 T alias\nffffffff81000100 t second\nffffffff81000200 D data\n");
    write("proc/allocinfo", "allocinfo - version: 1.0\n#     <size>  <calls> <tag info>\n"
                            " 99 9 nowhere func:first\n 99 9 a.c:1 first\n 10 1 mm/a.c:1 func:first \n"
                            " 30 1 mm/a.c:3 func:first accurate:no\n 20 1 mm/a.c:2 func:first\n"
                            " 1 1 drivers/mod.c:7 [mod] func:call\n");
    RVSymbolicator *symbolicator = memory->RVSymbolicatorCreateWithMachKernelFlagsAndNotification(0, nullptr);
    const struct {
        uint64_t address;
        const char *name, *source; // null: none
        int32_t line;
    } cases[] = {
        {0xffffffff80ffffff, nullptr, nullptr, 0},
        {0xffffffff810000ff, "first", "mm/a.c", 3},
        {0xffffffff81000100, "second", nullptr, 0},
        {0xffffffff81000200, nullptr, nullptr, 0},
        {0xffffffffc0000010, "call", "drivers/mod.c", 7},
        {HXKernelSiteForFunction("call", "mod"), nullptr, "drivers/mod.c", 7}, // known by name alone
        {0xffffffffffffffff, nullptr, nullptr, 0},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.address);
        EXPECT_STREQ(memory->RVSymbolicatorGetSymbolWithAddressAtTime(symbolicator, c.address, kRVNow).name,
                     c.name);
        const auto source =
            memory->RVSymbolicatorGetSourceInfoWithAddressAtTime(symbolicator, c.address, kRVNow);
        EXPECT_EQ(source.isNull, c.source == nullptr);
        EXPECT_STREQ(source.path, c.source);
        EXPECT_EQ(source.lineNumber, c.line);
    }
    memory->RVRelease(symbolicator);
    memory->RVRelease(nullptr);
}

} // namespace
