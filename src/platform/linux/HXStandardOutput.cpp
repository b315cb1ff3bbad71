#include "platform/linux/HXStandardOutput.h"

#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>

namespace {

std::atomic<int> firstFailure = 0;

void note(int failure) {
    int none = 0;
    firstFailure.compare_exchange_strong(none, failure);
}

ssize_t writeNoting(void *, const char *text, size_t length) {
    for (size_t at = 0; at < length;) {
        const ssize_t written = ::write(STDOUT_FILENO, text + at, length - at);
        if (written >= 0) {
            at += static_cast<size_t>(written);
        } else if (errno != EINTR) {
            note(errno);
            return 0; // a failure, for fopencookie(3)
        }
    }
    return static_cast<ssize_t>(length);
}

} // namespace

void HXWatchStandardOutput() {
    std::FILE *const stream = ::fopencookie(nullptr, "w", {nullptr, writeNoting, nullptr, nullptr});
    if (stream == nullptr) return;
    constexpr size_t piece = 1 << 16; // bytes
    const bool isTerminal = ::isatty(STDOUT_FILENO) == 1;
    std::setvbuf(stream, nullptr, isTerminal ? _IOLBF : _IOFBF, isTerminal ? BUFSIZ : piece);
    stdout = stream; // a variable, as the C library's manual says
}

int HXFlushStandardOutput() {
    errno = 0;
    if (std::fflush(stdout) != 0) note(errno);
    // Some file systems tell of a full disk or a quota only when a file is closed.
    const int copy = ::dup(STDOUT_FILENO);
    if (copy >= 0 && ::close(copy) != 0) note(errno);
    return firstFailure;
}
