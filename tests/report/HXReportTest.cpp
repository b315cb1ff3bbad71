// The model of a report: filled from an analysis and read from the document of the same run.
#include "report/HXReportGroups.h"
#include "report/HXReportReader.h"
#include "report/HXReportSource.h"

#include "support/HXProgramRun.h"
#include "support/HXTemporaryFolder.h"

#include <filesystem>
#include <gtest/gtest.h>
#include <map>
#include <set>

namespace {
namespace fs = std::filesystem;

using Number = HXReport::Number;

std::string textOf(const HXReportSizes &sizes) {
    std::string text = std::to_string(sizes.regions);
    for (const uint64_t size : {sizes.heft, sizes.swapped, sizes.clean, sizes.reclaimable, sizes.wired})
        text += ' ' + std::to_string(size);
    return text;
}

// All that a report says of processes, sets and categories, in an order of its own; without the sets of which
// each member sees its own part, which a document does not tell.
std::multimap<std::string, std::string> factsOf(const HXReport &report) {
    std::multimap<std::string, std::string> facts;
    const auto nameOf = [&](Number process) {
        return std::to_string(report.processes()[process].pid) + ' ' + report.processes()[process].name.str();
    };
    const auto add = [&](const std::string &of, std::span<const HXReport::Row> rows) {
        for (const HXReport::Row &row : rows)
            facts.emplace(of + report.categories()[row.category].str(), textOf(row.sizes));
    };
    for (Number i = 0; i < report.processes().size(); i++)
        facts.emplace(nameOf(i), std::to_string(report.processes()[i].heft));
    for (Number set = 0; set < report.setCount(); set++) {
        const auto [first, last] = report.viewsOfSet(set);
        std::string of = "set";
        std::set<std::string> members;
        for (const Number member : report.members(set))
            members.insert(' ' + nameOf(member));
        for (const std::string &member : members)
            of += member;
        if (first == last) add(of + ": ", report.rows(set));
        for (size_t i = first; i < last; i++)
            add(of + " seen by " + nameOf(report.view(i).process) + ": ", report.view(i).rows);
    }
    add("summary: ", report.summary());
    for (const HXReport::Figure &figure : report.figures())
        facts.emplace(nameOf(figure.process) + ' ' + figure.name.str(), std::to_string(figure.value));
    return facts;
}

std::multimap<std::string, std::string> regionsOf(const HXReport &report) {
    std::multimap<std::string, std::string> facts;
    for (const HXReport::Region &region : report.regions())
        facts.emplace(std::to_string(report.processes()[region.process].pid) + " at " +
                          std::to_string(region.start.value_or(1)) + ": " + region.name.str(),
                      textOf(region.sizes) + ' ' + std::to_string(region.size + region.offset));
    return facts;
}

HXReportSizes sumOfSets(const HXReport &report) {
    HXReportSizes sum;
    for (Number set = 0; set < report.setCount(); set++)
        sum += HXReport::sum(report.rows(set));
    return sum;
}

HXReport readReport(const std::string &path, bool listsRegions) {
    std::string reason;
    const auto source = HXReportSource::withPath(path, &reason);
    EXPECT_TRUE(source) << path << ": " << reason;
    auto report = source ? source->read(listsRegions, &reason) : std::nullopt;
    EXPECT_TRUE(report) << path << ": " << reason;
    return report ? std::move(*report) : HXReport();
}
} // namespace

TEST(HXReportTest, AnAnalysisAndItsDocumentSayTheSame) {
    int machines = 0;
    for (const auto &file : fs::directory_iterator(TEST_CASES)) {
        if (file.path().extension() != ".machine") continue;
        SCOPED_TRACE(file.path());
        const HXTemporaryFolder folder;
        const std::vector<std::string> replay = {HEFT_REPLAY_PROGRAM, file.path(), "-a", "--json",
                                                 folder / "document"};
        if (HXRunProgram(replay).status != 0) continue; // not root's machine
        machines++;
        const HXReport analysed = readReport(file.path(), false);
        const HXReport read = readReport(folder / "document", false);
        EXPECT_EQ(factsOf(analysed), factsOf(read));
        if (analysed.errors().empty()) {
            EXPECT_EQ(sumOfSets(analysed), analysed.total());
        }
        EXPECT_EQ(analysed.errors(), read.errors());
        EXPECT_EQ(analysed.warnings(), read.warnings());
        EXPECT_EQ(analysed.pageSize(), read.pageSize());
        EXPECT_EQ(analysed.isOfObjects(), read.isOfObjects());

        std::vector<std::string> verbose = replay;
        verbose.push_back("-v");
        ASSERT_EQ(HXRunProgram(verbose).status, 0);
        EXPECT_EQ(regionsOf(readReport(file.path(), true)), regionsOf(readReport(folder / "document", true)));
    }
    EXPECT_GT(machines, 5);
}

// Each whole is known from the summary where one set of a category has views; else it lies between what one
// member sees and what all together do.
TEST(HXReportTest, WholesOfSetsAreEstimatedFromViews) {
    const auto document = [](const std::string &summary, const std::string &shared) {
        return R"({"processes":[{"name":"a","pid":1,"heft":0},{"name":"b","pid":2,"heft":0},{"name":"c","pid":3,"heft":0}],"summary":{)" +
               summary + R"("total":{}},"shared":[)" + shared + "]}";
    };
    const auto view = [](const std::string &pids, int of, int dirty) {
        return R"({"pids":[)" + pids + R"(],"specific_to_pid":)" + std::to_string(of) +
               R"(,"categories":{"x":{"dirty":)" + std::to_string(dirty) + "}}}";
    };
    const auto hefts = [](const std::string &text) {
        std::string reason;
        const auto report = HXReadReport(text, false, &reason);
        EXPECT_TRUE(report) << reason;
        std::vector<uint64_t> result;
        for (Number set = 0; report && set < report->setCount(); set++)
            result.push_back(HXReport::sum(report->rows(set)).heft);
        return result;
    };
    using Hefts = std::vector<uint64_t>;
    const std::string both = view("1,2", 1, 30) + "," + view("1,2", 2, 50);
    EXPECT_EQ(hefts(document(R"("x":{"dirty":60},)", both)), Hefts{60});
    EXPECT_EQ(hefts(document(R"("x":{"dirty":10},)", both)), Hefts{50}); // never less than one sees
    EXPECT_EQ(hefts(document(R"("x":{"dirty":99},)", both)), Hefts{80}); // nor more than all see
    const std::string others = view("2,3", 2, 20) + "," + view("2,3", 3, 20);
    EXPECT_EQ(hefts(document(R"("x":{"dirty":95},)", both + "," + others)), (Hefts{65, 30}));
}

TEST(HXReportTest, WhatIsNoDocumentIsRefused) {
    const std::string head = R"({"processes":[{"name":"a","pid":1}],"summary":{"total":{}},)";
    std::string reason;
    ASSERT_TRUE(HXReadReport(head + R"("shared":[]})", true, &reason)) << reason;
    for (const std::string &text :
         {std::string(), std::string("{}"), std::string("[]"), std::string("7"), head,
          head + R"("processes":[{"name":"a"}],"shared":[]})", head + R"("shared":[{"pids":[]}]})",
          head + R"("shared":[{"pids":[4294967296]}]})", head + R"("shared":[{"pids":[1.5]}]})",
          head + R"("shared":[]} x)"}) {
        reason.clear();
        EXPECT_FALSE(HXReadReport(text, true, &reason)) << text;
        EXPECT_NE(reason, "") << text;
    }
}

// A category may be called like the sum, and a name may hold anything: the document may be anybody's.
TEST(HXReportTest, NamesAreOnlyNames) {
    std::string reason;
    const auto report = HXReadReport(
        R"({"processes":[{"name":"a\u001b[2J\"","pid":1,"heft":5,"categories":{"total":{"dirty":5}}}],)"
        R"("summary":{"total":{"dirty":5},"total":{"dirty":5}}})",
        false, &reason);
    ASSERT_TRUE(report) << reason;
    EXPECT_EQ(report->processes()[0].name.str(), "a?[2J'");
    EXPECT_EQ(report->total().heft, 5u);
}

// One's control group has a unit and a container, another's the same container alone, a third has no place.
TEST(HXReportTest, ProcessesAddUpByUnitAndContainer) {
    const HXReport report = readReport(std::string(TEST_CASES) + "/groups.machine", false);
    const HXTemporaryFolder folder;
    const auto place = [&](const std::string &pid, const std::string &group) {
        folder.write("proc/" + pid + "/status", "Name:\tx\nUid:\t0\t0\t0\t0\n");
        folder.write("proc/" + pid + "/cgroup", "0::" + group + "\n");
    };
    place("10", "/lxc.payload.web/system.slice/ssh.service");
    place("20", "/lxc.payload.web/init");
    folder.write("group/lxc.payload.web/memory.current", "4096\n");
    HXProcessPlaces places(folder / "proc", folder / "group");
    const auto told = [&](HXGroupBy by) {
        std::multiset<std::string> all;
        for (const HXReportGroup &group : HXGroupReport(report, by, &places).groups)
            all.insert(group.name + " " + std::to_string(group.processes) + " " +
                       std::to_string(group.measured.value_or(0)));
        return all;
    };
    using Groups = std::multiset<std::string>;
    EXPECT_EQ(told(HXGroupBy::unit), (Groups{"- 3 0", "lxc:web/ssh.service 1 0"}));
    EXPECT_EQ(told(HXGroupBy::container), (Groups{"- 2 0", "lxc:web 2 4096"}));
    EXPECT_EQ(told(HXGroupBy::user), (Groups{"- 2 0", "root 2 0"}));
}
