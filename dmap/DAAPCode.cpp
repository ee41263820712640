#include "dmap/DAAPCode.h"

namespace larder {

namespace {

char printable(std::uint8_t byte) {
  return byte >= 0x20 && byte < 0x7f ? static_cast<char>(byte) : '.';
}

}  // namespace

std::string DAAPCode::text(std::uint32_t code) {
  std::string result(4, '.');
  for (int index = 0; index < 4; ++index)
    result[static_cast<std::size_t>(index)] = character(code, index)[0];
  return result;
}

std::string DAAPCode::character(std::uint32_t code, int index) {
  const int shift = 8 * (3 - (index & 3));
  return std::string(1, printable(static_cast<std::uint8_t>(code >> shift)));
}

}  // namespace larder
