#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>
#include <sys/syscall.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>

void HXDescriptor::reset(int descriptor) {
    if (_descriptor >= 0) {
        const int kept = errno;
        ::close(_descriptor);
        errno = kept;
    }
    _descriptor = descriptor;
}

std::span<char> HXScratchBuffer() {
    constexpr size_t size = 65536;
    thread_local const std::unique_ptr<char[]> buffer(new char[size]);
    return {buffer.get(), size};
}

HXDescriptor HXOpenAt(int directory, const char *name, int flags) {
    return HXDescriptor(::openat(directory, name, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY | flags));
}

ssize_t HXReadFully(int descriptor, std::span<char> buffer) {
    size_t length = 0;
    while (length < buffer.size()) {
        const ssize_t got = ::read(descriptor, buffer.data() + length, buffer.size() - length);
        if (got < 0 && errno == EINTR) continue;
        if (got < 0 && length == 0) return -1;
        if (got <= 0) break;
        length += static_cast<size_t>(got);
    }
    return static_cast<ssize_t>(length);
}

std::optional<std::string_view> HXReadOnce(int directory, const char *name, std::span<char> buffer) {
    const HXDescriptor file = HXOpenAt(directory, name);
    if (!file) return std::nullopt;
    ssize_t got;
    do
        got = ::read(file.get(), buffer.data(), buffer.size());
    while (got < 0 && errno == EINTR);
    if (got < 0) return std::nullopt;
    return std::string_view(buffer.data(), static_cast<size_t>(got));
}

std::optional<std::string_view> HXReadWhole(int directory, const char *name, std::span<char> buffer) {
    const HXDescriptor file = HXOpenAt(directory, name);
    if (!file) return std::nullopt;
    const ssize_t got = HXReadFully(file.get(), buffer);
    if (got < 0) return std::nullopt;
    return std::string_view(buffer.data(), static_cast<size_t>(got));
}

std::optional<std::string> HXReadText(int directory, const char *name, size_t limit) {
    const HXDescriptor file = HXOpenAt(directory, name);
    if (!file) return std::nullopt;
    std::string text;
    while (text.size() < limit) {
        constexpr size_t step = 16384;
        const size_t length = text.size();
        text.resize(std::min(length + step, limit));
        const ssize_t got = HXReadFully(file.get(), std::span(text).subspan(length));
        if (got < 0) return std::nullopt;
        text.resize(length + static_cast<size_t>(got));
        if (static_cast<size_t>(got) < step) break;
    }
    return text;
}

std::optional<std::string_view> HXReadLink(int directory, const char *name, std::span<char> buffer) {
    const ssize_t length = ::readlinkat(directory, name, buffer.data(), buffer.size());
    if (length < 0) return std::nullopt;
    return std::string_view(buffer.data(), static_cast<size_t>(length));
}

namespace HXProcFileDetail {

// One record of getdents64(2).
struct Entry {
    uint64_t inode;
    int64_t offset;
    uint16_t length;
    uint8_t type;
    char name[1];
};

ssize_t readEntries(int directory, std::span<char> buffer) {
    return ::syscall(SYS_getdents64, directory, buffer.data(), buffer.size());
}

const char *nextEntry(std::span<const char> entries, size_t *position) {
    const char *entry = entries.data() + *position;
    uint16_t length;
    std::memcpy(&length, entry + offsetof(Entry, length), sizeof length);
    *position += length;
    return entry + offsetof(Entry, name);
}

} // namespace HXProcFileDetail
