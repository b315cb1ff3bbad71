// The two ways to read the page tables of a process from its pagemap
// (Documentation/admin-guide/mm/pagemap.rst): the PAGEMAP_SCAN request of kernel 6.7, which finds runs of
// pages that are there in one walk, and an entry for each page.
#pragma once

#include "platform/linux/procfs/HXDescriptor.h"

#include <cstddef>
#include <cstdint>
#include <optional>
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
    // Whether this kernel's answers tell shared zeros and guards from memory in every case, so that pages can
    // be counted by them. False also for a kernel that does not know the request.
    static bool isComplete();

    // How many runs one walk finds at most, for which each thread keeps room (24 KiB).
    static constexpr size_t kMostRuns = 1024;
    // How many runs a walk found and where it ended: the end asked for, or before the first run that had no
    // room.
    struct Walk {
        size_t count;
        uint64_t end;
    };
    // Finds the runs of present or swapped pages in [start, end), which is not empty, by an open pagemap;
    // none when the kernel refuses, or gets nowhere. Without `tellsFiles` the fact `file` is left out, which
    // is several times faster: the kernel then need not look at the pages themselves.
    static std::optional<Walk> find(const HXDescriptor &pagemap, bool tellsFiles, uint64_t start,
                                    uint64_t end, std::span<HXPageRun> runs);
};

// The facts (HXPageRun) of the pages from number `page` on by pagemap's entries: how many were read, 0 when
// the page tables have gone. Other than the request, entries show the shared page of zeros as present memory.
size_t HXReadPageFacts(const HXDescriptor &pagemap, uint64_t page, std::span<uint8_t> facts);
