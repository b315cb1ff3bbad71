#include "platform/linux/memory/HXPageReader.h"

#include "platform/linux/memory/HXMappedFile.h"
#include "platform/linux/memory/HXSharedSwap.h"
#include "platform/linux/memory/HXTaskFiles.h"
#include "platform/linux/procfs/HXProcFile.h"

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

// The disposition (VM_PAGE_QUERY_… bits) of a page of `mapping`; takes it off `left`.
int32_t dispositionOf(const HXMapping &mapping, uint8_t facts, HXPagesLeft *left) {
    constexpr int32_t present = VM_PAGE_QUERY_PAGE_PRESENT;
    constexpr int32_t dirty = present | VM_PAGE_QUERY_PAGE_DIRTY;
    if (facts & HXPageRun::nothing) return 0;
    if (mapping.has(HXMappingHugePages)) return facts & HXPageRun::present ? dirty : 0;
    if (facts & HXPageRun::swapped) {
        // Marks without a page behind them look the same.
        if (left->swapped == 0) return 0;
        left->swapped--;
        return VM_PAGE_QUERY_PAGE_PAGED_OUT;
    }
    if (!(facts & HXPageRun::present)) return 0;
    if (facts & HXPageRun::file)
        return mapping.has(HXMappingSwapBacked) ? dirty : present | VM_PAGE_QUERY_PAGE_EXTERNAL;
    // What a driver maps is no memory of the process.
    if (mapping.anonymousPages == 0) return 0;
    if (left->lazyFree > 0) {
        left->lazyFree--;
        return present | VM_PAGE_QUERY_PAGE_REUSABLE;
    }
    return dirty;
}

} // namespace

kern_return_t HXPageReader::query(const HXAddressSpace &addressSpace, uint64_t address,
                                  std::span<int32_t> dispositions) {
    size_t index = addressSpace.find(address);
    while (!dispositions.empty()) {
        if (index == addressSpace.count() || !addressSpace[index].contains(address))
            return KERN_INVALID_ADDRESS;
        const HXMapping &mapping = addressSpace[index++];
        const uint64_t pages = std::min<uint64_t>((mapping.end - address) >> _pageShift, dispositions.size());
        const bool needsPagemap = !_pagemap && !isKernelHalf(address);
        kern_return_t error = needsPagemap ? openPagemap(addressSpace) : KERN_SUCCESS;
        if (error == KERN_SUCCESS) error = queryMapping(mapping, address, dispositions.first(pages));
        if (error != KERN_SUCCESS) return error;
        dispositions = dispositions.subspan(pages);
        address += pages << _pageShift;
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

kern_return_t HXPageReader::queryMapping(const HXMapping &mapping, uint64_t start,
                                         std::span<int32_t> dispositions) {
    std::fill(dispositions.begin(), dispositions.end(), 0);
    if (isKernelHalf(start)) return KERN_SUCCESS;
    kern_return_t error = countUpTo(mapping, start);
    if (error == KERN_SUCCESS) error = fill(mapping, start, dispositions);
    if (error != KERN_SUCCESS) return error;
    if (mapping.has(HXMappingSwapBacked) && _left.swapped > 0) findSwapped(mapping, start, dispositions);
    _nextAddress = start + (dispositions.size() << _pageShift);
    return KERN_SUCCESS;
}

kern_return_t HXPageReader::countUpTo(const HXMapping &mapping, uint64_t start) {
    const bool counts = mapping.lazyFreePages > 0 || mapping.swappedPages > 0;
    if (mapping.start != _mappingStart || (counts && start < _nextAddress)) {
        _mappingStart = _nextAddress = mapping.start;
        _left = {mapping.swappedPages, mapping.lazyFreePages};
        _swapFile.reset();
    }
    if (!counts) return KERN_SUCCESS;
    std::array<int32_t, 512> before; // on the stack: 2 KiB
    while (_nextAddress < start) {
        const uint64_t pages = std::min<uint64_t>((start - _nextAddress) >> _pageShift, before.size());
        const kern_return_t error = queryMapping(mapping, _nextAddress, std::span(before).first(pages));
        if (error != KERN_SUCCESS) return error;
    }
    return KERN_SUCCESS;
}

kern_return_t HXPageReader::fill(const HXMapping &mapping, uint64_t start, std::span<int32_t> dispositions) {
    const uint64_t end = start + (dispositions.size() << _pageShift);
    for (uint64_t at = start; at < end;) {
        if (at < _windowStart || at >= _windowEnd) {
            const kern_return_t error = readRuns(at, mapping.end);
            if (error != KERN_SUCCESS) return error;
        }
        const uint64_t limit = std::min(end, _windowEnd);
        auto run = std::partition_point(_runs.begin(), _runs.end(),
                                        [at](const HXPageRun &each) { return each.end <= at; });
        for (; run != _runs.end() && run->start < limit; ++run)
            for (at = std::max(at, run->start); at < std::min(run->end, limit);
                 at += uint64_t{1} << _pageShift)
                dispositions[(at - start) >> _pageShift] = dispositionOf(mapping, run->facts, &_left);
        at = limit;
    }
    return KERN_SUCCESS;
}

kern_return_t HXPageReader::readRuns(uint64_t start, uint64_t end) {
    _windowStart = _windowEnd = start;
    _runs.resize(HXPageScan::kMostRuns);
    const auto walk = HXPageScan::find(_pagemap, true, start, end, _runs);
    _runs.resize(walk ? walk->count : 0);
    if (!walk) return readEntries(start, end);
    _windowEnd = std::min(walk->end, end);
    // A process that is gone has no page tables left, which alone would look like memory that is not there.
    uint8_t first;
    const bool isGone = _runs.empty() && HXReadPageFacts(_pagemap, start >> _pageShift, {&first, 1}) == 0;
    return isGone ? KERN_INVALID_ARGUMENT : KERN_SUCCESS;
}

kern_return_t HXPageReader::readEntries(uint64_t start, uint64_t end) {
    std::array<uint8_t, 4096> facts; // on the stack: 4 KiB
    const uint64_t pages = std::min<uint64_t>((end - start) >> _pageShift, facts.size());
    const size_t count = HXReadPageFacts(_pagemap, start >> _pageShift, std::span(facts).first(pages));
    for (const uint8_t fact : std::span(facts).first(count)) {
        const uint64_t at = std::exchange(_windowEnd, _windowEnd + (uint64_t{1} << _pageShift));
        if ((fact & (HXPageRun::present | HXPageRun::swapped)) == 0) continue;
        if (!_runs.empty() && _runs.back().end == at && _runs.back().facts == fact)
            _runs.back().end = _windowEnd;
        else
            _runs.push_back({at, _windowEnd, fact});
    }
    return count == 0 ? KERN_INVALID_ARGUMENT : KERN_SUCCESS;
}

void HXPageReader::findSwapped(const HXMapping &mapping, uint64_t start, std::span<int32_t> dispositions) {
    if (!_swapFile) _swapFile = HXOpenMappedFile(_process, mapping);
    const uint64_t offset = mapping.offset + (start - mapping.start);
    _left.swapped -= HXMarkSwapped(_swapFile, offset >> _pageShift, _pageShift, _left.swapped, dispositions);
}
