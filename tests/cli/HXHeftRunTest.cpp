// Runs of the driver and its choice of targets.
#include "support/HXBuilders.h"
#include "support/HXRun.h"

#include <filesystem>
#include <gtest/gtest.h>
#include <regex>

namespace {
using Words = std::vector<std::string>;

constexpr char kClosed[] = "task_for_pid: (os/kern) failure\n"; // process 50

// The pids whose headers a report has, in its order.
std::vector<int32_t> shown(const std::string &report) {
    static const std::regex header("\\[(-?[0-9]+)\\]: (64|32)-bit");
    std::vector<int32_t> pids;
    for (std::sregex_iterator match(report.begin(), report.end(), header), end; match != end; match++)
        pids.push_back(std::stoi((*match)[1]));
    return pids;
}

// A small tree: 1 (this program) under 10; 10 → 20, 21 → 30; 40 alone. The kernel is its own parent.
constexpr char kTree[] = R"(host  pid=1
process  pid=0  ppid=0  flags=0x11  comm=kernel
process  pid=1  ppid=10  args_path=/usr/bin/heft
process  pid=10  ppid=0  args_path=/bin/shell
process  pid=20  ppid=10  args_path=/bin/worker  dirty_flags=3
process  pid=21  ppid=10  args_path=/bin/worker  dirty_flags=7
process  pid=30  ppid=21  comm=7  dirty_flags=1
process  pid=40  ppid=0  name=launchd
process  pid=50  ppid=0  name=closed  task_error=5
process  pid=60  ppid=0  name=unseen  listed=0
process  pid=70  ppid=0  name=unread  readable=0
)";
} // namespace

TEST(HXHeftRunTest, ChoosesTargets) {
    struct {
        Words words;
        std::vector<int32_t> pids; // of equal heft, so by descending pid
        std::string err = {};
    } cases[] = {
        {{"worker"}, {21, 20}},
        {{"worker", "20", "-p", "21"}, {21, 20}},
        {{"10", "nothing"}, {10}, "Unable to find pid for process matching 'nothing'\n"},
        {{"launch", "Launchd", "launchd"},
         {40},
         "Unable to find pid for process matching 'launch'\nUnable to find pid for process matching "
         "'Launchd'\n"},
        {{"40x"}, {40}},
        {{"7"}, {30}}, // a name of digits
        {{"--pid", "40", "--pid", "60"}, {60, 40}},
        {{"40", "60"}, {40}, "Unable to find pid for process matching '60'\n"},
        {{"40", "70"}, {40}, "Unable to find pid for process matching '70'\n"},
        {{"4294967336", "40"}, {40}, "Unable to find pid for process matching '4294967336'\n"},
        {{"40", "closed"},
         {40},
         std::string(kClosed) + "Unable to analyze process closed [50] (try as root?)\n"},
        {{"40", "50"}, {40}, std::string(kClosed) + "Unable to analyze process with pid 50 (try as root?)\n"},
        {{"40", "--pid", "77"}, {40}, "Unable to analyze process with pid 77 (try as root?)\n"},
        {{"10", "worker", "-x", "worker", "-x", "nothing"}, {10}},
        {{"10", "1"}, {10}}, // never itself
        {{"-t", "21"}, {30, 21}},
        {{"-t", "10"}, {30, 21, 20, 10, 1}}, // children are added after the exclusions
        {{"-t", "10", "-x", "worker"}, {30, 21, 20, 10, 1}},
        {{"-t", "0", "-x", "10"},
         {40, 30, 21, 20, 10, 1, 0},
         std::string(kClosed) + "Unable to analyze process with pid 50 (try as root?)\n"},
        {{"-s", "worker", "30"}, {30, 21}},
        {{"-a"}, {40, 30, 21, 20, 10, 0}, kClosed},
        {{"-a", "-s"}, {40, 30, 21, 10, 0}, kClosed},
        {{"-a", "-x", "worker", "-x", "0", "--pid", "77", "-t"}, {40, 30, 10}, kClosed},
        {{"40", "--unmapped"}, {40}, kClosed},
    };
    for (const auto &test : cases) {
        const HXRun result = report(kTree, test.words);
        EXPECT_EQ(shown(result.out), test.pids) << test.words[0] << " " << test.words.back();
        EXPECT_EQ(result.err, test.err) << test.words[0];
    }
}

TEST(HXHeftRunTest, EndsWithTheStatusAndTextOfEachFailure) {
    const std::string file = temporaryPath();
    std::fclose(std::fopen(file.c_str(), "w"));
    const std::string nobody =
        "Unable to find any processes matching the supplied process names or pids (try as root?)\n";
    const std::string unseen = "Unable to obtain system process list\n";
    const std::string processes = &kTree[std::string(kTree).find('\n')];
    const std::string user = "host  pid=1  euid=501" + processes;
    const std::string blind = "host  list_pids_error=1" + processes;
    const std::string usage = contentOf(std::string(TEST_CASES "/usage.txt"));
    const std::string format =
        "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.\n";
    const std::string root = "Must run as root.\n";
    struct {
        std::string machine;
        Words words;
        std::string err;
        bool usage;
    } cases[] = {
        {kTree, {"-h"}, "", true},
        {kTree, {"--format", "x"}, format, true},
        {kTree, {}, "Must specify at least one process or memgraph\n", true},
        {kTree, {file}, "Error opening memgraph " + file + ": not a memory graph\n", true},
        {kTree, {"nobody"}, "Unable to find pid for process matching 'nobody'\n" + nobody, false},
        {kTree, {"40", "-x", "launchd"}, nobody, false},
        {kTree, {"-s", "20"}, nobody, false},
        {user, {"-a"}, root, false},
        {user, {"--unmapped", "40"}, root, false},
        {blind, {"40"}, unseen + nobody, false},
        {kTree, {"40", "-j", "/no/file"}, "heft: /no/file: No such file or directory\n", false},
    };
    for (const auto &test : cases) {
        const HXRun result = run(test.machine, test.words);
        EXPECT_EQ(result.status, test.err.empty() ? 0 : 1) << test.err;
        EXPECT_EQ(result.err, test.err) << test.err;
        EXPECT_EQ(result.out, test.usage ? usage : "") << test.err;
    }
    EXPECT_EQ(shown(run(user, {"40"}).out), std::vector<int32_t>{40});
    // A pid given as such needs no list, and an option that was switched off no privilege.
    EXPECT_EQ(shown(run(blind, {"--pid", "40"}).out), std::vector<int32_t>{40});
    EXPECT_EQ(shown(run(user, {"--unmapped", "--vmObjectDirty", "40"}).out), std::vector<int32_t>{40});
    // A path that is no graph but names a process: only one of that name.
    const std::string named = "process  pid=5  name=" + file + "\nprocess  pid=6  name=" + file + "\n";
    EXPECT_EQ(shown(run(named, {file}).out), std::vector<int32_t>{5});
    // No targets, no document.
    const std::string document = temporaryPath();
    EXPECT_EQ(run(kTree, {"nobody", "--json", document}).status, 1);
    EXPECT_FALSE(std::filesystem::exists(document));
}
