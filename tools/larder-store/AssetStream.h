#pragma once

#include <httplib.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/system/FileDescriptor.h"

namespace larder {

// Streams a file from disk into an answer, in large blocks, for any range
// of it, optionally damaged on purpose for fault tests.
class AssetStream {
 public:
  enum class Damage {
    None,
    Truncate,  // the connection ends after half of the bytes asked for
    Corrupt,   // bytes in the middle of the file arrive inverted
  };
  static constexpr std::size_t kBlockSize = 1u << 20u;
  static constexpr std::uint64_t kCorruptedBytes = 16;

  static std::shared_ptr<AssetStream> open(const std::string& path, Damage damage);

  [[nodiscard]] std::uint64_t size() const { return size_; }

  // Content provider in httplib's form: writes bytes from `offset` on, at
  // most `length`; false ends the answer (and the connection).
  bool provide(std::size_t offset, std::size_t length, httplib::DataSink& sink);

  // Takes ownership of `fd`.
  AssetStream(int fd, std::uint64_t size, Damage damage);

 private:
  void corrupt(std::uint64_t offset, std::span<char> bytes) const;

  FileDescriptor file_;
  std::uint64_t size_;
  Damage damage_;
  std::optional<std::uint64_t> truncateAt_;
  std::vector<char> buffer_;
};

}  // namespace larder
