#pragma once

#include <cstdint>
#include <optional>
#include <span>

namespace larder {

// One tag of a container: its code and exactly its value bytes.
struct DAAPTag {
  std::uint32_t code = 0;
  std::span<const std::uint8_t> value;
};

// Walks the tags of one container. A tag is only handed out when its header
// and its whole declared value lie inside the container, so nothing that
// reads a tag's value can leave it. A tag that claims more than the
// container has left ends the walk, as do stray bytes too few for a header:
// past that point no tag boundary can be trusted. The tags before it stand.
class DAAPTagReader {
 public:
  static constexpr std::size_t kHeaderSize = 8;

  explicit DAAPTagReader(std::span<const std::uint8_t> container) : rest_(container) {}

  std::optional<DAAPTag> next() {
    if (rest_.size() < kHeaderSize) {
      if (!rest_.empty()) reportStrayBytes();
      rest_ = {};
      return std::nullopt;
    }
    const std::uint32_t code = readUInt32(rest_.data());
    const std::uint32_t length = readUInt32(rest_.data() + 4);
    if (length > rest_.size() - kHeaderSize) {
      reportOverrun(code, length);
      rest_ = {};
      return std::nullopt;
    }
    DAAPTag tag{code, rest_.subspan(kHeaderSize, length)};
    rest_ = rest_.subspan(kHeaderSize + length);
    return tag;
  }

  static std::uint32_t readUInt32(const std::uint8_t* bytes) {
    return (std::uint32_t{bytes[0]} << 24) | (std::uint32_t{bytes[1]} << 16) |
           (std::uint32_t{bytes[2]} << 8) | std::uint32_t{bytes[3]};
  }

 private:
  void reportOverrun(std::uint32_t code, std::uint32_t length) const;
  void reportStrayBytes() const;

  std::span<const std::uint8_t> rest_;
};

}  // namespace larder
