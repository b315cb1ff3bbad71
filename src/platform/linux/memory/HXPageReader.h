// What the pages of a process's mappings are: dispositions from the kernel's pagemap
// (Documentation/admin-guide/mm/pagemap.rst).
#pragma once

#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/memory/HXPageScan.h"
#include "platform/linux/procfs/HXDescriptor.h"

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

// How many pages of a mapping are still to be found where the page tables do not show which they are.
struct HXPagesLeft {
    uint64_t swapped = 0;
    uint64_t lazyFree = 0;
};

// Reads the pages of one process; one thread at a time.
class HXPageReader {
  public:
    // `process`: its directory in /proc; it outlives this.
    HXPageReader(const HXDescriptor &process, uint32_t pageShift)
        : _process(process), _pageShift(pageShift) {}

    // The dispositions (VM_PAGE_QUERY_… bits) of the pages from `address` on, which lies on a page's border;
    // those of all pages of a mapping add up to its figures. KERN_INVALID_ADDRESS
    // when a page lies in no mapping, KERN_INVALID_ARGUMENT when the process is gone or executes another
    // program.
    kern_return_t query(const HXAddressSpace &addressSpace, uint64_t address,
                        std::span<int32_t> dispositions);

  private:
    kern_return_t openPagemap(const HXAddressSpace &addressSpace);
    kern_return_t queryMapping(const HXMapping &mapping, uint64_t start, std::span<int32_t> dispositions);
    // Goes through the pages of a mapping that lie before what is asked for, where these count.
    kern_return_t countUpTo(const HXMapping &mapping, uint64_t start);
    kern_return_t fill(const HXMapping &mapping, uint64_t start, std::span<int32_t> dispositions);
    kern_return_t readRuns(uint64_t start, uint64_t end);
    kern_return_t readEntries(uint64_t start, uint64_t end);
    void findSwapped(const HXMapping &mapping, uint64_t start, std::span<int32_t> dispositions);

    const HXDescriptor &_process;
    const uint32_t _pageShift;
    HXDescriptor _pagemap;
    // The runs of [_windowStart, _windowEnd); pages between them are not there.
    std::vector<HXPageRun> _runs;
    uint64_t _windowStart = 0;
    uint64_t _windowEnd = 0;
    // Where the last query of a mapping ended.
    uint64_t _mappingStart = UINT64_MAX;
    uint64_t _nextAddress = 0;
    HXPagesLeft _left;
    HXDescriptor _swapFile; // the mapped shared memory, for asking which of its pages are swapped out
};
