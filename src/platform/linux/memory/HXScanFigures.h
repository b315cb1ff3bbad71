// The figures of a process's mappings, counted from its page tables.
#pragma once

#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/procfs/HXDescriptor.h"

#include <cstdint>

// Counts the resident and swapped pages of all mappings. False when that does not do: the kernel refuses,
// nothing is there at all, or the swapped bytes are not `swappedSize`, what it has counted itself. The
// figures are then not good for anything.
bool HXScanFigures(const HXDescriptor &process, uint32_t pageShift, uint64_t swappedSize,
                   HXAddressSpace *addressSpace);
