// The kernel's PAGEMAP_SCAN request (kernel 6.7; Documentation/admin-guide/mm/pagemap.rst): runs of pages
// that are there, found by one walk of the page tables.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

// A run of pages that the kernel tells alike.
struct HXPageRun {
    enum Fact : uint8_t {
        present = 1,
        file = 2, // of a file or of shared memory
        swapped = 4,
        nothing = 8, // the shared page of zeros, or a guard: no memory
    };
    uint64_t start;
    uint64_t end;
    uint8_t facts;
};

class HXPageScan {
  public:
    // Whether this kernel answers the request.
    static bool isSupported();
    // Whether its answers tell shared zeros and guards from memory in every case, so that pages can be
    // counted by them.
    static bool isComplete();

    // Finds the runs of present or swapped pages in [start, end) by an open pagemap: stores as many as there
    // is room for and where the walk ended, `end` or before the first run that had no room. -1 when the
    // kernel refuses. Without `tellsFiles` the fact `file` is left out, which is several times faster: the
    // kernel then need not look at the pages themselves.
    static int find(int pagemap, bool tellsFiles, uint64_t start, uint64_t end, std::span<HXPageRun> runs,
                    uint64_t *walkEnd);
};
