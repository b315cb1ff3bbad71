#include "process/HXProcessSnapshot.h"
#include "process/HXUserProcess.h"
#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"
#include "support/HXMadeUpMachine.h"
#include "support/HXRun.h"

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstring>
#include <future>
#include <gtest/gtest.h>

namespace {
// Answers the argument area of every process with given bytes.
class ArgumentAreas : public HXMadeUpMachine {
  public:
    std::optional<uint32_t> argMax = 64;
    std::optional<std::string> area;

    int32_t sysctl(const int32_t *name, uint32_t nameLength, void *old, size_t *oldBytes) override {
        if (nameLength == 2 && name[0] == 1 && name[1] == 8 && argMax && *oldBytes == 4) {
            std::memcpy(old, &*argMax, 4);
            return 0;
        }
        if (nameLength == 3 && name[0] == 1 && name[1] == 49 && name[2] == 123 && area) {
            std::memcpy(old, area->data(), *oldBytes = std::min(area->size(), *oldBytes));
            return 0;
        }
        return -1;
    }
};

std::string nameOf(ArgumentAreas &platform, const std::vector<std::string> &words) {
    platform.area.reset();
    if (words[0] == "empty") platform.area = "";
    if (words[0] != "-" && words[0] != "empty") {
        const uint32_t count = static_cast<uint32_t>(std::stoul(words[0]));
        platform.area = std::string(reinterpret_cast<const char *>(&count), sizeof count) + words[1];
        std::replace(platform.area->begin(), platform.area->end(), '|', '\0');
    }
    proc_bsdinfo info{};
    info.pbi_pid = 123;
    std::memcpy(info.pbi_name, words[2].data(), words[2].size());
    std::memcpy(info.pbi_comm, words[3].data(), words[3].size());
    return HXProcess::_nameForBsdInfo(info);
}
} // namespace

TEST(HXProcessTest, IsNamedAfterItsExecutableOrItsRecord) {
    ArgumentAreas platform;
    const std::string rows = HXReadCases("names.txt")[0].input;
    EXPECT_EQ(HXAnswered(rows, [&](const auto &row) { return nameOf(platform, HXWordsOf(row)); }), rows);
    for (const auto argMax : {std::optional<uint32_t>(), std::optional<uint32_t>(0)}) {
        platform.argMax = argMax;
        EXPECT_EQ(nameOf(platform, {"1", "/usr/libexec/tool|", "n", "c"}), "n");
    }
}

TEST(HXProcessTest, AListAndItsNamesAreReadOnceWhenSomebodyAsks) {
    class Counted : public HXMadeUpMachine {
      public:
        using HXMadeUpMachine::HXMadeUpMachine;
        int lists = 0, names = 0;
        bool mayBeNamed(const proc_bsdinfo &, std::string_view name) override {
            return std::isalpha(name[0]);
        }
        int32_t proc_listallpids(int32_t *pids, uint32_t bytes) override {
            lists += pids != nullptr;
            return HXMadeUpMachine::proc_listallpids(pids, bytes);
        }
        int32_t sysctl(const int32_t *name, uint32_t length, void *old, size_t *oldBytes) override {
            names += length == 3;
            return HXMadeUpMachine::sysctl(name, length, old, oldBytes);
        }
    };
    Counted machine("process  pid=1  name=a\nprocess  pid=2  name=b\nprocess  pid=3  name=b\n"
                    "process  pid=4  name=c  ppid=3\nprocess  pid=5  name=unlisted  listed=0\n");
    HXProcessSnapshot alone;
    EXPECT_EQ(HXProcess::processWithPid(3, alone)->displayString(), "b [3]");
    EXPECT_EQ(machine.lists, 0);
    EXPECT_EQ(machine.names, 1);

    HXProcessSnapshot snapshot;
    snapshot.pidsForStringDescriptions({"2"}, nullptr);
    EXPECT_EQ(machine.names, 1) << "only who may be called so is asked";
    EXPECT_EQ(snapshot.pidsForStringDescriptions({"b", "4", "c"}, nullptr)->entries().size(), 3u);
    EXPECT_EQ(snapshot.childPidsForPids({3}), (std::vector<int32_t>{3, 4}));
    EXPECT_EQ(snapshot.allProcessesExcludingPids({2})->size(), 3u);
    EXPECT_EQ(HXProcess::processWithPid(5, snapshot)->name(), "unlisted");
    EXPECT_EQ(machine.lists, 1);
    EXPECT_EQ(machine.names, 6);
}

TEST(HXProcessTest, OnlyWhatRunsAndCannotBeOpenedIsAnError) {
    class Opened : public HXMadeUpMachine {
      public:
        using HXMadeUpMachine::HXMadeUpMachine;
        std::promise<void> answer;
        kern_return_t task_for_pid(mach_port_t self, int32_t pid, mach_port_t *task) override {
            if (pid == 1) {
                answer.get_future().wait(); // until the machine is no more
                return KERN_FAILURE;
            }
            return pid == 2 ? KERN_FAILURE : HXMadeUpMachine::task_for_pid(self, pid, task);
        }
        int32_t proc_pidinfo(int32_t pid, int32_t flavor, uint64_t argument, void *buffer,
                             uint32_t bytes) override {
            errno = ESRCH;
            if (pid == 2 && flavor == PROC_PIDT_SHORTBSDINFO) return 0; // it has ended
            return HXMadeUpMachine::proc_pidinfo(pid, flavor, argument, buffer, bytes);
        }
    };
    Opened machine("process  pid=1\nprocess  pid=2\nprocess  pid=3  task_error=5\nprocess  pid=4\n");
    machine.realServices.setAnswerTime(std::chrono::milliseconds(100));
    HXProcessSnapshot snapshot;
    HXProcess::Map processes;
    const HXPrinted printed =
        printedBy([&] { processes = *snapshot.allProcessesExcludingPids(std::set<int32_t>()); });
    EXPECT_TRUE(processes.size() == 1 && processes.contains(4));
    EXPECT_EQ(HXProcess::globalErrors(),
              (std::vector<std::string>{"task_for_pid [1] (os/kern) operation timed out",
                                        "task_for_pid [3] (os/kern) failure"}));
    EXPECT_EQ(printed.err, "task_for_pid: (os/kern) operation timed out\ntask_for_pid: (os/kern) failure\n");
}

// A bisection by addresses, down to 16 MiB.
TEST(HXProcessTest, SearchesForTheLastMappingBelowTheSharedRegion) {
    class Asked : public HXMadeUpMachine {
      public:
        using HXMadeUpMachine::HXMadeUpMachine;
        std::vector<uint64_t> addresses;
        kern_return_t mach_vm_region(mach_port_t task, uint64_t *address, uint64_t *size, int32_t flavor,
                                     vm_region_basic_info_64 *info, uint32_t *count) override {
            addresses.push_back(*address);
            return HXMadeUpMachine::mach_vm_region(task, address, size, flavor, info, count);
        }
    };
    Asked machine("process  pid=7\n" + region(7, 0x80000000, 0x4000, "tag=2") +
                  region(7, 0x180000000, 0x4000, "tag=2"));
    HXUserProcess process;
    HXProcessSnapshot snapshot;
    ASSERT_TRUE(process.initWithBsdInfo(*snapshot.bsdInfoOfPid(7), &snapshot));
    EXPECT_EQ(process._lastNonSharedCacheRegion(), 0x80000000u);
    EXPECT_EQ(machine.addresses, (std::vector<uint64_t>{0xc0000000, 0x5fffe000, 0x9fffe000, 0x8fffd000,
                                                        0x87ffc800, 0x83ffc400, 0x81ffc200, 0x80ffc100}));
}

TEST(HXProcessTest, DirtyFlagsAndLayoutsAreTold) {
    const HXMadeUpMachine platform;
    HXUserProcess process;
    EXPECT_EQ(process.idleExitStatus(), HXIdleExitUnknown);
    for (uint32_t flags = 0; flags < 12; flags++) {
        process._setIdleExitStatusFromDirtyFlags(flags);
        EXPECT_EQ(process.idleExitStatus(), flags == 7                  ? HXIdleExitDirty
                                            : flags == 3 || flags == 11 ? HXIdleExitClean
                                                                        : HXIdleExitNotSupported);
    }

    const HXSharedRegion before = process.sharedRegion();
    for (const int32_t code : {5, -1, 100}) {
        const auto printed = printedBy([&] { EXPECT_FALSE(process._setSharedRegionFromPlatform(code)); });
        EXPECT_EQ(printed.err, "Unable to determine platform architecture of target\n");
        EXPECT_EQ(process.sharedRegion().base, before.base);
    }
    EXPECT_TRUE(process._setSharedRegionFromPlatform(HXPlatformARM64_32));
    EXPECT_EQ(process.sharedRegion().end(), 0x5a000000u);
}
