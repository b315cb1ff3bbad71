// The built program on the whole machine: needs root.
#include "support/HXProgramRun.h"
#include "support/HXSubject.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <unistd.h>

namespace {

constexpr uid_t kNobody = 65534;

class HXProgramAsRoot : public testing::Test {
  protected:
    void SetUp() override {
        if (geteuid() != 0) GTEST_SKIP() << "needs root";
    }
};

// Processes with memory of their own that root may examine, by /proc; kernel threads and zombies have none,
// and a container's first process can be out of its root's reach.
std::set<int> userProcesses() {
    std::set<int> pids;
    for (const auto &entry : std::filesystem::directory_iterator("/proc")) {
        const std::string name = entry.path().filename();
        if (name.find_first_not_of("0123456789") != std::string::npos) continue;
        std::ifstream statm(entry.path() / "statm");
        long size = 0;
        const bool mayExamine = std::ifstream(entry.path() / "smaps").good();
        if (mayExamine && statm >> size && size > 0) pids.insert(std::stoi(name));
    }
    return pids;
}

std::map<int, int> reportedProcesses(const std::string &report) {
    std::map<int, int> pids;
    for (size_t at = 0; (at = report.find("]: ", at)) != std::string::npos; at++) {
        if (report.compare(at + 5, 4, "-bit") != 0) continue;
        const size_t open = report.rfind('[', at);
        pids[std::stoi(report.substr(open + 1))]++;
    }
    return pids;
}

TEST_F(HXProgramAsRoot, ListsEveryUserProcessOnce) {
    const HXSubject stable([]() -> std::vector<HXExpectedRegion> { return {}; });
    const std::set<int> before = userProcesses();
    const HXProgramRun run = HXRunHeft({"-a", "-f", "bytes"});
    const std::set<int> after = userProcesses();
    EXPECT_EQ(run.status, 0);
    const std::map<int, int> reported = reportedProcesses(run.out);
    for (const auto &[pid, times] : reported)
        EXPECT_EQ(times, 1) << pid;
    EXPECT_TRUE(reported.contains(0));
    EXPECT_TRUE(reported.contains(stable.pid()));
    for (const int pid : before)
        EXPECT_TRUE(!after.contains(pid) || reported.contains(pid)) << pid;
    for (const auto &[pid, times] : reported)
        EXPECT_TRUE(pid == 0 || before.contains(pid) || after.contains(pid)) << pid << " is no user process";
}

TEST_F(HXProgramAsRoot, RefusesWhatOnlyRootMay) {
    EXPECT_EQ(HXRunHeft({"-a"}, kNobody).err, "Must run as root.\n");
    EXPECT_EQ(HXRunHeft({"--unmapped", "1"}, kNobody).err, "Must run as root.\n");
    const HXProgramRun refused = HXRunHeft({"1"}, kNobody);
    EXPECT_EQ(refused.status, 1);
    EXPECT_NE(refused.err.find("Unable to analyze process with pid 1 (try as root?)\n"), std::string::npos)
        << refused.err;
    const HXProgramRun kernel = HXRunHeft({"0"}, kNobody);
    EXPECT_EQ(kernel.status, 0);
    EXPECT_NE(kernel.out.find("kernel [0]: (os/kern) no access"), std::string::npos) << kernel.out;
}

// Two hundred shells whose children start, map, unmap and die while everything is examined again and again.
TEST_F(HXProgramAsRoot, SurvivesAMachineInMotion) {
    const HXSubject parent("/bin/sh",
                           {"-c", "i=0; while [ $((i += 1)) -le 200 ]; do "
                                  "(while :; do sleep 0.4; : $(echo); done) & done; kill -STOP $$"});
    ASSERT_TRUE(parent.stopped());
    for (int i = 0; i < 50; i++) {
        const HXProgramRun run = HXRunHeft({"-a"});
        ASSERT_EQ(run.status, 0) << run.err;
        ASSERT_NE(run.out.find("Summary Heft: "), std::string::npos) << run.err;
        ASSERT_TRUE(run.out.ends_with("\n\n") || run.out.ends_with("TOTAL\n\n") ||
                    run.out.ends_with("TOTAL\n"));
    }
}

} // namespace
