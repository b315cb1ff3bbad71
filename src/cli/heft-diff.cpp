// heft-diff: what grew and what shrank between two reports.
#include "report/HXCompanion.h"
#include "report/HXReportDiff.h"
#include "report/HXReportSource.h"

#include <nlohmann/json.hpp>

#include <cstdio>
#include <cstdlib>

namespace {

using Kind = HXDiffRow::Kind;

const HXCompanion kProgram = {
    "heft-diff",
    "Usage: heft-diff [options] OLD NEW\n"
    "\n"
    "What grew and what shrank between two JSON reports of heft or machine files: by process, category and,\n"
    "where both have them, region.\n"
    "\n"
    "  -l, --least SIZE       leave out changes of less than SIZE (as 64K or 1M)\n"
    "  -n, --lines N          at most N processes\n"
    "      --fail-above SIZE  end with status 1 when something grew by more than SIZE\n"
    "  -j, --json             write JSON\n"};

constexpr int kGrew = 1;
constexpr int kTrouble = 2;

struct Setting {
    uint64_t least = 1;
    size_t most = SIZE_MAX;
    std::optional<uint64_t> limit;
    bool isJson = false;
};

std::vector<HXCompanionOption> optionsFor(Setting &setting) {
    const auto size = [](auto *taken) {
        return [taken](const std::string &argument) -> std::string {
            const auto bytes = HXParseSize(argument);
            if (bytes) *taken = *bytes;
            return bytes ? "" : "'" + argument + "' is no size";
        };
    };
    return {
        {"least", 'l', true, size(&setting.least)},
        {"lines", 'n', true,
         [&](const std::string &argument) -> std::string {
             const auto number = HXParseCount(argument, INT32_MAX);
             if (number) setting.most = *number;
             return number ? "" : "'" + argument + "' is no number of processes";
         }},
        {"fail-above", '\0', true, size(&setting.limit)},
        {"json", 'j', false,
         [&](const std::string &) {
             setting.isJson = true;
             return "";
         }},
    };
}

// A region's memory can change by what the category gains elsewhere, so every row is looked at by itself.
bool isWorthALine(const HXDiffRow &row, const Setting &setting) {
    const int64_t change = row.change();
    return change != 0 && static_cast<uint64_t>(change < 0 ? -change : change) >= setting.least;
}

std::string nameOf(const HXDiffRow &row) {
    char start[32];
    switch (row.kind) {
    case Kind::process:
        if (row.pidBefore < 0) return row.name + " [" + std::to_string(row.pidAfter) + "], new";
        if (row.pidAfter < 0) return row.name + " [" + std::to_string(row.pidBefore) + "], gone";
        if (row.pidBefore == row.pidAfter) return row.name + " [" + std::to_string(row.pidAfter) + "]";
        return row.name + " [" + std::to_string(row.pidBefore) + ", now " + std::to_string(row.pidAfter) +
               "]";
    case Kind::region:
        std::snprintf(start, sizeof start, "%llx ", static_cast<unsigned long long>(row.start));
        return (row.start != 0 ? start : "") + row.name;
    default:
        return row.name;
    }
}

void printRow(const HXDiffRow &row, const Setting &setting, int depth) {
    // What a process gains in one category it may lose in another.
    bool hasPart = false;
    for (const HXDiffRow &part : row.parts)
        hasPart = hasPart || isWorthALine(part, setting);
    if (!isWorthALine(row, setting) && !hasPart) return;
    std::printf("%8s %8s %8s  %*s%s\n", HXShortChange(row.change()).c_str(), HXShortSize(row.before).c_str(),
                HXShortSize(row.after).c_str(), 2 * depth, "", nameOf(row).c_str());
    for (const HXDiffRow &part : row.parts)
        printRow(part, setting, depth + 1);
}

// Leaves the most grown and the most shrunk, where not all are wanted.
void dropLeastChanged(std::vector<HXDiffRow> &rows, size_t most) {
    const auto size = [](const HXDiffRow &row) { return std::abs(row.change()); };
    size_t first = 0;
    size_t last = rows.size();
    while (last - first > most)
        size(rows[first]) < size(rows[last - 1]) ? first++ : last--;
    rows.erase(rows.begin() + static_cast<ptrdiff_t>(last), rows.end());
    rows.erase(rows.begin(), rows.begin() + static_cast<ptrdiff_t>(first));
}

void printText(const HXReportDiff &diff, const Setting &setting) {
    std::printf("%8s %8s %8s  %s\n", "CHANGE", "OLD", "NEW", "PROCESS, CATEGORY, REGION");
    for (const HXDiffRow &row : diff.processes)
        printRow(row, setting, 0);
    std::printf("\n%8s %8s %8s  %s\n", "CHANGE", "OLD", "NEW", "CATEGORY, ALL MEMORY ONCE");
    for (const HXDiffRow &row : diff.categories)
        printRow(row, setting, 0);
    std::string total = "total";
    if (diff.uncompared > 0) total += ", " + std::to_string(diff.uncompared) + " processes not compared";
    std::printf("%8s %8s %8s  %s\n", HXShortChange(diff.total.change()).c_str(),
                HXShortSize(diff.total.before).c_str(), HXShortSize(diff.total.after).c_str(), total.c_str());
}

using Json = nlohmann::ordered_json;

Json jsonOf(const std::vector<HXDiffRow> &rows, Kind kind, const Setting &setting);

Json jsonOf(const HXDiffRow &row, const Setting &setting) {
    Json json;
    json["name"] = row.name;
    if (row.kind == Kind::process) {
        json["old pid"] = row.pidBefore < 0 ? Json() : Json(row.pidBefore);
        json["new pid"] = row.pidAfter < 0 ? Json() : Json(row.pidAfter);
    }
    if (row.kind == Kind::region && row.start != 0) json["addr"] = row.start;
    json["change"] = row.change();
    json["old"] = row.before;
    json["new"] = row.after;
    if (row.kind == Kind::process) json["categories"] = jsonOf(row.parts, Kind::category, setting);
    if (row.kind == Kind::process || row.kind == Kind::category)
        json["regions"] = jsonOf(row.parts, Kind::region, setting);
    return json;
}

Json jsonOf(const std::vector<HXDiffRow> &rows, Kind kind, const Setting &setting) {
    Json json = Json::array();
    for (const HXDiffRow &row : rows)
        if (row.kind == kind && isWorthALine(row, setting)) json.push_back(jsonOf(row, setting));
    return json;
}

void printJson(const HXReportDiff &diff, const Setting &setting) {
    Json document;
    document["unit"] = "byte";
    document["processes"] = jsonOf(diff.processes, Kind::process, setting);
    document["categories"] = jsonOf(diff.categories, Kind::category, setting);
    document["total"] = jsonOf(diff.total, setting);
    document["uncompared"] = diff.uncompared;
    std::printf("%s\n", document.dump().c_str());
}

std::unique_ptr<HXReportSource> sources[2];

int run(const std::vector<std::string> &words, const Setting &setting) {
    std::optional<HXReport> reports[2];
    for (const size_t i : {0, 1}) {
        std::string reason;
        sources[i] = HXReportSource::withPath(words[i], &reason);
        reports[i] = sources[i] ? sources[i]->read(true, &reason) : std::nullopt;
        if (reports[i]) continue;
        kProgram.complain(words[i], reason);
        return kTrouble;
    }
    HXReportDiff diff = HXCompareReports(*reports[0], *reports[1]);
    const bool hasGrown = setting.limit && diff.hasGrowthAbove(*setting.limit);
    dropLeastChanged(diff.processes, setting.most);
    (setting.isJson ? printJson : printText)(diff, setting);
    if (!kProgram.finishOutput()) return kTrouble;
    return hasGrown ? kGrew : 0;
}

} // namespace

int main(int argc, char *argv[]) {
    static HXLinuxPlatform own;
    HXLinuxPlatform::prepareProcess("heft-diff");
    HXPlatform::setCurrent(&own);
    own.services().signal(HX_SIGPIPE, HXSignalDisposition::ignored);
    Setting setting;
    int status = 0;
    const auto words =
        kProgram.words(own.services(), argc, argv, optionsFor(setting), 2, 2, kTrouble, &status);
    if (!words) return status;
    status = run(*words, setting);
    for (const auto &source : sources)
        if (source) status = source->finish(status);
    return status;
}
