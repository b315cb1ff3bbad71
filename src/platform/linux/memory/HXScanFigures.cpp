#include "platform/linux/memory/HXAddressSpaceReader.h"
#include "platform/linux/memory/HXPageScan.h"
#include "platform/linux/procfs/HXProcFile.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <span>

namespace {

// The line behind all figures: a text that lacks it was cut.
bool isWholeStatus(std::string_view text) {
    const size_t last = text.find("\nThreads:");
    return last != std::string_view::npos && text.find('\n', last + 1) != std::string_view::npos;
}

} // namespace

std::optional<HXStatusRecord> HXReadStatus(int directory) {
    char buffer[8192];
    const auto text = HXReadOnce(directory, "status", buffer);
    if (!text) return std::nullopt;
    if (isWholeStatus(*text)) return HXParseStatus(*text);
    // A process may have 65536 groups, whose numbers come before the figures.
    constexpr size_t limit = 2 << 20;
    const auto longText = HXReadText(directory, "status", limit);
    if (!longText) return std::nullopt;
    if (isWholeStatus(*longText)) return HXParseStatus(*longText);
    errno = EIO;
    return std::nullopt;
}

namespace {

// Whether only a page itself shows whose it is: a private mapping of a file holds the file's pages and its
// own, and a driver's mapping what is nobody's memory.
bool needsPages(const HXMapping &mapping) {
    const auto kind = static_cast<HXPathKind>(mapping.kind);
    if (!mapping.isFile()) return kind == HXPathKind::vdso || kind == HXPathKind::special;
    return !(mapping.has(HXMappingShared) && mapping.has(HXMappingSwapBacked));
}

// Walks the page tables of a process, stretch by stretch of its mappings, and counts what is there.
class Scanner {
  public:
    Scanner(int directory, uint32_t pageShift, HXAddressSpace &addressSpace)
        : _pagemap(HXOpenAt(directory, "pagemap")), _pageShift(pageShift), _addressSpace(addressSpace) {}

    bool scan();
    uint64_t swappedSize() const { return _swappedPages << _pageShift; }
    bool foundAny() const { return _foundAny; }

  private:
    bool scan(uint64_t start, uint64_t end, bool tellsFiles);
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
    // A stretch of less memory is not worth a request of its own.
    constexpr uint64_t smallSize = 1 << 20;
    if (!_pagemap) return false;
    size_t count = _addressSpace.count();
    while (count > 0 && _addressSpace[count - 1].end >> 63 != 0)
        count--; // the gate page, which no page table of the process shows
    size_t begin = 0;
    bool tellsFiles = true;
    for (size_t i = 0; i < count;) {
        const bool needs = needsPages(_addressSpace[i]);
        const size_t first = i;
        uint64_t size = 0;
        for (; i < count && needsPages(_addressSpace[i]) == needs; i++)
            size += _addressSpace[i].end - _addressSpace[i].start;
        const bool tellsNext = needs || size < smallSize;
        if (first == 0) tellsFiles = tellsNext;
        if (tellsNext == tellsFiles) continue;
        if (!scan(_addressSpace[begin].start, _addressSpace[first - 1].end, tellsFiles)) return false;
        begin = first;
        tellsFiles = tellsNext;
    }
    return count == 0 || scan(_addressSpace[begin].start, _addressSpace[count - 1].end, tellsFiles);
}

bool Scanner::scan(uint64_t start, uint64_t end, bool tellsFiles) {
    thread_local std::array<HXPageRun, 1024> runs;
    for (uint64_t walkEnd = start; start < end; start = walkEnd) {
        const int count = HXPageScan::find(_pagemap.get(), tellsFiles, start, end, runs, &walkEnd);
        if (count < 0 || walkEnd <= start) return false;
        for (const HXPageRun &run : std::span(runs).first(static_cast<size_t>(count)))
            add(run);
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

bool HXScanFigures(int directory, uint32_t pageShift, uint64_t swappedSize, HXAddressSpace *addressSpace) {
    Scanner scanner(directory, pageShift, *addressSpace);
    // A living process has pages; the page tables of one that has gone are empty.
    return scanner.scan() && scanner.foundAny() && scanner.swappedSize() == swappedSize;
}
