// Runs of the driver and its choice of targets.
#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"
#include "support/HXRun.h"

#include <filesystem>
#include <gtest/gtest.h>
#include <regex>

namespace {
std::string shown(const HXRun &run) {
    static const std::regex header("\\[(-?[0-9]+)\\]: (64|32)-bit");
    std::string text = run.status == 0 ? "" : "status " + std::to_string(run.status) + "\n";
    std::string pids;
    for (std::sregex_iterator each(run.out.begin(), run.out.end(), header), end; each != end; each++)
        pids += (pids.empty() ? "" : " ") + (*each)[1].str();
    if (!pids.empty()) text += pids + "\n";
    if (run.out == contentOf(TEST_CASES "/usage.txt")) text += "usage\n";
    EXPECT_EQ(run.out.empty(), run.status != 0 && !text.ends_with("usage\n")) << run.out;
    return text + run.err;
}
} // namespace

TEST(HXHeftRunTest, ChoosesTargetsOrSaysWhyNot) {
    for (const HXCase &each : HXReadCases("targets.txt"))
        for (const auto &[arguments, expected] : each.expected)
            EXPECT_EQ(shown(run(each.input, HXWordsOf(arguments))), expected) << each.title << arguments;
}

TEST(HXHeftRunTest, WritesNoDocumentWithoutTargets) {
    const std::string document = temporaryPath();
    EXPECT_EQ(run("process  pid=1\n", {"nobody", "--json", document}).status, 1);
    EXPECT_FALSE(std::filesystem::exists(document));
}
