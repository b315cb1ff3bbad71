#include "output/HXOutputFormatterText.h"

#include "model/HXHeftSwitches.h"
#include "platform/HXInternalError.h"
#include "platform/HXPlatform.h"

#include <bsd/stdlib.h>

#include <algorithm>

namespace {

constexpr char kRulePart[] = "==========";

// A category table's size columns, in order.
enum Column { dirtyColumn, swappedColumn, cleanColumn, reclaimableColumn, wiredColumn, sizeColumns };

struct ColumnWidths {
    int formatted;
    int others; // bytes and pages
};
constexpr ColumnWidths columnWidths[sizeColumns] = {{7, 11}, {11, 14}, {11, 14}, {13, 14}, {11, 14}};

using Key = uint64_t (*)(const HXMemoryCategory &);

uint64_t dirtyAndSwapped(const HXMemoryCategory &c) {
    return c.totalDirtySize() + c.totalSwappedSize();
}

struct SortColumn {
    const char *name;
    std::vector<Key> keys; // larger first, each deciding among equals of those before
};

const std::vector<SortColumn> &sortColumns() {
    static const std::vector<SortColumn> columns = {
        {"Dirty",
         {dirtyAndSwapped, [](const HXMemoryCategory &c) { return c.totalReclaimableSize(); },
          [](const HXMemoryCategory &c) { return c.totalCleanSize(); }}},
        {"Swapped", {[](const HXMemoryCategory &c) { return c.totalSwappedSize(); }}},
        {"Clean", {[](const HXMemoryCategory &c) { return c.totalCleanSize(); }}},
        {"Reclaimable", {[](const HXMemoryCategory &c) { return c.totalReclaimableSize(); }}},
        {"Wired", {[](const HXMemoryCategory &c) { return c.totalWiredSize(); }}},
        {"Regions", {[](const HXMemoryCategory &c) { return static_cast<uint64_t>(c.totalRegions()); }}},
        {"Category", {}},
    };
    return columns;
}

std::string humanized(int64_t size) {
    char buffer[8];
    if (humanize_number(buffer, sizeof buffer, size, "B", HN_AUTOSCALE, 0) < 0) return "?";
    return buffer;
}

} // namespace

// One line of a category table below the titles.
struct HXOutputFormatterText::Row {
    uint64_t sizes[sizeColumns];
    int32_t regions;
    const std::string &name;
    HXString detail;
};

HXOutputFormatterText::HXOutputFormatterText(int32_t summaryFormat, int32_t options, std::string sort)
    : _summaryFormat(summaryFormat), _options(options), _sort(std::move(sort)), _output(stdout) {
    if (showsSwapped()) _swappedColumnName = "(Swapped)";
    if (showsWired()) _wiredColumnName = "(Wired)";
}

std::string HXOutputFormatterText::formattedStringForSize(uint64_t size) const {
    const auto asSigned = static_cast<int64_t>(size);
    if (_summaryFormat == HXFormatBytes) return std::to_string(asSigned) + " B";
    if (_summaryFormat == HXFormatFormatted) return humanized(asSigned);
    const uint64_t pageSize = _pageSize != 0 ? _pageSize : HXPlatform::current().vm_kernel_page_size();
    return std::to_string((size + pageSize - 1) / pageSize) + " pages";
}

HXString HXOutputFormatterText::_truncatedNameForString(HXString text) const {
    if (!text || _options & HXTextWide) return text;
    const std::string_view last = HXLastPathComponent(text.str());
    return last.size() == text.str().size() ? text : HXString::intern(".../" + std::string(last));
}

void HXOutputFormatterText::printRule(const char *lineEnd) {
    const auto part = [](bool shown) { return shown ? kRulePart : ""; };
    const auto width = [](bool shown) { return shown ? 10 : 0; };
    fprintf(_output, "%s%s%s%*s%s%s%*s%s%s%s", kRulePart, kRulePart, kRulePart, width(showsSwapped()),
            part(showsSwapped()), kRulePart, kRulePart, width(showsWired()), part(showsWired()), kRulePart,
            kRulePart, lineEnd);
}

// A line of seven texts under the columns: titles or dashes.
void HXOutputFormatterText::printTitleLike(const char *const titles[7]) {
    for (int column = 0; column < sizeColumns; column++) {
        const bool hidden =
            (column == swappedColumn && !showsSwapped()) || (column == wiredColumn && !showsWired());
        const ColumnWidths &widths = columnWidths[column];
        const int width = _summaryFormat == HXFormatFormatted ? widths.formatted : widths.others;
        fprintf(_output, "%*s", hidden ? 0 : width, hidden ? "" : titles[column]);
    }
    fprintf(_output, " %10s    %s", titles[5], titles[6]);
}

void HXOutputFormatterText::printRow(const Row &row) {
    std::string sizes[sizeColumns];
    const char *texts[7];
    for (int column = 0; column < sizeColumns; column++) {
        sizes[column] = formattedStringForSize(row.sizes[column]);
        texts[column] = sizes[column].c_str();
    }
    const std::string regions = std::to_string(row.regions);
    texts[5] = regions.c_str();
    texts[6] = row.name.c_str();
    printTitleLike(texts);
    // One blank, then the text, whatever its letters.
    if (row.detail) fprintf(_output, " %s", row.detail.c_str());
    fputc('\n', _output);
}

static constexpr const char *kDashes[7] = {"---", "---", "---", "---", "---", "---", "---"};

void HXOutputFormatterText::printTable(const HXCategoryMap &categories, const HXMemoryTotal &total) {
    const char *titles[7] = {"Dirty",       _swappedColumnName.c_str(), "Clean",
                             "Reclaimable", _wiredColumnName.c_str(),   "Regions",
                             "Category"};
    printTitleLike(titles);
    fputc('\n', _output);
    printTitleLike(kDashes);
    fputc('\n', _output);
    _printCategories(categories);
    _printTotalFooter(total);
}

std::vector<const HXCategoryMap::Entry *>
HXOutputFormatterText::_sortedKeysForCategories(const HXCategoryMap &categories) const {
    const auto &columns = sortColumns();
    const auto column =
        std::find_if(columns.begin(), columns.end(), [this](const SortColumn &c) { return c.name == _sort; });
    HXRequire(column != columns.end(), "_sortedKeysForCategories", "Unhandled text sort column");
    std::vector<const HXCategoryMap::Entry *> sorted;
    for (const HXCategoryMap::Entry &entry : categories.entries())
        sorted.push_back(&entry);
    std::sort(sorted.begin(), sorted.end(),
              [&](const HXCategoryMap::Entry *a, const HXCategoryMap::Entry *b) {
                  for (const Key key : column->keys) {
                      const uint64_t keyOfA = key(*a->category);
                      const uint64_t keyOfB = key(*b->category);
                      if (keyOfA != keyOfB) return keyOfA > keyOfB;
                  }
                  return a->key < b->key;
              });
    return sorted;
}

void HXOutputFormatterText::_printCategories(const HXCategoryMap &categories) {
    for (const HXCategoryMap::Entry *entry : _sortedKeysForCategories(categories)) {
        const HXMemoryCategory &category = *entry->category;
        const HXString name = category.name();
        printRow({{dirtyAndSwapped(category), category.totalSwappedSize(), category.totalCleanSize(),
                   category.totalReclaimableSize(), category.totalWiredSize()},
                  category.totalRegions(),
                  name ? name.str() : entry->key,
                  _truncatedNameForString(category.detailedName())});
    }
}

void HXOutputFormatterText::_printTotalFooter(const HXMemoryTotal &total) {
    static const std::string name = "TOTAL";
    printTitleLike(kDashes);
    fputc('\n', _output);
    printRow({{total.dirty + total.swapped, total.swapped, total.clean, total.reclaimable, total.wired},
              static_cast<int32_t>(total.regionCount),
              name,
              HXString()});
}

void HXOutputFormatterText::printProcessHeader(const HXProcess &process) {
    if (_processCount != 2) _processCount++;
    _pageSize = process.pageSize();
    printRule("\n");
    fprintf(_output, "%s: %s-bit", process.displayString().c_str(), process.is64bit() ? "64" : "32");
    if (!process.warnings().empty()) {
        fputs("\nWarnings were encountered while examining the process.\n", _output);
        for (const std::string &warning : process.warnings())
            fprintf(_output, "\t%s\n", warning.c_str());
    }
    if (process.hasErrors()) {
        fputs("\nErrors were encountered while examining the process. No results gathered.\n", _output);
        for (const std::string &error : process.errors())
            fprintf(_output, "\t%s\n", error.c_str());
    }
}

void HXOutputFormatterText::printProcessTotal(uint64_t heft, const HXProcess &process) {
    fprintf(_output, "\tHeft: %s (%lu bytes per page)\n", formattedStringForSize(heft).c_str(),
            static_cast<unsigned long>(process.pageSize()));
}

void HXOutputFormatterText::endProcessHeader(const HXProcess &) {
    printRule("\n\n");
}

void HXOutputFormatterText::printProcessCategories(const HXCategoryMap &categories,
                                                   const HXMemoryTotal &total) {
    printTable(categories, total);
    fputc('\n', _output);
}

void HXOutputFormatterText::printSharedCategories(const std::shared_ptr<const HXCategoryMap> &categories,
                                                  const HXProcessGroup &group, const HXProcess &process, bool,
                                                  const HXMemoryTotal &total) {
    constexpr size_t mostNamed = 20;
    const size_t members = group.processes().size();
    if (members <= mostNamed) {
        fputs("Shared with", _output);
        size_t printed = 0;
        for (const HXRegionOwner *member : group.processes()) {
            if (member->isEqual(process)) continue;
            fprintf(_output, " %s", member->displayString().c_str());
            if (++printed < members - 1) fputc(',', _output);
        }
        fputs(":\n", _output);
    } else {
        fprintf(_output, "Shared with %lu processes:\n", static_cast<unsigned long>(members));
    }
    printTable(*categories, total);
    fputc('\n', _output);
}

void HXOutputFormatterText::printProcessAuxData(const HXAuxDictionary *data) {
    if (!data) return;
    printAuxData(*data);
    fputc('\n', _output);
}

void HXOutputFormatterText::printProcessesWithWarnings(const Processes &withWarnings,
                                                       const Processes &withErrors,
                                                       const std::vector<std::string> &globalErrors) {
    if (!withWarnings.empty()) {
        fputs("\nWarnings were encountered while examining the following processes:\n", _output);
        for (const HXProcess *process : withWarnings)
            fprintf(_output, "\t%s\n", process->name().c_str());
    }
    if (!withErrors.empty()) {
        fputs("\nErrors were encountered while examining the following processes:\n", _output);
        for (const HXProcess *process : withErrors)
            fprintf(_output, "\t%s\n", process->name().c_str());
    }
    if (!globalErrors.empty()) {
        fputs("\nErrors were encountered:\n", _output);
        for (const std::string &error : globalErrors)
            fprintf(_output, "\t%s\n", error.c_str());
    }
    if (!withErrors.empty() || !globalErrors.empty())
        fputs("\nDue to errors, summary results may be invalid\n", _output);
}

void HXOutputFormatterText::_printPhysHeftBreakdownEnabled() {
    if (!HXHeftSwitches::breakDownPhysHeft()) fputs("VM Object Dirty Analysis: Enabled\n", _output);
}

void HXOutputFormatterText::printSummaryCategories(const HXCategoryMap &categories,
                                                   const HXMemoryTotal &total, bool hadErrors) {
    _printPhysHeftBreakdownEnabled();
    if (_processCount == 1) return; // the one process's own tables say it all
    printRule("\n");
    fprintf(_output, "Summary Heft: %s%s\n", formattedStringForSize(total.dirty + total.swapped).c_str(),
            hadErrors ? " (may be invalid due to errors)" : "");
    printRule("\n\n");
    printTable(categories, total);
}

void HXOutputFormatterText::printGlobalAuxData(const HXAuxDictionary *data) {
    if (_processCount == 1) return;
    fputc('\n', _output);
    printProcessAuxData(data);
}

void HXOutputFormatterText::printAuxData(const HXAuxDictionary &data) {
    fputs("Auxiliary data:\n", _output);
    _printAuxData(data, 1);
}

void HXOutputFormatterText::_printAuxData(const HXAuxDictionary &data, uint32_t indent) {
    for (const auto &[key, node] : data.entries()) {
        for (uint32_t i = 0; i < indent; i++)
            fputc('\t', _output);
        if (node->isContainer()) {
            fprintf(_output, "%s:\n", key.c_str());
            _printAuxData(static_cast<const HXAuxDictionary &>(*node), indent + 1);
        } else {
            const int64_t value = static_cast<const HXAuxData &>(*node).value();
            fprintf(_output, "%s: %s\n", key.c_str(),
                    formattedStringForSize(static_cast<uint64_t>(value)).c_str());
        }
    }
}

void HXOutputFormatterText::end() {
    fflush(_output);
}
