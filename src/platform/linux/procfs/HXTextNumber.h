// The tokeniser of the kernel's text: numbers, words, lines and labels.
#pragma once

#include <charconv>
#include <cstdint>
#include <optional>
#include <string_view>

// A cursor over one line or file of the kernel's text. A step that does not find what it wants leaves the
// rest as it is, but for blanks.
struct HXTextCursor {
    std::string_view rest;

    void skipBlanks() {
        size_t n = 0;
        while (n < rest.size() && (rest[n] == ' ' || rest[n] == '\t'))
            n++;
        rest.remove_prefix(n);
    }
    bool skip(char c) {
        if (rest.empty() || rest.front() != c) return false;
        rest.remove_prefix(1);
        return true;
    }
    bool skip(std::string_view text) {
        // Most texts differ in their first character, which takes no call to find out.
        const bool mayBe = !rest.empty() && !text.empty() && rest.front() == text.front();
        if (!mayBe || !rest.starts_with(text)) return text.empty();
        rest.remove_prefix(text.size());
        return true;
    }
    // The digits at the front, whatever follows them. False when there is none or the value does not fit.
    template <typename Number>
    bool number(Number *value, int base = 10) {
        const auto result = std::from_chars(rest.data(), rest.data() + rest.size(), *value, base);
        if (result.ec != std::errc()) return false;
        rest.remove_prefix(static_cast<size_t>(result.ptr - rest.data()));
        return true;
    }
    // The same behind blanks.
    template <typename Number>
    bool field(Number *value) {
        skipBlanks();
        return number(value);
    }
    // The text up to the next blank or the end of the line; empty at the end.
    std::string_view word() {
        skipBlanks();
        size_t n = 0;
        while (n < rest.size() && rest[n] != ' ' && rest[n] != '\t' && rest[n] != '\n')
            n++;
        const std::string_view found = rest.substr(0, n);
        rest.remove_prefix(n);
        return found;
    }
    // The word at the end, taken off; the same for a line without tabs.
    std::string_view lastWord() {
        while (rest.ends_with(' ') || rest.ends_with('\n'))
            rest.remove_suffix(1);
        const std::string_view found = rest.substr(rest.rfind(' ') + 1); // none found: all of it
        rest.remove_suffix(found.size());
        return found;
    }
    // The text up to the next newline, which is passed over.
    std::string_view line() {
        const size_t end = rest.find('\n');
        const std::string_view found = rest.substr(0, end);
        rest.remove_prefix(end == std::string_view::npos ? rest.size() : end + 1);
        return found;
    }
};

// Whether all of `text` is a number of at least one digit, which goes to *value.
template <typename Number>
bool HXIsNumber(std::string_view text, Number *value, int base = 10) {
    HXTextCursor cursor{text};
    return cursor.number(value, base) && cursor.rest.empty();
}

// One line of a file of labelled figures (status, meminfo, smaps_rollup): a label with its colon, blanks, a
// number and perhaps its unit. `unitSize`: bytes that 1 stands for.
template <typename Record>
struct HXLabelledFigure {
    std::string_view label;
    std::optional<uint64_t> Record::*figure;
    uint64_t unitSize = 1024;
};

// The figures of a record that the text has; those of lines that it lacks stay none.
template <typename Record, size_t Count>
Record HXParseLabelledFigures(std::string_view text, const HXLabelledFigure<Record> (&table)[Count]) {
    Record record;
    for (HXTextCursor cursor{text}; !cursor.rest.empty();) {
        HXTextCursor line{cursor.line()};
        for (const HXLabelledFigure<Record> &entry : table) {
            if (!line.skip(entry.label)) continue;
            uint64_t value = 0;
            if (line.field(&value)) record.*entry.figure = value * entry.unitSize;
            break;
        }
    }
    return record;
}
