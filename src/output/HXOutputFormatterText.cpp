#include "output/HXOutputFormatterText.h"

#include "model/HXHeftSwitches.h"
#include "platform/HXInternalError.h"
#include "platform/HXPlatform.h"

#include <bsd/stdlib.h>

#include <algorithm>

namespace {

using Figure = uint64_t (*)(const HXMemoryTotal &);

uint64_t clean(const HXMemoryTotal &total) {
    return total.clean;
}
uint64_t reclaimable(const HXMemoryTotal &total) {
    return total.reclaimable;
}
uint64_t regions(const HXMemoryTotal &total) {
    return total.regionCount;
}

std::string humanized(int64_t size) {
    char buffer[8]; // up to four digits, a blank, a prefix, "B" and the end
    if (humanize_number(buffer, sizeof buffer, size, "B", HN_AUTOSCALE, 0) < 0) return "?";
    return buffer;
}

void appendPadded(std::string &line, std::string_view text, int width) {
    const auto columns = static_cast<size_t>(width);
    line.append(columns - std::min(columns, text.size()), ' ');
    line += text;
}

std::vector<std::string> namesOf(const HXOutputFormatter::Processes &processes) {
    std::vector<std::string> names;
    for (const HXProcess *process : processes)
        names.push_back(process->name());
    return names;
}

} // namespace

// A column of a category table, the last one aside.
struct HXOutputFormatterText::Column {
    const char *name; // what it is sorted by
    const char *title;
    int formattedWidth;
    int otherWidth; // of bytes and pages
    int32_t option; // that shows it
    Figure figure;
};

// The dirty column includes the swapped bytes.
const HXOutputFormatterText::Column HXOutputFormatterText::kColumns[] = {
    {"Dirty", "Dirty", 7, 11, 0, [](const HXMemoryTotal &total) { return total.heft(); }},
    {"Swapped", "(Swapped)", 11, 14, HXTextSwapped, [](const HXMemoryTotal &total) { return total.swapped; }},
    {"Clean", "Clean", 11, 14, 0, clean},
    {"Reclaimable", "Reclaimable", 13, 14, 0, reclaimable},
    {"Wired", "(Wired)", 11, 14, HXTextWired, [](const HXMemoryTotal &total) { return total.wired; }},
    {"Regions", "Regions", 11, 11, 0, regions},
};

HXOutputFormatterText::HXOutputFormatterText(int32_t summaryFormat, int32_t options, std::string sort)
    : _summaryFormat(summaryFormat), _options(options), _sort(std::move(sort)), _output(stdout) {}

std::string HXOutputFormatterText::formattedStringForSize(uint64_t size) const {
    const auto asSigned = static_cast<int64_t>(size);
    if (_summaryFormat == HXFormatBytes) return std::to_string(asSigned) + " B";
    if (_summaryFormat == HXFormatFormatted) {
        // Most sizes are those of a few pages, and few are met once.
        HumanizedSize &known = _humanized[(size ^ size >> 12) % _humanized.size()];
        if (known.text.empty() || known.size != size) known = {size, humanized(asSigned)};
        return known.text;
    }
    const uint64_t pageSize = _pageSize != 0 ? _pageSize : HXPlatform::current().vm_kernel_page_size();
    return std::to_string((size + pageSize - 1) / pageSize) + " pages";
}

HXString HXOutputFormatterText::_truncatedNameForString(HXString text) const {
    if (!text || _options & HXTextWide) return text;
    const std::string_view last = HXLastPathComponent(text.str());
    return last.size() == text.str().size() ? text : HXString::intern(".../" + std::string(last));
}

void HXOutputFormatterText::printRule(const char *lineEnd) {
    const size_t width = 70 + (shows(HXTextSwapped) ? 10 : 0) + (shows(HXTextWired) ? 10 : 0);
    fprintf(_output, "%s%s", std::string(width, '=').c_str(), lineEnd);
}

template <typename Text>
void HXOutputFormatterText::printLine(Text text, std::string_view category, std::string_view detail) {
    _line.clear();
    for (const Column &column : kColumns)
        if (shows(column.option))
            appendPadded(_line, text(column),
                         _summaryFormat == HXFormatFormatted ? column.formattedWidth : column.otherWidth);
    _line.append("    ").append(category);
    if (!detail.empty()) _line.append(" ").append(detail);
    _line += '\n';
    fwrite(_line.data(), 1, _line.size(), _output);
}

void HXOutputFormatterText::printDashes() {
    printLine([](const Column &) { return "---"; }, "---");
}

void HXOutputFormatterText::printRow(const HXMemoryTotal &total, std::string_view category,
                                     std::string_view detail) {
    printLine(
        [&](const Column &column) {
            const uint64_t figure = column.figure(total);
            return column.figure == regions ? std::to_string(figure) : formattedStringForSize(figure);
        },
        category, detail);
}

void HXOutputFormatterText::printTable(const HXCategoryMap &categories, const HXMemoryTotal &total) {
    printLine([](const Column &column) { return column.title; }, "Category");
    printDashes();
    _printCategories(categories);
    _printTotalFooter(total);
}

std::vector<const HXMemoryCategory *>
HXOutputFormatterText::_sortedKeysForCategories(const HXCategoryMap &categories) const {
    std::vector<Figure> keys; // larger first, each deciding among equals of those before
    const auto column = std::find_if(std::begin(kColumns), std::end(kColumns),
                                     [this](const Column &each) { return each.name == _sort; });
    if (column != std::end(kColumns))
        keys.push_back(column->figure);
    else
        HXRequire(_sort == "Category", "_sortedKeysForCategories", "Unhandled text sort column");
    if (column == kColumns) keys.insert(keys.end(), {reclaimable, clean});

    std::vector<const HXMemoryCategory *> sorted;
    sorted.reserve(categories.categories().size());
    for (const HXMemoryCategory &category : categories.categories())
        sorted.push_back(&category);
    std::sort(sorted.begin(), sorted.end(), [&](const HXMemoryCategory *a, const HXMemoryCategory *b) {
        for (const Figure key : keys) {
            const uint64_t keyOfA = key(a->total());
            const uint64_t keyOfB = key(b->total());
            if (keyOfA != keyOfB) return keyOfA > keyOfB;
        }
        return a->fullName() < b->fullName();
    });
    return sorted;
}

void HXOutputFormatterText::_printCategories(const HXCategoryMap &categories) {
    for (const HXMemoryCategory *category : _sortedKeysForCategories(categories)) {
        const HXString detail = _truncatedNameForString(category->detailedName());
        printRow(category->total(), category->name().str(), detail ? detail.str() : std::string_view());
    }
}

void HXOutputFormatterText::_printTotalFooter(const HXMemoryTotal &total) {
    printDashes();
    printRow(total, "TOTAL");
}

void HXOutputFormatterText::printList(const char *heading, const std::vector<std::string> &texts) {
    if (texts.empty()) return;
    fprintf(_output, "\n%s\n", heading);
    for (const std::string &text : texts)
        fprintf(_output, "\t%s\n", text.c_str());
}

void HXOutputFormatterText::printProcessHeader(const HXProcess &process) {
    if (_processCount != 2) _processCount++;
    _pageSize = process.pageSize();
    printRule("\n");
    fprintf(_output, "%s: %s-bit", process.displayString().c_str(), process.is64bit() ? "64" : "32");
    printList("Warnings were encountered while examining the process.", process.warnings());
    printList("Errors were encountered while examining the process. No results gathered.", process.errors());
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
                                                       const HXGlobalMessages &messages) {
    printList("Warnings were encountered while examining the following processes:", namesOf(withWarnings));
    printList("Errors were encountered while examining the following processes:", namesOf(withErrors));
    printList("Warnings were encountered:", messages.warnings);
    printList("Errors were encountered:", messages.errors);
    if (!withErrors.empty() || !messages.errors.empty())
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
    fprintf(_output, "Summary Heft: %s%s\n", formattedStringForSize(total.heft()).c_str(),
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
