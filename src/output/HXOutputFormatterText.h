// The report as text.
#pragma once

#include "analysis/HXOutputFormatter.h"

#include <cstdio>

enum HXSummaryFormat : int32_t { HXFormatBytes = 0, HXFormatFormatted = 1, HXFormatPages = 2 };

// Bits of the text report's options.
enum HXTextOptions : int32_t { HXTextWired = 1, HXTextSwapped = 2, HXTextWide = 4 };

class HXOutputFormatterText : public HXOutputFormatter {
  public:
    // `sort` is one of the seven column names. Writes to standard output; write failures are ignored.
    HXOutputFormatterText(int32_t summaryFormat, int32_t options, std::string sort);

    void printProcessHeader(const HXProcess &process) override;
    void endProcessHeader(const HXProcess &process) override;
    void printProcessTotal(uint64_t heft, const HXProcess &process) override;
    void printProcessCategories(const HXCategoryMap &categories, const HXMemoryTotal &total) override;
    void printSharedCategories(const std::shared_ptr<const HXCategoryMap> &categories,
                               const HXProcessGroup &group, const HXProcess &process, bool hasProcessView,
                               const HXMemoryTotal &total) override;
    void printProcessAuxData(const HXAuxDictionary *data) override;
    void printProcessesWithWarnings(const Processes &withWarnings, const Processes &withErrors,
                                    const std::vector<std::string> &globalErrors) override;
    void printSummaryCategories(const HXCategoryMap &categories, const HXMemoryTotal &total,
                                bool hadErrors) override;
    void printGlobalAuxData(const HXAuxDictionary *data) override;
    void end() override;
    bool printsAtlasLikeOutput() const override { return true; }
    void printAtlasLikeOutputForProcess(const HXProcess &process, const HXMemoryRegionList &regions) override;

    // A size in the chosen format; pages are those of the process whose header came last.
    std::string formattedStringForSize(uint64_t size) const;
    // "…/" and the last path component unless the output is wide; none stays none.
    HXString _truncatedNameForString(HXString text) const;
    // The keys in print order.
    std::vector<const HXCategoryMap::Entry *> _sortedKeysForCategories(const HXCategoryMap &categories) const;
    void _printCategories(const HXCategoryMap &categories);
    void _printTotalFooter(const HXMemoryTotal &total);
    void printAuxData(const HXAuxDictionary &data);
    void _printAuxData(const HXAuxDictionary &data, uint32_t indent);
    void _printPhysHeftBreakdownEnabled();

    std::FILE *output() const { return _output; }
    // Not owned.
    void setOutput(std::FILE *output) { _output = output; }

  private:
    struct Row;

    void printTable(const HXCategoryMap &categories, const HXMemoryTotal &total);
    void printRow(const Row &row);
    void printTitleLike(const char *const titles[7]);
    void printRule(const char *lineEnd);
    void printRegion(const HXMemoryRegion &region, uint64_t pageSize);
    bool showsSwapped() const { return _options & HXTextSwapped; }
    bool showsWired() const { return _options & HXTextWired; }

    uint8_t _processCount = 0; // 0, 1, or 2 for two and more
    uint32_t _pageSize = 0;
    std::string _swappedColumnName; // empty: the column is hidden
    std::string _wiredColumnName;
    int32_t _summaryFormat;
    int32_t _options;
    std::string _sort;
    std::FILE *_output;
};
