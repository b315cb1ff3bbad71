#include "support/HXCheckReport.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <map>
#include <nlohmann/json.hpp>
#include <regex>
#include <set>
#include <sstream>

namespace {
using Json = nlohmann::ordered_json;
using Keys = std::vector<std::string>;

// ---- The document ----

// Parsed strictly; a key that comes twice in one object fails the test. An empty value when it does not
// parse.
Json parse(const std::string &text) {
    std::vector<std::set<std::string>> open;
    const auto notice = [&](int, Json::parse_event_t event, Json &value) {
        if (event == Json::parse_event_t::object_start) open.emplace_back();
        if (event == Json::parse_event_t::object_end) open.pop_back();
        if (event == Json::parse_event_t::key) {
            EXPECT_TRUE(open.back().insert(value.get<std::string>()).second) << "twice: " << value;
        }
        return true;
    };
    Json document = Json::parse(text, notice, false);
    EXPECT_FALSE(document.is_discarded()) << text;
    // Without white space and with numbers as they stand, writing it again gives the same bytes.
    EXPECT_EQ(document.dump(), text);
    return document.is_discarded() ? Json() : document;
}

Keys keysOf(const Json &object) {
    Keys keys;
    for (const auto &[key, value] : object.items())
        keys.push_back(key);
    return keys;
}

// The keys of an object are these in this order; those that begin with '?' may be missing.
void checkKeys(const Json &object, const Keys &allowed) {
    Keys expected;
    for (const std::string &key : allowed)
        if (key[0] != '?')
            expected.push_back(key);
        else if (object.contains(key.substr(1)))
            expected.push_back(key.substr(1));
    EXPECT_EQ(keysOf(object), expected);
}

const Keys kSizeKeys{"dirty", "swapped", "clean", "reclaimable", "wired", "regions"};

// A line of a table: what it is called, and its figures by JSON key.
struct Row {
    std::string label;
    std::map<std::string, uint64_t> figures;
};
using Table = std::vector<Row>;

Row rowOf(const std::string &label, const Json &sizes) {
    checkKeys(sizes, kSizeKeys);
    Row row{label, {}};
    for (const std::string &key : kSizeKeys)
        row.figures[key] = sizes.value(key, uint64_t{0});
    EXPECT_GE(row.figures["dirty"], row.figures["swapped"]) << label; // the one includes the other
    return row;
}
Table tableOf(const Json &categories) {
    Table table;
    for (const auto &[key, sizes] : categories.items())
        if (key != "total") table.push_back(rowOf(key, sizes));
    return table;
}

uint64_t heftOfRegions(const Json &regions) {
    uint64_t heft = 0;
    for (const Json &region : regions) {
        checkKeys(region, {"id", "name", "?addr", "vsize", "?offset", "?dirty", "?swapped", "?clean",
                           "?reclaimable", "?wired"});
        for (const auto &[key, value] : region.items())
            if (key != "id" && key != "name" && key != "addr" && key != "vsize") {
                EXPECT_NE(value, 0);
            }
        heft += region.value("dirty", uint64_t{0}) + region.value("swapped", uint64_t{0});
    }
    return heft;
}

void checkProcess(const Json &process, bool chargeByRegion) {
    SCOPED_TRACE(process["name"].dump());
    checkKeys(process,
              {"name", "pid", "?errors", "?warnings", "?regions", "?heft", "?categories", "auxiliary"});
    EXPECT_EQ(process.contains("heft"), !process.contains("errors"));
    if (process.contains("errors")) {
        EXPECT_EQ(process["categories"], Json::object());
    }
    if (process.contains("regions") && process.contains("heft") && chargeByRegion) {
        EXPECT_EQ(heftOfRegions(process["regions"]), process["heft"]);
    }
}

void checkShared(const Json &document) {
    std::set<int64_t> shown;
    for (const Json &process : document["processes"])
        shown.insert(process["pid"].get<int64_t>());
    std::set<std::string> groups;
    for (const Json &entry : document["shared"]) {
        checkKeys(entry, {"pids", "?specific_to_pid", "categories"});
        EXPECT_GE(entry["pids"].size(), 2u);
        bool anyShown = false;
        for (const Json &pid : entry["pids"])
            anyShown |= shown.contains(pid.get<int64_t>());
        EXPECT_TRUE(anyShown);
        if (entry.contains("specific_to_pid")) {
            EXPECT_TRUE(shown.contains(entry["specific_to_pid"].get<int64_t>()));
            EXPECT_NE(std::find(entry["pids"].begin(), entry["pids"].end(), entry["specific_to_pid"]),
                      entry["pids"].end());
        }
        EXPECT_TRUE(
            groups.insert(entry["pids"].dump() + entry.value("specific_to_pid", Json()).dump()).second);
    }
}

void checkTotals(const Json &document) {
    std::map<std::string, uint64_t> sums;
    for (const Row &row : tableOf(document["summary"]))
        for (const auto &[key, value] : row.figures)
            sums[key] += value;
    const Json &total = document["summary"]["total"];
    checkKeys(total, kSizeKeys);
    for (const std::string &key : kSizeKeys)
        EXPECT_EQ(total[key], sums[key]) << key;
    EXPECT_EQ(document["total heft"], total["dirty"]);
    Json errors = Json::array(), warnings = Json::array();
    for (const Json &process : document["processes"]) {
        for (const Json &error : process.value("errors", Json::array()))
            errors.push_back(error);
        for (const Json &warning : process.value("warnings", Json::array()))
            warnings.push_back(warning);
    }
    EXPECT_EQ(document["warnings"], warnings);
    const Json &all = document["errors"]; // the global ones come first
    ASSERT_GE(all.size(), errors.size());
    EXPECT_TRUE(std::equal(errors.begin(), errors.end(), all.end() - static_cast<long>(errors.size())));
}

// ---- The text ----

struct TextTable {
    std::string sharedWith; // the line before it; empty: private
    Table rows;
};
struct TextProcess {
    std::string header;
    std::optional<uint64_t> heft;
    std::vector<TextTable> tables;
};
struct TextReport {
    std::vector<TextProcess> processes; // the last may be the summary
};

bool startsWith(const std::string &text, const char *start) {
    return text.rfind(start, 0) == 0;
}

class TextReader {
  public:
    explicit TextReader(const std::string &text) {
        std::istringstream lines(text);
        for (std::string line; std::getline(lines, line);)
            _lines.push_back(line);
    }
    TextReport read() {
        TextReport report;
        std::string sharedWith;
        for (_at = 0; _at < _lines.size(); _at++) {
            const std::string &line = _lines[_at];
            if (isRule(line) && _at + 1 < _lines.size() && !_lines[_at + 1].empty()) {
                report.processes.push_back(readHeader());
            } else if (startsWith(line, "Shared with ")) {
                sharedWith = line;
            } else if (const size_t title = line.find("Regions    Category"); title != std::string::npos) {
                if (report.processes.empty()) {
                    ADD_FAILURE() << "a table before any header";
                    return report;
                }
                report.processes.back().tables.push_back({sharedWith, readTable()});
                sharedWith.clear();
            }
        }
        return report;
    }

  private:
    static bool isRule(const std::string &line) {
        return line.size() >= 70 && line.find_first_not_of('=') == std::string::npos;
    }
    TextProcess readHeader() {
        static const std::regex total("Heft: ([0-9]+) B");
        TextProcess process{_lines[++_at], std::nullopt, {}};
        for (; _at < _lines.size() && !isRule(_lines[_at]); _at++)
            if (std::smatch match; std::regex_search(_lines[_at], match, total))
                process.heft = std::stoull(match[1]);
        return process;
    }
    // Leaves the cursor at the TOTAL row.
    Table readTable() {
        static const std::map<std::string, std::string> keys{
            {"Dirty", "dirty"},   {"(Swapped)", "swapped"},
            {"Clean", "clean"},   {"Reclaimable", "reclaimable"},
            {"(Wired)", "wired"}, {"Regions", "regions"}};
        std::vector<std::string> columns;
        std::istringstream titles(_lines[_at]);
        for (std::string title; titles >> title && title != "Category";)
            columns.push_back(keys.at(title));
        Table table;
        Row sums{"TOTAL", {}};
        for (const std::string &column : columns)
            sums.figures[column] = 0;
        size_t dashes = 0;
        while (++_at < _lines.size()) {
            if (startsWith(_lines[_at].substr(_lines[_at].find_first_not_of(' ')), "---")) {
                dashes++;
                continue;
            }
            const Row row = readRow(columns);
            if (dashes == 2) {
                EXPECT_EQ(row.label, "TOTAL");
                EXPECT_EQ(row.figures, sums.figures);
                return table;
            }
            for (const auto &[key, value] : row.figures)
                sums.figures[key] += value;
            table.push_back(row);
        }
        ADD_FAILURE() << "a table without an end";
        return table;
    }
    Row readRow(const std::vector<std::string> &columns) const {
        std::istringstream words(_lines[_at]);
        Row row;
        for (const std::string &column : columns) {
            std::string unit;
            words >> row.figures[column];
            if (column != "regions") words >> unit;
            if (column != "regions") {
                EXPECT_EQ(unit, "B") << _lines[_at];
            }
        }
        EXPECT_TRUE(words.good()) << _lines[_at];
        std::getline(words, row.label);
        EXPECT_EQ(row.label.substr(0, 4), "    ") << _lines[_at];
        row.label.erase(0, 4);
        return row;
    }

    std::vector<std::string> _lines;
    size_t _at = 0;
};

// ---- Both ----

// Whether a label of the text stands for a full name: details may be shortened to ".../" and their last part.
bool means(const std::string &label, const std::string &fullName) {
    if (label == fullName) return true;
    const size_t cut = label.find(" .../");
    if (cut == std::string::npos) return false;
    const std::string tail = label.substr(cut + 5);
    std::string name = fullName;
    while (!name.empty() && name.back() == '/')
        name.pop_back();
    return startsWith(name, label.substr(0, cut + 1).c_str()) && name.size() > tail.size() &&
           name.compare(name.size() - tail.size() - 1, std::string::npos, "/" + tail) == 0;
}

// Whether both tables hold the same rows, in whatever order; the text may show fewer columns.
bool sameTable(const Table &text, Table json) {
    if (text.size() != json.size()) return false;
    for (const Row &row : text) {
        const auto found = std::find_if(json.begin(), json.end(), [&](const Row &other) {
            return means(row.label, other.label) &&
                   std::all_of(row.figures.begin(), row.figures.end(), [&](const auto &figure) {
                       return other.figures.at(figure.first) == figure.second;
                   });
        });
        if (found == json.end()) return false;
        json.erase(found);
    }
    return true;
}

std::string describe(const Table &table) {
    std::string text;
    for (const Row &row : table) {
        text += row.label + ":";
        for (const auto &[key, value] : row.figures)
            text += " " + key + " " + std::to_string(value);
        text += "\n";
    }
    return text;
}

// The pids that a "Shared with" line names, with the process's own; empty when it only counts them.
std::set<int64_t> pidsNamed(const std::string &line, int64_t own) {
    static const std::regex pid("\\[(-?[0-9]+)\\][,:]");
    if (std::regex_match(line, std::regex("Shared with [0-9]+ processes:"))) return {};
    std::set<int64_t> pids{own};
    for (std::sregex_iterator match(line.begin(), line.end(), pid), end; match != end; match++)
        pids.insert(std::stoll((*match)[1]));
    return pids;
}

void checkSharedTable(const TextTable &table, int64_t pid, const Json &shared) {
    const std::set<int64_t> named = pidsNamed(table.sharedWith, pid);
    for (const Json &entry : shared) {
        std::set<int64_t> pids;
        for (const Json &each : entry["pids"])
            pids.insert(each.get<int64_t>());
        const bool sameGroup =
            named.empty()
                ? pids.contains(pid) &&
                      table.sharedWith == "Shared with " + std::to_string(pids.size()) + " processes:"
                : pids == named;
        if (sameGroup && entry.value("specific_to_pid", pid) == pid &&
            sameTable(table.rows, tableOf(entry["categories"])))
            return;
    }
    ADD_FAILURE() << "no entry for pid " << pid << ": " << table.sharedWith << "\n" << describe(table.rows);
}

void checkProcessText(const TextProcess &text, const Json &process, const Json &shared) {
    const auto pid = process["pid"].get<int64_t>();
    SCOPED_TRACE(text.header);
    EXPECT_TRUE(startsWith(
        text.header, (process["name"].get<std::string>() + " [" + std::to_string(pid) + "]: ").c_str()));
    EXPECT_EQ(text.heft.has_value(), process.contains("heft"));
    if (text.heft) {
        EXPECT_EQ(*text.heft, process.value("heft", uint64_t{0}));
    }
    size_t privateTables = 0;
    for (const TextTable &table : text.tables)
        if (!table.sharedWith.empty()) {
            checkSharedTable(table, pid, shared);
        } else {
            privateTables++;
            EXPECT_TRUE(sameTable(table.rows, tableOf(process.value("categories", Json()))))
                << describe(table.rows);
        }
    EXPECT_EQ(privateTables, process.contains("categories") ? 1u : 0u);
}
} // namespace

void checkReport(const std::string &text, const std::string &json) {
    const Json document = parse(json);
    if (!document.is_object()) return;
    checkKeys(document, {"unit", "bytes per unit", "?vm_object_dirty_analysis", "processes", "errors",
                         "warnings", "summary", "total heft", "auxiliary", "shared", "page size"});
    const bool chargeByRegion = !document.contains("vm_object_dirty_analysis");
    EXPECT_EQ(text.find("VM Object Dirty Analysis: Enabled\n") == std::string::npos, chargeByRegion);
    for (const Json &process : document["processes"])
        checkProcess(process, chargeByRegion);
    checkShared(document);
    checkTotals(document);

    TextReport report = TextReader(text).read();
    const Json &processes = document["processes"];
    const bool summary = processes.size() != 1;
    ASSERT_EQ(report.processes.size(), processes.size() + summary) << text;
    for (size_t i = 0; i < processes.size(); i++)
        checkProcessText(report.processes[i], processes[i], document["shared"]);
    if (!summary) return;
    const TextProcess &last = report.processes.back();
    EXPECT_TRUE(startsWith(last.header, "Summary Heft: ")) << last.header;
    EXPECT_EQ(last.heft, document["total heft"].get<uint64_t>());
    ASSERT_EQ(last.tables.size(), 1u);
    EXPECT_TRUE(sameTable(last.tables[0].rows, tableOf(document["summary"])))
        << describe(last.tables[0].rows);
}
