// Reading of the kernel's text files: raw system calls into memory that each thread keeps.
#pragma once

#include "platform/linux/procfs/HXDescriptor.h"

#include <cstddef>
#include <optional>
#include <span>
#include <string>
#include <string_view>

// Memory of the calling thread for reading large files into; whoever reads one next on the thread overwrites
// it.
std::span<char> HXScratchBuffer();

// Opens `name`, relative to `directory`, for reading. Never waits and never becomes a controlling terminal.
HXDescriptor HXOpenAt(int directory, const char *name, int flags = 0);

// Fills `buffer` from the descriptor's place until it is full or the file ends: bytes read, or -1 with errno
// when there are none for an error.
ssize_t HXReadFully(int descriptor, std::span<char> buffer);

// The content of a file that the kernel hands out by one read call if there is room (stat, status, comm);
// none with errno set. The text lives in `buffer`.
std::optional<std::string_view> HXReadOnce(int directory, const char *name, std::span<char> buffer);
// The content of any file, cut to the buffer.
std::optional<std::string_view> HXReadWhole(int directory, const char *name, std::span<char> buffer);

// The whole content of a file of any length, up to `limit` bytes.
std::optional<std::string> HXReadText(int directory, const char *name, size_t limit);

// The target of a symbolic link; none with errno set.
std::optional<std::string_view> HXReadLink(int directory, const char *name, std::span<char> buffer);

// Calls `each` with the name of every entry of a directory until it answers false; false with errno set when
// the directory cannot be read.
template <typename Each>
bool HXForEachEntry(int directory, Each &&each);

namespace HXProcFileDetail {
ssize_t readEntries(int directory, std::span<char> buffer);
const char *nextEntry(std::span<const char> entries, size_t *position);
} // namespace HXProcFileDetail

template <typename Each>
bool HXForEachEntry(int directory, Each &&each) {
    alignas(8) char entries[16384];
    for (;;) {
        const ssize_t length = HXProcFileDetail::readEntries(directory, entries);
        if (length <= 0) return length == 0;
        size_t position = 0;
        while (position < static_cast<size_t>(length))
            if (!each(HXProcFileDetail::nextEntry({entries, static_cast<size_t>(length)}, &position)))
                return true;
    }
}
