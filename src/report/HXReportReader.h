// Reads the model of a report from the JSON document that heft --json writes.
#pragma once

#include "report/HXReport.h"

#include <optional>
#include <string>
#include <string_view>

// None with *reason set when `text` is no such document, or damaged. What the document does not tell of sets
// whose members see different parts is estimated (HXReport::estimateSetsFromViews). Names are made safe,
// since anybody may have written the document. `listsRegions`: regions are kept, where it has any.
std::optional<HXReport> HXReadReport(std::string_view text, bool listsRegions, std::string *reason);
