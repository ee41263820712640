#include "dmap/DAAPBuffer.h"

#include <limits>

namespace larder {

void DAAPBuffer::appendBigEndian(std::uint64_t value, int width) {
  for (int shift = 8 * (width - 1); shift >= 0; shift -= 8) {
    data_.push_back(static_cast<std::uint8_t>(value >> shift));
  }
}

std::size_t DAAPBuffer::appendHeader(std::uint32_t code, std::uint32_t size) {
  const std::size_t sizeOffset = data_.size() + 4;
  appendBigEndian(code, 4);
  appendBigEndian(size, 4);
  return sizeOffset;
}

std::size_t DAAPBuffer::appendUInt8(std::uint8_t value, std::uint32_t code) {
  appendHeader(code, 1);
  const std::size_t valueOffset = data_.size();
  data_.push_back(value);
  return valueOffset;
}

std::size_t DAAPBuffer::appendUInt32(std::uint32_t value, std::uint32_t code) {
  appendHeader(code, 4);
  const std::size_t valueOffset = data_.size();
  appendBigEndian(value, 4);
  return valueOffset;
}

std::size_t DAAPBuffer::appendUInt64(std::uint64_t value, std::uint32_t code) {
  appendHeader(code, 8);
  const std::size_t valueOffset = data_.size();
  appendBigEndian(value, 8);
  return valueOffset;
}

std::size_t DAAPBuffer::appendUTF8String(std::span<const std::uint8_t> bytes, std::uint32_t code) {
  constexpr std::size_t kMaxLength = std::numeric_limits<std::uint32_t>::max();
  const std::span<const std::uint8_t> written = bytes.first(std::min(bytes.size(), kMaxLength));
  appendHeader(code, static_cast<std::uint32_t>(written.size()));
  const std::size_t valueOffset = data_.size();
  data_.insert(data_.end(), written.begin(), written.end());
  return valueOffset;
}

std::size_t DAAPBuffer::appendUTF8String(std::string_view bytes, std::uint32_t code) {
  return appendUTF8String(
      std::span(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()), code);
}

bool DAAPBuffer::mendSize(std::size_t sizeOffset, std::uint32_t size) {
  if (sizeOffset > data_.size() || data_.size() - sizeOffset < 4) return false;
  for (int index = 0; index < 4; ++index) {
    data_[sizeOffset + static_cast<std::size_t>(index)] =
        static_cast<std::uint8_t>(size >> (8 * (3 - index)));
  }
  return true;
}

}  // namespace larder
