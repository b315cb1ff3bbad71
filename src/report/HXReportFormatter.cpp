#include "report/HXReportFormatter.h"

#include "model/HXHeftSwitches.h"
#include "platform/HXPlatform.h"

namespace {

HXReportSizes reportSizes(const HXSizes &sizes, uint32_t regions) {
    return {sizes.heft(), sizes.swapped, sizes.clean, sizes.reclaimable, sizes.wired, regions};
}

} // namespace

const HXReportFormatter::Rows &HXReportFormatter::rowsOf(const HXCategoryMap &categories) {
    _rows.clear();
    for (const HXMemoryCategory &category : categories.categories())
        _rows.push_back({_report.category(HXString::intern(category.fullName())),
                         reportSizes(category.total(), category.total().regionCount)});
    return _rows;
}

HXReport::Number HXReportFormatter::setOf(const HXProcessGroup &group) {
    const auto [found, isNew] = _sets.try_emplace(&group);
    if (isNew) {
        std::vector<HXReport::Number> members;
        for (const HXRegionOwner *member : group.processes())
            members.push_back(_report.memberOfPid(member->pid()));
        found->second = _report.set(std::move(members));
    }
    return found->second;
}

void HXReportFormatter::printAtlasLikeOutputForProcess(const HXProcess &process,
                                                       const HXMemoryRegionList &regions) {
    const HXReport::Number number = _report.memberOfPid(process.pid());
    for (const HXMemoryRegion &region : regions) {
        if (region.isPart()) continue;
        HXReport::Region listed;
        listed.process = number;
        listed.name = HXString::intern(region.fullName());
        listed.object = region.object_id();
        if (region.start() != kNoAddress) listed.start = region.start();
        listed.size = region.size();
        listed.offset = region.offset();
        const HXSizes sizes = {region.listedSizes().dirty, region.listedSizes().swapped,
                               region.cleanNonSpecSize(), region.reclaimableSize(), region.wiredSize()};
        listed.sizes = reportSizes(sizes, 1);
        _report.addRegion(listed);
    }
}

void HXReportFormatter::printProcessHeader(const HXProcess &process) {
    _process = _report.addProcess(process.pid(), HXString::intern(process.name()));
    if (process.hasErrors()) _report.setHasErrors(_process);
    if (_report.pageSize() == 0) _report.setPageSize(process.pageSize());
}

void HXReportFormatter::printProcessCategories(const HXCategoryMap &categories, const HXMemoryTotal &) {
    if (!categories.categories().empty()) _report.addRows(_report.set({_process}), rowsOf(categories));
}

void HXReportFormatter::printSharedCategories(const std::shared_ptr<const HXCategoryMap> &categories,
                                              const HXProcessGroup &group, const HXProcess &,
                                              bool hasProcessView, const HXMemoryTotal &) {
    if (hasProcessView) _report.addView(setOf(group), _process, rowsOf(*categories));
}

void HXReportFormatter::printWholeGroup(const HXProcessGroup &group, const HXCategoryMap &categories) {
    _report.addRows(setOf(group), rowsOf(categories));
}

// `prefix`: the keys above, each with ": " after it.
void HXReportFormatter::addFigures(const HXAuxDictionary &data, const std::string &prefix) {
    for (const auto &[key, node] : data.entries()) {
        const std::string name = prefix + key;
        if (node->isContainer())
            addFigures(static_cast<const HXAuxDictionary &>(*node), name + ": ");
        else
            _report.addFigure(
                {_process, HXString::intern(name), static_cast<const HXAuxData &>(*node).value()});
    }
}

void HXReportFormatter::printProcessAuxData(const HXAuxDictionary *data) {
    if (data) addFigures(*data, "");
}

void HXReportFormatter::printProcessesWithWarnings(const Processes &withWarnings, const Processes &withErrors,
                                                   const HXGlobalMessages &messages) {
    for (const std::string &error : messages.errors)
        _report.addError(error);
    for (const HXProcess *process : withErrors)
        for (const std::string &error : process->errors())
            _report.addError(error);
    for (const std::string &warning : messages.warnings)
        _report.addWarning(warning);
    for (const HXProcess *process : withWarnings)
        for (const std::string &warning : process->warnings())
            _report.addWarning(warning);
}

void HXReportFormatter::printSummaryCategories(const HXCategoryMap &categories, const HXMemoryTotal &, bool) {
    for (const HXReport::Row &row : rowsOf(categories))
        _report.addSummaryRow(row);
}

void HXReportFormatter::end() {
    if (_report.pageSize() == 0) _report.setPageSize(HXPlatform::current().vm_kernel_page_size());
    _report.setIsOfObjects(!HXHeftSwitches::breakDownPhysHeft());
    _report.finish();
}
