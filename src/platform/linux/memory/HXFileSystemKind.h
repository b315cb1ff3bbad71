// Kinds of file systems, as far as memory accounting and reading a mapped file tell them apart.
#pragma once

#include <cstdint>

enum class HXFileSystemKind : uint8_t {
    unknown,
    remote,      // may wait for another machine or a user's process
    layered,     // its files lie on other file systems, which may be remote
    local,       // reads end in bounded time
    swapBacked,  // tmpfs: its pages leave memory only for swap
    deviceNodes, // devtmpfs: a tmpfs of device files, whose mappings need not be its pages
    hugePages,   // hugetlbfs
};
