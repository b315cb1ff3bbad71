// Facts of the whole machine that decide which of a process's files tell enough.
#pragma once

#include <chrono>
#include <cstdint>
#include <mutex>
#include <string>

// Any thread.
class HXMachineFacts {
  public:
    explicit HXMachineFacts(std::string procPath) : _vmstatPath(std::move(procPath) + "/vmstat") {}

    // Whether any page is swapped out now.
    bool usesSwap() const;
    // By how many pages in all a process's counters of resident memory may be off: the kernel adds up what it
    // counted for each processor, or each of the process's `threads`, only now and then.
    uint64_t counterErrorPages(uint64_t threads) const;
    // Whether any process had ever freed pages lazily at some moment after `since`: one lookup serves all
    // processes that were opened before it.
    bool hasFreedLazily(std::chrono::steady_clock::time_point since);

  private:
    const std::string _vmstatPath;
    std::mutex _mutex;
    bool _hasFreedLazily = false;
    std::chrono::steady_clock::time_point _lookedUp{};
};
