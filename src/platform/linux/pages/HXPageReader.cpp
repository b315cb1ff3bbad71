#include "platform/linux/pages/HXPageReader.h"

#include "platform/HXPlatform.h"
#include "platform/linux/memory/HXMappedFile.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXTaskFiles.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

namespace {

bool isKernelHalf(uint64_t address) {
    return address >> 63 != 0; // the gate page, which the page tables of the process do not show
}

// Whether the process executed another program since its mappings were read: its stack then begins elsewhere.
bool isReplaced(const HXAddressSpace &addressSpace, const HXDescriptor &process) {
    const auto stat = HXReadStat(process);
    if (!stat || stat->startStack == 0) return false;
    for (size_t i = addressSpace.count(); i-- > 0;) {
        const HXMapping &mapping = addressSpace[i];
        // The kernel gives this name to the mapping where the stack began, be it at its very end.
        if (mapping.kind == HXPathKind::stack)
            return stat->startStack < mapping.start || stat->startStack > mapping.end;
    }
    return false;
}

// The disposition (VM_PAGE_QUERY_… bits) of *pages pages of `mapping` that look alike, or of the first of
// them, then fewer; takes them off `left`.
int32_t dispositionOf(const HXMapping &mapping, uint8_t facts, HXPagesLeft *left, uint64_t *pages) {
    constexpr int32_t present = VM_PAGE_QUERY_PAGE_PRESENT;
    constexpr int32_t dirty = present | VM_PAGE_QUERY_PAGE_DIRTY;
    const auto takeOff = [pages](uint64_t *count) {
        *pages = std::min(*pages, *count);
        *count -= *pages;
    };
    if (facts & HXPageRun::nothing) return 0;
    if (mapping.has(HXMappingHugePages)) return facts & HXPageRun::present ? dirty : 0;
    if (facts & HXPageRun::swapped) {
        // Marks without a page behind them look the same.
        if (left->swapped.pagesLeft == 0) return 0;
        takeOff(&left->swapped.pagesLeft);
        return VM_PAGE_QUERY_PAGE_PAGED_OUT;
    }
    if (!(facts & HXPageRun::present)) return 0;
    if (facts & HXPageRun::file)
        return mapping.has(HXMappingSwapBacked) ? dirty : present | VM_PAGE_QUERY_PAGE_EXTERNAL;
    // What a driver maps is no memory of the process.
    if (mapping.anonymousPages == 0) return 0;
    if (left->lazyFree > 0) {
        takeOff(&left->lazyFree);
        return present | VM_PAGE_QUERY_PAGE_REUSABLE;
    }
    return dirty;
}

// Runs that are enough for one answer: some 400 KiB.
constexpr size_t kManyRuns = 16384;

// Adds a run to an answer.
void addRun(uint64_t start, uint64_t end, int32_t disposition, uint32_t pageShift,
            std::vector<vm_page_run> *runs) {
    if (start < end) runs->push_back({start, (end - start) >> pageShift, disposition});
}

// Adds pages to an answer, of them those that a lower mapping is charged for as what they are here: not
// charged, and where they are swapped out, nothing.
void addPages(const HXAddressSpace &addressSpace, const HXFoundPages &pages, uint32_t pageShift,
              std::vector<vm_page_run> *runs) {
    const auto &repeated = addressSpace.repeated;
    uint64_t start = pages.start;
    if (pages.areObjects) {
        auto each = std::partition_point(repeated.begin(), repeated.end(),
                                         [start](const auto &range) { return range.end <= start; });
        for (; each != repeated.end() && each->start < pages.end; ++each) {
            const uint64_t first = std::max(start, each->start);
            addRun(start, first, pages.disposition, pageShift, runs);
            start = std::min(each->end, pages.end);
            if (pages.disposition & VM_PAGE_QUERY_PAGE_PRESENT)
                addRun(first, start, VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL, pageShift,
                       runs);
        }
    }
    addRun(start, pages.end, pages.disposition, pageShift, runs);
}

} // namespace

// The first address, not before `address`, where an answer from `origin` on may end.
uint64_t HXPageReader::borderBehind(uint64_t address, uint64_t origin) const {
    const uint64_t step = HXPlatform::kPageQueryPages << _pageShift;
    return origin + (address - origin + step - 1) / step * step;
}

kern_return_t HXPageReader::query(const HXAddressSpace &addressSpace, uint64_t address,
                                  std::vector<vm_page_run> *runs, uint64_t *pages) {
    runs->clear();
    uint64_t end = address + (*pages << _pageShift);
    uint64_t at = address;
    kern_return_t error = KERN_SUCCESS;
    for (size_t index = addressSpace.find(address); at < end; index++) {
        if (index == addressSpace.count() || !addressSpace[index].contains(at)) {
            error = KERN_INVALID_ADDRESS;
            break;
        }
        const HXMapping &mapping = addressSpace[index];
        uint64_t foundEnd = std::min(mapping.end, end);
        error = findPages(addressSpace, mapping, at, address, &foundEnd);
        if (error != KERN_SUCCESS) break;
        for (const HXFoundPages &found : _found)
            addPages(addressSpace, found, _pageShift, runs);
        at = foundEnd;
        if (foundEnd < mapping.end) break;
        if (runs->size() >= kManyRuns) end = std::min(end, borderBehind(at, address));
    }
    if (error != KERN_SUCCESS) {
        // What could be told stands, as far as whole steps go.
        const uint64_t step = HXPlatform::kPageQueryPages << _pageShift;
        at = address + (at - address) / step * step;
        if (at == address) return error;
        HXCutRuns(at, uint64_t{1} << _pageShift, runs);
    }
    *pages = (at - address) >> _pageShift;
    return KERN_SUCCESS;
}

kern_return_t HXPageReader::findAll(const HXAddressSpace &addressSpace, const HXMapping &mapping,
                                    const std::function<void(const HXFoundPages &)> &each) {
    for (uint64_t start = mapping.start, end = 0; start < mapping.end; start = end) {
        end = mapping.end;
        const kern_return_t error = findPages(addressSpace, mapping, start, mapping.start, &end);
        if (error != KERN_SUCCESS) return error;
        for (const HXFoundPages &found : _found)
            each(found);
    }
    return KERN_SUCCESS;
}

kern_return_t HXPageReader::openPagemap(const HXAddressSpace &addressSpace) {
    _pagemap = HXOpenAt(_process, "pagemap");
    if (!_pagemap) return errno == EACCES || errno == EPERM ? KERN_NO_ACCESS : KERN_INVALID_ARGUMENT;
    if (!isReplaced(addressSpace, _process)) return KERN_SUCCESS;
    _pagemap.reset();
    return KERN_INVALID_ARGUMENT;
}

// Finds the pages of [start, *end), which lies in the mapping. Where they are many, *end becomes a border
// nearer to the start, where an answer from `origin` on may end.
kern_return_t HXPageReader::findPages(const HXAddressSpace &addressSpace, const HXMapping &mapping,
                                      uint64_t start, uint64_t origin, uint64_t *end) {
    _found.clear();
    if (isKernelHalf(start)) return KERN_SUCCESS;
    kern_return_t error = _pagemap ? KERN_SUCCESS : openPagemap(addressSpace);
    if (error == KERN_SUCCESS) error = countUpTo(mapping, start);
    if (error == KERN_SUCCESS) error = fill(mapping, start, origin, end);
    return error;
}

// Goes through the pages of a mapping that lie before what is asked for, where these count.
kern_return_t HXPageReader::countUpTo(const HXMapping &mapping, uint64_t start) {
    constexpr uint32_t mostSwapCalls = 1 << 18; // some 200 ms for pages that are swapped here and there
    const bool counts = mapping.lazyFreePages > 0 || mapping.swappedPages > 0;
    if (mapping.start != _mappingStart || (counts && start < _nextAddress)) {
        _mappingStart = _nextAddress = mapping.start;
        _left = {{mapping.swappedPages, mostSwapCalls}, mapping.lazyFreePages};
        _swapFile.reset();
    }
    while (counts && _nextAddress < start) {
        uint64_t end = start;
        const kern_return_t error = fill(mapping, _nextAddress, mapping.start, &end);
        if (error != KERN_SUCCESS) return error;
    }
    return KERN_SUCCESS;
}

kern_return_t HXPageReader::fill(const HXMapping &mapping, uint64_t start, uint64_t origin, uint64_t *end) {
    _found.clear();
    for (uint64_t at = start; at < *end;) {
        if (at < _windowStart || at >= _windowEnd) {
            const kern_return_t error = readRuns(mapping, at);
            if (error != KERN_SUCCESS) return error;
        }
        const uint64_t limit = std::min(*end, _windowEnd);
        take(mapping, at, limit);
        at = limit;
        if (_found.size() >= kManyRuns) *end = std::min(*end, borderBehind(at, origin));
    }
    _nextAddress = *end;
    return KERN_SUCCESS;
}

// Takes what the window tells of [start, end), which lies in it.
void HXPageReader::take(const HXMapping &mapping, uint64_t start, uint64_t end) {
    auto run = std::partition_point(_runs.begin(), _runs.end(),
                                    [start](const HXPageRun &each) { return each.end <= start; });
    for (; run != _runs.end() && run->start < end; ++run) {
        const uint64_t runStart = std::max(start, run->start);
        takeHole(mapping, start, runStart);
        start = std::min(end, run->end);
        takeRun(mapping, runStart, start, run->facts);
    }
    takeHole(mapping, start, end);
}

void HXPageReader::takeRun(const HXMapping &mapping, uint64_t start, uint64_t end, uint8_t facts) {
    while (start < end) {
        uint64_t pages = (end - start) >> _pageShift;
        const int32_t disposition = dispositionOf(mapping, facts, &_left, &pages);
        const uint64_t next = start + (pages << _pageShift);
        if (disposition != 0) _found.push_back({start, next, disposition, (facts & HXPageRun::file) != 0});
        start = next;
    }
}

// Pages of shared memory that are swapped out have no entries in page tables.
void HXPageReader::takeHole(const HXMapping &mapping, uint64_t start, uint64_t end) {
    if (start == end || !mapping.has(HXMappingSwapBacked) || _left.swapped.pagesLeft == 0) return;
    if (!_swapFile && _left.swapped.callsLeft > 0) _swapFile = HXOpenMappedFile(_process, mapping);
    const uint64_t first = (mapping.offset + (start - mapping.start)) >> _pageShift;
    for (const HXPageSpan &span :
         HXFindSwapped(_swapFile, _pageShift, {first, (end - start) >> _pageShift}, &_left.swapped)) {
        const uint64_t at = start + ((span.first - first) << _pageShift);
        _found.push_back({at, at + (span.count << _pageShift), VM_PAGE_QUERY_PAGE_PAGED_OUT, true});
    }
}

// Reads a window of the mapping from `start` on.
kern_return_t HXPageReader::readRuns(const HXMapping &mapping, uint64_t start) {
    const bool goesOn = start == _windowEnd && start != mapping.start;
    _windowStart = _windowEnd = start;
    _runs.resize(HXPageScan::kMostRuns);
    const auto walk = HXPageScan::find(_pagemap, true, start, mapping.end, _runs);
    _runs.resize(walk ? walk->count : 0);
    if (!walk) {
        // Those of shared memory that are swapped out have no entry.
        const uint32_t swapped = mapping.has(HXMappingShared) ? 0 : mapping.swappedPages;
        if (!goesOn) _unseenPages = uint64_t{mapping.residentPages} + mapping.hugePages + swapped;
        return readEntries(mapping, start);
    }
    _windowEnd = std::min(walk->end, mapping.end);
    // A process that is gone has no page tables left, which alone would look like memory that is not there.
    uint8_t first;
    const bool isGone = _runs.empty() && HXReadPageFacts(_pagemap, start >> _pageShift, {&first, 1}) == 0;
    return isGone ? KERN_INVALID_ARGUMENT : KERN_SUCCESS;
}

kern_return_t HXPageReader::readEntries(const HXMapping &mapping, uint64_t start) {
    std::array<uint8_t, 4096> facts; // on the stack: 4 KiB
    // Nobody would go through terabytes of nothing; one entry tells that the process is still there.
    const bool sawAll = _unseenPages == 0;
    const uint64_t most = sawAll ? 1 : facts.size();
    const uint64_t pages = std::min<uint64_t>((mapping.end - start) >> _pageShift, most);
    const size_t count = HXReadPageFacts(_pagemap, start >> _pageShift, std::span(facts).first(pages));
    if (count == 0) return KERN_INVALID_ARGUMENT;
    if (sawAll) {
        _windowEnd = mapping.end;
        return KERN_SUCCESS;
    }
    for (const uint8_t fact : std::span(facts).first(count)) {
        const uint64_t at = std::exchange(_windowEnd, _windowEnd + (uint64_t{1} << _pageShift));
        if ((fact & (HXPageRun::present | HXPageRun::swapped)) == 0) continue;
        if (_unseenPages > 0) _unseenPages--;
        if (!_runs.empty() && _runs.back().end == at && _runs.back().facts == fact)
            _runs.back().end = _windowEnd;
        else
            _runs.push_back({at, _windowEnd, fact});
    }
    return KERN_SUCCESS;
}
