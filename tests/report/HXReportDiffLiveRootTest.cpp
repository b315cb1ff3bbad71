// heft-diff over two readings of live processes.
#include "support/HXCaseFile.h"
#include "support/HXProgramRun.h"
#include "support/HXSubject.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <csignal>
#include <cstring>
#include <filesystem>
#include <memory>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {

constexpr size_t kLeak = 1 << 20;
constexpr int kProcesses = 300;

// A process at rest, which leaks when it goes on, and stops again.
void restThenLeak() {
    void *const leak = mmap(nullptr, kLeak, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    madvise(leak, kLeak, MADV_NOHUGEPAGE);
    raise(SIGSTOP);
    std::memset(leak, 1, kLeak);
}

} // namespace

TEST(HXReportDiffLiveRootTest, ALeakAmongProcessesAtRestIsFound) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root";
#ifdef __SANITIZE_THREAD__
    GTEST_SKIP() << "the sanitizer's own memory, in 300 processes, takes it minutes to read";
#endif
    std::vector<std::unique_ptr<HXSubject>> subjects;
    std::vector<std::string> words = {"-v", "--json", ""};
    for (int i = 0; i < kProcesses; i++) {
        subjects.push_back(std::make_unique<HXSubject>(restThenLeak));
        ASSERT_TRUE(subjects.back()->stopped());
        words.push_back(std::to_string(subjects.back()->pid()));
    }
    const HXTemporaryFolder folder;
    const auto reading = [&](const char *name) {
        words[2] = folder / name;
        EXPECT_EQ(HXRunHeft(words).status, 0);
        return words[2];
    };
    const std::string first = reading("first.json");
    const std::string second = reading("second.json");
    const pid_t leaking = subjects[kProcesses / 2]->pid();
    kill(leaking, SIGCONT);
    int status = 0;
    ASSERT_EQ(waitpid(leaking, &status, WUNTRACED), leaking);
    ASSERT_TRUE(WIFSTOPPED(status));
    const std::string third = reading("third.json");

    const std::string program = std::filesystem::path(HEFT_PROGRAM).parent_path() / "heft-diff";
    const auto difference = [&](const std::string &before, const std::string &after, int expected) {
        const HXProgramRun run = HXRunProgram({program, "--json", "--fail-above", "0", before, after});
        EXPECT_EQ(run.status, expected) << run.out;
        return nlohmann::json::parse(run.out);
    };
    EXPECT_TRUE(difference(first, second, 0)["processes"].empty());
    const auto found = difference(second, third, 1);
    ASSERT_EQ(found["processes"].size(), 1u);
    EXPECT_EQ(found["processes"][0]["new pid"], leaking);
    // With the page tables and what the handler touched besides.
    EXPECT_GE(found["processes"][0]["change"], kLeak);
    EXPECT_LT(found["processes"][0]["change"], kLeak + kLeak / 4);
    EXPECT_EQ(found["processes"][0]["categories"][0]["name"], "anonymous");
    EXPECT_EQ(found["processes"][0]["categories"][0]["regions"][0]["change"], kLeak);
}
