// What the page of heft-html shows of a report: few enough tiles to be drawn, with every byte in exactly one.
#pragma once

#include "report/HXReport.h"

#include <string>

// How much is told one by one; the rest is added up.
struct HXPageLimits {
    size_t processes = 500; // the largest; others by command
    size_t commands = 200;  // of those others; the rest is one
    size_t sets = 300;      // of processes that share memory
    size_t members = 30000; // runs of numbers in all sets together
    size_t parts = 6;       // categories of a process or a set, by heft; half as many more by other sizes
    size_t restParts = 40;  // of several that are told as one, and of the kernel
    size_t rows = 500;      // of the list of categories
    size_t changes = 200;   // processes and categories that changed
};

// A report with the name of where it comes from.
struct HXPageReport {
    const HXReport &report;
    std::string title;
};

// The data as JSON that can stand in a script element: no "<", ">" or "&" in it. Sizes are in bytes; a list
// of sizes is [heft, swapped, clean, reclaimable]. `earlier` (null: none) is what `now` is compared with.
// See the keys at the top of HXPageData.cpp.
std::string HXPageData(const HXPageReport &now, const HXPageReport *earlier, const HXPageLimits &limits = {});
