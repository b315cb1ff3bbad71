// A live process that maps memory as told and then stops, for tests of the live host.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

// What a subject's mapping must be reported as. Plain data: it comes through a pipe.
struct HXExpectedRegion {
    uint64_t start = 0;
    uint64_t size = 0;
    uint64_t dirtySize = 0;
    uint64_t cleanSize = 0;
    uint64_t reclaimableSize = 0;
    char name[40] = {};
    bool wired = false;
};

class HXSubject {
  public:
    using SetUp = std::function<std::vector<HXExpectedRegion>()>;

    // Forks a process that runs `setUp` and stops. An empty answer with `failed` set means that the machine
    // cannot do what was asked for.
    explicit HXSubject(const SetUp &setUp);
    // Runs a program instead, which must stop itself.
    HXSubject(const std::string &path, const std::vector<std::string> &arguments);
    ~HXSubject(); // kills it
    HXSubject(const HXSubject &) = delete;
    HXSubject &operator=(const HXSubject &) = delete;

    pid_t pid() const { return _pid; }
    bool stopped() const { return _stopped; }
    const std::vector<HXExpectedRegion> &expected() const { return _expected; }

  private:
    void waitUntilStopped();

    pid_t _pid = -1;
    bool _stopped = false;
    std::vector<HXExpectedRegion> _expected;
};

// One mapping as /proc/PID/smaps tells it, figures in bytes. Read on purpose by other means than the
// program's.
struct HXSmapsEntry {
    uint64_t start = 0;
    uint64_t end = 0;
    std::string path;
    uint64_t rss = 0, anonymous = 0, lazyFree = 0, swap = 0, hugetlb = 0, dirty = 0;
};
std::vector<HXSmapsEntry> HXReadSmaps(pid_t pid);
// A figure of /proc/PID/status in bytes; 0 when it is missing.
uint64_t HXReadStatus(pid_t pid, const std::string &field);
