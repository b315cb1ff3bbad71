// A report as OpenMetrics text (the format of that name, version 1.0).
#pragma once

#include "report/HXReportGroups.h"

#include <string>

struct HXMetricsSetting {
    size_t most = 50;                  // groups and categories that are told by name; the rest is "other"
    HXProcessPlaces *places = nullptr; // null: units are not known, and left out
    double seconds = 0;                // what reading took
};

// The text, whole. Each series of a group is what the group holds, every byte once, so groups that share add
// up to more than the machine has. Categories are told each byte once.
std::string HXMetricsText(const HXReport &report, const HXMetricsSetting &setting);
