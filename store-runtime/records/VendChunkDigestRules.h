#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace larder {

// What a store's list of chunk digests may say: checked when the answer is
// read, so that an unusable asset is refused before any byte is fetched, and
// again by the verifier that checks the bytes.
class VendChunkDigestRules {
 public:
  // One digest may cover at most this much of a file: a store cannot make
  // the disk fill before a single mismatch is found.
  static constexpr std::uint64_t kMaxChunkSize = 64u << 20u;
  static constexpr std::size_t kSha256Length = 32;
  static constexpr std::size_t kMd5Length = 16;

  // Why a chunk size cannot be checked against, or nullopt.
  static std::optional<std::string> chunkSizeProblem(std::uint64_t chunkSize);
  // Why a list of hex digests cannot be checked against, or nullopt: all of
  // one length, SHA-256 or MD5, hex digits only.
  static std::optional<std::string> digestListProblem(const std::vector<std::string>& hexDigests);
};

}  // namespace larder
