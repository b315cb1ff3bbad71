// A live process that does as told and then stops, for tests of the live host; and the kernel's figures of
// it.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <vector>

class HXSubject {
  public:
    using SetUp = std::function<void()>;

    // Forks a process that runs `setUp` and stops. One that ends instead has not stopped.
    explicit HXSubject(const SetUp &setUp);
    // Runs a program instead, which must stop itself.
    HXSubject(const std::string &path, const std::vector<std::string> &arguments);
    ~HXSubject(); // kills it, and what it has started
    HXSubject(const HXSubject &) = delete;
    HXSubject &operator=(const HXSubject &) = delete;

    pid_t pid() const { return _pid; }
    bool stopped() const { return _pid > 0; }

  private:
    pid_t _pid = -1;
};

// One mapping as /proc/PID/smaps tells it, figures in bytes. Read on purpose by other means than the
// program's.
struct HXSmapsEntry {
    uint64_t start = 0;
    uint64_t end = 0;
    std::string path;
    std::map<std::string, uint64_t> figures; // by label, without its colon

    uint64_t operator[](const std::string &label) const;
    uint64_t hugePages() const { return (*this)["Shared_Hugetlb"] + (*this)["Private_Hugetlb"]; }
};
std::vector<HXSmapsEntry> HXReadSmaps(pid_t pid);
// A figure of /proc/PID/status in bytes; 0 when it is missing.
uint64_t HXReadStatus(pid_t pid, const std::string &field);
