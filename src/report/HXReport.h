// The model of a report that the companion programs work on: which set of processes holds how much memory of
// which category. A formatter fills it from an analysis (HXReportFormatter), a reader from a JSON document
// (HXReportReader).
#pragma once

#include "model/HXSizes.h"
#include "model/HXString.h"

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

// The sizes of a row, in bytes, and the number of its regions.
struct HXReportSizes {
    uint64_t heft = 0; // dirty and swapped
    uint64_t swapped = 0;
    uint64_t clean = 0;
    uint64_t reclaimable = 0;
    uint64_t wired = 0;
    uint32_t regions = 0;

    HXReportSizes &operator+=(const HXReportSizes &other);
    bool operator==(const HXReportSizes &) const = default;
};

// Processes, categories and sets are numbers that count from 0 in the order in which they were added. Strings
// are interned. Every byte of the summary is in the rows of exactly one
// set, but for those of processes with errors, of which nothing is told.
class HXReport {
  public:
    using Number = uint32_t;
    static constexpr Number kNone = UINT32_MAX;
    static constexpr int32_t kKernelPid = 0;

    struct Process {
        int32_t pid = 0;
        HXString name; // none: it has memory in common with others, but no report of its own
        uint64_t heft = 0;
        bool isShown = false;   // has a report of its own
        bool hasErrors = false; // which then has no figures
    };
    // So much memory of a category.
    struct Row {
        Number category = 0;
        HXReportSizes sizes;
    };
    // What one process sees of a set's memory, where not all of the set see the same.
    struct View {
        Number set;
        Number process;
        std::span<const Row> rows;
    };
    // A mapping, or memory without an address; only of documents and analyses that list them.
    struct Region {
        Number process = 0;
        HXString name;
        uint64_t object = 0;
        std::optional<uint64_t> start;
        uint64_t size = 0;
        uint64_t offset = 0;
        HXReportSizes sizes; // as listed: of one region
    };
    // A figure of the auxiliary data: its keys, joined by ": ".
    struct Figure {
        Number process = 0;
        HXString name;
        int64_t value = 0;
    };

    // ---- Reading ----
    const std::vector<Process> &processes() const { return _processes; }
    const std::vector<HXString> &categories() const { return _categories; }
    // Sets of one process hold what is its alone.
    size_t setCount() const { return _sets.size(); }
    // The members' numbers in ascending order; never none.
    std::span<const Number> members(Number set) const;
    // What the whole set holds, each byte once.
    std::span<const Row> rows(Number set) const;
    size_t viewCount() const { return _views.size(); }
    // Views of one set follow each other.
    View view(size_t i) const;
    // The views of a set: [first, last) of view(). Members without one see the whole.
    std::pair<size_t, size_t> viewsOfSet(Number set) const;
    // By process in the order of the regions.
    const std::vector<Region> &regions() const { return _regions; }
    const std::vector<Figure> &figures() const { return _figures; }
    // All memory, each byte once, by category; and the sum.
    const std::vector<Row> &summary() const { return _summary; }
    HXReportSizes total() const { return sum(_summary); }
    const std::vector<std::string> &errors() const { return _errors; }
    const std::vector<std::string> &warnings() const { return _warnings; }
    // Bytes in a page; 0 where that is not known.
    uint64_t pageSize() const { return _pageSize; }
    // Whether the sizes are what memory objects see, not what the kernel charges.
    bool isOfObjects() const { return _isOfObjects; }
    // The record of a pid; none when there is none. Where several have it, the first.
    std::optional<Number> processOfPid(int32_t pid) const;
    // Whether the kernel's record is among the processes: then the report is of a whole machine.
    bool hasKernel() const { return processOfPid(kKernelPid).has_value(); }

    static HXReportSizes sum(std::span<const Row> rows);

    // ---- Filling; `finish` comes last ----
    // A record with a report of its own; one with the pid that only sets knew becomes it.
    Number addProcess(int32_t pid, HXString name);
    void setHeft(Number process, uint64_t heft) { _processes[process].heft = heft; }
    void setHasErrors(Number process) { _processes[process].hasErrors = true; }
    Number category(HXString name);
    // The set of exactly these processes, in any order.
    Number set(std::vector<Number> members);
    // The process of a pid, made without a report of its own where there is none yet.
    Number memberOfPid(int32_t pid);
    void addRows(Number set, std::span<const Row> rows);
    void addView(Number set, Number process, std::span<const Row> rows);
    void addRegion(const Region &region) { _regions.push_back(region); }
    void addFigure(const Figure &figure) { _figures.push_back(figure); }
    void addSummaryRow(const Row &row) { _summary.push_back(row); }
    void addError(std::string error) { _errors.push_back(std::move(error)); }
    void addWarning(std::string warning) { _warnings.push_back(std::move(warning)); }
    void setPageSize(uint64_t bytes) { _pageSize = bytes; }
    void setIsOfObjects(bool isOfObjects) { _isOfObjects = isOfObjects; }
    // Puts the views in order.
    void finish();
    // What the sets with views hold is not known: estimates it from the views and the summary, each size
    // between the largest view and the sum of all. Exact for a category that one such set has. Once, after
    // `finish`.
    void estimateSetsFromViews();

  private:
    struct Slice {
        uint32_t first = 0;
        uint32_t count = 0;
    };
    struct SetRecord {
        Slice members;
        Slice rows;
        Slice views; // once finished
    };
    struct ViewRecord {
        Number set;
        Number process;
        Slice rows;
    };

    Slice store(std::span<const Row> rows);

    std::vector<Process> _processes;
    std::unordered_map<int32_t, Number> _byPid;
    std::vector<HXString> _categories;
    std::unordered_map<const void *, Number> _byCategory; // by the identity of the name
    std::vector<SetRecord> _sets;
    std::unordered_multimap<uint64_t, Number> _byMembers; // by a hash of the members
    std::vector<Number> _members;
    std::vector<Row> _rows;
    std::vector<ViewRecord> _views;
    std::vector<Region> _regions;
    std::vector<Figure> _figures;
    std::vector<Row> _summary;
    std::vector<std::string> _errors;
    std::vector<std::string> _warnings;
    uint64_t _pageSize = 0;
    bool _isOfObjects = false;
};
