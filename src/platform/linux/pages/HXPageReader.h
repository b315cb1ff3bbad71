// What the pages of a process's mappings are: dispositions from the kernel's pagemap
// (Documentation/admin-guide/mm/pagemap.rst).
#pragma once

#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/pages/HXPageScan.h"
#include "platform/linux/pages/HXSharedSwap.h"
#include "platform/linux/procfs/HXDescriptor.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <vector>

// How many pages of a mapping are still to be found where the page tables do not show which they are.
struct HXPagesLeft {
    HXSwapSearch swapped;
    uint64_t lazyFree = 0;
};

// Pages [start, end) of a mapping.
struct HXFoundPages {
    uint64_t start;
    uint64_t end;
    int32_t disposition; // VM_PAGE_QUERY_… bits
    bool areObjects;     // those of the file or object that is mapped; else the process's own
};

// Reads the pages of one process; one thread at a time.
class HXPageReader {
  public:
    // `process`: its directory in /proc; it outlives this.
    HXPageReader(const HXDescriptor &process, uint32_t pageShift)
        : _process(process), _pageShift(pageShift) {}

    // HXPlatform::mach_vm_page_range_query of *pages pages from `address` on, which lies on a page's border;
    // the runs of all pages of a mapping add up to its figures. KERN_INVALID_ARGUMENT also when the process
    // executes another program.
    kern_return_t query(const HXAddressSpace &addressSpace, uint64_t address, std::vector<vm_page_run> *runs,
                        uint64_t *pages);

    // Calls `each` for the pages of a whole mapping, in ascending order, without regard to those that are
    // repeated.
    kern_return_t findAll(const HXAddressSpace &addressSpace, const HXMapping &mapping,
                          const std::function<void(const HXFoundPages &)> &each);

  private:
    kern_return_t openPagemap(const HXAddressSpace &addressSpace);
    uint64_t borderBehind(uint64_t address, uint64_t origin) const;
    kern_return_t findPages(const HXAddressSpace &addressSpace, const HXMapping &mapping, uint64_t start,
                            uint64_t origin, uint64_t *end);
    kern_return_t countUpTo(const HXMapping &mapping, uint64_t start);
    kern_return_t fill(const HXMapping &mapping, uint64_t start, uint64_t origin, uint64_t *end);
    void take(const HXMapping &mapping, uint64_t start, uint64_t end);
    void takeRun(const HXMapping &mapping, uint64_t start, uint64_t end, uint8_t facts);
    void takeHole(const HXMapping &mapping, uint64_t start, uint64_t end);
    kern_return_t readRuns(const HXMapping &mapping, uint64_t start);
    kern_return_t readEntries(const HXMapping &mapping, uint64_t start);

    const HXDescriptor &_process;
    const uint32_t _pageShift;
    HXDescriptor _pagemap;
    // The runs of [_windowStart, _windowEnd); pages between them are not there.
    std::vector<HXPageRun> _runs;
    uint64_t _windowStart = 0;
    uint64_t _windowEnd = 0;
    // Where pages are read one by one: how many of the mapping's have not been seen at most.
    uint64_t _unseenPages = 0;
    // Where the last query of a mapping ended.
    uint64_t _mappingStart = UINT64_MAX;
    uint64_t _nextAddress = 0;
    HXPagesLeft _left;
    HXDescriptor _swapFile; // the mapped shared memory, for asking which of its pages are swapped out
    std::vector<HXFoundPages> _found;
};
