#include "platform/linux/HXProgressLine.h"

#include "platform/HXSafeText.h"

#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <string_view>
#include <utility>

namespace {

constexpr std::string_view kErase = "\r\033[K"; // ECMA-48: erase in line

// Whether somebody looks: not while the program runs behind another, nor on a terminal without cursor.
bool isWatched() {
    const char *const kind = std::getenv("TERM");
    return ::isatty(STDERR_FILENO) == 1 && ::tcgetpgrp(STDERR_FILENO) == ::getpgrp() && kind != nullptr &&
           std::string_view(kind) != "dumb";
}

// What a line of the terminal holds, its last column left free.
size_t lineLength() {
    constexpr size_t usual = 79;
    winsize size{};
    return ::ioctl(STDERR_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_col > 1 ? size.ws_col - 1U : usual;
}

// Of a line that does not arrive nothing depends.
void show(std::string_view text) {
    [[maybe_unused]] const ssize_t written = ::write(STDERR_FILENO, text.data(), text.size());
}

} // namespace

HXProgressLine::HXProgressLine(HXLinuxServices &services, std::chrono::milliseconds untold)
    : _services(services), _untold(untold) {
    if (!isWatched()) return;
    _stream =
        ::fopencookie(this, "w", {.read = nullptr, .write = writeThrough, .seek = nullptr, .close = nullptr});
    if (_stream == nullptr) return;
    std::setvbuf(_stream, nullptr, _IONBF, 0);
    _replaced = std::exchange(stderr, _stream); // a variable, as the C library's manual says
    _services.setLoopObserver(this);
}

HXProgressLine::~HXProgressLine() {
    if (_stream == nullptr) return;
    _services.setLoopObserver(nullptr);
    stderr = _replaced;
    std::fclose(_stream);
    ended();
}

void HXProgressLine::looked(const HXDispatchQueue &queue, size_t done, size_t all,
                            std::optional<size_t> waitingFor) {
    if (_stream == nullptr || std::chrono::steady_clock::now() - _start < _untold) return;
    std::string text = "heft: " + queue.activity + ": " + std::to_string(done) + " of " + std::to_string(all);
    if (waitingFor && queue.processOf) text += ", waiting for " + queue.processOf(*waitingFor);
    const std::string line = "\r" + std::string(HXCutText(text, lineLength())) + "\033[K";
    const std::lock_guard lock(_mutex);
    show(line);
    _isShown = true;
}

void HXProgressLine::ended() {
    const std::lock_guard lock(_mutex);
    erase();
}

void HXProgressLine::erase() {
    if (std::exchange(_isShown, false)) show(kErase);
}

ssize_t HXProgressLine::writeThrough(void *line, const char *text, size_t length) {
    auto &self = *static_cast<HXProgressLine *>(line);
    const std::lock_guard lock(self._mutex);
    self.erase();
    for (size_t at = 0; at < length;) {
        const ssize_t written = ::write(STDERR_FILENO, text + at, length - at);
        if (written < 0 && errno != EINTR) return 0; // an error, for fopencookie(3)
        at += static_cast<size_t>(std::max<ssize_t>(written, 0));
    }
    return static_cast<ssize_t>(length);
}
