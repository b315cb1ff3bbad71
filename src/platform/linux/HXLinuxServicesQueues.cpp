// Work queues and signals.
#include "platform/linux/HXLinuxServices.h"
#include "platform/linux/HXTemporaryFiles.h"
#include "platform/linux/procfs/HXDescriptor.h"

#include <poll.h>
#include <pthread.h>
#include <sched.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <system_error>
#include <thread>
#include <vector>

namespace {

// How many processors the calling thread may run on.
size_t usableProcessorCount() {
    // Machines with more processors than a cpu_set_t has bits need larger sets.
    for (size_t processors = CPU_SETSIZE; processors <= (size_t{1} << 20); processors *= 4) {
        cpu_set_t *set = CPU_ALLOC(processors);
        if (set == nullptr) break;
        const size_t bytes = CPU_ALLOC_SIZE(processors);
        const bool known = ::sched_getaffinity(0, bytes, set) == 0;
        const int count = known ? CPU_COUNT_S(bytes, set) : 0;
        CPU_FREE(set);
        if (known) return static_cast<size_t>(std::max(count, 1));
        if (errno != EINVAL) break;
    }
    return 1;
}

// Watches for one signal on a thread of its own, while all threads have it blocked.
class SignalSource final : public HXDispatchSource {
  public:
    // Blocks the signal in the calling thread, and so in those that it starts. Null when there can be no
    // source.
    static std::unique_ptr<SignalSource> create(int signal);
    ~SignalSource() override { cancel(); }

    void setHandler(std::function<void()> handler) { _handler = std::move(handler); }
    void resume();
    // No handler runs afterwards; a signal that comes from now on stays pending.
    void cancel();

  private:
    SignalSource(HXDescriptor signals, HXDescriptor wake)
        : _signals(std::move(signals)), _wake(std::move(wake)) {}
    void watch();

    const HXDescriptor _signals, _wake;
    std::function<void()> _handler;
    std::thread _thread;
};

std::unique_ptr<SignalSource> SignalSource::create(int signal) {
    sigset_t set;
    sigemptyset(&set);
    if (sigaddset(&set, signal) != 0) return nullptr;
    HXDescriptor signals(::signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK));
    HXDescriptor wake(::eventfd(0, EFD_CLOEXEC));
    if (!signals || !wake || ::pthread_sigmask(SIG_BLOCK, &set, nullptr) != 0) return nullptr;
    return std::unique_ptr<SignalSource>(new SignalSource(std::move(signals), std::move(wake)));
}

void SignalSource::resume() {
    if (_thread.joinable()) return;
    try {
        _thread = std::thread([this] { watch(); });
    } catch (const std::system_error &) {
        // Without a thread to watch for it the signal waits until its disposition is set anew.
    }
}

void SignalSource::watch() {
    for (;;) {
        pollfd waits[] = {{_wake.get(), POLLIN, 0}, {_signals.get(), POLLIN, 0}};
        if (::poll(waits, std::size(waits), -1) < 0 && errno != EINTR) return;
        if (waits[0].revents != 0) return; // cancelled: what is pending is left to its disposition
        signalfd_siginfo info;
        if (waits[1].revents != 0 && ::read(_signals.get(), &info, sizeof info) == sizeof info && _handler)
            _handler();
    }
}

void SignalSource::cancel() {
    if (!_thread.joinable()) return;
    const uint64_t one = 1;
    while (::write(_wake.get(), &one, sizeof one) < 0 && errno == EINTR) {
    }
    _thread.join();
}

// Whether the calling thread has the signal blocked.
bool isBlocked(int signal) {
    sigset_t set;
    return ::pthread_sigmask(SIG_BLOCK, nullptr, &set) == 0 && sigismember(&set, signal) == 1;
}

} // namespace

HXDispatchQueue HXLinuxServices::dispatch_queue_create(const std::string &label, uint32_t qualityOfService) {
    return {label, qualityOfService};
}

void HXLinuxServices::dispatch_apply(size_t iterations, const HXDispatchQueue &,
                                     const std::function<void(size_t)> &work) {
    const size_t workers = _workerCount == 0 ? usableProcessorCount() : _workerCount;
    std::atomic<size_t> next = 0;
    const auto run = [&] {
        for (size_t i = next++; i < iterations; i = next++)
            work(i);
    };
    const auto runAsBatch = [&] {
        const sched_param parameter{};
        ::pthread_setschedparam(::pthread_self(), SCHED_BATCH, &parameter);
        run();
    };
    std::vector<std::jthread> threads;
    try {
        for (size_t i = 0; i < std::min(iterations, workers); i++)
            threads.emplace_back(runAsBatch);
    } catch (const std::system_error &) {
        // No more threads may be had: those that run share the work, or this one does it.
        if (threads.empty()) run();
    }
}

std::unique_ptr<HXDispatchSource> HXLinuxServices::dispatch_source_create(int signal) {
    return SignalSource::create(signal);
}

void HXLinuxServices::dispatch_source_set_event_handler(HXDispatchSource &source,
                                                        std::function<void()> handler) {
    static_cast<SignalSource &>(source).setHandler(std::move(handler));
}

void HXLinuxServices::dispatch_resume(HXDispatchSource &source) {
    static_cast<SignalSource &>(source).resume();
}

void HXLinuxServices::dispatch_source_cancel(HXDispatchSource &source) {
    static_cast<SignalSource &>(source).cancel();
}

void HXLinuxServices::signal(int signal, HXSignalDisposition disposition) {
    // To ignore a signal that a source has blocked would throw away one that is pending for it; the block
    // alone keeps it from acting.
    if (disposition == HXSignalDisposition::ignored && isBlocked(signal)) return;
    struct sigaction action {};
    action.sa_handler =
        disposition == HXSignalDisposition::ignored ? SIG_IGN : HXDefaultSignalHandler(signal);
    ::sigaction(signal, &action, nullptr);
    // One that is pending acts by the new disposition.
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, signal);
    ::pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
}
