#include "cli/HXHeftArgs.h"

#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"
#include "support/HXMadeUpMachine.h"

#include <algorithm>
#include <gtest/gtest.h>

namespace {
// Every field that differs from its default, as one line.
std::string told(const HXHeftArgs &args) {
    std::string text;
    const auto tell = [&](bool differs, const std::string &what) { text += differs ? " " + what : ""; };
    tell(args.targetChildren(), "children");
    tell(args.targetAll(), "all");
    tell(args.skipIdleExitClean(), "skip");
    tell(args.atlasLikeOutput(), "atlas");
    tell(!args.summarize(), "detailed");
    tell(!args.shouldGetPhysHeftBreakdown(), "objects");
    tell(args.didSetShouldGetPhysHeftBreakdown(), "set");
    tell(args.searchForUnmapped(), "unmapped");
    tell(args.summaryFormat() != 1, "format=" + std::to_string(args.summaryFormat()));
    tell(args.textOptions() != 0, "options=" + std::to_string(args.textOptions()));
    tell(args.textSort() != "Dirty", "sort=" + args.textSort());
    tell(args.JSONOutputFile().has_value(), "json=" + args.JSONOutputFile().value_or(""));
    for (const auto &entry : args.targetPids().entries())
        tell(true, "pid=" + std::to_string(entry.pid) + entry.description.value_or(""));
    for (const auto &each : args.potentialTargetProcesses().strings())
        tell(true, "target=" + each);
    for (const auto &each : args.excludedPidsOrProcesses().strings())
        tell(true, "not=" + each);
    return text;
}
std::string parsed(const std::string &line) {
    std::vector<std::string> words = HXWordsOf("heft " + line);
    std::vector<char *> argv;
    for (std::string &word : words)
        argv.push_back(word.data());
    argv.push_back(nullptr);
    std::unique_ptr<HXHeftArgs> args;
    HXError error;
    const HXPrinted printed =
        printedBy([&] { args = HXHeftArgs::withArgc(static_cast<int>(words.size()), argv.data(), &error); });
    EXPECT_EQ(printed.out, "");
    std::string text = args ? told(*args) : " error " + std::to_string(error.code);
    EXPECT_EQ(error.domain, args ? "" : "HXHeftError");
    if (error.localizedDescription) text += ": " + *error.localizedDescription;
    if (!printed.err.empty()) text += " | " + printed.err;
    std::replace(text.begin(), text.end(), '\n', '/');
    return text.empty() ? text : text.substr(1);
}
} // namespace

TEST(HXHeftArgsTest, AreWhatTheirTableSays) {
    const HXMadeUpMachine platform;
    for (const HXCase &each : HXReadCases("options.txt"))
        EXPECT_EQ(HXAnswered(each.input, parsed), each.input) << each.title;
}
