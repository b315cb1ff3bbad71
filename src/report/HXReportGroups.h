// Adds the processes of a report up: by process, command, user, systemd unit or container.
#pragma once

#include "platform/linux/HXProcessPlaces.h"
#include "report/HXReport.h"

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

enum class HXGroupBy : uint8_t { process, command, user, unit, container };
inline constexpr std::string_view kGroupByNames[] = {"process", "command", "user", "unit", "container"};
std::optional<HXGroupBy> HXGroupByOfName(std::string_view name);

// What a group of processes holds, every byte once. Sizes in bytes.
struct HXGroupFigures {
    uint64_t heft = 0;
    uint64_t freed = 0;  // of the heft: every process that holds it is in the group
    uint64_t shared = 0; // the rest: somebody outside holds it, too
    uint64_t swapped = 0;
    uint64_t reclaimable = 0;
    uint32_t processes = 0;
};

struct HXReportGroup : HXGroupFigures {
    std::string name;                 // "-": it is not known or there is none
    int32_t pid = 0;                  // by process
    std::optional<uint64_t> measured; // what the kernel counts for the unit or container
};

struct HXGroupedReport {
    std::vector<HXReportGroup> groups; // of all processes but the kernel
    HXGroupFigures kernel;
    // Everything. Freed: what no process's end leaves behind; shared: nothing.
    HXGroupFigures total;
    uint32_t unexamined = 0; // processes that have errors instead of figures, which are in no group
};

// The figures of groups 0 … groupCount − 1, given each process's group or HXReport::kNone. Where members see
// different parts of what they share, a group that has some of them has at most what these see.
std::vector<HXGroupFigures>
HXFiguresOfGroups(const HXReport &report, const std::vector<HXReport::Number> &groupOf, size_t groupCount);

// `places` tells of live processes; null: the report is not of this machine, or not of now. When there are
// more than `most` groups, the largest stay, in order, and the others become one, the last, called
// `kOtherGroup`.
inline constexpr char kOtherGroup[] = "other";
HXGroupedReport HXGroupReport(const HXReport &report, HXGroupBy by, HXProcessPlaces *places,
                              size_t most = SIZE_MAX);
