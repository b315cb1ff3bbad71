// The built programs, as a shell or an impatient user runs them.
#include "platform/HXVersion.h"
#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"
#include "support/HXCheckReport.h"
#include "support/HXProgramRun.h"
#include "support/HXSubject.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <fcntl.h>
#include <regex>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {
namespace fs = std::filesystem;

bool contains(const std::string &text, const std::string &part) {
    return text.find(part) != std::string::npos;
}

// A machine file of so many processes, each of which tells on standard error that its walk failed.
std::string failingMachine(int processes) {
    std::string text = "heft-machine 1\nhost\tself_region_heft=1\tledger=other\n";
    for (int pid = 101; pid <= 100 + processes; pid++) {
        const std::string owner = "\tpid=" + std::to_string(pid);
        text += "process" + owner + "\tname=p\nfault" + owner +
                "\tcall=mach_vm_region_recurse\tfrom=1\terror=5\n";
    }
    return text;
}

// Whether a signal waits for the process, and whether all of its threads wait for something or it has ended.
bool hasPending(pid_t pid, int signal) {
    const std::string status = contentOf("/proc/" + std::to_string(pid) + "/status");
    const std::string pending = status.substr(status.find("ShdPnd:") + 7, 17);
    return std::stoull(pending, nullptr, 16) >> (signal - 1) & 1;
}
bool isAtRest(pid_t pid) {
    for (const auto &thread : fs::directory_iterator("/proc/" + std::to_string(pid) + "/task")) {
        const std::string stat = contentOf(thread.path() / "stat");
        if (!contains(stat, ") S ") && !contains(stat, ") Z ")) return false;
    }
    return true;
}
} // namespace

TEST(HXProgramsTest, RecordSaysWhatIsWrongWithItsArguments) {
    const HXTemporaryFolder folder;
    const auto answer = [&](std::string arguments) {
        arguments = std::regex_replace(arguments, std::regex("FOLDER"), folder.path().native());
        arguments = std::regex_replace(arguments, std::regex("SELF"), std::to_string(getpid()));
        const HXProgramRun run = HXRunProgram(HXWordsOf(HEFT_RECORD_PROGRAM " " + arguments));
        EXPECT_EQ(run.status, run.err.empty() ? 0 : 1) << arguments;
        EXPECT_NE(run.err.empty(), run.out.empty()) << arguments;
        const std::string firstLine = HXLinesOf(run.out + run.err).at(0);
        return std::regex_replace(firstLine, std::regex(folder.path().native()), "FOLDER");
    };
    const std::string rows = HXReadCases("record.txt")[0].input;
    EXPECT_EQ(HXAnswered(rows, answer), rows);
    EXPECT_TRUE(fs::is_empty(folder.path())); // nor is a half-written file left behind
}

TEST(HXProgramsTest, TellTheirVersion) {
    const HXTemporaryFolder folder;
    const std::string recordVersion = std::string("heft-record ") + kHXVersion + "\n";
    EXPECT_EQ(HXRunProgram({HEFT_RECORD_PROGRAM, "--version"}).out, recordVersion);
    EXPECT_EQ(HXRunProgram({HEFT_REPLAY_PROGRAM, "--version"}).out,
              std::string("heft-replay ") + kHXVersion + "\n");
    const std::string self = std::to_string(getpid()), graph = folder / "graph", machine = folder / "machine";
    EXPECT_EQ(HXRunProgram({HEFT_RECORD_PROGRAM, "memgraph", self, graph}).status, 0);
    EXPECT_EQ(HXRunProgram({HEFT_RECORD_PROGRAM, "machine", machine, self}).status, 0);
    for (const std::string &capture : {graph, machine})
        EXPECT_TRUE(contentOf(capture).ends_with("\n# " + recordVersion)) << capture;
    EXPECT_EQ(HXRunProgram({HEFT_REPLAY_PROGRAM, machine, graph}).status, 0); // which are read all the same
}

// Standard error is a pipe that nobody reads, so gathering cannot come to its end.
TEST(HXProgramsTest, AnInterruptDuringGatheringGivesTheReportOfWhatWasGathered) {
    const HXTemporaryFolder folder;
    folder.write("machine", failingMachine(2000));
    const std::string machine = folder / "machine";
    int err[2];
    ASSERT_EQ(pipe2(err, O_CLOEXEC), 0);
    ASSERT_GE(fcntl(err[1], F_SETPIPE_SZ, 4096), 4096);
    std::FILE *const out = tmpfile();
    const pid_t pid = fork();
    if (pid == 0) {
        dup2(fileno(out), 1);
        dup2(err[1], 2);
        execl(HEFT_REPLAY_PROGRAM, "heft-replay", machine.c_str(), "-a", nullptr);
        _exit(127);
    }
    close(err[1]);
    std::string printed(1, '\0');
    ASSERT_EQ(read(err[0], printed.data(), 1), 1); // gathering has begun
    kill(pid, SIGINT);
    // The handler tells the analysis, and then comes to rest at the pipe, too.
    while (hasPending(pid, SIGINT) || !isAtRest(pid))
        sched_yield();
    char buffer[4096];
    for (ssize_t got = 0; (got = read(err[0], buffer, sizeof buffer)) > 0;)
        printed.append(buffer, static_cast<size_t>(got));
    close(err[0]);
    int status = -1;
    waitpid(pid, &status, 0);
    EXPECT_EQ(status, 0);
    EXPECT_TRUE(contains(printed, "Exiting early due to SIGINT\n"));
    EXPECT_LT(std::count(printed.begin(), printed.end(), '\n'), 2 * 2000);
    const std::string report = contentOf(out);
    EXPECT_TRUE(contains(report, "Heft exited early due to SIGINT and did not finish gathering all data"));
    EXPECT_TRUE(contains(report, "(os/kern) failure"));
}

TEST(HXProgramsTest, ClosedStandardStreamsStayOutOfTheDocument) {
    const HXTemporaryFolder folder;
    folder.write("machine", failingMachine(3));
    const std::string json = folder / "json", machine = folder / "machine";
    const std::string commands[] = {std::string(HEFT_REPLAY_PROGRAM) + " " + machine + " -a",
                                    std::string(HEFT_PROGRAM) + " " + std::to_string(getpid())};
    for (const std::string &command : commands)
        for (int closed = 0; closed < 8; closed++) { // a bit for each descriptor
            std::string line = "exec " + command + " -w -f bytes -j " + json;
            for (int descriptor = 0; descriptor <= 2; descriptor++)
                if (closed >> descriptor & 1) line += " " + std::to_string(descriptor) + ">&-";
            folder.remove("json");
            const HXProgramRun run = HXRunProgram({"/bin/sh", "-c", line});
            EXPECT_EQ(run.status, 0) << line;
            const std::string document = contentOf(json);
            const bool hasText = !(closed & 2);
            EXPECT_EQ(run.out.empty(), !hasText) << line;
            if (hasText) checkReport(run.out, document);
            EXPECT_TRUE(document.starts_with("{") && document.ends_with("}")) << line << document;
        }
}

TEST(HXProgramsTest, ALostReportIsAFailure) {
    if (!fs::exists("/dev/full")) GTEST_SKIP() << "no /dev/full";
    const HXTemporaryFolder folder;
    folder.write("machine", failingMachine(3));
    const std::string self = std::to_string(getpid()), machine = folder / "machine";
    const std::pair<std::string, std::string> lines[] = {
        {HEFT_PROGRAM " " + self, "heft"},
        {HEFT_PROGRAM " -v " + self, "heft"},
        {HEFT_PROGRAM " -h", "heft"},
        {HEFT_REPLAY_PROGRAM " " + machine + " -a", "heft-replay"},
        {HEFT_REPLAY_PROGRAM " -h", "heft-replay"},
        {HEFT_RECORD_PROGRAM " -h", "heft-record"},
        {HEFT_RECORD_PROGRAM " machine - " + self, "heft-record"}};
    for (const auto &[line, program] : lines) {
        const HXProgramRun run = HXRunProgram({"/bin/sh", "-c", line + " >/dev/full"});
        EXPECT_EQ(run.status, 1) << line;
        EXPECT_TRUE(run.err.ends_with(program + ": standard output: No space left on device\n")) << run.err;
        // A reader that has gone is none, whether or not its signal is ignored.
        for (const char *const before : {"", "trap '' PIPE; "}) {
            const HXProgramRun left =
                HXRunProgram({"/bin/bash", "-c", before + line + " 2>&1 | true; exit ${PIPESTATUS[0]}"});
            EXPECT_TRUE(left.status == 0 || left.status == 128 + SIGPIPE) << line;
        }
    }
}

// Through pipes, which is how they leave a machine without a place for them.
TEST(HXProgramsTest, CapturesAndDocumentsGoThroughOpenFiles) {
    const HXTemporaryFolder folder;
    const HXSubject subject([] {});
    const std::string pid = std::to_string(subject.pid()), json = folder / "json";
    const std::string record = HEFT_RECORD_PROGRAM " machine ", replay = HEFT_REPLAY_PROGRAM " ";
    const auto lines = {record + "- " + pid + " | " + replay + "- " + pid,
                        record + "/dev/stdout " + pid + " | " + replay + "/dev/stdin " + pid,
                        record + folder.path().native() + "/m " + pid + " && " + replay + "- " + pid + " <" +
                            folder.path().native() + "/m",
                        HEFT_RECORD_PROGRAM " memgraph " + pid + " - >" + json + " && " HEFT_PROGRAM " " +
                            json,
                        HEFT_PROGRAM " " + pid + " --json /dev/fd/3 3>" + json};
    for (const std::string &line : lines) {
        const HXProgramRun run = HXRunProgram({"/bin/sh", "-c", line});
        EXPECT_EQ(run.status, 0) << line;
        EXPECT_EQ(run.err, "") << line;
        EXPECT_TRUE(contains(run.out, " [" + pid + "]")) << line << run.out;
    }
    EXPECT_TRUE(contentOf(json).ends_with("}"));
}

// The reader leaves after a byte of a document that no pipe holds whole.
TEST(HXProgramsTest, AReaderThatGoesAwayIsAFailedWrite) {
    const HXTemporaryFolder folder;
    folder.write("machine", failingMachine(2000));
    ASSERT_EQ(mkfifo((folder / "fifo").c_str(), 0600), 0);
    const std::string line = "cd " + folder.path().string() + " && (head -c 1 fifo >&2 & exec " +
                             HEFT_REPLAY_PROGRAM + " machine -a -j fifo)";
    const HXProgramRun run = HXRunProgram({"/bin/sh", "-c", line});
    EXPECT_EQ(run.status, 1);
    EXPECT_TRUE(run.err.ends_with("heft: fifo: Broken pipe\n"));
    EXPECT_TRUE(contains(run.out, "Summary")) << "the text is complete";
}

TEST(HXProgramsTest, CapturesAreReadInPieces) {
    const HXTemporaryFolder folder;
    folder.write("machine", failingMachine(1));
    folder.write("sparse", "heft-memgraph 1\n");
    fs::resize_file(folder / "sparse", uint64_t{1} << 30);
    const HXProgramRun refused = HXRunProgram({HEFT_REPLAY_PROGRAM, folder / "machine", folder / "sparse"});
    EXPECT_TRUE(contains(refused.err, "sparse: line 2: the record is longer than 1 MiB\n")) << refused.err;
    EXPECT_LT(refused.peakKilobytes, 500 << 10);
    // From a fifo, too.
    ASSERT_EQ(mkfifo((folder / "fifo").c_str(), 0600), 0);
    const std::string line =
        "cd " + folder.path().string() + " && (cat machine >fifo & exec " + HEFT_REPLAY_PROGRAM + " fifo -a)";
    const HXProgramRun run = HXRunProgram({"/bin/sh", "-c", line});
    EXPECT_EQ(run.status, 0);
    EXPECT_TRUE(contains(run.out, "p [101]")) << run.err;
}
