#include "output/HXOutputFormatterJSON.h"

#include "model/HXHeftSwitches.h"
#include "platform/HXPlatform.h"

#include <cerrno>
#include <charconv>
#include <iterator>

namespace {

std::string escaped(const std::string &text) {
    std::string result;
    for (const char c : text) {
        if (c == '"') result += '\\';
        result += c;
    }
    return result;
}

} // namespace

std::unique_ptr<HXOutputFormatterJSON> HXOutputFormatterJSON::withPath(const std::string &path) {
    auto file = HXPlatform::current().services().createPendingFile(path);
    if (!file) return nullptr;
    return std::unique_ptr<HXOutputFormatterJSON>(new HXOutputFormatterJSON(std::move(*file)));
}

HXOutputFormatterJSON::HXOutputFormatterJSON(HXPendingFile file)
    : _file(std::move(file)), _stream(_file.stream) {
    open('{');
    key("unit");
    text("byte");
    member("bytes per unit", 1);
    if (!HXHeftSwitches::breakDownPhysHeft()) {
        key("vm_object_dirty_analysis");
        raw("true");
    }
    key("processes");
    open('[');
}

HXOutputFormatterJSON::~HXOutputFormatterJSON() {
    HXPlatform::current().services().discardPendingFile(_file);
}

void HXOutputFormatterJSON::noteFailure() {
    if (_writeError == 0) _writeError = errno != 0 ? errno : EIO;
}

// Hands over what has been made so far.
void HXOutputFormatterJSON::flush() {
    errno = 0;
    if (fwrite(_text.data(), 1, _text.size(), _stream) != _text.size() || fflush(_stream) != 0)
        noteFailure(); // while the reason is known
    _text.clear();
}

void HXOutputFormatterJSON::separate() {
    if (_needsComma) _text += ',';
}

void HXOutputFormatterJSON::key(std::string_view name) {
    (_text += _needsComma ? ",\"" : "\"").append(name).append("\":");
    _needsComma = false;
}

void HXOutputFormatterJSON::open(char bracket) {
    constexpr size_t piece = 1 << 16; // bytes
    separate();
    _text += bracket;
    _needsComma = false;
    if (_text.size() > piece) flush();
}

void HXOutputFormatterJSON::close(char bracket) {
    _text += bracket;
    _needsComma = true;
}

void HXOutputFormatterJSON::raw(std::string_view json) {
    _text += json;
    _needsComma = true;
}

void HXOutputFormatterJSON::number(uint64_t value) {
    char digits[20];
    raw({digits, std::to_chars(digits, std::end(digits), value).ptr});
}

void HXOutputFormatterJSON::text(std::string_view value) {
    _text += '"';
    raw(value);
    _text += '"';
}

void HXOutputFormatterJSON::texts(std::string_view name, const std::vector<std::string> &values) {
    key(name);
    open('[');
    for (const std::string &value : values) {
        separate();
        text(value);
    }
    close(']');
}

void HXOutputFormatterJSON::member(std::string_view name, uint64_t value) {
    key(name);
    number(value);
}

// A total's dirty bytes include the swapped ones.
void HXOutputFormatterJSON::sizes(const HXMemoryTotal &total) {
    open('{');
    member("dirty", total.heft());
    member("swapped", total.swapped);
    member("clean", total.clean);
    member("reclaimable", total.reclaimable);
    member("wired", total.wired);
    member("regions", total.regionCount);
    close('}');
}

void HXOutputFormatterJSON::region(const HXMemoryRegion &region) {
    const auto unlessZero = [this](std::string_view name, uint64_t value) {
        if (value != 0) member(name, value);
    };
    open('{');
    member("id", region.object_id());
    key("name");
    text(escaped(region.fullName()));
    if (region.start() != kNoAddress) member("addr", region.start());
    member("vsize", region.size());
    unlessZero("offset", region.offset());
    unlessZero("dirty", region.listedSizes().dirty);
    unlessZero("swapped", region.listedSizes().swapped);
    unlessZero("clean", region.cleanNonSpecSize());
    unlessZero("reclaimable", region.reclaimableSize());
    unlessZero("wired", region.wiredSize());
    close('}');
}

void HXOutputFormatterJSON::printProcessHeader(const HXProcess &process) {
    open('{');
    key("name");
    text(escaped(process.name()));
    key("pid");
    raw(std::to_string(process.pid()));
    if (process.hasErrors()) texts("errors", process.errors());
    if (!process.warnings().empty()) texts("warnings", process.warnings());
    if (_verbose) {
        key("regions");
        open('[');
        for (const HXMemoryRegion &each : process.memoryRegions())
            if (!each.isPart()) region(each);
        close(']');
    }
    if (_pageSize == 0) _pageSize = process.pageSize();
}

void HXOutputFormatterJSON::printProcessTotal(uint64_t heft, const HXProcess &) {
    member("heft", heft);
}

void HXOutputFormatterJSON::printProcessCategories(const HXCategoryMap &categories, const HXMemoryTotal &) {
    key("categories");
    open('{');
    JSONForCategories(categories);
    close('}');
}

void HXOutputFormatterJSON::printSharedCategories(const std::shared_ptr<const HXCategoryMap> &categories,
                                                  const HXProcessGroup &group, const HXProcess &process,
                                                  bool hasProcessView, const HXMemoryTotal &) {
    // Groups reach the report frozen: equal groups are the same group.
    if (!hasProcessView && !_addedProcessGroups.insert(&group).second) return;
    SharedEntry entry{.pids = {}, .categories = categories, .specificToPid = std::nullopt};
    for (const HXRegionOwner *member : group.processes())
        entry.pids.push_back(member->pid());
    if (hasProcessView) entry.specificToPid = process.pid();
    _shared.push_back(std::move(entry));
}

void HXOutputFormatterJSON::printProcessAuxData(const HXAuxDictionary *data) {
    key("auxiliary");
    JSONForAuxData(data);
    close('}');
    flush();
}

void HXOutputFormatterJSON::printProcessesWithWarnings(const Processes &withWarnings,
                                                       const Processes &withErrors,
                                                       const HXGlobalMessages &messages) {
    close(']');
    std::vector<std::string> errors = messages.errors;
    for (const HXProcess *process : withErrors)
        for (const std::string &error : process->errors())
            errors.push_back(error);
    std::vector<std::string> warnings = messages.warnings;
    for (const HXProcess *process : withWarnings)
        warnings.insert(warnings.end(), process->warnings().begin(), process->warnings().end());
    texts("errors", errors);
    texts("warnings", warnings);
}

void HXOutputFormatterJSON::printSummaryCategories(const HXCategoryMap &categories,
                                                   const HXMemoryTotal &total, bool) {
    key("summary");
    open('{');
    JSONForCategories(categories);
    key("total");
    sizes(total);
    close('}');
    member("total heft", total.heft());
}

void HXOutputFormatterJSON::printGlobalAuxData(const HXAuxDictionary *data) {
    key("auxiliary");
    JSONForAuxData(data);
}

void HXOutputFormatterJSON::sharedEntry(const SharedEntry &entry) {
    open('{');
    key("pids");
    open('[');
    for (const int32_t pid : entry.pids) {
        separate();
        raw(std::to_string(pid));
    }
    close(']');
    if (entry.specificToPid) {
        key("specific_to_pid");
        raw(std::to_string(*entry.specificToPid));
    }
    key("categories");
    open('{');
    JSONForCategories(*entry.categories);
    close('}');
    close('}');
}

void HXOutputFormatterJSON::end() {
    key("shared");
    open('[');
    for (const SharedEntry &entry : _shared)
        sharedEntry(entry);
    close(']');
    if (_pageSize == 0) _pageSize = HXPlatform::current().vm_kernel_page_size();
    member("page size", _pageSize);
    close('}');
    flush();
    if (!HXPlatform::current().services().commitPendingFile(_file)) noteFailure();
}

void HXOutputFormatterJSON::JSONForCategories(const HXCategoryMap &categories) {
    for (const HXMemoryCategory &category : categories.categories()) {
        key(escaped(category.fullName()));
        sizes(category.total());
    }
}

void HXOutputFormatterJSON::JSONForAuxData(const HXAuxDictionary *data) {
    raw(data ? data->jsonRepresentation() : "0");
}
