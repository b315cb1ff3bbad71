// Text of the host made harmless, so that no process can break a terminal or the JSON document by its name.
#pragma once

#include <string>
#include <string_view>

// `text` with every byte that is not part of valid UTF-8, every control character (U+0000 to U+001F, U+007F
// to U+009F), every separator of lines or paragraphs (U+2028, U+2029), every control of the writing direction
// (U+061C, U+200E, U+200F, U+202A to U+202E, U+2066 to U+2069) and every backslash replaced by one '?' each.
std::string HXSafeText(std::string_view text);
// Whether that is the text itself because all of it is printable ASCII: the usual case, without a copy.
bool HXIsPlainText(std::string_view text);

// The same, with double quotes turned into single ones: for names of processes and of kernel records, which
// enter messages that the JSON document quotes as they stand.
std::string HXSafeName(std::string_view text);

// `text` cut to at most `bytes`, at the end of a whole UTF-8 character. For safe text.
std::string_view HXCutText(std::string_view text, size_t bytes);
