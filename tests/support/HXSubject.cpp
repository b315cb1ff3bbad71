#include "support/HXSubject.h"

#include <fstream>
#include <sstream>

#include <csignal>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

HXSubject::HXSubject(const SetUp &setUp) {
    const pid_t parent = getpid();
    _pid = fork();
    if (_pid == 0) {
        setpgid(0, 0); // so that what it starts goes with it
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (getppid() != parent) _exit(1);
        setUp();
        for (;;)
            raise(SIGSTOP);
    }
    int status = 0;
    if (waitpid(_pid, &status, WUNTRACED) != _pid || !WIFSTOPPED(status)) _pid = -1;
}

HXSubject::HXSubject(const std::string &path, const std::vector<std::string> &arguments)
    : HXSubject([&] {
          std::vector<char *> argv = {const_cast<char *>(path.c_str())};
          for (const std::string &argument : arguments)
              argv.push_back(const_cast<char *>(argument.c_str()));
          argv.push_back(nullptr);
          execv(path.c_str(), argv.data());
          _exit(127);
      }) {}

HXSubject::~HXSubject() {
    if (_pid <= 0) return;
    kill(-_pid, SIGKILL);
    kill(_pid, SIGKILL);
    waitpid(_pid, nullptr, 0);
}

uint64_t HXSmapsEntry::operator[](const std::string &label) const {
    const auto found = figures.find(label);
    return found == figures.end() ? 0 : found->second;
}

std::vector<HXSmapsEntry> HXReadSmaps(pid_t pid) {
    std::vector<HXSmapsEntry> entries;
    std::ifstream file("/proc/" + std::to_string(pid) + "/smaps");
    for (std::string line; std::getline(file, line);) {
        std::istringstream words(line);
        std::string first, skipped;
        words >> first;
        if (first.ends_with(':')) {
            uint64_t kilobytes = 0;
            words >> kilobytes;
            first.pop_back();
            entries.back().figures[first] = kilobytes * 1024;
        } else {
            HXSmapsEntry &entry = entries.emplace_back();
            entry.start = std::stoull(first, nullptr, 16);
            entry.end = std::stoull(first.substr(first.find('-') + 1), nullptr, 16);
            words >> skipped >> skipped >> skipped >> skipped >> std::ws;
            std::getline(words, entry.path);
        }
    }
    return entries;
}

uint64_t HXReadStatus(pid_t pid, const std::string &field) {
    std::ifstream file("/proc/" + std::to_string(pid) + "/status");
    for (std::string line; std::getline(file, line);)
        if (line.starts_with(field + ":")) return std::stoull(line.substr(field.size() + 1)) * 1024;
    return 0;
}
