// The class operations of HXProcess that read the process list.
#include "platform/HXPlatform.h"
#include "process/HXProcess.h"

#include <algorithm>
#include <charconv>
#include <unordered_set>

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

// Adds every process that the description means; whether there was one.
bool matchDescription(const std::string &description, const std::vector<proc_bsdinfo> &processes,
                      HXPidDescriptions &result) {
    const std::optional<int32_t> number = leadingInteger(description);
    bool matched = false;
    for (const proc_bsdinfo &info : processes) {
        if (description == HXProcess::_nameForBsdInfo(info)) {
            result.set(info.pbi_pid, description);
            matched = true;
        } else if (number == info.pbi_pid) {
            result.set(info.pbi_pid, std::nullopt);
            return true;
        }
    }
    return matched;
}

} // namespace

std::optional<std::vector<proc_bsdinfo>> listAllBsdInfo() {
    constexpr size_t slack = 20; // processes that start between the two calls
    HXPlatform &platform = HXPlatform::current();
    const int32_t expected = platform.proc_listallpids(nullptr, 0);
    if (expected < 0) return std::nullopt;
    std::vector<int32_t> pids(static_cast<size_t>(expected) + slack);
    const int32_t filled =
        platform.proc_listallpids(pids.data(), static_cast<uint32_t>(pids.size() * sizeof(int32_t)));
    if (filled < 0) return std::nullopt;
    pids.resize(std::min(pids.size(), static_cast<size_t>(filled)));

    std::vector<proc_bsdinfo> records;
    records.reserve(pids.size());
    for (const int32_t pid : pids) {
        proc_bsdinfo info{};
        if (platform.proc_pidinfo(pid, PROC_PIDTBSDINFO, 0, &info, sizeof info) ==
            static_cast<int32_t>(sizeof info))
            records.push_back(info);
    }
    if (records.empty()) return std::nullopt;
    return records;
}

std::optional<HXPidDescriptions>
HXProcess::pidsForStringDescriptions(const std::vector<std::string> &descriptions,
                                     std::vector<std::string> *messages) {
    const auto processes = listAllBsdInfo();
    if (!processes) {
        if (messages) *messages = {"Unable to obtain system process list"};
        return std::nullopt;
    }
    HXPidDescriptions result;
    for (const std::string &description : descriptions)
        if (!matchDescription(description, *processes, result) && messages)
            messages->push_back("Unable to find pid for process matching '" + description + "'");
    return result;
}

std::optional<std::vector<int32_t>> HXProcess::childPidsForPids(const std::vector<int32_t> &pids) {
    const auto processes = listAllBsdInfo();
    if (!processes) return std::nullopt;
    std::vector<int32_t> result;
    std::vector<int32_t> frontier = pids;
    std::unordered_set<int32_t> seen(pids.begin(), pids.end());
    while (!frontier.empty()) {
        const std::unordered_set<int32_t> parents(frontier.begin(), frontier.end());
        std::vector<int32_t> next;
        for (const proc_bsdinfo &info : *processes)
            // A pid that was seen stays where it is: pid 0 is its own parent.
            if (parents.contains(info.pbi_ppid) && seen.insert(info.pbi_pid).second)
                next.push_back(info.pbi_pid);
        result.insert(result.end(), frontier.begin(), frontier.end());
        frontier = std::move(next);
    }
    return result;
}

std::optional<HXProcess::Map> HXProcess::allProcessesExcludingPids(const std::set<int32_t> &excluded) {
    const auto processes = listAllBsdInfo();
    if (!processes) return std::nullopt;
    Map result;
    for (const proc_bsdinfo &info : *processes) {
        if (excluded.contains(info.pbi_pid)) continue;
        if (auto process = processWithBsdInfo(info)) result[info.pbi_pid] = std::move(process);
    }
    return result;
}

HXProcess::Map HXProcess::removeIdleExitCleanProcessesFrom(Map processes) {
    std::erase_if(processes,
                  [](const auto &entry) { return entry.second->idleExitStatus() == HXIdleExitClean; });
    return processes;
}
