// Fills the model of a report from an analysis.
#pragma once

#include "analysis/HXOutputFormatter.h"
#include "report/HXReport.h"

#include <unordered_map>

class HXReportFormatter : public HXOutputFormatter {
  public:
    // `report` is empty, not owned and complete after `end`. With `listsRegions` a verbose run adds the
    // regions.
    HXReportFormatter(HXReport &report, bool listsRegions) : _report(report), _listsRegions(listsRegions) {}

    void printProcessHeader(const HXProcess &process) override;
    void endProcessHeader(const HXProcess &) override {}
    void printProcessTotal(uint64_t heft, const HXProcess &) override { _report.setHeft(_process, heft); }
    void printProcessCategories(const HXCategoryMap &categories, const HXMemoryTotal &) override;
    void printSharedCategories(const std::shared_ptr<const HXCategoryMap> &categories,
                               const HXProcessGroup &group, const HXProcess &, bool hasProcessView,
                               const HXMemoryTotal &) override;
    void printProcessAuxData(const HXAuxDictionary *data) override;
    void printProcessesWithWarnings(const Processes &withWarnings, const Processes &withErrors,
                                    const HXGlobalMessages &messages) override;
    void printSummaryCategories(const HXCategoryMap &categories, const HXMemoryTotal &, bool) override;
    void printGlobalAuxData(const HXAuxDictionary *) override {}
    void end() override;
    bool printsAtlasLikeOutput() const override { return _listsRegions; }
    void printAtlasLikeOutputForProcess(const HXProcess &process, const HXMemoryRegionList &regions) override;
    bool printsWholeGroups() const override { return true; }
    void printWholeGroup(const HXProcessGroup &group, const HXCategoryMap &categories) override;

  private:
    using Rows = std::vector<HXReport::Row>;

    const Rows &rowsOf(const HXCategoryMap &categories); // until the next call
    HXReport::Number setOf(const HXProcessGroup &group);
    void addFigures(const HXAuxDictionary &data, const std::string &prefix);

    HXReport &_report;
    const bool _listsRegions;
    HXReport::Number _process = HXReport::kNone; // whose calls these are
    std::unordered_map<const HXProcessGroup *, HXReport::Number> _sets;
    Rows _rows;
};
