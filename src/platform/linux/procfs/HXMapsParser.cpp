#include "platform/linux/procfs/HXMapsParser.h"

#include "platform/linux/procfs/HXProcText.h"

#include <algorithm>
#include <cstring>

namespace {

// Labels are padded to 16 characters, numbers right-aligned to eight more (show_smap of the kernel).
constexpr size_t labelWidth = 16;
constexpr size_t numberWidth = 8;

struct Field {
    std::string_view label;
    uint32_t HXMapping::*figure;
};
constexpr Field fields[] = {
    {"Rss:            ", &HXMapping::residentPages}, {"Shared_Dirty:   ", &HXMapping::dirtyPages},
    {"Private_Dirty:  ", &HXMapping::dirtyPages},    {"Anonymous:      ", &HXMapping::anonymousPages},
    {"LazyFree:       ", &HXMapping::lazyFreePages}, {"Shared_Hugetlb: ", &HXMapping::hugePages},
    {"Private_Hugetlb:", &HXMapping::hugePages},     {"Swap:           ", &HXMapping::swappedPages},
};
constexpr size_t noField = std::size(fields);
constexpr std::string_view flagsLabel = "VmFlags:";

constexpr uint16_t pair(char first, char second) {
    return static_cast<uint16_t>(static_cast<uint8_t>(first) | static_cast<uint8_t>(second) << 8);
}
uint16_t pairAt(const char *text) {
    return pair(text[0], text[1]);
}

bool isHexDigit(char c) {
    return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f');
}

// The number at the front of the text; blanks before it are passed over. *at ends behind it.
bool readHexadecimal(const char **at, const char *end, uint64_t *value) {
    const char *p = *at;
    uint64_t number = 0;
    for (; p < end; p++) {
        const char c = *p;
        if (c >= '0' && c <= '9')
            number = number << 4 | static_cast<uint64_t>(c - '0');
        else if (c >= 'a' && c <= 'f')
            number = number << 4 | static_cast<uint64_t>(c - 'a' + 10);
        else
            break;
    }
    *value = number;
    const bool found = p > *at && p - *at <= 16;
    *at = p;
    return found;
}

bool readDecimal(const char **at, const char *end, uint64_t *value) {
    const char *p = *at;
    while (p < end && *p == ' ')
        p++;
    const char *const digits = p;
    uint64_t number = 0;
    for (; p < end && *p >= '0' && *p <= '9'; p++)
        number = number * 10 + static_cast<uint64_t>(*p - '0');
    *value = number;
    *at = p;
    return p > digits;
}

bool skipCharacter(const char **at, const char *end, char c) {
    if (*at >= end || **at != c) return false;
    ++*at;
    return true;
}

uint16_t accessOf(const char *permissions) {
    uint16_t flags = HXMappingMayRead | HXMappingMayWrite | HXMappingMayExecute;
    if (permissions[0] == 'r') flags |= HXMappingReadable;
    if (permissions[1] == 'w') flags |= HXMappingWritable;
    if (permissions[2] == 'x') flags |= HXMappingExecutable;
    if (permissions[3] == 's') flags |= HXMappingShared;
    return flags;
}

// "START-END PERM OFFSET MAJOR:MINOR INODE   PATH"
bool parseHeader(std::string_view line, HXMapsEntry *entry) {
    const char *at = line.data();
    const char *const end = at + line.size();
    HXMapping &mapping = entry->mapping;
    uint64_t major = 0;
    uint64_t minor = 0;
    if (!readHexadecimal(&at, end, &mapping.start) || !skipCharacter(&at, end, '-') ||
        !readHexadecimal(&at, end, &mapping.end) || !skipCharacter(&at, end, ' ') || end - at < 5)
        return false;
    mapping.flags = accessOf(at);
    at += 4;
    if (!skipCharacter(&at, end, ' ') || !readHexadecimal(&at, end, &mapping.offset) ||
        !skipCharacter(&at, end, ' ') || !readHexadecimal(&at, end, &major) ||
        !skipCharacter(&at, end, ':') || !readHexadecimal(&at, end, &minor) ||
        !readDecimal(&at, end, &mapping.inode))
        return false;
    mapping.device = HXDeviceNumber(static_cast<uint32_t>(major), static_cast<uint32_t>(minor));
    while (at < end && *at == ' ')
        at++;
    entry->path = {at, static_cast<size_t>(end - at)};
    return mapping.start < mapping.end;
}

size_t fieldAt(const char *label) {
    for (size_t i = 0; i < std::size(fields); i++)
        if (std::memcmp(label, fields[i].label.data(), labelWidth) == 0) return i;
    return noField;
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
    uint32_t &figure = mapping->*fields[field].figure;
    figure = static_cast<uint32_t>(std::min<uint64_t>(figure + (kilobytes >> _kilobyteShift), UINT32_MAX));
}

bool HXMapsParser::next(std::string_view *text, bool complete, HXMapsEntry *entry) {
    for (;;) {
        const size_t end = text->find('\n');
        if (end == std::string_view::npos && (!complete || text->empty())) return false;
        const std::string_view line = text->substr(0, end);
        std::string_view rest = text->substr(std::min(line.size() + 1, text->size()));
        *entry = {};
        if (!line.empty() && isHexDigit(line.front()) && parseHeader(line, entry)) {
            if (!parseFields(&rest, complete, &entry->mapping)) return false;
            *text = rest;
            return true;
        }
        *text = rest;
    }
}

bool HXMapsParser::parseColumns(std::string_view *text, HXMapping *mapping) const {
    const char *const begin = text->data();
    if (_flagsPosition == 0 || text->size() < _flagsPosition + flagsLabel.size()) return false;
    if (std::memcmp(begin + _flagsPosition, flagsLabel.data(), flagsLabel.size()) != 0 ||
        begin[_flagsPosition - 1] != '\n')
        return false;
    const std::string_view rest = text->substr(_flagsPosition + flagsLabel.size());
    const size_t end = rest.find('\n');
    if (end == std::string_view::npos) return false;
    for (size_t i = 0; i < _columnCount; i++)
        if (std::memcmp(begin + _columns[i].position, fields[_columns[i].field].label.data(), labelWidth) !=
            0)
            return false;
    for (size_t i = 0; i < _columnCount; i++) {
        const char *number = begin + _columns[i].position + labelWidth;
        if (std::memcmp(number, "       0", numberWidth) == 0) continue;
        uint64_t kilobytes = 0;
        readDecimal(&number, rest.data(), &kilobytes);
        setField(_columns[i].field, kilobytes, mapping);
    }
    constexpr uint16_t permitted = HXMappingMayRead | HXMappingMayWrite | HXMappingMayExecute;
    mapping->flags =
        static_cast<uint16_t>((mapping->flags & ~permitted) | HXParseMappingFlags(rest.substr(0, end)));
    *text = rest.substr(end + 1);
    return true;
}

bool HXMapsParser::parseFields(std::string_view *text, bool complete, HXMapping *mapping) {
    if (parseColumns(text, mapping)) return true;
    std::string_view rest = *text;
    for (;;) {
        if (rest.empty()) {
            if (!complete) return false;
            break;
        }
        if (isHexDigit(rest.front())) break; // the next mapping
        const size_t end = rest.find('\n');
        if (end == std::string_view::npos && !complete) return false;
        const std::string_view line = rest.substr(0, end);
        if (line.starts_with(flagsLabel)) {
            constexpr uint16_t permitted = HXMappingMayRead | HXMappingMayWrite | HXMappingMayExecute;
            mapping->flags = static_cast<uint16_t>((mapping->flags & ~permitted) |
                                                   HXParseMappingFlags(line.substr(flagsLabel.size())));
            learn(*text, static_cast<size_t>(line.data() - text->data()));
            rest = rest.substr(std::min(line.size() + 1, rest.size()));
            break; // the last line of a mapping
        }
        if (line.size() > labelWidth) {
            const size_t field = fieldAt(line.data());
            const char *number = line.data() + labelWidth;
            uint64_t kilobytes = 0;
            if (field != noField && readDecimal(&number, line.data() + line.size(), &kilobytes))
                setField(field, kilobytes, mapping);
        }
        rest = rest.substr(std::min(line.size() + 1, rest.size()));
    }
    *text = rest;
    return true;
}

void HXMapsParser::learn(std::string_view text, size_t flagsPosition) {
    _columnCount = 0;
    _flagsPosition = 0;
    size_t position = 0;
    while (position < flagsPosition) {
        const size_t end = text.find('\n', position);
        const size_t length = end - position;
        const size_t field = length > labelWidth ? fieldAt(text.data() + position) : noField;
        if (field != noField) {
            // A number that outgrew its column: these lines are no pattern.
            if (length != labelWidth + numberWidth + 3 || _columnCount == maximumColumns) return;
            _columns[_columnCount++] = {static_cast<uint16_t>(position), static_cast<uint8_t>(field)};
        }
        position = end + 1;
    }
    if (flagsPosition > 0 && flagsPosition < UINT16_MAX)
        _flagsPosition = static_cast<uint32_t>(flagsPosition);
}
