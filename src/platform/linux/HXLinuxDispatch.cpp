#include "platform/linux/HXLinuxDispatch.h"

#include <poll.h>
#include <pthread.h>
#include <sched.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <system_error>
#include <vector>

size_t HXUsableProcessorCount() {
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

void HXConcurrentLoop(size_t iterations, size_t workers, const std::function<void(size_t)> &work) {
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
        for (size_t i = 0; i < std::min(iterations, std::max<size_t>(workers, 1)); i++)
            threads.emplace_back(runAsBatch);
    } catch (const std::system_error &) {
        // No more threads may be had: those that run share the work, or this one does it.
        if (threads.empty()) run();
    }
}

std::unique_ptr<HXSignalSource> HXSignalSource::create(int signal) {
    sigset_t set;
    sigemptyset(&set);
    if (sigaddset(&set, signal) != 0) return nullptr;
    HXDescriptor signals(::signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK));
    HXDescriptor wake(::eventfd(0, EFD_CLOEXEC));
    if (!signals || !wake || ::pthread_sigmask(SIG_BLOCK, &set, nullptr) != 0) return nullptr;
    return std::unique_ptr<HXSignalSource>(new HXSignalSource(std::move(signals), std::move(wake)));
}

void HXSignalSource::resume() {
    if (_thread.joinable()) return;
    try {
        _thread = std::thread([this] { watch(); });
    } catch (const std::system_error &) {
        // Without a thread to watch for it the signal waits until its disposition is set anew.
    }
}

void HXSignalSource::watch() {
    for (;;) {
        pollfd waits[] = {{_wake.get(), POLLIN, 0}, {_signals.get(), POLLIN, 0}};
        if (::poll(waits, std::size(waits), -1) < 0 && errno != EINTR) return;
        if (waits[0].revents != 0) return; // cancelled: what is pending is left to its disposition
        signalfd_siginfo info;
        if (waits[1].revents != 0 && ::read(_signals.get(), &info, sizeof info) == sizeof info && _handler)
            _handler();
    }
}

void HXSignalSource::cancel() {
    if (!_thread.joinable()) return;
    const uint64_t one = 1;
    while (::write(_wake.get(), &one, sizeof one) < 0 && errno == EINTR) {
    }
    _thread.join();
}

bool HXIsSignalBlocked(int signal) {
    sigset_t set;
    return ::pthread_sigmask(SIG_BLOCK, nullptr, &set) == 0 && sigismember(&set, signal) == 1;
}

void HXSetSignalDisposition(int signal, HXSignalDisposition disposition) {
    struct sigaction action {};
    action.sa_handler = disposition == HXSignalDisposition::ignored ? SIG_IGN : SIG_DFL;
    ::sigaction(signal, &action, nullptr);
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, signal);
    ::pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
}
