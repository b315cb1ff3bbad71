#include "platform/capture/HXCaptureWriter.h"

#include <charconv>

void HXCaptureWriter::header() {
    _text += _format.header;
    _text += '\n';
}

void HXCaptureWriter::begin(size_t record) {
    _record = record;
    _text += _format.records[record].word;
}

void HXCaptureWriter::name(const HXFieldForm &field) {
    _text += '\t';
    _text += field.name;
    _text += '=';
}

void HXCaptureWriter::numbers(const void *record) {
    for (const HXFieldForm &field : _format.records[_record].fields)
        if (field.member.exists()) write(field, field.member.of(record));
}

// Signed numbers are given sign-extended.
void HXCaptureWriter::write(const HXFieldForm &field, uint64_t value) {
    if (field.need == HXFieldNeed::defaulted && field.defaultValue == value) return;
    name(field);
    const bool isSigned = field.kind() == HXFieldKind::signed32 || field.kind() == HXFieldKind::signed64;
    if (field.isHexadecimal) _text += "0x";
    char digits[24];
    char *const end = digits + sizeof digits;
    const auto [stop, error] = isSigned ? std::to_chars(digits, end, static_cast<int64_t>(value))
                                        : std::to_chars(digits, end, value, field.isHexadecimal ? 16 : 10);
    _text.append(digits, stop);
}

void HXCaptureWriter::text(size_t field, std::string_view text) {
    if (form(field).need == HXFieldNeed::defaulted && text.empty()) return;
    name(form(field));
    for (const char c : text) {
        if (c == '\t' || c == '\n' || c == '\\') _text += '\\';
        _text += c == '\t' ? 't' : c == '\n' ? 'n' : c;
    }
}
