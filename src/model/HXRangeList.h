// The page runs of one VM object, merged where they share pages, so that memory mapped twice counts once.
#pragma once

#include "model/HXMemoryTotal.h"

#include <cstdint>
#include <map>

class HXMemoryRegion;

// A run of bytes of a VM object. Machine words: 64 bits wide.
struct HXRange {
    uint64_t location = 0; // first byte
    uint64_t length = 0;   // bytes

    uint64_t end() const { return location + length; }
    bool operator==(const HXRange &) const = default;
};

// One merged run with the amounts counted for it.
struct HXRangeListNode : HXRange, HXSizes {
    bool operator==(const HXRangeListNode &) const = default;
};

// Invariant: runs ascend by location, and between two neighbours there is at least one page that neither
// touches: the first one's end, rounded up to a page, lies strictly below the second one's start, rounded
// down.
//
// Kept in a tree by location: adding a run costs the logarithm of the number of runs, plus the runs it
// absorbs.
class HXRangeList {
  public:
    using Nodes = std::map<uint64_t, HXRangeListNode>;

    // Adds a run with its amounts. `pageSize` is a power of two.
    void addRange(HXRange range, uint32_t pageSize, const HXSizes &sizes) {
        insert({range, sizes}, pageSize);
    }

    // Adds each run of `other`, in order.
    void _addRangeList(const HXRangeList &other, uint32_t pageSize);

    // Adds a region's page runs where it has them, else the whole region as one run from its offset on.
    void addRegion(const HXMemoryRegion &region, uint32_t pageSize);

    // The amounts of all runs; the region count is 0.
    HXMemoryTotal sum() const;

    // The runs by location, in ascending order.
    const Nodes &nodes() const { return _nodes; }

  private:
    void insert(HXRangeListNode run, uint32_t pageSize);

    Nodes _nodes;
};
