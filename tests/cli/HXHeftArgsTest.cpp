#include "cli/HXHeftArgs.h"

#include "support/HXBarePlatform.h"
#include "support/HXBuilders.h"

#include <gtest/gtest.h>

namespace {
using Words = std::vector<std::string>;

constexpr char kOldSummary[] =
    "WARNING: -y/--summary options are deprecated because summary is the default mode\n";
constexpr char kOldHeft[] = "WARNING: --physHeft option is deprecated because it is the default mode\n";
constexpr char kIgnored[] =
    "WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' does not support "
    "unmapped owned VM objects\n";
constexpr char kRedundant[] = "NOTICE: '--unmapped' is redundant when using -a/--all\n";

struct Parsed {
    std::unique_ptr<HXHeftArgs> args;
    HXError error;
    std::string err;
};
Parsed parse(Words words) {
    words.insert(words.begin(), "heft");
    std::vector<char *> argv;
    for (std::string &word : words)
        argv.push_back(word.data());
    argv.push_back(nullptr);
    Parsed parsed;
    const auto printed = printedBy([&] {
        parsed.args = HXHeftArgs::withArgc(static_cast<int>(words.size()), argv.data(), &parsed.error);
    });
    parsed.err = printed.err;
    EXPECT_EQ(printed.out, "");
    return parsed;
}

// Every field that differs from its default, as one line.
std::string told(const HXHeftArgs &args) {
    std::string text;
    const auto tell = [&](bool differs, const std::string &what) {
        if (differs) text += (text.empty() ? "" : " ") + what;
    };
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
} // namespace

TEST(HXHeftArgsTest, TakesOptions) {
    const HXBarePlatform platform;
    struct {
        Words words;
        std::string told;
        std::string err = {};
    } cases[] = {
        {{}, ""},
        {{"-a"}, "all"},
        {{"--all", "-s", "-t"}, "children all skip"},
        {{"-v"}, "atlas detailed"},
        {{"-w", "--wired"}, "options=7"},
        {{"--swapped", "--wired"}, "options=3"},
        {{"-f", "bytes"}, "format=0"},
        {{"--format", "pages", "-fformatted"}, ""},
        {{"--format=pages"}, "format=2"},
        {{"--sort", "wIrEd"}, "sort=Wired"},
        {{"-j", "a", "--json", "b"}, "json=b"},
        {{"-p", "123", "--proc", "x", "y", "123"}, "target=123 target=x target=y"},
        {{"y", "-p", "x", "--", "-a"}, "target=x target=y target=-a"},
        {{"-x", "a", "--exclude", "7", "-x", "a"}, "not=a not=7"},
        {{"--pid", "12", "--pid", "12abc", "--pid", " 13"}, "pid=12 pid=13"},
        {{"--pid", "-5"}, "pid=-5"},
        {{"--pid", "0x10"}, "pid=0"},
        {{"--vmObjectDirty"}, "objects set"},
        {{"--physHeft"}, "", kOldHeft},
        {{"-y", "--summary", "-v"}, "atlas detailed", std::string(kOldSummary) + kOldSummary},
        {{"--unmapped", "1"}, "unmapped target=1"},
        {{"-a", "--unmapped"}, "all", kRedundant},
        {{"--unmapped", "--vmObjectDirty"}, "objects set", kIgnored},
        {{"--vmObjectDirty", "--unmapped", "-a"}, "all objects set", kIgnored},
    };
    for (const auto &test : cases) {
        const Parsed parsed = parse(test.words);
        ASSERT_TRUE(parsed.args) << test.told;
        EXPECT_EQ(told(*parsed.args), test.told);
        EXPECT_EQ(parsed.err, test.err) << test.told;
    }
}

TEST(HXHeftArgsTest, RefusesBadArguments) {
    const HXBarePlatform platform;
    const std::string sort = " to --sort.\nAccepted arguments: dirty, swapped, clean, reclaimable, wired, "
                             "regions, category";
    const std::string format =
        "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.";
    const std::string pid = " is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a "
                            "process name.";
    struct {
        Words words;
        int code;
        std::optional<std::string> description;
    } cases[] = {
        {{"-h"}, 1, std::nullopt},
        {{"--help", "--nonsense"}, 1, std::nullopt},
        {{"-f", "Bytes"}, 2, format},
        {{"--sort", "size"}, 3, "Unrecognized argument 'size'" + sort},
        {{"--pid", "abc"}, 4, "'abc'" + pid},
        {{"-x", "1", "--pid", "-", "-f", "bad"}, 4, "'-'" + pid}, // the first failure ends parsing
        {{"--nonsense"}, 5, std::nullopt},
        {{"-j"}, 5, std::nullopt},
        {{"--all=yes"}, 5, std::nullopt},
    };
    for (const auto &test : cases) {
        const Parsed parsed = parse(test.words);
        EXPECT_FALSE(parsed.args);
        EXPECT_EQ(parsed.error.domain, "HXHeftError");
        EXPECT_EQ(parsed.error.code, test.code) << test.words[0];
        EXPECT_EQ(parsed.error.localizedDescription, test.description) << test.words[0];
        EXPECT_EQ(parsed.err.empty(), test.code != 5) << parsed.err; // the scanner's own words
    }
}
