// Recording a replayed machine gives the machine again.
#include "record/HXMachineRecorder.h"
#include "platform/HXRegionTags.h"
#include "platform/replay/HXReplayPlatform.h"
#include "support/HXBarePlatform.h"

#include <gtest/gtest.h>

#include <algorithm>

namespace {

// What a recorder writes of the machine; a bar stands for each TAB in both texts.
class Recording {
  public:
    explicit Recording(std::string records, bool anonymize = false, const std::vector<int32_t> &pids = {}) {
        std::replace(records.begin(), records.end(), '|', '\t');
        const auto machine = HXMachine::loadText("heft-machine 1\n" + records, &reason);
        if (!machine) return;
        HXReplayPlatform host(*machine, services);
        std::FILE *const file = std::tmpfile();
        HXMachineRecorder recorder(host, file, anonymize);
        EXPECT_TRUE(recorder.record(pids));
        text.resize(static_cast<size_t>(std::ftell(file)));
        std::rewind(file);
        EXPECT_EQ(std::fread(text.data(), 1, text.size(), file), text.size());
        std::fclose(file);
        std::replace(text.begin(), text.end(), '\t', '|');
        int32_t setting = 0;
        size_t bytes = sizeof setting;
        if (host.sysctlbyname("vm.self_region_heft", &setting, &bytes, nullptr, 0) == 0)
            settingAfter = setting;
    }

    HXLinuxServices services;
    std::string reason;
    std::string text;
    int32_t settingAfter = -1;
};

// Records in the recorder's order and spelling.
const std::string kHost =
    "host|page_size=4096|arg_max=4096|pid=99|self_region_heft=0|ledger=cpu,page_table\n";
const std::string kKernel = "zone|name=inodes|count=3|cur_size=8192|elem_size=600|collectable=1\n"
                            "site|flags=0x102|site=0xffff0010|size=4096|zone=1\n"
                            "site|flags=0x500|site=0x3|size=1|mapped=2|tag=3|name=stacks\n"
                            "kext|load_tag=4|bundle_id=ext4\n"
                            "symbol|address=0xffff0010|size=1|name=f|path=a.c|line=7\n";
const std::string kWorker =
    "process|pid=5|ppid=2|comm=worker|name=worker|args_path=/opt/big/worker|argc=3|dirty_flags=3|heft=4096"
    "|heft_peak=8192|page_table=-1|owned_error=13\n"
    "image|pid=5|path=/opt/big/worker|base=0x400000\n"
    "segment|pid=5|name=__TEXT|start=0x400000|size=0x1000\n"
    "region|pid=5|address=0x400000|size=0x1000|prot=5|max_prot=5|inheritance=2|offset=0x2000|resident=1|refs="
    "2"
    "|shadow_depth=1|pager=1|share_mode=1|behavior=-1|object_id=0x7|full_object_id=0x900000007"
    "|path=/opt/big/worker\n"
    "region|pid=5|address=0x500000|size=0x4000|tag=110|resident=2|shared_now_private=1|swapped=1|dirtied=2"
    "|reusable=1|share_mode=4|object_id=0x8|wired=1|purge=1|dirtied_object=1|pages=1*9,1*0,1*16\n"
    "region|pid=5|address=0x600000|size=0x2000|tag=101|resident=1|share_mode=4|short_record=1|pages=\n"
    "region|pid=5|address=0x700000|size=0x1000|tag=4294967295|dirtied=2|heft_only=1\n";
const std::string kOthers =
    "process|pid=6|status=5|readable=0|task_error=5\n"
    "process|pid=7|flags=0|owned_none=1\n"
    "process|pid=8\n"
    "owned|pid=8|object_id=0x3|virtual=4096|resident=1|wired=2|reusable=3|compressed=4"
    "|flags=0x31\n";
const std::string kTags = "tag|tag=101|name=anonymous\ntag|tag=110|name=arena\n";

TEST(HXMachineRecorder, WritesTheMachineThatItReads) {
    const std::string noSharedRegion = "host|page_size=4096|arg_max=4096|pid=99|self_region_heft=1"
                                       "|shared_region=0|ledger=cpu,page_table\n";
    const std::string machines[] = {
        noSharedRegion + kKernel + "process|pid=0|flags=1|comm=kernel\n" + kWorker + kOthers + kTags,
        "host|pid=99|euid=501|memory_info_error=8\nprocess|pid=4\n"
        "top|pid=4|address=0x4000|size=0x8000|prot=1|max_prot=2|inheritance=0|offset=0x10|behavior=2|wired="
        "3\n"
        "region|pid=4|address=0x4000|size=0x4000\n"
        "region|pid=4|address=0x8000|size=0x8000|share_mode=4|pages=2*1\n",
        "host|pid=99|list_pids_error=1\n",
    };
    for (const std::string &machine : machines) {
        const Recording recording(machine);
        ASSERT_EQ(recording.reason, "");
        EXPECT_EQ(recording.text, "heft-machine 1\n" + machine);
        const bool hasSetting = machine.find("self_region_heft") != std::string::npos;
        EXPECT_EQ(recording.settingAfter, hasSetting ? 1 : -1);
    }
}

TEST(HXMachineRecorder, LeavesOutItselfAndWhatVanishes) {
    const std::string start = "host|pid=99\n", first = "process|pid=4\n", last = "process|pid=6\n";
    const std::string gone = "process|pid=5\nregion|pid=5|address=0x4000|size=0x4000\n"
                             "region|pid=5|address=0x8000|size=0x4000\n"
                             "fault|pid=5|call=mach_vm_region_recurse|from=4|error=268435459|becomes=gone\n";
    testing::internal::CaptureStderr();
    EXPECT_EQ(Recording(start + "process|pid=99\n" + first + gone + last).text,
              "heft-machine 1\n" + start + first + last);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "heft-record: 5 is left out: it exited meanwhile\n");
    EXPECT_EQ(Recording(start + first + kKernel + last, false, {6}).text, "heft-machine 1\n" + start + last);
}

TEST(HXMachineRecorder, GoesOnWithPagesThatOneRecordCannotHold) {
    std::string runs;
    for (int i = 0; i < 130000; i++)
        runs += "1*1,1*9,";
    runs.pop_back();
    const std::string region =
        "host|page_size=4096|pid=99\nprocess|pid=4\n"
        "region|pid=4|address=0x1000000|size=0x40000000|resident=1|share_mode=4|pages=";
    const std::string half = runs.substr(0, 800003), rest = runs.substr(800004);
    const Recording recording(region + half + "\npages|pid=4|pages=" + rest + "\n");
    ASSERT_EQ(recording.reason, "");
    const size_t second = recording.text.find("\npages|pid=4|pages=");
    ASSERT_NE(second, std::string::npos);
    std::string whole = recording.text;
    for (size_t at; (at = whole.find("\npages|pid=4|pages=")) != std::string::npos;)
        whole.replace(at, 19, ",");
    EXPECT_TRUE(whole == "heft-machine 1\n" + region + runs + "\n");
}

TEST(HXMachineRecorder, MakesUpNamesButKeepsTheStructure) {
    const std::string text =
        Recording("host|page_size=4096|pid=99\n" + kKernel + "process|pid=0|flags=1|comm=kernel\n" + kWorker +
                      "region|pid=5|address=0x800000|size=0x1000|pager=1"
                      "|path=/opt/secret/worker (deleted)\n"
                      "region|pid=5|address=0x801000|size=0x1000|pager=1|path=/SYSV0000beef\n"
                      "region|pid=5|address=0x802000|size=0x1000|pager=1|path=[vdso]\n"
                      "region|pid=5|address=0x803000|size=0x1000|pager=1"
                      "|path=/memfd:secret (deleted)\n" +
                      kTags,
                  true)
            .text;
    for (const char *secret : {"worker", "opt", "big", "secret", "beef", "arena"})
        EXPECT_EQ(text.find(secret), std::string::npos) << secret;
    for (const char *kept :
         {"comm=f1|name=f1|args_path=/d1/d2/f1|", "image|pid=5|path=/d1/d2/f1|", "|path=/d1/d2/f1\n",
          "|path=/d1/d3/f1 (deleted)\n", "|path=/SYSVk1\n", "|path=[vdso]\n", "|path=/memfd:f2 (deleted)\n",
          "name=__TEXT", "name=inodes", "comm=kernel", "bundle_id=ext4", "path=a.c",
          "tag|tag=101|name=anonymous\n", "tag|tag=110|name=n1\n"})
        EXPECT_NE(text.find(kept), std::string::npos) << kept;
}

} // namespace
