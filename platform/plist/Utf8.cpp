#include "platform/plist/Utf8.h"

#include <cstdint>
#include <cstring>

namespace larder {

namespace {

bool isContinuation(unsigned char byte) {
  return (byte & 0xC0u) == 0x80u;
}

// Where the run of ASCII from `position` ends, read eight bytes at a time:
// most text is ASCII, and DMAP documents check every string they carry.
std::size_t endOfAsciiRun(std::string_view text, std::size_t position) {
  while (position + 8 <= text.size()) {
    std::uint64_t chunk = 0;
    std::memcpy(&chunk, text.data() + position, 8);
    if ((chunk & 0x8080808080808080ULL) != 0) break;
    position += 8;
  }
  return position;
}

}  // namespace

char32_t decodeUtf8(std::string_view text, std::size_t& position) {
  const auto byteAt = [&](std::size_t index) { return static_cast<unsigned char>(text[index]); };
  const unsigned char lead = byteAt(position);
  if (lead < 0x80) {
    ++position;
    return lead;
  }
  // Lead byte ranges and the allowed range of the second byte, which rules
  // out overlong forms, surrogates and code points above U+10FFFF.
  std::size_t length = 0;
  unsigned char secondLow = 0x80;
  unsigned char secondHigh = 0xBF;
  char32_t codePoint = 0;
  if (lead >= 0xC2 && lead <= 0xDF) {
    length = 2;
    codePoint = lead & 0x1Fu;
  } else if (lead >= 0xE0 && lead <= 0xEF) {
    length = 3;
    codePoint = lead & 0x0Fu;
    if (lead == 0xE0) secondLow = 0xA0;
    if (lead == 0xED) secondHigh = 0x9F;
  } else if (lead >= 0xF0 && lead <= 0xF4) {
    length = 4;
    codePoint = lead & 0x07u;
    if (lead == 0xF0) secondLow = 0x90;
    if (lead == 0xF4) secondHigh = 0x8F;
  }
  if (length == 0 || text.size() - position < length) {
    ++position;
    return kUnicodeReplacementCharacter;
  }
  const unsigned char second = byteAt(position + 1);
  if (second < secondLow || second > secondHigh) {
    ++position;
    return kUnicodeReplacementCharacter;
  }
  codePoint = (codePoint << 6) | (second & 0x3Fu);
  for (std::size_t index = 2; index < length; ++index) {
    const unsigned char next = byteAt(position + index);
    if (!isContinuation(next)) {
      ++position;
      return kUnicodeReplacementCharacter;
    }
    codePoint = (codePoint << 6) | (next & 0x3Fu);
  }
  position += length;
  return codePoint;
}

void appendUtf8(std::string& out, char32_t codePoint) {
  if (codePoint < 0x80) {
    out.push_back(static_cast<char>(codePoint));
  } else if (codePoint < 0x800) {
    out.push_back(static_cast<char>(0xC0 | (codePoint >> 6)));
    out.push_back(static_cast<char>(0x80 | (codePoint & 0x3F)));
  } else if (codePoint < 0x10000) {
    out.push_back(static_cast<char>(0xE0 | (codePoint >> 12)));
    out.push_back(static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F)));
    out.push_back(static_cast<char>(0x80 | (codePoint & 0x3F)));
  } else {
    out.push_back(static_cast<char>(0xF0 | (codePoint >> 18)));
    out.push_back(static_cast<char>(0x80 | ((codePoint >> 12) & 0x3F)));
    out.push_back(static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F)));
    out.push_back(static_cast<char>(0x80 | (codePoint & 0x3F)));
  }
}

bool isWellFormedUtf8(std::string_view text) {
  std::size_t position = 0;
  while (position < text.size()) {
    position = endOfAsciiRun(text, position);
    if (position >= text.size()) break;
    if (static_cast<unsigned char>(text[position]) < 0x80) {
      ++position;
      continue;
    }
    const std::size_t before = position;
    const char32_t codePoint = decodeUtf8(text, position);
    // A genuine U+FFFD takes three bytes; a replacement for bad input one.
    if (codePoint == kUnicodeReplacementCharacter && position - before == 1) return false;
  }
  return true;
}

std::string toWellFormedUtf8(std::string_view text) {
  if (isWellFormedUtf8(text)) return std::string(text);
  std::string out;
  out.reserve(text.size() + 8);
  std::size_t position = 0;
  while (position < text.size()) appendUtf8(out, decodeUtf8(text, position));
  return out;
}

}  // namespace larder
