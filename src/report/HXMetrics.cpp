#include "report/HXMetrics.h"

#include <algorithm>
#include <cstdio>
#include <map>
#include <string_view>
#include <utility>
#include <vector>

namespace {

// A label's value: backslashes, double quotes and line ends are escaped.
std::string escaped(std::string_view text) {
    std::string result;
    for (const char c : text) {
        if (c == '\\' || c == '"') result += '\\';
        if (c == '\n')
            result += "\\n";
        else
            result += c;
    }
    return result;
}

class Writer {
  public:
    // A family of gauges; `unit` is the end of its name, or empty.
    void family(const std::string &name, std::string_view unit, std::string_view help) {
        _name = name;
        _text += "# TYPE " + name + " gauge\n";
        if (!unit.empty()) _text += "# UNIT " + name + ' ' + std::string(unit) + '\n';
        _text += "# HELP " + name + ' ' + std::string(help) + '\n';
    }
    void value(const std::string &value) { _text += _name + ' ' + value + '\n'; }
    void value(std::string_view label, std::string_view of, uint64_t value) {
        _text +=
            _name + '{' + std::string(label) + "=\"" + escaped(of) + "\"} " + std::to_string(value) + '\n';
    }
    std::string text() && { return std::move(_text) + "# EOF\n"; }

  private:
    std::string _name;
    std::string _text;
};

struct GroupFamily {
    const char *name;
    const char *help;
    uint64_t HXGroupFigures::*figure;
};
constexpr GroupFamily kCommandFamilies[] = {
    {"heft_command_bytes", "Memory that the processes of a command hold, every byte once.",
     &HXGroupFigures::heft},
    {"heft_command_swapped_bytes", "What of it is swapped out.", &HXGroupFigures::swapped},
};
constexpr GroupFamily kUnitFamilies[] = {
    {"heft_unit_bytes", "Memory that the processes of a systemd unit hold, every byte once.",
     &HXGroupFigures::heft},
    {"heft_unit_freed_if_stopped_bytes", "What of it nobody outside the unit holds.", &HXGroupFigures::freed},
    {"heft_unit_swapped_bytes", "What of it is swapped out.", &HXGroupFigures::swapped},
};

template <size_t count>
void writeGroups(const std::vector<HXReportGroup> &groups, const GroupFamily (&families)[count],
                 std::string_view label, Writer &writer) {
    for (const GroupFamily &family : families) {
        writer.family(family.name, "bytes", family.help);
        for (const HXReportGroup &group : groups)
            writer.value(label, group.name, group.*family.figure);
    }
}

void writeCategories(const HXReport &report, size_t most, Writer &writer) {
    std::map<std::string, uint64_t> hefts; // several may have one name once made safe
    for (const HXReport::Row &row : report.summary())
        if (row.sizes.heft != 0) hefts[report.categories()[row.category].str()] += row.sizes.heft;
    std::vector<std::pair<std::string, uint64_t>> order(hefts.begin(), hefts.end());
    std::ranges::stable_sort(order, [](const auto &a, const auto &b) { return a.second > b.second; });
    writer.family("heft_category_bytes", "bytes", "Memory of a category, every byte once.");
    uint64_t rest = 0;
    bool hasRest = false;
    for (size_t i = 0, told = 0; i < order.size(); i++) {
        if (told < most && order[i].first != kOtherGroup) {
            writer.value("category", order[i].first, order[i].second);
            told++;
        } else {
            rest += order[i].second;
            hasRest = true;
        }
    }
    if (hasRest) writer.value("category", kOtherGroup, rest);
}

} // namespace

std::string HXMetricsText(const HXReport &report, const HXMetricsSetting &setting) {
    Writer writer;
    const HXGroupedReport commands = HXGroupReport(report, HXGroupBy::command, setting.places, setting.most);
    const auto number = [&](const char *name, std::string_view unit, std::string_view help, uint64_t value) {
        writer.family(name, unit, help);
        writer.value(std::to_string(value));
    };
    number("heft_machine_bytes", "bytes", "Memory that all processes and the kernel hold, every byte once.",
           commands.total.heft);
    number("heft_machine_swapped_bytes", "bytes", "What of it is swapped out.", commands.total.swapped);
    if (report.hasKernel())
        number("heft_kernel_bytes", "bytes", "What of it is the kernel's own.", commands.kernel.heft);
    number("heft_processes", "", "Processes that were examined, the kernel included.",
           commands.total.processes);
    number("heft_unexamined_processes", "", "Processes that could not be examined to the end.",
           commands.unexamined);
    number("heft_errors", "", "Errors in the report.", report.errors().size());
    number("heft_warnings", "", "Warnings in the report.", report.warnings().size());
    char seconds[32];
    std::snprintf(seconds, sizeof seconds, "%.6f", setting.seconds);
    writer.family("heft_duration_seconds", "seconds", "How long the examination took.");
    writer.value(seconds);
    writeGroups(commands.groups, kCommandFamilies, "command", writer);
    if (setting.places)
        writeGroups(HXGroupReport(report, HXGroupBy::unit, setting.places, setting.most).groups,
                    kUnitFamilies, "unit", writer);
    writeCategories(report, setting.most, writer);
    return std::move(writer).text();
}
