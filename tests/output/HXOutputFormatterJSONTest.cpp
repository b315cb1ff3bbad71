#include "output/HXOutputFormatterJSON.h"

#include "support/HXBarePlatform.h"
#include "support/HXBuilders.h"
#include "support/HXRun.h"
#include "support/HXTwoWorkers.h"

#include "model/HXHeftSwitches.h"

#include <cerrno>
#include <filesystem>
#include <gtest/gtest.h>

namespace {
std::string withoutLineEnds(std::string text) {
    std::erase(text, '\n');
    return text;
}
} // namespace

TEST(HXOutputFormatterJSONTest, WritesAWholeDocument) {
    EXPECT_EQ(report(kTwoWorkers, {"alpha", "beta"}).json,
              withoutLineEnds(R"({"unit":"byte","bytes per unit":1,
"processes":[
{"name":"alpha","pid":100,"heft":311296,"categories":{
"__TEXT":{"dirty":0,"swapped":0,"clean":32768,"reclaimable":0,"wired":0,"regions":1},
"MALLOC_SMALL":{"dirty":245760,"swapped":49152,"clean":65536,"reclaimable":0,"wired":0,"regions":1},
"page table":{"dirty":32768,"swapped":0,"clean":0,"reclaimable":0,"wired":0,"regions":1}},
"auxiliary":{"phys_heft":300000,"phys_heft_peak":400000}},
{"name":"beta","pid":200,"heft":49152,"categories":{
"MALLOC_LARGE":{"dirty":16384,"swapped":0,"clean":0,"reclaimable":0,"wired":16384,"regions":1}},
"auxiliary":0}],
"errors":[],"warnings":[],
"summary":{
"__TEXT":{"dirty":0,"swapped":0,"clean":32768,"reclaimable":0,"wired":0,"regions":1},
"MALLOC_SMALL":{"dirty":245760,"swapped":49152,"clean":65536,"reclaimable":0,"wired":0,"regions":1},
"mapped file":{"dirty":32768,"swapped":0,"clean":32768,"reclaimable":0,"wired":0,"regions":2},
"page table":{"dirty":32768,"swapped":0,"clean":0,"reclaimable":0,"wired":0,"regions":1},
"MALLOC_LARGE":{"dirty":16384,"swapped":0,"clean":0,"reclaimable":0,"wired":16384,"regions":1},
"total":{"dirty":327680,"swapped":49152,"clean":131072,"reclaimable":0,"wired":16384,"regions":6}},
"total heft":327680,"auxiliary":0,
"shared":[{"pids":[100,200],"categories":{
"mapped file":{"dirty":32768,"swapped":0,"clean":32768,"reclaimable":0,"wired":0,"regions":2}}}],
"page size":16384})"));
}

TEST(HXOutputFormatterJSONTest, ListsRegionsOnlyWhenAskedTo) {
    EXPECT_EQ(report(kTwoWorkers, {"alpha", "beta"}).json.find("regions\":["), std::string::npos);
    const std::string json = report(kTwoWorkers, {"beta", "-v", "--vmObjectDirty"}).json;
    EXPECT_EQ(
        json.rfind(R"({"unit":"byte","bytes per unit":1,"vm_object_dirty_analysis":true,"processes":[{)", 0),
        0u);
    EXPECT_NE(
        json.find(R"("name":"beta","pid":200,"regions":[{"id":3,"name":"MALLOC_LARGE","addr":65536,)"
                  R"("vsize":16384,"dirty":16384,"wired":16384},{"id":50,"name":"mapped file /data/file.db",)"
                  R"("addr":131072,"vsize":65536,"dirty":32768,"clean":32768}],"heft":49152,)"),
        std::string::npos)
        << json;
}

TEST(HXOutputFormatterJSONTest, WritesRegionsNamesAndMessages) {
    const HXBarePlatform platform;
    HXHeftSwitches::setBreakDownPhysHeft(true);
    const std::string path = temporaryPath();
    HXMadeUpProcess process(-5, "a \"b\" \\", {});
    HXMemoryRegionList regions;
    regions.push_back(makeRegion({.object = UINT64_MAX, .start = kNoAddress, .size = 7, .name = "\"q\""}));
    regions.push_back(makeRegion({.start = 0, .name = "x", .detail = "/y"}));
    regions.push_back(makeRegion({.start = 1,
                                  .size = 2,
                                  .offset = 3,
                                  .dirty = 4,
                                  .swapped = 5,
                                  .clean = 6,
                                  .reclaimable = 7,
                                  .wired = true}));
    process.setMemoryRegions(std::move(regions));
    process.addWarning("careful");
    process.addError("first");
    process.addError("second");
    const auto formatter = HXOutputFormatterJSON::withPath(path);
    ASSERT_TRUE(formatter);
    formatter->printAtlasLikeOutputForProcess(process, process.memoryRegions());
    for (int i = 0; i < 2; i++) {
        formatter->printProcessHeader(process);
        formatter->endProcessHeader(process);
        formatter->printProcessCategories(HXCategoryMap(), {});
        formatter->printProcessAuxData(nullptr);
    }
    formatter->printProcessesWithWarnings({&process}, {&process}, {"global"});
    formatter->printSummaryCategories(HXCategoryMap(), {}, true);
    HXAuxDictionary aux, inner;
    aux.set("k", std::make_shared<HXAuxData>(-1, false));
    aux.set("m", std::make_shared<HXAuxDictionary>());
    formatter->printGlobalAuxData(&aux);
    formatter->end();
    EXPECT_EQ(formatter->writeError(), 0);
    const std::string one = withoutLineEnds(R"({"name":"a \"b\" \","pid":-5,
"errors":["first","second"],"warnings":["careful"],
"regions":[{"id":18446744073709551615,"name":"\"q\"","vsize":7},{"id":0,"name":"x /y","addr":0,"vsize":0},
{"id":0,"name":"memory","addr":1,"vsize":2,"offset":3,"dirty":4,"swapped":5,"clean":6,"reclaimable":7,"wired":2}],
"categories":{},"auxiliary":0})");
    EXPECT_EQ(contentOf(path),
              R"({"unit":"byte","bytes per unit":1,"processes":[)" + one + "," + one + withoutLineEnds(R"(],
"errors":["global","first","second"],"warnings":["careful"],
"summary":{"total":{"dirty":0,"swapped":0,"clean":0,"reclaimable":0,"wired":0,"regions":0}},"total heft":0,
"auxiliary":{"k":-1,"m":{}},"shared":[],"page size":16384})"));
}

TEST(HXOutputFormatterJSONTest, SaysWhenNothingCanBeWritten) {
    const HXBarePlatform platform;
    EXPECT_EQ(HXOutputFormatterJSON::withPath("/no such directory/file"), nullptr);
    EXPECT_EQ(errno, ENOENT);
    if (!std::filesystem::exists("/dev/full")) GTEST_SKIP() << "no /dev/full";
    const auto formatter = HXOutputFormatterJSON::withPath("/dev/full");
    ASSERT_TRUE(formatter);
    formatter->printProcessesWithWarnings({}, {}, std::vector<std::string>(100000, "a long report"));
    formatter->printSummaryCategories(HXCategoryMap(), {}, false);
    formatter->printGlobalAuxData(nullptr);
    formatter->end();
    EXPECT_EQ(formatter->writeError(), ENOSPC);
}

TEST(HXOutputFormatterJSONTest, SharesOneEntryUnlessViewsDiffer) {
    // Both map object 7 whole; process 2 maps only the first page of object 8.
    const std::string machine =
        "process  pid=1001  name=one\n" +
        region(1001, 0x4000, 0x8000, "tag=2  object_id=7  share_mode=4  resident=2  dirtied=2") +
        region(1001, 0x10000, 0x8000, "tag=2  object_id=8  share_mode=4  resident=2  dirtied=2") +
        "process  pid=1002  name=two\n" +
        region(1002, 0x4000, 0x8000, "tag=2  object_id=7  share_mode=4  resident=2  dirtied=2");
    const auto category = [](int dirty, int regions) {
        return R"({"MALLOC_SMALL":{"dirty":)" + std::to_string(dirty) +
               R"(,"swapped":0,"clean":0,"reclaimable":0,"wired":0,"regions":)" + std::to_string(regions) +
               "}}}";
    };
    EXPECT_NE(report(machine, {"one", "two"})
                  .json.find(R"("shared":[{"pids":[1001,1002],"categories":)" + category(32768, 2) + "],"),
              std::string::npos);
    const std::string partial =
        report(machine +
                   region(1002, 0x10000, 0x4000, "tag=2  object_id=8  share_mode=4  resident=1  dirtied=1"),
               {"one", "two"})
            .json;
    // One category of both objects: four dirty pages for the first process, three for the second, which comes
    // first: of two that have the same heft the greater pid does.
    EXPECT_NE(partial.find(R"("shared":[{"pids":[1001,1002],"specific_to_pid":1002,"categories":)" +
                           category(49152, 3) +
                           R"(,{"pids":[1001,1002],"specific_to_pid":1001,"categories":)" +
                           category(65536, 3) + "],"),
              std::string::npos)
        << partial;
}
