// What HXPlatform.h promises, asked of the live host and of a replayed one that has the same process.
#include "platform/HXSafeText.h"
#include "platform/linux/HXLinuxPlatform.h"
#include "support/HXMadeUpMachine.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {

const uint64_t kPage = static_cast<uint64_t>(::sysconf(_SC_PAGESIZE));
constexpr int32_t kNobody = INT32_MAX;
constexpr mach_port_t kNoPort = 9999;

// This process, with memory between two holes: four pages, the first two written, then one page of a file
// whose path is longer than 1,024 bytes. And a process that vanishes once its task is open.
class HXHostContract : public testing::TestWithParam<const char *> {
  protected:
    HXHostContract() {
        std::string name = "x";
        while (path.size() < 1200) {
            for (int i = 0; i < 100; i++)
                name += "é";
            path =
                folder / (path.empty() ? name : path.substr(folder.path().string().size() + 1) + "/" + name);
            name.clear();
        }
        folder.write(path.substr(folder.path().string().size() + 1), std::string(kPage, 'x'));
        constexpr int anonymous = MAP_PRIVATE | MAP_ANONYMOUS;
        auto *const room = static_cast<char *>(::mmap(nullptr, 9 * kPage, PROT_READ, anonymous, -1, 0));
        place = reinterpret_cast<uint64_t>(room) + 2 * kPage;
        ::mprotect(room + 2 * kPage, 4 * kPage, PROT_READ | PROT_WRITE);
        ::memset(room + 2 * kPage, 1, 2 * kPage);
        const int file = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
        ::mmap(room + 6 * kPage, kPage, PROT_READ, MAP_PRIVATE | MAP_FIXED, file, 0);
        ::close(file);
        ::munmap(room, 2 * kPage);
        ::munmap(room + 7 * kPage, 2 * kPage);
        if (::pipe(ends) != 0 || (child = ::fork()) != 0) return;
        char byte;
        ::close(ends[1]); // the parent's own is then the last
        _exit(static_cast<int>(::read(ends[0], &byte, 1)));
    }
    ~HXHostContract() override { ::munmap(reinterpret_cast<void *>(place), 5 * kPage); }

    void SetUp() override {
        if (GetParam() == std::string("Live")) {
            host = std::make_unique<HXLinuxPlatform>();
        } else {
            const std::string pid = "  pid=" + std::to_string(::getpid());
            const std::string gone = "  pid=" + std::to_string(child);
            const auto at = [&](uint64_t page, uint64_t pages) {
                return "  address=" + std::to_string(place + page * kPage) +
                       "  size=" + std::to_string(pages * kPage);
            };
            host = std::make_unique<HXMadeUpMachine>(
                "host  page_size=" + std::to_string(kPage) + "  self_region_heft=0  ledger=page_table" + pid +
                "\nprocess  args_path=/heft-tests  heft=1  page_table=1" + pid + "\nregion" + pid + at(0, 4) +
                "  resident=2  pages=2*9\nregion" + pid + at(4, 1) + "  pager=1  pages=1*0x81  path=" + path +
                "\nprocess" + gone + "\nregion" + gone + at(0, 4) + "\nfault" + gone +
                "  call=mach_vm_region_recurse  error=0x10000003  becomes=gone\n");
        }
        ASSERT_EQ(host->task_for_pid(host->mach_task_self(), ::getpid(), &task), KERN_SUCCESS);
    }
    void TearDown() override { host->mach_port_deallocate(host->mach_task_self(), task); }

    // The first leaf mapping that ends above `address`, asked for with room for so many words.
    kern_return_t recurse(mach_port_t port, uint64_t from, uint32_t room = VM_REGION_SUBMAP_INFO_COUNT_64) {
        address = from;
        depth = UINT32_MAX;
        words = room;
        std::memset(static_cast<void *>(&info), 0xEE, sizeof info);
        return host->mach_vm_region_recurse(port, &address, &size, &depth, &info, &words);
    }
    kern_return_t top(mach_port_t port, uint64_t from, int32_t flavor = VM_REGION_BASIC_INFO_64,
                      uint32_t room = VM_REGION_BASIC_INFO_COUNT_64) {
        address = from;
        words = room;
        return host->mach_vm_region(port, &address, &size, flavor, &basic, &words);
    }
    kern_return_t pages(mach_port_t port, uint64_t from, uint64_t bytes, uint64_t room) {
        count = room;
        return host->mach_vm_page_range_query(port, from, bytes, dispositions, &count);
    }
    // The errno of an answer; 0 when it is no failure.
    static int errorOf(int32_t answer, int32_t failure = -1) { return answer == failure ? errno : 0; }

    HXTemporaryFolder folder;
    std::string path;
    uint64_t place = 0;
    int ends[2] = {-1, -1};
    pid_t child = -1;
    std::unique_ptr<HXPlatform> host;
    mach_port_t task = 0;
    uint64_t address = 0, size = 0, count = 0;
    uint32_t depth = 0, words = 0;
    vm_region_submap_info_64 info{};
    vm_region_basic_info_64 basic{};
    int32_t dispositions[8] = {};
};

TEST_P(HXHostContract, Mappings) {
    for (const uint64_t asked : {place - 1, place, place + 4 * kPage - 1}) {
        ASSERT_EQ(recurse(task, asked), KERN_SUCCESS);
        EXPECT_EQ((std::vector<uint64_t>{address, size, depth, words}),
                  (std::vector<uint64_t>{place, 4 * kPage, 0, VM_REGION_SUBMAP_INFO_COUNT_64}));
        ASSERT_EQ(top(task, asked), KERN_SUCCESS);
        EXPECT_EQ((std::vector<uint64_t>{address, size, words, static_cast<uint64_t>(basic.protection)}),
                  (std::vector<uint64_t>{place, 4 * kPage, VM_REGION_BASIC_INFO_COUNT_64, 3}));
    }
    ASSERT_EQ(recurse(task, place, 9), KERN_SUCCESS);
    EXPECT_EQ(words, 9U);
    EXPECT_EQ(info.pages_dirtied, 0xEEEEEEEE) << "beyond the room";
    EXPECT_EQ(info.protection, 3);
    EXPECT_EQ(top(task, place, VM_REGION_BASIC_INFO_64, VM_REGION_BASIC_INFO_COUNT_64 - 1),
              KERN_INVALID_ARGUMENT);
    EXPECT_EQ(top(task, place, 10), KERN_INVALID_ARGUMENT);
    EXPECT_EQ(recurse(task, UINT64_MAX), KERN_INVALID_ADDRESS);
    EXPECT_EQ(top(task, UINT64_MAX), KERN_INVALID_ADDRESS);
}

TEST_P(HXHostContract, Pages) {
    constexpr int32_t own = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;
    ASSERT_EQ(pages(task, place + kPage + 1, 2 * kPage, 8), KERN_SUCCESS) << "no whole pages";
    EXPECT_EQ(count, 3U);
    EXPECT_EQ(std::vector(dispositions, dispositions + 3), (std::vector<int32_t>{own, 0, 0}));
    ASSERT_EQ(pages(task, place, UINT64_MAX, 2), KERN_SUCCESS) << "more than there is room for";
    EXPECT_EQ(count, 2U);
    EXPECT_EQ(pages(task, place, 0, 8), KERN_SUCCESS);
    EXPECT_EQ(count, 0U);
    EXPECT_EQ(pages(task, place, 5 * kPage, 8), KERN_SUCCESS) << "of two mappings";
    EXPECT_EQ(pages(task, place, 6 * kPage, 8), KERN_INVALID_ADDRESS);
    EXPECT_EQ(pages(task, place - kPage, kPage, 8), KERN_INVALID_ADDRESS);
}

TEST_P(HXHostContract, NoSuchTaskOrProcess) {
    mach_port_t none = 0;
    EXPECT_EQ(host->task_for_pid(host->mach_task_self(), kNobody, &none), KERN_FAILURE);
    EXPECT_EQ(recurse(kNoPort, place), MACH_SEND_INVALID_DEST);
    EXPECT_EQ(top(kNoPort, place), MACH_SEND_INVALID_DEST);
    EXPECT_EQ(pages(kNoPort, place, kPage, 8), KERN_INVALID_ARGUMENT);
    int32_t state = 0;
    EXPECT_NE(host->mach_vm_purgable_control(kNoPort, place, VM_PURGABLE_GET_STATE, &state), KERN_SUCCESS);
    EXPECT_EQ(host->RVSymbolicatorCreateWithTaskFlagsAndNotification(kNoPort, 0, nullptr), nullptr);

    proc_bsdinfo record;
    rusage_info_v4 usage;
    ledger_entry_info entry;
    int64_t entries = 1;
    char buffer[8];
    const int32_t area[] = {CTL_KERN, KERN_PROCARGS2, kNobody};
    size_t bytes = sizeof buffer;
    for (const int32_t flavor : {PROC_PIDTBSDINFO, PROC_PIDT_SHORTBSDINFO})
        EXPECT_EQ(errorOf(host->proc_pidinfo(kNobody, flavor, 0, &record, sizeof record), 0), ESRCH);
    EXPECT_EQ(errorOf(host->proc_pid_rusage(kNobody, RUSAGE_INFO_V4, &usage)), ESRCH);
    EXPECT_EQ(errorOf(host->ledger(LEDGER_ENTRY_INFO, kNobody, &entry, &entries)), ESRCH);
    EXPECT_EQ(errorOf(host->sysctl(area, 3, buffer, &bytes)), ESRCH);
    EXPECT_EQ(host->proc_regionfilename(kNobody, place, buffer, sizeof buffer), 0);
}

TEST_P(HXHostContract, ProcessThatVanishes) {
    ASSERT_EQ(host->task_for_pid(host->mach_task_self(), child, &task), KERN_SUCCESS);
    ::close(ends[1]);
    ASSERT_EQ(::waitpid(child, nullptr, 0), child);
    EXPECT_EQ(recurse(task, 0), MACH_SEND_INVALID_DEST);
    proc_bsdshortinfo record;
    EXPECT_EQ(errorOf(host->proc_pidinfo(child, PROC_PIDT_SHORTBSDINFO, 1, &record, sizeof record), 0),
              ESRCH);
}

TEST_P(HXHostContract, LittleRoomAndUnknownQuestions) {
    const int32_t self = ::getpid();
    char buffer[1030] = {};
    EXPECT_EQ(errorOf(host->proc_pidinfo(self, PROC_PIDTBSDINFO, 0, buffer, 135), 0), ENOMEM);
    EXPECT_EQ(errorOf(host->proc_pidinfo(self, PROC_PIDT_SHORTBSDINFO, 1, buffer, 63), 0), ENOMEM);
    EXPECT_EQ(errorOf(host->proc_pidinfo(self, 99, 0, buffer, sizeof buffer), 0), EINVAL);
    rusage_info_v4 usage;
    EXPECT_EQ(errorOf(host->proc_pid_rusage(self, RUSAGE_INFO_V4 + 1, &usage)), EINVAL);
    int64_t entries = 0;
    EXPECT_EQ(errorOf(host->ledger(99, self, buffer, &entries)), EINVAL);
    EXPECT_EQ(host->ledger(LEDGER_TEMPLATE_INFO, 0, buffer, &entries), 0);
    EXPECT_EQ(entries, 0);
    int32_t pids[2] = {};
    EXPECT_EQ(host->proc_listallpids(pids, 7), 1);
    EXPECT_GE(host->proc_listallpids(nullptr, 0), 2);

    const int32_t maximum[] = {CTL_KERN, KERN_ARGMAX}, area[] = {CTL_KERN, KERN_PROCARGS2, self},
                  other[] = {1, 9};
    size_t bytes = 3;
    EXPECT_EQ(errorOf(host->sysctl(maximum, 2, buffer, &bytes)), ENOMEM);
    EXPECT_EQ(errorOf(host->sysctl(other, 2, buffer, &bytes)), ENOENT);
    bytes = 6;
    EXPECT_EQ(host->sysctl(area, 3, buffer, &bytes), 0);
    EXPECT_EQ(bytes, 6U);
    EXPECT_EQ(host->sysctl(area, 3, nullptr, &bytes), 0);
    EXPECT_GT(bytes, 6U);
    EXPECT_EQ(errorOf(host->sysctlbyname("vm.other", buffer, &bytes, nullptr, 0)), ENOENT);
    const char *const setting = "vm.self_region_heft";
    const int32_t one = 1;
    EXPECT_EQ(errorOf(host->sysctlbyname(setting, nullptr, nullptr, &one, 3)), EINVAL);
    bytes = 3;
    EXPECT_EQ(errorOf(host->sysctlbyname(setting, buffer, &bytes, &one, sizeof one)), ENOMEM);
    bytes = 5;
    EXPECT_EQ(host->sysctlbyname(setting, buffer, &bytes, nullptr, 0), 0);
    EXPECT_EQ(std::string(buffer, bytes), std::string(4, '\0')) << "not changed by the calls that failed";
}

TEST_P(HXHostContract, PathsAreCutToWholeCharacters) {
    char buffer[1030];
    ASSERT_EQ(recurse(task, place + 4 * kPage), KERN_SUCCESS);
    EXPECT_NE(info.external_pager, 0);
    for (uint32_t room = 1015; room <= 1024; room++) {
        const int32_t length = host->proc_regionfilename(::getpid(), address, buffer, room);
        EXPECT_GE(length, static_cast<int32_t>(room) - 1);
        const std::string_view cut(buffer, static_cast<size_t>(length));
        EXPECT_TRUE(path.starts_with(cut) && HXSafeText(cut) == cut) << cut;
    }
    EXPECT_EQ(host->proc_regionfilename(::getpid(), place, buffer, sizeof buffer), 0) << "of no file";
}

INSTANTIATE_TEST_SUITE_P(Hosts, HXHostContract, testing::Values("Live", "Replayed"),
                         [](const auto &host) { return std::string(host.param); });

} // namespace
