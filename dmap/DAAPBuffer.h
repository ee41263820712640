#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>
#include <utility>

#include "platform/value/PlistValue.h"

namespace larder {

// Writes a DMAP tag stream: the body of a request to the cloud library
// service, and documents in tests. Every number goes out big-endian.
// Appends return where their value (or, for a header, its size field)
// starts, so that a caller can mend a container's size afterwards.
// Belongs to the one thread that fills it.
class DAAPBuffer {
 public:
  DAAPBuffer() = default;

  // Header alone; the value, for a container its children, follows.
  std::size_t appendHeader(std::uint32_t code, std::uint32_t size);
  std::size_t appendUInt8(std::uint8_t value, std::uint32_t code);
  std::size_t appendUInt32(std::uint32_t value, std::uint32_t code);
  std::size_t appendUInt64(std::uint64_t value, std::uint32_t code);
  // The bytes as given, of any kind. Text beyond 4 GiB - 1 bytes, more than
  // a length field can say, is cut there so the stream stays well-formed.
  std::size_t appendUTF8String(std::string_view bytes, std::uint32_t code);
  std::size_t appendUTF8String(std::span<const std::uint8_t> bytes, std::uint32_t code);

  // Rewrites the size field at `sizeOffset` (as `appendHeader` returned it).
  // False, and nothing written, when the offset is not inside the buffer.
  bool mendSize(std::size_t sizeOffset, std::uint32_t size);

  // Room for `bytes` more bytes, so that a body of known size grows once.
  void reserve(std::size_t bytes) { data_.reserve(data_.size() + bytes); }

  // A copy of the bytes written so far.
  [[nodiscard]] PlistData data() const { return data_; }
  // The bytes written so far, without a copy; the buffer is empty after.
  [[nodiscard]] PlistData takeData() {
    PlistData taken = std::move(data_);
    data_.clear();
    return taken;
  }
  [[nodiscard]] std::span<const std::uint8_t> bytes() const { return data_; }
  [[nodiscard]] std::size_t length() const { return data_.size(); }

 private:
  void appendBigEndian(std::uint64_t value, int width);

  PlistData data_;
};

}  // namespace larder
