#include "report/HXTop.h"

#include "report/HXCompanion.h"

#include <nlohmann/json.hpp>

#include <algorithm>

namespace {

using Row = HXTop::Row;

// A figure of a row, or none where it has none.
using Figure = std::optional<int64_t> (*)(const Row &row);

enum class When : uint8_t { always, grouped, measured, watched };

struct Column {
    const char *title;
    const char *name; // to sort by, and in JSON
    Figure figure;
    When when;
    bool isChange;
    bool isSize;
    size_t width;
};

std::optional<int64_t> sizeOf(uint64_t size) {
    return static_cast<int64_t>(size);
}

constexpr Column kColumns[] = {
    {"HEFT", "heft", [](const Row &row) { return sizeOf(row.heft); }, When::always, false, true, 7},
    {"FREED", "freed", [](const Row &row) { return row.canBeStopped ? sizeOf(row.freed) : std::nullopt; },
     When::always, false, true, 7},
    {"SHARED", "shared", [](const Row &row) { return sizeOf(row.shared); }, When::always, false, true, 7},
    {"SWAPPED", "swapped", [](const Row &row) { return sizeOf(row.swapped); }, When::always, false, true, 8},
    {"RECLAIM", "reclaimable", [](const Row &row) { return sizeOf(row.reclaimable); }, When::always, false,
     true, 8},
    {"CGROUP", "cgroup", [](const Row &row) { return row.measured ? sizeOf(*row.measured) : std::nullopt; },
     When::measured, false, true, 7},
    {"LAST", "change", [](const Row &row) { return row.sinceLast; }, When::watched, true, true, 8},
    {"START", "growth", [](const Row &row) { return row.sinceStart; }, When::watched, true, true, 8},
    {"PROCS", "processes", [](const Row &row) { return sizeOf(row.processes); }, When::grouped, false, false,
     6},
};

bool isShown(const Column &column, const HXTopSetting &setting) {
    switch (column.when) {
    case When::always:
        return true;
    case When::grouped:
        return setting.by != HXGroupBy::process;
    case When::measured:
        return setting.by == HXGroupBy::unit || setting.by == HXGroupBy::container;
    case When::watched:
        return setting.showsChanges;
    }
    return false;
}

std::string padded(const std::string &text, size_t width) {
    return text.size() < width ? std::string(width - text.size(), ' ') + text : text;
}

std::string cell(const Column &column, const Row &row) {
    const auto figure = column.figure(row);
    if (!figure) return "-";
    if (!column.isSize) return std::to_string(*figure);
    return column.isChange ? HXShortChange(*figure) : HXShortSize(static_cast<uint64_t>(*figure));
}

int64_t change(uint64_t now, uint64_t before) {
    return static_cast<int64_t>(now - before);
}

constexpr size_t kPidWidth = 8;

} // namespace

const std::vector<std::string> &HXTop::sortNames() {
    static const std::vector<std::string> names = [] {
        std::vector<std::string> all;
        for (const Column &column : kColumns)
            all.emplace_back(column.name);
        all.emplace_back("name");
        return all;
    }();
    return names;
}

bool HXTop::hasSortColumn(const HXTopSetting &setting) {
    const auto column = std::ranges::find(kColumns, setting.sort, &Column::name);
    return column == std::end(kColumns) || isShown(*column, setting);
}

void HXTop::take(HXGroupedReport reading) {
    Hefts hefts;
    _rows.clear();
    const bool isFirst = !_last;
    const auto compare = [&](Row &row, const Key &key) {
        hefts[key] += row.heft;
        if (isFirst) return;
        const auto before = [&key](const Hefts &all) {
            const auto found = all.find(key);
            return found == all.end() ? 0 : found->second;
        };
        row.sinceLast = change(row.heft, before(*_last));
        row.sinceStart = change(row.heft, before(_first));
    };
    for (HXReportGroup &group : reading.groups) {
        Row row;
        static_cast<HXReportGroup &>(row) = std::move(group);
        compare(row, {row.name, row.pid});
        _rows.push_back(std::move(row));
    }
    // No process has these names and numbers.
    constexpr int32_t noPid = -1;
    _kernel = {};
    static_cast<HXGroupFigures &>(_kernel) = reading.kernel;
    _kernel.name = "the kernel";
    _kernel.canBeStopped = false;
    compare(_kernel, {"kernel", noPid});
    _total = {};
    static_cast<HXGroupFigures &>(_total) = reading.total;
    _total.name = "total";
    compare(_total, {"total", noPid});
    if (isFirst) _first = hefts;
    _last = std::move(hefts);
    reading.groups.clear();
    _reading = std::move(reading);
    sortRows();
}

void HXTop::sortRows() {
    const auto column = std::ranges::find(kColumns, _setting.sort, &Column::name);
    const auto figure = [&](const Row &row) {
        return column == std::end(kColumns) ? 0 : column->figure(row).value_or(INT64_MIN);
    };
    std::ranges::sort(_rows, [&](const Row &a, const Row &b) {
        if (_setting.sort == "name" && a.name != b.name) return a.name < b.name;
        if (figure(a) != figure(b)) return figure(a) > figure(b);
        return std::tuple(b.heft, a.name, a.pid) < std::tuple(a.heft, b.name, b.pid);
    });
}

std::vector<std::string> HXTop::lines(size_t mostRows) const {
    const size_t shown = std::min({_rows.size(), _setting.most, mostRows});
    std::vector<std::string> lines;
    const auto add = [&](const Row &row, const std::string &pid, const std::string &name) {
        std::string line;
        for (const Column &column : kColumns)
            if (isShown(column, _setting)) line += padded(cell(column, row), column.width);
        if (_setting.by == HXGroupBy::process) line += padded(pid, kPidWidth);
        lines.push_back(line + "  " + name);
    };
    std::string title;
    for (const Column &column : kColumns)
        if (isShown(column, _setting)) title += padded(column.title, column.width);
    if (_setting.by == HXGroupBy::process) title += padded("PID", kPidWidth);
    std::string named(kGroupByNames[static_cast<size_t>(_setting.by)]);
    std::ranges::transform(named, named.begin(), [](char c) { return static_cast<char>(c - 'a' + 'A'); });
    lines.push_back(title + "  " + named);
    for (size_t i = 0; i < shown; i++)
        add(_rows[i], std::to_string(_rows[i].pid), _rows[i].name);
    if (_kernel.processes > 0) add(_kernel, "0", _kernel.name);
    std::string total = "total of " + std::to_string(_reading.total.processes);
    if (shown < _rows.size()) total += ", " + std::to_string(_rows.size() - shown) + " lines not shown";
    if (_reading.unexamined > 0) total += ", " + std::to_string(_reading.unexamined) + " not examined";
    add(_total, "", total);
    return lines;
}

std::string HXTop::json() const {
    using Json = nlohmann::ordered_json;
    const auto object = [&](const Row &row) {
        Json json;
        json["name"] = row.name;
        if (_setting.by == HXGroupBy::process) json["pid"] = row.pid;
        for (const Column &column : kColumns) {
            const auto figure = column.figure(row);
            if (isShown(column, _setting)) json[column.name] = figure ? Json(*figure) : Json();
        }
        return json;
    };
    Json document;
    document["by"] = kGroupByNames[static_cast<size_t>(_setting.by)];
    document["unit"] = "byte";
    document["groups"] = Json::array();
    for (size_t i = 0; i < std::min(_rows.size(), _setting.most); i++)
        document["groups"].push_back(object(_rows[i]));
    document["kernel"] = _kernel.processes > 0 ? object(_kernel) : Json();
    document["total"] = object(_total);
    document["total"].erase("pid");
    document["total"]["processes"] = _reading.total.processes;
    document["unexamined"] = _reading.unexamined;
    return document.dump();
}
