#include "platform/linux/memory/HXPageReader.h"

#include "platform/linux/memory/HXMappedFile.h"
#include "platform/linux/memory/HXSharedSwap.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXProcText.h"

#include <algorithm>
#include <array>
#include <cerrno>

namespace {

// Bits of an entry of pagemap.
constexpr uint64_t entryPresent = uint64_t{1} << 63;
constexpr uint64_t entrySwapped = uint64_t{1} << 62;
constexpr uint64_t entryFile = uint64_t{1} << 61;
constexpr uint64_t entryGuard = uint64_t{1} << 58;

uint8_t factsOfEntry(uint64_t entry) {
    uint8_t facts = 0;
    if (entry & entryPresent) facts |= HXPageRun::present;
    if (entry & entryFile) facts |= HXPageRun::file;
    if (entry & entrySwapped) facts |= HXPageRun::swapped;
    if (entry & entryGuard) facts |= HXPageRun::nothing;
    return facts;
}

bool isKernelHalf(uint64_t address) {
    return address >> 63 != 0; // the gate page, which the page tables of the process do not show
}

// Whether the process executed another program since its mappings were read: its stack then begins elsewhere.
bool isReplaced(const HXAddressSpace &addressSpace, int directory) {
    char buffer[2048];
    const auto text = HXReadOnce(directory, "stat", buffer);
    const auto stat = text ? HXParseStat(*text) : std::nullopt;
    if (!stat || stat->startStack == 0) return false;
    for (size_t i = addressSpace.count(); i-- > 0;) {
        const HXMapping &mapping = addressSpace[i];
        // The kernel gives this name to the mapping where the stack began, be it at its very end.
        if (mapping.kind == static_cast<uint8_t>(HXPathKind::stack))
            return stat->startStack < mapping.start || stat->startStack > mapping.end;
    }
    return false;
}

} // namespace

int32_t HXPageDisposition(const HXMapping &mapping, uint8_t facts, HXPagesLeft *left) {
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

kern_return_t HXPageReader::query(const HXAddressSpace &addressSpace, uint64_t address,
                                  std::span<int32_t> dispositions) {
    size_t index = addressSpace.find(address);
    while (!dispositions.empty()) {
        if (index == addressSpace.count() || !addressSpace[index].contains(address))
            return KERN_INVALID_ADDRESS;
        const HXMapping &mapping = addressSpace[index++];
        const uint64_t pages = std::min<uint64_t>((mapping.end - address) >> _pageShift, dispositions.size());
        kern_return_t error = KERN_SUCCESS;
        if (!_pagemap && !isKernelHalf(address)) error = openPagemap(addressSpace);
        if (error == KERN_SUCCESS) error = queryMapping(mapping, address, dispositions.first(pages));
        if (error != KERN_SUCCESS) return error;
        dispositions = dispositions.subspan(pages);
        address += pages << _pageShift;
    }
    return KERN_SUCCESS;
}

void HXPageReader::reset() {
    _pagemap.reset();
    _swapFile.reset();
    _runs.clear();
    _run = 0;
    _windowStart = _windowEnd = 0;
    _mappingStart = UINT64_MAX;
}

kern_return_t HXPageReader::openPagemap(const HXAddressSpace &addressSpace) {
    _pagemap = HXOpenAt(_directory, "pagemap");
    if (!_pagemap) return errno == EACCES || errno == EPERM ? KERN_NO_ACCESS : KERN_INVALID_ARGUMENT;
    if (!isReplaced(addressSpace, _directory)) return KERN_SUCCESS;
    _pagemap.reset();
    return KERN_INVALID_ARGUMENT;
}

kern_return_t HXPageReader::queryMapping(const HXMapping &mapping, uint64_t start,
                                         std::span<int32_t> dispositions) {
    std::fill(dispositions.begin(), dispositions.end(), 0);
    if (isKernelHalf(start)) return KERN_SUCCESS;
    if (mapping.start != _mappingStart || start == mapping.start) {
        _mappingStart = _nextAddress = mapping.start;
        _left = {mapping.swappedPages, mapping.lazyFreePages};
        _swapFile.reset();
    }
    const bool counts = mapping.lazyFreePages > 0 || mapping.swappedPages > 0;
    if (counts && start != _nextAddress) {
        // Asked out of order: count what lies before.
        std::array<int32_t, 512> before;
        if (start < _nextAddress) _mappingStart = UINT64_MAX;
        for (uint64_t at = start < _nextAddress ? mapping.start : _nextAddress; at < start;) {
            const uint64_t pages = std::min<uint64_t>((start - at) >> _pageShift, before.size());
            const kern_return_t error = queryMapping(mapping, at, std::span(before).first(pages));
            if (error != KERN_SUCCESS) return error;
            at += pages << _pageShift;
        }
    }
    const auto isBefore = [start](const HXPageRun &run) { return run.end <= start; };
    _run = static_cast<size_t>(std::partition_point(_runs.begin(), _runs.end(), isBefore) - _runs.begin());
    const uint64_t end = start + (dispositions.size() << _pageShift);
    for (uint64_t at = start; at < end;) {
        if (at < _windowStart || at >= _windowEnd) {
            const kern_return_t error = readRuns(at, mapping.end);
            if (error != KERN_SUCCESS) return error;
        }
        while (_run < _runs.size() && _runs[_run].end <= at)
            _run++;
        const uint64_t limit = std::min(end, _windowEnd);
        for (; at < limit && _run < _runs.size() && _runs[_run].start < limit; _run++) {
            const HXPageRun &run = _runs[_run];
            const uint64_t runEnd = std::min(run.end, limit);
            for (at = std::max(at, run.start); at < runEnd; at += uint64_t{1} << _pageShift)
                dispositions[(at - start) >> _pageShift] = HXPageDisposition(mapping, run.facts, &_left);
            if (runEnd < run.end) break;
        }
        at = limit;
    }
    if (mapping.has(HXMappingSwapBacked) && _left.swapped > 0) findSwapped(mapping, start, dispositions);
    _nextAddress = end;
    return KERN_SUCCESS;
}

kern_return_t HXPageReader::readRuns(uint64_t start, uint64_t end) {
    _runs.clear();
    _run = 0;
    _windowStart = start;
    _windowEnd = start;
    if (_mayScan && scan(start, end))
        return _runs.empty() && isGone(start) ? KERN_INVALID_ARGUMENT : KERN_SUCCESS;
    return readEntries(start, end);
}

bool HXPageReader::scan(uint64_t start, uint64_t end) {
    constexpr size_t window = 1024;
    if (!HXPageScan::isSupported()) return false;
    _runs.resize(window);
    uint64_t walkEnd = start;
    const int count = HXPageScan::find(_pagemap.get(), true, start, end, _runs, &walkEnd);
    _runs.resize(static_cast<size_t>(std::max(count, 0)));
    if (count < 0 || walkEnd <= start) return false;
    _windowEnd = std::min(walkEnd, end);
    return true;
}

kern_return_t HXPageReader::readEntries(uint64_t start, uint64_t end) {
    thread_local std::array<uint64_t, 4096> entries;
    const uint64_t pages = std::min<uint64_t>((end - start) >> _pageShift, entries.size());
    const auto position = static_cast<off_t>((start >> _pageShift) * sizeof entries[0]);
    const ssize_t got = ::pread(_pagemap.get(), entries.data(), pages * sizeof entries[0], position);
    const uint64_t count = got < 0 ? 0 : static_cast<uint64_t>(got) / sizeof entries[0];
    if (count == 0) return KERN_INVALID_ARGUMENT;
    uint64_t at = start;
    for (uint64_t i = 0; i < count; i++, at += uint64_t{1} << _pageShift) {
        const uint8_t facts = factsOfEntry(entries[i]);
        if ((facts & (HXPageRun::present | HXPageRun::swapped)) == 0) continue;
        if (!_runs.empty() && _runs.back().end == at && _runs.back().facts == facts)
            _runs.back().end += uint64_t{1} << _pageShift;
        else
            _runs.push_back({at, at + (uint64_t{1} << _pageShift), facts});
    }
    _windowEnd = at;
    return KERN_SUCCESS;
}

bool HXPageReader::isGone(uint64_t address) const {
    uint64_t entry;
    const auto position = static_cast<off_t>((address >> _pageShift) * sizeof entry);
    return ::pread(_pagemap.get(), &entry, sizeof entry, position) <= 0;
}

void HXPageReader::findSwapped(const HXMapping &mapping, uint64_t start, std::span<int32_t> dispositions) {
    if (!_swapFile) _swapFile = HXOpenMappedFile(_directory, mapping);
    const uint64_t offset = mapping.offset + (start - mapping.start);
    _left.swapped -=
        HXMarkSwapped(_swapFile.get(), offset >> _pageShift, _pageShift, _left.swapped, dispositions);
}
