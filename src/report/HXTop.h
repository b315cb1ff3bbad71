// The table of heft-top: a line for each process or group, the kernel's and the totals.
#pragma once

#include "report/HXReportGroups.h"

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <utility>
#include <vector>

struct HXTopSetting {
    HXGroupBy by = HXGroupBy::process;
    std::string sort = "heft"; // one of HXTop::sortNames()
    size_t most = SIZE_MAX;    // lines of groups
    bool showsChanges = false; // since the last reading and since the first
};

class HXTop {
  public:
    struct Row : HXReportGroup {
        bool canBeStopped = true;         // not so the kernel
        std::optional<int64_t> sinceLast; // change of the heft; none at the first reading
        std::optional<int64_t> sinceStart;
    };

    explicit HXTop(HXTopSetting setting) : _setting(std::move(setting)) {}

    static const std::vector<std::string> &sortNames();
    // Whether the table has the column that it is to be sorted by.
    static bool hasSortColumn(const HXTopSetting &setting);
    // Takes the next reading.
    void take(HXGroupedReport reading);
    // The rows of the last reading in order, all of them.
    const std::vector<Row> &rows() const { return _rows; }
    // The table in lines, with so many rows of groups at most.
    std::vector<std::string> lines(size_t mostRows) const;
    // The same as one JSON object.
    std::string json() const;

  private:
    using Key = std::pair<std::string, int32_t>; // name and pid
    using Hefts = std::map<Key, uint64_t>;

    void sortRows();

    const HXTopSetting _setting;
    std::vector<Row> _rows;
    HXGroupedReport _reading; // without its groups
    Row _kernel;
    Row _total;
    std::optional<Hefts> _last;
    Hefts _first;
};
