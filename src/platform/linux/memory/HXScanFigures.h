// The figures of a process's mappings, counted from its page tables.
#pragma once

#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/memory/HXPageScan.h"

#include <cstdint>
#include <functional>
#include <optional>
#include <span>

// What HXPageScan::find answers of one process.
using HXFindRuns = std::function<std::optional<HXPageScan::Walk>(bool tellsFiles, uint64_t start,
                                                                 uint64_t end, std::span<HXPageRun> runs)>;

// Counts the resident and swapped pages of all mappings. False when that does not do: a walk fails, nothing
// is there at all, or the swapped bytes are not `swappedSize`, what the kernel has counted. The figures are
// then not good for anything.
bool HXCountRuns(const HXFindRuns &findRuns, uint32_t pageShift, uint64_t swappedSize,
                 HXAddressSpace *addressSpace);
// The same by the process's page tables.
bool HXScanFigures(const HXDescriptor &process, uint32_t pageShift, uint64_t swappedSize,
                   HXAddressSpace *addressSpace);
