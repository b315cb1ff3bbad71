// The companions as a shell runs them.
#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"
#include "support/HXProgramRun.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <csignal>
#include <fcntl.h>
#include <filesystem>
#include <regex>
#include <sys/wait.h>
#include <unistd.h>

namespace {
namespace fs = std::filesystem;

constexpr char kSmallReport[] =
    R"({"processes":[{"name":"the kernel","pid":0,"heft":0},{"name":"a","pid":7,"heft":4096,)"
    R"("categories":{"heap":{"dirty":4096}}}],"summary":{"heap":{"dirty":4096},"total":{}}})";
const fs::path kPrograms = fs::path(HEFT_PROGRAM).parent_path();

void writeFile(const HXTemporaryFolder &folder, const std::string &name, const std::string &text) {
    if (!name.ends_with(".machine")) return folder.write(name, text);
    folder.write(name, "heft-machine 1\n" + text);
    const std::string document = folder / (name.substr(0, name.rfind('.')) + ".json");
    const HXProgramRun run =
        HXRunProgram({HEFT_REPLAY_PROGRAM, folder / name, "-a", "-v", "--json", document});
    EXPECT_EQ(run.status, 0) << run.err;
}

// What a command prints over the files of the folder.
std::string printed(const HXTemporaryFolder &folder, const std::string &command) {
    std::vector<std::string> words = HXWordsOf(command);
    words[0] = kPrograms / words[0];
    for (std::string &word : words)
        if (word.ends_with(".json") || word.ends_with(".machine")) word = folder / word;
    const HXProgramRun run = HXRunProgram(words);
    std::string all =
        run.out + run.err + (run.status == 0 ? "" : "status " + std::to_string(run.status) + "\n");
    all = std::regex_replace(all, std::regex("(heft_duration_seconds) [0-9.]+"), "$1 TIME");
    return std::regex_replace(all, std::regex(folder.path().native() + "/"), "");
}
} // namespace

TEST(HXCompanionsTest, PrintWhatIsExpected) {
    for (const HXCase &tested : HXReadCases("companions.txt")) {
        SCOPED_TRACE(tested.title);
        const HXTemporaryFolder folder;
        writeFile(folder, "a.machine", tested.input);
        for (const HXCase::Part &part : tested.expected) {
            if (part.label.starts_with("file "))
                writeFile(folder, part.label.substr(5), part.text);
            else
                EXPECT_EQ(printed(folder, part.label.substr(2)), part.text) << part.label;
        }
    }
}

// Among 300 processes that do not change, one page more is found, and nothing where there is nothing.
TEST(HXCompanionsTest, DiffFindsALeakAmongManyProcesses) {
    const auto machine = [](uint64_t leakedPages) {
        std::string text = "host\tpage_size=4096\tself_region_heft=0\tpid=999\tledger=page_table\n";
        for (int pid = 1; pid <= 300; pid++) {
            const uint64_t pages = 1000 + (pid == 150 ? leakedPages : 0);
            const std::string of = "\tpid=" + std::to_string(pid);
            text += "process" + of + "\tname=worker\tpage_table=8192\nregion" + of +
                    "\taddress=0x10000\tsize=0x1000000\ttag=100\tresident=" + std::to_string(pages) +
                    "\tdirtied=" + std::to_string(pages) + "\tobject_id=" + std::to_string(pid) + "\n";
        }
        return text;
    };
    const HXTemporaryFolder folder;
    writeFile(folder, "rest.machine", machine(0));
    writeFile(folder, "leak.machine", machine(256));
    EXPECT_EQ(printed(folder, "heft-diff --fail-above 1023K rest.json rest.machine").find("status"),
              std::string::npos);
    const auto found =
        nlohmann::json::parse(HXLinesOf(printed(folder, "heft-diff --json rest.json leak.json"))[0]);
    ASSERT_EQ(found["processes"].size(), 1u);
    EXPECT_EQ(found["processes"][0]["new pid"], 150);
    EXPECT_EQ(found["processes"][0]["change"], 1 << 20);
    EXPECT_EQ(printed(folder, "heft-diff --fail-above 1M rest.json leak.json").find("status"),
              std::string::npos);
    EXPECT_NE(printed(folder, "heft-diff --fail-above 1023K rest.json leak.json").find("status 1"),
              std::string::npos);
}

TEST(HXCompanionsTest, WatchingReadsTheFileAgainAndTellsTheChanges) {
    const HXTemporaryFolder folder;
    folder.write("a.json", kSmallReport);
    const auto lines = HXLinesOf(printed(folder, "heft-top --watch 0.001 --count 2 --json a.json"));
    ASSERT_EQ(lines.size(), 2u);
    const auto first = nlohmann::json::parse(lines[0]);
    const auto second = nlohmann::json::parse(lines[1]);
    EXPECT_TRUE(first["groups"][0]["change"].is_null());
    EXPECT_EQ(second["groups"][0]["change"], 0);
    EXPECT_EQ(second["groups"][0]["growth"], 0);
    EXPECT_TRUE(second["kernel"]["freed"].is_null()); // it cannot be stopped
    EXPECT_FALSE(second["total"].contains("pid"));
}

// A watcher that waits for its next reading ends in order when it is interrupted.
TEST(HXCompanionsTest, WatchingEndsWhenInterrupted) {
    const HXTemporaryFolder folder;
    folder.write("a.json", kSmallReport);
    const std::string program = kPrograms / "heft-top";
    const std::string document = folder / "a.json";
    int out[2];
    ASSERT_EQ(pipe2(out, O_CLOEXEC), 0);
    const pid_t pid = fork();
    if (pid == 0) {
        dup2(out[1], 1);
        execl(program.c_str(), "heft-top", "--watch", "100000", "--json", document.c_str(), nullptr);
        _exit(127);
    }
    close(out[1]);
    char first = 0;
    EXPECT_EQ(read(out[0], &first, 1), 1); // the first reading is told
    EXPECT_EQ(kill(pid, SIGINT), 0);
    int status = 0;
    EXPECT_EQ(waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    close(out[0]);
}

TEST(HXCompanionsTest, MetricsAreWrittenWholeOrNotAtAll) {
    const HXTemporaryFolder folder;
    folder.write("a.json", kSmallReport);
    const std::string output = folder / "heft.prom";
    const std::string program = kPrograms / "heft-metrics";
    const auto status = [&](const std::string &document) {
        return HXRunProgram({program, "-o", output, folder / document}).status;
    };
    EXPECT_EQ(status("a.json"), 0);
    const std::string text = contentOf(output);
    EXPECT_TRUE(text.ends_with("# EOF\n"));
    EXPECT_EQ(fs::status(output).permissions(), fs::perms(0644)); // the collector is another user
    folder.write("bad.json", std::string(kSmallReport).substr(0, 50));
    EXPECT_EQ(status("bad.json"), 1);
    EXPECT_EQ(contentOf(output), text);
    folder.remove("a.json");
    folder.remove("bad.json");
    EXPECT_EQ(std::distance(fs::directory_iterator(folder.path()), {}), 1); // nothing temporary is left
}
