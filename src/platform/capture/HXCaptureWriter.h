// Writes records of capture files in their common form.
#pragma once

#include "platform/capture/HXCaptureFormat.h"

#include <concepts>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

// Collects records as text. A record's fields are given in any order between `begin` and `end`; those that
// equal their default are left out.
//
//     writer.begin(ownedRecord);
//     writer.number(Owned::pid, pid);
//     writer.numbers(&object);
//     writer.end();
class HXCaptureWriter {
  public:
    explicit HXCaptureWriter(const HXCaptureFormat &format) : _format(format) {}

    void header();
    void begin(size_t record);
    // A record whose first field is a pid.
    void begin(size_t record, int32_t pid) {
        begin(record);
        number(0, pid);
    }
    // In decimal or hexadecimal, as the form says.
    template <std::integral Number>
    void number(size_t field, Number value) {
        write(form(field), static_cast<uint64_t>(value));
    }
    template <class Number>
    void number(size_t field, const std::optional<Number> &value) {
        if (value) number(field, *value);
    }
    // Every member of `record` that the record's form has a place for.
    void numbers(const void *record);
    void text(size_t field, std::string_view text);
    void end() { _text += '\n'; }

    const std::string &written() const { return _text; }
    void clear() { _text.clear(); }

  private:
    void write(const HXFieldForm &field, uint64_t value);
    const HXFieldForm &form(size_t field) const { return _format.records[_record].fields[field]; }
    void name(const HXFieldForm &field);

    const HXCaptureFormat &_format;
    size_t _record = 0;
    std::string _text;
};
