// Numbers in the kernel's text.
#pragma once

#include <charconv>
#include <cstdint>
#include <optional>
#include <string_view>

// A cursor over one line or file of the kernel's text. A step that does not find what it wants leaves the
// rest as it is.
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
    template <typename Number>
    bool number(Number *value, int base = 10) {
        const auto result = std::from_chars(rest.data(), rest.data() + rest.size(), *value, base);
        if (result.ec != std::errc()) return false;
        rest.remove_prefix(static_cast<size_t>(result.ptr - rest.data()));
        return true;
    }
    // The text up to the next blank or the end.
    std::string_view word() {
        skipBlanks();
        size_t n = 0;
        while (n < rest.size() && rest[n] != ' ' && rest[n] != '\t' && rest[n] != '\n')
            n++;
        const std::string_view found = rest.substr(0, n);
        rest.remove_prefix(n);
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

// `text` as a whole decimal number of at least one digit; none for anything else.
template <typename Number>
std::optional<Number> HXWholeNumber(std::string_view text) {
    HXTextCursor cursor{text};
    Number value{};
    if (!cursor.number(&value) || !cursor.rest.empty()) return std::nullopt;
    return value;
}
