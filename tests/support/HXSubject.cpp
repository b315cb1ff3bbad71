#include "support/HXSubject.h"

#include <fstream>
#include <sstream>

#include <csignal>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {
constexpr uint64_t kEndOfExpected = UINT64_MAX;
}

HXSubject::HXSubject(const SetUp &setUp) {
    int ends[2];
    if (pipe(ends) != 0) return;
    const pid_t parent = getpid();
    _pid = fork();
    if (_pid == 0) {
        setpgid(0, 0); // so that what it starts goes with it
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) _exit(1);
        close(ends[0]);
        std::vector<HXExpectedRegion> expected = setUp();
        // The end is marked, since the subject's own children may hold the pipe open.
        expected.push_back({.start = kEndOfExpected});
        for (const HXExpectedRegion &region : expected)
            if (write(ends[1], &region, sizeof region) != static_cast<ssize_t>(sizeof region)) _exit(1);
        close(ends[1]);
        for (;;)
            raise(SIGSTOP);
    }
    close(ends[1]);
    HXExpectedRegion region;
    while (read(ends[0], &region, sizeof region) == static_cast<ssize_t>(sizeof region) &&
           region.start != kEndOfExpected)
        _expected.push_back(region);
    close(ends[0]);
    waitUntilStopped();
}

HXSubject::HXSubject(const std::string &path, const std::vector<std::string> &arguments) {
    const pid_t parent = getpid();
    _pid = fork();
    if (_pid == 0) {
        setpgid(0, 0); // so that what it starts goes with it
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) _exit(1);
        std::vector<char *> argv = {const_cast<char *>(path.c_str())};
        for (const std::string &argument : arguments)
            argv.push_back(const_cast<char *>(argument.c_str()));
        argv.push_back(nullptr);
        execv(path.c_str(), argv.data());
        _exit(127);
    }
    waitUntilStopped();
}

void HXSubject::waitUntilStopped() {
    int status = 0;
    _stopped = _pid > 0 && waitpid(_pid, &status, WUNTRACED) == _pid && WIFSTOPPED(status);
    if (!_stopped) _pid = -1;
}

HXSubject::~HXSubject() {
    if (_pid <= 0) return;
    kill(-_pid, SIGKILL);
    kill(_pid, SIGKILL);
    waitpid(_pid, nullptr, 0);
}

std::vector<HXSmapsEntry> HXReadSmaps(pid_t pid) {
    std::vector<HXSmapsEntry> entries;
    std::ifstream file("/proc/" + std::to_string(pid) + "/smaps");
    for (std::string line; std::getline(file, line);) {
        std::istringstream words(line);
        std::string first;
        words >> first;
        if (first.empty()) continue;
        if (first.back() != ':') {
            HXSmapsEntry &entry = entries.emplace_back();
            const size_t dash = first.find('-');
            entry.start = std::stoull(first.substr(0, dash), nullptr, 16);
            entry.end = std::stoull(first.substr(dash + 1), nullptr, 16);
            std::string skipped;
            words >> skipped >> skipped >> skipped >> skipped >> std::ws;
            std::getline(words, entry.path);
            continue;
        }
        uint64_t kilobytes = 0;
        words >> kilobytes;
        HXSmapsEntry &entry = entries.back();
        const uint64_t bytes = kilobytes * 1024;
        if (first == "Rss:") entry.rss = bytes;
        if (first == "Anonymous:") entry.anonymous = bytes;
        if (first == "LazyFree:") entry.lazyFree = bytes;
        if (first == "Swap:") entry.swap = bytes;
        if (first == "Shared_Hugetlb:" || first == "Private_Hugetlb:") entry.hugetlb += bytes;
        if (first == "Shared_Dirty:" || first == "Private_Dirty:") entry.dirty += bytes;
    }
    return entries;
}

uint64_t HXReadStatus(pid_t pid, const std::string &field) {
    std::ifstream file("/proc/" + std::to_string(pid) + "/status");
    for (std::string line; std::getline(file, line);)
        if (line.starts_with(field + ":")) return std::stoull(line.substr(field.size() + 1)) * 1024;
    return 0;
}
