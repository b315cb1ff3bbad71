#include "platform/linux/procfs/HXDescriptor.h"

#include <sched.h>

#include <chrono>

namespace {

void giveWayBeforeReading(size_t length) {
    constexpr size_t much = 8192; // a file of few figures is read with less
    if (length > much) HXGiveWay();
}

} // namespace

void HXGiveWay() {
    using Clock = std::chrono::steady_clock;
    constexpr std::chrono::milliseconds turn(1); // whoever comes instead has some
    thread_local Clock::time_point last;
    if (Clock::now() - last < turn) return;
    ::sched_yield();
    last = Clock::now();
}

void HXDescriptor::reset(int descriptor) {
    if (_descriptor >= 0) {
        const int kept = errno;
        ::close(_descriptor);
        errno = kept;
    }
    _descriptor = descriptor;
}

ssize_t HXDescriptor::read(std::span<char> buffer) const {
    giveWayBeforeReading(buffer.size());
    for (;;) {
        const ssize_t got = ::read(_descriptor, buffer.data(), buffer.size());
        if (got >= 0 || errno != EINTR) return got;
    }
}

ssize_t HXDescriptor::readFully(std::span<char> buffer) const {
    size_t length = 0;
    while (length < buffer.size()) {
        const ssize_t got = read(buffer.subspan(length));
        if (got < 0) return -1;
        if (got == 0) break;
        length += static_cast<size_t>(got);
    }
    return static_cast<ssize_t>(length);
}

ssize_t HXDescriptor::readAt(uint64_t position, void *buffer, size_t length) const {
    giveWayBeforeReading(length);
    return ::pread(_descriptor, buffer, length, static_cast<off_t>(position));
}
