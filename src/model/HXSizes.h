// How an amount of memory divides: that of a page run, a region, an object, a category or a whole report.
#pragma once

#include <cstdint>

// All in bytes.
struct HXSizes {
    uint64_t dirty = 0;
    uint64_t swapped = 0;     // compressed or swapped out
    uint64_t clean = 0;       // resident and droppable
    uint64_t reclaimable = 0; // purgeable, or freed lazily
    uint64_t wired = 0;       // of which may not be paged out

    // What counts toward a process's heft.
    uint64_t heft() const { return dirty + swapped; }
    HXSizes &operator+=(const HXSizes &other) {
        dirty += other.dirty;
        swapped += other.swapped;
        clean += other.clean;
        reclaimable += other.reclaimable;
        wired += other.wired;
        return *this;
    }
    bool operator==(const HXSizes &) const = default;
};
