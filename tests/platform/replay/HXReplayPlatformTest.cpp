// What a replayed machine answers.
#include "platform/replay/HXReplayPlatform.h"
#include "platform/HXRegionTags.h"
#include "support/HXBarePlatform.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>

namespace {

class HXReplay : public testing::Test {
  protected:
    // Loads a machine; a bar stands for each TAB.
    void load(std::string records) {
        std::replace(records.begin(), records.end(), '|', '\t');
        std::string reason;
        host.reset();
        machine = HXMachine::loadText("heft-machine 1\n" + records, &reason);
        ASSERT_TRUE(machine) << reason;
        host = std::make_unique<HXReplayPlatform>(*machine, services);
    }
    mach_port_t task(int32_t pid) {
        mach_port_t port = 0;
        EXPECT_EQ(host->task_for_pid(1, pid, &port), KERN_SUCCESS);
        return port;
    }
    struct Found {
        kern_return_t error;
        uint64_t address, size;
        vm_region_submap_info_64 info;
        uint32_t words;
        bool operator==(const std::pair<uint64_t, uint64_t> &place) const {
            return error == KERN_SUCCESS && address == place.first && size == place.second;
        }
    };
    Found recurse(mach_port_t port, uint64_t address) {
        Found found{0, address, 0, {}, VM_REGION_SUBMAP_INFO_COUNT_64};
        uint32_t depth = UINT32_MAX;
        found.error = host->mach_vm_region_recurse(port, &found.address, &found.size, &depth, &found.info,
                                                   &found.words);
        return found;
    }
    kern_return_t top(mach_port_t port, uint64_t *address, uint64_t *size) {
        vm_region_basic_info_64 info{};
        uint32_t words = VM_REGION_BASIC_INFO_COUNT_64;
        return host->mach_vm_region(port, address, size, VM_REGION_BASIC_INFO_64, &info, &words);
    }
    // The dispositions as text, or "error N".
    std::string pages(mach_port_t port, uint64_t address, uint64_t size, uint64_t room = 16) {
        int32_t dispositions[16] = {};
        const kern_return_t error = host->mach_vm_page_range_query(port, address, size, dispositions, &room);
        if (error != KERN_SUCCESS) return "error " + std::to_string(error);
        std::string text;
        for (uint64_t i = 0; i < room; i++)
            text += (i == 0 ? "" : " ") + std::to_string(dispositions[i]);
        return text;
    }
    void setRegionHeft(int32_t value) {
        EXPECT_EQ(host->sysctlbyname("vm.self_region_heft", nullptr, nullptr, &value, sizeof value), 0);
    }
    // The status in the short record, or minus the errno.
    int32_t status(int32_t pid) {
        proc_bsdshortinfo info{};
        const int32_t bytes = host->proc_pidinfo(pid, PROC_PIDT_SHORTBSDINFO, 1, &info, sizeof info);
        return bytes == sizeof info ? static_cast<int32_t>(info.pbsi_status) : -errno;
    }

    HXLinuxServices services;
    std::unique_ptr<HXMachine> machine;
    std::unique_ptr<HXReplayPlatform> host;
};

TEST_F(HXReplay, FindsTheFirstRegionThatEndsAboveAnAddress) {
    load("host|page_size=4096|self_region_heft=1\nprocess|pid=5\n"
         "region|pid=5|address=0x1000|size=0x2000|dirtied=2|dirtied_object=1\n"
         "region|pid=5|address=0x3000|size=0x1000|object_id=7|short_record=1|full_object_id=0x900000008\n"
         "region|pid=5|address=0x5000|size=0x1000|heft_only=1|tag=0xffffffff\n"
         "region|pid=5|address=0xfffffffffffe0000|size=0x1000|purge=1|pager=1|path=/x\n"
         "process|pid=6\nprocess|pid=7|task_error=8\n");
    const mach_port_t port = task(5);
    using Place = std::pair<uint64_t, uint64_t>;
    EXPECT_EQ(recurse(port, 0), Place(0x1000, 0x2000));
    EXPECT_EQ(recurse(port, 0x3000), Place(0x3000, 0x1000));
    EXPECT_EQ(recurse(port, 0x4000), Place(0x5000, 0x1000));
    EXPECT_EQ(recurse(port, 0x1000), Place(0x1000, 0x2000)); // backwards
    EXPECT_EQ(recurse(port, 0x6000), Place(0xfffffffffffe0000, 0x1000));
    EXPECT_EQ(recurse(port, UINT64_MAX).error, KERN_INVALID_ADDRESS);
    EXPECT_EQ(recurse(task(6), 0).error, KERN_INVALID_ADDRESS);
    EXPECT_EQ(recurse(99, 0).error, MACH_SEND_INVALID_DEST);
    mach_port_t none = 0;
    EXPECT_EQ(host->task_for_pid(1, 7, &none), KERN_NO_ACCESS);
    EXPECT_EQ(host->task_for_pid(1, 8, &none), KERN_FAILURE);

    EXPECT_EQ(recurse(port, 0x3000).words, 18u);
    EXPECT_EQ(recurse(port, 0x3000).info.object_id, 7u);
    EXPECT_EQ(recurse(port, 0).words, 19u);
    EXPECT_EQ(recurse(port, 0).info.pages_dirtied, 2u);
    setRegionHeft(0);
    EXPECT_EQ(recurse(port, 0).info.pages_dirtied, 1u);
    EXPECT_EQ(recurse(port, 0x4000), Place(0xfffffffffffe0000, 0x1000));
    uint64_t address = 0x4000, size = 0;
    EXPECT_EQ(top(port, &address, &size), KERN_SUCCESS);
    EXPECT_EQ(address, 0xfffffffffffe0000);
}

TEST_F(HXReplay, AnswersPageQueriesAcrossRegions) {
    load("host|page_size=4096\nprocess|pid=5\n"
         "region|pid=5|address=0x1000|size=0x4000|pages=1*9,1*0x10\n"
         "region|pid=5|address=0x5000|size=0x2000|pages=2*3\n"
         "region|pid=5|address=0x7000|size=0x1000\n"
         "region|pid=5|address=0x9000|size=0x1000|pages=1*0xffffffff\n");
    const mach_port_t port = task(5);
    static constexpr struct {
        uint64_t address, size, room;
        const char *answer;
    } cases[] = {
        {0x1000, 0x6000, 16, "9 16 0 0 3 3"},
        {0x1000, 0x6000, 2, "9 16"},
        {0x1000, 0, 16, ""},
        {0x0, 0x2000, 16, "error 1"},
        {0x9000, 0x1000, 16, "-1"},
        {0x1fff, 2, 16, "9 16"},
        {0x5000, UINT64_MAX, 2, "3 3"},
        {0xfffffffffffff000, 0x1000, 16, "error 1"},
    };
    for (const auto &test : cases)
        EXPECT_EQ(pages(port, test.address, test.size, test.room), test.answer)
            << std::hex << test.address << " " << test.size;
}

TEST_F(HXReplay, FaultsFromTheCallOnThatTheyName) {
    const std::pair<const char *, HXMachineCall> calls[] = {
        {"mach_vm_region", HXMachineCall::region},
        {"mach_vm_region_recurse", HXMachineCall::regionRecurse},
        {"mach_vm_page_range_query", HXMachineCall::pageRangeQuery}};
    const std::pair<const char *, int32_t> fates[] = {
        {"", 2}, {"|becomes=gone", -ESRCH}, {"|becomes=zombie", 5}};
    for (const auto &faulty : calls) {
        for (const auto &fate : fates) {
            const std::string fault = "fault|pid=5|call=" + std::string(faulty.first);
            load("process|pid=5\nregion|pid=5|address=0x4000|size=0x4000|pages=1*1\n" + fault +
                 "|from=9|error=1\n" + fault + "|from=3|error=268435459" + fate.first + "\n");
            for (int i = 1; i <= 5; i++) {
                EXPECT_EQ(status(5), i <= 3 ? 2 : fate.second);
                for (const auto &[name, call] : calls) {
                    uint64_t address = 0x4000, size = 0;
                    const std::string queried = call == HXMachineCall::pageRangeQuery
                                                    ? pages(task(5), 0x4000, 0x4000)
                                                : call == HXMachineCall::region
                                                    ? "error " + std::to_string(top(task(5), &address, &size))
                                                    : "error " + std::to_string(recurse(task(5), 0).error);
                    EXPECT_EQ(queried == "error 268435459", i >= 3 && call == faulty.second) << name << i;
                }
            }
        }
    }
}

TEST_F(HXReplay, ListsProcessesAndTheirRecords) {
    load("host|arg_max=12|pid=77\nprocess|pid=9|comm=0123456789abcdefgh|name=a\"b\\tc|ppid=3\n"
         "process|pid=4|readable=0|status=5|args_path=/bin/tool|argc=258|listed=0\nprocess|pid=5\n");
    int32_t pids[4] = {};
    EXPECT_EQ(host->proc_listallpids(pids, sizeof pids), 2);
    EXPECT_EQ((std::pair{pids[0], pids[1]}), (std::pair{9, 5}));
    EXPECT_EQ(host->proc_listallpids(pids, 7), 1);

    proc_bsdinfo info{};
    ASSERT_EQ(host->proc_pidinfo(9, PROC_PIDTBSDINFO, 0, &info, sizeof info), int32_t{sizeof info});
    EXPECT_EQ(std::string(info.pbi_comm, sizeof info.pbi_comm), "0123456789abcdef");
    EXPECT_STREQ(info.pbi_name, "a'b?c");
    EXPECT_EQ(host->proc_pidinfo(4, PROC_PIDTBSDINFO, 0, &info, sizeof info), 0);
    EXPECT_EQ(status(4), 5);
    EXPECT_EQ(status(1), -ESRCH);

    char area[32];
    const int32_t name[] = {1, 49, 4};
    size_t bytes = sizeof area;
    ASSERT_EQ(host->sysctl(name, 3, area, &bytes), 0);
    EXPECT_EQ(std::string(area, bytes), std::string("\2\1\0\0/bin/too", 12)) << "cut to arg_max";
    load("host|list_pids_error=1\nprocess|pid=1\n");
    EXPECT_EQ(host->proc_listallpids(pids, sizeof pids), -1);
}

TEST_F(HXReplay, AnswersFiguresAndOwnedObjects) {
    load("host|ledger=cpu,page_table,a_name_that_is_longer_than_the_31_bytes\n"
         "process|pid=1|heft=10|heft_peak=20|page_table=-5|dirty_flags=7|owned_error=1\n"
         "owned|pid=1|object_id=3|virtual=8|flags=0x10\nowned|pid=1|object_id=4\n"
         "process|pid=2|owned_none=1\nprocess|pid=3\n");
    rusage_info_v4 usage{};
    EXPECT_EQ(host->proc_pid_rusage(1, RUSAGE_INFO_V4, &usage), 0);
    EXPECT_EQ(usage.ri_lifetime_max_phys_heft, 20u);
    EXPECT_EQ(host->proc_pid_rusage(2, RUSAGE_INFO_V4, &usage), -1);
    EXPECT_EQ(errno, EPERM);
    ledger_template_info names[8];
    int64_t count = 8;
    EXPECT_EQ(host->ledger(LEDGER_TEMPLATE_INFO, 0, names, &count), 0);
    ASSERT_EQ(count, 3);
    EXPECT_STREQ(names[2].lti_name, "a_name_that_is_longer_than_the_");
    ledger_entry_info entries[8];
    count = 2;
    EXPECT_EQ(host->ledger(LEDGER_ENTRY_INFO, 1, entries, &count), 0);
    EXPECT_EQ(count, 2);
    EXPECT_EQ(entries[1].lei_balance, -5);

    const auto owned = [&](int32_t pid, size_t room) -> std::pair<int32_t, size_t> {
        mach_port_t port = task(pid);
        std::vector<char> reply(room);
        size_t bytes = room;
        const int32_t result = host->sysctlbyname("vm.get_owned_vmobjects", room ? reply.data() : nullptr,
                                                  &bytes, &port, sizeof port);
        return {result == 0 ? 0 : errno, bytes};
    };
    EXPECT_EQ(owned(1, 0), std::pair(0, size_t{120}));
    EXPECT_EQ(owned(1, 500), std::pair(0, size_t{120}));
    EXPECT_EQ(owned(1, 64), std::pair(0, size_t{64}));
    EXPECT_EQ(owned(2, 500), std::pair(0, size_t{8}));
    EXPECT_EQ(owned(3, 500).first, ENOENT);
}

TEST_F(HXReplay, FindsSymbolsOfTheKernel) {
    load("symbol|address=0xfffffffffffffff0|size=16|name=f|path=/"
         "k.c|line=3\nsymbol|address=8|size=8|name=g\n");
    RVSymbolicator *kernel = host->RVSymbolicatorCreateWithMachKernelFlagsAndNotification(0, nullptr);
    const std::pair<uint64_t, const char *> symbols[] = {
        {7, nullptr}, {15, "g"}, {16, nullptr}, {UINT64_MAX, "f"}};
    for (const auto &[address, name] : symbols)
        EXPECT_STREQ(host->RVSymbolicatorGetSymbolWithAddressAtTime(kernel, address, kRVNow).name, name);
    EXPECT_TRUE(host->RVSymbolicatorGetSourceInfoWithAddressAtTime(kernel, 8, kRVNow).isNull);
    EXPECT_EQ(host->RVSymbolicatorGetSourceInfoWithAddressAtTime(kernel, UINT64_MAX, kRVNow).lineNumber, 3);
    host->RVRelease(kernel);
}

TEST_F(HXReplay, NamesOfTagsKeepTheirMeaningBesideOtherNames) {
    load("process|pid=1\ntag|tag=111|name=arena\nregion|pid=1|address=0x4000|size=0x4000|tag=111\n");
    const uint32_t taken = *host->namedTags().tagForName("of a memory graph");
    EXPECT_EQ(taken, 111u);
    const auto nameOf = [&](uint32_t tag) {
        return host->GXRegionTypeDescriptionForTagShareProtAndPager(tag, 0, 0, 0).value_or("none");
    };
    EXPECT_EQ(nameOf(recurse(task(1), 0).info.user_tag), "arena");
    EXPECT_EQ(nameOf(taken), "of a memory graph");
}

} // namespace
