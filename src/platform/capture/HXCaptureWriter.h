// Writes records of capture files in their common form.
#pragma once

#include "platform/capture/HXCaptureFormat.h"

#include <string>
#include <string_view>
#include <utility>

// Collects records as text. A record's fields are given in any order between `begin` and `end`; those that
// equal their default are left out.
//
//     writer.begin(regionRecord);
//     writer.hex(Region::address, address);
//     writer.end();
class HXCaptureWriter {
  public:
    explicit HXCaptureWriter(const HXCaptureFormat &format) : _format(format) {}

    void header();
    void begin(size_t record);
    // Signed numbers are given sign-extended.
    void number(size_t field, uint64_t value);
    void signedNumber(size_t field, int64_t value) { number(field, static_cast<uint64_t>(value)); }
    void hex(size_t field, uint64_t value);
    void text(size_t field, std::string_view text);
    void end() { _text += '\n'; }

    const std::string &written() const { return _text; }
    void clear() { _text.clear(); }

  private:
    bool isDefault(const HXFieldForm &field, uint64_t value) const {
        return field.need == HXFieldNeed::defaulted && field.defaultValue == value;
    }
    const HXFieldForm &form(size_t field) const { return _format.records[_record].fields[field]; }
    void name(const HXFieldForm &field);

    const HXCaptureFormat &_format;
    size_t _record = 0;
    std::string _text;
};
