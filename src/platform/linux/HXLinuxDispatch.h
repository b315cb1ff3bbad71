// Concurrent loops and signal sources on threads of the machine's own.
#pragma once

#include "platform/HXPlatform.h"
#include "platform/linux/HXDescriptor.h"

#include <cstddef>
#include <functional>
#include <memory>
#include <thread>

// How many processors the calling thread may run on.
size_t HXUsableProcessorCount();

// Calls `work` with 0 … iterations − 1 on `workers` batch-scheduled threads, starting in that order; the
// caller waits.
void HXConcurrentLoop(size_t iterations, size_t workers, const std::function<void(size_t)> &work);

// Watches for one signal on a thread of its own, while all threads have it blocked.
class HXSignalSource final : public HXDispatchSource {
  public:
    // Blocks the signal in the calling thread, and so in those that it starts. Null when there can be no
    // source.
    static std::unique_ptr<HXSignalSource> create(int signal);
    ~HXSignalSource() override { cancel(); }

    void setHandler(std::function<void()> handler) { _handler = std::move(handler); }
    void resume();
    // No handler runs afterwards; a signal that comes from now on stays pending.
    void cancel();

  private:
    HXSignalSource(HXDescriptor signals, HXDescriptor wake)
        : _signals(std::move(signals)), _wake(std::move(wake)) {}
    void watch();

    const HXDescriptor _signals, _wake;
    std::function<void()> _handler;
    std::thread _thread;
};

// Whether the calling thread has the signal blocked.
bool HXIsSignalBlocked(int signal);
// Sets the disposition, then lets the calling thread receive the signal: one that is pending acts by the new
// disposition.
void HXSetSignalDisposition(int signal, HXSignalDisposition disposition);
