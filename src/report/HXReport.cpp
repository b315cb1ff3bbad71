#include "report/HXReport.h"

#include "platform/HXInternalError.h"

#include <algorithm>

namespace {

uint64_t hashOf(std::span<const HXReport::Number> members) {
    uint64_t hash = members.size();
    for (const HXReport::Number member : members)
        hash = (hash ^ member) * 0x9E3779B97F4A7C15;
    return hash;
}

template <typename Element>
std::span<const Element> slice(const std::vector<Element> &all, uint32_t first, uint32_t count) {
    return std::span(all).subspan(first, count);
}

} // namespace

HXReportSizes &HXReportSizes::operator+=(const HXReportSizes &other) {
    heft += other.heft;
    swapped += other.swapped;
    clean += other.clean;
    reclaimable += other.reclaimable;
    wired += other.wired;
    regions += other.regions;
    return *this;
}

std::span<const HXReport::Number> HXReport::members(Number set) const {
    return slice(_members, _sets[set].members.first, _sets[set].members.count);
}

std::span<const HXReport::Row> HXReport::rows(Number set) const {
    return slice(_rows, _sets[set].rows.first, _sets[set].rows.count);
}

HXReport::View HXReport::view(size_t i) const {
    const ViewRecord &view = _views[i];
    return {view.set, view.process, slice(_rows, view.rows.first, view.rows.count)};
}

std::pair<size_t, size_t> HXReport::viewsOfSet(Number set) const {
    const Slice &views = _sets[set].views;
    return {views.first, size_t{views.first} + views.count};
}

std::optional<HXReport::Number> HXReport::processOfPid(int32_t pid) const {
    const auto found = _byPid.find(pid);
    if (found == _byPid.end()) return std::nullopt;
    return found->second;
}

HXReportSizes HXReport::sum(std::span<const Row> rows) {
    HXReportSizes sum;
    for (const Row &row : rows)
        sum += row.sizes;
    return sum;
}

HXReport::Number HXReport::memberOfPid(int32_t pid) {
    const auto [found, isNew] = _byPid.try_emplace(pid, static_cast<Number>(_processes.size()));
    if (isNew) {
        Process process;
        process.pid = pid;
        _processes.push_back(process);
    }
    return found->second;
}

HXReport::Number HXReport::addProcess(int32_t pid, HXString name) {
    Number number = memberOfPid(pid);
    // Another record of the pid is one more process; sets know the first.
    if (_processes[number].isShown) {
        number = static_cast<Number>(_processes.size());
        _processes.push_back({.pid = pid, .name = {}, .heft = 0, .isShown = false, .hasErrors = false});
    }
    _processes[number].name = name;
    _processes[number].isShown = true;
    return number;
}

HXReport::Number HXReport::category(HXString name) {
    const auto [found, isNew] =
        _byCategory.try_emplace(name.identity(), static_cast<Number>(_categories.size()));
    if (isNew) _categories.push_back(name);
    return found->second;
}

HXReport::Number HXReport::set(std::vector<Number> members) {
    std::sort(members.begin(), members.end());
    members.erase(std::unique(members.begin(), members.end()), members.end());
    HXRequire(!members.empty(), "HXReport set", "!members.empty()");
    const uint64_t hash = hashOf(members);
    const auto [first, last] = _byMembers.equal_range(hash);
    for (auto each = first; each != last; ++each)
        if (std::ranges::equal(this->members(each->second), members)) return each->second;
    const auto number = static_cast<Number>(_sets.size());
    _sets.push_back(
        {{static_cast<uint32_t>(_members.size()), static_cast<uint32_t>(members.size())}, {}, {}});
    _members.insert(_members.end(), members.begin(), members.end());
    _byMembers.emplace(hash, number);
    return number;
}

HXReport::Slice HXReport::store(std::span<const Row> rows) {
    const Slice stored = {static_cast<uint32_t>(_rows.size()), static_cast<uint32_t>(rows.size())};
    _rows.insert(_rows.end(), rows.begin(), rows.end());
    return stored;
}

void HXReport::addRows(Number set, std::span<const Row> rows) {
    if (_sets[set].rows.count == 0) {
        _sets[set].rows = store(rows);
        return;
    }
    // Several records of one pid have a set each, which is one here.
    const auto before = this->rows(set);
    std::vector<Row> all(before.begin(), before.end());
    all.insert(all.end(), rows.begin(), rows.end());
    _sets[set].rows = store(all);
}

void HXReport::addView(Number set, Number process, std::span<const Row> rows) {
    _views.push_back({set, process, store(rows)});
}

void HXReport::finish() {
    std::stable_sort(_views.begin(), _views.end(),
                     [](const ViewRecord &a, const ViewRecord &b) { return a.set < b.set; });
    for (uint32_t i = 0; i < _views.size(); i++) {
        Slice &views = _sets[_views[i].set].views;
        if (views.count++ == 0) views.first = i;
    }
    std::stable_sort(_regions.begin(), _regions.end(),
                     [](const Region &a, const Region &b) { return a.process < b.process; });
}
