#include "report/HXReportGroups.h"

#include <algorithm>
#include <numeric>
#include <set>
#include <tuple>
#include <unordered_map>

namespace {

using Number = HXReport::Number;

constexpr char kUnknown[] = "-";

// Of one set: which groups have members, and what these see.
class GroupsOfSet {
  public:
    GroupsOfSet(const std::vector<Number> &groupOf, size_t groupCount)
        : _groupOf(groupOf), _seen(groupCount), _wholes(groupCount), _isMet(groupCount) {}

    void begin() {
        for (const Number group : _met) {
            _seen[group] = {};
            _wholes[group] = _isMet[group] = false;
        }
        _met.clear();
        _hasOutsiders = false;
    }
    void addMember(Number process) {
        const Number group = _groupOf[process];
        if (group == HXReport::kNone) {
            _hasOutsiders = true;
            return;
        }
        if (!_isMet[group]) _met.push_back(group);
        _isMet[group] = true;
    }
    // That a member sees all of it, or only `part`.
    void addWhole(Number process) {
        if (_groupOf[process] != HXReport::kNone) _wholes[_groupOf[process]] = true;
    }
    void addPart(Number process, const HXReportSizes &part) {
        if (_groupOf[process] != HXReport::kNone) _seen[_groupOf[process]] += part;
    }

    void count(const HXReportSizes &whole, std::vector<HXGroupFigures> &figures) const {
        const bool isInOne = _met.size() == 1 && !_hasOutsiders;
        for (const Number group : _met) {
            const bool all = isInOne || _wholes[group];
            const auto part = [&](uint64_t HXReportSizes::*size) {
                return all ? whole.*size : std::min(whole.*size, _seen[group].*size);
            };
            HXGroupFigures &figure = figures[group];
            const uint64_t heft = part(&HXReportSizes::heft);
            figure.heft += heft;
            (isInOne ? figure.freed : figure.shared) += heft;
            figure.swapped += part(&HXReportSizes::swapped);
            figure.reclaimable += part(&HXReportSizes::reclaimable);
        }
    }

  private:
    const std::vector<Number> &_groupOf;
    std::vector<HXReportSizes> _seen;
    std::vector<bool> _wholes;
    std::vector<bool> _isMet;
    std::vector<Number> _met;
    bool _hasOutsiders = false;
};

// The groups of a report as they are named, and what stands in the control groups of each.
struct Naming {
    struct Group {
        std::string name;
        int32_t pid = 0;
        std::set<std::pair<std::string, std::string>> controlGroups; // paths, unified and of version 1
    };
    std::vector<Group> groups;
    std::vector<Number> groupOf;
};

class Namer {
  public:
    Namer(HXGroupBy by, HXProcessPlaces *places) : _by(by), _places(places) {}

    Naming nameAll(const HXReport &report) {
        _naming.groupOf.assign(report.processes().size(), HXReport::kNone);
        for (Number i = 0; i < report.processes().size(); i++) {
            const HXReport::Process &process = report.processes()[i];
            if (process.isShown && !process.hasErrors && process.pid != HXReport::kKernelPid)
                _naming.groupOf[i] = groupOf(process);
        }
        return std::move(_naming);
    }

  private:
    Number groupOf(const HXReport::Process &process) {
        if (_by == HXGroupBy::process) {
            _naming.groups.push_back({process.name.str(), process.pid, {}});
            return static_cast<Number>(_naming.groups.size() - 1);
        }
        if (_by == HXGroupBy::command) return named(process.name.str());
        const auto place = _places ? _places->placeOf(process.pid) : std::nullopt;
        if (!place) return named(kUnknown);
        if (_by == HXGroupBy::user) return named(place->user);
        const auto which = _by == HXGroupBy::unit ? &HXGroupNames::unit : &HXGroupNames::container;
        const HXNamedGroup &found = place->groups.*which;
        if (found.name.empty()) return named(kUnknown);
        const Number group = named(found.name);
        const HXNamedGroup &memory = place->memoryGroups.*which;
        _naming.groups[group].controlGroups.emplace(found.path,
                                                    memory.name == found.name ? memory.path : std::string());
        return group;
    }

    Number named(const std::string &name) {
        const auto [found, isNew] = _byName.try_emplace(name, static_cast<Number>(_naming.groups.size()));
        if (isNew) _naming.groups.push_back({name, 0, {}});
        return found->second;
    }

    const HXGroupBy _by;
    HXProcessPlaces *const _places;
    Naming _naming;
    std::unordered_map<std::string, Number> _byName;
};

// Nothing where the kernel does not count for all of them.
std::optional<uint64_t> measured(const Naming::Group &group, const HXProcessPlaces *places) {
    if (!places || group.controlGroups.empty()) return std::nullopt;
    uint64_t sum = 0;
    for (const auto &[unified, memory] : group.controlGroups) {
        const auto size = places->memoryOf(unified, memory);
        if (!size) return std::nullopt;
        sum += *size;
    }
    return sum;
}

// Leaves the `most` largest groups and one of all others. A group that has that one's name
// comes last, and so belongs to it.
void uniteSmallest(const HXReport &report, size_t most, Naming &naming) {
    const std::vector<HXGroupFigures> figures =
        HXFiguresOfGroups(report, naming.groupOf, naming.groups.size());
    std::vector<Number> order(naming.groups.size());
    std::iota(order.begin(), order.end(), Number{0});
    const auto isOther = [&](Number group) { return naming.groups[group].name == kOtherGroup; };
    std::ranges::sort(order, [&](Number a, Number b) {
        return std::tuple(isOther(a), figures[b].heft, naming.groups[a].name, a) <
               std::tuple(isOther(b), figures[a].heft, naming.groups[b].name, b);
    });
    std::vector<Naming::Group> groups;
    std::vector<Number> renumbered(order.size());
    for (size_t i = 0; i < order.size(); i++) {
        renumbered[order[i]] = static_cast<Number>(std::min(i, most));
        if (i < most) groups.push_back(std::move(naming.groups[order[i]]));
    }
    groups.push_back({kOtherGroup, 0, {}});
    naming.groups = std::move(groups);
    for (Number &group : naming.groupOf)
        if (group != HXReport::kNone) group = renumbered[group];
}

} // namespace

std::optional<HXGroupBy> HXGroupByOfName(std::string_view name) {
    const auto found = std::ranges::find(kGroupByNames, name);
    if (found == std::end(kGroupByNames)) return std::nullopt;
    return static_cast<HXGroupBy>(found - std::begin(kGroupByNames));
}

std::vector<HXGroupFigures> HXFiguresOfGroups(const HXReport &report, const std::vector<Number> &groupOf,
                                              size_t groupCount) {
    std::vector<HXGroupFigures> figures(groupCount);
    for (const Number group : groupOf)
        if (group != HXReport::kNone) figures[group].processes++;
    GroupsOfSet groups(groupOf, groupCount);
    std::vector<size_t> lastSetWithView(report.processes().size());
    for (Number set = 0; set < report.setCount(); set++) {
        const HXReportSizes whole = HXReport::sum(report.rows(set));
        if (whole.heft == 0 && whole.swapped == 0 && whole.reclaimable == 0) continue; // of most: files
        groups.begin();
        const auto [first, last] = report.viewsOfSet(set);
        for (size_t i = first; i < last; i++) {
            const HXReport::View view = report.view(i);
            groups.addPart(view.process, HXReport::sum(view.rows));
            lastSetWithView[view.process] = size_t{set} + 1;
        }
        for (const Number member : report.members(set)) {
            groups.addMember(member);
            if (lastSetWithView[member] != size_t{set} + 1) groups.addWhole(member);
        }
        groups.count(whole, figures);
    }
    return figures;
}

HXGroupedReport HXGroupReport(const HXReport &report, HXGroupBy by, HXProcessPlaces *places, size_t most) {
    Naming naming = Namer(by, places).nameAll(report);
    if (naming.groups.size() > most) uniteSmallest(report, most, naming);
    const size_t named = naming.groups.size();
    HXGroupedReport grouped;
    uint32_t examined = 0;
    for (Number i = 0; i < report.processes().size(); i++) {
        const HXReport::Process &process = report.processes()[i];
        if (process.pid == HXReport::kKernelPid) naming.groupOf[i] = static_cast<Number>(named);
        if (!process.isShown) continue;
        (process.hasErrors ? grouped.unexamined : examined)++;
    }
    const std::vector<HXGroupFigures> figures = HXFiguresOfGroups(report, naming.groupOf, named + 1);
    for (size_t i = 0; i < named; i++) {
        HXReportGroup group;
        static_cast<HXGroupFigures &>(group) = figures[i];
        group.name = std::move(naming.groups[i].name);
        group.pid = naming.groups[i].pid;
        group.measured = measured(naming.groups[i], places);
        grouped.groups.push_back(std::move(group));
    }
    grouped.kernel = figures[named];
    const HXReportSizes total = report.total();
    grouped.total = {total.heft, total.heft - grouped.kernel.heft, 0, total.swapped, total.reclaimable,
                     examined};
    return grouped;
}
