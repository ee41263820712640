#pragma once

#include <cstdint>
#include <cstring>
#include <optional>
#include <span>

namespace larder {

// Bounds-checked reads of fixed-width numbers out of a tag's value. Every
// read names its offset and answers nothing when the bytes are not all
// inside the span, so no caller can read past a value whatever the wire
// claims.
class DAAPBytes {
 public:
  using Bytes = std::span<const std::uint8_t>;

  static bool has(Bytes bytes, std::size_t offset, std::size_t width) {
    return offset <= bytes.size() && width <= bytes.size() - offset;
  }

  // Big-endian unsigned number of `width` bytes (at most 8), no bounds check.
  static std::uint64_t bigEndianUnchecked(const std::uint8_t* bytes, std::size_t width) {
    std::uint64_t value = 0;
    for (std::size_t index = 0; index < width; ++index) value = (value << 8) | bytes[index];
    return value;
  }

  static std::optional<std::uint8_t> uint8At(Bytes bytes, std::size_t offset) {
    if (!has(bytes, offset, 1)) return std::nullopt;
    return bytes[offset];
  }
  static std::optional<std::uint16_t> uint16At(Bytes bytes, std::size_t offset) {
    if (!has(bytes, offset, 2)) return std::nullopt;
    return static_cast<std::uint16_t>(bigEndianUnchecked(bytes.data() + offset, 2));
  }
  static std::optional<std::uint32_t> uint32At(Bytes bytes, std::size_t offset) {
    if (!has(bytes, offset, 4)) return std::nullopt;
    return static_cast<std::uint32_t>(bigEndianUnchecked(bytes.data() + offset, 4));
  }
  static std::optional<std::uint64_t> uint64At(Bytes bytes, std::size_t offset) {
    if (!has(bytes, offset, 8)) return std::nullopt;
    return bigEndianUnchecked(bytes.data() + offset, 8);
  }

  // The bytes as they stand in memory, without a swap: the wire carries a
  // few values that way.
  template <typename Number>
  static std::optional<Number> hostOrderAt(Bytes bytes, std::size_t offset) {
    if (!has(bytes, offset, sizeof(Number))) return std::nullopt;
    Number value;
    std::memcpy(&value, bytes.data() + offset, sizeof(Number));
    return value;
  }
};

}  // namespace larder
