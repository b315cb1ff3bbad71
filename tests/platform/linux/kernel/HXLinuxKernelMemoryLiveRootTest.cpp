// The running kernel's record against what the kernel says of itself elsewhere.
#include "platform/linux/kernel/HXLinuxKernelFile.h"
#include "platform/linux/kernel/HXLinuxKernelMemory.h"
#include "platform/linux/kernel/HXLinuxKernelText.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <filesystem>
#include <set>
#include <string>
#include <unistd.h>

namespace {

// The account's figures, and the same by the kernel's sums.
struct Reading {
    uint64_t zonesDirtySize = 0, zonesReclaimableSize = 0, sitesDirtySize = 0;
    uint64_t slabUnreclaimableSize = 0, slabReclaimableSize = 0, sitesSumSize = 0;
};

double deviation(uint64_t measured, uint64_t expected) {
    return std::abs(static_cast<double>(measured) - static_cast<double>(expected)) /
           static_cast<double>(expected);
}

class HXLinuxKernelMemoryLiveRootTest : public testing::Test {
  protected:
    void SetUp() override {
        if (geteuid() != 0) GTEST_SKIP() << "needs root: slabinfo and vmallocinfo are root's alone";
        const auto meminfo = HXParseKernelMeminfo(HXReadKernelFile("/proc/meminfo"));
        if (!meminfo || meminfo->vmallocUsedSize == 0)
            GTEST_SKIP() << "needs a kernel that counts VmallocUsed";
        pageSize = static_cast<uint32_t>(sysconf(_SC_PAGESIZE));
    }

    Reading read() {
        HXLinuxKernelMemory memory("/proc", "/sys", pageSize);
        mach_zone_name *names = nullptr;
        mach_zone_info *zones = nullptr;
        mach_memory_info_record *records = nullptr;
        uint32_t nameCount = 0, zoneCount = 0, recordCount = 0;
        // The kernel adds its counts per CPU up now and then; reading this file makes it do so at once.
        HXReadKernelFile("/proc/sys/vm/stat_refresh");
        EXPECT_EQ(memory.mach_memory_info(0, &names, &nameCount, &zones, &zoneCount, &records, &recordCount),
                  KERN_SUCCESS);
        Reading reading;
        addKernelsSums(&reading);
        for (uint32_t i = 0; i < zoneCount; i++) {
            const mach_zone_info &zone = zones[i];
            const uint64_t dirtySize =
                zone.mzi_collectable ? zone.mzi_count * zone.mzi_elem_size : zone.mzi_cur_size;
            reading.zonesDirtySize += dirtySize;
            reading.zonesReclaimableSize += zone.mzi_cur_size - dirtySize;
        }
        std::set<std::pair<uint64_t, uint64_t>> sites;
        for (uint32_t i = 0; i < recordCount; i++) {
            const mach_memory_info_record &site = records[i];
            EXPECT_TRUE(sites.insert({site.flags & VM_KERN_SITE_TYPE, site.site}).second) << site.name;
            if ((site.flags & VM_KERN_SITE_WIRED) && !(site.flags & VM_KERN_SITE_HIDE) && site.site != 24)
                reading.sitesDirtySize += site.size;
        }
        return reading;
    }

    // Pages of vmalloc as the kernel's own counter has them (VmallocUsed, since 5.3), not as vmallocinfo adds
    // up.
    void addKernelsSums(Reading *reading) const {
        const auto meminfo = HXParseKernelMeminfo(HXReadKernelFile("/proc/meminfo")).value();
        reading->slabUnreclaimableSize = meminfo.slabUnreclaimableSize;
        reading->slabReclaimableSize = meminfo.slabReclaimableSize;
        const std::string areasText = HXReadKernelFile("/proc/vmallocinfo");
        const bool stacksInVmalloc = areasText.find(" kernel_clone+0x") != std::string::npos ||
                                     areasText.find(" copy_process") != std::string::npos ||
                                     areasText.find(" _do_fork+0x") != std::string::npos;
        uint64_t zramSize = 0;
        if (std::filesystem::exists("/sys/block"))
            for (const auto &device : std::filesystem::directory_iterator("/sys/block"))
                zramSize += HXParseZramUsedSize(HXReadKernelFile(device.path() / "mm_stat"));
        reading->sitesSumSize = meminfo.vmallocUsedSize + meminfo.perCpuSize + meminfo.zswapSize + zramSize +
                                (stacksInVmalloc ? 0 : meminfo.kernelStackSize);
    }

    uint32_t pageSize = 0;
};

TEST_F(HXLinuxKernelMemoryLiveRootTest, zonesAndSitesAgreeWithTheKernelsSums) {
    // Other processes come and go meanwhile, and the kernel's sums lag: the best of many readings counts.
    constexpr double tolerance = 0.02;
    double zonesDirty = 1, zonesReclaimable = 1, sites = 1;
    for (int attempt = 0; attempt < 200 && std::max({zonesDirty, zonesReclaimable, sites}) >= tolerance;
         attempt++) {
        const Reading reading = read();
        zonesDirty = std::min(zonesDirty, deviation(reading.zonesDirtySize, reading.slabUnreclaimableSize));
        zonesReclaimable =
            std::min(zonesReclaimable, deviation(reading.zonesReclaimableSize, reading.slabReclaimableSize));
        sites = std::min(sites, deviation(reading.sitesDirtySize, reading.sitesSumSize));
    }
    EXPECT_LT(zonesDirty, tolerance);
    EXPECT_LT(zonesReclaimable, tolerance);
    EXPECT_LT(sites, tolerance);
}

} // namespace
