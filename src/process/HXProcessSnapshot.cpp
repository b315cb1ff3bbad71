#include "process/HXProcessSnapshot.h"

#include <algorithm>
#include <charconv>
#include <unordered_set>
#include <utility>

namespace {

// The decimal integer at the start of a description, after optional white space; none when there is none or
// when it does not fit a pid.
std::optional<int32_t> leadingInteger(std::string_view text) {
    const size_t first = text.find_first_not_of(" \t\n\v\f\r");
    if (first == std::string_view::npos) return std::nullopt;
    text.remove_prefix(first);
    const bool plus = text.starts_with('+');
    if (plus) text.remove_prefix(1);
    if (plus && text.starts_with('-')) return std::nullopt;
    int32_t value = 0;
    const auto parsed = std::from_chars(text.data(), text.data() + text.size(), value);
    if (parsed.ec != std::errc()) return std::nullopt;
    return value;
}

} // namespace

void HXPidDescriptions::set(int32_t pid, Description description) {
    const auto [position, isNew] = _index.try_emplace(pid, _entries.size());
    if (isNew)
        _entries.push_back({pid, std::move(description)});
    else
        _entries[position->second].description = std::move(description);
}

std::vector<int32_t> HXPidDescriptions::pids() const {
    std::vector<int32_t> pids;
    for (const Entry &entry : _entries)
        pids.push_back(entry.pid);
    return pids;
}

void HXPidDescriptions::remove(const std::set<int32_t> &pids) {
    _index.clear();
    for (Entry &entry : std::exchange(_entries, {}))
        if (!pids.contains(entry.pid)) set(entry.pid, std::move(entry.description));
}

// Fills the list; false when there is none.
bool HXProcessSnapshot::readList() {
    constexpr size_t slack = 20; // processes that may start between the two calls
    const int32_t expected = _host.proc_listallpids(nullptr, 0);
    if (expected < 0) return false;
    std::vector<int32_t> pids(static_cast<size_t>(expected) + slack);
    const int32_t filled =
        _host.proc_listallpids(pids.data(), static_cast<uint32_t>(pids.size() * sizeof(int32_t)));
    if (filled < 0) return false;
    pids.resize(std::min(pids.size(), static_cast<size_t>(filled)));
    _records.reserve(pids.size());
    for (const int32_t pid : pids) {
        proc_bsdinfo info{};
        if (_host.proc_pidinfo(pid, PROC_PIDTBSDINFO, 0, &info, sizeof info) != int32_t{sizeof info})
            continue;
        _positions.emplace(info.pbi_pid, _records.size());
        _records.push_back(info);
    }
    return !_records.empty();
}

const std::vector<proc_bsdinfo> *HXProcessSnapshot::listAllBsdInfo() {
    if (!_isListed) _isListed = readList();
    return *_isListed ? &_records : nullptr;
}

std::optional<proc_bsdinfo> HXProcessSnapshot::bsdInfoOfPid(int32_t pid) {
    if (const auto listed = _positions.find(pid); listed != _positions.end()) return _records[listed->second];
    proc_bsdinfo info{};
    if (_host.proc_pidinfo(pid, PROC_PIDTBSDINFO, 0, &info, sizeof info) != int32_t{sizeof info})
        return std::nullopt;
    return info;
}

const std::string &HXProcessSnapshot::nameOf(const proc_bsdinfo &info) {
    const auto [name, isNew] = _names.try_emplace(info.pbi_pid);
    if (isNew) name->second = HXProcess::_nameForBsdInfo(info);
    return name->second;
}

void HXProcessSnapshot::openTasks(const std::vector<int32_t> &pids) {
    const auto openings = std::make_shared<std::vector<Opening>>();
    const auto names = std::make_shared<std::vector<Naming>>(pids.size()); // whoever is given up writes here
    for (size_t i = 0; i < pids.size(); i++) {
        openings->push_back({HXTaskPort(_host), KERN_FAILURE});
        const auto listed = _positions.find(pids[i]);
        if (listed != _positions.end() && !_names.contains(pids[i]))
            (*names)[i].info = _records[listed->second];
    }
    HXServices &services = _host.services();
    HXDispatchQueue queue = services.dispatch_queue_create("org.heft.opentasks", QOS_CLASS_UTILITY);
    queue.activity = "opening processes";
    queue.processOf = [&pids](size_t i) { return std::to_string(pids[i]); };
    const auto givenUp = services.dispatch_apply(pids.size(), queue, [pids, openings, names](size_t i) {
        // Who is given up here uses nothing of the run's any more when he answers after all.
        Naming &naming = (*names)[i];
        if (naming.info) naming.name = HXProcess::_nameForBsdInfo(*naming.info);
        Opening &opening = (*openings)[i];
        opening.error = opening.task.open(pids[i]);
    });
    for (size_t i = 0; i < pids.size(); i++) {
        const bool isGivenUp = std::binary_search(givenUp.begin(), givenUp.end(), i);
        _opened.insert_or_assign(pids[i], isGivenUp ? Opening{HXTaskPort(_host), KERN_OPERATION_TIMED_OUT}
                                                    : std::move((*openings)[i]));
        if (!isGivenUp && (*names)[i].info) _names.emplace(pids[i], std::move((*names)[i].name));
    }
}

kern_return_t HXProcessSnapshot::takeTask(int32_t pid, HXTaskPort *task) {
    if (!_opened.contains(pid)) openTasks({pid});
    Opening opening = std::move(_opened.extract(pid).mapped());
    *task = std::move(opening.task);
    return opening.error;
}

// Adds every process that the description means; whether there was one.
bool HXProcessSnapshot::matchDescription(const std::string &description, HXPidDescriptions &result) {
    const std::optional<int32_t> number = leadingInteger(description);
    bool matched = false;
    for (const proc_bsdinfo &info : _records) {
        if (_host.mayBeNamed(info, description) && description == nameOf(info)) {
            result.set(info.pbi_pid, description);
            matched = true;
        } else if (number == info.pbi_pid) {
            result.set(info.pbi_pid, std::nullopt);
            return true;
        }
    }
    return matched;
}

std::optional<HXPidDescriptions>
HXProcessSnapshot::pidsForStringDescriptions(const std::vector<std::string> &descriptions,
                                             std::vector<std::string> *messages) {
    if (!listAllBsdInfo()) {
        if (messages) *messages = {"Unable to obtain system process list"};
        return std::nullopt;
    }
    HXPidDescriptions result;
    for (const std::string &description : descriptions)
        if (!matchDescription(description, result) && messages)
            messages->push_back("Unable to find pid for process matching '" + description + "'");
    return result;
}

std::optional<std::vector<int32_t>> HXProcessSnapshot::childPidsForPids(const std::vector<int32_t> &pids) {
    if (!listAllBsdInfo()) return std::nullopt;
    std::vector<int32_t> result;
    std::vector<int32_t> frontier = pids;
    std::unordered_set<int32_t> seen(pids.begin(), pids.end());
    while (!frontier.empty()) {
        const std::unordered_set<int32_t> parents(frontier.begin(), frontier.end());
        std::vector<int32_t> next;
        for (const proc_bsdinfo &info : _records)
            // A pid that was seen stays where it is: pid 0 is its own parent.
            if (parents.contains(info.pbi_ppid) && seen.insert(info.pbi_pid).second)
                next.push_back(info.pbi_pid);
        result.insert(result.end(), frontier.begin(), frontier.end());
        frontier = std::move(next);
    }
    return result;
}

std::optional<HXProcess::Map>
HXProcessSnapshot::allProcessesExcludingPids(const std::set<int32_t> &excluded) {
    if (!listAllBsdInfo()) return std::nullopt;
    std::vector<int32_t> pids;
    for (const proc_bsdinfo &info : _records)
        if (!excluded.contains(info.pbi_pid) && !(info.pbi_flags & PROC_FLAG_SYSTEM))
            pids.push_back(info.pbi_pid);
    openTasks(pids);
    HXProcess::Map result;
    for (const proc_bsdinfo &info : _records) {
        if (excluded.contains(info.pbi_pid)) continue;
        if (auto process = HXProcess::processWithBsdInfo(info, *this))
            result[info.pbi_pid] = std::move(process);
    }
    return result;
}
