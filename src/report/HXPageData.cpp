// The keys of the data, which src/html/page.js reads:
//
//   title, earlier      where the reports come from; null without an earlier one
//   total               sizes of all memory
//   isOfObjects         the sizes are what memory objects see
//   isWhole             the report is of a whole machine
//   processes, unexamined   how many there are; how many of them have errors instead of figures
//   errors              as they stand, at most kMostErrors; errorCount: of how many
//   categories          names, to which parts refer by index
//   entities            processes, or several that are told as one:
//       n name, p pid (null: several), k how many, mixed (several of different names),
//       f [heft, freed, shared, swapped, reclaimable], parts: what it alone holds, part by part
//   sets                entities that share memory: m [first, last, first, last, …] of entities, k processes,
//                       some: not all processes of each entity hold all of it; o: somebody of whom nothing is
//                       told shares it, too; parts
//   otherSets           how many sets are told as one: k, parts
//   summary             [name, sizes …, wired, regions] by category; the rest last, its name null
//   change              null, or what changed since the earlier report: total [before, after];
//       processes: n, p, q (pids now and before, -1: none), s [before, after], c [[category, before, after],
//       …]; categories [[name, before, after], …]; uncompared; more: how many changed processes are left out
//
// A part is [category, sizes …]; category -1: the rest.
#include "report/HXPageData.h"

#include "report/HXReportDiff.h"
#include "report/HXReportGroups.h"

#include <nlohmann/json.hpp>

#include <algorithm>
#include <map>
#include <numeric>
#include <tuple>

namespace {

using Json = nlohmann::ordered_json;
using Number = HXReport::Number;
using Sizes = HXReportSizes;

constexpr size_t kMostErrors = 50;
constexpr char kOtherProcesses[] = "other processes";

// By category.
using Parts = std::map<Number, Sizes>;

// Processes that are told as one.
struct Entity {
    std::string name;
    int32_t pid = -1; // of the only one
    uint32_t count = 0;
    bool isMixed = false;
    Parts parts;
};

// Entities that share memory.
struct SharedSet {
    std::vector<Number> members; // entities, ascending
    bool hasOutsiders = false;
    bool isPartial = false;        // not all processes of each entity hold all of it
    std::vector<Number> processes; // who holds any of it, in any order, some more than once
    Parts parts;
    Sizes total;
};

Sizes sumOf(const Parts &parts) {
    Sizes sum;
    for (const auto &[category, sizes] : parts)
        sum += sizes;
    return sum;
}

// What a tile can be drawn for.
uint64_t weight(const Sizes &sizes) {
    return sizes.heft + sizes.clean + sizes.reclaimable;
}

void append(Json &list, const Sizes &sizes) {
    for (const uint64_t size : {sizes.heft, sizes.swapped, sizes.clean, sizes.reclaimable})
        list.push_back(size);
}

Json jsonOf(const Sizes &sizes) {
    Json list = Json::array();
    append(list, sizes);
    return list;
}

// Calls `add(key, sizes)` for the `most` with the largest heft and, of the others, half as many of the
// largest in other sizes; then with `rest` as the key of what is left.
template <typename Key, typename Add>
void addLargest(std::vector<std::pair<Key, Sizes>> all, size_t most, const Key &rest, const Add &add) {
    std::ranges::stable_sort(all, [](const auto &a, const auto &b) { return a.second.heft > b.second.heft; });
    const size_t first = std::min(most, all.size());
    std::stable_sort(all.begin() + static_cast<ptrdiff_t>(first), all.end(),
                     [](const auto &a, const auto &b) { return weight(a.second) > weight(b.second); });
    Sizes others;
    for (size_t i = 0; i < all.size(); i++) {
        if (i < first + most / 2)
            add(all[i].first, all[i].second);
        else
            others += all[i].second;
    }
    if (weight(others) != 0) add(rest, others);
}

// First and last of each run of numbers.
std::vector<Number> rangesOf(const std::vector<Number> &numbers) {
    std::vector<Number> ranges;
    for (const Number number : numbers) {
        if (!ranges.empty() && ranges.back() + 1 == number)
            ranges.back() = number;
        else
            ranges.insert(ranges.end(), {number, number});
    }
    return ranges;
}

class Page {
  public:
    Page(const HXReport &report, const HXPageLimits &limits) : _report(report), _limits(limits) {
        nameCategories();
        makeEntities();
        for (Number set = 0; set < report.setCount(); set++)
            addSet(set);
    }

    void addTo(Json &json) {
        json["categories"] = _categories;
        addEntities(json);
        addSets(json);
        addSummary(json);
    }

  private:
    void nameCategories();
    void makeEntities();
    Number addEntity(const std::string &name, bool isMixed);
    void addProcess(Number entity, Number process);
    size_t countOf(const std::vector<Number> &entities) const; // of their processes
    void addSet(Number set);
    static Json jsonOfParts(const Parts &parts, size_t most);
    void addEntities(Json &json) const;
    void addSets(Json &json);
    void addSummary(Json &json) const;

    const HXReport &_report;
    const HXPageLimits &_limits;
    std::vector<std::string> _categories; // without paths
    std::vector<Number> _categoryOf;      // by the report's categories
    std::vector<Entity> _entities;
    std::vector<Number> _entityOf; // by process; kNone: nothing is told of it
    std::map<std::pair<std::vector<Number>, bool>, SharedSet> _sets; // by members and hasOutsiders
};

void Page::nameCategories() {
    std::map<std::string, Number> numbers;
    for (const HXString name : _report.categories()) {
        const auto [found, isNew] =
            numbers.try_emplace(HXCategoryWithoutPath(name.str()), static_cast<Number>(_categories.size()));
        if (isNew) _categories.push_back(found->first);
        _categoryOf.push_back(found->second);
    }
}

Number Page::addEntity(const std::string &name, bool isMixed) {
    Entity entity;
    entity.name = name;
    entity.isMixed = isMixed;
    _entities.push_back(std::move(entity));
    return static_cast<Number>(_entities.size() - 1);
}

void Page::addProcess(Number entity, Number process) {
    _entityOf[process] = entity;
    _entities[entity].pid = ++_entities[entity].count == 1 ? _report.processes()[process].pid : -1;
}

void Page::makeEntities() {
    const auto &processes = _report.processes();
    std::vector<Number> shown;
    for (Number i = 0; i < processes.size(); i++)
        if (processes[i].isShown && !processes[i].hasErrors) shown.push_back(i);
    std::ranges::stable_sort(shown,
                             [&](Number a, Number b) { return processes[a].heft > processes[b].heft; });
    const size_t single = std::min(shown.size(), _limits.processes);
    // Processes that follow each other in the report often share: their numbers then make short ranges.
    std::sort(shown.begin(), shown.begin() + static_cast<ptrdiff_t>(single));
    _entityOf.assign(processes.size(), HXReport::kNone);
    for (size_t i = 0; i < single; i++)
        addProcess(addEntity(processes[shown[i]].name.str(), false), shown[i]);
    // The largest come first, so that the first commands are those with the largest processes.
    std::map<std::string, Number> commands;
    std::optional<Number> rest;
    for (size_t i = single; i < shown.size(); i++) {
        const std::string &name = processes[shown[i]].name.str();
        const auto found = commands.find(name);
        if (found != commands.end()) {
            addProcess(found->second, shown[i]);
        } else if (commands.size() < _limits.commands) {
            addProcess(commands[name] = addEntity(name, false), shown[i]);
        } else {
            if (!rest) rest = addEntity(kOtherProcesses, true);
            addProcess(*rest, shown[i]);
        }
    }
}

size_t Page::countOf(const std::vector<Number> &entities) const {
    return std::accumulate(entities.begin(), entities.end(), size_t{0},
                           [this](size_t sum, Number entity) { return sum + _entities[entity].count; });
}

// Sets that are the same set of entities become one; what an entity shares with nobody else is its own.
void Page::addSet(Number set) {
    std::vector<Number> members;
    bool hasOutsiders = false;
    for (const Number process : _report.members(set)) {
        if (_entityOf[process] == HXReport::kNone)
            hasOutsiders = true;
        else
            members.push_back(_entityOf[process]);
    }
    const size_t known = members.size();
    if (members.empty()) return; // of an unexamined process, of whose memory nothing is told
    std::ranges::sort(members);
    members.erase(std::unique(members.begin(), members.end()), members.end());
    Parts *parts = nullptr;
    if (members.size() == 1 && !hasOutsiders) {
        parts = &_entities[members[0]].parts;
    } else {
        SharedSet &shared = _sets[{members, hasOutsiders}];
        shared.members = members;
        shared.hasOutsiders = hasOutsiders;
        shared.isPartial = !shared.processes.empty() || known < countOf(members);
        const auto all = _report.members(set);
        shared.processes.insert(shared.processes.end(), all.begin(), all.end());
        parts = &shared.parts;
    }
    for (const HXReport::Row &row : _report.rows(set))
        (*parts)[_categoryOf[row.category]] += row.sizes;
}

Json Page::jsonOfParts(const Parts &parts, size_t most) {
    Json list = Json::array();
    constexpr int64_t rest = -1;
    std::vector<std::pair<int64_t, Sizes>> rows;
    for (const auto &[category, sizes] : parts)
        if (weight(sizes) != 0) rows.emplace_back(category, sizes);
    addLargest(std::move(rows), most, rest, [&list](int64_t category, const Sizes &sizes) {
        Json part = {category};
        append(part, sizes);
        list.push_back(std::move(part));
    });
    return list;
}

void Page::addEntities(Json &json) const {
    const auto figures = HXFiguresOfGroups(_report, _entityOf, _entities.size());
    Json list = Json::array();
    for (size_t i = 0; i < _entities.size(); i++) {
        const Entity &entity = _entities[i];
        const HXGroupFigures &figure = figures[i];
        const bool isBroad = entity.count > 1 || entity.pid == HXReport::kKernelPid;
        Json entry;
        entry["n"] = entity.name;
        entry["p"] = entity.pid < 0 ? Json() : Json(entity.pid);
        entry["k"] = entity.count;
        if (entity.isMixed) entry["mixed"] = true;
        entry["f"] = {figure.heft, figure.freed, figure.shared, figure.swapped, figure.reclaimable};
        entry["parts"] = jsonOfParts(entity.parts, isBroad ? _limits.restParts : _limits.parts);
        list.push_back(std::move(entry));
    }
    json["entities"] = std::move(list);
}

void Page::addSets(Json &json) {
    std::vector<SharedSet *> sets;
    for (auto &[key, set] : _sets) {
        set.total = sumOf(set.parts);
        if (weight(set.total) != 0) sets.push_back(&set);
    }
    std::ranges::stable_sort(sets, [](const SharedSet *a, const SharedSet *b) {
        return std::pair(a->total.heft, weight(a->total)) > std::pair(b->total.heft, weight(b->total));
    });
    Json list = Json::array();
    Parts others;
    size_t otherCount = 0;
    size_t left = _limits.members;
    for (SharedSet *set : sets) {
        const std::vector<Number> ranges = rangesOf(set->members);
        if (list.size() == _limits.sets || ranges.size() / 2 > left) {
            for (const auto &[category, sizes] : set->parts)
                others[category] += sizes;
            otherCount++;
            continue;
        }
        left -= ranges.size() / 2;
        Json entry;
        entry["m"] = ranges;
        std::ranges::sort(set->processes);
        entry["k"] = std::unique(set->processes.begin(), set->processes.end()) - set->processes.begin();
        if (set->isPartial) entry["some"] = true;
        if (set->hasOutsiders) entry["o"] = true;
        entry["parts"] = jsonOfParts(set->parts, _limits.parts);
        list.push_back(std::move(entry));
    }
    json["sets"] = std::move(list);
    json["otherSets"] = {{"k", otherCount}, {"parts", jsonOfParts(others, _limits.restParts)}};
}

void Page::addSummary(Json &json) const {
    std::vector<std::pair<Json, Sizes>> rows;
    for (const HXReport::Row &row : _report.summary())
        rows.emplace_back(_report.categories()[row.category].str(), row.sizes);
    Json list = Json::array();
    addLargest(std::move(rows), _limits.rows, Json(), [&list](const Json &name, const Sizes &sizes) {
        Json row = {name};
        append(row, sizes);
        row.push_back(sizes.wired);
        row.push_back(sizes.regions);
        list.push_back(std::move(row));
    });
    json["summary"] = std::move(list);
}

// The most changed, in the order in which they stand.
std::vector<const HXDiffRow *> mostChanged(const std::vector<HXDiffRow> &rows, size_t most) {
    std::vector<const HXDiffRow *> changed;
    changed.reserve(rows.size());
    for (const HXDiffRow &row : rows)
        changed.push_back(&row);
    const auto size = [](const HXDiffRow *row) {
        return std::max(row->before, row->after) - std::min(row->before, row->after);
    };
    std::ranges::stable_sort(changed,
                             [&size](const HXDiffRow *a, const HXDiffRow *b) { return size(a) > size(b); });
    if (changed.size() > most) changed.resize(most);
    std::ranges::sort(changed);
    return changed;
}

Json jsonOfChange(const HXReport &before, const HXReport &after, const HXPageLimits &limits) {
    const HXReportDiff diff = HXCompareReports(before, after);
    const auto listed = [](const std::vector<HXDiffRow> &rows, size_t most) {
        Json list = Json::array();
        for (const HXDiffRow *row : mostChanged(rows, most))
            list.push_back({row->name, row->before, row->after});
        return list;
    };
    Json json;
    json["total"] = {diff.total.before, diff.total.after};
    Json processes = Json::array();
    for (const HXDiffRow *row : mostChanged(diff.processes, limits.changes)) {
        Json entry;
        entry["n"] = row->name;
        entry["p"] = row->pidAfter;
        entry["q"] = row->pidBefore;
        entry["s"] = {row->before, row->after};
        entry["c"] = listed(row->parts, limits.parts);
        processes.push_back(std::move(entry));
    }
    json["more"] = diff.processes.size() - processes.size();
    json["processes"] = std::move(processes);
    json["categories"] = listed(diff.categories, limits.changes);
    json["uncompared"] = diff.uncompared;
    return json;
}

// What would end the element or, on some way into a page, be taken as markup stands only in strings, where an
// escape means the same.
std::string escaped(const std::string &json) {
    static constexpr std::pair<std::string_view, std::string_view> kEscapes[] = {
        {"<", "\\u003c"},
        {">", "\\u003e"},
        {"&", "\\u0026"},
        {"\xE2\x80\xA8", "\\u2028"},
        {"\xE2\x80\xA9", "\\u2029"},
    };
    std::string text;
    text.reserve(json.size());
    for (size_t i = 0; i < json.size();) {
        const auto *found = std::ranges::find_if(kEscapes, [&](const auto &escape) {
            return json.compare(i, escape.first.size(), escape.first) == 0;
        });
        const bool isPlain = found == std::end(kEscapes);
        text += isPlain ? std::string_view(json).substr(i, 1) : found->second;
        i += isPlain ? 1 : found->first.size();
    }
    return text;
}

} // namespace

std::string HXPageData(const HXPageReport &now, const HXPageReport *earlier, const HXPageLimits &limits) {
    const HXReport &report = now.report;
    Json json;
    json["title"] = now.title;
    json["earlier"] = earlier ? Json(earlier->title) : Json();
    json["total"] = jsonOf(report.total());
    json["isOfObjects"] = report.isOfObjects();
    json["isWhole"] = report.hasKernel();
    json["processes"] = std::ranges::count_if(report.processes(), &HXReport::Process::isShown);
    json["unexamined"] = std::ranges::count_if(report.processes(), &HXReport::Process::hasErrors);
    json["errorCount"] = report.errors().size();
    json["errors"] = std::vector(report.errors().begin(),
                                 report.errors().begin() +
                                     static_cast<ptrdiff_t>(std::min(report.errors().size(), kMostErrors)));
    Page(report, limits).addTo(json);
    json["change"] = earlier ? jsonOfChange(earlier->report, report, limits) : Json();
    return escaped(json.dump(-1, ' ', false, Json::error_handler_t::replace));
}
