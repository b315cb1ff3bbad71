// Texts in fields of fixed width, which end at a zero or at the field's end.
#pragma once

#include <algorithm>
#include <cstddef>
#include <string_view>

// Fills a field of zeros; what does not fit is cut.
template <size_t N>
void HXFillText(char (&field)[N], std::string_view text) {
    std::copy_n(text.begin(), std::min(N, text.size()), field);
}

template <size_t N>
std::string_view HXTextOfField(const char (&field)[N]) {
    return {field, static_cast<size_t>(std::find(field, field + N, '\0') - field)};
}
