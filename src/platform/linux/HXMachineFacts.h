// Facts of the whole machine that decide which of a process's files tell enough.
#pragma once

#include <chrono>
#include <mutex>
#include <string>

// Any thread.
class HXMachineFacts {
  public:
    explicit HXMachineFacts(std::string procPath) : _vmstatPath(std::move(procPath) + "/vmstat") {}

    // Whether any page is swapped out now.
    bool usesSwap() const;
    // Whether any process has ever freed pages lazily. Looked up again after a while.
    bool hasFreedLazily();

  private:
    const std::string _vmstatPath;
    std::mutex _mutex;
    bool _hasFreedLazily = false;
    std::chrono::steady_clock::time_point _lookedUp{};
};
