#include "platform/HXSafeText.h"

#include <algorithm>
#include <cstdint>
#include <iterator>

namespace {

// The length of the valid UTF-8 sequence at the start of `text` (Unicode 15, table 3-7), or 0; its character
// in *c.
size_t sequenceLength(std::string_view text, uint32_t *c) {
    const auto byte = [&](size_t i) { return static_cast<uint8_t>(text[i]); };
    const uint8_t lead = byte(0);
    if (lead < 0x80) {
        *c = lead;
        return 1;
    }
    const size_t length = lead >= 0xC2 && lead <= 0xDF   ? 2
                          : lead >= 0xE0 && lead <= 0xEF ? 3
                          : lead >= 0xF0 && lead <= 0xF4 ? 4
                                                         : 0;
    if (length == 0 || text.size() < length) return 0;
    *c = lead & (0x7F >> length);
    for (size_t i = 1; i < length; i++) {
        if ((byte(i) & 0xC0) != 0x80) return 0;
        *c = *c << 6 | (byte(i) & 0x3F);
    }
    const bool overlong = (length == 3 && *c < 0x800) || (length == 4 && *c < 0x10000);
    const bool surrogate = *c >= 0xD800 && *c <= 0xDFFF;
    return overlong || surrogate || *c > 0x10FFFF ? 0 : length;
}

// What a terminal or an editor does not show as a character but acts on.
bool isUnsafe(uint32_t c) {
    constexpr struct {
        uint32_t first, last;
    } unsafe[] = {
        {0x0000, 0x001F},                   // control characters
        {'\\', '\\'},                       // escapes of the JSON document
        {0x007F, 0x009F},                   // control characters
        {0x061C, 0x061C}, {0x200E, 0x200F}, // marks of writing direction
        {0x2028, 0x202E}, // separators of lines and paragraphs; embedded directions, overrides
        {0x2066, 0x2069}, // isolated directions
    };
    return std::any_of(std::begin(unsafe), std::end(unsafe),
                       [c](const auto &range) { return c >= range.first && c <= range.last; });
}

} // namespace

bool HXIsPlainText(std::string_view text) {
    return std::all_of(text.begin(), text.end(), [](char c) { return c >= 0x20 && c < 0x7F && c != '\\'; });
}

std::string HXSafeText(std::string_view text) {
    if (HXIsPlainText(text)) return std::string(text);
    std::string safe;
    safe.reserve(text.size());
    while (!text.empty()) {
        uint32_t c = 0;
        const size_t length = sequenceLength(text, &c);
        if (length == 0 || isUnsafe(c))
            safe += '?';
        else
            safe += text.substr(0, length);
        text.remove_prefix(std::max<size_t>(length, 1));
    }
    return safe;
}

std::string HXSafeName(std::string_view text) {
    std::string safe = HXSafeText(text);
    std::replace(safe.begin(), safe.end(), '"', '\'');
    return safe;
}

std::string_view HXCutText(std::string_view text, size_t bytes) {
    if (text.size() <= bytes) return text;
    while (bytes > 0 && (static_cast<uint8_t>(text[bytes]) & 0xC0) == 0x80)
        bytes--;
    return text.substr(0, bytes);
}
