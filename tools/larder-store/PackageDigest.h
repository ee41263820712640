#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/error/Result.h"

namespace larder {

// The digests a download is checked against: the hex SHA-256 of each chunk
// of `chunkSize` bytes of the file, the last chunk possibly shorter.
struct PackageDigest {
  std::uint64_t fileSize = 0;
  std::uint64_t chunkSize = 0;
  std::vector<std::string> hashes;

  // Reads the file once, in large blocks; an error when it cannot be read
  // (its errno as code) or `chunkSize` is 0.
  static constexpr std::string_view kErrorDomain = "PackageDigest";
  static Result<PackageDigest> compute(const std::string& path, std::uint64_t chunkSize);
};

}  // namespace larder
