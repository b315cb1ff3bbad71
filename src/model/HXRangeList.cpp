#include "model/HXRangeList.h"

#include "model/HXMemoryRegion.h"

#include <algorithm>
#include <iterator>

namespace {

// A run's pages: [start, end), rounded outwards. An end beyond the last page of the 64-bit space is that
// page's start.
struct PageExtent {
    uint64_t start;
    uint64_t end;
};

PageExtent pageExtent(const HXRange &range, uint32_t pageSize) {
    const uint64_t mask = ~(uint64_t{pageSize} - 1);
    uint64_t end = 0;
    if (__builtin_add_overflow(range.location, range.length, &end) ||
        __builtin_add_overflow(end, pageSize - 1, &end))
        end = UINT64_MAX;
    return {range.location & mask, end & mask};
}

uint64_t overlapOf(const PageExtent &a, const PageExtent &b) {
    const uint64_t start = std::max(a.start, b.start);
    const uint64_t end = std::min(a.end, b.end);
    return start < end ? end - start : 0;
}

// Two amounts of runs with `overlap` bytes of pages in common: pages of both count once, as far as the
// overlap allows, and no part loses what it had.
uint64_t merged(uint64_t a, uint64_t b, uint64_t overlap) {
    const uint64_t together = a + b;
    return std::max({a, b, together > overlap ? together - overlap : 0});
}

void absorb(HXRangeListNode &run, const HXRangeListNode &other, uint64_t overlap) {
    run.dirty = merged(run.dirty, other.dirty, overlap);
    run.swapped = merged(run.swapped, other.swapped, overlap);
    run.clean = merged(run.clean, other.clean, overlap);
    run.reclaimable = merged(run.reclaimable, other.reclaimable, overlap);
    run.wired = merged(run.wired, other.wired, overlap);
    const uint64_t end = std::max(run.end(), other.end());
    run.location = std::min(run.location, other.location);
    run.length = end - run.location;
}

} // namespace

void HXRangeList::_addRangeList(const HXRangeList &other, uint32_t pageSize) {
    for (const auto &[location, node] : other._nodes)
        insert(node, pageSize);
}

void HXRangeList::addRegion(const HXMemoryRegion &region, uint32_t pageSize) {
    if (const HXRangeList *runs = region.subrangeList()) return _addRangeList(*runs, pageSize);
    addRange({region.offset(), region.size()}, pageSize, region.sizes());
}

void HXRangeList::insert(HXRangeListNode run, uint32_t pageSize) {
    const PageExtent added = pageExtent(run, pageSize);
    const auto extentOf = [&](const HXRangeListNode &node) { return pageExtent(node, pageSize); };

    // The first run that overlaps or touches the new one. Runs ascend, so those that end before it come
    // first.
    auto first = _nodes.upper_bound(run.location);
    while (first != _nodes.begin() && extentOf(std::prev(first)->second).end >= added.start)
        --first;
    auto next = first;
    while (next != _nodes.end() && extentOf(next->second).start <= added.end) {
        // Always measured against the run that is added, not against what it has absorbed so far.
        absorb(run, next->second, overlapOf(added, extentOf(next->second)));
        ++next;
    }
    if (first != next && std::next(first) == next && first->first == run.location) {
        first->second = run;
        return;
    }
    next = _nodes.erase(first, next);
    _nodes.emplace_hint(next, run.location, run);
}

HXMemoryTotal HXRangeList::sum() const {
    HXMemoryTotal total;
    for (const auto &[location, node] : _nodes)
        total.HXSizes::operator+=(node);
    return total;
}
