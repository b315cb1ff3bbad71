// Recording a replayed machine gives the machine again, or memory graphs of its processes.
#include "record/HXMachineRecorder.h"
#include "record/HXMemgraphRecorder.h"
#include "support/HXBuilders.h"
#include "support/HXMadeUpMachine.h"

#include <atomic>
#include <cerrno>
#include <future>
#include <gtest/gtest.h>

namespace {

const std::string kCases = TEST_CASES "/captures/";

template <class Record>
std::string written(const Record &record) {
    std::FILE *const file = std::tmpfile();
    record(file);
    return contentOf(file);
}

std::string recorded(HXPlatform &host, bool anonymize = false, const std::vector<int32_t> &pids = {}) {
    return written(
        [&](std::FILE *file) { EXPECT_TRUE(HXMachineRecorder(host, file, anonymize).record(pids)); });
}

// A machine file's records, as HXMadeUpMachine takes them.
std::string recordsOf(const std::string &file) {
    return file.substr(file.find('\n') + 1);
}

// The graph of process 5 without what it says of this machine, or why there is none.
std::string graphOf(const std::string &records, bool breakDown = true) {
    HXMadeUpMachine host(records);
    std::string reason;
    std::string text = written([&](std::FILE *file) {
        const auto categoryName = [](uint32_t tag) { return "tag " + std::to_string(tag); };
        HXMemgraphRecorder::record(host, file, categoryName, {5, "worker", breakDown}, &reason);
    });
    if (!reason.empty()) return reason;
    const size_t description = text.find("\tdescription=");
    return text.erase(description, text.find('\t', description + 1) - description);
}

TEST(HXMachineRecorder, WritesTheMachineThatItReads) {
    for (const auto &[name, settingAfter] :
         {std::pair("whole", 1), std::pair("tops", -1), std::pair("unlisted", -1)}) {
        const std::string file = contentOf(kCases + name + ".machine");
        HXMadeUpMachine host(recordsOf(file));
        EXPECT_EQ(recorded(host), file);
        int32_t setting = -1;
        size_t bytes = sizeof setting;
        (void)host.sysctlbyname("vm.self_region_heft", &setting, &bytes, nullptr, 0);
        EXPECT_EQ(setting, settingAfter);
    }
}

TEST(HXMachineRecorder, MakesUpNamesButKeepsTheStructure) {
    HXMadeUpMachine host(recordsOf(contentOf(kCases + "whole.machine")));
    EXPECT_EQ(recorded(host, true), contentOf(kCases + "whole.anonymized"));
}

// Process 5, whose task could not be opened, exits when its arguments are read.
class Exiting : public HXMadeUpMachine {
  public:
    Exiting() : HXMadeUpMachine("process  pid=5  task_error=5\n") {}
    int32_t proc_pidinfo(int32_t pid, int32_t flavor, uint64_t argument, void *buffer,
                         uint32_t bytes) override {
        errno = ESRCH;
        return _isGone ? 0 : HXMadeUpMachine::proc_pidinfo(pid, flavor, argument, buffer, bytes);
    }
    int32_t sysctl(const int32_t *name, uint32_t length, void *old, size_t *oldBytes) override {
        _isGone = _isGone || length == 3;
        return HXMadeUpMachine::sysctl(name, length, old, oldBytes);
    }

  private:
    bool _isGone = false;
};

TEST(HXMachineRecorder, LeavesOutItselfAndWhatVanishes) {
    const auto check = [](HXPlatform &host, const std::vector<int32_t> &pids, const std::string &err,
                          const std::string &out) {
        std::string text;
        EXPECT_EQ(printedBy([&] { text = recorded(host, false, pids); }).err, "heft-record: " + err + "\n");
        EXPECT_EQ(text, "heft-machine 1\n" + out);
    };
    const std::string vanishing = "host  pid=99\nprocess  pid=99\nprocess  pid=4\nprocess  pid=5\n"
                                  "region  pid=5  address=0x4000  size=0x4000\n"
                                  "region  pid=5  address=0x8000  size=0x4000\nprocess  pid=6\n"
                                  "fault  pid=5  call=mach_vm_region_recurse  error=268435459  ";
    const std::string others = "host\tpid=99\nprocess\tpid=4\nprocess\tpid=6\n";
    HXMadeUpMachine gone(vanishing + "from=4  becomes=gone\n");
    check(gone, {}, "5 is left out: it exited meanwhile", others);
    HXMadeUpMachine zombie(vanishing + "becomes=zombie\n");
    check(zombie, {}, "5 is left out: (ipc/send) invalid destination port", others);
    check(zombie, {6, 7}, "7 is left out: no such process", "host\tpid=99\nprocess\tpid=6\n");
    Exiting exiting;
    check(exiting, {5}, "5 is left out: it exited meanwhile", "host\n");
}

TEST(HXMachineRecorder, LeavesOutWhatDoesNotAnswer) {
    struct Waiting : HXMadeUpMachine {
        using HXMadeUpMachine::HXMadeUpMachine;
        std::atomic<bool> isFirst = true;
        void mach_port_deallocate(mach_port_t, mach_port_t) override {
            static auto &answer = *new std::promise<void>; // which is never given
            if (isFirst.exchange(false)) answer.get_future().wait();
        }
    } host("host\nprocess  pid=5  name=a\nprocess  pid=6  name=b\n");
    host.realServices.setAnswerTime(std::chrono::milliseconds(100));
    std::string file;
    const HXPrinted printed = printedBy([&] { file = recorded(host); });
    EXPECT_EQ(printed.err, "heft-record: 5 is left out: not answering\n");
    EXPECT_EQ(file.find("pid=5"), std::string::npos) << file;
    EXPECT_NE(file.find("pid=6"), std::string::npos) << file;
}

TEST(HXMachineRecorder, GoesOnWithPagesThatOneRecordCannotHold) {
    std::string runs;
    for (int i = 0; i < 130000; i++)
        runs += i == 0 ? "1*1,1*9" : ",1*1,1*9";
    const std::string more = "\npages\tpid=4\tpages=";
    const std::string region =
        "host\tpage_size=4096\tpid=99\nprocess\tpid=4\nregion\tpid=4\taddress=0x1000000"
        "\tsize=0x40000000\tresident=1\tshare_mode=4\tpages=";
    HXMadeUpMachine host(region + runs.substr(0, 800003) + more + runs.substr(800004) + "\n");
    std::string whole = recorded(host);
    int records = 1;
    for (size_t at; (at = whole.find(more)) != std::string::npos; records++)
        whole.replace(at, more.size(), ",");
    EXPECT_EQ(records, 2);
    EXPECT_TRUE(whole == "heft-machine 1\n" + region + runs + "\n");
}

TEST(HXMemgraphRecorder, WritesWhatALiveWalkFinds) {
    const std::string machine = recordsOf(contentOf(kCases + "worker.walk"));
    EXPECT_EQ(graphOf(machine), contentOf(kCases + "worker.memgraph"));
    EXPECT_EQ(graphOf(machine, false), contentOf(kCases + "worker.objects.memgraph"));
}

TEST(HXMemgraphRecorder, PutsPageTablesWhereTheyFitOrSaysWhyThereIsNoGraph) {
    const std::string host = "host  page_size=4096  self_region_heft=1  ledger=cpu,page_table\n";
    const std::string process = "process  pid=5  page_table=12288\n";
    const std::pair<std::string, const char *> cases[] = {
        {process, "\nregion\taddress=0x8000000000000000\tlength=0x3000\ttype=page table"},
        {process + "region  pid=5  address=0x7fffffffffffd000  size=0x4000\n",
         "address=0x8000000000001000\tlength=0x3000"},
        {process + "region  pid=5  address=0x8000000000003000  size=0x1000\n",
         "address=0x8000000000000000\tlength=0x3000"},
        {process + "region  pid=5  address=0x8000000000002000  size=0x1000\n",
         "address=0x8000000000003000\tlength=0x3000"},
        {"process  pid=4\n", "No such process"},
        {"process  pid=5  task_error=5\n", "(os/kern) failure"},
        {"process  pid=5  flags=1\n", "the kernel has no memory graph"},
        {process + "fault  pid=5  call=mach_vm_region_recurse  error=268435459  becomes=gone\n",
         "(ipc/send) invalid destination port"},
    };
    for (const auto &[records, expected] : cases)
        EXPECT_NE(graphOf(host + records).find(expected), std::string::npos) << expected;
}

} // namespace
