// Which pages of shared memory are swapped out: no page table shows it.
#pragma once

#include "platform/linux/procfs/HXDescriptor.h"

#include <cstdint>
#include <functional>
#include <optional>
#include <span>

// How many of `count` pages from page `first` of the object on are swapped out; none when the kernel does not
// tell.
using HXCountSwapped = std::function<std::optional<uint64_t>(uint64_t first, uint64_t count)>;

// Marks, among the dispositions of the pages from page `first` of the object on, at most `limit` pages that
// are not there as paged out: those that are swapped out, or, where that cannot be told, the first ones.
// Answers how many.
uint64_t HXMarkSwapped(const HXDescriptor &file, uint64_t first, uint32_t pageShift, uint64_t limit,
                       std::span<int32_t> dispositions);
uint64_t HXMarkSwapped(const HXCountSwapped &countSwapped, uint64_t first, uint64_t limit,
                       std::span<int32_t> dispositions);
