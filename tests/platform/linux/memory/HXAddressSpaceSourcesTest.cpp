// The figures of a live process from both sources that the host has: smaps, and maps with the page tables.
#include "platform/linux/HXLinuxPlatform.h"

#include "support/HXSubject.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <sys/mman.h>
#include <unistd.h>

namespace {

namespace fs = std::filesystem;
constexpr size_t P = 4096;
constexpr int readWrite = PROT_READ | PROT_WRITE;

void touch(void *memory, size_t first, size_t count, size_t step = 1) {
    for (size_t i = 0; i < count; i += step)
        static_cast<volatile char *>(memory)[(first + i) * P] = 1;
}
void look(void *memory, size_t pages) {
    for (size_t i = 0; i < pages; i++)
        (void)static_cast<volatile char *>(memory)[i * P];
}

// Mappings of every kind whose pages the page tables must tell apart.
std::vector<HXExpectedRegion> variety() {
    const int file = memfd_create("x", 0);
    if (ftruncate(file, 512 * P) != 0) _exit(1);
    const int program = open("/proc/self/exe", O_RDONLY);
    const int zero = open("/dev/zero", O_RDWR);
    const int anonymous = MAP_PRIVATE | MAP_ANONYMOUS;
    void *zeros = mmap(nullptr, 512 * P, readWrite, anonymous, -1, 0);
    look(zeros, 64);
    touch(zeros, 10, 100, 3);
    void *huge = mmap(nullptr, 4096 * P, readWrite, anonymous, -1, 0);
    madvise(huge, 4096 * P, MADV_HUGEPAGE);
    look(huge, 4096);
    touch(huge, 1024, 512);
    touch(mmap(nullptr, 512 * P, readWrite, MAP_SHARED, file, 0), 0, 100, 7);
    void *copy = mmap(nullptr, 512 * P, readWrite, MAP_PRIVATE, file, 0);
    look(copy, 50);
    touch(copy, 20, 50);
    void *own = mmap(nullptr, 16 * P, readWrite, MAP_PRIVATE, program, 0);
    look(own, 16);
    touch(own, 3, 4);
    look(mmap(nullptr, 16 * P, PROT_READ, MAP_SHARED, program, 0), 16);
    void *device = mmap(nullptr, 64 * P, readWrite, MAP_PRIVATE, zero, 0);
    look(device, 32);
    touch(device, 8, 4);
    void *guarded = mmap(nullptr, 64 * P, readWrite, anonymous, -1, 0);
    touch(guarded, 0, 64);
    madvise(guarded, 8 * P, 102); // MADV_GUARD_INSTALL, where the kernel has it
    mprotect(guarded, 32 * P, PROT_NONE);
    char *small = static_cast<char *>(mmap(nullptr, 6000 * P, readWrite, anonymous, -1, 0));
    madvise(small, 6000 * P, MADV_NOHUGEPAGE);
    touch(small, 0, 6000, 2); // more runs than one request has room for
    for (size_t i = 0; i < 200; i++)
        mprotect(small + i * 3 * P, P, PROT_READ);
    return {};
}

// Of the huge-page pool, but it takes no page of it.
std::vector<HXExpectedRegion> untouchedHugePages() {
    const int flags = MAP_ANONYMOUS | MAP_HUGETLB | MAP_NORESERVE;
    mmap(nullptr, 512 * P, readWrite, MAP_PRIVATE | flags, -1, 0);
    mmap(nullptr, 512 * P, readWrite, MAP_SHARED | flags, -1, 0);
    return {};
}

// A /proc with that process alone, on a machine where nobody has freed pages lazily.
class OneProcess {
  public:
    explicit OneProcess(pid_t pid) {
        std::string name = fs::temp_directory_path() / "heft-proc-XXXXXX";
        if (mkdtemp(name.data()) == nullptr) abort();
        _path = name;
        fs::create_symlink("/proc/" + std::to_string(pid), _path / std::to_string(pid));
        std::ofstream(_path / "vmstat") << "pglazyfree 0\n";
    }
    ~OneProcess() { fs::remove_all(_path); }
    OneProcess(const OneProcess &) = delete;
    std::string path() const { return _path; }

  private:
    fs::path _path;
};

constexpr uint64_t kLargestCounted = uint64_t{1} << 31;

void countPages(HXLinuxPlatform &platform, mach_port_t task, uint64_t address, uint64_t size, uint32_t *dirty,
                uint32_t *clean) {
    *dirty = *clean = 0;
    std::vector<int32_t> pages(size / P);
    uint64_t count = pages.size();
    EXPECT_EQ(platform.mach_vm_page_range_query(task, address, size, pages.data(), &count), KERN_SUCCESS);
    for (const int32_t page : pages) {
        *dirty += (page & VM_PAGE_QUERY_PAGE_DIRTY) != 0;
        *clean +=
            (page & (VM_PAGE_QUERY_PAGE_DIRTY | VM_PAGE_QUERY_PAGE_PRESENT)) == VM_PAGE_QUERY_PAGE_PRESENT;
    }
}

// Every region's record and what its pages add up to, as text.
std::string report(HXLinuxPlatform &platform, pid_t pid) {
    uint32_t charge = 1;
    platform.sysctlbyname("vm.self_region_heft", nullptr, nullptr, &charge, sizeof charge);
    mach_port_t task = 0;
    EXPECT_EQ(platform.task_for_pid(platform.mach_task_self(), pid, &task), KERN_SUCCESS);
    std::ostringstream text;
    uint64_t address = 0, size = 0;
    for (;; address += size) {
        vm_region_submap_info_64 info;
        uint32_t depth = UINT32_MAX, words = 19;
        if (platform.mach_vm_region_recurse(task, &address, &size, &depth, &info, &words) != KERN_SUCCESS)
            break;
        uint32_t dirty = info.pages_dirtied, clean = info.pages_resident - info.pages_dirtied;
        // Sanitizers reserve terabytes, which nobody would go through page by page.
        if (size <= kLargestCounted) countPages(platform, task, address, size, &dirty, &clean);
        EXPECT_EQ(dirty, info.pages_dirtied) << std::hex << address;
        EXPECT_EQ(dirty + clean, info.pages_resident) << std::hex << address;
        text << std::hex << address << " " << size << " " << info.object_id_full << std::dec << " "
             << info.user_tag << " " << info.pages_resident << " " << info.pages_dirtied << " "
             << info.pages_swapped_out << " " << int{info.share_mode} << int{info.external_pager} << "\n";
    }
    platform.mach_port_deallocate(platform.mach_task_self(), task);
    return text.str();
}

// Reports of both sources, which must agree.
std::string reportOfBoth(const HXSubject::SetUp &setUp) {
    const HXSubject subject(setUp);
    if (!subject.stopped()) return {};
    const OneProcess proc(subject.pid());
    HXLinuxPlatform::Setting setting;
    setting.procPath = proc.path();
    HXLinuxPlatform scanning(setting);
    setting.mayScanPageTables = false;
    HXLinuxPlatform reading(setting);
    const std::string expected = report(reading, subject.pid());
    EXPECT_EQ(report(scanning, subject.pid()), expected);
    return expected;
}

TEST(HXAddressSpaceSources, Agree) {
    const std::string various = reportOfBoth(variety);
    EXPECT_GT(std::count(various.begin(), various.end(), '\n'), 400);
    EXPECT_NE(reportOfBoth(untouchedHugePages), "");
}

} // namespace
