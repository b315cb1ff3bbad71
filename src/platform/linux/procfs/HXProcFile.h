// Reading of the kernel's text files (proc(5), sysfs(5)).
//
// One rule holds for all readers: a text is whole or there is none. When a read fails in the middle of a
// file, as it does when the process goes meanwhile, what came before is dropped, since a figure taken from
// half a file is worse than none. None comes with errno set. Names are relative to a directory.
#pragma once

#include "platform/linux/procfs/HXDescriptor.h"

#include <cstddef>
#include <functional>
#include <optional>
#include <span>
#include <string>
#include <string_view>

// Memory of the calling thread for reading large files into; whoever reads one next on the thread overwrites
// it.
std::span<char> HXScratchBuffer();

// Opens `name` for reading, closed on execution. Never waits and never becomes a controlling terminal.
// `flags`: more of open(2), as O_DIRECTORY or O_PATH. Not open with errno set; a shortage is noted
// (HXShortageWatch).
HXDescriptor HXOpenAt(HXDirectoryView directory, const char *name, int flags = 0);

// The content of a file that the kernel hands out by one read call if there is room (stat, status, comm).
// The text lives in `buffer`, and is cut to it.
std::optional<std::string_view> HXReadOnce(HXDirectoryView directory, const char *name,
                                           std::span<char> buffer);

// The whole content of a file of any length; none with EFBIG when it is longer than `limit` bytes.
std::optional<std::string> HXReadText(HXDirectoryView directory, const char *name, size_t limit = SIZE_MAX);

// The target of a symbolic link, in `buffer` and cut to it.
std::optional<std::string_view> HXReadLink(HXDirectoryView directory, const char *name,
                                           std::span<char> buffer);

// Calls `each` with the name of every entry of an open directory, "." and ".." included, until it answers
// false; false with errno set when the directory cannot be read.
bool HXForEachEntry(HXDirectoryView directory, const std::function<bool(const char *name)> &each);
