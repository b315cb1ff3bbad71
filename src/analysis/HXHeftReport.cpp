// The report: what the formatters are called with, in which order.
#include "analysis/HXHeft.h"

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

void HXHeft::reportGroups(const HXProcess &process, const HXHeftSharingData::Groups &groups,
                          const HXHeftSharingData &sharing, bool summarize) {
    for (const HXProcessGroup *group : groups) {
        bool hasProcessView = false;
        const auto categories = std::make_shared<const HXCategoryMap>(
            _categoriesForObjects(sharing.objectsOfGroup(*group), process, &hasProcessView, summarize));
        const HXMemoryTotal total = _totalForCategories(*categories);
        for (HXOutputFormatter *formatter : _outputFormatters) {
            if (group->isPrivate())
                formatter->printProcessCategories(*categories, total);
            else
                formatter->printSharedCategories(categories, *group, process, hasProcessView, total);
        }
    }
}

void HXHeft::reportProcess(const HXProcess &process, Report &report, const HXHeftSharingData &sharing,
                           bool summarize) {
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
    const HXHeftSharingData::Groups *groups = sharing.groupsOfProcess(process.pid());
    if (!failed && groups) {
        reportGroups(process, *groups, sharing, summarize);
    } else {
        for (HXOutputFormatter *formatter : _outputFormatters)
            formatter->printProcessCategories(HXCategoryMap(), HXMemoryTotal());
    }
    for (HXOutputFormatter *formatter : _outputFormatters)
        formatter->printProcessAuxData(auxData.get());
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
    Report report;
    for (const HXProcess *process : inOrder)
        reportProcess(*process, report, sharing, summarize);
    reportWholeGroups(sharing, summarize);

    const HXGlobalMessages messages = {HXProcess::globalErrors(), _warnings};
    for (HXOutputFormatter *formatter : _outputFormatters)
        formatter->printProcessesWithWarnings(report.withWarnings, report.withErrors, messages);
    const HXCategoryMap summary = _categoriesForAllProcessesShouldSummarize(summarize);
    const HXMemoryTotal total = _totalForCategories(summary);
    const bool hadErrors = !messages.errors.empty() || !report.withErrors.empty();
    for (HXOutputFormatter *formatter : _outputFormatters) {
        formatter->printSummaryCategories(summary, total, hadErrors);
        formatter->printGlobalAuxData(report.globalAuxData.get());
        formatter->end();
    }
}
