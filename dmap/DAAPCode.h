#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace larder {

// A DMAP content code: four ASCII characters read as one big-endian 32-bit
// number, so that a `switch` over codes compiles to integer comparisons.
class DAAPCode {
 public:
  static constexpr std::uint32_t fromText(std::string_view text) {
    std::uint32_t code = 0;
    for (std::size_t index = 0; index < 4; ++index) {
      const char c = index < text.size() ? text[index] : ' ';
      code = (code << 8) | static_cast<std::uint8_t>(c);
    }
    return code;
  }

  // The four characters for a log line. The code comes off the network, so
  // bytes that would break or forge a line (controls, DEL, anything beyond
  // ASCII) are shown as '.'.
  static std::string text(std::uint32_t code);

  // One character of `text`, as a "%c" argument wants it.
  static std::string character(std::uint32_t code, int index);
};

constexpr std::uint32_t operator""_dmap(const char* text, std::size_t size) {
  return DAAPCode::fromText(std::string_view(text, size));
}

}  // namespace larder
