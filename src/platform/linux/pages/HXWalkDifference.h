// Whether the mappings that were read and the process's own counters tell of the same amount of memory. They
// do not when memory moved while it was read, as mremap(2) moves it: from a place that was still to be read
// to one that had been, so that it is in no mapping, or the other way round, so that it is in two.
#pragma once

#include "platform/HXPlatform.h"
#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/procfs/HXProcText.h"

#include <cstdint>
#include <optional>

struct HXWalkTolerance {
    uint32_t pageShift;
    uint64_t counterErrorSize; // by how much the kernel's counters may be off
};

// None when they agree to within 1 % or 1 MiB and the error of the counters, which are `before` and `after`
// the reading and may have changed in between; also when the kernel does not tell them.
std::optional<HXWalkDifference> HXFindWalkDifference(const HXAddressSpace &addressSpace,
                                                     const HXStatusRecord &before,
                                                     const HXStatusRecord &after,
                                                     const HXWalkTolerance &tolerance);
