// Whole reports, kept as files: the machine CASE.machine, the words of the command line in CASE.args, what
// the program then writes in CASE.expected and, in some cases, CASE.json.expected (whose line ends are for
// its readers); where it writes to standard error, CASE.err.expected, whose lines are sorted since processes
// are gathered several at once. A case named MACHINE.RUN is another run over MACHINE.machine.
#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"
#include "support/HXRun.h"

#include <algorithm>
#include <filesystem>
#include <gtest/gtest.h>

namespace {
namespace fs = std::filesystem;

const fs::path kFolder = TEST_CASES;

std::vector<std::string> caseNames() {
    std::vector<std::string> names;
    for (const auto &file : fs::directory_iterator(kFolder))
        if (file.path().extension() == ".args") names.push_back(file.path().stem());
    std::sort(names.begin(), names.end());
    return names;
}

std::vector<std::string> sortedLines(const std::string &text) {
    std::vector<std::string> lines = HXLinesOf(text);
    std::sort(lines.begin(), lines.end());
    return lines;
}

class HXCasesTest : public testing::TestWithParam<std::string> {
  protected:
    static std::string file(const std::string &ending) { return contentOf(kFolder / (GetParam() + ending)); }
};
} // namespace

TEST_P(HXCasesTest, PrintsWhatIsExpected) {
    const std::string machineName = GetParam().substr(0, GetParam().find('.')) + ".machine";
    const std::string machine = contentOf(kFolder / machineName);
    ASSERT_TRUE(machine.starts_with("heft-machine 1\n#")) << machineName << " does not say what it shows";
    const std::string records = machine.substr(machine.find('\n') + 1);
    const std::vector<std::string> arguments = HXWordsOf(file(".args"));

    const HXRun plain = run(records, arguments);
    EXPECT_EQ(plain.status, 0);
    EXPECT_EQ(plain.out, file(".expected"));
    EXPECT_EQ(sortedLines(plain.err), sortedLines(file(".err.expected")));
    const std::string document = report(records, arguments).json;
    std::string expected = file(".json.expected");
    std::erase(expected, '\n');
    EXPECT_EQ(document, expected.empty() ? document : expected);
}

INSTANTIATE_TEST_SUITE_P(Files, HXCasesTest, testing::ValuesIn(caseNames()), [](const auto &tested) {
    std::string name = tested.param;
    std::replace_if(
        name.begin(), name.end(), [](char c) { return c == '-' || c == '.'; }, '_');
    return name;
});
