// What a replayed machine answers of its own; what every host does is in HXHostContractTest.cpp.
#include "platform/HXHostGuards.h"
#include "support/HXCaseFile.h"
#include "support/HXHostCalls.h"
#include "support/HXMadeUpMachine.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <sstream>
#include <tuple>

namespace {

// The status in the short record, or minus the errno.
int32_t status(HXPlatform &host, int32_t pid) {
    proc_bsdshortinfo info{};
    const int32_t bytes = host.proc_pidinfo(pid, PROC_PIDT_SHORTBSDINFO, 1, &info, sizeof info);
    return bytes == sizeof info ? static_cast<int32_t>(info.pbsi_status) : -errno;
}

TEST(HXReplay, FindsRegionsAndPages) {
    for (const HXCase &each : HXReadCases("replayed.txt")) {
        HXMadeUpMachine host(each.input);
        const mach_port_t task = HXTaskOf(host, 5);
        EXPECT_EQ(HXAnswered(each.expected.at(0).text,
                             [&](const std::string &question) {
                                 std::istringstream words(question);
                                 uint64_t address = 0, bytes = 0;
                                 words >> std::hex >> address;
                                 if (words >> bytes) return HXPagesAt(host, task, address, bytes);
                                 vm_region_submap_info_64 info;
                                 const std::string found = HXRegionAt(host, task, address, &info);
                                 EXPECT_EQ(HXRegionAt(host, task, address, nullptr), found);
                                 return found;
                             }),
                  each.expected.at(0).text)
            << each.title;
    }
}

// As queries of 4,096 pages each would, though one may tell of more.
TEST(HXReplay, TellsOfAsManyPagesAsCallsSucceed) {
    const std::string region = R"(
region  pid=5  address=0x100000000  size=0x10000000  pages=8190*0,8*9,0x2000*0,1*3
region  pid=5  address=0x110000000  size=0x5000000  pages=1*9
region  pid=5  address=0x115000000  size=0x1000
)";
    static constexpr struct {
        const char *fault;
        uint64_t size, told;
        size_t runs;
        kern_return_t error; // of the pages behind
    } cases[] = {
        {"", 0x14000000, 0x14000, 3, 0},
        {"", 0x15001000, 0x15000, 3, KERN_INVALID_ADDRESS},
        {"from=3  error=9", 0x14000000, 0x2000, 1, 9},
        {"from=4  error=9", 0x14000000, 0x3000, 1, 9},
        {"from=21  error=9", 0x14000000, 0x14000, 3, 9},
    };
    for (const auto &test : cases) {
        const std::string fault = *test.fault == 0 ? "" : "fault  pid=5  call=mach_vm_page_range_query  ";
        HXMadeUpMachine host("host  page_size=4096\nprocess  pid=5" + region + fault + test.fault + "\n");
        std::vector<vm_page_run> runs;
        uint64_t told = 0;
        const mach_port_t task = HXTaskOf(host, 5);
        ASSERT_EQ(host.mach_vm_page_range_query(task, 0x100000000, test.size, &runs, &told), KERN_SUCCESS);
        EXPECT_EQ(told, test.told) << test.fault;
        EXPECT_EQ(runs.size(), test.runs) << test.fault;
        if (test.told == 0x2000) {
            EXPECT_EQ(runs.back().pages, 2U) << "cut at the end of what is told";
        }
        const uint64_t behind = told == 0x14000 ? 0x100000000 : 0x100000000 + told * 4096;
        EXPECT_EQ(host.mach_vm_page_range_query(task, behind, 0x2000, &runs, &told), test.error);
    }
}

TEST(HXReplay, FaultsFromTheCallOnThatTheyName) {
    const std::string error = "(ipc/send) invalid destination port";
    const std::pair<std::string, int32_t> fates[] = {
        {"alive", 2}, {"gone", -ESRCH}, {"zombie", static_cast<int32_t>(SZOMB)}};
    for (const std::string faulty :
         {"mach_vm_region", "mach_vm_region_recurse", "mach_vm_page_range_query"}) {
        for (const auto &[fate, statusAfter] : fates) {
            const std::string fault = "fault  pid=5  call=" + faulty;
            HXMadeUpMachine host("process  pid=5\nregion  pid=5  address=0x4000  size=0x4000  pages=1*1\n" +
                                 fault + "  from=9  error=1\n" + fault +
                                 "  from=3  error=268435459  becomes=" + fate + "\n");
            const mach_port_t task = HXTaskOf(host, 5);
            vm_region_submap_info_64 info;
            for (int i = 1; i <= 4; i++) {
                EXPECT_EQ(status(host, 5), i <= 3 ? 2 : statusAfter);
                const std::pair<std::string, std::string> calls[] = {
                    {"mach_vm_region", HXRegionAt(host, task, 0, nullptr)},
                    {"mach_vm_region_recurse", HXRegionAt(host, task, 0, &info)},
                    {"mach_vm_page_range_query", HXPagesAt(host, task, 0x4000, 0x4000)}};
                for (const auto &[call, answer] : calls)
                    EXPECT_EQ(answer == error, i >= 3 && call == faulty) << call << i;
            }
        }
    }
}

TEST(HXReplay, TellsOfProcesses) {
    HXMadeUpMachine host(R"(host  arg_max=12  pid=77  ledger=cpu,a_name_of_30_bytes_and_then_someé
process  pid=9  comm=0123456789abcdefgh  name=a"b\tc  ppid=3
process  pid=4  readable=0  status=5  args_path=/bin/tool  argc=258  listed=0
process  pid=5  owned_error=13
owned  pid=9  object_id=3
)");
    int32_t pids[4] = {};
    EXPECT_EQ(host.proc_listallpids(pids, sizeof pids), 2);
    EXPECT_EQ((std::pair{pids[0], pids[1]}), (std::pair{9, 5}));
    proc_bsdinfo info{};
    ASSERT_EQ(host.proc_pidinfo(9, PROC_PIDTBSDINFO, 0, &info, sizeof info), int32_t{sizeof info});
    EXPECT_EQ(std::string(info.pbi_comm, sizeof info.pbi_comm), "0123456789abcdef");
    EXPECT_STREQ(info.pbi_name, "a'b?c");
    EXPECT_EQ(host.proc_pidinfo(4, PROC_PIDTBSDINFO, 0, &info, sizeof info), 0);
    EXPECT_EQ(errno, EPERM);
    EXPECT_EQ(status(host, 4), static_cast<int32_t>(SZOMB));
    char area[200];
    const int32_t name[] = {CTL_KERN, KERN_PROCARGS2, 4};
    size_t bytes = sizeof area;
    ASSERT_EQ(host.sysctl(name, 3, area, &bytes), 0);
    EXPECT_EQ(std::string(area, bytes), std::string("\2\1\0\0/bin/too", 12)) << "cut to arg_max";
    ledger_template_info names[3];
    int64_t count = 3;
    EXPECT_EQ(host.ledger(LEDGER_TEMPLATE_INFO, 0, names, &count), 0);
    EXPECT_EQ(count, 2);
    EXPECT_STREQ(names[1].lti_name, "a_name_of_30_bytes_and_then_som") << "room for a zero";

    const std::tuple<int32_t, size_t, int, size_t> replies[] = {// pid, room, errno, bytes
                                                                {9, sizeof area, 0, 64},
                                                                {9, 60, 0, 60},
                                                                {5, sizeof area, EACCES, sizeof area}};
    for (const auto &[pid, room, error, filled] : replies) {
        const mach_port_t port = HXTaskOf(host, pid);
        bytes = room;
        const int32_t result = host.sysctlbyname("vm.get_owned_vmobjects", area, &bytes, &port, sizeof port);
        EXPECT_EQ(std::pair(result == 0 ? 0 : errno, bytes), std::pair(error, filled));
    }
}

TEST(HXReplay, FindsSymbolsOfTheKernelAndNamesOfTags) {
    HXMadeUpMachine host(R"(symbol  address=0xfffffffffffffff0  size=16  name=f  path=/k.c  line=3
symbol  address=8  size=8  name=g
process  pid=5
tag  tag=111  name=arena
region  pid=5  address=0x4000  size=0x4000  tag=111
)");
    const HXSymbolicatorGuard kernel = HXSymbolicatorOfKernel(host, 0);
    const std::pair<uint64_t, const char *> symbols[] = {
        {7, nullptr}, {8, "g"}, {15, "g"}, {16, nullptr}, {UINT64_MAX, "f"}};
    for (const auto &[address, name] : symbols)
        EXPECT_STREQ(host.RVSymbolicatorGetSymbolWithAddressAtTime(kernel.get(), address, kRVNow).name, name);
    EXPECT_TRUE(host.RVSymbolicatorGetSourceInfoWithAddressAtTime(kernel.get(), 8, kRVNow).isNull);
    EXPECT_EQ(host.RVSymbolicatorGetSourceInfoWithAddressAtTime(kernel.get(), UINT64_MAX, kRVNow).lineNumber,
              3);

    // Names keep their meaning beside others that take their numbers.
    const auto nameOf = [&](uint32_t tag) {
        return host.GXRegionTypeDescriptionForTagShareProtAndPager(tag, 0, 0, 0).value_or("none");
    };
    EXPECT_EQ(host.namedTags().tagForName("of a memory graph"), 111U);
    vm_region_submap_info_64 info;
    HXRegionAt(host, HXTaskOf(host, 5), 0, &info);
    EXPECT_EQ(nameOf(info.user_tag), "arena");
    EXPECT_EQ(nameOf(111), "of a memory graph");
}

} // namespace
