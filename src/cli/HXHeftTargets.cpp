// From the options to the process records.
#include "cli/HXHeftArgs.h"
#include "platform/HXPlatform.h"
#include "process/HXMemgraphProcess.h"

namespace {

bool fail(HXError *error, HXHeftErrorCode code, std::string description) {
    if (error) *error = HXError(HXHeftError, code, std::move(description));
    return false;
}

} // namespace

// The records of memory graphs, in command-line order.
struct HXHeftArgs::Memgraphs {
    ProcessList records;
};

bool HXHeftArgs::takeMemgraph(const std::string &path, Memgraphs &memgraphs, HXError *error) {
    HXError reason;
    auto graph = HXMemgraphProcess::processWithMemgraph(path, &reason);
    if (!graph) {
        const auto pids = HXProcess::pidsForStringDescriptions({path}, nullptr);
        if (!pids || pids->empty())
            return fail(error, HXErrorMemgraph,
                        "Error opening memgraph " + path + ": " + reason.localizedDescription.value_or(""));
        const HXPidDescriptions::Entry &first = pids->entries().front();
        _targetPids.set(first.pid, first.description);
        return true;
    }
    const bool mode = graph->breakDownPhysHeft();
    if (_didSetShouldGetPhysHeftBreakdown && mode != _shouldGetPhysHeftBreakdown)
        return fail(
            error, HXErrorConflictingMemgraph,
            "Memgraph was gathered with an analysis mode that conflicts with other memgraphs or command line "
            "arguments: " +
                path);
    _shouldGetPhysHeftBreakdown = mode;
    _didSetShouldGetPhysHeftBreakdown = true;
    memgraphs.records.push_back(std::move(graph));
    return true;
}

bool HXHeftArgs::loadMemgraphs(Memgraphs &memgraphs, HXError *error) {
    const std::vector<std::string> descriptions = _potentialTargetProcesses.strings();
    for (const std::string &description : descriptions) {
        if (!HXPlatform::current().services().stat(description)) continue;
        if (!takeMemgraph(description, memgraphs, error)) return false;
        _potentialTargetProcesses.remove(description);
    }
    return true;
}

std::set<int32_t> HXHeftArgs::exclusions() const {
    std::set<int32_t> excluded;
    if (_excludeSelf) excluded.insert(HXPlatform::current().getpid());
    if (_excludedPidsOrProcesses.empty()) return excluded;
    if (const auto pids = HXProcess::pidsForStringDescriptions(_excludedPidsOrProcesses.strings(), nullptr))
        for (const auto &entry : pids->entries())
            excluded.insert(entry.pid);
    return excluded;
}

void HXHeftArgs::resolveDescriptions() {
    if (_potentialTargetProcesses.empty()) return; // nothing to look up: the process list is not read
    std::vector<std::string> messages;
    if (const auto pids =
            HXProcess::pidsForStringDescriptions(_potentialTargetProcesses.strings(), &messages))
        for (const auto &entry : pids->entries())
            _targetPids.set(entry.pid, entry.description);
    for (const std::string &message : messages)
        fprintf(stderr, "%s\n", message.c_str());
}

void HXHeftArgs::addChildren() {
    std::vector<int32_t> pids;
    for (const auto &entry : _targetPids.entries())
        pids.push_back(entry.pid);
    if (const auto all = HXProcess::childPidsForPids(pids))
        for (const int32_t pid : *all)
            _targetPids.set(pid, std::nullopt);
}

void HXHeftArgs::addTargets(HXProcess::Map &processes) const {
    for (const auto &[pid, name] : _targetPids.entries()) {
        if (auto process = HXProcess::processWithPid(pid))
            processes[pid] = std::move(process);
        else if (name)
            fprintf(stderr, "Unable to analyze process %s [%ld] (try as root?)\n", name->c_str(), long{pid});
        else
            fprintf(stderr, "Unable to analyze process with pid %ld (try as root?)\n", long{pid});
    }
}

std::optional<HXHeftArgs::ProcessList> HXHeftArgs::targetProcessesAndError(HXError *error) {
    if (error) *error = HXError();
    Memgraphs memgraphs;
    if (!loadMemgraphs(memgraphs, error)) return std::nullopt;
    if (memgraphs.records.empty() && _targetPids.empty() && _potentialTargetProcesses.empty() &&
        !_targetAll) {
        fail(error, HXErrorNoTarget, "Must specify at least one process or memgraph");
        return std::nullopt;
    }
    const std::set<int32_t> excluded = exclusions();
    HXProcess::Map live;
    if (_targetAll) {
        memgraphs.records.clear();
        if (auto all = HXProcess::allProcessesExcludingPids(excluded)) live = std::move(*all);
    } else {
        resolveDescriptions();
        for (const int32_t pid : excluded)
            _targetPids.remove(pid);
        if (_targetChildren) addChildren();
        if (_searchForUnmapped) {
            std::set<int32_t> others = excluded;
            others.insert(0);
            for (const auto &entry : _targetPids.entries())
                others.insert(entry.pid);
            memgraphs.records.clear();
            if (auto all = HXProcess::allProcessesExcludingPids(others)) live = std::move(*all);
            for (auto &[pid, process] : live)
                process->setHiddenFromDisplay(true);
        }
        addTargets(live);
    }
    if (_skipIdleExitClean) live = HXProcess::removeIdleExitCleanProcessesFrom(std::move(live));

    ProcessList targets = std::move(memgraphs.records);
    for (auto &[pid, process] : live)
        targets.push_back(std::move(process));
    return targets;
}
