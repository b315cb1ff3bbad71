#include "process/HXKernelProcess.h"

#include "support/HXBarePlatform.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <map>
#include <string>
#include <vector>

namespace {

mach_zone_name zoneName(const std::string &name) {
    mach_zone_name zone{};
    std::memcpy(zone.mzn_name, name.data(), std::min<size_t>(name.size(), sizeof zone.mzn_name));
    return zone;
}

mach_zone_info zoneInfo(uint64_t count, uint64_t currentSize, uint64_t elementSize, uint64_t collectable) {
    mach_zone_info zone{};
    zone.mzi_count = count;
    zone.mzi_cur_size = currentSize;
    zone.mzi_elem_size = elementSize;
    zone.mzi_collectable = collectable;
    return zone;
}

mach_memory_info_record site(uint64_t flags, uint64_t number, uint64_t size, const std::string &name = "",
                             uint16_t zone = 0) {
    mach_memory_info_record record{};
    record.flags = flags;
    record.site = number;
    record.size = size;
    record.zone = zone;
    std::memcpy(record.name, name.data(), std::min(name.size(), sizeof record.name));
    return record;
}

mach_memory_info_record counter(uint64_t flags, uint64_t number, uint64_t mapped, uint64_t size = 0) {
    mach_memory_info_record record = site(flags, number, size);
    record.mapped = mapped;
    return record;
}

// A kernel of made-up records, which counts what is handed out and given back.
class KernelPlatform : public HXBarePlatform {
  public:
    class Symbolicator : public RVSymbolicator {};

    kern_return_t mach_memory_info(mach_port_t, mach_zone_name **outNames, uint32_t *nameCount,
                                   mach_zone_info **outZones, uint32_t *zoneCount,
                                   mach_memory_info_record **outRecords, uint32_t *recordCount) override {
        *outNames = names.data();
        *outZones = zones.data();
        *outRecords = records.data();
        *nameCount = *zoneCount = static_cast<uint32_t>(zones.size());
        *recordCount = static_cast<uint32_t>(records.size());
        return error;
    }
    kern_return_t vm_deallocate(mach_port_t, const void *address, uint64_t bytes) override {
        returned[address] = bytes;
        return deallocateError;
    }
    std::vector<OSKextInfo> OSKextCopyLoadedKextInfo() override { return kexts; }
    RVSymbolicator *RVSymbolicatorCreateWithMachKernelFlagsAndNotification(uint32_t flags,
                                                                           const void *) override {
        EXPECT_EQ(flags, 0x100002u);
        if (hasSymbols) openSymbolicators++;
        return hasSymbols ? &symbolicator : nullptr;
    }
    RVSymbol RVSymbolicatorGetSymbolWithAddressAtTime(RVSymbolicator *, uint64_t address, uint64_t) override {
        return {address == 0xffffff8000100000 ? "known_function" : nullptr};
    }
    RVSourceInfo RVSymbolicatorGetSourceInfoWithAddressAtTime(RVSymbolicator *, uint64_t address,
                                                              uint64_t) override {
        if (address == 0xffffff8000100000) return {"kern/known.c", 42, false};
        return {address == 0xffffff8000200000 ? nullptr : "no.c", 7, address != 0xffffff8000200000};
    }
    void RVRelease(RVSymbolicator *released) override {
        if (released) openSymbolicators--;
    }

    std::vector<mach_zone_name> names;
    std::vector<mach_zone_info> zones;
    std::vector<mach_memory_info_record> records;
    std::vector<OSKextInfo> kexts;
    kern_return_t error = KERN_SUCCESS, deallocateError = KERN_SUCCESS;
    bool hasSymbols = true;
    Symbolicator symbolicator;
    int openSymbolicators = 0;
    std::map<const void *, uint64_t> returned; // length by address
};

class HXKernelProcessTest : public testing::Test {
  protected:
    void SetUp() override {
        proc_bsdinfo info{};
        info.pbi_flags = PROC_FLAG_SYSTEM | PROC_FLAG_LP64;
        std::memcpy(info.pbi_name, "kernel", 6);
        kernel = HXProcess::processWithBsdInfo(info);
        ASSERT_NE(dynamic_cast<HXKernelProcess *>(kernel.get()), nullptr);
    }

    // The single region that one record makes.
    const HXMemoryRegion &regionOf(const mach_memory_info_record &record) {
        platform.records = {record};
        kernel->gatherData();
        EXPECT_EQ(kernel->memoryRegions().size(), platform.zones.size() + 1);
        return kernel->memoryRegions().back();
    }
    std::map<std::string, int64_t> counters() const {
        std::map<std::string, int64_t> values;
        const auto tree = kernel->auxData();
        const auto maps = std::dynamic_pointer_cast<const HXAuxDictionary>(tree->get("Maps"));
        for (const auto &[name, node] : maps->entries()) {
            const auto &leaf = dynamic_cast<const HXAuxData &>(*node);
            EXPECT_FALSE(leaf.shouldAggregate());
            values[name] = leaf.value();
        }
        return values;
    }

    KernelPlatform platform;
    std::unique_ptr<HXProcess> kernel;
};

constexpr uint64_t W = VM_KERN_SITE_WIRED, H = VM_KERN_SITE_HIDE, N = VM_KERN_SITE_NAMED,
                   Z = VM_KERN_SITE_ZONE;
const std::string k80(80, 'n');

TEST_F(HXKernelProcessTest, isConstructedFromTheSystemRecord) {
    EXPECT_EQ(kernel->displayString(), "kernel [0]");
    EXPECT_EQ(kernel->idleExitStatus(), HXIdleExitNotSupported);
    EXPECT_EQ(kernel->pageSize(), 16384u);
    EXPECT_TRUE(counters().empty());
}

TEST_F(HXKernelProcessTest, zones) {
    static const struct {
        std::string name;
        mach_zone_info info;
        uint64_t dirtySize, reclaimableSize;
    } cases[] = {
        {"plain", zoneInfo(10, 1000, 64, 0), 1000, 0},
        {"collectable", zoneInfo(10, 1000, 64, 1), 640, 360},
        {k80, zoneInfo(0, 1000, 64, 7), 0, 1000},
        {"outgrown", zoneInfo(10, 639, 64, 1), 640, 0},
        {"wrapped", zoneInfo(1ull << 60, 1000, 16, 1), 0, 0},
        {"", zoneInfo(5, 1000, 0, 1), 0, 1000},
    };
    for (const auto &c : cases) {
        platform.names.push_back(zoneName(c.name));
        platform.zones.push_back(c.info);
    }
    kernel->gatherData();
    const HXMemoryRegionList &regions = kernel->memoryRegions();
    ASSERT_EQ(regions.size(), std::size(cases));
    for (size_t i = 0; i < regions.size(); i++) {
        SCOPED_TRACE(cases[i].name);
        EXPECT_EQ(regions[i].name().str(), cases[i].name);
        EXPECT_EQ(regions[i].detailedName().str(), "zone");
        EXPECT_EQ(regions[i].size(), cases[i].info.mzi_cur_size);
        EXPECT_EQ(regions[i].dirtySize(), cases[i].dirtySize);
        EXPECT_EQ(regions[i].reclaimableSize(), cases[i].reclaimableSize);
        EXPECT_EQ(regions[i].object_id(), 0x200000000u + i);
        EXPECT_FALSE(regions[i].wired());
    }
    const std::map<const void *, uint64_t> everything = {
        {platform.names.data(), 6 * 80}, {platform.zones.data(), 6 * 64}, {nullptr, 0}};
    EXPECT_EQ(platform.returned, everything);
    EXPECT_EQ(platform.openSymbolicators, 0);
}

TEST_F(HXKernelProcessTest, namesAndObjectIdsOfSites) {
    platform.kexts = {{7, "com.first"}, {8, std::nullopt}, {7, "com.second"}};
    platform.names = {zoneName("zone.0"), zoneName(k80)};
    platform.zones = {zoneInfo(1, 1, 1, 0), zoneInfo(1, 1, 1, 0)};
    constexpr uint64_t known = 0xffffff8000100000, unknown = 0xffffff8000200000;
    const struct {
        mach_memory_info_record record;
        std::string fullName;
        uint64_t objectId;
    } cases[] = {
        {site(W, 0, 9), "VM_KERN_MEMORY_NONE", 0x300000000},
        {site(W, 3, 9), "VM_KERN_MEMORY_DRIVERS", 0x300000003},
        {site(W, 13, 9), "VM_KERN_MEMORY_KALLOC", 0x30000000d},
        {site(W, 26, 9), "VM_KERN_MEMORY_NETWORK", 0x30000001a},
        {site(W, 28, 9), "VM_KERN_MEMORY_FIRST_DYNAMIC", 0x30000001c},
        {site(W, 29, 9), "VM_KERN_MEMORY_29", 0x30000001d},
        {site(W, 40, 9), "VM_KERN_MEMORY_40", 0x300000028},
        {site(W, 255, 9), "VM_KERN_MEMORY_ANY", 0x3000000ff},
        {site(W, 256, 9), "VM_KERN_MEMORY_256", 0x300000100},
        {site(W, 1ull << 40, 0), "VM_KERN_MEMORY_1099511627776", 0x10300000000},
        {site(W | 1, 7, 9), "com.second", 0x500000007},
        {site(W | 1, 8, 9), "unloaded kmod 8", 0x500000008},
        {site(W | 1, 9, 9), "unloaded kmod 9", 0x500000009},
        {site(W | 2, 0, 9), "site 0x0", 0x100000000},
        {site(W | 2, known, 9), "known_function (kern/known.c:42)", 0xffffff8100100000},
        {site(W | 2, unknown, 9), "site 0xffffff8000200000", 0xffffff8100200000},
        {site(W | 3, 2, 9), "VM_KERN_COUNT_WIRED", 0x400000002}, // a wired counter is a site
        {site(W | 3, 11, 9), "VM_KERN_COUNT_11", 0x40000000b},
        {site(W | 4, 0x1f, 9), "unknown site (0x4, 0x1f)", 0x10000001f},
        {site(W | N, 13, 9, "given"), "given", 0x30000000d},
        {site(W | N, 13, 9, k80), k80, 0x30000000d},
        {site(W | N | 2, known, 9, "given"), "given (kern/known.c:42)", 0xffffff8100100000},
        {site(W | Z, 13, 9, "", 0), "VM_KERN_MEMORY_KALLOC[zone.0]", 0x30000000d},
        {site(W | Z | N, 13, 9, "given", 1), "given[" + k80 + "]", 0x30000000d},
        {site(W | Z, 13, 9, "", 2), "VM_KERN_MEMORY_KALLOC", 0x30000000d}, // no such zone
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.fullName);
        const HXMemoryRegion &region = regionOf(c.record);
        EXPECT_EQ(region.fullName(), c.fullName);
        EXPECT_EQ(region.object_id(), c.objectId);
        EXPECT_EQ(region.size(), c.record.size);
    }
    platform.hasSymbols = false;
    EXPECT_EQ(regionOf(site(W | 2, known, 9)).fullName(), "site 0xffffff8000100000");
    EXPECT_EQ(platform.openSymbolicators, 0);
}

TEST_F(HXKernelProcessTest, whatIsChargedAsDirty) {
    static const struct {
        uint64_t flags, number;
        bool isDirty;
        const char *detail;
    } cases[] = {
        {W, 13, true, ""},
        {0, 13, false, ""},
        {W | Z, 13, false, ""},
        {W | H, 13, false, "(hidden)"},
        {W, 24, false, "(user wired)"},
        {W | H, 24, false, "(hidden)"},
        {0, 24, false, "(user wired)"},
        {W | 1, 24, false, "(user wired)"},
        {W | 1, 25, true, ""},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(testing::Message() << c.flags << " " << c.number);
        const HXMemoryRegion &region = regionOf(site(c.flags, c.number, 4096));
        EXPECT_EQ(region.dirtySize(), c.isDirty ? 4096u : 0u);
        EXPECT_EQ(region.cleanNonSpecSize(), c.isDirty ? 0u : 4096u);
        EXPECT_EQ(region.wiredSize(), c.flags & W ? 4096u : 0u);
        EXPECT_EQ(region.detailedName().str(), c.detail);
    }
}

TEST_F(HXKernelProcessTest, countersAndEmptyRecords) {
    platform.records = {
        counter(3, 0, 100), counter(3, 0, 0, 5),    // nothing mapped: passed over, whatever its size
        counter(3, 2, 200), counter(3 | H, 2, 300), // replaces the one before
        counter(3, 10, 1),  counter(3, 11, 2),      counter(3, 4, 0),
        site(W, 0, 0),      counter(W, 0, 7), // a site counts by its size
        site(W, 0, 1),      site(W, 5, 0),
    };
    kernel->gatherData();
    const std::map<std::string, int64_t> expected = {
        {"VM_KERN_COUNT_MANAGED", 100}, {"VM_KERN_COUNT_WIRED", 300}, {"VM_KERN_COUNT_BOOT_STOLEN", 1},
        {"VM_KERN_COUNT_11", 2},        {"VM_KERN_COUNT_STOLEN", 0},
    };
    EXPECT_EQ(counters(), expected);
    EXPECT_EQ(kernel->auxData()->mergeWithData(nullptr), nullptr);
    ASSERT_EQ(kernel->memoryRegions().size(), 2u);
    EXPECT_EQ(kernel->memoryRegions()[0].user_tag(), 9u); // the record's index
    EXPECT_EQ(kernel->memoryRegions()[1].user_tag(), 10u);
}

TEST_F(HXKernelProcessTest, aKernelThatRefuses) {
    platform.error = KERN_NO_ACCESS;
    platform.zones = {zoneInfo(1, 1, 1, 0)};
    testing::internal::CaptureStderr();
    kernel->gatherData();
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "kernel [0]: mach_memory_info: (os/kern) no access\n");
    EXPECT_EQ(kernel->errors(), std::vector<std::string>{"kernel [0]: (os/kern) no access"});
    EXPECT_TRUE(kernel->memoryRegions().empty());
    EXPECT_TRUE(platform.returned.empty());
}

TEST_F(HXKernelProcessTest, buffersThatAreNotTakenBackAreNoError) {
    platform.deallocateError = KERN_INVALID_ADDRESS;
    platform.names = {zoneName("z")};
    platform.zones = {zoneInfo(1, 1, 1, 0)};
    testing::internal::CaptureStderr();
    kernel->gatherData();
    const std::string line = "kernel [0]: vm_deallocate: (os/kern) invalid address\n";
    EXPECT_EQ(testing::internal::GetCapturedStderr(), line + line + line);
    EXPECT_TRUE(kernel->errors().empty());
    EXPECT_EQ(kernel->memoryRegions().size(), 1u);
}

} // namespace
