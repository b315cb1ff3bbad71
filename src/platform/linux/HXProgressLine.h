// A line on the terminal of standard error that tells how far the work is.
#pragma once

#include "platform/linux/HXLinuxServices.h"

#include <chrono>
#include <cstdio>
#include <mutex>
#include <string>

// While it lives and standard error is a terminal that somebody looks at, all that is written to stderr goes
// through it, so that the line is erased before. Nothing is shown at first, and nothing anywhere else.
// Outlives whoever writes to stderr.
class HXProgressLine final : public HXLoopObserver {
  public:
    // `services` work with it from here on. `untold`: how long nothing is shown.
    explicit HXProgressLine(HXLinuxServices &services,
                            std::chrono::milliseconds untold = std::chrono::milliseconds(500));
    ~HXProgressLine() override;
    HXProgressLine(const HXProgressLine &) = delete;
    HXProgressLine &operator=(const HXProgressLine &) = delete;

    void looked(const HXDispatchQueue &queue, size_t done, size_t all,
                std::optional<size_t> waitingFor) override;
    void ended() override;

  private:
    static ssize_t writeThrough(void *line, const char *text, size_t length);
    void erase();

    HXLinuxServices &_services;
    const std::chrono::milliseconds _untold;
    std::FILE *_stream = nullptr; // in place of stderr; null: no terminal
    std::FILE *_replaced = nullptr;
    const std::chrono::steady_clock::time_point _start = std::chrono::steady_clock::now();
    std::mutex _mutex;
    bool _isShown = false;
};
