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

void HXCaptureWriter::number(size_t field, uint64_t value) {
    if (isDefault(form(field), value)) return;
    name(form(field));
    const bool isSigned =
        form(field).kind == HXFieldKind::signed32 || form(field).kind == HXFieldKind::signed64;
    char digits[24];
    char *const end = digits + sizeof digits;
    const auto [stop, error] = isSigned ? std::to_chars(digits, end, static_cast<int64_t>(value))
                                        : std::to_chars(digits, end, value);
    _text.append(digits, stop);
}

void HXCaptureWriter::hex(size_t field, uint64_t value) {
    if (isDefault(form(field), value)) return;
    name(form(field));
    char digits[24] = "0x";
    const auto [stop, error] = std::to_chars(digits + 2, digits + sizeof digits, value, 16);
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
