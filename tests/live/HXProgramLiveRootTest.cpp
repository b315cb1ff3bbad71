// The built program on the whole machine: needs root.
#include "support/HXProgramRun.h"
#include "support/HXSubject.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <regex>
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

// The processes by /proc, and whether each has memory of its own that root may examine: kernel threads and
// zombies have none, and a container's first process can be out of its root's reach. Left out are those whose
// leading thread has ended, which another test may have just now.
std::map<int, bool> processes() {
    std::map<int, bool> pids;
    for (const auto &entry : std::filesystem::directory_iterator("/proc")) {
        std::ifstream statm(entry.path() / "statm");
        const int pid = std::atoi(entry.path().filename().c_str());
        long size = 0;
        const bool hasMemory =
            pid > 0 && std::ifstream(entry.path() / "smaps").good() && statm >> size && size > 0;
        std::ifstream status(entry.path() / "status");
        const std::string text{std::istreambuf_iterator<char>(status), {}};
        const bool isAlone = text.find("\nThreads:\t1\n") != std::string::npos;
        if (pid > 0 && (hasMemory || isAlone)) pids[pid] = hasMemory;
    }
    return pids;
}

TEST_F(HXProgramAsRoot, ListsEveryUserProcessOnce) {
    const HXSubject stable([] {});
    const std::map<int, bool> before = processes();
    const HXProgramRun run = HXRunHeft({"-a", "-f", "bytes"});
    EXPECT_EQ(run.status, 0);
    std::set<int> reported;
    const std::regex header(R"(\[(\d+)\]: \d\d-bit)");
    for (std::sregex_iterator at(run.out.begin(), run.out.end(), header), end; at != end; ++at)
        EXPECT_TRUE(reported.insert(std::stoi((*at)[1])).second) << "twice: " << (*at)[1];
    EXPECT_TRUE(reported.contains(0));
    EXPECT_TRUE(reported.contains(stable.pid()));
    // Those that lived all the time, unchanged; others may have come and gone meanwhile.
    for (const auto &[pid, isUsers] : processes()) {
        const auto known = before.find(pid);
        const bool isSame = known != before.end() && known->second == isUsers;
        EXPECT_EQ(isSame && reported.contains(pid), isSame && isUsers) << pid;
    }
}

TEST_F(HXProgramAsRoot, RefusesWhatOnlyRootMay) {
    const HXProgramRun all = HXRunHeft({"-a"}, kNobody), one = HXRunHeft({"1"}, kNobody),
                       kernel = HXRunHeft({"0"}, kNobody);
    EXPECT_EQ(all.err, "Must run as root.\n");
    EXPECT_EQ(one.status, 1);
    EXPECT_NE(one.err.find("Unable to analyze process with pid 1 (try as root?)\n"), std::string::npos)
        << one.err;
    EXPECT_EQ(kernel.status, 0);
    EXPECT_NE(kernel.out.find("kernel [0]: (os/kern) no access"), std::string::npos) << kernel.out;
}

TEST_F(HXProgramAsRoot, SaysHowMuchOfARecordingIsMissing) {
    const HXSubject subject([] {});
    const HXProgramRun run =
        HXRunProgram({HEFT_RECORD_PROGRAM, "machine", "-", std::to_string(subject.pid())}, kNobody);
    EXPECT_EQ(run.status, 3);
    EXPECT_EQ(run.err, "heft-record: 1 of 1 processes could not be read (try as root?)\n");
    EXPECT_NE(run.out.find("\ttask_error=8"), std::string::npos);
}

// As JavaScript has them, numbers are whole below 2^53.
TEST_F(HXProgramAsRoot, GivesIdentifiersThatEveryReaderKeeps) {
    const HXProgramRun run = HXRunHeft({"-a", "-v", "-j", "/dev/stdout"});
    const std::string document = run.out.substr(run.out.find("{\"unit\""));
    const std::regex region(R"("id":(\d+),"name":"([^"]*)\")");
    std::set<uint64_t> pageTables;
    size_t count = 0;
    for (std::sregex_iterator at(document.begin(), document.end(), region), end; at != end; ++at) {
        const uint64_t id = std::stoull((*at)[1]);
        EXPECT_LT(id, uint64_t{1} << 53) << (*at)[2];
        if ((*at)[2] != "page table") continue;
        count++;
        pageTables.insert(id);
    }
    EXPECT_GT(count, 1U);
    EXPECT_EQ(pageTables.size(), count) << "two objects have one identifier";
}

TEST_F(HXProgramAsRoot, SaysWhenProcTellsNothingOrNotAll) {
    const auto answer = [](const std::string &line) {
        return HXRunProgram({"/usr/bin/env", "unshare", "-m", "sh", "-c", line});
    };
    if (answer("mount -t proc -o hidepid=2 proc /proc").status != 0) GTEST_SKIP() << "no mount namespace";
    const std::string heft = HEFT_PROGRAM;
    for (const std::string &target : {std::string("-a"), std::string("1")}) {
        // Sanitizers miss /proc, too, and say so.
        const HXProgramRun run =
            answer("umount -l /proc && ASAN_OPTIONS=detect_leaks=0 exec " + heft + " " + target);
        EXPECT_EQ(run.status, 1);
        EXPECT_NE(run.err.find("heft: /proc is not mounted\n"), std::string::npos) << run.err;
    }
    for (const std::string &mode : {std::string("1"), std::string("2")}) {
        const HXProgramRun run = answer("mount -t proc -o hidepid=" + mode +
                                        ",gid=12345 proc /proc && exec setpriv --bounding-set=-all "
                                        "--inh-caps=-all " +
                                        heft + " -a");
        EXPECT_TRUE(run.err.starts_with("heft: /proc hides processes (it is mounted with ")) << run.err;
    }
    EXPECT_EQ(answer("mount -t proc -o hidepid=2 proc /proc && exec " + heft + " -a").err.find("hides"),
              std::string::npos);
}

// Two hundred shells whose children start, map, unmap and die while everything is examined again and again.
TEST_F(HXProgramAsRoot, SurvivesAMachineInMotion) {
    const HXSubject parent("/bin/sh",
                           {"-c", "i=0; while [ $((i += 1)) -le 200 ]; do "
                                  "(while :; do sleep 0.4; : $(echo); done) & done; kill -STOP $$"});
    ASSERT_TRUE(parent.stopped());
    for (int i = 0; i < 20; i++) {
        const HXProgramRun run = HXRunHeft({"-a"});
        ASSERT_EQ(run.status, 0) << run.err;
        ASSERT_NE(run.out.find("Summary Heft: "), std::string::npos) << run.err;
    }
}

} // namespace
