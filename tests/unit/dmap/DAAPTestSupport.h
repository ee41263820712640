#pragma once

#include <algorithm>
#include <cstdint>
#include <memory>
#include <mutex>
#include <ostream>
#include <string>
#include <string_view>
#include <vector>

#include "dmap/DAAPBuffer.h"
#include "dmap/DAAPCode.h"
#include "dmap/DAAPParser.h"
#include "platform/log/TillLogManager.h"

namespace larder {

// Lets test failures show values as the log shows them.
inline void PrintTo(const DAAPValue& value, std::ostream* out) {
  *out << value.description();
}

}  // namespace larder

namespace larder::dmaptest {

// One tag of a document under construction: a leaf with its value bytes,
// or a container with its children. Written through DAAPBuffer, with each
// container's size worked out ahead, as a client writes a request body.
struct Tag {
  enum class Width { Raw, UInt8, UInt32, UInt64 };

  std::uint32_t code = 0;
  Width width = Width::Raw;
  std::uint64_t number = 0;
  PlistData bytes;
  std::vector<Tag> children;
  bool isContainer = false;

  [[nodiscard]] std::uint32_t valueSize() const {
    if (!isContainer) {
      switch (width) {
        case Width::UInt8:
          return 1;
        case Width::UInt32:
          return 4;
        case Width::UInt64:
          return 8;
        case Width::Raw:
          return static_cast<std::uint32_t>(bytes.size());
      }
    }
    std::uint32_t size = 0;
    for (const Tag& child : children) size += 8 + child.valueSize();
    return size;
  }

  void writeTo(DAAPBuffer& buffer) const {
    if (isContainer) {
      buffer.appendHeader(code, valueSize());
      for (const Tag& child : children) child.writeTo(buffer);
      return;
    }
    switch (width) {
      case Width::UInt8:
        buffer.appendUInt8(static_cast<std::uint8_t>(number), code);
        return;
      case Width::UInt32:
        buffer.appendUInt32(static_cast<std::uint32_t>(number), code);
        return;
      case Width::UInt64:
        buffer.appendUInt64(number, code);
        return;
      case Width::Raw:
        buffer.appendUTF8String(std::span<const std::uint8_t>(bytes), code);
        return;
    }
  }
};

inline std::uint32_t code(std::string_view text) {
  return DAAPCode::fromText(text);
}

inline Tag raw(std::string_view name, PlistData bytes) {
  Tag tag;
  tag.code = code(name);
  tag.bytes = std::move(bytes);
  return tag;
}
inline Tag text(std::string_view name, std::string_view value) {
  return raw(name, PlistData(value.begin(), value.end()));
}
inline Tag u8(std::string_view name, std::uint8_t value) {
  Tag tag;
  tag.code = code(name);
  tag.width = Tag::Width::UInt8;
  tag.number = value;
  return tag;
}
inline Tag u16(std::string_view name, std::uint16_t value) {
  return raw(name, {static_cast<std::uint8_t>(value >> 8), static_cast<std::uint8_t>(value)});
}
inline Tag u32(std::string_view name, std::uint32_t value) {
  Tag tag;
  tag.code = code(name);
  tag.width = Tag::Width::UInt32;
  tag.number = value;
  return tag;
}
inline Tag u64(std::string_view name, std::uint64_t value) {
  Tag tag;
  tag.code = code(name);
  tag.width = Tag::Width::UInt64;
  tag.number = value;
  return tag;
}
inline Tag container(std::string_view name, std::vector<Tag> children) {
  Tag tag;
  tag.code = code(name);
  tag.isContainer = true;
  tag.children = std::move(children);
  return tag;
}

inline PlistData document(const Tag& top) {
  DAAPBuffer buffer;
  top.writeTo(buffer);
  return buffer.data();
}

inline DAAPValue decode(const Tag& top) {
  return DAAPParser::decodeData(document(top));
}

inline PlistData bytesOf(std::string_view text) {
  return PlistData(text.begin(), text.end());
}

// Captures the log's lines at level 3 for as long as it lives, and puts the
// level back afterwards.
class LogCapture {
 public:
  struct Line {
    int level;
    std::string text;
  };

  LogCapture() : previousLevel_(TillLogManager::sharedManager().level()) {
    TillLogManager::sharedManager().setLevel(3);
    handle_ = TillLogManager::sharedManager().addSink([this](int level, const std::string& line) {
      std::lock_guard lock(mutex_);
      lines_.push_back({level, line});
    });
  }
  ~LogCapture() {
    handle_.reset();
    TillLogManager::sharedManager().setLevel(previousLevel_);
  }
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  [[nodiscard]] std::vector<Line> lines() const {
    std::lock_guard lock(mutex_);
    return lines_;
  }
  [[nodiscard]] std::vector<std::string> texts() const {
    std::vector<std::string> result;
    for (const Line& line : lines()) result.push_back(line.text);
    return result;
  }
  void clear() {
    std::lock_guard lock(mutex_);
    lines_.clear();
  }
  [[nodiscard]] std::size_t countExactly(std::string_view text, int level = 3) const {
    std::lock_guard lock(mutex_);
    return static_cast<std::size_t>(
        std::count_if(lines_.begin(), lines_.end(),
                      [&](const Line& line) { return line.text == text && line.level == level; }));
  }
  [[nodiscard]] std::size_t countContaining(std::string_view fragment) const {
    std::lock_guard lock(mutex_);
    return static_cast<std::size_t>(std::count_if(
        lines_.begin(), lines_.end(),
        [&](const Line& line) { return line.text.find(fragment) != std::string::npos; }));
  }
  [[nodiscard]] std::size_t size() const {
    std::lock_guard lock(mutex_);
    return lines_.size();
  }

 private:
  int previousLevel_;
  std::shared_ptr<void> handle_;
  mutable std::mutex mutex_;
  std::vector<Line> lines_;
};

}  // namespace larder::dmaptest
