// What grew and what shrank between two reports: by process, category and region.
#pragma once

#include "report/HXReport.h"

#include <cstdint>
#include <string>
#include <vector>

// A line of the comparison; hefts in bytes, 0 where it was not there.
struct HXDiffRow {
    enum class Kind : uint8_t { process, category, region, total };

    Kind kind = Kind::total;
    std::string name;
    int32_t pidBefore = -1; // of a process, -1: it was not there
    int32_t pidAfter = -1;
    uint64_t start = 0; // of a region
    uint64_t before = 0;
    uint64_t after = 0;
    std::vector<HXDiffRow> parts; // those that changed: categories of a process, regions of either

    int64_t change() const { return static_cast<int64_t>(after - before); }
};

struct HXReportDiff {
    // What changed, in each list by descending change, ties by name and pid.
    std::vector<HXDiffRow> processes;
    std::vector<HXDiffRow> categories; // of all memory, each byte once
    HXDiffRow total;
    uint32_t uncompared = 0; // processes that have errors in either report

    // Whether anything grew by more than so many bytes.
    bool hasGrowthAbove(uint64_t size) const;
};

// Processes are matched by pid and name, those that are left by name, the largest first. Regions are compared
// where both reports have them, of processes that kept their pid.
HXReportDiff HXCompareReports(const HXReport &before, const HXReport &after);

// The name of a category as runs tell it that do not list regions: a listing run tells them apart by path,
// too.
std::string HXCategoryWithoutPath(const std::string &category);
