// What the live host tells of a stopped process, against the kernel's own files, to the byte, and from both
// sources that it has: smaps, and maps with the page tables.
#include "analysis/HXHeft.h"
#include "platform/HXPlatform.h"
#include "platform/linux/HXLinuxPlatform.h"
#include "process/HXProcessSnapshot.h"
#include "process/HXUserProcess.h"
#include "support/HXMemoryRecipe.h"
#include "support/HXSubject.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <csignal>
#include <sstream>

namespace {

constexpr uint64_t kPage = 4096;
constexpr size_t kAsMuchAsUsed = SIZE_MAX;
constexpr int kWrite = MADV_POPULATE_WRITE, kRead = MADV_POPULATE_READ, kGuard = 102,
              kNoHuge = MADV_NOHUGEPAGE;
constexpr int kReadOnly = HXActProtect - PROT_READ, kReadWrite = PROT_READ | PROT_WRITE;
constexpr int kOwn = MAP_PRIVATE | MAP_ANONYMOUS, kShared = MAP_SHARED | MAP_ANONYMOUS;
constexpr int kPool = MAP_HUGETLB | MAP_NORESERVE;
constexpr size_t kHuge = 512, kWide = size_t{1} << 26;

const HXMemoryRecipe kRecipes[] = {
    {"PlainAnonymous",
     {{2048, kReadWrite, kOwn, nullptr, {{kNoHuge}, {kWrite, 256, 256}}, "anonymous", 256},
      {4, kReadWrite | PROT_EXEC, kOwn, nullptr, {{kWrite, 0, 1}}, "anonymous code", 1}}},
    {"Reservations",
     {{1 << 14, PROT_NONE, kOwn | MAP_NORESERVE, nullptr, {}, "guard"},
      {1 << 26,
       kReadWrite,
       kOwn | MAP_NORESERVE,
       nullptr,
       {{kNoHuge}, {kWrite, 1 << 25, 256}},
       "anonymous",
       256}}},
    {"LazilyFreedAndLocked",
     {{16, kReadWrite, kOwn, nullptr, {{kWrite}, {MADV_FREE, 0, 4}}, "anonymous", 12, 0, 4},
      {4, kReadWrite, kOwn, nullptr, {{HXActLock}}, "anonymous", 4, 0, 0, true}}},
    {"TransparentHugePages",
     {{4 * kHuge,
       kReadWrite,
       kOwn,
       nullptr,
       {{MADV_HUGEPAGE}, {kWrite, 0, 2 * kHuge}},
       "anonymous",
       2 * kHuge}}},
    {"ManyMappings",
     {{4000, kReadWrite, kOwn, nullptr, {{kNoHuge}, {kWrite, 0, 2000}, {kReadOnly, 0, 4000, 2}}}}},
    {"FileMappings",
     {{16, kReadWrite, MAP_PRIVATE, "/var/tmp", {{kWrite, 0, 3}, {kRead}}, "mapped file", 3, 13},
      {8, kReadWrite, MAP_SHARED, "/var/tmp", {{kRead}, {kWrite, 0, 1}}, "mapped file", 0, 8}}},
    {"TmpfsTwice", // by writing, since reading would map the neighbours, too
     {{8, kReadWrite, MAP_SHARED, "/dev/shm", {{kWrite}}, "deleted shared memory", 8},
      {8, kReadWrite, MAP_SHARED, "/dev/shm", {{kWrite, 0, 6}}, "deleted shared memory", 2, 4, 0, false, 4}}},
    // Pages are charged where their object is mapped first; others show them as clean.
    {"OneObjectManyTimes",
     {{64, kReadWrite, MAP_SHARED, "memfd", {{kWrite, 0, 64, 2}}, "memfd", 32},
      {64, kReadWrite, MAP_SHARED, "memfd", {{kWrite}}, "memfd", 32, 32},
      {32, kReadWrite, MAP_SHARED, "memfd", {{kWrite}}, "memfd", 16, 16, 0, false, 48},
      {64, kReadWrite, MAP_PRIVATE, "memfd", {{kRead}, {kWrite, 0, 8}}, "memfd", 8, 56},
      {64, kReadWrite, MAP_SHARED, "memfd", {}, "memfd"},
      // On a machine with swap, what is taken out of one mapping is out of all.
      {64, kReadWrite, MAP_SHARED, "/dev/shm", {{kWrite}, {MADV_PAGEOUT}}},
      {64, kReadWrite, MAP_SHARED, "/dev/shm", {}}}},
    // Two touched pages far apart: the cost follows pages, not addresses.
    {"Sparse",
     {{kWide, kReadWrite, MAP_SHARED, "memfd", {{kWrite, 0, 1}, {kWrite, kWide - 1, 1}}, "memfd", 2}}},
    {"SharedMemory",
     {{16, kReadWrite, MAP_SHARED, "memfd", {{kWrite, 0, 5}}, "memfd", 5},
      {16, kReadWrite, MAP_PRIVATE, "memfd", {{kRead, 0, 5}, {kWrite, 0, 1}}, "memfd", 1, 4},
      {16, kReadWrite, kShared, nullptr, {{kWrite, 0, 7}}, "shared anonymous", 7},
      {16, kReadWrite, MAP_SHARED, "SysV", {{kWrite, 0, 3}}, "System V shared memory", 3}}},
    // On a machine with swap, what the kernel takes out is told as swapped; elsewhere it stays.
    {"PagedOut",
     {{256, kReadWrite, kOwn, nullptr, {{kNoHuge}, {kWrite, 0, 128}, {MADV_PAGEOUT, 0, 64}}},
      {256, kReadWrite, kShared, nullptr, {{kWrite, 0, 128}, {MADV_PAGEOUT, 0, 64}}}}},
    {"ThreadStack",
     {{256, kReadWrite, kOwn | MAP_STACK, nullptr, {{kNoHuge}, {HXActRunThread}}, "stack", kAsMuchAsUsed}}},
    // What page tables must tell apart.
    {"ZerosAndGuards",
     {{512, kReadWrite, kOwn, nullptr, {{kRead, 0, 64}, {kWrite, 10, 100, 3}}},
      {4096, kReadWrite, kOwn, nullptr, {{MADV_HUGEPAGE}, {kRead}, {kWrite, 1024, kHuge}}},
      {64, kReadWrite, MAP_PRIVATE, "/dev/zero", {{kRead, 0, 32}, {kWrite, 8, 4}}},
      {64, kReadWrite, kOwn, nullptr, {{kWrite}, {kGuard, 0, 8}, {HXActProtect, 0, 32}}}}},
    {"CopiesAmongFiles",
     {{512, kReadWrite, MAP_SHARED, "memfd", {{kWrite, 0, 100, 7}}, "memfd", 15},
      {512, kReadWrite, MAP_PRIVATE, "memfd", {{kRead, 0, 50}, {kWrite, 20, 50}}, "memfd", 67, 3},
      {16, kReadWrite, MAP_PRIVATE, "/proc/self/exe", {{kRead}, {kWrite, 3, 4}}, "mapped file", 4, 12},
      {16, PROT_READ, MAP_SHARED, "/proc/self/exe", {{kRead}}, "mapped file", 0, 16}}},
    {"MoreRunsThanOneRequestFinds",
     {{6000, kReadWrite, kOwn, nullptr, {{kNoHuge}, {kWrite, 0, 6000, 2}, {kReadOnly, 0, 600, 3}}}}},
    // Of the huge-page pool, of which it takes no page.
    {"UntouchedHugePages",
     {{kHuge, kReadWrite, kOwn | kPool, nullptr, {}, "huge pages", 0, 0, 0, true},
      {kHuge, kReadWrite, kShared | kPool, nullptr, {}, "huge pages", 0, 0, 0, true}}},
};

bool isSwapBacked(const HXSmapsEntry &entry) {
    for (const char *const place : {"/dev/shm/", "/memfd:", "/SYSV", "/dev/zero (deleted)", "[anon_shmem"})
        if (entry.path.starts_with(place)) return true;
    return false;
}

bool isTmpfs(const HXMemoryMapping &mapping) {
    return mapping.file && mapping.file == std::string("/dev/shm");
}

const HXMemoryRegion *regionAt(const HXProcess &process, uint64_t start) {
    for (const HXMemoryRegion &region : process.memoryRegions())
        if (region.start() == start) return &region;
    return nullptr;
}

// Dirty, swapped, clean, reclaimable.
using Sizes = std::array<uint64_t, 4>;
Sizes sizesOf(const HXMemoryRegion &region) {
    return {region.dirtySize(), region.swappedSize(), region.cleanNonSpecSize(), region.reclaimableSize()};
}

class HXLiveRegions : public testing::TestWithParam<HXMemoryRecipe> {
  protected:
    void SetUp() override {
        for (const HXMemoryMapping &mapping : GetParam().mappings)
            if (isTmpfs(mapping) && !HXHasTmpfs()) GTEST_SKIP() << "/dev/shm is no tmpfs";
        ASSERT_TRUE(subject.stopped()) << "this machine cannot do it";
        HXPlatform::setCurrent(&platform);
    }
    void TearDown() override { HXProcess::_clearGlobalErrors(); }

    std::unique_ptr<HXUserProcess> gathered(bool breakDown) {
        HXHeft::setBreakDownPhysHeft(breakDown);
        HXProcessSnapshot snapshot;
        auto process = HXProcess::processWithPid(subject.pid(), snapshot);
        if (process) process->gatherData();
        return std::unique_ptr<HXUserProcess>(static_cast<HXUserProcess *>(process.release()));
    }
    // What a swap-backed mapping has clean, others of the process are charged for.
    uint64_t repeatedAt(uint64_t start) const {
        for (size_t i = 0; i < GetParam().mappings.size(); i++) {
            const HXMemoryMapping &mapping = GetParam().mappings[i];
            const bool isSwapBacked =
                isTmpfs(mapping) || (mapping.file && mapping.file == std::string("memfd"));
            if (HXPlaceOf(GetParam(), i) == start && isSwapBacked) return mapping.clean * kPage;
        }
        return 0;
    }
    uint64_t status(const char *field) const { return HXReadStatus(subject.pid(), field); }

    const HXSubject subject{[] { HXFollow(GetParam()); }};
    const std::vector<HXSmapsEntry> entries = HXReadSmaps(subject.pid());
    HXLinuxPlatform platform;
};

TEST_P(HXLiveRegions, AgreeWithTheKernelsFiles) {
    const auto objects = gathered(false), process = gathered(true);
    ASSERT_TRUE(objects && process);
    EXPECT_TRUE(process->errors().empty());
    uint64_t charged = 0;
    for (const HXSmapsEntry &entry : entries) {
        const HXMemoryRegion *region = regionAt(*process, entry.start);
        ASSERT_TRUE(region) << entry.path;
        EXPECT_EQ(region->end(), entry.end);
        const uint64_t rss = entry["Rss"], anonymous = entry["Anonymous"], lazyFree = entry["LazyFree"];
        const uint64_t shared = isSwapBacked(entry) ? rss - anonymous : 0;
        const uint64_t repeated = repeatedAt(entry.start);
        const uint64_t dirty = anonymous - lazyFree + shared + entry.hugePages() - repeated;
        const uint64_t clean = rss + entry.hugePages() - dirty - lazyFree;
        EXPECT_EQ(sizesOf(*region), (Sizes{dirty, entry["Swap"], clean, lazyFree}))
            << entry.path << " at " << std::hex << entry.start;
        charged += dirty + entry["Swap"];
        const bool isFile =
            entry.path.starts_with("/") && !isSwapBacked(entry) && !entry.path.starts_with("/anon_hugepage");
        const uint64_t seen = isFile ? entry["Shared_Dirty"] + entry["Private_Dirty"] : dirty + clean;
        // The kernel's own pages in the process are nobody's.
        if (!entry.path.starts_with("[v")) {
            EXPECT_EQ(regionAt(*objects, entry.start)->dirtySize(), seen) << entry.path;
        }
        const bool isNamed = entry.path.starts_with("[anon:");
        EXPECT_EQ(isNamed ? "[anon:" + region->name().str() + "]" : entry.path, entry.path);
        if (const HXRangeList *runs = region->subrangeList()) {
            const HXMemoryTotal sum = runs->sum();
            EXPECT_EQ((Sizes{sum.dirty, sum.swapped, sum.clean, sum.reclaimable}), sizesOf(*region))
                << entry.path;
        }
    }
    const HXMemoryRegion *pageTables = regionAt(*process, kNoAddress);
    ASSERT_TRUE(pageTables);
    EXPECT_EQ(pageTables->name().str(), "page table");
    EXPECT_EQ(pageTables->dirtySize(), status("VmPTE"));
    EXPECT_EQ(HXHeft(HXHeft::ProcessList())._calculateHeftForProcess(*process), charged + status("VmPTE"));
    EXPECT_EQ(process->physHeft(), status("RssAnon") + status("RssShmem") + status("VmSwap") +
                                       status("VmPTE") + status("HugetlbPages"));
    EXPECT_GE(process->physHeftPeak(), process->physHeft());
}

TEST_P(HXLiveRegions, AreNamedAndSizedAsMapped) {
    const auto process = gathered(true);
    ASSERT_TRUE(process);
    for (size_t i = 0; i < GetParam().mappings.size(); i++) {
        const HXMemoryMapping &mapping = GetParam().mappings[i];
        if (mapping.name == nullptr) continue;
        const HXMemoryRegion *region = regionAt(*process, HXPlaceOf(GetParam(), i));
        ASSERT_TRUE(region) << mapping.name;
        EXPECT_EQ(region->size(), mapping.pages * kPage) << mapping.name;
        EXPECT_EQ(region->name().str(), mapping.name);
        EXPECT_EQ(region->wired(), mapping.wired) << mapping.name;
        if (mapping.dirty == kAsMuchAsUsed) continue;
        EXPECT_EQ(sizesOf(*region),
                  (Sizes{mapping.dirty * kPage, 0, mapping.clean * kPage, mapping.reclaimable * kPage}))
            << mapping.name;
    }
}

// Every region's record as text, in agreement with its pages.
std::string regionsAndPages(HXLinuxPlatform &platform, pid_t pid) {
    const uint32_t charge = 1;
    platform.sysctlbyname("vm.self_region_heft", nullptr, nullptr, &charge, sizeof charge);
    mach_port_t task = 0;
    EXPECT_EQ(platform.task_for_pid(platform.mach_task_self(), pid, &task), KERN_SUCCESS);
    std::ostringstream text;
    vm_region_submap_info_64 info;
    uint32_t depth = UINT32_MAX, words = 19;
    for (uint64_t address = 0, size = 0;; address += size) {
        if (platform.mach_vm_region_recurse(task, &address, &size, &depth, &info, &words) != KERN_SUCCESS)
            break;
        text << std::hex << address << " " << size << " " << info.object_id_full << std::dec << " "
             << info.user_tag << " " << info.pages_resident << " " << info.pages_dirtied << " "
             << info.pages_swapped_out << " " << int{info.share_mode} << int{info.external_pager} << "\n";
        std::vector<vm_page_run> all, runs;
        for (uint64_t at = address, told = 0; at < address + size; at += told * kPage) {
            const uint64_t left = address + size - at;
            const kern_return_t error = platform.mach_vm_page_range_query(task, at, left, &runs, &told);
            EXPECT_EQ(error, KERN_SUCCESS);
            if (error != KERN_SUCCESS) break;
            all.insert(all.end(), runs.begin(), runs.end());
        }
        const auto pagesThatAre = [&](int32_t bit) {
            uint64_t pages = 0;
            for (const vm_page_run &run : all)
                pages += run.disposition & bit ? run.pages : 0;
            return pages;
        };
        EXPECT_EQ(pagesThatAre(VM_PAGE_QUERY_PAGE_DIRTY), info.pages_dirtied) << std::hex << address;
        EXPECT_EQ(pagesThatAre(VM_PAGE_QUERY_PAGE_PRESENT), info.pages_resident) << std::hex << address;
        EXPECT_EQ(pagesThatAre(VM_PAGE_QUERY_PAGE_PAGED_OUT), info.pages_swapped_out) << std::hex << address;
    }
    platform.mach_port_deallocate(platform.mach_task_self(), task);
    return text.str();
}

TEST_P(HXLiveRegions, AreTheSameFromBothSources) {
    // A /proc with that process alone, on a machine where nobody else has freed pages lazily.
    const HXTemporaryFolder proc;
    const std::string pid = std::to_string(subject.pid());
    uint64_t lazyFree = 0;
    for (const HXSmapsEntry &entry : entries)
        lazyFree += entry["LazyFree"];
    proc.link(pid, "/proc/" + pid);
    proc.write("vmstat", "pglazyfree " + std::to_string(lazyFree) + "\n");
    HXLinuxPlatform::Setting setting;
    setting.procPath = proc.path();
    HXLinuxPlatform scanning(setting);
    setting.mayScanPageTables = false;
    HXLinuxPlatform reading(setting);
    EXPECT_EQ(regionsAndPages(scanning, subject.pid()), regionsAndPages(reading, subject.pid()));
}

TEST(HXLiveTask, HasTheMemoryOfWhatItHasExecutedSinceItWasOpened) {
    const HXSubject subject([] {
        raise(SIGSTOP);
        execl("/bin/sh", "sh", "-c", "kill -STOP $$", nullptr);
    });
    ASSERT_TRUE(subject.stopped());
    HXLinuxPlatform platform;
    mach_port_t task = 0;
    ASSERT_EQ(platform.task_for_pid(platform.mach_task_self(), subject.pid(), &task), KERN_SUCCESS);
    kill(subject.pid(), SIGCONT);
    int status = 0;
    ASSERT_EQ(waitpid(subject.pid(), &status, WUNTRACED), subject.pid());
    ASSERT_TRUE(WIFSTOPPED(status));
    vm_region_basic_info_64 info;
    uint32_t count = VM_REGION_BASIC_INFO_COUNT_64;
    uint64_t address = 0, size = 0;
    ASSERT_EQ(platform.mach_vm_region(task, &address, &size, VM_REGION_BASIC_INFO_64, &info, &count),
              KERN_SUCCESS);
    EXPECT_EQ(address, HXReadSmaps(subject.pid()).front().start);
}

INSTANTIATE_TEST_SUITE_P(Subjects, HXLiveRegions, testing::ValuesIn(kRecipes),
                         [](const auto &each) { return each.param.name; });

} // namespace
