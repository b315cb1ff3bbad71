// Runs of the driver and its choice of targets.
#include "support/HXBuilders.h"
#include "support/HXRun.h"

#include <filesystem>
#include <gtest/gtest.h>
#include <regex>

namespace {
using Words = std::vector<std::string>;

constexpr char kNobody[] =
    "Unable to find any processes matching the supplied process names or pids (try as root?)\n";

// The pids whose headers a report has, in its order.
std::vector<int32_t> shown(const std::string &report) {
    static const std::regex header("\\[(-?[0-9]+)\\]: (64|32)-bit");
    std::vector<int32_t> pids;
    for (std::sregex_iterator match(report.begin(), report.end(), header), end; match != end; match++)
        pids.push_back(std::stoi((*match)[1]));
    return pids;
}

std::string usage() {
    return "Gather memory information about a process or set of processes\n"
           "Usage: heft [args] [proc/pid/memgraph [proc/pid/memgraph [...]]]\n"
           "\t-a, --all \t\t\t\ttarget all processes\n"
           "\t-j, --json <file> \t\t\tprint json output to a file\n"
           "\t-h, --help \t\t\t\tprint this output\n"
           "\t-p, --proc, --pid [proc/pid] \t\ttarget pid or process (or interpret for -p)\n"
           "\t-x, --exclude [proc/pid] \t\texclude pid or process\n"
           "\t-s, --skip \t\t\t\tskip processes that are idle-exit clean\n"
           "\t-v \t\t\t\t\tprint all regions and atlas-like output of address space layout (default output "
           "is "
           "a summary)\n"
           "\t-f, --format (bytes|formatted|pages) \tchange size formatting preference (default: formatted)\n"
           "\t--sort <column> \t\t\tchange the column used for sorting (default: dirty)\n"
           "\t-w, --wide\t\t\t\tshow wide output with all columns and full paths (implies --swapped "
           "--wired)\n"
           "\t--swapped\t\t\t\tshow swapped/compressed column\n"
           "\t--wired\t\t\t\t\tshow wired column\n"
           "\t--vmObjectDirty\t\t\tinterpret dirty memory as viewed by VM objects in the kernel\n"
           "\t--unmapped\t\t\t\tsearch all processes for unmapped memory owned by the target processes\n";
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
         "task_for_pid: (os/kern) failure\n"
         "Unable to analyze process closed [50] (try as root?)\n"},
        {{"40", "50"},
         {40},
         "task_for_pid: (os/kern) failure\n"
         "Unable to analyze process with pid 50 (try as root?)\n"},
        {{"40", "--pid", "77"}, {40}, "Unable to analyze process with pid 77 (try as root?)\n"},
        {{"10", "worker", "-x", "worker", "-x", "nothing"}, {10}},
        {{"10", "1"}, {10}}, // never itself
        {{"-t", "21"}, {30, 21}},
        {{"-t", "10"}, {30, 21, 20, 10, 1}}, // children are added after the exclusions
        {{"-t", "10", "-x", "worker"}, {30, 21, 20, 10, 1}},
        {{"-t", "0", "-x", "10"},
         {40, 30, 21, 20, 10, 1, 0},
         "task_for_pid: (os/kern) failure\n"
         "Unable to analyze process with pid 50 (try as root?)\n"},
        {{"-s", "worker", "30"}, {30, 21}},
        {{"-a"}, {40, 30, 21, 20, 10, 0}, "task_for_pid: (os/kern) failure\n"},
        {{"-a", "-s"}, {40, 30, 21, 10, 0}, "task_for_pid: (os/kern) failure\n"},
        {{"-a", "-x", "worker", "-x", "0", "--pid", "77", "-t"},
         {40, 30, 10},
         "task_for_pid: (os/kern) failure\n"},
        {{"40", "--unmapped"}, {40}, "task_for_pid: (os/kern) failure\n"},
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
    const std::string unseen = "Unable to obtain system process list\n";
    const std::string user =
        std::string("host  pid=1  euid=501\n") + &kTree[std::string(kTree).find('\n') + 1];
    const std::string blind =
        std::string("host  list_pids_error=1\n") + &kTree[std::string(kTree).find('\n') + 1];
    struct {
        const char *title;
        std::string machine;
        Words words;
        int status;
        std::string err;
        bool usage;
    } cases[] = {
        {"help", kTree, {"-h"}, 0, "", true},
        {"bad format",
         kTree,
         {"--format", "x"},
         1,
         "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.\n",
         true},
        {"nothing to target", kTree, {}, 1, "Must specify at least one process or memgraph\n", true},
        {"a file that is no graph",
         kTree,
         {file},
         1,
         "Error opening memgraph " + file + ": not a memory graph\n",
         true},
        {"no match",
         kTree,
         {"nobody"},
         1,
         "Unable to find pid for process matching 'nobody'\n" + std::string(kNobody),
         false},
        {"all excluded", kTree, {"40", "-x", "launchd"}, 1, kNobody, false},
        {"only clean ones", kTree, {"-s", "20"}, 1, kNobody, false},
        {"all without privilege", user, {"-a"}, 1, "Must run as root.\n", false},
        {"unmapped without privilege", user, {"--unmapped", "40"}, 1, "Must run as root.\n", false},
        {"no process list", blind, {"40"}, 1, unseen + kNobody, false},
        {"no directory for the document",
         kTree,
         {"40", "--json", "/no such/file"},
         1,
         "heft: /no such/file: No such file or directory\n",
         false},
    };
    for (const auto &test : cases) {
        const HXRun result = run(test.machine, test.words);
        EXPECT_EQ(result.status, test.status) << test.title;
        EXPECT_EQ(result.err, test.err) << test.title;
        EXPECT_EQ(result.out, test.usage ? usage() : "") << test.title;
    }
    EXPECT_EQ(shown(run(user, {"40"}).out), std::vector<int32_t>{40});
    // A pid given as such needs no list; nor does a switch that privilege would be needed for but that is
    // off.
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
