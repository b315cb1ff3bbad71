// What a replayed machine answers.
#include "platform/replay/HXReplayPlatform.h"
#include "platform/HXRegionTags.h"
#include "support/HXBarePlatform.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <thread>

namespace {

class HXReplay : public testing::Test {
  protected:
    // Loads a machine; a bar stands for each TAB.
    void load(std::string records) {
        std::replace(records.begin(), records.end(), '|', '\t');
        HXNamedTags::shared().clear();
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
        uint64_t address;
        uint64_t size;
        vm_region_submap_info_64 info;
        uint32_t words;
        bool operator==(const std::pair<uint64_t, uint64_t> &place) const {
            return error == KERN_SUCCESS && address == place.first && size == place.second;
        }
    };
    Found recurse(mach_port_t port, uint64_t address, uint32_t words = VM_REGION_SUBMAP_INFO_COUNT_64) {
        Found found{0, address, 0, {}, words};
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

    HXBarePlatform services;
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
    EXPECT_EQ(recurse(port, 0x2fff), Place(0x1000, 0x2000));
    EXPECT_EQ(recurse(port, 0x3000), Place(0x3000, 0x1000));
    EXPECT_EQ(recurse(port, 0x4000), Place(0x5000, 0x1000));
    EXPECT_EQ(recurse(port, 0x1000), Place(0x1000, 0x2000)); // backwards
    EXPECT_EQ(recurse(port, 0x6000), Place(0xfffffffffffe0000, 0x1000));
    EXPECT_EQ(recurse(port, 0xfffffffffffe1000).error, KERN_INVALID_ADDRESS);
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

    int32_t purge = 0;
    EXPECT_EQ(host->mach_vm_purgable_control(port, address + 1, VM_PURGABLE_GET_STATE, &purge), KERN_SUCCESS);
    EXPECT_EQ(purge, 1);
    EXPECT_NE(host->mach_vm_purgable_control(port, 0x1000, VM_PURGABLE_GET_STATE, &purge), KERN_SUCCESS);
    char path[8];
    EXPECT_EQ(host->proc_regionfilename(5, address, path, sizeof path), 2);
    EXPECT_EQ(host->proc_regionfilename(5, 0x4000, path, sizeof path), 0);
    EXPECT_EQ(host->proc_regionfilename(9, address, path, sizeof path), 0);
}

TEST_F(HXReplay, AnswersPageQueriesAcrossRegions) {
    load("host|page_size=4096\nprocess|pid=5\n"
         "region|pid=5|address=0x1000|size=0x4000|pages=1*9,1*0x10\n"
         "region|pid=5|address=0x5000|size=0x2000|pages=2*3\n"
         "region|pid=5|address=0x7000|size=0x1000\n"
         "region|pid=5|address=0x9000|size=0x1000|pages=1*0xffffffff\n");
    const mach_port_t port = task(5);
    const struct {
        uint64_t address, size, room;
        const char *answer;
    } cases[] = {
        {0x1000, 0x6000, 16, "9 16 0 0 3 3"},
        {0x2000, 0x1000, 16, "16"},
        {0x4000, 0x2000, 16, "0 3"},
        {0x1000, 0x6000, 2, "9 16"},
        {0x1000, 0, 16, ""},
        {0x0, 0x2000, 16, "error 1"},
        {0x5000, 0x3000, 16, "error 1"},
        {0x8000, 0x1000, 16, "error 1"},
        {0x9000, 0x1000, 16, "-1"},
        {0x9000, 0x2000, 16, "error 1"},
        {0x1fff, 2, 16, "9 16"},
        {0x5000, UINT64_MAX, 2, "3 3"},
        {0xfffffffffffff000, 0x1000, 16, "error 1"},
    };
    for (const auto &test : cases)
        EXPECT_EQ(pages(port, test.address, test.size, test.room), test.answer)
            << std::hex << test.address << " " << test.size;
    EXPECT_EQ(pages(99, 0x1000, 0x1000), "error 4");
}

TEST_F(HXReplay, TopLevelMappingsHideTheRegionsFromTheTopLevelQuery) {
    load("process|pid=5\nregion|pid=5|address=0x4000|size=0x4000\n"
         "top|pid=5|address=0x8000|size=0x10000\n");
    uint64_t address = 0, size = 0;
    EXPECT_EQ(top(task(5), &address, &size), KERN_SUCCESS);
    EXPECT_EQ(address, 0x8000u);
    EXPECT_EQ(size, 0x10000u);
    address = 0x18000;
    EXPECT_EQ(top(task(5), &address, &size), KERN_INVALID_ADDRESS);
}

TEST_F(HXReplay, FaultsFromTheCallOnThatTheyName) {
    const struct {
        const char *call;
        HXMachineCall kind;
    } calls[] = {{"mach_vm_region", HXMachineCall::region},
                 {"mach_vm_region_recurse", HXMachineCall::regionRecurse},
                 {"mach_vm_page_range_query", HXMachineCall::pageRangeQuery}};
    const struct {
        const char *becomes;
        int32_t status;
    } fates[] = {{"", 2}, {"|becomes=alive", 2}, {"|becomes=gone", -ESRCH}, {"|becomes=zombie", 5}};
    for (const auto &faulty : calls) {
        for (const auto &fate : fates) {
            const std::string fault = "fault|pid=5|call=" + std::string(faulty.call);
            load("process|pid=5\nregion|pid=5|address=0x4000|size=0x4000|pages=1*1\n" + fault +
                 "|from=9|error=1\n" + fault + "|from=3|error=268435459" + fate.becomes + "\n");
            for (int i = 1; i <= 5; i++) {
                const bool before = i < 3;
                EXPECT_EQ(status(5), before || i == 3 ? 2 : fate.status);
                for (const auto &call : calls) {
                    uint64_t address = 0x4000, size = 0;
                    const std::string queried = call.kind == HXMachineCall::pageRangeQuery
                                                    ? pages(task(5), 0x4000, 0x4000)
                                                : call.kind == HXMachineCall::region
                                                    ? "error " + std::to_string(top(task(5), &address, &size))
                                                    : "error " + std::to_string(recurse(task(5), 0).error);
                    const bool fails = !before && call.kind == faulty.kind;
                    EXPECT_EQ(queried == "error 268435459", fails) << faulty.call << " " << i << queried;
                }
            }
        }
    }
}

TEST_F(HXReplay, CountsTheCallsOfAllThreads) {
    load("process|pid=5\nregion|pid=5|address=0x4000|size=0x4000\n"
         "fault|pid=5|call=mach_vm_region_recurse|from=1001|error=5\n");
    const mach_port_t port = task(5);
    std::atomic<int> succeeded = 0;
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; i++)
        threads.emplace_back([&] {
            for (int k = 0; k < 500; k++)
                succeeded += recurse(port, 0).error == KERN_SUCCESS;
        });
    for (std::thread &thread : threads)
        thread.join();
    EXPECT_EQ(succeeded, 1000);
}

TEST_F(HXReplay, ListsProcessesAndTheirRecords) {
    load("host|arg_max=12|pid=77|euid=5\nprocess|pid=9|comm=0123456789abcdefgh|name=a\"b\\tc|ppid=3|flags=1\n"
         "process|pid=4|readable=0|status=5|args_path=/bin/tool|argc=258|listed=0\nprocess|pid=5|args_path=/"
         "x\n");
    int32_t pids[4] = {};
    EXPECT_EQ(host->proc_listallpids(nullptr, 0), 2);
    EXPECT_EQ(host->proc_listallpids(pids, sizeof pids), 2);
    EXPECT_EQ(pids[0], 9);
    EXPECT_EQ(pids[1], 5);
    EXPECT_EQ(host->proc_listallpids(pids, 7), 1);

    proc_bsdinfo info{};
    ASSERT_EQ(host->proc_pidinfo(9, PROC_PIDTBSDINFO, 0, &info, sizeof info), int32_t{sizeof info});
    EXPECT_EQ(std::string(info.pbi_comm, sizeof info.pbi_comm), "0123456789abcdef");
    EXPECT_STREQ(info.pbi_name, "a'b?c");
    EXPECT_EQ(info.pbi_ppid, 3);
    EXPECT_EQ(info.pbi_flags, 1u);
    EXPECT_EQ(host->proc_pidinfo(4, PROC_PIDTBSDINFO, 0, &info, sizeof info), 0);
    EXPECT_EQ(status(4), 5);
    EXPECT_EQ(status(1), -ESRCH);

    char area[32];
    const auto arguments = [&](int32_t pid) {
        const int32_t name[] = {1, 49, pid};
        size_t bytes = sizeof area;
        return host->sysctl(name, 3, area, &bytes) == 0 ? std::string(area, bytes) : "none";
    };
    EXPECT_EQ(arguments(5), std::string("\1\0\0\0/x\0", 7));
    EXPECT_EQ(arguments(4), std::string("\2\1\0\0/bin/too", 12)); // cut to arg_max
    EXPECT_EQ(arguments(9), "none");
    EXPECT_EQ(host->getpid(), 77);
    EXPECT_EQ(host->geteuid(), 5u);
    load("host|list_pids_error=1\nprocess|pid=1\n");
    EXPECT_EQ(host->proc_listallpids(pids, sizeof pids), -1);
}

TEST_F(HXReplay, AnswersFiguresAndSettings) {
    load("host|ledger=cpu,page_table,a_name_that_is_longer_than_the_31_bytes\n"
         "process|pid=1|heft=10|heft_peak=20|page_table=-5|dirty_flags=7|owned_error=1\n"
         "owned|pid=1|object_id=3|virtual=8|flags=0x10\nowned|pid=1|object_id=4\n"
         "process|pid=2|owned_none=1\nprocess|pid=3\n");
    rusage_info_v4 usage{};
    EXPECT_EQ(host->proc_pid_rusage(1, RUSAGE_INFO_V4, &usage), 0);
    EXPECT_EQ(usage.ri_phys_heft, 10u);
    EXPECT_EQ(usage.ri_lifetime_max_phys_heft, 20u);
    EXPECT_EQ(host->proc_pid_rusage(2, RUSAGE_INFO_V4, &usage), -1);
    EXPECT_EQ(errno, EPERM);
    uint32_t flags = 0;
    EXPECT_EQ(host->proc_get_dirty(1, &flags), 0);
    EXPECT_EQ(flags, 7u);
    EXPECT_EQ(host->proc_get_dirty(2, &flags), -1);

    ledger_template_info names[8];
    int64_t count = 8;
    EXPECT_EQ(host->ledger(LEDGER_TEMPLATE_INFO, 0, names, &count), 0);
    ASSERT_EQ(count, 3);
    EXPECT_STREQ(names[1].lti_name, "page_table");
    EXPECT_STREQ(names[2].lti_name, "a_name_that_is_longer_than_the_");
    ledger_entry_info entries[8];
    count = 2;
    EXPECT_EQ(host->ledger(LEDGER_ENTRY_INFO, 1, entries, &count), 0);
    EXPECT_EQ(count, 2);
    EXPECT_EQ(entries[1].lei_balance, -5);
    EXPECT_EQ(host->ledger(LEDGER_ENTRY_INFO, 2, entries, &count), -1);
    EXPECT_EQ(errno, EPERM);

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
    int32_t setting = 1;
    EXPECT_EQ(host->sysctlbyname("vm.self_region_heft", nullptr, nullptr, &setting, sizeof setting), -1);
    EXPECT_EQ(errno, ENOENT);
    load("");
    EXPECT_EQ(host->ledger(LEDGER_TEMPLATE_INFO, 0, names, &count), -1);
    EXPECT_EQ(errno, ENOSYS);
}

TEST_F(HXReplay, TellsImagesAndTheKernel) {
    load("process|pid=1\nimage|pid=1|path=/a|base=16\nimage|pid=1|path=/b|base=32\n"
         "segment|pid=1|name=__TEXT x|start=1|size=2\nsegment|pid=1|name=__DATA|start=3|size=4\n"
         "zone|name=z\"1|count=2|cur_size=3|elem_size=4|collectable=1\n"
         "site|flags=0x502|site=9|size=5|name=" +
         std::string(100, 'n') + "\nkext|load_tag=1|bundle_id=a\nkext|load_tag=1\n" +
         "symbol|address=0xfffffffffffffff0|size=16|name=f|path=/"
         "k.c|line=3\nsymbol|address=8|size=8|name=g\n");
    RVSymbolicator *images = host->RVSymbolicatorCreateWithTaskFlagsAndNotification(task(1), 0, nullptr);
    std::string seen;
    host->RVSymbolicatorForeachSymbolOwnerAtTime(images, kRVNow, [&](const RVSymbolOwner &image) {
        seen += std::string(image.path) + "@" + std::to_string(image.baseAddress);
        for (size_t i = 0; i < image.segmentCount; i++)
            seen += std::string(" ") + image.segments[i].name + std::to_string(image.segments[i].length);
    });
    host->RVRelease(images);
    EXPECT_EQ(seen, "/a@16/b@32 __TEXT x2 __DATA4");
    EXPECT_EQ(host->RVSymbolicatorCreateWithTaskFlagsAndNotification(99, 0, nullptr), nullptr);

    RVSymbolicator *kernel = host->RVSymbolicatorCreateWithMachKernelFlagsAndNotification(0, nullptr);
    const auto symbol = [&](uint64_t address) {
        const char *const name = host->RVSymbolicatorGetSymbolWithAddressAtTime(kernel, address, kRVNow).name;
        return std::string(name ? name : "none");
    };
    EXPECT_EQ(symbol(7), "none");
    EXPECT_EQ(symbol(15), "g");
    EXPECT_EQ(symbol(16), "none");
    EXPECT_EQ(symbol(UINT64_MAX), "f");
    EXPECT_TRUE(host->RVSymbolicatorGetSourceInfoWithAddressAtTime(kernel, 8, kRVNow).isNull);
    EXPECT_EQ(host->RVSymbolicatorGetSourceInfoWithAddressAtTime(kernel, UINT64_MAX, kRVNow).lineNumber, 3);
    host->RVRelease(kernel);

    mach_zone_name *names;
    mach_zone_info *zones;
    mach_memory_info_record *records;
    uint32_t nameCount = 0, zoneCount = 0, recordCount = 0;
    ASSERT_EQ(host->mach_memory_info(2, &names, &nameCount, &zones, &zoneCount, &records, &recordCount), 0);
    ASSERT_EQ(nameCount, 1u);
    ASSERT_EQ(recordCount, 1u);
    EXPECT_STREQ(names[0].mzn_name, "z'1");
    EXPECT_EQ(zones[0].mzi_elem_size, 4u);
    EXPECT_EQ(std::string(records[0].name, 80), std::string(80, 'n'));
    for (const void *memory :
         {static_cast<void *>(names), static_cast<void *>(zones), static_cast<void *>(records)})
        EXPECT_EQ(host->vm_deallocate(1, memory, 1), 0);
    EXPECT_EQ(host->OSKextCopyLoadedKextInfo().size(), 2u);
    load("host|memory_info_error=8\n");
    EXPECT_EQ(host->mach_memory_info(2, &names, &nameCount, &zones, &zoneCount, &records, &recordCount), 8);
}

TEST_F(HXReplay, NamesOfTagsKeepTheirMeaningBesideOtherNames) {
    load(""); // clears the names
    const uint32_t taken = *HXNamedTags::shared().tagForName("of a memory graph");
    std::string reason;
    machine = HXMachine::loadText("heft-machine 1\nprocess\tpid=1\ntag\ttag=110\tname=arena\n"
                                  "tag\ttag=101\tname=anonymous\n"
                                  "region\tpid=1\taddress=0x4000\tsize=0x4000\ttag=110\n",
                                  &reason);
    host = std::make_unique<HXReplayPlatform>(*machine, services);
    const auto nameOf = [&](uint32_t tag) {
        return host->GXRegionTypeDescriptionForTagShareProtAndPager(tag, 0, 0, 0).value_or("none");
    };
    EXPECT_EQ(nameOf(recurse(task(1), 0).info.user_tag), "arena");
    EXPECT_EQ(nameOf(taken), "of a memory graph");
    EXPECT_EQ(nameOf(101), "anonymous");
    EXPECT_EQ(nameOf(100), "none");
}

} // namespace
