// Captures of live processes tell what the processes themselves tell.
#include "support/HXBuilders.h"
#include "support/HXProgramRun.h"
#include "support/HXSubject.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace {

class Captures : public testing::Test {
  protected:
    Captures() {
        EXPECT_EQ(ftruncate(memfd, 1 << 20), 0);
        // Pages of a program that has just been built await writing, but not for long.
        const int program = open("/proc/self/exe", O_RDONLY | O_CLOEXEC);
        EXPECT_EQ(fsync(program), 0);
        close(program);
    }
    ~Captures() override { close(memfd); }
    std::string file(const std::string &name) const { return folder / name; }

    const HXTemporaryFolder folder;
    const int memfd = static_cast<int>(syscall(SYS_memfd_create, "heft", 0));
};

// A process with anonymous memory, a shared memfd written in part, and a name for some of its memory.
HXSubject::SetUp sharing(int memfd, size_t from) {
    return [=] {
        constexpr size_t size = 1 << 20;
        void *shared = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, memfd, 0);
        memset(static_cast<char *>(shared) + from, 1, size / 2);
        void *own = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        memset(own, 1, size / 4);
        constexpr int setVma = 0x53564d41; // PR_SET_VMA, prctl(2)
        syscall(SYS_prctl, setVma, 0, own, size, "arena");
    };
}

TEST_F(Captures, ReplayToTheSameReports) {
    const HXSubject first(sharing(memfd, 0));
    const HXSubject second(sharing(memfd, 1 << 18));
    const std::vector<std::string> pids = {std::to_string(first.pid()), std::to_string(second.pid())};
    const std::string machine = file("machine");
    const HXProgramRun recording = HXRunProgram({HEFT_RECORD_PROGRAM, "machine", machine, pids[0], pids[1]});
    ASSERT_EQ(recording.status, 0) << recording.err;
    EXPECT_EQ(std::filesystem::status(machine).permissions(), std::filesystem::perms(0600));

    const std::vector<std::vector<std::string>> options = {
        {},           {"-f", "bytes"},           {"-f", "pages", "--sort", "clean"},
        {"-v", "-w"}, {"--vmObjectDirty", "-v"}, {"--sort", "regions", "--wired"}};
    for (std::vector<std::string> arguments : options) {
        arguments.insert(arguments.end(), {pids[0], pids[1], "-j", file("live")});
        const HXProgramRun live = HXRunHeft(arguments);
        arguments.back() = file("replayed");
        arguments.insert(arguments.begin(), {HEFT_REPLAY_PROGRAM, machine});
        const HXProgramRun replayed = HXRunProgram(arguments);
        EXPECT_EQ(live.status, 0) << live.err;
        EXPECT_NE(live.out.find("Shared with "), std::string::npos);
        EXPECT_EQ(replayed.out, live.out) << replayed.err;
        EXPECT_EQ(contentOf(file("replayed")), contentOf(file("live")));
    }
    const HXProgramRun nobody = HXRunProgram({HEFT_REPLAY_PROGRAM, file("none"), "1"});
    EXPECT_EQ(nobody.status, 1);
    EXPECT_EQ(nobody.err, file("none") + ": No such file or directory\n");
}

TEST_F(Captures, HideNamesButNotFiguresWhenAskedTo) {
    const HXSubject subject(sharing(memfd, 0));
    const std::string pid = std::to_string(subject.pid());
    ASSERT_EQ(HXRunProgram({HEFT_RECORD_PROGRAM, "machine", "--anonymize", file("machine"), pid}).status, 0);
    const std::string content = contentOf(file("machine"));
    EXPECT_EQ(content.find("heft-tests"), std::string::npos);
    EXPECT_EQ(content.find("arena"), std::string::npos);
    EXPECT_EQ(content.find("libc"), std::string::npos);
    const auto totals = [](const HXProgramRun &run) {
        return run.out.substr(run.out.find("TOTAL") - 60, 60);
    };
    EXPECT_EQ(totals(HXRunProgram({HEFT_REPLAY_PROGRAM, file("machine"), pid, "-f", "bytes"})),
              totals(HXRunHeft({pid, "-f", "bytes"})));
}

TEST_F(Captures, OfOneProcessGiveItsHeftAndCategories) {
    const HXSubject subject(sharing(memfd, 0));
    const std::string pid = std::to_string(subject.pid());
    const auto figures = [&](const std::string &target, const std::vector<std::string> &mode) {
        std::vector<std::string> arguments = mode;
        arguments.insert(arguments.end(), {target, "-j", file("json")});
        EXPECT_EQ(HXRunHeft(arguments).status, 0);
        const std::string filter = ".processes[0] | .heft, .auxiliary, .categories";
        return HXRunProgram({"/usr/bin/env", "jq", "-cS", filter, file("json")}).out;
    };
    for (const auto &mode : std::vector<std::vector<std::string>>{{}, {"--vmObjectDirty"}}) {
        std::vector<std::string> arguments = {HEFT_RECORD_PROGRAM, "memgraph"};
        arguments.insert(arguments.end(), mode.begin(), mode.end());
        arguments.insert(arguments.end(), {pid, file("graph")});
        ASSERT_EQ(HXRunProgram(arguments).status, 0);
        const std::string live = figures(pid, mode);
        EXPECT_NE(live.find("memfd"), std::string::npos);
        EXPECT_EQ(figures(file("graph"), mode), live);
    }
    const HXProgramRun conflict = HXRunHeft({"--vmObjectDirty", file("graph")});
    EXPECT_EQ(conflict.status, 0) << "the last graph was gathered in that mode";
    EXPECT_NE(conflict.out.find("[" + pid + "] (memgraph): 64-bit\tHeft: "), std::string::npos);
    ASSERT_EQ(HXRunProgram({HEFT_RECORD_PROGRAM, "memgraph", pid, file("other")}).status, 0);
    const HXProgramRun mixed = HXRunHeft({file("graph"), file("other")});
    EXPECT_EQ(mixed.status, 1);
    EXPECT_EQ(mixed.err.find("Memgraph was gathered with an analysis mode that conflicts"), 0U) << mixed.err;
}

// A listing is written as it is made: it takes no memory that grows with it.
TEST_F(Captures, AreListedInTheMemoryOfTheirRegions) {
    const HXSubject subject([] {
        constexpr size_t page = 4096;
        constexpr size_t pairs = 25000;
        auto *all = static_cast<char *>(
            mmap(nullptr, 2 * pairs * page, PROT_READ, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0));
        for (size_t i = 0; i < pairs; i++)
            mprotect(all + 2 * i * page, page, PROT_READ | PROT_WRITE);
    });
    ASSERT_TRUE(subject.stopped());
    const std::string pid = std::to_string(subject.pid());
    const HXProgramRun summary = HXRunHeft({pid, "-j", file("json")});
    const HXProgramRun listing = HXRunHeft({pid, "-v", "-j", file("json")});
    EXPECT_GT(listing.out.size(), 80 * 50000U);
    EXPECT_LT(listing.peakKilobytes, summary.peakKilobytes + summary.peakKilobytes / 4);
}

} // namespace
