// What holds for every report.
#pragma once

#include <string>

// Fails the test unless the JSON document parses (by a strict parser that is not ours), has exactly the keys
// it may have, its parts add up, and it says the same as `text`: the wide text report of the same run in
// bytes, with any sort order and listing.
void checkReport(const std::string &text, const std::string &json);
