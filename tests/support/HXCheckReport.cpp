#include "support/HXCheckReport.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>
#include <regex>
#include <set>
#include <sstream>

namespace {
using Json = nlohmann::ordered_json;
using Keys = std::vector<std::string>;
using Figures = std::vector<uint64_t>;
using Rows = std::multiset<std::string>; // what rowOf() makes

const Keys kSizeKeys{"dirty", "swapped", "clean", "reclaimable", "wired", "regions"};

// ---- The document ----

// Parsed strictly; a key that comes twice in one object fails the test.
Json parse(const std::string &text) {
    std::vector<std::set<std::string>> open;
    const auto notice = [&](int, Json::parse_event_t event, Json &value) {
        if (event == Json::parse_event_t::object_start) open.emplace_back();
        if (event == Json::parse_event_t::object_end) open.pop_back();
        if (event == Json::parse_event_t::key && !open.back().insert(value.get<std::string>()).second)
            ADD_FAILURE() << "twice: " << value;
        return true;
    };
    Json document = Json::parse(text, notice, false);
    EXPECT_FALSE(document.is_discarded()) << text;
    // Without white space and with numbers as they stand, writing it again gives the same bytes.
    EXPECT_EQ(document.dump(), text);
    return document;
}

// The keys of an object are these in this order; those that begin with '?' may be missing.
void checkKeys(const Json &object, const Keys &allowed) {
    Keys keys, expected;
    for (const auto &[key, value] : object.items())
        keys.push_back(key);
    for (const std::string &key : allowed)
        if (key[0] != '?' || object.contains(key.substr(1))) expected.push_back(key.substr(key[0] == '?'));
    EXPECT_EQ(keys, expected);
}

// A line of a table. Of the path in a label the last part stays: the text may show no more.
std::string rowOf(std::string label, const Figures &figures) {
    const size_t path = std::min(label.find(" /"), label.find(" .../"));
    if (path != std::string::npos) {
        label.erase(label.find_last_not_of('/') + 1);
        label = label.substr(0, path) + " " + label.substr(label.rfind('/') + 1);
    }
    for (const uint64_t figure : figures)
        label += " " + std::to_string(figure);
    return label;
}

// The lines of the categories in the given columns; they add up to the total if there is one.
Rows rowsOf(const Json &categories, const Keys &columns = kSizeKeys) {
    Rows rows;
    Figures sums(columns.size());
    for (const auto &[label, sizes] : categories.items()) {
        checkKeys(sizes, kSizeKeys);
        EXPECT_GE(sizes["dirty"], sizes["swapped"]) << label; // the one includes the other
        Figures figures;
        for (const std::string &column : columns)
            figures.push_back(sizes[column].get<uint64_t>());
        if (label == "total") {
            EXPECT_EQ(figures, sums);
            continue;
        }
        std::transform(sums.begin(), sums.end(), figures.begin(), sums.begin(), std::plus<>());
        rows.insert(rowOf(label, figures));
    }
    return rows;
}

uint64_t heftOfRegions(const Json &regions) {
    uint64_t heft = 0;
    for (const Json &region : regions) {
        checkKeys(region, {"id", "name", "?addr", "vsize", "?offset", "?dirty", "?swapped", "?clean",
                           "?reclaimable", "?wired"});
        for (const std::string key : {"offset", "dirty", "swapped", "clean", "reclaimable", "wired"})
            EXPECT_NE(region.value(key, uint64_t{1}), 0u);
        heft += region.value("dirty", uint64_t{0}) + region.value("swapped", uint64_t{0});
    }
    return heft;
}

void checkProcess(const Json &process, bool chargeByRegion) {
    SCOPED_TRACE(process["name"].dump());
    checkKeys(process,
              {"name", "pid", "?errors", "?warnings", "?regions", "?heft", "?categories", "auxiliary"});
    EXPECT_EQ(process.contains("heft"), !process.contains("errors"));
    EXPECT_TRUE(!process.contains("errors") || process["categories"] == Json::object());
    if (process.contains("regions") && process.contains("heft") && chargeByRegion) {
        EXPECT_EQ(heftOfRegions(process["regions"]), process["heft"]);
    }
}

void checkDocument(const Json &document) {
    checkKeys(document, {"unit", "bytes per unit", "?vm_object_dirty_analysis", "processes", "errors",
                         "warnings", "summary", "total heft", "auxiliary", "shared", "page size"});
    std::set<Json> shown;
    Json errors = Json::array(), warnings = Json::array();
    for (const Json &process : document["processes"]) {
        checkProcess(process, !document.contains("vm_object_dirty_analysis"));
        shown.insert(process["pid"]);
        for (const Json &error : process.value("errors", Json::array()))
            errors.push_back(error);
        for (const Json &warning : process.value("warnings", Json::array()))
            warnings.push_back(warning);
    }
    EXPECT_EQ(document["warnings"], warnings);
    const Json &all = document["errors"]; // the global ones come first
    ASSERT_GE(all.size(), errors.size());
    EXPECT_TRUE(std::equal(errors.begin(), errors.end(), all.end() - static_cast<long>(errors.size())));
    (void)rowsOf(document["summary"]);
    checkKeys(document["summary"]["total"], kSizeKeys);
    EXPECT_EQ(document["total heft"], document["summary"]["total"]["dirty"]);

    std::set<std::string> groups;
    for (const Json &entry : document["shared"]) {
        checkKeys(entry, {"pids", "?specific_to_pid", "categories"});
        const std::set<Json> pids(entry["pids"].begin(), entry["pids"].end());
        const Json specific = entry.value("specific_to_pid", Json());
        EXPECT_GE(pids.size(), 2u);
        EXPECT_TRUE(std::any_of(pids.begin(), pids.end(), [&](auto &pid) { return shown.contains(pid); }));
        EXPECT_TRUE(specific.is_null() || (shown.contains(specific) && pids.contains(specific)));
        EXPECT_TRUE(groups.insert(entry["pids"].dump() + specific.dump()).second);
    }
}

// ---- The text ----

struct TextTable {
    std::string sharedWith; // the line before it; empty: private
    Keys columns;
    Rows rows;
};
struct TextProcess {
    std::string header;
    std::optional<uint64_t> heft;
    std::vector<TextTable> tables;
};

bool startsWith(const std::string &text, const std::string &start) {
    return text.rfind(start, 0) == 0;
}
bool isRule(const std::string &line) {
    return line.size() >= 70 && line.find_first_not_of('=') == std::string::npos;
}

// A line of a table in figures and, behind four blanks, its label.
std::string readRow(const std::string &line, const Keys &columns, Figures *figures) {
    std::istringstream words(line);
    for (const std::string &column : columns) {
        std::string unit = "B";
        words >> figures->emplace_back();
        if (column != "regions") words >> unit;
        EXPECT_EQ(unit, "B") << line;
    }
    EXPECT_TRUE(words.good()) << line;
    std::string label;
    std::getline(words, label);
    EXPECT_TRUE(startsWith(label, "    ")) << line;
    return label.substr(4);
}

// The rest of a table whose titles are given; its lines add up to its last.
TextTable readTable(const std::string &titles, std::istream &lines) {
    TextTable table;
    std::istringstream words(titles);
    for (std::string title; words >> title && title != "Category";) {
        std::erase_if(title, [](char c) { return c == '(' || c == ')'; });
        title[0] = static_cast<char>(title[0] + ('a' - 'A'));
        table.columns.push_back(title);
    }
    Figures sums(table.columns.size());
    int dashes = 0;
    for (std::string line; std::getline(lines, line);) {
        if (startsWith(line.substr(line.find_first_not_of(' ')), "---")) {
            dashes++;
            continue;
        }
        Figures figures;
        const std::string label = readRow(line, table.columns, &figures);
        if (dashes == 2) {
            EXPECT_EQ(label, "TOTAL");
            EXPECT_EQ(figures, sums);
            return table;
        }
        std::transform(sums.begin(), sums.end(), figures.begin(), sums.begin(), std::plus<>());
        table.rows.insert(rowOf(label, figures));
    }
    ADD_FAILURE() << "a table without an end";
    return table;
}

// The processes of a report; the last may be the summary.
std::vector<TextProcess> readReport(const std::string &text) {
    static const std::regex total("Heft: ([0-9]+) B");
    std::vector<TextProcess> processes(1); // what comes before the first header
    std::istringstream lines(text);
    std::string sharedWith;
    for (std::string line; std::getline(lines, line);) {
        if (isRule(line) && std::getline(lines, line) && !line.empty()) {
            TextProcess &process = processes.emplace_back(TextProcess{line, std::nullopt, {}});
            do
                if (std::smatch match; std::regex_search(line, match, total))
                    process.heft = std::stoull(match[1]);
            while (std::getline(lines, line) && !isRule(line));
        } else if (startsWith(line, "Shared with ")) {
            sharedWith = line;
        } else if (line.find("Regions    Category") != std::string::npos) {
            processes.back().tables.push_back(readTable(line, lines));
            processes.back().tables.back().sharedWith = std::exchange(sharedWith, "");
        }
    }
    EXPECT_TRUE(processes[0].tables.empty()) << "a table before any header";
    processes.erase(processes.begin());
    return processes;
}

// ---- Both ----

// Whether a "Shared with" line of a process's stands for these pids, its own among them.
bool namesPids(const std::string &line, const Json &own, const std::set<Json> &pids) {
    static const std::regex pid("\\[(-?[0-9]+)\\][,:]");
    if (line == "Shared with " + std::to_string(pids.size()) + " processes:") return pids.contains(own);
    std::set<Json> named{own};
    for (std::sregex_iterator match(line.begin(), line.end(), pid), end; match != end; match++)
        named.insert(std::stoll((*match)[1]));
    return named == pids;
}

void checkProcessText(const TextProcess &text, const Json &process, const Json &shared) {
    const Json pid = process["pid"];
    SCOPED_TRACE(text.header);
    EXPECT_TRUE(startsWith(text.header, process["name"].get<std::string>() + " [" + pid.dump() + "]: "));
    EXPECT_EQ(text.heft.has_value(), process.contains("heft"));
    EXPECT_EQ(text.heft.value_or(0), process.value("heft", uint64_t{0}));
    size_t privateTables = 0;
    for (const TextTable &table : text.tables)
        if (table.sharedWith.empty()) {
            privateTables++;
            EXPECT_EQ(table.rows, rowsOf(process.value("categories", Json()), table.columns));
        } else {
            EXPECT_TRUE(std::any_of(shared.begin(), shared.end(),
                                    [&](const Json &entry) {
                                        const std::set<Json> pids(entry["pids"].begin(), entry["pids"].end());
                                        return namesPids(table.sharedWith, pid, pids) &&
                                               entry.value("specific_to_pid", pid) == pid &&
                                               table.rows == rowsOf(entry["categories"], table.columns);
                                    }))
                << table.sharedWith << testing::PrintToString(table.rows);
        }
    EXPECT_EQ(privateTables, process.contains("categories") ? 1u : 0u);
}
} // namespace

void checkReport(const std::string &text, const std::string &json) {
    const Json document = parse(json);
    if (!document.is_object()) return;
    checkDocument(document);
    EXPECT_EQ(text.find("VM Object Dirty Analysis: Enabled\n") != std::string::npos,
              document.contains("vm_object_dirty_analysis"));

    const std::vector<TextProcess> report = readReport(text);
    const Json &processes = document["processes"];
    const bool summary = processes.size() != 1;
    ASSERT_EQ(report.size(), processes.size() + summary) << text;
    for (size_t i = 0; i < processes.size(); i++)
        checkProcessText(report[i], processes[i], document["shared"]);
    if (!summary) return;
    EXPECT_TRUE(startsWith(report.back().header, "Summary Heft: ")) << report.back().header;
    EXPECT_EQ(report.back().heft, document["total heft"].get<uint64_t>());
    ASSERT_EQ(report.back().tables.size(), 1u);
    const TextTable &table = report.back().tables[0];
    EXPECT_EQ(table.rows, rowsOf(document["summary"], table.columns));
}
