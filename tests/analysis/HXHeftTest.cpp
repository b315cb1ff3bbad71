#include "analysis/HXHeft.h"
#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"
#include "support/HXMadeUpMachine.h"

#include <cerrno>
#include <future>
#include <gtest/gtest.h>

namespace {
class HXHeftTest : public testing::Test {
  protected:
    HXHeftTest() {
        HXHeftSwitches::setBreakDownPhysHeft(true);
        HXProcess::_clearGlobalErrors();
    }
    ~HXHeftTest() override {
        HXHeftSwitches::setSharingAnalysisDisabled(false);
        HXProcess::_clearGlobalErrors();
    }
    HXMadeUpProcess &add(int32_t pid, const std::vector<std::string> &regions, bool is64bit = true) {
        auto process = std::make_unique<HXMadeUpProcess>(pid, "p", regions);
        HXMadeUpProcess &reference = *process;
        process->setIs64bit(is64bit);
        _targets.push_back(std::move(process));
        return reference;
    }
    HXHeft &gather() {
        _heft = std::make_unique<HXHeft>(std::move(_targets));
        _heft->gatherData();
        return *_heft;
    }
    // The object of a process's region.
    static const HXMemoryObject *objectOf(const HXProcess &process, size_t region = 0) {
        return process.memoryRegions()[region].memoryObject();
    }

    HXMadeUpMachine _platform;
    std::unique_ptr<HXHeft> _heft;

  private:
    HXHeft::ProcessList _targets;
};
} // namespace

TEST_F(HXHeftTest, RegionsOfOneKeyShareAnObject) {
    for (const HXCase &each : HXReadCases("keys.txt")) {
        const auto answer = [&](const std::string &regions) {
            const size_t slash = regions.find('/');
            const auto &first = add(10, {regions.substr(0, slash)});
            const auto &second = add(20, {regions.substr(slash + 1)}, each.title.starts_with("64-bit"));
            gather();
            return objectOf(first) == objectOf(second) ? "one" : "two";
        };
        EXPECT_EQ(HXAnswered(each.input, answer), each.input) << each.title;
    }
    // Two regions of one process with no identifier to go by never share.
    const std::string nameless = "0+4000 d4000", allOnes = nameless + " #ffffffffffffffff";
    const auto &alone = add(10, {nameless, nameless, allOnes, allOnes});
    EXPECT_EQ(gather().memoryObjects().size(), 4u);
    EXPECT_EQ(objectOf(alone, 1)->sizes().dirty, 0u);
    EXPECT_EQ(objectOf(alone, 2)->sizes().dirty, 0x4000u);
}

TEST_F(HXHeftTest, OwnersAndViewsFollowTheSwitches) {
    const std::string owned = "0+4000 d4000 #7 owned", shared = "0+4000 d4000 #8";
    for (const bool breakDown : {true, false})
        for (const bool disabled : {true, false}) {
            HXHeftSwitches::setBreakDownPhysHeft(breakDown);
            HXHeftSwitches::setSharingAnalysisDisabled(disabled);
            const auto &first = add(10, {owned, shared, shared});
            const auto &second = add(20, {owned, shared});
            gather();
            EXPECT_EQ(objectOf(first)->ownerPid(), breakDown ? 20 : -1); // the later one
            EXPECT_EQ(objectOf(second, 1)->processMemoryRegions().size(), disabled ? 0u : 3u);
        }
}

// As two memory graphs of one process have: it is one member of a group, whichever of them comes first.
TEST_F(HXHeftTest, RecordsOfOnePidAreOneMember) {
    add(10, {"0+4000 #1", "0+4000 #2"});
    add(20, {"0+4000 #1", "0+4000 #2", "0+4000 #3", "0+4000 #4"});
    add(10, {"0+4000 #2", "0+4000 #3", "0+4000 #5"});
    const HXHeftSharingData sharing = gather()._sharingData();
    std::string groups;
    for (const HXProcessGroup &group : sharing.groups) {
        for (const HXRegionOwner *process : group.processes())
            groups += std::to_string(process->pid()) + " ";
        groups += "x" + std::to_string(sharing.objectsOfGroup(group).size()) + "\n";
    }
    EXPECT_EQ(groups, "10 20 x3\n20 x1\n10 x1\n");
    EXPECT_EQ(sharing.groupsOfProcess(10)->size(), 2u);
}

TEST_F(HXHeftTest, AnInterruptLeavesOutWhatHasNotBegun) {
    _platform.realServices.setWorkerCount(1);
    HXHeft *heft = nullptr;
    HXHeft::ProcessList targets;
    auto started = std::make_unique<HXMadeUpProcess>(30, "started", std::vector<std::string>{"0+4000 #1"});
    started->whenGathered = [&] { heft->cancel(); };
    targets.push_back(std::make_unique<HXMadeUpProcess>(10, "late", std::vector<std::string>{"0+4000 #2"}));
    targets.push_back(std::move(started));
    HXHeft analysis(std::move(targets));
    heft = &analysis;
    analysis.gatherData();
    EXPECT_EQ(analysis.processes()[0]->memoryRegions().size(), 0u);
    EXPECT_EQ(analysis.processes()[1]->memoryRegions().size(), 1u);
    EXPECT_EQ(
        HXProcess::globalErrors(),
        std::vector<std::string>{"Heft exited early due to SIGINT and did not finish gathering all data"});
}

TEST_F(HXHeftTest, AProcessThatDoesNotAnswerIsToldBesideTheOthers) {
    _platform.realServices.setAnswerTime(std::chrono::milliseconds(100));
    static std::promise<void> answer, written; // of a worker that outlives the analysis
    auto &stuck = add(10, {"0+4000 #1"});
    stuck.setHiddenFromDisplay(true);
    stuck.whenGathered = [] { answer.get_future().wait(); };
    stuck.whenEnded = [] { written.set_value(); };
    add(20, {"0+4000 #2"});
    const HXPrinted printed = printedBy([&] { gather(); });
    const HXProcess &told = *_heft->processes()[0];
    EXPECT_EQ(told.errors(), std::vector<std::string>{"p [10]: not answering"});
    EXPECT_EQ(printed.err, "p [10]: not answering\n");
    EXPECT_TRUE(told.pid() == 10 && told.hiddenFromDisplay() && told.is64bit() && told.pageSize() == 0x4000);
    EXPECT_EQ(_heft->memoryObjects().size(), 1u);
    answer.set_value();
    written.get_future().wait();
    EXPECT_EQ(told.memoryRegions().size(), 0u);
}

TEST_F(HXHeftTest, AnAnalysisSwitchThatCannotBeReadOrSetIsTold) {
    EXPECT_TRUE(HXHeftSwitches::breakDownPhysHeft());
    struct : HXMadeUpMachine {
        int32_t sysctlbyname(const char *, void *, size_t *, const void *, size_t) override {
            errno = EPERM;
            return -1;
        }
    } refusing;
    const auto printed = printedBy([&] {
        HXHeftSwitches::setBreakDownPhysHeft(true);
        EXPECT_FALSE(HXHeftSwitches::breakDownPhysHeft());
    });
    EXPECT_EQ(printed.err,
              "Unable to configure physical heft data collection: Operation not permitted\n"
              "Unable to retrieve status of physical heft data collection: Operation not permitted\n");
}
