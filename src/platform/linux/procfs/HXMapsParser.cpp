#include "platform/linux/procfs/HXMapsParser.h"

#include "platform/linux/procfs/HXProcText.h"
#include "platform/linux/procfs/HXTextNumber.h"

#include <algorithm>
#include <cstring>
#include <span>

namespace {

// Labels are padded to 16 characters, numbers right-aligned to eight or more (show_smap of the kernel).
constexpr size_t kLabelWidth = 16;
constexpr std::string_view kZero = "       0";

struct Field {
    std::string_view label;
    uint32_t HXMapping::*figure;
};
constexpr Field kFields[] = {
    {"Rss:            ", &HXMapping::residentPages}, {"Shared_Dirty:   ", &HXMapping::dirtyPages},
    {"Private_Dirty:  ", &HXMapping::dirtyPages},    {"Anonymous:      ", &HXMapping::anonymousPages},
    {"LazyFree:       ", &HXMapping::lazyFreePages}, {"Shared_Hugetlb: ", &HXMapping::hugePages},
    {"Private_Hugetlb:", &HXMapping::hugePages},     {"Swap:           ", &HXMapping::swappedPages},
};
constexpr size_t kNoField = std::size(kFields);
constexpr std::string_view kFlagsLabel = "VmFlags:";
constexpr uint16_t kPermitted = HXMappingMayRead | HXMappingMayWrite | HXMappingMayExecute;

constexpr uint16_t pair(char first, char second) {
    return static_cast<uint16_t>(static_cast<uint8_t>(first) | static_cast<uint8_t>(second) << 8);
}
uint16_t pairAt(const char *text) {
    return pair(text[0], text[1]);
}

bool isHexDigit(char c) {
    return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f');
}

uint16_t accessOf(std::string_view permissions) {
    uint16_t flags = kPermitted; // unless smaps says otherwise
    if (permissions[0] == 'r') flags |= HXMappingReadable;
    if (permissions[1] == 'w') flags |= HXMappingWritable;
    if (permissions[2] == 'x') flags |= HXMappingExecutable;
    if (permissions[3] == 's') flags |= HXMappingShared;
    return flags;
}

// Whether a line behind the first may begin a mapping.
bool holdsHeader(std::string_view text) {
    unsigned found =
        isHexDigit(text.front()); // without a branch, so that it is done for many characters at once
    for (size_t i = 1; i < text.size(); i++)
        found |= static_cast<unsigned>(text[i - 1] == '\n') & static_cast<unsigned>(isHexDigit(text[i]));
    return found != 0;
}

// "START-END PERM OFFSET MAJOR:MINOR INODE   PATH"
bool parseHeader(std::string_view text, HXMapsEntry *entry) {
    constexpr int hexadecimal = 16;
    constexpr size_t permissionsWidth = 4;
    HXTextCursor line{text};
    HXMapping &mapping = entry->mapping;
    uint32_t major = 0, minor = 0;
    if (!line.number(&mapping.start, hexadecimal) || !line.skip('-') ||
        !line.number(&mapping.end, hexadecimal) || !line.skip(' ') || line.rest.size() < permissionsWidth)
        return false;
    mapping.flags = accessOf(line.rest);
    line.rest.remove_prefix(permissionsWidth);
    if (!line.skip(' ') || !line.number(&mapping.offset, hexadecimal) || !line.skip(' ') ||
        !line.number(&major, hexadecimal) || !line.skip(':') || !line.number(&minor, hexadecimal) ||
        !line.field(&mapping.inode))
        return false;
    mapping.device = HXDeviceNumber(major, minor);
    line.rest.remove_prefix(std::min(line.rest.find_first_not_of(' '), line.rest.size()));
    entry->path = line.rest;
    return mapping.start < mapping.end;
}

// Takes smaps' word for what the mapping may be made to allow.
void setFlags(std::string_view flags, HXMapping *mapping) {
    mapping->flags = static_cast<uint16_t>((mapping->flags & ~kPermitted) | HXParseMappingFlags(flags));
}

size_t fieldAt(const char *label) {
    for (size_t i = 0; i < std::size(kFields); i++)
        if (std::memcmp(label, kFields[i].label.data(), kLabelWidth) == 0) return i;
    return kNoField;
}

} // namespace

uint16_t HXParseMappingFlags(std::string_view text) {
    static constexpr struct {
        uint16_t letters;
        uint16_t flag;
    } known[] = {
        {pair('m', 'r'), HXMappingMayRead},    {pair('m', 'w'), HXMappingMayWrite},
        {pair('m', 'e'), HXMappingMayExecute}, {pair('l', 'o'), HXMappingLocked},
        {pair('h', 't'), HXMappingHugePages},  {pair('d', 'c'), HXMappingNotInherited},
    };
    uint16_t flags = 0;
    size_t i = 0;
    while (i + 2 <= text.size()) {
        if (text[i] == ' ') {
            i++;
            continue;
        }
        const uint16_t letters = pairAt(text.data() + i);
        for (const auto &entry : known)
            if (letters == entry.letters) flags |= entry.flag;
        i += 2;
    }
    return flags;
}

void HXMapsParser::setField(size_t field, uint64_t kilobytes, HXMapping *mapping) const {
    uint32_t &figure = mapping->*kFields[field].figure;
    figure = static_cast<uint32_t>(std::min<uint64_t>(figure + (kilobytes >> _kilobyteShift), UINT32_MAX));
}

bool HXMapsParser::next(std::string_view *text, bool complete, HXMapsEntry *entry) {
    while (!text->empty()) {
        HXTextCursor cursor{*text};
        if (!complete && text->find('\n') == std::string_view::npos) return false;
        const std::string_view line = cursor.line();
        *entry = {};
        const bool isMapping = !line.empty() && isHexDigit(line.front()) && parseHeader(line, entry);
        if (isMapping && !parseFields(&cursor.rest, complete, &entry->mapping)) return false;
        *text = cursor.rest;
        if (isMapping) return true;
    }
    return false;
}

bool HXMapsParser::parseColumns(std::string_view *text, HXMapping *mapping) const {
    if (_flagsPosition == 0 || text->size() < _flagsPosition) return false;
    HXTextCursor flags{text->substr(_flagsPosition)};
    if ((*text)[_flagsPosition - 1] != '\n' || !flags.skip(kFlagsLabel)) return false;
    const size_t end = flags.rest.find('\n');
    if (end == std::string_view::npos) return false;
    const std::span columns(_columns, _columnCount);
    for (const Column &column : columns)
        if (!text->substr(column.position).starts_with(kFields[column.field].label)) return false;
    if (holdsHeader(text->substr(0, _flagsPosition))) return false;
    for (const Column &column : columns) {
        HXTextCursor number{text->substr(column.position + kLabelWidth)};
        uint64_t kilobytes = 0;
        // Most figures are 0; no number behind the label leaves it so.
        if (!number.rest.starts_with(kZero) && number.field(&kilobytes))
            setField(column.field, kilobytes, mapping);
    }
    setFlags(flags.rest.substr(0, end), mapping);
    *text = flags.rest.substr(end + 1);
    return true;
}

bool HXMapsParser::parseFields(std::string_view *text, bool complete, HXMapping *mapping) {
    if (parseColumns(text, mapping)) return true;
    HXTextCursor cursor{*text};
    while (!cursor.rest.empty() && !isHexDigit(cursor.rest.front())) { // that begins the next mapping
        if (!complete && cursor.rest.find('\n') == std::string_view::npos) return false;
        HXTextCursor line{cursor.line()};
        const char *const begin = line.rest.data();
        if (line.skip(kFlagsLabel)) { // the last line of a mapping
            setFlags(line.rest, mapping);
            learn(*text, static_cast<size_t>(begin - text->data()));
            *text = cursor.rest;
            return true;
        }
        const size_t field = line.rest.size() > kLabelWidth ? fieldAt(begin) : kNoField;
        if (field == kNoField) continue;
        uint64_t kilobytes = 0;
        line.rest.remove_prefix(kLabelWidth);
        if (line.field(&kilobytes)) setField(field, kilobytes, mapping);
    }
    if (cursor.rest.empty() && !complete) return false;
    *text = cursor.rest;
    return true;
}

void HXMapsParser::learn(std::string_view text, size_t flagsPosition) {
    _columnCount = 0;
    _flagsPosition = 0;
    if (flagsPosition > UINT16_MAX) return;
    for (HXTextCursor cursor{text.substr(0, flagsPosition)}; !cursor.rest.empty();) {
        const size_t position = flagsPosition - cursor.rest.size();
        const std::string_view line = cursor.line();
        const size_t field = line.size() > kLabelWidth ? fieldAt(line.data()) : kNoField;
        if (field == kNoField) continue;
        if (_columnCount == maximumColumns) return; // no text of the kernel: nothing is learned
        _columns[_columnCount++] = {static_cast<uint16_t>(position), static_cast<uint8_t>(field)};
    }
    _flagsPosition = static_cast<uint32_t>(flagsPosition);
}
