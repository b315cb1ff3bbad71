#include "analysis/HXHeft.h"
#include "support/HXBarePlatform.h"
#include "support/HXBuilders.h"

#include <cerrno>
#include <future>
#include <gtest/gtest.h>

namespace {
constexpr uint64_t kPage = 16384;

HXRegionFacts object(uint64_t id, uint8_t shareMode = SM_SHARED) {
    return {.object = id, .size = kPage, .dirty = kPage, .shareMode = shareMode};
}

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
    HXMadeUpProcess &add(int32_t pid, const std::vector<HXRegionFacts> &regions, bool is64bit = true) {
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

    HXBarePlatform _platform;
    std::unique_ptr<HXHeft> _heft;

  private:
    HXHeft::ProcessList _targets;
};
} // namespace

TEST_F(HXHeftTest, RegionsOfOneKeyShareAnObject) {
    HXRegionFacts cowDirty = object(7, SM_COW), cowClean = cowDirty;
    cowClean.dirty = 0;
    HXRegionFacts text = object(7), data = object(7), cache = object(7);
    text.segment = HXSegmentText;
    data.segment = HXSegmentData;
    cache.sharedCache = true;
    HXRegionFacts cacheElsewhere = cache, cacheOtherObject = cache, textInCache = cache;
    cacheElsewhere.start = 0x2000;
    cacheOtherObject.object = 8;
    textInCache.segment = HXSegmentText;
    // A key whose upper half is turned to zero, or to all ones, by the process's pid (10, and 20 beside it).
    const auto key = [](uint64_t high, uint64_t low, uint8_t mode) { return object(high << 32 | low, mode); };
    struct {
        const char *title;
        HXRegionFacts first, second; // of process 10 and of process 20
        bool shared;
        bool both64bit = true;
    } cases[] = {
        {"shared", object(7), object(7), true},
        {"different objects", object(7), object(8), false},
        {"the upper half counts", object(7), key(1, 7, SM_SHARED), false},
        {"copied on write", cowDirty, cowDirty, false},
        {"copied on write by one only", cowDirty, cowClean, false},
        {"not yet copied", cowClean, cowClean, true},
        {"a key that looks like the other's copy", cowDirty, key(10, 7, SM_SHARED), true},
        {"no object", object(0), object(0), false},
        {"all ones", object(UINT64_MAX), object(UINT64_MAX), false},
        {"all ones after the turn", key(0xFFFFFFFF ^ 10, 0xFFFFFFFF, SM_COW),
         key(0xFFFFFFFF ^ 20, 0xFFFFFFFF, SM_COW), false},
        {"text and data", text, data, false},
        {"text", text, text, true},
        {"data and no image", data, object(7), true},
        {"the shared cache goes by address", cache, cacheOtherObject, true},
        {"two places of the shared cache", cache, cacheElsewhere, false},
        {"the shared cache knows no segments", cache, textInCache, true},
        {"the shared cache of 32 and 64 bits", cache, cache, false, false},
    };
    for (const auto &test : cases) {
        const auto &first = add(10, {test.first});
        const auto &second = add(20, {test.second}, test.both64bit);
        gather();
        EXPECT_EQ(objectOf(first) == objectOf(second), test.shared) << test.title;
    }
    // Two regions of one process with no identifier to go by never share.
    const auto &alone = add(10, {object(0), object(0), object(UINT64_MAX), object(UINT64_MAX)});
    EXPECT_EQ(gather().memoryObjects().size(), 4u);
    EXPECT_EQ(objectOf(alone, 1)->sizes().dirty, 0u);
    EXPECT_EQ(objectOf(alone, 2)->sizes().dirty, kPage);
}

TEST_F(HXHeftTest, OwnersAndViewsFollowTheSwitches) {
    HXRegionFacts owned = object(7);
    owned.owned = true;
    for (const bool breakDown : {true, false})
        for (const bool disabled : {true, false}) {
            HXHeftSwitches::setBreakDownPhysHeft(breakDown);
            HXHeftSwitches::setSharingAnalysisDisabled(disabled);
            const auto &first = add(10, {owned, object(8), object(8)});
            const auto &second = add(20, {owned, object(8)});
            gather();
            EXPECT_EQ(objectOf(first)->ownerPid(), breakDown ? 20 : -1); // the later one
            EXPECT_EQ(objectOf(second, 1)->processMemoryRegions().size(), disabled ? 0u : 3u);
        }
}

TEST_F(HXHeftTest, AnInterruptLeavesOutWhatHasNotBegun) {
    _platform.realServices.setWorkerCount(1);
    HXHeft *heft = nullptr;
    HXHeft::ProcessList targets;
    auto started = std::make_unique<HXMadeUpProcess>(30, "started", std::vector{object(1)});
    started->whenGathered = [&] { heft->cancel(); };
    targets.push_back(std::make_unique<HXMadeUpProcess>(10, "late", std::vector{object(2)}));
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
    auto &stuck = add(10, {object(1)});
    stuck.setHiddenFromDisplay(true);
    stuck.whenGathered = [] { answer.get_future().wait(); };
    stuck.whenEnded = [] { written.set_value(); };
    add(20, {object(2)});
    const HXPrinted printed = printedBy([&] { gather(); });
    const HXProcess &told = *_heft->processes()[0];
    EXPECT_EQ(told.errors(), std::vector<std::string>{"p [10]: not answering"});
    EXPECT_EQ(printed.err, "p [10]: not answering\n");
    EXPECT_TRUE(told.pid() == 10 && told.hiddenFromDisplay() && told.is64bit() && told.pageSize() == kPage);
    EXPECT_EQ(_heft->memoryObjects().size(), 1u);
    answer.set_value();
    written.get_future().wait();
    EXPECT_EQ(told.memoryRegions().size(), 0u);
}

TEST_F(HXHeftTest, AnAnalysisSwitchThatCannotBeReadOrSetIsTold) {
    EXPECT_TRUE(HXHeftSwitches::breakDownPhysHeft());
    struct : HXBarePlatform {
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
