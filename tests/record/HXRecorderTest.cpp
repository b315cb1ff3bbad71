// Recording a replayed machine gives the machine again, or memory graphs of its processes.
#include "record/HXMachineRecorder.h"
#include "record/HXMemgraphRecorder.h"
#include "support/HXBuilders.h"
#include "support/HXMadeUpMachine.h"

#include <gtest/gtest.h>

namespace {

// What `record` writes, two blanks for each TAB.
template <class Record>
std::string written(const Record &record) {
    std::FILE *const file = std::tmpfile();
    record(file);
    std::string text = contentOf(file);
    for (size_t tab; (tab = text.find('\t')) != std::string::npos;)
        text.replace(tab, 1, "  ");
    return text;
}

std::string recorded(HXPlatform &host, bool anonymize = false, const std::vector<int32_t> &pids = {}) {
    return written(
        [&](std::FILE *file) { EXPECT_TRUE(HXMachineRecorder(host, file, anonymize).record(pids)); });
}

// The graph of process 5 without what it says of this machine, or why there is none.
std::string graphOf(const std::string &records, bool breakDown = true) {
    HXMadeUpMachine host("host  page_size=4096  self_region_heft=1  ledger=cpu,page_table\n" + records);
    std::string reason;
    std::string text = written([&](std::FILE *file) {
        HXMemgraphRecorder recorder(host, file, [](uint32_t tag) { return "tag " + std::to_string(tag); });
        recorder.record(5, "worker", breakDown, &reason);
    });
    if (!reason.empty()) return reason;
    const size_t description = text.find("  description=");
    return text.erase(description, text.find("  ", description + 1) - description);
}

// Records in the recorder's order and spelling.
const std::string kKernel = R"(zone  name=inodes  count=3  cur_size=8192  elem_size=600  collectable=1
site  flags=0x102  site=0xffff0010  size=4096  zone=1
site  flags=0x500  site=0x3  size=1  mapped=2  tag=3  name=stacks
kext  load_tag=4  bundle_id=ext4
symbol  address=0xffff0010  size=1  name=f  path=a.c  line=7
process  pid=0  comm=kernel  flags=1
)";
const std::string kWorker =
    R"(process  pid=5  comm=worker  name=worker  args_path=/opt/big/worker  dirty_flags=3  heft=4096  page_table=-1  ppid=2  argc=3  heft_peak=8192  owned_error=13
image  pid=5  path=/opt/big/worker  base=0x400000
segment  pid=5  name=__TEXT  start=0x400000  size=0x1000
region  pid=5  address=0x400000  size=0x1000  prot=5  max_prot=5  inheritance=2  offset=0x2000  resident=1  refs=2  shadow_depth=1  pager=1  share_mode=1  behavior=-1  object_id=0x7  full_object_id=0x900000007  path=/opt/big/worker
region  pid=5  address=0x500000  size=0x4000  tag=110  resident=2  shared_now_private=1  swapped=1  dirtied=2  reusable=1  share_mode=4  object_id=0x8  wired=1  dirtied_object=1  purge=1  pages=1*9,1*0,1*16
region  pid=5  address=0x600000  size=0x2000  tag=101  resident=1  share_mode=4  short_record=1  pages=
region  pid=5  address=0x700000  size=0x1000  tag=4294967295  dirtied=2  heft_only=1
)";
const std::string kOthers = R"(process  pid=6  status=5  readable=0  task_error=5
process  pid=7  flags=0  owned_none=1
process  pid=8
owned  pid=8  object_id=0x3  virtual=4096  resident=1  wired=2  reusable=3  compressed=4  flags=0x31
)";
const std::string kTags = "tag  tag=101  name=anonymous\ntag  tag=110  name=arena\n";

TEST(HXMachineRecorder, WritesTheMachineThatItReads) {
    const std::pair<std::string, int32_t> machines[] = {
        // and the setting afterwards
        {"host  page_size=4096  arg_max=4096  pid=99  shared_region=0  self_region_heft=1  "
         "ledger=cpu,page_table\n" +
             kKernel + kWorker + kOthers + kTags,
         1},
        {R"(host  pid=99  euid=501  memory_info_error=8
process  pid=4
top  pid=4  address=0x4000  size=0x8000  prot=1  max_prot=2  inheritance=0  offset=0x10  behavior=2  wired=3
region  pid=4  address=0x4000  size=0x4000
region  pid=4  address=0x8000  size=0x8000  share_mode=4  pages=2*1
)",
         -1},
        {"host  pid=99  list_pids_error=1\n", -1},
    };
    for (const auto &[records, settingAfter] : machines) {
        HXMadeUpMachine host(records);
        EXPECT_EQ(recorded(host), "heft-machine 1\n" + records);
        int32_t setting = -1;
        size_t bytes = sizeof setting;
        (void)host.sysctlbyname("vm.self_region_heft", &setting, &bytes, nullptr, 0);
        EXPECT_EQ(setting, settingAfter);
    }
}

TEST(HXMachineRecorder, LeavesOutItselfAndWhatVanishes) {
    const std::string start = "host  pid=99\n", first = "process  pid=4\n", last = "process  pid=6\n";
    const std::string regions =
        "region  pid=5  address=0x4000  size=0x4000\nregion  pid=5  address=0x8000  size=0x4000\n";
    const std::string fault = "fault  pid=5  call=mach_vm_region_recurse  error=268435459  from=";
    const std::pair<std::string, std::string> cases[] = {
        {"process  pid=5\n" + regions + fault + "4  becomes=gone\n", "it exited meanwhile"},
        {"process  pid=5\n" + regions + fault + "1  becomes=zombie\n", "(ipc/send) invalid destination port"},
    };
    for (const auto &[vanishing, reason] : cases) {
        HXMadeUpMachine host(start + "process  pid=99\n" + first + vanishing + last);
        std::string text;
        EXPECT_EQ(printedBy([&] { text = recorded(host); }).err,
                  "heft-record: 5 is left out: " + reason + "\n");
        EXPECT_EQ(text, "heft-machine 1\n" + start + first + last);
    }
    HXMadeUpMachine host(start + first + kKernel + last);
    std::string text;
    EXPECT_EQ(printedBy([&] {
                  text = recorded(host, false, {6, 7});
              }).err,
              "heft-record: 7 is left out: no such process\n");
    EXPECT_EQ(text, "heft-machine 1\n" + start + last);
}

// A process that exits before its task is opened.
TEST(HXMachineRecorder, LeavesOutWhatExitsBeforeItIsOpened) {
    class Exiting : public HXMadeUpMachine {
      public:
        using HXMadeUpMachine::HXMadeUpMachine;
        int32_t proc_pidinfo(int32_t pid, int32_t flavor, uint64_t argument, void *buffer,
                             uint32_t bytes) override {
            if (!_isGone) return HXMadeUpMachine::proc_pidinfo(pid, flavor, argument, buffer, bytes);
            errno = error;
            return 0;
        }
        kern_return_t task_for_pid(mach_port_t, int32_t, mach_port_t *) override {
            _isGone = true;
            return KERN_FAILURE;
        }
        int error = ESRCH;

      private:
        bool _isGone = false;
    };
    for (const int error : {ESRCH, EPERM}) {
        Exiting host("process  pid=5\n");
        host.error = error;
        std::string text;
        const HXPrinted printed = printedBy([&] { text = recorded(host, false, {5}); });
        EXPECT_EQ(printed.err.find("5 is left out: it exited meanwhile") != std::string::npos,
                  error == ESRCH);
        EXPECT_EQ(text.find("task_error=5") != std::string::npos, error == EPERM);
    }
}

TEST(HXMachineRecorder, GoesOnWithPagesThatOneRecordCannotHold) {
    std::string runs;
    for (int i = 0; i < 130000; i++)
        runs += i == 0 ? "1*1,1*9" : ",1*1,1*9";
    const std::string more = "\npages  pid=4  pages=";
    const std::string region =
        "host  page_size=4096  pid=99\nprocess  pid=4\nregion  pid=4  address=0x1000000"
        "  size=0x40000000  resident=1  share_mode=4  pages=";
    HXMadeUpMachine host(region + runs.substr(0, 800003) + more + runs.substr(800004) + "\n");
    std::string whole = recorded(host);
    int records = 1;
    for (size_t at; (at = whole.find(more)) != std::string::npos; records++)
        whole.replace(at, more.size(), ",");
    EXPECT_EQ(records, 2);
    EXPECT_TRUE(whole == "heft-machine 1\n" + region + runs + "\n");
}

TEST(HXMachineRecorder, MakesUpNamesButKeepsTheStructure) {
    HXMadeUpMachine host("host  page_size=4096  pid=99\n" + kKernel + kWorker + R"(
region  pid=5  address=0x800000  size=0x1000  pager=1  path=/opt/secret/worker (deleted)
region  pid=5  address=0x801000  size=0x1000  pager=1  path=/SYSV0000beef
region  pid=5  address=0x802000  size=0x1000  pager=1  path=[vdso]
region  pid=5  address=0x803000  size=0x1000  pager=1  path=/memfd:secret (deleted)
)" + kTags);
    const std::string text = recorded(host, true);
    for (const char *secret : {"worker", "opt", "big", "secret", "beef", "arena"})
        EXPECT_EQ(text.find(secret), std::string::npos) << secret;
    for (const char *kept :
         {"comm=f1  name=f1  args_path=/d1/d2/f1  ", "image  pid=5  path=/d1/d2/f1  ", "  path=/d1/d2/f1\n",
          "  path=/d1/d3/f1 (deleted)\n", "  path=/SYSVk1\n", "  path=[vdso]\n",
          "  path=/memfd:f2 (deleted)\n", "name=__TEXT", "name=inodes", "comm=kernel", "bundle_id=ext4",
          "path=a.c", "tag  tag=101  name=anonymous\n", "tag  tag=110  name=n1\n"})
        EXPECT_NE(text.find(kept), std::string::npos) << kept;
}

TEST(HXMemgraphRecorder, WritesWhatALiveWalkFinds) {
    const std::string machine = R"(process  pid=5  comm=worker  heft=40960  heft_peak=50000  page_table=12288
image  pid=5  path=/lib/x.so  base=0x1000
segment  pid=5  name=MACH_HEADER  start=0x1000  size=0x1000
segment  pid=5  name=__DATA x  start=0x2000  size=0x1000
region  pid=5  address=0x1000  size=0x1000  resident=1  pager=1  share_mode=1  object_id=7  path=/l
region  pid=5  address=0x2000  size=0x1000  prot=1  dirtied=1  resident=1  object_id=7  full_object_id=0x100000007
region  pid=5  address=0x4000  size=0x1000  pager=1  share_mode=4  object_id=8  path=/data
region  pid=5  address=0x5000  size=0x2000  tag=101  resident=2  swapped=1  dirtied=2  dirtied_object=1  purge=0  object_id=7  full_object_id=0x100000007
region  pid=5  address=0xffffffffff600000  size=0x1000  tag=31  share_mode=3
)";
    const std::string start = "heft-memgraph 1\nprocess  pid=5  name=worker  page_size=4096  phys_heft=40960"
                              "  phys_heft_peak=50000";
    const std::string images = R"(  shared_region=0
region  address=0x1000  length=0x1000  type=__TEXT  path=/lib/x.so  prot=3  max_prot=7  resident=4096  external_pager=1  share_mode=1  object_id=0x7
region  address=0x2000  length=0x1000  type=__DATA  path=/lib/x.so  prot=1  max_prot=7  resident=4096  dirty=4096  object_id=0x8
region  address=0x4000  length=0x1000  type=mapped file  path=/data  prot=3  max_prot=7  external_pager=1  share_mode=4  object_id=0x9
region  address=0x5000  length=0x2000  type=tag 101  prot=3  max_prot=7  user_tag=101  resident=8192  swapped=4096  dirty=)";
    const std::string pageTable =
        "region  address=0x8000000000000000  length=0x3000  type=page table  user_tag=239"
        "  resident=12288  dirty=12288  share_mode=1  object_id=0xfffffffe\n";
    const std::string end =
        "region  address=0xffffffffff600000  length=0x1000  type=tag 31  prot=3  max_prot=7"
        "  user_tag=31  share_mode=3\n";
    EXPECT_EQ(graphOf(machine), start + images + "8192  object_id=0x8  purgeable=0\n" + pageTable + end);
    EXPECT_EQ(graphOf(machine, false),
              start + "  shows_phys_heft=0" + images + "4096  object_id=0x8  purgeable=0\n" + end);
}

TEST(HXMemgraphRecorder, PutsPageTablesWhereTheyFitOrSaysWhyThereIsNoGraph) {
    const std::string process = "process  pid=5  page_table=12288\n";
    const std::pair<std::string, const char *> cases[] = {
        {process, "\nregion  address=0x8000000000000000  length=0x3000  type=page table"},
        {process + "region  pid=5  address=0x7fffffffffffd000  size=0x4000\n",
         "address=0x8000000000001000  length=0x3000"},
        {process + "region  pid=5  address=0x8000000000002000  size=0x1000\n",
         "address=0x8000000000003000  length=0x3000"},
        {"process  pid=4\n", "No such process"},
        {"process  pid=5  task_error=5\n", "(os/kern) failure"},
        {"process  pid=5  flags=1\n", "the kernel has no memory graph"},
        {process + "fault  pid=5  call=mach_vm_region_recurse  error=268435459  becomes=gone\n",
         "(ipc/send) invalid destination port"},
    };
    for (const auto &[records, expected] : cases)
        EXPECT_NE(graphOf(records).find(expected), std::string::npos) << expected;
}

} // namespace
