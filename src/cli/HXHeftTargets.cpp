// From the options to the process records.
#include "cli/HXHeftArgs.h"
#include "platform/HXPlatform.h"
#include "process/HXMemgraphProcess.h"

// What the choice of one run rests on.
struct HXHeftArgs::Choice {
    HXProcessSnapshot snapshot;
    ProcessList memgraphs; // in command-line order
};

bool HXHeftArgs::takeMemgraph(const std::string &path, Choice &choice, HXError *error) {
    HXError reason;
    auto graph = HXMemgraphProcess::processWithMemgraph(path, &reason);
    if (!graph) {
        const auto pids = choice.snapshot.pidsForStringDescriptions({path}, nullptr);
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
    choice.memgraphs.push_back(std::move(graph));
    return true;
}

bool HXHeftArgs::loadMemgraphs(Choice &choice, HXError *error) {
    const std::vector<std::string> descriptions = _potentialTargetProcesses.strings();
    for (const std::string &description : descriptions) {
        if (!HXPlatform::current().services().stat(description)) continue;
        if (!takeMemgraph(description, choice, error)) return false;
        _potentialTargetProcesses.remove(description);
    }
    return true;
}

std::set<int32_t> HXHeftArgs::exclusions(HXProcessSnapshot &snapshot) const {
    std::set<int32_t> excluded = {HXPlatform::current().getpid()};
    if (_excludedPidsOrProcesses.empty()) return excluded;
    if (const auto pids = snapshot.pidsForStringDescriptions(_excludedPidsOrProcesses.strings(), nullptr))
        for (const int32_t pid : pids->pids())
            excluded.insert(pid);
    return excluded;
}

void HXHeftArgs::resolveDescriptions(HXProcessSnapshot &snapshot) {
    if (_potentialTargetProcesses.empty()) return; // nothing to look up: the process list is not read
    std::vector<std::string> messages;
    if (const auto pids = snapshot.pidsForStringDescriptions(_potentialTargetProcesses.strings(), &messages))
        for (const auto &entry : pids->entries())
            _targetPids.set(entry.pid, entry.description);
    for (const std::string &message : messages)
        fprintf(stderr, "%s\n", message.c_str());
}

void HXHeftArgs::addChildren(HXProcessSnapshot &snapshot) {
    if (const auto all = snapshot.childPidsForPids(_targetPids.pids()))
        for (const int32_t pid : *all)
            _targetPids.set(pid, std::nullopt);
}

void HXHeftArgs::addTargets(HXProcessSnapshot &snapshot, HXProcess::Map &processes) const {
    snapshot.openTasks(_targetPids.pids());
    for (const auto &[pid, name] : _targetPids.entries()) {
        if (auto process = HXProcess::processWithPid(pid, snapshot))
            processes[pid] = std::move(process);
        else if (name)
            fprintf(stderr, "Unable to analyze process %s [%ld] (try as root?)\n", name->c_str(), long{pid});
        else
            fprintf(stderr, "Unable to analyze process with pid %ld (try as root?)\n", long{pid});
    }
}

// Before anything is missed.
void HXHeftArgs::sayWhatIsNotTold() const {
    const bool areAllWanted = _targetAll || _searchForUnmapped;
    if (!areAllWanted && _targetPids.empty() && _potentialTargetProcesses.empty()) return;
    if (const auto reason = HXPlatform::current().processesNotTold(areAllWanted))
        fprintf(stderr, "heft: %s\n", reason->c_str());
}

// The processes that options and descriptions mean, without the memory graphs.
HXProcess::Map HXHeftArgs::liveTargets(HXProcessSnapshot &snapshot) {
    std::set<int32_t> excluded = exclusions(snapshot);
    if (_targetAll) return snapshot.allProcessesExcludingPids(excluded).value_or(HXProcess::Map());
    resolveDescriptions(snapshot);
    _targetPids.remove(excluded);
    if (_targetChildren) addChildren(snapshot);
    HXProcess::Map live;
    if (_searchForUnmapped) {
        excluded.insert(0);
        for (const int32_t pid : _targetPids.pids())
            excluded.insert(pid);
        if (auto all = snapshot.allProcessesExcludingPids(excluded)) live = std::move(*all);
        for (auto &[pid, process] : live)
            process->setHiddenFromDisplay(true);
    }
    addTargets(snapshot, live);
    return live;
}

std::optional<HXHeftArgs::ProcessList> HXHeftArgs::targetProcessesAndError(HXError *error) {
    if (error) *error = HXError();
    Choice choice;
    if (!loadMemgraphs(choice, error)) return std::nullopt;
    if (choice.memgraphs.empty() && _targetPids.empty() && _potentialTargetProcesses.empty() && !_targetAll) {
        fail(error, HXErrorNoTarget, "Must specify at least one process or memgraph");
        return std::nullopt;
    }
    sayWhatIsNotTold();
    HXProcess::Map live = liveTargets(choice.snapshot);
    if (_skipIdleExitClean) live = HXProcess::removeIdleExitCleanProcessesFrom(std::move(live));

    ProcessList targets;
    // Neither all processes nor the search for unmapped memory leave room for graphs.
    if (!_targetAll && !_searchForUnmapped) targets = std::move(choice.memgraphs);
    for (auto &[pid, process] : live)
        targets.push_back(std::move(process));
    return targets;
}
