// The figures of a process's mappings, counted from its page tables.
#pragma once

#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/procfs/HXDescriptor.h"

#include <cstdint>

// Counts the resident and swapped pages of all mappings, or of all but the private ones that the address
// space lacks by its own word. False when that does not do: the kernel refuses,
// nothing is there at all, or the swapped bytes are not `swappedSize`, what it has counted itself, as far as
// all are counted. The figures are then not good for anything.
bool HXScanFigures(const HXDescriptor &process, uint32_t pageShift, uint64_t swappedSize,
                   HXAddressSpace *addressSpace);
