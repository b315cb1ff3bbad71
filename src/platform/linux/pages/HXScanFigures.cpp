#include "platform/linux/pages/HXScanFigures.h"

#include "platform/linux/memory/HXMappingClass.h"
#include "platform/linux/pages/HXPageScan.h"
#include "platform/linux/procfs/HXProcFile.h"

#include <algorithm>
#include <memory>
#include <span>

namespace {

// Whether only a page itself shows whose it is: a private mapping of a file holds the file's pages and its
// own, and a driver's mapping what is nobody's memory.
bool needsPages(const HXMapping &mapping) {
    if (!mapping.isFile()) return mapping.kind == HXPathKind::vdso || mapping.kind == HXPathKind::special;
    return !(mapping.has(HXMappingShared) && mapping.has(HXMappingSwapBacked));
}

// Walks the page tables of a process, stretch by stretch of its mappings, and counts what is there.
class Scanner {
  public:
    Scanner(const HXDescriptor &process, uint32_t pageShift, HXAddressSpace &addressSpace)
        : _pagemap(HXOpenAt(process, "pagemap")), _pageShift(pageShift), _addressSpace(addressSpace) {}

    bool scan();
    // A living process has pages; the page tables of one that has gone are empty.
    bool isGood(uint64_t swappedSize) const {
        if (_addressSpace.lacksPrivatePages) return true;
        return _foundAny && _swappedPages << _pageShift == swappedSize;
    }

  private:
    bool scanStretch(size_t first, size_t end);
    bool leaves(const HXMapping &mapping) const {
        return _addressSpace.lacksPrivatePages && HXMayShareAfterFork(mapping);
    }
    bool walk(size_t first, size_t end, bool tellsFiles);
    void add(const HXPageRun &run);
    void count(uint8_t facts, uint32_t pages, HXMapping &mapping);

    const HXDescriptor _pagemap;
    const uint32_t _pageShift;
    HXAddressSpace &_addressSpace;
    size_t _index = 0;
    uint64_t _swappedPages = 0;
    bool _foundAny = false;
};

bool Scanner::scan() {
    if (!_pagemap) return false;
    size_t count = _addressSpace.count();
    while (count > 0 && _addressSpace[count - 1].end >> 63 != 0)
        count--; // the gate page, which no page table of the process shows
    for (size_t i = 0, first = 0; i < count; first = i) {
        while (i < count && !leaves(_addressSpace[i]))
            i++;
        if (first < i && !scanStretch(first, i)) return false;
        while (i < count && leaves(_addressSpace[i]))
            i++;
    }
    return true;
}

// Neighbours that need the same go together. So does what does not need its pages looked at, yet lies between
// others that do and is so small that a request of its own would cost more than looking.
bool Scanner::scanStretch(size_t begin, size_t count) {
    constexpr uint64_t smallSize = 1 << 20; // 256 pages
    bool tellsFiles = true;
    for (size_t i = begin; i < count;) {
        const bool needs = needsPages(_addressSpace[i]);
        const size_t first = i;
        uint64_t size = 0;
        for (; i < count && needsPages(_addressSpace[i]) == needs; i++)
            size += _addressSpace[i].end - _addressSpace[i].start;
        const bool tellsNext = needs || size < smallSize;
        if (first > begin && tellsNext != tellsFiles) {
            if (!walk(begin, first, tellsFiles)) return false;
            begin = first;
        }
        tellsFiles = tellsNext;
    }
    return walk(begin, count, tellsFiles);
}

// From the mapping `first` to the one before `end`.
bool Scanner::walk(size_t first, size_t end, bool tellsFiles) {
    thread_local const auto memory = std::make_unique_for_overwrite<HXPageRun[]>(HXPageScan::kMostRuns);
    const std::span runs(memory.get(), HXPageScan::kMostRuns);
    const uint64_t endAddress = _addressSpace[end - 1].end;
    for (uint64_t start = _addressSpace[first].start; start < endAddress;) {
        const auto found = HXPageScan::find(_pagemap, tellsFiles, start, endAddress, runs);
        if (!found) return false;
        for (const HXPageRun &run : runs.first(found->count))
            add(run);
        start = found->end;
    }
    return true;
}

// Runs come in ascending order; one may reach over several mappings.
void Scanner::add(const HXPageRun &run) {
    while (_index < _addressSpace.count() && _addressSpace[_index].end <= run.start)
        _index++;
    for (size_t i = _index; i < _addressSpace.count() && _addressSpace[i].start < run.end; i++) {
        HXMapping &mapping = _addressSpace[i];
        const uint64_t size = std::min(run.end, mapping.end) - std::max(run.start, mapping.start);
        count(run.facts, static_cast<uint32_t>(size >> _pageShift), mapping);
    }
}

void Scanner::count(uint8_t facts, uint32_t pages, HXMapping &mapping) {
    _foundAny = true;
    if (facts & HXPageRun::nothing) return;
    const bool isFile = needsPages(mapping) ? (facts & HXPageRun::file) != 0 : mapping.isFile();
    // Memory of the process's own is in private mappings only; what else has no file is a driver's.
    if (!isFile && mapping.has(HXMappingShared)) return;
    if (facts & HXPageRun::swapped) {
        if (isFile) return; // on its way from one place to another
        mapping.swappedPages += pages;
        _swappedPages += pages;
        return;
    }
    mapping.residentPages += pages;
    if (!isFile) mapping.anonymousPages += pages;
}

} // namespace

bool HXScanFigures(const HXDescriptor &process, uint32_t pageShift, uint64_t swappedSize,
                   HXAddressSpace *addressSpace) {
    Scanner scanner(process, pageShift, *addressSpace);
    return scanner.scan() && scanner.isGood(swappedSize);
}
