#include "platform/capture/HXCaptureReader.h"

#include "platform/HXSafeText.h"

#include <bit>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <limits>

namespace {

constexpr size_t kReadBytes = size_t{64} * 1024;

struct NumberRange {
    bool isSigned;
    uint64_t largest;
};

constexpr NumberRange numberRanges[] = {
    {false, std::numeric_limits<uint8_t>::max()},  {false, std::numeric_limits<uint16_t>::max()},
    {false, std::numeric_limits<uint32_t>::max()}, {false, std::numeric_limits<uint64_t>::max()},
    {true, std::numeric_limits<int32_t>::max()},   {true, std::numeric_limits<int64_t>::max()},
};

} // namespace

bool HXParseNumber(std::string_view text, HXFieldKind kind, uint64_t *number) {
    const NumberRange &range = numberRanges[static_cast<size_t>(kind)];
    const bool negative = range.isSigned && text.starts_with('-');
    if (negative) text.remove_prefix(1);
    const bool hexadecimal = text.starts_with("0x");
    if (hexadecimal) text.remove_prefix(2);
    const char *const end = text.data() + text.size();
    const auto [stop, error] = std::from_chars(text.data(), end, *number, hexadecimal ? 16 : 10);
    if (error != std::errc() || stop != end) return false;
    if (*number > range.largest + (negative ? 1 : 0)) return false;
    if (negative) *number = 0 - *number;
    return true;
}

HXCaptureReader::HXCaptureReader(const HXCaptureFormat &format, std::FILE *stream)
    : _format(format), _stream(stream) {}

HXCaptureReader::HXCaptureReader(const HXCaptureFormat &format, std::string_view content)
    : _format(format), _window(content) {}

bool HXCaptureReader::fail(std::string_view problem) {
    if (_reason.empty()) _reason = "line " + std::to_string(_line) + ": " + std::string(problem);
    return false;
}

bool HXCaptureReader::fail(std::string_view problem, std::string_view quoted) {
    constexpr size_t shownBytes = 60;
    const std::string safe = HXSafeText(quoted.substr(0, shownBytes));
    return fail(std::string(problem) + " \"" + safe + (quoted.size() > shownBytes ? "…\"" : "\""));
}

bool HXCaptureReader::checkPlace(uint64_t address, uint64_t size) {
    constexpr uint64_t longest = uint64_t{1} << 57;
    if (size == 0) return fail("a length of 0");
    if (size > longest) return fail("it is longer than 2^57 bytes");
    if (address > UINT64_MAX - size) return fail("it ends beyond the address space");
    return true;
}

bool HXCaptureReader::checkPageSize(uint32_t pageSize) {
    const bool fits = std::has_single_bit(pageSize) && pageSize >= 4096 && pageSize <= 65536;
    return fits || fail("page_size is no power of two from 4096 to 65536");
}

bool HXCaptureReader::next() {
    if (failed() || (!_headerWasRead && !readHeader())) return false;
    std::string_view line;
    while (nextLine(&line))
        if (!line.empty() && line[0] != '#') return parseRecord(line);
    return false;
}

void HXCaptureReader::fill(void *record) const {
    const auto &fields = _format.records[_kind].fields;
    for (size_t i = 0; i < fields.size(); i++)
        if (fields[i].member.exists()) fields[i].member.set(record, number(i));
}

bool HXCaptureReader::readHeader() {
    _headerWasRead = true;
    std::string_view line;
    if (nextLine(&line) && line == _format.header) return true;
    // A first line too long for a record is no header either; a read error stays what it is.
    if (!failed() || _line == 1) _reason = _format.headerProblem;
    return false;
}

// The next line without its newline; of a comment any part. False at the end and on a failure.
bool HXCaptureReader::nextLine(std::string_view *line) {
    size_t searched = 0;
    for (;;) {
        const size_t newline = _window.find('\n', searched);
        const bool found = newline != std::string_view::npos;
        const bool comment = _skipsLine || _window.starts_with('#');
        if ((found ? newline : _window.size()) > kMaxCaptureRecordBytes && !comment) {
            _line++;
            return fail("the record is longer than 1 MiB");
        }
        if (found) {
            *line = _skipsLine ? std::string_view("#") : _window.substr(0, newline);
            _skipsLine = false;
            _window.remove_prefix(newline + 1);
            _line++;
            return true;
        }
        searched = _window.size();
        if (comment && searched > kReadBytes) {
            _skipsLine = true;
            _window = {};
            searched = 0;
        }
        if (refill()) continue;
        if (failed() || (_window.empty() && !_skipsLine)) return false;
        *line = _skipsLine ? std::string_view("#") : _window;
        _skipsLine = false;
        _window = {};
        _line++;
        return true;
    }
}

// Reads on behind what the window still holds; false at the end of the file and on a failure.
bool HXCaptureReader::refill() {
    if (_stream == nullptr) return false;
    const size_t kept = _window.size();
    if (kept > 0) std::memmove(_buffer.data(), _window.data(), kept);
    if (_buffer.size() < kept + kReadBytes) {
        _buffer.resize(kept + kReadBytes + kept / 2);
    }
    const size_t count = std::fread(_buffer.data() + kept, 1, _buffer.size() - kept, _stream);
    _window = std::string_view(_buffer.data(), kept + count);
    _bytesRead += count;
    if (count > 0 && _bytesRead <= _format.longestFile) return true;
    if (count > 0)
        _reason = std::strerror(EFBIG);
    else if (std::ferror(_stream) != 0)
        _reason = std::strerror(errno);
    _stream = nullptr;
    return false;
}

bool HXCaptureReader::parseRecord(std::string_view line) {
    const size_t tab = line.find('\t');
    const std::string_view word = line.substr(0, tab);
    for (_kind = 0; _kind < _format.records.size(); _kind++) {
        const HXRecordForm &form = _format.records[_kind];
        if (form.word == word)
            return parseFields(tab == std::string_view::npos ? std::string_view() : line.substr(tab), form);
    }
    return fail("unknown record", word);
}

// `rest` is empty or begins with the TAB before the first field.
bool HXCaptureReader::parseFields(std::string_view rest, const HXRecordForm &form) {
    const size_t fieldCount = form.fields.size();
    _seen = 0;
    _unescaped.clear();
    for (size_t i = 0; i < fieldCount; i++)
        _values[i].number = form.fields[i].defaultValue;

    size_t field = 0; // fields mostly come in the table's order
    while (!rest.empty()) {
        rest.remove_prefix(1);
        const std::string_view part = rest.substr(0, rest.find('\t'));
        rest.remove_prefix(part.size());
        const size_t equals = part.find('=');
        if (equals == std::string_view::npos) return fail("a field without a value:", part);
        const std::string_view name = part.substr(0, equals);
        size_t tries = 0;
        for (; tries < fieldCount && form.fields[field].name != name; tries++)
            field = field + 1 == fieldCount ? 0 : field + 1;
        if (tries == fieldCount) return fail("unknown field", name);
        if (has(field)) return fail("twice the field", name);
        _seen |= uint64_t{1} << field;
        if (!parseValue(form.fields[field], part.substr(equals + 1), &_values[field])) return false;
    }
    const uint64_t missing = form.required & ~_seen;
    return missing == 0 || fail("missing field", form.fields[std::countr_zero(missing)].name);
}

bool HXCaptureReader::parseValue(const HXFieldForm &form, std::string_view text, Value *value) {
    if (form.kind() == HXFieldKind::text) return unescape(form, text, &value->text);
    if (form.kind() == HXFieldKind::boolean) {
        if (text != "0" && text != "1") return fail(std::string(form.name) + " is not 0 or 1:", text);
        value->number = text == "1";
        return true;
    }
    if (HXParseNumber(text, form.kind(), &value->number)) return true;
    return fail(std::string(form.name) + " is no number of its width:", text);
}

bool HXCaptureReader::unescape(const HXFieldForm &form, std::string_view text, std::string_view *result) {
    size_t backslash = text.find('\\');
    *result = text;
    if (backslash == std::string_view::npos) return true;
    // Never longer than the record, so that texts unescaped earlier stay where they are.
    _unescaped.reserve(kMaxCaptureRecordBytes);
    const size_t start = _unescaped.size();
    while (backslash != std::string_view::npos) {
        _unescaped += text.substr(0, backslash);
        const char escaped = backslash + 1 < text.size() ? text[backslash + 1] : '\0';
        if (escaped != 't' && escaped != 'n' && escaped != '\\')
            return fail("a bad escape in " + std::string(form.name) + ":", text);
        _unescaped += escaped == 't' ? '\t' : escaped == 'n' ? '\n' : '\\';
        text.remove_prefix(backslash + 2);
        backslash = text.find('\\');
    }
    _unescaped += text;
    *result = std::string_view(_unescaped).substr(start);
    return true;
}
