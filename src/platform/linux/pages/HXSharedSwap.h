// Which pages of shared memory are swapped out: no page table shows it.
#pragma once

#include "platform/linux/procfs/HXDescriptor.h"

#include <cstdint>
#include <functional>
#include <optional>
#include <vector>

// Pages of an object, by their numbers.
struct HXPageSpan {
    uint64_t first;
    uint64_t count;

    bool operator==(const HXPageSpan &) const = default;
};

// How many pages of `span` are swapped out; none when the kernel does not tell.
using HXCountSwapped = std::function<std::optional<uint64_t>(const HXPageSpan &span)>;

// Bytes of a whole file in memory that are swapped out; none when the kernel does not tell.
std::optional<uint64_t> HXSwappedSize(const HXDescriptor &file);

// How far a search goes on.
struct HXSwapSearch {
    uint64_t pagesLeft = 0; // to be found
    uint32_t callsLeft = 0; // of the kernel
};

// The pages of `span`, of which none is resident in the process, that are swapped out, at most as many as are
// left; or, where that cannot be told, the first ones.
std::vector<HXPageSpan> HXFindSwapped(const HXDescriptor &file, uint32_t pageShift, const HXPageSpan &span,
                                      HXSwapSearch *search);
std::vector<HXPageSpan> HXFindSwapped(const HXCountSwapped &countSwapped, const HXPageSpan &span,
                                      HXSwapSearch *search);
