// Shared memory held in every way, as the built programs tell it: needs root.
#include "support/HXProgramRun.h"
#include "support/HXSubject.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <map>
#include <regex>
#include <sched.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

constexpr int64_t kMebibyte = 1 << 20;

// What the subject has below, by category; MiB.
const std::map<std::string, int64_t> kHeld = {
    {"memfd", 3 + 2},
    {"memfd (unmapped)", 10 + 5 + 2},
    {"System V shared memory", 5},
    {"System V shared memory (unattached)", 6},
    {"deleted shared memory", 1},
    {"deleted shared memory (unmapped)", 9},
    {"mapped file", 2},
    {"tmpfs", 7},
    {"shared anonymous (unmapped)", 4},
};

void require(bool done) {
    if (!done) _exit(1);
}

// Maps that much of a file, or of shared memory without one, and writes it.
char *map(int file, int64_t size) {
    void *const start =
        ::mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED | (file < 0 ? MAP_ANONYMOUS : 0), file, 0);
    require(start != MAP_FAILED);
    return static_cast<char *>(std::memset(start, 1, size));
}

// A file with that much in it.
int filled(int file, int64_t size) {
    require(file >= 0 && ::fallocate(file, 0, 0, size) == 0);
    return file;
}

void *attached(int64_t size) {
    void *const start = ::shmat(::shmget(IPC_PRIVATE, static_cast<size_t>(size), 0600), nullptr, 0);
    require(start != reinterpret_cast<void *>(-1));
    return std::memset(start, 1, static_cast<size_t>(size));
}

// In namespaces of the subject's own, so that all goes with it.
void hold(const std::string &folder) {
    require(::unshare(CLONE_NEWNS | CLONE_NEWIPC) == 0);
    require(::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0);
    require(::mount("none", folder.c_str(), "tmpfs", 0, "size=64m") == 0);
    const auto create = [&](const char *name) {
        return ::open((folder + name).c_str(), O_RDWR | O_CREAT, 0600);
    };
    filled(::memfd_create("open", 0), 10 * kMebibyte);
    map(filled(::memfd_create("partly", 0), 8 * kMebibyte), 3 * kMebibyte);
    const int closed = filled(::memfd_create("closed", 0), 4 * kMebibyte);
    ::munmap(map(closed, 4 * kMebibyte), 2 * kMebibyte);
    ::close(closed);
    attached(5 * kMebibyte);
    ::shmdt(attached(6 * kMebibyte));
    filled(create("/open"), 9 * kMebibyte);
    map(filled(create("/mapped"), kMebibyte), kMebibyte);
    ::unlink((folder + "/open").c_str());
    ::unlink((folder + "/mapped").c_str());
    ::close(filled(create("/named\\ file"), 7 * kMebibyte));
    map(filled(create("/both"), 2 * kMebibyte), 2 * kMebibyte);
    ::madvise(map(-1, 4 * kMebibyte), 4 * kMebibyte, MADV_DONTNEED);
}

// The dirty bytes of the summary by category; of the file system of `folder` as that of "tmpfs".
std::map<std::string, int64_t> summary(const HXProgramRun &run, const std::string &folder) {
    std::map<std::string, int64_t> rows;
    const std::string text = run.out.substr(std::min(run.out.find("Summary Heft"), run.out.size()));
    const std::regex row(R"(\n +(\d+) B .* {4}(\S[^\n]*))");
    for (std::sregex_iterator at(text.begin(), text.end(), row), end; at != end; ++at)
        rows[(*at)[2] == "tmpfs " + folder ? std::string("tmpfs") : (*at)[2].str()] = std::stoll((*at)[1]);
    return rows;
}

int64_t sharedMemory() {
    std::ifstream file("/proc/meminfo");
    for (std::string line; std::getline(file, line);)
        if (line.starts_with("Shmem:")) return std::atoll(line.c_str() + 6) * 1024;
    return 0;
}

TEST(HXHeldAsRoot, IsToldOnceAndReplayed) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root";
    const HXTemporaryFolder temporary;
    const std::string folder = temporary / "a place";
    ASSERT_EQ(::mkdir(folder.c_str(), 0700), 0);
    auto before = summary(HXRunHeft({"0", std::to_string(getpid()), "-f", "bytes"}), folder);
    const int64_t sharedBefore = sharedMemory();
    const HXSubject subject([&] { hold(folder); });
    if (!subject.stopped()) GTEST_SKIP() << "needs namespaces";
    const int64_t growth = sharedMemory() - sharedBefore;

    const std::string pid = std::to_string(subject.pid()), machine = temporary / "machine";
    auto live = summary(HXRunHeft({"0", pid, "-f", "bytes"}), folder);
    ASSERT_EQ(HXRunProgram({HEFT_RECORD_PROGRAM, "machine", machine, "0", pid}).status, 0);
    auto replayed = summary(HXRunProgram({HEFT_REPLAY_PROGRAM, machine, "0", pid, "-f", "bytes"}), folder);
    auto all = summary(HXRunHeft({"-a", "-f", "bytes"}), folder);
    int64_t sum = 0;
    for (const auto &[category, mebibytes] : kHeld) {
        const int64_t size = live[category] - before[category];
        EXPECT_EQ(size, mebibytes * kMebibyte) << category;
        EXPECT_EQ(replayed[category], live[category]) << category;
        EXPECT_GE(all[category], size) << category;
        sum += size;
    }
    EXPECT_NEAR(static_cast<double>(sum), static_cast<double>(growth), kMebibyte);
}

} // namespace
