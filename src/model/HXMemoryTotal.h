#pragma once

#include <cstdint>

// Size totals: of one page run, of a range list or of a category map. Zeroed before it is filled.
struct HXMemoryTotal {
    uint64_t dirty = 0;       // bytes, like all sizes here
    uint64_t swapped = 0;     // compressed or swapped out
    uint64_t clean = 0;       // resident and droppable
    uint64_t reclaimable = 0; // purgeable, or freed lazily
    uint64_t wired = 0;       // of which may not be paged out
    uint32_t regionCount = 0;

    bool operator==(const HXMemoryTotal &) const = default;
};
