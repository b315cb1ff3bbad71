#include "report/HXReportDiff.h"

#include <algorithm>
#include <map>
#include <optional>
#include <tuple>
#include <unordered_map>

namespace {

using Number = HXReport::Number;
using Kind = HXDiffRow::Kind;

// Hefts before and after, by name.
using Pair = std::pair<uint64_t, uint64_t>;
using Pairs = std::map<std::string, Pair>;
constexpr uint64_t Pair::*kSides[] = {&Pair::first, &Pair::second};

// One report as it is compared.
class Side {
  public:
    Side(const HXReport &report, bool dropsPaths) : _report(report) {
        for (const HXString name : report.categories())
            _names.push_back(dropsPaths ? HXCategoryWithoutPath(name.str()) : name.str());
        _categories.resize(report.processes().size());
        for (Number set = 0; set < report.setCount(); set++)
            addSet(set);
        _regions.resize(report.processes().size());
        for (size_t i = 0; i < report.regions().size(); i++) {
            auto &[first, count] = _regions[report.regions()[i].process];
            if (count++ == 0) first = i;
        }
    }

    const HXReport &report() const { return _report; }
    const HXReport::Process &process(Number number) const { return _report.processes()[number]; }
    bool isCompared(Number number) const { return process(number).isShown && !process(number).hasErrors; }
    void addCategories(Number process, uint64_t Pair::*side, Pairs &pairs) const {
        for (const auto &[category, heft] : _categories[process])
            pairs[_names[category]].*side += heft;
    }
    void addSummary(uint64_t Pair::*side, Pairs &pairs) const {
        for (const HXReport::Row &row : _report.summary())
            pairs[_names[row.category]].*side += row.sizes.heft;
    }
    std::span<const HXReport::Region> regions(Number process) const {
        return std::span(_report.regions()).subspan(_regions[process].first, _regions[process].second);
    }

  private:
    void addSet(Number set) {
        const auto add = [this](Number process, std::span<const HXReport::Row> rows) {
            for (const HXReport::Row &row : rows)
                if (row.sizes.heft != 0) _categories[process][row.category] += row.sizes.heft;
        };
        const auto [first, last] = _report.viewsOfSet(set);
        std::vector<Number> viewing;
        for (size_t i = first; i < last; i++) {
            add(_report.view(i).process, _report.view(i).rows);
            viewing.push_back(_report.view(i).process);
        }
        std::ranges::sort(viewing);
        for (const Number member : _report.members(set))
            if (!std::ranges::binary_search(viewing, member)) add(member, _report.rows(set));
    }

    const HXReport &_report;
    std::vector<std::string> _names;                               // of categories
    std::vector<std::unordered_map<Number, uint64_t>> _categories; // hefts, by process
    std::vector<std::pair<size_t, size_t>> _regions;               // first and count, by process
};

void sortRows(std::vector<HXDiffRow> &rows) {
    std::ranges::stable_sort(rows, [](const HXDiffRow &a, const HXDiffRow &b) {
        return std::tuple(b.change(), a.name, a.pidAfter, a.start) <
               std::tuple(a.change(), b.name, b.pidAfter, b.start);
    });
}

std::vector<HXDiffRow> changedRows(const Pairs &pairs) {
    std::vector<HXDiffRow> rows;
    for (const auto &[name, hefts] : pairs) {
        if (hefts.first == hefts.second) continue;
        HXDiffRow row;
        row.kind = Kind::category;
        row.name = name;
        std::tie(row.before, row.after) = hefts;
        rows.push_back(std::move(row));
    }
    sortRows(rows);
    return rows;
}

class Comparison {
  public:
    Comparison(const HXReport &before, const HXReport &after, bool dropsPaths)
        : _sides{Side(before, dropsPaths), Side(after, dropsPaths)},
          _comparesRegions(!before.regions().empty() && !after.regions().empty()) {}

    HXReportDiff compare() {
        matchProcesses();
        Pairs summary;
        for (const int side : {0, 1})
            _sides[side].addSummary(kSides[side], summary);
        _diff.categories = changedRows(summary);
        _diff.total.name = "total";
        _diff.total.before = _sides[0].report().total().heft;
        _diff.total.after = _sides[1].report().total().heft;
        sortRows(_diff.processes);
        return std::move(_diff);
    }

  private:
    using Key = std::pair<const void *, int32_t>; // name and pid
    using Left = std::map<std::string, std::vector<Number>>;

    // Whether a process with errors is in the way of comparing this one.
    bool isUncompared(int side, Number number) const { return !_sides[side].isCompared(number); }

    void matchProcesses() {
        std::map<Key, Number> after;
        const auto keyOf = [this](int side, Number number) {
            const HXReport::Process &process = _sides[side].process(number);
            return Key{process.name.identity(), process.pid};
        };
        for (Number i = 0; i < count(1); i++)
            if (_sides[1].process(i).isShown) after.emplace(keyOf(1, i), i);
        Left left[2];
        for (Number i = 0; i < count(0); i++) {
            if (!_sides[0].process(i).isShown) continue;
            const auto found = after.find(keyOf(0, i));
            if (found != after.end()) {
                add(i, found->second);
                after.erase(found);
            } else {
                left[0][_sides[0].process(i).name.str()].push_back(i);
            }
        }
        for (const auto &[key, number] : after)
            left[1][_sides[1].process(number).name.str()].push_back(number);
        matchByName(left);
    }

    void matchByName(Left (&left)[2]) {
        for (const int side : {0, 1})
            for (auto &[name, numbers] : left[side])
                std::ranges::sort(numbers, [&](Number a, Number b) {
                    const auto &one = _sides[side].process(a);
                    const auto &other = _sides[side].process(b);
                    return std::tuple(other.heft, one.pid) < std::tuple(one.heft, other.pid);
                });
        for (const auto &[name, before] : left[0]) {
            const std::vector<Number> &after = left[1][name];
            for (size_t i = 0; i < std::max(before.size(), after.size()); i++)
                add(i < before.size() ? std::optional(before[i]) : std::nullopt,
                    i < after.size() ? std::optional(after[i]) : std::nullopt);
        }
        for (const auto &[name, after] : left[1])
            for (const Number number : after)
                if (!left[0].contains(name)) add(std::nullopt, number);
    }

    size_t count(int side) const { return _sides[side].report().processes().size(); }

    void add(std::optional<Number> before, std::optional<Number> after) {
        if ((before && isUncompared(0, *before)) || (after && isUncompared(1, *after))) {
            _diff.uncompared++;
            return;
        }
        HXDiffRow row;
        row.kind = Kind::process;
        Pairs categories;
        const std::optional<Number> numbers[] = {before, after};
        for (const int side : {0, 1}) {
            if (!numbers[side]) continue;
            const HXReport::Process &process = _sides[side].process(*numbers[side]);
            row.name = process.name.str();
            (side == 0 ? row.pidBefore : row.pidAfter) = process.pid;
            (side == 0 ? row.before : row.after) = process.heft;
            _sides[side].addCategories(*numbers[side], kSides[side], categories);
        }
        row.parts = changedRows(categories);
        if (_comparesRegions && before && after && row.pidBefore == row.pidAfter)
            addRegions(*before, *after, row);
        if (row.change() != 0 || !row.parts.empty()) _diff.processes.push_back(std::move(row));
    }

    // Puts each changed region under the changed category that its name begins with, if there is one.
    void addRegions(Number before, Number after, HXDiffRow &row) {
        using Place = std::pair<uint64_t, std::string>;
        std::map<Place, Pair> places;
        for (const int side : {0, 1})
            for (const HXReport::Region &region : _sides[side].regions(side == 0 ? before : after))
                places[{region.start.value_or(0), region.name.str()}].*kSides[side] += region.sizes.heft;
        std::vector<HXDiffRow> ofNoCategory;
        for (const auto &[place, hefts] : places) {
            if (hefts.first == hefts.second) continue;
            HXDiffRow changed;
            changed.kind = Kind::region;
            std::tie(changed.start, changed.name) = place;
            std::tie(changed.before, changed.after) = hefts;
            HXDiffRow *category = nullptr;
            for (HXDiffRow &each : row.parts)
                if ((changed.name + ' ').starts_with(each.name + ' ') &&
                    (!category || each.name.size() > category->name.size()))
                    category = &each;
            (category ? category->parts : ofNoCategory).push_back(std::move(changed));
        }
        for (HXDiffRow &category : row.parts)
            sortRows(category.parts);
        sortRows(ofNoCategory);
        std::ranges::move(ofNoCategory, std::back_inserter(row.parts));
    }

    const Side _sides[2];
    const bool _comparesRegions;
    HXReportDiff _diff;
};

bool hasGrowth(const HXDiffRow &row, uint64_t size) {
    return (row.after > row.before && row.after - row.before > size) ||
           std::ranges::any_of(row.parts, [size](const HXDiffRow &part) { return hasGrowth(part, size); });
}

} // namespace

bool HXReportDiff::hasGrowthAbove(uint64_t size) const {
    const auto grows = [size](const HXDiffRow &row) { return hasGrowth(row, size); };
    return grows(total) || std::ranges::any_of(processes, grows) || std::ranges::any_of(categories, grows);
}

std::string HXCategoryWithoutPath(const std::string &category) {
    return category.substr(0, std::min(category.find(" /"), category.find(" [")));
}

HXReportDiff HXCompareReports(const HXReport &before, const HXReport &after) {
    const auto hasPaths = [](const HXReport &report) {
        return std::ranges::any_of(report.categories(), [](HXString name) {
            return HXCategoryWithoutPath(name.str()) != name.str();
        });
    };
    return Comparison(before, after, hasPaths(before) != hasPaths(after)).compare();
}
