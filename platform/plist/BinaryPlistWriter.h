#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/plist/PlistValue.h"

namespace larder {

// Seconds between 1970-01-01 and 2001-01-01, the epoch of property-list dates.
inline constexpr double kPlistDateEpochOffset = 978307200.0;

// Encodes values in the "bplist00" binary property-list format.
//
// Encoding is linear in the size of the value: objects are numbered in one
// breadth-first pass and written in a second, and equal strings, integers
// and booleans are stored once (dictionary keys repeat across records, so
// this keeps catalogues small). Null values inside containers are skipped;
// a null root is written as an empty dictionary.
class BinaryPlistWriter {
 public:
  static PlistData write(const PlistValue& root);
};

// Text in property-list values is UTF-8. Bytes that do not form well-formed
// UTF-8 are each replaced by U+FFFD, by the writer when it converts text to
// UTF-16 and by the readers when they take text in, so that any text a
// reader hands out survives a write and a second read unchanged.
[[nodiscard]] bool isWellFormedUtf8(std::string_view text);
[[nodiscard]] std::string toWellFormedUtf8(std::string_view text);

// Decodes one code point starting at text[position] and advances position.
// Returns U+FFFD and advances by one byte when the bytes there are not
// well-formed UTF-8.
[[nodiscard]] char32_t decodeUtf8(std::string_view text, std::size_t& position);
void appendUtf8(std::string& out, char32_t codePoint);

}  // namespace larder
