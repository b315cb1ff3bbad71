// What heft-html shows of a report, and the page as a file; tests/html/check looks at it in a browser.
#include "report/HXPageData.h"
#include "support/HXProgramRun.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <sys/stat.h>

namespace {
namespace fs = std::filesystem;
using Json = nlohmann::json;
using Number = HXReport::Number;

const fs::path kProgram = fs::path(HEFT_PROGRAM).parent_path() / "heft-html";

HXReport::Row row(HXReport &report, const char *category, uint64_t heft, uint64_t clean = 0) {
    HXReport::Row made;
    made.category = report.category(HXString::intern(category));
    made.sizes.heft = heft;
    made.sizes.clean = clean;
    return made;
}

// Processes 1 … 6 are called a a a b b c and hold 600 … 100 of their own; the process with errors has no name
// in any set but one.
HXReport madeUpReport() {
    HXReport report;
    const char *const names[] = {"a", "a", "a", "b", "b", "c"};
    for (int32_t pid = 1; pid <= 6; pid++) {
        const Number process = report.addProcess(pid, HXString::intern(names[pid - 1]));
        const uint64_t heft = 700 - 100 * static_cast<uint64_t>(pid);
        report.setHeft(process, heft);
        const HXReport::Row rows[] = {row(report, "heap /tmp/x", heft - 30, 7), row(report, "heap", 20),
                                      row(report, "stack", 6), row(report, "tmpfs", 4),
                                      row(report, "file", 0, 9)};
        report.addRows(report.set({process}), rows);
    }
    report.setHasErrors(report.addProcess(7, HXString::intern("failed")));
    const auto share = [&report](std::vector<Number> members, uint64_t heft) {
        const HXReport::Row shared = row(report, "tmpfs", heft);
        report.addRows(report.set(std::move(members)), {{shared}});
    };
    share({0, 1, 2}, 5000); // inside the entities: of 1, 2 and the rest of a
    share({3, 4}, 3000);    // of one entity, once both are told as one
    share({0, 5}, 2000);
    share({1, 5}, 1000);
    share({2, 6}, 500);
    report.finish();
    return report;
}

// The sum of a size (0: heft, 2: clean) in all tiles.
uint64_t sumOfTiles(const Json &data, size_t size) {
    uint64_t sum = 0;
    const auto add = [&](const Json &tile) {
        for (const Json &part : tile["parts"])
            sum += part[1 + size].get<uint64_t>();
    };
    std::ranges::for_each(data["entities"], add);
    std::ranges::for_each(data["sets"], add);
    add(data["otherSets"]);
    return sum;
}

std::string contents(const fs::path &path) {
    std::ostringstream text;
    text << std::ifstream(path).rdbuf();
    return text.str();
}
} // namespace

TEST(HXPageTest, AddsUpWhatCannotBeSeenAndLosesNoByte) {
    const HXReport report = madeUpReport();
    constexpr uint64_t all = 2100 + 11500;
    for (const HXPageLimits limits :
         {HXPageLimits(), HXPageLimits{2, 1, 2, 100, 2, 1, 1, 1}, HXPageLimits{0, 0, 0, 0, 0, 0, 0, 0},
          HXPageLimits{6, 0, 9, 3, 1, 1, 1, 1}}) {
        const Json data = Json::parse(HXPageData({report, "r"}, nullptr, limits));
        EXPECT_EQ(sumOfTiles(data, 0), all) << limits.processes;
        EXPECT_EQ(sumOfTiles(data, 2), 96u) << limits.processes;
    }
    const Json few = Json::parse(HXPageData({report, "r"}, nullptr, {2, 1, 2, 100, 2, 1, 1, 1}));
    const Json &entities = few["entities"];
    ASSERT_EQ(entities.size(), 4u);
    EXPECT_EQ(entities[1]["p"], 2);
    // The third a is the only one of its command that is not told by itself.
    EXPECT_EQ(entities[2]["p"], 3);
    EXPECT_EQ(entities[3]["mixed"], true);
    EXPECT_EQ(entities[3]["k"], 3);
    EXPECT_EQ(entities[3]["f"], Json::parse("[6600,3600,3000,0,0]"));
    // What both b share is the rest's own; paths are left out, small categories added up.
    EXPECT_EQ(entities[3]["parts"], Json::parse("[[2,3012,0,0,0],[-1,588,0,48,0]]"));
    // The first two by heft, then the one with the most of something else.
    EXPECT_EQ(entities[0]["parts"], Json::parse("[[0,590,0,7,0],[1,6,0,0,0],[3,0,0,9,0],[-1,4,0,0,0]]"));
    EXPECT_EQ(few["categories"], Json::parse(R"(["heap","stack","tmpfs","file"])"));
    EXPECT_EQ(few["sets"][0]["m"], Json::parse("[0,2]"));
    EXPECT_EQ(few["sets"][1]["m"], Json::parse("[0,0,3,3]"));
    // All of the first, of the second one of the rest.
    EXPECT_FALSE(few["sets"][0].contains("some"));
    EXPECT_EQ(few["sets"][1]["some"], true);
    EXPECT_EQ(few["sets"][1]["k"], 2);
    EXPECT_EQ(few["otherSets"], Json::parse(R"({"k":2,"parts":[[2,1500,0,0,0]]})"));
    EXPECT_EQ(few["unexamined"], 1);
    const Json whole = Json::parse(HXPageData({report, "r"}, nullptr));
    EXPECT_EQ(whole["sets"][4]["o"], true); // shared with the process that has errors
}

TEST(HXPageTest, TellsWhatChangedMost) {
    const auto reportOf = [](const std::vector<uint64_t> &hefts) {
        HXReport report;
        for (size_t i = 0; i < hefts.size(); i++) {
            const Number process = report.addProcess(static_cast<int32_t>(i + 1), HXString::intern("p"));
            report.setHeft(process, hefts[i]);
            const HXReport::Row held = row(report, "heap", hefts[i]);
            report.addRows(report.set({process}), {{held}});
        }
        report.finish();
        return report;
    };
    const HXReport before = reportOf({100, 100, 900});
    const HXReport after = reportOf({110, 300, 100});
    HXPageLimits limits;
    limits.changes = 2;
    const HXPageReport earlier = {before, "old"};
    const Json data = Json::parse(HXPageData({after, "new"}, &earlier, limits));
    EXPECT_EQ(data["earlier"], "old");
    EXPECT_EQ(data["change"]["processes"],
              Json::parse(R"([{"n":"p","p":2,"q":2,"s":[100,300],"c":[["heap",100,300]]},)"
                          R"({"n":"p","p":3,"q":3,"s":[900,100],"c":[["heap",900,100]]}])"));
    EXPECT_EQ(data["change"]["more"], 1);
}

TEST(HXPageTest, ProgramWritesAWholePageOrEndsWithTrouble) {
    if (!fs::exists(kProgram)) GTEST_SKIP() << "heft-html is not built: node-d3 is missing";
    const HXTemporaryFolder folder;
    const std::string name = "</script><img src=x onerror=alert(1)>&\xE2\x80\xA8<!--@DATA@";
    const Json document = {
        {"processes",
         {{{"name", name}, {"pid", 7}, {"heft", 4096}, {"categories", {{name, {{"dirty", 4096}}}}}}}},
        {"summary", {{name, {{"dirty", 4096}}}, {"total", Json::object()}}}};
    folder.write("a<b.json", document.dump());
    const std::string page = folder / "page.html";
    EXPECT_EQ(HXRunProgram({kProgram, folder / "a<b.json", "-o", page}).status, 0);
    const std::string text = contents(page);
    EXPECT_EQ(HXRunProgram({kProgram, folder / "a<b.json"}).out, text);
    struct stat status = {};
    EXPECT_EQ(stat(page.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777u, 0600u); // names of other people's processes

    const std::string opening = "<script type=\"application/json\" id=\"data\">";
    const size_t start = text.find(opening) + opening.size();
    const std::string data = text.substr(start, text.find("</script>", start) - start);
    EXPECT_EQ(data.find_first_of("<>&"), std::string::npos);
    EXPECT_EQ(data.find("\xE2\x80\xA8"), std::string::npos);
    const Json parsed = Json::parse(data);
    EXPECT_EQ(parsed["title"], "a<b.json");
    EXPECT_NE(parsed["entities"][0]["n"].get<std::string>().find("<img src=x onerror=alert(1)>"),
              std::string::npos);
    const std::string rest = text.substr(0, start) + text.substr(start + data.size());
    for (const char *const slot : {"@DATA@", "@STYLE@", "@SCRIPT@", "@D3_SCRIPT@", "@D3_LICENCE@"})
        EXPECT_EQ(rest.find(slot), std::string::npos) << slot;
    EXPECT_NE(rest.find("Redistribution and use in source and binary forms"), std::string::npos);
    EXPECT_TRUE(rest.ends_with("</html>\n"));

    folder.write("damaged.json", document.dump().substr(0, 60));
    folder.write("other.json", "[]");
    const std::string good = folder / "a<b.json";
    for (const std::vector<std::string> &words :
         std::vector<std::vector<std::string>>{{},
                                               {good, good, good},
                                               {folder / "none.json"},
                                               {folder / "damaged.json"},
                                               {good, folder / "other.json"},
                                               {good, "-o", folder / "none/page.html"},
                                               {good, "-o", ""},
                                               {good, "--unknown"}}) {
        std::vector<std::string> command = {kProgram};
        command.insert(command.end(), words.begin(), words.end());
        const HXProgramRun run = HXRunProgram(command);
        EXPECT_EQ(run.status, 2);
        EXPECT_EQ(run.out, "");
        EXPECT_NE(run.err, "");
    }
}
