#include "output/HXOutputFormatterJSON.h"

#include "model/HXHeftSwitches.h"
#include "platform/HXPlatform.h"

#include <cerrno>
#include <cinttypes>

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
    std::FILE *stream = HXPlatform::current().services().fopen(path, "w+");
    if (!stream) return nullptr;
    return std::unique_ptr<HXOutputFormatterJSON>(new HXOutputFormatterJSON(stream));
}

HXOutputFormatterJSON::HXOutputFormatterJSON(std::FILE *stream) : _stream(stream) {
    open('{');
    key("\"unit\":");
    text("byte");
    member("\"bytes per unit\":", 1);
    if (!HXHeftSwitches::breakDownPhysHeft()) {
        key("\"vm_object_dirty_analysis\":");
        fputs("true", _stream);
        _needsComma = true;
    }
    key("\"processes\":");
    open('[');
}

HXOutputFormatterJSON::~HXOutputFormatterJSON() {
    if (_stream) fclose(_stream);
}

void HXOutputFormatterJSON::noteFailure() {
    if (_writeError == 0) _writeError = errno != 0 ? errno : EIO;
}

void HXOutputFormatterJSON::separate() {
    if (_needsComma) fputc(',', _stream);
}

void HXOutputFormatterJSON::key(const char *literal) {
    separate();
    fputs(literal, _stream);
    _needsComma = false;
}

void HXOutputFormatterJSON::keyNamed(const std::string &name) {
    separate();
    fprintf(_stream, "\"%s\":", name.c_str());
    _needsComma = false;
}

void HXOutputFormatterJSON::open(char bracket) {
    separate();
    fputc(bracket, _stream);
    _needsComma = false;
}

void HXOutputFormatterJSON::close(char bracket) {
    fputc(bracket, _stream);
    _needsComma = true;
}

void HXOutputFormatterJSON::number(uint64_t value) {
    fprintf(_stream, "%" PRIu64, value);
    _needsComma = true;
}

void HXOutputFormatterJSON::signedNumber(int64_t value) {
    fprintf(_stream, "%" PRId64, value);
    _needsComma = true;
}

void HXOutputFormatterJSON::text(const std::string &value) {
    fprintf(_stream, "\"%s\"", value.c_str());
    _needsComma = true;
}

void HXOutputFormatterJSON::texts(const char *literal, const std::vector<std::string> &values) {
    key(literal);
    open('[');
    for (const std::string &value : values) {
        separate();
        text(value);
    }
    close(']');
}

void HXOutputFormatterJSON::member(const char *literal, uint64_t value) {
    key(literal);
    number(value);
}

void HXOutputFormatterJSON::sizes(uint64_t dirty, uint64_t swapped, uint64_t clean, uint64_t reclaimable,
                                  uint64_t wired, uint32_t regions) {
    member("\"dirty\":", dirty + swapped);
    member("\"swapped\":", swapped);
    member("\"clean\":", clean);
    member("\"reclaimable\":", reclaimable);
    member("\"wired\":", wired);
    member("\"regions\":", regions);
}

void HXOutputFormatterJSON::region(const HXMemoryRegion &region) {
    const auto unlessZero = [this](const char *literal, uint64_t value) {
        if (value != 0) member(literal, value);
    };
    open('{');
    member("\"id\":", region.object_id());
    key("\"name\":");
    text(escaped(region.fullName()));
    if (region.start() != kNoAddress) member("\"addr\":", region.start());
    member("\"vsize\":", region.size());
    unlessZero("\"offset\":", region.offset());
    unlessZero("\"dirty\":", region.dirtySize());
    unlessZero("\"swapped\":", region.swappedSize());
    unlessZero("\"clean\":", region.cleanNonSpecSize());
    unlessZero("\"reclaimable\":", region.reclaimableSize());
    unlessZero("\"wired\":", region.wiredSize());
    close('}');
}

void HXOutputFormatterJSON::printProcessHeader(const HXProcess &process) {
    open('{');
    key("\"name\":");
    text(escaped(process.name()));
    key("\"pid\":");
    signedNumber(process.pid());
    if (process.hasErrors()) texts("\"errors\":", process.errors());
    if (!process.warnings().empty()) texts("\"warnings\":", process.warnings());
    if (_verbose) {
        key("\"regions\":");
        open('[');
        for (const HXMemoryRegion &each : process.memoryRegions())
            region(each);
        close(']');
    }
    if (_pageSize == 0) _pageSize = process.pageSize();
}

void HXOutputFormatterJSON::printProcessTotal(uint64_t heft, const HXProcess &) {
    member("\"heft\":", heft);
}

void HXOutputFormatterJSON::printProcessCategories(const HXCategoryMap &categories, const HXMemoryTotal &) {
    key("\"categories\":");
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
        entry.pids.push_back(member->asNumber());
    if (hasProcessView) entry.specificToPid = process.asNumber();
    _shared.push_back(std::move(entry));
}

void HXOutputFormatterJSON::printProcessAuxData(const HXAuxDictionary *data) {
    key("\"auxiliary\":");
    errno = 0;
    JSONForAuxData(data);
    close('}');
    if (fflush(_stream) != 0) noteFailure(); // while the reason is known
}

void HXOutputFormatterJSON::printProcessesWithWarnings(const Processes &withWarnings,
                                                       const Processes &withErrors,
                                                       const std::vector<std::string> &globalErrors) {
    close(']');
    std::vector<std::string> errors = globalErrors;
    for (const HXProcess *process : withErrors)
        for (const std::string &error : process->errors())
            errors.push_back(error);
    std::vector<std::string> warnings;
    for (const HXProcess *process : withWarnings)
        warnings.insert(warnings.end(), process->warnings().begin(), process->warnings().end());
    texts("\"errors\":", errors);
    texts("\"warnings\":", warnings);
}

void HXOutputFormatterJSON::printSummaryCategories(const HXCategoryMap &categories,
                                                   const HXMemoryTotal &total, bool) {
    key("\"summary\":");
    open('{');
    JSONForCategories(categories);
    key("\"total\":");
    open('{');
    sizes(total.dirty, total.swapped, total.clean, total.reclaimable, total.wired, total.regionCount);
    close('}');
    close('}');
    member("\"total heft\":", total.dirty + total.swapped);
}

void HXOutputFormatterJSON::printGlobalAuxData(const HXAuxDictionary *data) {
    key("\"auxiliary\":");
    JSONForAuxData(data);
}

void HXOutputFormatterJSON::sharedEntry(const SharedEntry &entry) {
    open('{');
    key("\"pids\":");
    open('[');
    for (const int32_t pid : entry.pids) {
        separate();
        signedNumber(pid);
    }
    close(']');
    if (entry.specificToPid) {
        key("\"specific_to_pid\":");
        signedNumber(*entry.specificToPid);
    }
    key("\"categories\":");
    open('{');
    JSONForCategories(*entry.categories);
    close('}');
    close('}');
}

void HXOutputFormatterJSON::end() {
    key("\"shared\":");
    open('[');
    for (const SharedEntry &entry : _shared)
        sharedEntry(entry);
    close(']');
    if (_pageSize == 0) _pageSize = HXPlatform::current().vm_kernel_page_size();
    member("\"page size\":", _pageSize);
    close('}');
    errno = 0;
    if (fflush(_stream) != 0 || ferror(_stream)) noteFailure();
    if (fclose(_stream) != 0) noteFailure();
    _stream = nullptr;
}

void HXOutputFormatterJSON::JSONForCategories(const HXCategoryMap &categories) {
    for (const auto &[name, category] : categories.entries()) {
        keyNamed(escaped(category->fullName()));
        open('{');
        sizes(category->totalDirtySize(), category->totalSwappedSize(), category->totalCleanSize(),
              category->totalReclaimableSize(), category->totalWiredSize(),
              static_cast<uint32_t>(category->totalRegions()));
        close('}');
    }
}

void HXOutputFormatterJSON::JSONForAuxData(const HXAuxDataType *data) {
    if (!data || !data->isContainer())
        return signedNumber(data ? static_cast<const HXAuxData *>(data)->value() : 0);
    open('{');
    for (const auto &[name, node] : static_cast<const HXAuxDictionary *>(data)->entries()) {
        keyNamed(name);
        JSONForAuxData(node.get());
    }
    close('}');
}
