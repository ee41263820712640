#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace larder {

// The digests a download is checked against: the hex SHA-256 of each chunk
// of `chunkSize` bytes of the file, the last chunk possibly shorter.
struct PackageDigest {
  std::uint64_t fileSize = 0;
  std::uint64_t chunkSize = 0;
  std::vector<std::string> hashes;

  // Reads the file once, in large blocks; nullopt (with *error) when it
  // cannot be read or `chunkSize` is 0.
  static std::optional<PackageDigest> compute(const std::string& path, std::uint64_t chunkSize,
                                              std::string* error);
};

}  // namespace larder
