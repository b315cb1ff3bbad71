// Reads the common form of capture files: lines, records, fields, escapes, numbers.
#pragma once

#include "platform/capture/HXCaptureFormat.h"

#include <array>
#include <cstdio>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

// The number that all of `text` spells in the common form, sign-extended; false when it spells none or one
// that does not fit `kind`, which is a number's.
bool HXParseNumber(std::string_view text, HXFieldKind kind, uint64_t *number);

// Steps through the records of one capture. Its memory is bounded by the longest record allowed, whatever the
// file holds.
//
//     HXCaptureReader reader(format, stream);
//     while (reader.next())
//         … reader.kind(), reader.number(fieldIndex), reader.text(fieldIndex) …
//     if (reader.failed()) … reader.reason() …
class HXCaptureReader {
  public:
    // Reads from a stream, which the caller keeps open and closes.
    HXCaptureReader(const HXCaptureFormat &format, std::FILE *stream);
    // Reads from memory, which must outlive the reader.
    HXCaptureReader(const HXCaptureFormat &format, std::string_view content);

    HXCaptureReader(const HXCaptureReader &) = delete;
    HXCaptureReader &operator=(const HXCaptureReader &) = delete;

    // Goes on to the next record; false at the end and on a failure.
    bool next();

    bool failed() const { return !_reason.empty(); }
    // Why the load fails: "line N: …", the format's header problem, or the system's reason for a failed read.
    const std::string &reason() const { return _reason; }
    // Fails the load for a reason in the current record, or in the last line after the end. The first reason
    // stands. Always false.
    bool fail(std::string_view problem);
    // The same, quoting text of the file.
    bool fail(std::string_view problem, std::string_view quoted);

    // Fails the load unless `size` is 1 byte to 2^57 and [address, address + size) ends within 64 bits.
    bool checkPlace(uint64_t address, uint64_t size);
    // Fails the load unless it is a power of two from 4096 to 65536.
    bool checkPageSize(uint32_t pageSize);

    // The current record: its index in the format's table, and its fields by their index in the record's.
    size_t kind() const { return _kind; }
    bool has(size_t field) const { return (_seen >> field & 1) != 0; }
    // A number or boolean; the default when the field is absent (0 without a default).
    uint64_t number(size_t field) const { return _values[field].number; }
    // A text with its escapes undone, not yet made safe; empty when absent. Valid until `next`.
    std::string_view text(size_t field) const {
        return has(field) ? _values[field].text : std::string_view();
    }
    // Sets every member of `record` that the record's form has a place for.
    void fill(void *record) const;
    // The number of a field whose absence has a meaning of its own.
    template <class Number>
    std::optional<Number> optionalNumber(size_t field) const {
        return has(field) ? std::optional(static_cast<Number>(number(field))) : std::nullopt;
    }

  private:
    struct Value {
        uint64_t number = 0;
        std::string_view text;
    };

    bool readHeader();
    bool nextLine(std::string_view *line);
    bool refill();
    bool parseRecord(std::string_view line);
    bool parseFields(std::string_view rest, const HXRecordForm &form);
    bool parseValue(const HXFieldForm &form, std::string_view text, Value *value);
    bool unescape(const HXFieldForm &form, std::string_view text, std::string_view *result);

    const HXCaptureFormat &_format;
    std::FILE *_stream = nullptr; // null when all content is in memory
    uint64_t _bytesRead = 0;      // from the stream
    std::vector<char> _buffer;
    std::string_view _window; // read and not yet consumed
    bool _skipsLine = false;  // the window begins within a comment
    bool _headerWasRead = false;
    uint64_t _line = 0;

    size_t _kind = 0;
    uint64_t _seen = 0;
    std::array<Value, kMaxCaptureFields> _values;
    std::string _unescaped; // backs the texts of the current record that hold escapes
    std::string _reason;
};
