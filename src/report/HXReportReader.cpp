#include "report/HXReportReader.h"

#include "platform/HXSafeText.h"

#include <nlohmann/json.hpp>

namespace {

using Number = HXReport::Number;

// Where in the document a value stands; kIgnored: in a part that the model has no use for.
enum class Place : uint8_t {
    kRoot,
    kProcesses,
    kProcess,
    kRegions,
    kRegion,
    kCategories,
    kSizes,
    kAuxiliary,
    kShared,
    kSharedEntry,
    kPids,
    kErrors,
    kWarnings,
    kSummary,
    kIgnored,
};

struct Step {
    Place in;
    Place to;
    bool isObject;        // else an array
    std::string_view key; // empty: any key, or the element of an array
};
constexpr Step kSteps[] = {
    {Place::kRoot, Place::kProcesses, false, "processes"},
    {Place::kRoot, Place::kErrors, false, "errors"},
    {Place::kRoot, Place::kWarnings, false, "warnings"},
    {Place::kRoot, Place::kSummary, true, "summary"},
    {Place::kRoot, Place::kShared, false, "shared"},
    {Place::kProcesses, Place::kProcess, true, ""},
    {Place::kProcess, Place::kRegions, false, "regions"},
    {Place::kProcess, Place::kCategories, true, "categories"},
    {Place::kProcess, Place::kAuxiliary, true, "auxiliary"},
    {Place::kRegions, Place::kRegion, true, ""},
    {Place::kAuxiliary, Place::kAuxiliary, true, ""},
    {Place::kShared, Place::kSharedEntry, true, ""},
    {Place::kSharedEntry, Place::kPids, false, "pids"},
    {Place::kSharedEntry, Place::kCategories, true, "categories"},
    {Place::kCategories, Place::kSizes, true, ""},
    {Place::kSummary, Place::kSizes, true, ""},
};

struct SizeName {
    std::string_view name;
    uint64_t HXReportSizes::*size;
};
constexpr SizeName kSizeNames[] = {
    {"dirty", &HXReportSizes::heft},  {"swapped", &HXReportSizes::swapped},
    {"clean", &HXReportSizes::clean}, {"reclaimable", &HXReportSizes::reclaimable},
    {"wired", &HXReportSizes::wired},
};

// One process or one entry of "shared", complete at its end.
struct Entry {
    std::optional<int32_t> pid; // of an entry of "shared": whose view it is
    std::optional<HXString> name;
    uint64_t heft = 0;
    bool hasErrors = false;
    std::vector<int32_t> pids;
    std::vector<HXReport::Row> rows;
    std::vector<HXReport::Region> regions;
    std::vector<HXReport::Figure> figures;
};

// Takes the document value by value, so that it is never held as a whole.
class Reader : public nlohmann::json_sax<nlohmann::json> {
  public:
    Reader(HXReport &report, bool listsRegions) : _report(report), _listsRegions(listsRegions) {}

    bool isComplete() const { return _hasProcesses && _hasSummary; }
    const std::string &reason() const { return _reason; }

    bool null() override { return true; }
    bool boolean(bool value) override {
        if (place() == Place::kRoot && _key == "vm_object_dirty_analysis") _report.setIsOfObjects(value);
        return true;
    }
    bool number_integer(int64_t value) override { return number(value < 0 ? 0 : value, value); }
    bool number_unsigned(uint64_t value) override { return number(value, static_cast<int64_t>(value)); }
    bool number_float(double, const std::string &text) override { return fail("not a size: " + text); }
    bool string(std::string &text) override;
    bool binary(binary_t &) override { return true; }
    bool start_object(size_t) override { return enter(true); }
    bool key(std::string &text) override {
        _key.swap(text);
        return true;
    }
    bool end_object() override;
    bool start_array(size_t) override { return enter(false); }
    bool end_array() override;
    bool parse_error(size_t position, const std::string &, const nlohmann::detail::exception &) override {
        return fail("no complete JSON document: byte " + std::to_string(position));
    }

  private:
    Place place() const { return _places.empty() ? Place::kIgnored : _places.back(); }
    bool fail(const std::string &reason);
    bool enter(bool isObject);
    bool number(uint64_t value, int64_t signedValue);
    bool numberOfProcess(int64_t value, uint64_t size);
    void numberOfRegion(uint64_t value);
    bool takePid(int64_t value, std::optional<int32_t> *pid);
    void beginSizes();
    void endSizes();
    bool endProcess();
    bool endSharedEntry();
    void endSummary();

    HXReport &_report;
    const bool _listsRegions;
    std::vector<Place> _places;
    std::string _key;
    std::string _reason;
    Entry _entry;
    HXReport::Row _row; // whose sizes are being read
    HXReport::Region _region;
    std::vector<std::string> _auxiliaryPrefixes;
    bool _hasProcesses = false;
    bool _hasSummary = false;
};

bool Reader::fail(const std::string &reason) {
    if (_reason.empty()) _reason = reason;
    return false;
}

void Reader::beginSizes() {
    _row = {_report.category(HXString::intern(HXSafeText(_key))), {}};
}

bool Reader::enter(bool isObject) {
    if (_places.empty()) {
        if (!isObject) return fail("not a report of heft");
        _places.push_back(Place::kRoot);
        return true;
    }
    Place to = Place::kIgnored;
    for (const Step &step : kSteps) {
        if (step.in != place() || step.isObject != isObject || (!step.key.empty() && step.key != _key))
            continue;
        to = step.to;
        break;
    }
    // What is not wanted or not known is passed over.
    if (to == Place::kRegions && !_listsRegions) to = Place::kIgnored;
    if (place() == Place::kProcess && _key == "errors") _entry.hasErrors = true;
    if (to == Place::kSizes) beginSizes();
    if (to == Place::kProcess || to == Place::kSharedEntry || to == Place::kSummary) _entry = {};
    if (to == Place::kRegion) _region = {};
    if (to == Place::kAuxiliary)
        _auxiliaryPrefixes.push_back(
            place() != Place::kAuxiliary ? "" : _auxiliaryPrefixes.back() + HXSafeText(_key) + ": ");
    _hasProcesses = _hasProcesses || to == Place::kProcesses;
    _hasSummary = _hasSummary || to == Place::kSummary;
    _places.push_back(to);
    return true;
}

bool Reader::end_array() {
    _places.pop_back();
    return true;
}

bool Reader::end_object() {
    const Place ended = place();
    _places.pop_back();
    switch (ended) {
    case Place::kSizes:
        endSizes();
        break;
    case Place::kRegion:
        _entry.regions.push_back(_region);
        break;
    case Place::kProcess:
        return endProcess();
    case Place::kSummary:
        endSummary();
        break;
    case Place::kAuxiliary:
        _auxiliaryPrefixes.pop_back();
        break;
    case Place::kSharedEntry:
        return endSharedEntry();
    default:
        break;
    }
    return true;
}

bool Reader::string(std::string &text) {
    if (place() == Place::kProcess && _key == "name") _entry.name = HXString::intern(HXSafeName(text));
    if (place() == Place::kRegion && _key == "name") _region.name = HXString::intern(HXSafeText(text));
    if (place() == Place::kErrors) _report.addError(HXSafeText(text));
    if (place() == Place::kWarnings) _report.addWarning(HXSafeText(text));
    return true;
}

bool Reader::takePid(int64_t value, std::optional<int32_t> *pid) {
    if (value < INT32_MIN || value > INT32_MAX) return fail("not a process id: " + std::to_string(value));
    *pid = static_cast<int32_t>(value);
    return true;
}

bool Reader::numberOfProcess(int64_t value, uint64_t size) {
    if (_key == "pid") return takePid(value, &_entry.pid);
    if (_key == "heft") _entry.heft = size;
    return true;
}

void Reader::numberOfRegion(uint64_t value) {
    if (_key == "id") _region.object = value;
    if (_key == "addr") _region.start = value;
    if (_key == "vsize") _region.size = value;
    if (_key == "offset") _region.offset = value;
    for (const auto &[name, size] : kSizeNames)
        if (_key == name) _region.sizes.*size += value;
    // Of a region the dirty bytes do not include the swapped ones.
    if (_key == "swapped") _region.sizes.heft += value;
}

bool Reader::number(uint64_t value, int64_t signedValue) {
    switch (place()) {
    case Place::kRoot:
        if (_key == "page size") _report.setPageSize(value);
        return true;
    case Place::kProcess:
        return numberOfProcess(signedValue, value);
    case Place::kRegion:
        numberOfRegion(value);
        return true;
    case Place::kSizes:
        for (const auto &[name, size] : kSizeNames)
            if (_key == name) _row.sizes.*size = value;
        if (_key == "regions") _row.sizes.regions = static_cast<uint32_t>(value);
        return true;
    case Place::kAuxiliary:
        _entry.figures.push_back(
            {0, HXString::intern(_auxiliaryPrefixes.back() + HXSafeText(_key)), signedValue});
        return true;
    case Place::kSharedEntry:
        return _key != "specific_to_pid" || takePid(signedValue, &_entry.pid);
    case Place::kPids: {
        std::optional<int32_t> pid;
        if (!takePid(signedValue, &pid)) return false;
        _entry.pids.push_back(*pid);
        return true;
    }
    default:
        return true;
    }
}

void Reader::endSizes() {
    _entry.rows.push_back(_row);
}

bool Reader::endProcess() {
    if (!_entry.pid || *_entry.pid < 0) return fail("a process without a process id");
    const Number process = _report.addProcess(*_entry.pid, _entry.name.value_or(HXString()));
    _report.setHeft(process, _entry.heft);
    if (_entry.hasErrors) _report.setHasErrors(process);
    if (!_entry.rows.empty()) _report.addRows(_report.set({process}), _entry.rows);
    for (HXReport::Region &region : _entry.regions) {
        region.process = process;
        region.sizes.regions = 1;
        _report.addRegion(region);
    }
    for (HXReport::Figure &figure : _entry.figures) {
        figure.process = process;
        _report.addFigure(figure);
    }
    return true;
}

bool Reader::endSharedEntry() {
    if (_entry.pids.empty()) return fail("memory that is shared by nobody");
    std::vector<Number> members;
    for (const int32_t pid : _entry.pids)
        members.push_back(_report.memberOfPid(pid));
    const Number set = _report.set(std::move(members));
    if (_entry.pid)
        _report.addView(set, _report.memberOfPid(*_entry.pid), _entry.rows);
    else
        _report.addRows(set, _entry.rows);
    return true;
}

// The last of the summary is the total, whatever categories are called.
void Reader::endSummary() {
    for (size_t i = 0; i + 1 < _entry.rows.size(); i++)
        _report.addSummaryRow(_entry.rows[i]);
}

} // namespace

std::optional<HXReport> HXReadReport(std::string_view text, bool listsRegions, std::string *reason) {
    std::optional<HXReport> report(std::in_place);
    Reader reader(*report, listsRegions);
    const bool parsed = nlohmann::json::sax_parse(text.data(), text.data() + text.size(), &reader);
    if (!parsed || !reader.isComplete()) {
        *reason = reader.reason().empty() ? "not a report of heft" : reader.reason();
        return std::nullopt;
    }
    report->finish();
    report->estimateSetsFromViews();
    return report;
}
