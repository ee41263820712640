#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace larder {

// What stands for bytes that are not well-formed UTF-8 once text is
// converted.
inline constexpr char32_t kUnicodeReplacementCharacter = 0xFFFD;

// Text in property-list values is UTF-8. Bytes that do not form well-formed
// UTF-8 are each replaced by U+FFFD, by the writer when it converts text to
// UTF-16 and by the readers when they take text in, so that any text a
// reader hands out survives a write and a second read unchanged.
//
// Well-formed is strict: no overlong forms, no surrogates, nothing above
// U+10FFFF. Text from the network is checked the same way before it is
// taken at all.
[[nodiscard]] bool isWellFormedUtf8(std::string_view text);
[[nodiscard]] std::string toWellFormedUtf8(std::string_view text);

// Decodes one code point starting at text[position] and advances position.
// Returns U+FFFD and advances by one byte when the bytes there are not
// well-formed UTF-8.
[[nodiscard]] char32_t decodeUtf8(std::string_view text, std::size_t& position);
void appendUtf8(std::string& out, char32_t codePoint);

}  // namespace larder
