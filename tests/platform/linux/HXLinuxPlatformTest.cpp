// The live host over a made-up /proc.
#include "platform/linux/HXLinuxPlatform.h"

#include "platform/HXRegionTags.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>

namespace {

namespace fs = std::filesystem;

// A directory made to look like /proc.
class MadeUpProc {
  public:
    MadeUpProc() {
        std::string name = fs::temp_directory_path() / "heft-proc-XXXXXX";
        if (mkdtemp(name.data()) == nullptr) abort();
        _path = name;
    }
    ~MadeUpProc() { fs::remove_all(_path); }
    MadeUpProc(const MadeUpProc &) = delete;

    std::string path() const { return _path; }
    void write(const std::string &name, const std::string &content) const {
        fs::create_directories((_path / name).parent_path());
        std::ofstream(_path / name) << content;
    }
    void link(const std::string &name, const std::string &target) const {
        fs::create_directories((_path / name).parent_path());
        fs::create_symlink(target, _path / name);
    }
    // `memory` as maps and smaps have it.
    void process(int pid, const std::string &comm, const std::string &memory, char state = 'S',
                 uint32_t flags = 4194560) const {
        const std::string folder = std::to_string(pid) + "/";
        std::ostringstream stat;
        stat << pid << " (" << comm << ") " << state << " 7 8 9 0 -1 " << flags
             << " 1 2 3 4 5 6 7 8 20 0 1 0 4242 1000 200 0 0 0 140724000000000 0 0\n";
        write(folder + "stat", stat.str());
        write(folder + "comm", comm + "\n");
        write(folder + "maps", memory);
        write(folder + "smaps", memory);
    }
    void remove(int pid) const { fs::remove_all(_path / std::to_string(pid)); }

  private:
    fs::path _path;
};

class HXLinuxPlatformTest : public testing::Test {
  protected:
    MadeUpProc proc;
    HXLinuxPlatform platform{{proc.path(), proc.path(), HXDeviceNumber(0, 1)}};

    mach_port_t open(int pid) {
        mach_port_t task = 0;
        EXPECT_EQ(platform.task_for_pid(platform.mach_task_self(), pid, &task), KERN_SUCCESS) << pid;
        return task;
    }
    std::string nameInArguments(int pid) {
        int32_t name[] = {1, 49, pid};
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

const std::string mapping = "1000-2000 rw-p 00000000 00:00 0\nRss:                  4 kB\n";

TEST_F(HXLinuxPlatformTest, ListsAndDescribesProcesses) {
    proc.process(300, "worker \x1b[1m\"x\"\n", mapping);
    proc.process(2, "kthreadd", "", 'S', 2129984);
    proc.process(40, "gone", "", 'Z');
    proc.write("50/stat", "senseless");
    proc.write("self/stat", "");
    proc.write("12monkeys", "");

    EXPECT_EQ(platform.proc_listallpids(nullptr, 0), 5);
    std::vector<int32_t> pids(10);
    const int32_t count = platform.proc_listallpids(pids.data(), 40);
    pids.resize(static_cast<size_t>(std::max(count, 0)));
    ASSERT_FALSE(pids.empty());
    EXPECT_EQ(pids.front(), 0);
    std::sort(pids.begin(), pids.end());
    EXPECT_EQ(pids, (std::vector<int32_t>{0, 40, 300}));
    EXPECT_EQ(platform.proc_listallpids(pids.data(), 8), 2) << "as many as there is room for";

    proc_bsdinfo info;
    ASSERT_EQ(platform.proc_pidinfo(300, 3, 0, &info, sizeof info), 136);
    EXPECT_EQ(std::string(info.pbi_name, strnlen(info.pbi_name, 32)), "worker ?[1m'x'?");
    EXPECT_EQ(std::string(info.pbi_comm, strnlen(info.pbi_comm, 16)), "worker ?[1m'x'?");
    EXPECT_EQ(info.pbi_ppid, 7);
    EXPECT_EQ(info.pbi_flags, PROC_FLAG_LP64);
    ASSERT_EQ(platform.proc_pidinfo(0, 3, 0, &info, sizeof info), 136);
    EXPECT_STREQ(info.pbi_name, "kernel");
    EXPECT_EQ(info.pbi_flags & PROC_FLAG_SYSTEM, PROC_FLAG_SYSTEM);
    for (const int32_t absent : {40, 2, 50, 99, -1}) {
        EXPECT_EQ(platform.proc_pidinfo(absent, 3, 0, &info, sizeof info), 0) << absent;
        EXPECT_EQ(errno, ESRCH) << absent;
    }
    proc_bsdshortinfo brief;
    ASSERT_EQ(platform.proc_pidinfo(40, 13, 1, &brief, sizeof brief), 64);
    EXPECT_EQ(brief.pbsi_status, SZOMB);
    proc.remove(300);
    EXPECT_EQ(platform.proc_pidinfo(300, 13, 1, &brief, sizeof brief), 0);
    EXPECT_EQ(errno, ESRCH);
}

TEST_F(HXLinuxPlatformTest, ReadsStatusBehindLongListsOfGroups) {
    std::string groups;
    for (int i = 0; i < 65536; i++)
        groups += std::to_string(1000000 + i) + " ";
    const std::string figures = "\nRssAnon:\t    8 kB\nVmPTE:\t    4 kB\n";
    const struct {
        std::string text;
        int32_t result;
    } cases[] = {
        {"Groups:\t1 2" + figures + "Threads:\t1\n", 0},
        {"Groups:\t" + groups + figures + "Threads:\t1\n", 0},
        {"Groups:\t" + groups + figures, -1},
    };
    for (size_t i = 0; i < std::size(cases); i++) {
        proc.write("300/status", cases[i].text);
        rusage_info_v4 usage{};
        EXPECT_EQ(platform.proc_pid_rusage(300, RUSAGE_INFO_V4, &usage), cases[i].result) << i;
        EXPECT_EQ(usage.ri_phys_heft, cases[i].result == 0 ? 12288u : 0u) << i;
    }
}

TEST_F(HXLinuxPlatformTest, NamesProcessesByWhatWasExecuted) {
    using namespace std::literals;
    const struct {
        const char *exe;
        const char *comm;
        std::string arguments;
        std::string expected;
    } cases[] = {
        {"/usr/bin/sleep", "sleep", "sleep\0100\0"s, "/usr/bin/sleep"},
        {"/usr/bin/sleep (deleted)", "sleep", "sleep\0"s, "/usr/bin/sleep"},
        {"/usr/bin/a-rather-long-program", "a-rather-long-p", "x\0"s, "/usr/bin/a-rather-long-program"},
        {"/usr/bin/python3.11", "tool.py", "/usr/bin/python3\0/opt/tool.py\0-v\0"s, "/opt/tool.py"},
        {"/usr/bin/perl", "tool", "perl\0-w\0./tool\0x\0"s, "./tool"},
        {"/usr/bin/python3.11", "python3", "python3\0/opt/tool.py\0"s,
         "/usr/bin/python3.11"}, // not by its #! line
        {"/usr/bin/node", "MainThread", "node\0server.js\0"s, "/usr/bin/node"},
        {"/usr/bin/x\x1b\"\n", "renamed", "", "/usr/bin/x?'?"},
        {"/usr/bin/none", "other", "", "/usr/bin/none"},
    };
    int pid = 1000;
    for (const auto &item : cases) {
        const std::string folder = std::to_string(++pid) + "/";
        proc.process(pid, item.comm, mapping);
        proc.link(folder + "exe", item.exe);
        proc.write(folder + "cmdline", item.arguments);
        EXPECT_EQ(nameInArguments(pid), item.expected);
    }
    std::string many;
    for (int i = 0; i < 1000; i++)
        many += "arg\0"s;
    proc.write(std::to_string(pid) + "/cmdline", many);
    EXPECT_EQ(nameInArguments(pid), "/usr/bin/none") << "256 arguments and more";
    proc.process(2000, "kthread", "");
    EXPECT_EQ(nameInArguments(2000), "error " + std::to_string(ENOENT));
    EXPECT_EQ(nameInArguments(3000), "error " + std::to_string(ESRCH));
    // Where the process's memory tells the path that was executed, it decides.
    const HXProgramName told{"/usr/bin/python3", "worker", "python3\0-c\0/opt/worker\0"sv, "/opt/worker"};
    EXPECT_EQ(HXExecutedPath(told), "/opt/worker");
    const HXProgramName renamed{"/usr/bin/node", "server.js", "node\0server.js\0"sv, "/usr/bin/node"};
    EXPECT_EQ(HXExecutedPath(renamed), "/usr/bin/node");
}

std::string smaps(const std::string &header, uint64_t rss, uint64_t anonymous, uint64_t dirty) {
    char text[512];
    snprintf(text, sizeof text,
             "%s\nRss:            %8lu kB\nShared_Dirty:   %8lu kB\nAnonymous:      %8lu kB\nVmFlags: rd \n",
             header.c_str(), rss, dirty, anonymous);
    return text;
}

TEST_F(HXLinuxPlatformTest, WalksMappings) {
    proc.process(10, "p",
                 smaps("1000-9000 r-xp 00002000 fe:01 5 /bin/a\\012b\\c", 32, 8, 4) +
                     smaps("10000-18000 rw-s 00000000 00:01 7 /SYSV00000000 (deleted)", 32, 0, 0) +
                     smaps("20000-28000 rw-s 00000000 00:33 8 /shm/x", 16, 0, 0) +
                     smaps("30000-38000 rw-s 00000000 00:34 8 /nfs/x", 16, 0, 8) +
                     smaps("34000-3a000 rw-p 00000000 00:00 0 [anon:My Arena]", 8, 8, 0) + // joined meanwhile
                     smaps("40000-48000 rw-p 00000000 00:00 0 [stack]", 8, 8, 0));
    proc.write("10/mountinfo", "1 1 0:51 / /shm rw - tmpfs tmpfs rw\n2 1 0:52 / /nfs rw - nfs4 s:/x rw\n");
    setReportsCharge(1);
    const mach_port_t task = open(10);
    static const struct {
        uint64_t start, end, dirtyPages;
        uint32_t tag;
        const char *path;
    } expected[] = {
        {0x1000, 0x9000, 2, 0, "/bin/a?b?c"},
        {0x10000, 0x18000, 8, HXHostTagSystemVSharedMemory, "/SYSV00000000 (deleted)"},
        {0x20000, 0x28000, 4, 0, "/shm/x"},
        {0x30000, 0x38000, 0, 0, "/nfs/x"},
        {0x38000, 0x3a000, 2, HXHostTagFirstNamed, ""},
        {0x40000, 0x48000, 2, HXHostTagStack, ""},
    };
    uint64_t address = 0;
    uint64_t size = 0;
    uint32_t depth = UINT32_MAX;
    uint32_t count = 19;
    vm_region_submap_info_64 info;
    for (const auto &item : expected) {
        ASSERT_EQ(platform.mach_vm_region_recurse(task, &address, &size, &depth, &info, &count),
                  KERN_SUCCESS);
        EXPECT_EQ(address, item.start);
        EXPECT_EQ(address + size, item.end);
        EXPECT_EQ(info.pages_dirtied, item.dirtyPages) << std::hex << address;
        EXPECT_EQ(info.user_tag, item.tag) << std::hex << address;
        char path[1024];
        const int32_t length = platform.proc_regionfilename(10, address, path, sizeof path);
        EXPECT_EQ(std::string(path, static_cast<size_t>(length)), item.path);
        address += size;
    }
    EXPECT_EQ(platform.mach_vm_region_recurse(task, &address, &size, &depth, &info, &count),
              KERN_INVALID_ADDRESS);
    EXPECT_EQ(platform.GXRegionTypeDescriptionForTagShareProtAndPager(HXHostTagFirstNamed, 0, 0, 0),
              "My Arena");

    address = 0x8fff; // not in order, in the middle of a mapping
    vm_region_basic_info_64 basic;
    count = 9;
    ASSERT_EQ(platform.mach_vm_region(task, &address, &size, 9, &basic, &count), KERN_SUCCESS);
    EXPECT_EQ(address, 0x1000u);
    EXPECT_EQ(uint64_t{basic.offset}, 0x2000u);
    setReportsCharge(0);
    count = 19;
    address = 0x30000;
    ASSERT_EQ(platform.mach_vm_region_recurse(task, &address, &size, &depth, &info, &count), KERN_SUCCESS);
    EXPECT_EQ(info.pages_dirtied, 2u) << "dirty pages of a file";
    EXPECT_EQ(platform.mach_vm_purgable_control(task, 0x1000, 0, nullptr), KERN_INVALID_ARGUMENT);
    platform.mach_port_deallocate(platform.mach_task_self(), task);
    EXPECT_EQ(platform.mach_vm_region_recurse(task, &address, &size, &depth, &info, &count),
              MACH_SEND_INVALID_DEST);
}

TEST_F(HXLinuxPlatformTest, ProcessesVanishAndRefuse) {
    mach_port_t task = 0;
    proc.process(2, "kthreadd", "", 'S', 2129984);
    proc.process(3, "zombie", "", 'Z');
    for (const int32_t pid : {2, 3, 4, 0, -1})
        EXPECT_EQ(platform.task_for_pid(1, pid, &task), KERN_FAILURE) << pid;

    proc.process(10, "empty", "");
    proc.process(11, "vanishes", mapping);
    proc.process(12, "recycled", mapping);
    const mach_port_t empty = open(10);
    const mach_port_t vanishes = open(11);
    const mach_port_t recycled = open(12);
    proc.remove(11);
    proc.remove(12);
    proc.process(12, "another", mapping);
    const struct {
        mach_port_t task;
        kern_return_t error;
    } cases[] = {{empty, KERN_INVALID_ADDRESS},
                 {vanishes, MACH_SEND_INVALID_DEST},
                 {recycled, MACH_SEND_INVALID_DEST}};
    for (const auto &item : cases) {
        uint64_t address = 0, size = 0;
        uint32_t depth = UINT32_MAX, count = 19;
        vm_region_submap_info_64 info;
        EXPECT_EQ(platform.mach_vm_region_recurse(item.task, &address, &size, &depth, &info, &count),
                  item.error);
        RVSymbolicator *symbolicator =
            platform.RVSymbolicatorCreateWithTaskFlagsAndNotification(item.task, 0, nullptr);
        platform.RVSymbolicatorForeachSymbolOwnerAtTime(symbolicator, kRVNow,
                                                        [](const RVSymbolOwner &) { ADD_FAILURE(); });
        platform.RVRelease(symbolicator);
    }
    rusage_info_v4 usage;
    EXPECT_NE(platform.proc_pid_rusage(11, 4, &usage), 0);
}

TEST_F(HXLinuxPlatformTest, PageTablesOfMadeUpProcess) {
    const uint64_t present = 1ULL << 63, swapped = 1ULL << 62, file = 1ULL << 61;
    proc.process(10, "p",
                 "1000-5000 rw-p 0 fe:01 5 /x\nRss:            8 kB\nAnonymous:      4 kB\nSwap: 4 kB\n" +
                     std::string("Swap:                  4 kB\nVmFlags: rd\n8000-9000 r--p 0 00:00 0\n"));
    const uint64_t entries[] = {0, present | file, present, swapped, 0};
    proc.write("10/pagemap", std::string(reinterpret_cast<const char *>(entries), sizeof entries));
    const mach_port_t task = open(10);
    int32_t pages[8];
    uint64_t count = 8;
    ASSERT_EQ(platform.mach_vm_page_range_query(task, 0x1000, 0x4000, pages, &count), KERN_SUCCESS);
    EXPECT_EQ(count, 4u);
    EXPECT_EQ((std::vector<int32_t>(pages, pages + 4)), (std::vector<int32_t>{0x81, 0x9, 0x10, 0}));
    count = 8;
    EXPECT_EQ(platform.mach_vm_page_range_query(task, 0x3000, 0x4000, pages, &count), KERN_INVALID_ADDRESS);
    count = 8;
    EXPECT_EQ(platform.mach_vm_page_range_query(task, 0x8000, 0x1000, pages, &count), KERN_INVALID_ARGUMENT)
        << "the page tables have gone";
}

TEST_F(HXLinuxPlatformTest, FiguresAndLedger) {
    proc.process(10, "p", mapping);
    const auto status = [&](int pageTable) {
        proc.write("10/status", "VmHWM: 900 kB\nRssAnon: 100 kB\nVmPTE: " + std::to_string(pageTable) +
                                    " kB\nThreads: 1\n");
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
    ASSERT_EQ(platform.proc_pid_rusage(10, 4, &usage), 0) << "without a task";

    ledger_template_info names[2];
    count = 2;
    ASSERT_EQ(platform.ledger(LEDGER_TEMPLATE_INFO, 0, names, &count), 0);
    EXPECT_EQ(count, 1);
    EXPECT_STREQ(names[0].lti_name, "page_table");
    uint32_t value = 9;
    size_t length = sizeof value;
    EXPECT_EQ(platform.sysctlbyname("vm.self_region_heft", &value, &length, nullptr, 0), 0);
    EXPECT_EQ(value, 0u);
    EXPECT_NE(platform.sysctlbyname("vm.get_owned_vmobjects", nullptr, &length, &task, 4), 0);
    EXPECT_EQ(errno, ENOENT);
}

} // namespace
