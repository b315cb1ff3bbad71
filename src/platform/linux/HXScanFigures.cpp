#include "platform/linux/HXAddressSpaceReader.h"
#include "platform/linux/HXPageScan.h"
#include "platform/linux/HXProcFile.h"

#include <algorithm>
#include <array>
#include <span>

std::optional<HXStatusRecord> HXReadStatus(int directory) {
    char buffer[8192];
    const auto text = HXReadOnce(directory, "status", buffer);
    if (!text) return std::nullopt;
    return HXParseStatus(*text);
}

namespace {

class Counter {
  public:
    Counter(uint32_t pageShift, HXAddressSpace &addressSpace)
        : _pageShift(pageShift), _addressSpace(addressSpace) {}

    // Runs come in ascending order; one may reach over several mappings.
    void add(const HXPageRun &run) {
        while (_index < _addressSpace.count() && _addressSpace[_index].end <= run.start)
            _index++;
        for (size_t i = _index; i < _addressSpace.count() && _addressSpace[i].start < run.end; i++) {
            HXMapping &mapping = _addressSpace[i];
            const uint64_t size = std::min(run.end, mapping.end) - std::max(run.start, mapping.start);
            count(run.facts, static_cast<uint32_t>(size >> _pageShift), mapping);
        }
    }
    uint64_t swappedPages() const { return _swappedPages; }
    bool foundAny() const { return _foundAny; }

  private:
    void count(uint8_t facts, uint32_t pages, HXMapping &mapping) {
        _foundAny = true;
        if (facts & HXPageRun::nothing) return;
        const bool isFile = (facts & HXPageRun::file) != 0;
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

    const uint32_t _pageShift;
    HXAddressSpace &_addressSpace;
    size_t _index = 0;
    uint64_t _swappedPages = 0;
    bool _foundAny = false;
};

// Where the last mapping ends that the page tables of the process can show: the gate page lies above.
uint64_t endOfUserSpace(const HXAddressSpace &addressSpace) {
    size_t count = addressSpace.count();
    while (count > 0 && addressSpace[count - 1].end >> 63 != 0)
        count--;
    return count == 0 ? 0 : addressSpace[count - 1].end;
}

} // namespace

bool HXScanFigures(int directory, uint32_t pageShift, uint64_t swappedSize, HXAddressSpace *addressSpace) {
    const HXDescriptor pagemap = HXOpenAt(directory, "pagemap");
    if (!pagemap || addressSpace->count() == 0) return false;
    thread_local std::array<HXPageRun, 1024> runs;
    Counter counter(pageShift, *addressSpace);
    const uint64_t end = endOfUserSpace(*addressSpace);
    uint64_t walkEnd = 0;
    for (uint64_t start = (*addressSpace)[0].start; start < end; start = walkEnd) {
        const int count = HXPageScan::find(pagemap.get(), start, end, runs, &walkEnd);
        if (count < 0 || walkEnd <= start) return false;
        for (const HXPageRun &run : std::span(runs).first(static_cast<size_t>(count)))
            counter.add(run);
    }
    // A living process has pages; the page tables of one that has gone are empty.
    return counter.foundAny() && counter.swappedPages() << pageShift == swappedSize;
}
