// What HXPlatform.h promises, asked of the live host and of a replayed one that has the same process.
#include "platform/HXSafeText.h"
#include "platform/linux/HXLinuxPlatform.h"
#include "support/HXHostCalls.h"
#include "support/HXMadeUpMachine.h"
#include "support/HXRun.h"
#include "support/HXSubject.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

namespace {

constexpr uint64_t kPage = 4096;
constexpr int32_t kNobody = INT32_MAX;
constexpr mach_port_t kNoPort = 9999;

constexpr uint64_t kPlace = 0x7ea000000000; // far from all that a process maps by itself

// This process, with memory of its own: four pages, the first two written, then a page of a file whose path
// is longer than 1,024 bytes. And a process that can be made to vanish.
class HXHostContract : public testing::TestWithParam<const char *> {
  protected:
    HXHostContract() {
        std::string name;
        for (int i = 1; i <= 600; i++)
            name += i % 100 == 0 ? "é/" : "é";
        path = folder / (name + "x");
        folder.write(name + "x", std::string(kPage, 'x'));
        const int file = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
        map(0, 4, MAP_ANONYMOUS, -1);
        ::memset(reinterpret_cast<void *>(kPlace), 1, 2 * kPage);
        map(4, 1, 0, file);
        EXPECT_EQ(*reinterpret_cast<const volatile char *>(kPlace + 4 * kPage), 'x');
        ::close(file);
    }
    static void map(uint64_t first, uint64_t count, int flags, int file) {
        void *const start = reinterpret_cast<void *>(kPlace + first * kPage);
        ::mmap(start, count * kPage, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_FIXED | flags, file, 0);
    }
    ~HXHostContract() override { ::munmap(reinterpret_cast<void *>(kPlace), 5 * kPage); }

    void SetUp() override {
        const std::string other = "  pid=" + std::to_string(vanishing->pid()) + "\n";
        if (GetParam() == std::string("Live"))
            host = std::make_unique<HXLinuxPlatform>();
        else
            host = std::make_unique<HXMadeUpMachine>(
                "host  self_region_heft=0  ledger=page_table  page_size=" + std::to_string(kPage) +
                "\nprocess  args_path=/heft-tests  pid=" + std::to_string(self) + "\n" +
                region(self, kPlace, 4 * kPage, "pages=2*9") +
                region(self, kPlace + 4 * kPage, kPage, "pager=1  pages=1*0x81  path=" + path) +
                "held  name=memfd (unmapped)  object_id=2  resident=0x3000  flags=1  pid=" +
                std::to_string(self) + "\nheld  object_id=3  pid=" + std::to_string(self) + "\nprocess" +
                other + "fault  call=mach_vm_region_recurse  error=0x10000003  becomes=gone" + other);
        task = HXTaskOf(*host, self);
    }
    void TearDown() override { host->mach_port_deallocate(host->mach_task_self(), task); }

    // The errno of an answer; 0 when it is no failure.
    static int errorOf(int32_t answer, int32_t failure = -1) { return answer == failure ? errno : 0; }

    const int32_t self = ::getpid();
    HXTemporaryFolder folder;
    std::string path;
    std::unique_ptr<HXSubject> vanishing = std::make_unique<HXSubject>([] {});
    std::unique_ptr<HXPlatform> host;
    mach_port_t task = 0;
};

TEST_P(HXHostContract, MappingsAndPages) {
    vm_region_submap_info_64 info;
    for (const uint64_t asked : {kPlace - 1, kPlace, kPlace + 4 * kPage - 1}) {
        EXPECT_EQ(HXRegionAt(*host, task, asked, &info), "7ea000000000+4000");
        EXPECT_EQ(HXRegionAt(*host, task, asked, nullptr, 9), "7ea000000000+4000");
    }
    info.pages_dirtied = 0xEEEEEEEE;
    EXPECT_EQ(HXRegionAt(*host, task, kPlace, &info, 9), "7ea000000000+4000");
    EXPECT_EQ(info.pages_dirtied, 0xEEEEEEEE) << "beyond the room";
    EXPECT_EQ(HXRegionAt(*host, task, kPlace, nullptr, 8), "(os/kern) invalid argument");
    for (auto *const each : {&info, static_cast<vm_region_submap_info_64 *>(nullptr)}) {
        EXPECT_EQ(HXRegionAt(*host, task, UINT64_MAX, each), "(os/kern) invalid address");
        EXPECT_EQ(HXRegionAt(*host, kNoPort, kPlace, each), "(ipc/send) invalid destination port");
    }
    const struct {
        uint64_t address, bytes;
        const char *expected;
    } queries[] = {
        {kPlace + kPage + 1, 2 * kPage, "9 0 0"}, // no whole pages
        {kPlace, UINT64_MAX - kPlace, "(os/kern) invalid address"},
        {kPlace, 0, ""},
        {kPlace, 4 * kPage + 1, "9 9 0 0 81"}, // of two mappings
        {kPlace, 6 * kPage, "(os/kern) invalid address"},
        {kPlace - kPage, kPage, "(os/kern) invalid address"},
    };
    for (const auto &[address, bytes, expected] : queries)
        EXPECT_EQ(HXPagesAt(*host, task, address, bytes), expected);
    EXPECT_EQ(HXPagesAt(*host, kNoPort, kPlace, kPage), "(os/kern) invalid argument");
}

TEST_P(HXHostContract, NoSuchTaskOrProcess) {
    const int32_t gone = vanishing->pid();
    mach_port_t port = HXTaskOf(*host, gone);
    vanishing.reset();
    vm_region_submap_info_64 info;
    EXPECT_EQ(HXRegionAt(*host, port, 0, &info), "(ipc/send) invalid destination port");
    EXPECT_EQ(host->task_for_pid(host->mach_task_self(), kNobody, &port), KERN_FAILURE);
    EXPECT_EQ(host->RVSymbolicatorCreateWithTaskFlagsAndNotification(kNoPort, 0, nullptr), nullptr);

    char buffer[300];
    rusage_info_v4 usage;
    int64_t entries = 1;
    size_t bytes = sizeof buffer;
    const int32_t area[] = {CTL_KERN, KERN_PROCARGS2, kNobody};
    EXPECT_EQ(errorOf(host->proc_pidinfo(gone, PROC_PIDT_SHORTBSDINFO, 1, buffer, sizeof buffer), 0), ESRCH);
    EXPECT_EQ(errorOf(host->proc_pidinfo(kNobody, PROC_PIDTBSDINFO, 0, buffer, sizeof buffer), 0), ESRCH);
    EXPECT_EQ(errorOf(host->proc_pid_rusage(kNobody, RUSAGE_INFO_V4, &usage)), ESRCH);
    EXPECT_EQ(errorOf(host->ledger(LEDGER_ENTRY_INFO, kNobody, buffer, &entries)), ESRCH);
    EXPECT_EQ(errorOf(host->sysctl(area, 3, buffer, &bytes)), ESRCH);
    EXPECT_EQ(host->proc_regionfilename(kNobody, kPlace, buffer, sizeof buffer), 0);
}

TEST_P(HXHostContract, LittleRoomAndUnknownQuestions) {
    char buffer[200] = {};
    EXPECT_EQ(errorOf(host->proc_pidinfo(self, PROC_PIDTBSDINFO, 0, buffer, 135), 0), ENOMEM);
    EXPECT_EQ(errorOf(host->proc_pidinfo(self, PROC_PIDT_SHORTBSDINFO, 1, buffer, 63), 0), ENOMEM);
    EXPECT_EQ(errorOf(host->proc_pidinfo(self, 99, 0, buffer, sizeof buffer), 0), EINVAL);
    rusage_info_v4 usage;
    EXPECT_EQ(errorOf(host->proc_pid_rusage(self, RUSAGE_INFO_V4 + 1, &usage)), EINVAL);
    int64_t entries = 0;
    EXPECT_EQ(errorOf(host->ledger(99, self, buffer, &entries)), EINVAL);
    int32_t pids[2] = {};
    EXPECT_EQ(host->proc_listallpids(pids, 7), 1);
    EXPECT_GE(host->proc_listallpids(nullptr, 0), 2);

    const int32_t maximum[] = {CTL_KERN, KERN_ARGMAX}, area[] = {CTL_KERN, KERN_PROCARGS2, self},
                  other[] = {1, 9};
    size_t bytes = 3, less = 6;
    EXPECT_EQ(errorOf(host->sysctl(maximum, 2, buffer, &bytes)), ENOMEM);
    EXPECT_EQ(errorOf(host->sysctl(other, 2, buffer, &bytes)), ENOENT);
    EXPECT_EQ(host->sysctl(area, 3, buffer, &less), 0);
    EXPECT_EQ(less, 6U);
    const char *const setting = "vm.self_region_heft";
    const int32_t one = 1;
    EXPECT_EQ(errorOf(host->sysctlbyname("vm.other", buffer, &bytes, nullptr, 0)), ENOENT);
    EXPECT_EQ(errorOf(host->sysctlbyname(setting, nullptr, nullptr, &one, 3)), EINVAL);
    EXPECT_EQ(errorOf(host->sysctlbyname(setting, buffer, &bytes, &one, sizeof one)), ENOMEM);
    bytes = 5;
    EXPECT_EQ(host->sysctlbyname(setting, buffer, &bytes, nullptr, 0), 0);
    EXPECT_EQ(std::string(buffer, bytes), std::string(4, '\0')) << "changed by a call that failed";
}

TEST_P(HXHostContract, PathsAreCutToWholeCharacters) {
    char buffer[1024];
    for (uint32_t room = 1020; room <= sizeof buffer; room++) {
        const int32_t length = host->proc_regionfilename(self, kPlace + 4 * kPage, buffer, room);
        EXPECT_GE(length, static_cast<int32_t>(room) - 1);
        const std::string_view cut(buffer, static_cast<size_t>(length));
        EXPECT_TRUE(path.starts_with(cut) && HXSafeText(cut) == cut) << cut;
    }
    EXPECT_EQ(host->proc_regionfilename(self, kPlace, buffer, sizeof buffer), 0) << "of no file";
}

TEST_P(HXHostContract, WhatDescriptorsHold) {
    const int file = ::memfd_create("three pages", MFD_CLOEXEC);
    ASSERT_EQ(::write(file, std::string(3 * kPage, 'x').data(), 3 * kPage), ssize_t{3 * kPage});
    const auto open = host->proc_held_objects(self);
    EXPECT_EQ(std::count_if(open.begin(), open.end(),
                            [](const task_held_object &object) {
                                return object.name == "memfd (unmapped)" && object.resident_size == 3 * kPage;
                            }),
              1);
    for (const task_held_object &object : open)
        EXPECT_EQ(object.flags, TASK_HELD_OPEN);
    for (const task_held_object &object : host->task_held_objects(task))
        EXPECT_EQ(object.flags, 0U);
    EXPECT_TRUE(host->task_held_objects(kNoPort).empty());
    ::close(file);
}

INSTANTIATE_TEST_SUITE_P(Hosts, HXHostContract, testing::Values("Live", "Replayed"),
                         [](const auto &host) { return std::string(host.param); });

} // namespace
