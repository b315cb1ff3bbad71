// The report: what the formatters are called with, in which order.
#include "analysis/HXHeft.h"

#include <algorithm>

struct HXHeft::Report {
    Processes withWarnings;
    Processes withErrors;
    HXAuxTree globalAuxData; // of the shown processes without errors
};

void HXHeft::printAtlasLikeOutputForProcesses(const Processes &processes) {
    for (const HXProcess *process : processes)
        for (HXOutputFormatter *formatter : _outputFormatters)
            if (formatter->printsAtlasLikeOutput())
                formatter->printAtlasLikeOutputForProcess(*process, process->memoryRegions());
}

HXHeft::GroupReports HXHeft::groupReports(const HXProcess &process, const HXHeftSharingData &sharing,
                                          bool summarize) const {
    GroupReports reports;
    const HXHeftSharingData::Groups *groups = sharing.groupsOfProcess(process.pid());
    if (process.hasErrors() || !groups) return reports;
    for (const HXProcessGroup *group : *groups) {
        GroupReport &report = reports.emplace_back(GroupReport{group, nullptr, {}});
        report.categories = std::make_shared<const HXCategoryMap>(_categoriesForObjects(
            sharing.objectsOfGroup(*group), process, &report.hasProcessView, summarize));
        report.total = _totalForCategories(*report.categories);
    }
    return reports;
}

void HXHeft::reportProcess(const HXProcess &process, Report &report, const GroupReports &groups) {
    const bool failed = process.hasErrors();
    const HXAuxTree auxData = process.auxData();
    if (!process.warnings().empty()) report.withWarnings.push_back(&process);
    if (failed)
        report.withErrors.push_back(&process);
    else if (auxData)
        report.globalAuxData = auxData->mergeWithData(report.globalAuxData.get());

    for (HXOutputFormatter *formatter : _outputFormatters) {
        formatter->printProcessHeader(process);
        if (!failed) formatter->printProcessTotal(_pidToHeft[process.pid()], process);
        formatter->endProcessHeader(process);
    }
    for (const auto &[group, categories, total, hasProcessView] : groups)
        for (HXOutputFormatter *formatter : _outputFormatters)
            if (group->isPrivate())
                formatter->printProcessCategories(*categories, total);
            else
                formatter->printSharedCategories(categories, *group, process, hasProcessView, total);
    if (groups.empty())
        for (HXOutputFormatter *formatter : _outputFormatters)
            formatter->printProcessCategories(HXCategoryMap(), HXMemoryTotal());
    for (HXOutputFormatter *formatter : _outputFormatters)
        formatter->printProcessAuxData(auxData.get());
}

// One worker writes; the others work out, ahead of him, what is said of each process, of so many at a time
// that it is little enough to keep, and then the sums, which are written last.
void HXHeft::reportProcesses(const Processes &processes, Report &report, const HXHeftSharingData &sharing,
                             bool summarize, HXWorkAhead &summing) {
    constexpr size_t most = 512, leastObjects = 2048, mostHelpers = 64;
    const size_t helpers = std::min(_objects.size() / leastObjects, mostHelpers);
    for (size_t first = 0; first < processes.size(); first += most) {
        std::vector<GroupReports> groups(std::min(most, processes.size() - first));
        HXWorkAhead grouping(groups.size(), [&](size_t i) {
            groups[i] = groupReports(*processes[first + i], sharing, summarize);
        });
        forAll(1 + helpers, leastObjects, [&](size_t worker) {
            if (worker > 0) {
                grouping.help();
                return summing.help();
            }
            for (size_t i = 0; i < groups.size(); i++) {
                grouping.need(i);
                reportProcess(*processes[first + i], report, groups[i]);
            }
        });
    }
}

// For the formatters that ask for it.
void HXHeft::reportWholeGroups(const HXHeftSharingData &sharing, bool summarize) {
    std::vector<HXOutputFormatter *> asking;
    for (HXOutputFormatter *formatter : _outputFormatters)
        if (formatter->printsWholeGroups()) asking.push_back(formatter);
    if (asking.empty()) return;
    for (const HXProcessGroup &group : sharing.groups) {
        if (group.isPrivate()) continue;
        HXCategoryMap categories(summarize);
        for (const HXMemoryObject *object : sharing.objectsOfGroup(group))
            categories.categoryForObject(*object).addMemoryObject(object->wholeView());
        for (HXOutputFormatter *formatter : asking)
            formatter->printWholeGroup(group, categories);
    }
}

void HXHeft::printOutputVerbose(bool verbose, bool summarize) {
    const Processes inOrder = _processesBySortingHeft(_notHiddenProcesses());
    if (verbose) printAtlasLikeOutputForProcesses(inOrder);

    const HXHeftSharingData sharing = _sharingData();
    HXCategoryMap summary;
    HXWorkAhead summing(1, [&](size_t) { summary = _categoriesForAllProcessesShouldSummarize(summarize); });
    Report report;
    reportProcesses(inOrder, report, sharing, summarize, summing);
    reportWholeGroups(sharing, summarize);
    summing.need(0);

    const HXGlobalMessages messages = {HXProcess::globalErrors(), _warnings};
    for (HXOutputFormatter *formatter : _outputFormatters)
        formatter->printProcessesWithWarnings(report.withWarnings, report.withErrors, messages);
    const HXMemoryTotal total = _totalForCategories(summary);
    const bool hadErrors = !messages.errors.empty() || !report.withErrors.empty();
    for (HXOutputFormatter *formatter : _outputFormatters) {
        formatter->printSummaryCategories(summary, total, hadErrors);
        formatter->printGlobalAuxData(report.globalAuxData.get());
        formatter->end();
    }
}
