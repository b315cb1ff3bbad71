#include "platform/linux/procfs/HXProcFile.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <memory>

std::span<char> HXScratchBuffer() {
    constexpr size_t size = 65536; // some hundred mappings of smaps: few calls, and it stays in the cache
    thread_local const std::unique_ptr<char[]> buffer(new char[size]);
    return {buffer.get(), size};
}

HXDescriptor HXOpenAt(HXDirectoryView directory, const char *name, int flags) {
    constexpr int always = O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY;
    HXDescriptor file(::openat(directory.get(), name, always | flags));
    if (!file) HXShortageWatch::note(errno);
    return file;
}

std::optional<std::string_view> HXReadOnce(HXDirectoryView directory, const char *name,
                                           std::span<char> buffer) {
    const HXDescriptor file = HXOpenAt(directory, name);
    const ssize_t got = file ? file.read(buffer) : -1;
    if (got < 0) return std::nullopt;
    return std::string_view(buffer.data(), static_cast<size_t>(got));
}

std::optional<std::string> HXReadText(HXDirectoryView directory, const char *name, size_t limit) {
    constexpr size_t firstRoom = 16384; // the kernel makes such a file up in pieces of a page or more
    const HXDescriptor file = HXOpenAt(directory, name);
    if (!file) return std::nullopt;
    std::string text;
    for (;;) {
        const size_t length = text.size(), room = std::max(firstRoom, length);
        text.resize(length + room);
        const ssize_t got = file.readFully(std::span(text).subspan(length));
        if (got < 0) return std::nullopt;
        text.resize(length + static_cast<size_t>(got));
        if (text.size() > limit) {
            errno = EFBIG;
            return std::nullopt;
        }
        if (static_cast<size_t>(got) < room) return text;
    }
}

std::optional<std::string_view> HXReadLink(HXDirectoryView directory, const char *name,
                                           std::span<char> buffer) {
    const ssize_t length = ::readlinkat(directory.get(), name, buffer.data(), buffer.size());
    if (length < 0) return std::nullopt;
    return std::string_view(buffer.data(), static_cast<size_t>(length));
}

bool HXForEachEntry(HXDirectoryView directory, const std::function<bool(const char *name)> &each) {
    alignas(dirent64) char entries[16384];
    for (;;) {
        const ssize_t length = ::getdents64(directory.get(), entries, sizeof entries);
        if (length <= 0) return length == 0;
        for (ssize_t at = 0; at < length;) {
            const auto *entry = reinterpret_cast<const dirent64 *>(entries + at);
            if (!each(entry->d_name)) return true;
            at += entry->d_reclen;
        }
    }
}
