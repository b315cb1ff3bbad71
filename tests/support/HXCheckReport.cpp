#include "support/HXCheckReport.h"

#include <algorithm>
#include <cstdint>
#include <gtest/gtest.h>
#include <map>
#include <nlohmann/json.hpp>
#include <regex>
#include <set>
#include <sstream>
#include <utility>
#include <vector>

namespace {
using Json = nlohmann::ordered_json;
using Figures = std::vector<uint64_t>;
using Rows = std::multiset<std::string>;

// What a report says of one process, or in its summary.
struct Section {
    std::string header;
    std::string heft; // empty: none
    std::map<std::string, Rows>
        tables; // by the pids that share the memory, or how many they are; "": private
};

// A row of a wide table, each run of blanks as one.
std::string rowOf(const std::string &line) {
    static const std::regex blanks(" +");
    return std::regex_replace(line, blanks, " ");
}
std::string rowOf(const std::string &label, const Figures &figures) {
    std::string line;
    for (size_t i = 0; i < figures.size(); i++)
        line += " " + std::to_string(figures[i]) + (i + 1 < figures.size() ? " B" : "");
    return rowOf(line + " " + label);
}

// The table of some categories, with the sum that its last row must show.
Rows tableOf(const Json &categories) {
    Rows rows;
    Figures sums(6);
    for (const auto &[label, sizes] : categories.items()) {
        Figures figures; // filled one by one: iterators of objects have no distance
        for (const Json &size : sizes)
            figures.push_back(size.get<uint64_t>());
        EXPECT_GE(figures[0], figures[1]) << label; // dirty bytes include swapped ones
        if (label == "total") {
            EXPECT_EQ(figures, sums);
            continue;
        }
        std::transform(sums.begin(), sums.end(), figures.begin(), sums.begin(), std::plus<>());
        rows.insert(rowOf(label, figures));
    }
    rows.insert(rowOf("TOTAL", sums));
    return rows;
}

// The others that a process shares memory with, as the text tells them.
std::string othersOf(const Json &pids, const Json &own) {
    if (pids.size() > 20) return std::to_string(pids.size()) + " ";
    std::string others;
    for (const Json &pid : pids)
        if (pid != own) others += pid.dump() + " ";
    return others;
}

// What the text must say of a process.
Section sectionOf(const Json &process, const Json &document) {
    const Json own = process["pid"];
    Section section{process["name"].get<std::string>() + " [" + own.dump() + "]: ", "", {}};
    EXPECT_NE(process.contains("heft"), process.contains("errors"));
    if (process.contains("heft")) section.heft = process["heft"].dump();
    if (process.contains("categories")) section.tables[""] = tableOf(process["categories"]);
    for (const Json &entry : document["shared"]) {
        const auto &pids = entry["pids"];
        if (std::find(pids.begin(), pids.end(), own) == pids.end() || process.contains("errors")) continue;
        // The process's own view goes before what others see.
        if (entry.value("specific_to_pid", Json()) == own)
            section.tables[othersOf(pids, own)] = tableOf(entry["categories"]);
        else if (!entry.contains("specific_to_pid"))
            section.tables.try_emplace(othersOf(pids, own), tableOf(entry["categories"]));
    }
    // Where the kernel charges each region, the charges are the heft.
    if (process.contains("regions") && !document.contains("vm_object_dirty_analysis")) {
        uint64_t charged = 0;
        for (const Json &region : process["regions"])
            charged += region.value("dirty", uint64_t{0}) + region.value("swapped", uint64_t{0});
        EXPECT_EQ(process.value("heft", charged), charged);
    }
    return section;
}

// The processes of a report; the last may be the summary.
std::vector<Section> readReport(const std::string &text) {
    static const std::regex rule("={90}"), heft("Heft: ([0-9]+) B"),
        other("\\[(-?[0-9]+)\\][,:]| ([0-9]+) processes:");
    std::vector<Section> sections;
    std::istringstream lines(text);
    std::string others;
    for (std::string line; std::getline(lines, line);) {
        std::smatch match;
        if (std::regex_match(line, rule)) {
            Section &section = sections.emplace_back();
            std::getline(lines, section.header);
            for (line = section.header; lines && !std::regex_match(line, rule); std::getline(lines, line))
                if (std::regex_search(line, match, heft)) section.heft = match[1];
        } else if (line.starts_with("Shared with ")) {
            for (std::sregex_iterator each(line.begin(), line.end(), other), end; each != end; each++)
                others += (*each)[1].str() + (*each)[2].str() + " ";
        } else if (!sections.empty() && line.ends_with("Regions    Category")) {
            Rows &rows = sections.back().tables[std::exchange(others, "")];
            while (std::getline(lines, line) && !line.empty())
                if (line.find("---") == std::string::npos) rows.insert(rowOf(line));
        }
    }
    return sections;
}
} // namespace

void checkReport(const std::string &text, const std::string &json) {
    const Json document = Json::parse(json, nullptr, false);
    // Without white space, without a key twice in an object and with numbers as they stand, writing it again
    // gives the same bytes.
    ASSERT_EQ(document.dump(), json);
    EXPECT_EQ(text.find("VM Object Dirty Analysis: Enabled\n") != std::string::npos,
              document.contains("vm_object_dirty_analysis"));
    const Json heft = document["total heft"];
    EXPECT_EQ(heft, document["summary"]["total"]["dirty"]);

    std::vector<Section> expected;
    for (const Json &process : document["processes"])
        expected.push_back(sectionOf(process, document));
    const Section summary{"Summary Heft: ", heft.dump(), {{"", tableOf(document["summary"])}}};
    if (expected.size() != 1) expected.push_back(summary);
    const std::vector<Section> report = readReport(text);
    ASSERT_EQ(report.size(), expected.size()) << text;
    for (size_t i = 0; i < report.size(); i++) {
        EXPECT_TRUE(report[i].header.starts_with(expected[i].header)) << report[i].header;
        EXPECT_EQ(report[i].heft, expected[i].heft) << report[i].header;
        EXPECT_EQ(report[i].tables, expected[i].tables) << report[i].header;
    }
}
