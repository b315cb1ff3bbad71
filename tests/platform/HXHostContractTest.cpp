// What HXPlatform.h promises, asked of the live host and of a replayed one that has the same process.
#include "platform/HXSafeText.h"
#include "platform/linux/HXLinuxPlatform.h"
#include "support/HXMadeUpMachine.h"
#include "support/HXPages.h"
#include "support/HXRun.h"
#include "support/HXSubject.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

namespace {

const uint64_t kPage = static_cast<uint64_t>(::sysconf(_SC_PAGESIZE));
constexpr int32_t kNobody = INT32_MAX;
constexpr mach_port_t kNoPort = 9999;

// This process, with memory between two holes: four pages, the first two written, then a page of a file whose
// path is longer than 1,024 bytes. And a process that can be made to vanish.
class HXHostContract : public testing::TestWithParam<const char *> {
  protected:
    HXHostContract() {
        std::string name;
        for (int i = 1; i <= 600; i++)
            name += i % 100 == 0 ? "é/" : "é";
        path = folder / (name + "x");
        folder.write(name + "x", std::string(kPage, 'x'));
        auto *const room =
            static_cast<char *>(::mmap(nullptr, 9 * kPage, PROT_READ, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
        char *const start = room + 2 * kPage;
        ::mprotect(start, 4 * kPage, PROT_READ | PROT_WRITE);
        ::memset(start, 1, 2 * kPage);
        const int file = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
        ::mmap(start + 4 * kPage, kPage, PROT_READ, MAP_PRIVATE | MAP_FIXED, file, 0);
        ::close(file);
        ::munmap(room, 2 * kPage);
        ::munmap(room + 7 * kPage, 2 * kPage);
        place = reinterpret_cast<uint64_t>(start);
    }
    ~HXHostContract() override { ::munmap(reinterpret_cast<void *>(place), 5 * kPage); }

    void SetUp() override {
        const std::string other = "  pid=" + std::to_string(vanishing->pid()) + "\n";
        if (GetParam() == std::string("Live"))
            host = std::make_unique<HXLinuxPlatform>();
        else
            host = std::make_unique<HXMadeUpMachine>(
                "host  self_region_heft=0  ledger=page_table  page_size=" + std::to_string(kPage) +
                "\nprocess  args_path=/heft-tests  pid=" + std::to_string(self) + "\n" +
                region(self, place, 4 * kPage, "pages=2*9") +
                region(self, place + 4 * kPage, kPage, "pager=1  pages=1*1  path=" + path) + "process" +
                other + "fault  call=mach_vm_region_recurse  error=0x10000003  becomes=gone" + other);
        ASSERT_EQ(host->task_for_pid(host->mach_task_self(), self, &task), KERN_SUCCESS);
    }
    void TearDown() override { host->mach_port_deallocate(host->mach_task_self(), task); }

    // The first mapping that ends above `address`, its place and size in pages, and how many words were
    // filled of those that there was room for.
    std::string mapping(bool isTop, mach_port_t port, uint64_t address, uint32_t words) {
        uint64_t size = 0;
        uint32_t depth = UINT32_MAX;
        vm_region_basic_info_64 basic;
        std::memset(static_cast<void *>(&info), 0xEE, sizeof info);
        const kern_return_t error =
            isTop ? host->mach_vm_region(port, &address, &size, VM_REGION_BASIC_INFO_64, &basic, &words)
                  : host->mach_vm_region_recurse(port, &address, &size, &depth, &info, &words);
        if (error != KERN_SUCCESS) return host->mach_error_string(error);
        EXPECT_EQ(depth, isTop ? UINT32_MAX : 0);
        return std::to_string((address - place) / kPage) + " +" + std::to_string(size / kPage) + ", " +
               std::to_string(words) + " words";
    }
    // The dispositions of pages.
    std::string pages(mach_port_t port, uint64_t address, uint64_t bytes) {
        std::vector<int32_t> dispositions;
        const kern_return_t error = HXPagesOf(*host, port, address, bytes, &dispositions);
        std::string text = error == KERN_SUCCESS ? "" : host->mach_error_string(error);
        for (const int32_t disposition : dispositions)
            text += std::to_string(disposition & 9);
        return text;
    }
    // The errno of an answer; 0 when it is no failure.
    static int errorOf(int32_t answer, int32_t failure = -1) { return answer == failure ? errno : 0; }

    const int32_t self = ::getpid();
    HXTemporaryFolder folder;
    std::string path;
    uint64_t place = 0;
    std::unique_ptr<HXSubject> vanishing =
        std::make_unique<HXSubject>([] { return std::vector<HXExpectedRegion>(); });
    std::unique_ptr<HXPlatform> host;
    mach_port_t task = 0;
    vm_region_submap_info_64 info{};
};

TEST_P(HXHostContract, MappingsAndPages) {
    for (const uint64_t asked : {place - 1, place, place + 4 * kPage - 1}) {
        EXPECT_EQ(mapping(false, task, asked, 19), "0 +4, 19 words");
        EXPECT_EQ(mapping(true, task, asked, 9), "0 +4, 9 words");
    }
    EXPECT_EQ(mapping(false, task, place, 9), "0 +4, 9 words");
    EXPECT_EQ(info.pages_dirtied, 0xEEEEEEEE) << "beyond the room";
    EXPECT_EQ(mapping(true, task, place, 8), "(os/kern) invalid argument");
    for (const bool isTop : {false, true})
        EXPECT_EQ(mapping(isTop, task, UINT64_MAX, 19), "(os/kern) invalid address");
    EXPECT_EQ(pages(task, place + kPage + 1, 2 * kPage), "900") << "no whole pages";
    EXPECT_EQ(pages(task, place, UINT64_MAX - place), "(os/kern) invalid address");
    EXPECT_EQ(pages(task, place, 0), "");
    EXPECT_EQ(pages(task, place, 4 * kPage + 1).substr(0, 4), "9900") << "of two mappings";
    EXPECT_EQ(pages(task, place, 6 * kPage), "(os/kern) invalid address");
    EXPECT_EQ(pages(task, place - kPage, kPage), "(os/kern) invalid address");
}

TEST_P(HXHostContract, NoSuchTaskOrProcess) {
    mach_port_t port = 0;
    ASSERT_EQ(host->task_for_pid(host->mach_task_self(), vanishing->pid(), &port), KERN_SUCCESS);
    const int32_t gone = vanishing->pid();
    vanishing.reset();
    EXPECT_EQ(mapping(false, port, 0, 19), "(ipc/send) invalid destination port");
    EXPECT_EQ(host->task_for_pid(host->mach_task_self(), kNobody, &port), KERN_FAILURE);
    for (const bool isTop : {false, true})
        EXPECT_EQ(mapping(isTop, kNoPort, place, 19), "(ipc/send) invalid destination port");
    EXPECT_EQ(pages(kNoPort, place, kPage), "(os/kern) invalid argument");
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
    EXPECT_EQ(host->proc_regionfilename(kNobody, place, buffer, sizeof buffer), 0);
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
        const int32_t length = host->proc_regionfilename(self, place + 4 * kPage, buffer, room);
        EXPECT_GE(length, static_cast<int32_t>(room) - 1);
        const std::string_view cut(buffer, static_cast<size_t>(length));
        EXPECT_TRUE(path.starts_with(cut) && HXSafeText(cut) == cut) << cut;
    }
    EXPECT_EQ(host->proc_regionfilename(self, place, buffer, sizeof buffer), 0) << "of no file";
}

INSTANTIATE_TEST_SUITE_P(Hosts, HXHostContract, testing::Values("Live", "Replayed"),
                         [](const auto &host) { return std::string(host.param); });

} // namespace
