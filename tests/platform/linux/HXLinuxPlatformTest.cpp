// The live host over a made-up /proc.
#include "platform/linux/HXLinuxPlatform.h"

#include "platform/linux/pages/HXPageScan.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "support/HXCaseFile.h"
#include "support/HXHostCalls.h"
#include "support/HXTemporaryFolder.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cinttypes>
#include <cstring>
#include <filesystem>
#include <sstream>

namespace {

using namespace std::literals;

constexpr uint32_t kRegionWords = 19;
const std::string kMapping = "1000-2000 rw-p 00000000 00:00 0\nRss:                  4 kB\n";

class HXLinuxPlatformTest : public testing::Test {
  protected:
    const HXTemporaryFolder proc;
    HXLinuxPlatform platform{{proc.path(), proc.path(), HXDeviceNumber(0, 1)}};
    uint64_t address = 0, size = 0;
    vm_region_submap_info_64 info{};

    // `memory` as maps and smaps have it.
    void process(int pid, const std::string &comm, const std::string &memory, char state = 'S',
                 uint32_t flags = 4194560) const {
        const std::string folder = std::to_string(pid) + "/";
        proc.write(folder + "stat", std::to_string(pid) + " (" + comm + ") " + state + " 7 8 9 0 -1 " +
                                        std::to_string(flags) +
                                        " 1 2 3 4 5 6 7 8 20 0 1 0 4242 1000 200 0 0 0 "
                                        "140724247392256 0 0\n");
        proc.write(folder + "comm", comm + "\n");
        proc.write(folder + "maps", memory);
        proc.write(folder + "smaps", memory);
    }
    void kernelThread(int pid) const { process(pid, "kthreadd", "", 'S', 2129984); }
    mach_port_t open(int pid) { return HXTaskOf(platform, pid); }
    // The region from `address` on.
    kern_return_t region(mach_port_t task) {
        uint32_t depth = UINT32_MAX, words = kRegionWords;
        return platform.mach_vm_region_recurse(task, &address, &size, &depth, &info, &words);
    }
    // All of a process, a line each.
    std::string regions(int pid) {
        static const char *const shareModes[] = {"?", "cow", "private", "empty", "shared"};
        const mach_port_t task = open(pid);
        std::ostringstream text;
        for (address = 0; region(task) == KERN_SUCCESS; address += size) {
            char path[1024];
            const int32_t length = platform.proc_regionfilename(pid, address, path, sizeof path);
            const auto may = [&](int32_t access, char letter) {
                return info.protection & access ? letter : '-';
            };
            text << std::hex << address << "-" << address + size << " " << may(VM_PROT_READ, 'r')
                 << may(VM_PROT_WRITE, 'w') << may(VM_PROT_EXECUTE, 'x') << " " << info.offset << std::dec
                 << " "
                 << platform.GXRegionTypeDescriptionForTagShareProtAndPager(info.user_tag, 0, 0, 0)
                        .value_or(std::to_string(info.user_tag))
                 << ", " << shareModes[info.share_mode] << (info.external_pager ? " pager" : "")
                 << (info.user_wired_count ? " wired" : "") << ", resident " << info.pages_resident
                 << " dirty " << info.pages_dirtied << " swapped " << info.pages_swapped_out
                 << (length > 0 ? " " : "") << std::string(path, static_cast<size_t>(length)) << "\n";
        }
        EXPECT_EQ(region(task), KERN_INVALID_ADDRESS);
        platform.mach_port_deallocate(platform.mach_task_self(), task);
        return text.str();
    }
    std::string nameInArguments(int pid) {
        const int32_t name[] = {1, 49, pid};
        std::string area(131072, 'x');
        size_t length = area.size();
        if (platform.sysctl(name, 3, area.data(), &length) != 0) return "error " + std::to_string(errno);
        area.resize(length);
        const size_t path = area.find_first_not_of('\0', area.find('\0'));
        return area.substr(path, area.find('\0', path) - path);
    }
    void setReportsCharge(uint32_t value) {
        platform.sysctlbyname("vm.self_region_heft", nullptr, nullptr, &value, sizeof value);
    }
};

TEST_F(HXLinuxPlatformTest, ListsAndDescribesProcesses) {
    process(300, "worker \x1b[1m\"x\"\n", kMapping);
    kernelThread(2);
    process(40, "gone", "", 'Z');
    for (const char *const name : {"50/stat", "self/stat", "12monkeys"})
        proc.write(name, "senseless");

    EXPECT_EQ(platform.proc_listallpids(nullptr, 0), 5);
    std::vector<int32_t> pids(10);
    pids.resize(static_cast<size_t>(std::max(platform.proc_listallpids(pids.data(), 40), 1)));
    EXPECT_EQ(pids.front(), 0);
    std::sort(pids.begin(), pids.end());
    EXPECT_EQ(pids, (std::vector<int32_t>{0, 40, 300}));
    EXPECT_EQ(platform.proc_listallpids(pids.data(), 8), 2) << "as many as there is room for";

    proc_bsdinfo long_;
    ASSERT_EQ(platform.proc_pidinfo(300, 3, 0, &long_, sizeof long_), 136);
    EXPECT_STREQ(long_.pbi_name, "worker ?[1m'x'?");
    EXPECT_EQ(std::string(long_.pbi_comm, strnlen(long_.pbi_comm, 16)), "worker ?[1m'x'?");
    EXPECT_EQ(long_.pbi_ppid, 7);
    EXPECT_EQ(long_.pbi_flags, PROC_FLAG_LP64);
    ASSERT_EQ(platform.proc_pidinfo(0, 3, 0, &long_, sizeof long_), 136);
    EXPECT_STREQ(long_.pbi_name, "kernel");
    EXPECT_EQ(long_.pbi_flags & PROC_FLAG_SYSTEM, PROC_FLAG_SYSTEM);
    for (const int32_t absent : {40, 2, 50, 99, -1}) {
        EXPECT_EQ(platform.proc_pidinfo(absent, 3, 0, &long_, sizeof long_), 0) << absent;
        EXPECT_EQ(errno, ESRCH) << absent;
    }
    proc_bsdshortinfo brief;
    ASSERT_EQ(platform.proc_pidinfo(40, 13, 1, &brief, sizeof brief), 64);
    EXPECT_EQ(brief.pbsi_status, SZOMB);
    proc.remove("300");
    EXPECT_EQ(platform.proc_pidinfo(300, 13, 1, &brief, sizeof brief), 0);
    EXPECT_EQ(errno, ESRCH);
}

TEST_F(HXLinuxPlatformTest, NamesProcessesAsPsDoes) {
    const struct {
        const char *exe;
        const char *comm;
        std::string expected;
    } cases[] = {
        {"/usr/bin/sleep", "sleep", "/usr/bin/sleep"},
        {"/usr/bin/sleep (deleted)", "sleep", "/usr/bin/sleep"},
        {"/usr/bin/a-rather-long-program", "a-rather-long-p", "/usr/bin/a-rather-long-program"},
        {"/usr/bin/a-rather-long-program (deleted)", "a-rather-long-p", "/usr/bin/a-rather-long-program"},
        {"/usr/bin/sleeper", "sleep", "/usr/bin/sleep"},
        {"/usr/bin/python3.11", "a-rather-long-s", "/usr/bin/a-rather-long-s"}, // a script
        {"/usr/bin/redis-check-rdb", "redis-server", "/usr/bin/redis-server"},  // a link
        {"/memfd:x (deleted)", "3", "/3"},
        {"/usr/bin/x", "a\x1b\"\n", "/usr/bin/a?'?"},
        {"/usr/bin/x", "kworker/0:1", "error 2"}, // the last component would be another name
        {"/usr/bin/x", "", "error 2"},
    };
    int pid = 1000;
    for (const auto &item : cases) {
        const std::string folder = std::to_string(++pid) + "/";
        process(pid, item.comm, kMapping);
        proc.link(folder + "exe", item.exe);
        EXPECT_EQ(nameInArguments(pid), item.expected);
        proc_bsdinfo record;
        ASSERT_EQ(platform.proc_pidinfo(pid, 3, 0, &record, sizeof record), 136);
        const std::string recorded(record.pbi_comm, strnlen(record.pbi_comm, 16));
        const bool isCutOrReplaced = recorded.size() == 15 || recorded.find('?') != std::string::npos;
        EXPECT_EQ(platform.isNamedByRecord(record), !isCutOrReplaced);
        if (!isCutOrReplaced && item.expected.starts_with('/')) {
            EXPECT_TRUE(item.expected.ends_with('/' + recorded));
        }
    }
    process(2000, "kthread", "");
    EXPECT_EQ(nameInArguments(2000), "error " + std::to_string(ENOENT));
    EXPECT_EQ(nameInArguments(3000), "error " + std::to_string(ESRCH));
}

// The leader of process 10 has ended; thread 12 runs.
TEST_F(HXLinuxPlatformTest, ReadsProcessesThroughALiveThread) {
    const auto stat = [](int pid, const char *state, const char *threads, const char *stack) {
        return std::to_string(pid) + " (worker) " + state + " 7 8 9 0 -1 64 1 2 3 4 5 6 7 8 20 0 " + threads +
               " 0 4242 1000 200 0 0 0 " + stack + " 0 0\n";
    };
    process(10, "worker", "");
    process(11, "worker", "");
    process(12, "worker", kMapping);
    proc.write("10/stat", stat(10, "Z", "3", "0"));
    proc.write("11/stat", stat(11, "Z", "3", "0"));
    proc.write("12/stat", stat(12, "S", "3", "4294967040"));
    proc.link("12/exe", "/bin/worker");
    for (const char *const thread : {"10/task/10/stat", "10/task/11/stat", "10/task/12/stat"})
        proc.write(thread, "");
    proc_bsdinfo long_;
    ASSERT_EQ(platform.proc_pidinfo(10, 3, 0, &long_, sizeof long_), 136);
    EXPECT_EQ(long_.pbi_flags, 0u) << "the thread's stack lies low";
    proc_bsdshortinfo brief;
    ASSERT_EQ(platform.proc_pidinfo(10, 13, 1, &brief, sizeof brief), 64);
    EXPECT_EQ(brief.pbsi_status, 0u);
    EXPECT_EQ(nameInArguments(10), "/bin/worker");
    EXPECT_EQ(region(open(10)), KERN_SUCCESS);
    proc.write("12/stat", stat(12, "Z", "3", "0"));
    mach_port_t task = 0;
    EXPECT_EQ(platform.task_for_pid(1, 10, &task), KERN_FAILURE) << "all have ended by now";
}

TEST_F(HXLinuxPlatformTest, TellsWhatRegionsMappingsAre) {
    int pid = 10;
    for (const HXCase &each : HXReadCases("linux-regions.txt"))
        for (const auto &[label, expected] : each.expected) {
            process(++pid, "p", each.input);
            proc.write(std::to_string(pid) + "/mountinfo",
                       "1 1 0:40 / /dev/shm rw - tmpfs tmpfs rw\n1 1 0:51 / /shm rw - tmpfs tmpfs rw\n"
                       "2 1 0:52 / /nfs rw - nfs4 s:/x rw\n3 1 254:0 / / rw - ext4 /dev/x rw\n");
            setReportsCharge(label == "charge");
            EXPECT_EQ(regions(pid), expected) << each.title << " " << label;
        }
}

TEST_F(HXLinuxPlatformTest, FindsMappingsInAnyOrder) {
    process(10, "p", "1000-9000 r-xp 00002000 fe:01 5 /bin/a\n10000-18000 rw-p 00000000 00:00 0\n");
    const mach_port_t task = open(10);
    EXPECT_EQ(HXRegionAt(platform, task, 0x9000, &info), "10000+8000");
    EXPECT_EQ(HXRegionAt(platform, task, 0x8fff, nullptr), "1000+8000");
    platform.mach_port_deallocate(platform.mach_task_self(), task);
    EXPECT_EQ(region(task), MACH_SEND_INVALID_DEST);
}

// The list's records serve for opening, but not for what has ended since.
TEST_F(HXLinuxPlatformTest, ProcessesEndAfterTheyWereListed) {
    process(5, "runs", kMapping);
    process(6, "ends", kMapping);
    process(7, "goes", kMapping);
    EXPECT_EQ(platform.proc_listallpids(nullptr, 0), 4);
    process(8, "comes", kMapping); // one list is of one moment
    int32_t pids[10];
    EXPECT_EQ(platform.proc_listallpids(pids, sizeof pids), 4);
    EXPECT_EQ(platform.proc_listallpids(pids, sizeof pids), 5);
    process(6, "ends", "", 'Z');
    for (const char *const file : {"7/stat", "7/comm", "7/maps", "7/smaps"})
        proc.remove(file);
    proc.remove("5/stat");
    mach_port_t task = 0;
    EXPECT_EQ(platform.task_for_pid(1, 6, &task), KERN_FAILURE);
    EXPECT_EQ(platform.task_for_pid(1, 7, &task), KERN_FAILURE);
    proc.write("5/status", "VmRSS:\t      12 kB\nThreads:\t1\n");
    EXPECT_EQ(platform.task_for_pid(1, 5, &task), KERN_SUCCESS) << "its record is read once";
}

TEST_F(HXLinuxPlatformTest, ProcessesVanishAndRefuse) {
    mach_port_t task = 0;
    kernelThread(2);
    process(3, "zombie", "", 'Z');
    EXPECT_EQ(platform.getpid(), -1) << "none of these processes";
    proc.link("self", "2");
    EXPECT_EQ(platform.getpid(), 2);
    for (const int32_t pid : {3, 4, 2, 0, -1})
        EXPECT_EQ(platform.task_for_pid(1, pid, &task), KERN_FAILURE) << pid;

    // Its memory goes before itself.
    process(5, "dying", "", 'R');
    proc.write("5/stat", "5 (dying) R 7 8 9 0 -1 64 1 2 3 4 5 6 7 8 20 0 1 0 4242 0 0 0 0 0 0 0 0\n");
    EXPECT_EQ(platform.task_for_pid(1, 5, &task), KERN_FAILURE);
    proc_bsdshortinfo brief;
    ASSERT_EQ(platform.proc_pidinfo(5, 13, 1, &brief, sizeof brief), 64);
    EXPECT_EQ(brief.pbsi_status, SZOMB);

    process(10, "empty", "");
    process(11, "vanishes", kMapping);
    process(12, "recycled", kMapping);
    const mach_port_t tasks[] = {open(10), open(11), open(12)};
    proc.remove("11");
    proc.remove("12");
    process(12, "another", kMapping);
    for (const mach_port_t each : tasks) {
        EXPECT_EQ(region(each), each == tasks[0] ? KERN_INVALID_ADDRESS : MACH_SEND_INVALID_DEST);
        RVSymbolicator *images = platform.RVSymbolicatorCreateWithTaskFlagsAndNotification(each, 0, nullptr);
        platform.RVSymbolicatorForeachSymbolOwnerAtTime(images, kRVNow,
                                                        [](const RVSymbolOwner &) { ADD_FAILURE(); });
        platform.RVRelease(images);
    }
    rusage_info_v4 usage;
    EXPECT_NE(platform.proc_pid_rusage(11, 4, &usage), 0);
}

// With fewer descriptors than processes.
TEST_F(HXLinuxPlatformTest, ReadsMoreProcessesThanItMayOpenFiles) {
    rlimit before, few;
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
    constexpr int count = 60;
    for (int pid = 1; pid <= count; pid++)
        process(pid, "p", kMapping);
    // The undefined-behaviour sanitizer opens a pipe when it first meets a class.
    const mach_port_t first = open(1);
    EXPECT_EQ(region(first), KERN_SUCCESS);
    platform.mach_port_deallocate(1, first);
    // Those that are open already, and ten.
    few = before;
    few.rlim_cur = static_cast<rlim_t>(::open("/dev/null", O_RDONLY | O_CLOEXEC)) + 10;
    setrlimit(RLIMIT_NOFILE, &few);
    std::vector<mach_port_t> tasks;
    for (int pid = 1; pid <= count; pid++)
        tasks.push_back(open(pid));
    for (size_t i = 0; i < tasks.size() / 2; i++) {
        address = 0;
        EXPECT_EQ(region(tasks[i]), KERN_SUCCESS) << i;
        platform.mach_port_deallocate(1, tasks[i]);
    }
    std::vector<HXDescriptor> taken; // none is left
    while (taken.empty() || taken.back())
        taken.push_back(HXOpenAt(AT_FDCWD, "/dev/null"));
    address = 0;
    mach_port_t refused = 0;
    EXPECT_EQ(region(tasks[count - 2]), KERN_RESOURCE_SHORTAGE);
    EXPECT_EQ(platform.task_for_pid(1, 1, &refused), KERN_RESOURCE_SHORTAGE);
    int32_t pids[count];
    EXPECT_EQ(platform.proc_listallpids(pids, sizeof pids), -1);
    taken.clear();
    setrlimit(RLIMIT_NOFILE, &before);
    ::close(static_cast<int>(few.rlim_cur) - 10);
    proc.write("60/stat", "60 (p) S 7 8 9 0 -1 64 1 2 3 4 5 6 7 8 20 0 1 0 4243 1000 200 0 0 0 0 0 0\n");
    EXPECT_EQ(region(tasks[count - 1]), MACH_SEND_INVALID_DEST) << "another process has the pid now";
}

TEST_F(HXLinuxPlatformTest, ReadsPageTables) {
    process(
        10, "p",
        "1000-9000 rw-p 0 fe:01 5 /x\n"
        "Rss:                  16 kB\nAnonymous:            12 kB\nLazyFree:              4 kB\n"
        "Swap:                  4 kB\nVmFlags: rd\n9000-a000 rw-p 0 00:06 7 /dev/driver\nVmFlags: rd\n"
        "a000-c000 rw-s 0 00:01 8 /memfd:x (deleted)\nRss:                   4 kB\nVmFlags: rd\n"
        "c000-e000 rw-s 0 00:0f 9 /pool\nShared_Hugetlb: 4 kB\nVmFlags: rd ht\n20000-21000 r--p 0 00:00 0\n");
    constexpr uint64_t present = 1ULL << 63, swapped = 1ULL << 62, file = 1ULL << 61, guard = 1ULL << 58;
    const uint64_t entries[] = {
        0,       present | file, present, swapped,        swapped, guard | swapped, present, present, 0,
        present, present | file, 0,       present | file, 0};
    proc.write("10/pagemap", {reinterpret_cast<const char *>(entries), sizeof entries});
    const mach_port_t task = open(10);
    const struct {
        uint64_t from, bytes;
        const char *expected;
    } cases[] = {
        {0x1000, 0x7000, "81 801 10 0 0 9 9"},
        {0x3001, 0x1fff, "10 0"}, // back, and rounded to pages
        {0x6000, 0x1000, "9"},    // what lies before has been counted
        {0x2000, 0x1000, "801"},
        {0x9000, 0x5000, "0 9 0 9 0"}, // a driver's, shared memory, the huge-page pool
        {0xd000, 0x2000, "(os/kern) invalid address"},
        {0x20000, 0x1000, "(os/kern) invalid argument"}, // the page tables have gone
    };
    for (const auto &[from, bytes, expected] : cases)
        EXPECT_EQ(HXPagesAt(platform, task, from, bytes), expected) << std::hex << from;
}

TEST_F(HXLinuxPlatformTest, ReadsNoPageTablesBehindTheLastPage) {
    constexpr uint64_t bytes = uint64_t{1} << 46, pages = bytes / 4096; // which nobody would read one by one
    process(10, "p",
            "0-400000000000 rw-s 0 00:01 8 /memfd:x (deleted)\nRss:                   8 kB\nVmFlags: rd\n");
    std::string entries(5000 * 8, '\0');
    entries[7] = entries.back() = static_cast<char>(0xA0); // present, of the object
    proc.write("10/pagemap", entries);
    std::filesystem::resize_file(proc / "10/pagemap", pages * 8);
    std::vector<vm_page_run> runs;
    uint64_t told = 0;
    ASSERT_EQ(platform.mach_vm_page_range_query(open(10), 0, bytes, &runs, &told), KERN_SUCCESS);
    EXPECT_EQ(told, pages);
    ASSERT_EQ(runs.size(), 2u);
    EXPECT_EQ(runs[1].address, 4999u * 4096);
}

TEST_F(HXLinuxPlatformTest, LeavesThePagesOfAnotherProgramAlone) {
    // The fixture's processes have their stack at 0x7ffceac6f000.
    const std::pair<const char *, const char *> cases[] = {
        {"7ffceac60000-7ffceac6f000", "0"},
        {"7ffceac60000-7ffceac6e000", "(os/kern) invalid argument"},
        {"7ffceac70000-7ffceac7f000", "(os/kern) invalid argument"}};
    int pid = 10;
    for (const auto &[range, expected] : cases) {
        process(++pid, "p", "0-1000 rw-p 0 00:00 0\n"s + range + " rw-p 0 00:00 0 [stack]\n");
        proc.write(std::to_string(pid) + "/pagemap", std::string(8, '\0'));
        EXPECT_EQ(HXPagesAt(platform, open(pid), 0, 0x1000), expected) << range;
    }
    process(14, "p", "0-1000 rw-p 0 00:00 0\n");
    EXPECT_EQ(HXPagesAt(platform, open(14), 0, 0x1000), "(os/kern) invalid argument") << "without any";
}

TEST_F(HXLinuxPlatformTest, TellsWhenMemoryMovedWhileItWasRead) {
    const std::string anonymous = "10000000-40000000 rw-p 00000000 00:00 0 \n"
                                  "Rss:              204800 kB\nAnonymous:        204800 kB\nVmFlags: rd \n";
    const std::string resident = "\nRss:              102400 kB\nVmFlags: rd \n";
    const std::string memfd = "50000000-90000000 rw-s 00000000 00:01 5 /memfd:x (deleted)" + resident;
    const std::string driver = "a0000000-b0000000 rw-s 00000000 00:05 5 /dev/dri/card0" + resident;
    const struct {
        std::string memory;
        uint64_t rssAnon, rssShmem, swap;                      // KiB
        std::optional<std::pair<uint64_t, uint64_t>> expected; // KiB
    } cases[] = {
        {anonymous, 204800, 0, 0, {}},
        {anonymous, 206800, 0, 0, {}}, // less than 1 %
        {anonymous, 150000, 0, 60000, std::pair(204800, 210000)},
        {anonymous, 100000, 0, 0, std::pair(204800, 100000)},
        {anonymous + memfd, 204800, 102400, 0, {}},
        {anonymous + memfd, 204800, 204800, 0, std::pair(307200, 409600)},
        {anonymous + driver, 204800, 0, 0, {}}, // which a driver counts or not
        {anonymous + driver, 204800, 102400, 0, {}},
    };
    int pid = 10;
    for (const auto &item : cases) {
        process(++pid, "p", item.memory);
        proc.write(std::to_string(pid) + "/status", "RssAnon: " + std::to_string(item.rssAnon) +
                                                        " kB\nRssShmem: " + std::to_string(item.rssShmem) +
                                                        " kB\nVmSwap: " + std::to_string(item.swap) +
                                                        " kB\nVmPTE: 4 kB\nVmRSS: 1 kB\nThreads: 1\n");
        const auto difference = platform.walkDifference(open(pid));
        ASSERT_EQ(difference.has_value(), item.expected.has_value()) << pid;
        if (!difference) continue;
        EXPECT_EQ(difference->regionsSize, item.expected->first * 1024) << pid;
        EXPECT_EQ(difference->countersSize, item.expected->second * 1024) << pid;
    }
}

// A page of the test's own, in a made-up process that has the test's page tables.
alignas(4096) char ownPage[4096] = {1};

TEST_F(HXLinuxPlatformTest, OpensWithoutWaitingAndClosesOnExecution) {
    const std::string fifo = proc.path().native() + "/fifo";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
    const HXDescriptor file = HXOpenAt(AT_FDCWD, fifo.c_str()); // nobody writes to it
    EXPECT_EQ(::fcntl(file.get(), F_GETFD), FD_CLOEXEC);
}

TEST_F(HXLinuxPlatformTest, CountsFromPageTablesOnlyWhereTheyTellEnough) {
    if (!HXPageScan::isComplete()) GTEST_SKIP() << "the kernel's answers are not complete";
    HXFileSystems fileSystems(proc.path(), HXDeviceNumber(0, 1));
    HXNamedTags tags;
    proc.write("mountinfo", "1 1 0:53 / /huge rw - hugetlbfs none rw\n");
    proc.link("pagemap", "/proc/self/pagemap");
    static_cast<volatile char *>(ownPage)[0] = 2; // now it is in memory
    const HXDescriptor directory = HXOpenAt(AT_FDCWD, proc.path().c_str());
    const auto sourceFor = [&](const std::string &question) -> std::string {
        const std::vector<std::string> words = HXWordsOf(question);
        char range[64];
        const auto start = reinterpret_cast<uint64_t>(ownPage);
        snprintf(range, sizeof range, "%" PRIx64 "-%" PRIx64 " ", start, start + sizeof ownPage);
        // Behind it one that is large enough to be walked by itself.
        const std::string maps = range + words.at(0) + "\n7e0000000000-7e0000400000 rw-p 0 00:00 0\n";
        proc.write("maps", maps);
        proc.write("smaps", maps);
        std::string status = words.at(1);
        std::replace(status.begin(), status.end(), ',', '\n');
        proc.write("status", status + "\nThreads: 1\n");
        proc.write("vmstat", "pglazyfree " + words.at(2) + "\n");
        proc.write("smaps_rollup", "LazyFree: " + words.at(3) + " kB\n");
        HXMachineFacts machine(proc.path());
        const auto read = HXReadAddressSpace({directory, {}, false, std::chrono::steady_clock::now()},
                                             {&fileSystems, &machine, &tags, 12, true});
        return read->knowsDirtyPages ? "smaps" : "page tables";
    };
    for (const HXCase &each : HXReadCases("linux-sources.txt"))
        EXPECT_EQ(HXAnswered(each.input, sourceFor), each.input);
}

TEST_F(HXLinuxPlatformTest, FiguresAndLedger) {
    process(10, "p", kMapping);
    const auto status = [&](int pageTable) {
        proc.write("10/status", "VmHWM: 900 kB\nRssAnon: 100 kB\nRssShmem: 0 kB\nVmSwap: 0 kB\nVmPTE: " +
                                    std::to_string(pageTable) + " kB\nThreads: 1\n");
    };
    status(8);
    const mach_port_t task = open(10);
    rusage_info_v4 usage;
    ledger_entry_info entry;
    int64_t count = 3;
    ASSERT_EQ(platform.proc_pid_rusage(10, 4, &usage), 0);
    status(16);
    ASSERT_EQ(platform.ledger(LEDGER_ENTRY_INFO, 10, &entry, &count), 0);
    EXPECT_EQ(usage.ri_phys_heft, 108u * 1024);
    EXPECT_EQ(usage.ri_lifetime_max_phys_heft, 908u * 1024);
    EXPECT_EQ(entry.lei_balance, 8 * 1024) << "both of one reading";
    EXPECT_EQ(count, 1);
    ASSERT_EQ(platform.proc_pid_rusage(10, 4, &usage), 0);
    EXPECT_EQ(usage.ri_phys_heft, 116u * 1024) << "read anew";
    platform.mach_port_deallocate(1, task);

    ledger_template_info names[2];
    count = 2;
    ASSERT_EQ(platform.ledger(LEDGER_TEMPLATE_INFO, 0, names, &count), 0);
    EXPECT_EQ(count, 1);
    EXPECT_STREQ(names[0].lti_name, "page_table");
    uint32_t value = 9;
    size_t length = sizeof value;
    EXPECT_EQ(platform.sysctlbyname("vm.self_region_heft", &value, &length, nullptr, 0), 0);
    EXPECT_EQ(value, 0u);
    const int32_t otherNames[] = {6, 8};
    EXPECT_NE(platform.sysctl(otherNames, 2, &value, &length), 0);
    EXPECT_NE(platform.sysctlbyname("vm.get_owned_vmobjects", nullptr, &length, &task, 4), 0);
    EXPECT_EQ(errno, ENOENT);

    // The figures may stand behind long lists of groups; what is cut has none.
    std::string groups = "Groups:\t";
    for (int i = 0; i < 65536; i++)
        groups += std::to_string(1000000 + i) + " ";
    for (const std::string end : {"Threads:\t1\n", ""}) {
        proc.write("10/status",
                   groups + "\nRssAnon:\t8 kB\nRssShmem:\t0 kB\nVmPTE:\t4 kB\nVmSwap:\t0 kB\n" + end);
        usage = {};
        EXPECT_EQ(platform.proc_pid_rusage(10, RUSAGE_INFO_V4, &usage), end.empty() ? -1 : 0);
        EXPECT_EQ(usage.ri_phys_heft, end.empty() ? 0u : 12288u);
    }
}

} // namespace
