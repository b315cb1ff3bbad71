// The running kernel's record against what the kernel says of itself elsewhere.
#include "platform/linux/kernel/HXKernelRecord.h"
#include "platform/linux/procfs/HXProcFile.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <fcntl.h>
#include <filesystem>
#include <set>

namespace {

std::string textOf(const std::string &path) {
    return HXReadText(AT_FDCWD, path.c_str()).value_or("");
}

double deviation(uint64_t measured, uint64_t expected) {
    return std::abs(static_cast<double>(measured) - static_cast<double>(expected)) /
           static_cast<double>(expected);
}

// What the wired sites should add up to: pages of vmalloc as the kernel's own counter has them (VmallocUsed,
// since 5.3), not as vmallocinfo adds up.
uint64_t sitesSum(const HXKernelMeminfo &meminfo) {
    const std::string areas = textOf("/proc/vmallocinfo");
    uint64_t size = *meminfo.vmallocUsedSize + *meminfo.perCpuSize + meminfo.zswapSize.value_or(0);
    if (areas.find(" kernel_clone+0x") == std::string::npos &&
        areas.find(" copy_process") == std::string::npos)
        size += *meminfo.kernelStackSize; // they are not vmalloc's
    if (std::filesystem::exists("/sys/block"))
        for (const auto &device : std::filesystem::directory_iterator("/sys/block"))
            size += HXParseZramUsedSize(textOf(device.path() / "mm_stat")).value_or(0);
    return size;
}

TEST(HXLinuxKernelMemoryLiveRootTest, zonesAndSitesAgreeWithTheKernelsSums) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: slabinfo and vmallocinfo are root's alone";
    if (HXParseKernelMeminfo(textOf("/proc/meminfo")).value().vmallocUsedSize.value_or(0) == 0)
        GTEST_SKIP() << "needs a kernel that counts VmallocUsed";
    HXLinuxKernelMemory memory("/proc", "/sys", static_cast<uint32_t>(sysconf(_SC_PAGESIZE)));
    // Other processes come and go meanwhile, and the kernel's sums lag: the best of many readings counts.
    constexpr double tolerance = 0.02;
    double zonesDirty = 1, zonesReclaimable = 1, sites = 1;
    for (int attempt = 0; attempt < 200 && std::max({zonesDirty, zonesReclaimable, sites}) >= tolerance;
         attempt++) {
        // The kernel adds its counts per CPU up now and then; reading this file makes it do so at once.
        textOf("/proc/sys/vm/stat_refresh");
        const HXKernelRecord record(memory);
        ASSERT_EQ(record.error, KERN_SUCCESS);
        uint64_t size = 0, dirtySize = 0, wiredSize = 0;
        for (const mach_zone_info &zone : record.zones) {
            size += zone.mzi_cur_size;
            dirtySize += HXKernelRecord::dirtySize(zone);
        }
        std::set<std::pair<uint64_t, uint64_t>> seen;
        for (const mach_memory_info_record &site : record.records) {
            EXPECT_TRUE(seen.insert({site.flags & VM_KERN_SITE_TYPE, site.site}).second) << site.name;
            // Locked user memory is the processes'.
            if ((site.flags & VM_KERN_SITE_WIRED) && !(site.flags & VM_KERN_SITE_HIDE) && site.site != 24)
                wiredSize += site.size;
        }
        const auto meminfo = HXParseKernelMeminfo(textOf("/proc/meminfo")).value();
        zonesDirty = std::min(zonesDirty, deviation(dirtySize, *meminfo.slabUnreclaimableSize));
        zonesReclaimable =
            std::min(zonesReclaimable, deviation(size - dirtySize, *meminfo.slabReclaimableSize));
        sites = std::min(sites, deviation(wiredSize, sitesSum(meminfo)));
    }
    EXPECT_LT(zonesDirty, tolerance);
    EXPECT_LT(zonesReclaimable, tolerance);
    EXPECT_LT(sites, tolerance);
}

} // namespace
