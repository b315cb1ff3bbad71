// The report as text.
#pragma once

#include "analysis/HXOutputFormatter.h"

#include <array>
#include <cstdio>
#include <string>
#include <string_view>

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
                                    const HXGlobalMessages &messages) override;
    void printSummaryCategories(const HXCategoryMap &categories, const HXMemoryTotal &total,
                                bool hadErrors) override;
    void printGlobalAuxData(const HXAuxDictionary *data) override;
    void end() override;
    bool printsAtlasLikeOutput() const override { return true; }
    void printAtlasLikeOutputForProcess(const HXProcess &process, const HXMemoryRegionList &regions) override;

    // A size in the chosen format; pages are those of the process whose header came last.
    std::string formattedStringForSize(uint64_t size) const;
    // ".../" and the last path component unless the output is wide; none stays none.
    HXString _truncatedNameForString(HXString text) const;
    // The categories in print order.
    std::vector<const HXMemoryCategory *> _sortedKeysForCategories(const HXCategoryMap &categories) const;
    void _printCategories(const HXCategoryMap &categories);
    void _printTotalFooter(const HXMemoryTotal &total);
    void printAuxData(const HXAuxDictionary &data);
    void _printAuxData(const HXAuxDictionary &data, uint32_t indent);
    void _printPhysHeftBreakdownEnabled();

    // Not owned.
    void setOutput(std::FILE *output) { _output = output; }

  private:
    struct Column;
    static const Column kColumns[];

    void printTable(const HXCategoryMap &categories, const HXMemoryTotal &total);
    // A line of a table: `text(column)` in each column, then the category and its detail, if any.
    template <typename Text>
    void printLine(Text text, std::string_view category, std::string_view detail = {});
    void printDashes();
    void printRow(const HXMemoryTotal &total, std::string_view category, std::string_view detail = {});
    void printRule(const char *lineEnd);
    // A heading and a line for each text; nothing without texts.
    void printList(const char *heading, const std::vector<std::string> &texts);
    void printRegion(const HXMemoryRegion &region, uint64_t pageSize);
    // Whether a column that needs the option is shown; 0 is always shown.
    bool shows(int32_t option) const { return option == 0 || (_options & option) != 0; }

    uint8_t _processCount = 0; // 0, 1, or 2 for two and more
    uint32_t _pageSize = 0;
    int32_t _summaryFormat;
    int32_t _options;
    std::string _sort;
    std::FILE *_output;
    std::string _line; // that is being made
    struct HumanizedSize {
        uint64_t size = 0;
        std::string text; // empty: none yet
    };
    mutable std::array<HumanizedSize, 1024> _humanized;
};
