#include "platform/linux/pages/HXRepeatedPages.h"

#include <algorithm>
#include <iterator>
#include <map>
#include <tuple>
#include <utility>

namespace {

// Bytes of one object that have been met: ranges that neither overlap nor touch.
class Offsets {
  public:
    // Adds [start, end) and calls `each` for the parts of it that were there already.
    template <typename Each>
    void add(uint64_t start, uint64_t end, Each each) {
        uint64_t joinedStart = start, joinedEnd = end;
        auto next = _ends.upper_bound(start);
        if (next != _ends.begin() && std::prev(next)->second >= start) --next;
        while (next != _ends.end() && next->first <= end) {
            const uint64_t from = std::max(start, next->first), to = std::min(end, next->second);
            if (from < to) each(from, to);
            joinedStart = std::min(joinedStart, next->first);
            joinedEnd = std::max(joinedEnd, next->second);
            next = _ends.erase(next);
        }
        _ends.emplace_hint(next, joinedStart, joinedEnd);
    }

  private:
    std::map<uint64_t, uint64_t> _ends; // by start
};

bool mayRepeat(const HXMapping &mapping) {
    return mapping.isFile() && mapping.has(HXMappingSwapBacked | HXMappingHugePages) &&
           (mapping.residentPages | mapping.hugePages | mapping.swappedPages) != 0;
}

// Equal for mappings of one object. The number of System V memory may be that of other memory, too.
auto objectOf(const HXMapping &mapping) {
    return std::tuple(mapping.device, mapping.inode, mapping.kind == HXPathKind::systemV);
}

class Finder {
  public:
    Finder(uint32_t pageShift, HXPageReader &pages, HXAddressSpace &addressSpace)
        : _pageShift(pageShift), _pages(pages), _addressSpace(addressSpace) {}

    void find();

  private:
    using Indexes = std::vector<size_t>;

    void forget();
    bool findAmong(Indexes group);
    void add(HXMapping &mapping, const HXFoundPages &found, Offsets &known);

    const uint32_t _pageShift;
    HXPageReader &_pages;
    HXAddressSpace &_addressSpace;
};

// What has been found so far.
void Finder::forget() {
    if (_addressSpace.repeated.empty()) return;
    for (size_t i = 0; i < _addressSpace.count(); i++)
        if (mayRepeat(_addressSpace[i]))
            _addressSpace[i].repeatedPages = _addressSpace[i].repeatedSwappedPages = 0;
    _addressSpace.repeated.clear();
}

// Goes through the mappings by object and offset, in groups that overlap.
void Finder::find() {
    forget(); // of a run that had too few descriptors
    Indexes all;
    for (size_t i = 0; i < _addressSpace.count(); i++)
        if (mayRepeat(_addressSpace[i])) all.push_back(i);
    const auto placeOf = [this](size_t index) {
        return std::pair(objectOf(_addressSpace[index]), _addressSpace[index].offset);
    };
    std::sort(all.begin(), all.end(), [&](size_t a, size_t b) { return placeOf(a) < placeOf(b); });
    for (size_t first = 0, next = 0; first < all.size(); first = next) {
        const auto object = objectOf(_addressSpace[all[first]]);
        uint64_t end = 0;
        for (; next < all.size(); next++) {
            const HXMapping &mapping = _addressSpace[all[next]];
            if (next > first && (objectOf(mapping) != object || mapping.offset >= end)) break;
            end = std::max(end, mapping.offset + (mapping.end - mapping.start));
        }
        if (next - first > 1 && !findAmong(Indexes(all.begin() + static_cast<std::ptrdiff_t>(first),
                                                   all.begin() + static_cast<std::ptrdiff_t>(next))))
            return;
    }
    std::sort(_addressSpace.repeated.begin(), _addressSpace.repeated.end(),
              [](const HXAddressRange &a, const HXAddressRange &b) { return a.start < b.start; });
}

// False when the process is gone: nothing is repeated then.
bool Finder::findAmong(Indexes group) {
    std::sort(group.begin(), group.end()); // by address
    Offsets known;
    for (const size_t index : group) {
        HXMapping &mapping = _addressSpace[index];
        const kern_return_t error = _pages.findAll(
            _addressSpace, mapping, [&](const HXFoundPages &found) { add(mapping, found, known); });
        if (error == KERN_SUCCESS) continue;
        forget();
        return false;
    }
    return true;
}

void Finder::add(HXMapping &mapping, const HXFoundPages &found, Offsets &known) {
    if (!found.areObjects) return;
    const uint64_t shift = mapping.start - mapping.offset; // from offset to address
    known.add(found.start - shift, found.end - shift, [&](uint64_t from, uint64_t to) {
        const auto pages = static_cast<uint32_t>((to - from) >> _pageShift);
        const bool isSwapped = (found.disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT) != 0;
        (isSwapped ? mapping.repeatedSwappedPages : mapping.repeatedPages) += pages;
        _addressSpace.repeated.push_back({from + shift, to + shift});
    });
}

} // namespace

void HXFindRepeatedPages(uint32_t pageShift, HXPageReader *pages, HXAddressSpace *addressSpace) {
    Finder(pageShift, *pages, *addressSpace).find();
}
