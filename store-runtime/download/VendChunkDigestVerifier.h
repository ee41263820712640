#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "store-runtime/records/VendChunkDigestRules.h"

namespace larder {

// Checks a file against its manifest while the bytes arrive: the file is
// cut into chunks of `chunkSize` bytes, the last one possibly shorter, and
// each chunk must have the digest listed for it. A chunk is checked the
// moment its last byte arrives, so a corrupt transfer stops at the first
// bad chunk instead of at the end. The digests are hex SHA-256 (64 digits);
// manifests of managed distribution may list hex MD5 (32 digits) instead,
// and the length of the digests tells which.
//
// Not thread-safe: one feeder at a time.
class VendChunkDigestVerifier {
 public:
  enum class Failure {
    kNone,
    kBadManifest,     // digests that are not hex of one known length, or a chunk size of 0
                      // or over kMaxChunkSize
    kDigestMismatch,  // a chunk's digest differs
    kTooLong,         // more bytes than the file size
    kTooShort,        // the transfer ended before the file size
    kChunkCount,      // the file has more or fewer chunks than digests
  };

  // The most bytes one digest may cover. A bad chunk is found only when
  // its last byte arrives, so this bounds what a store can have written
  // before its bytes are caught; one digest for a whole file of any size
  // bounds nothing.
  static constexpr std::uint64_t kMaxChunkSize = VendChunkDigestRules::kMaxChunkSize;

  VendChunkDigestVerifier(std::uint64_t fileSize, std::uint64_t chunkSize,
                          const std::vector<std::string>& hexDigests);
  ~VendChunkDigestVerifier();
  VendChunkDigestVerifier(VendChunkDigestVerifier&&) noexcept;
  VendChunkDigestVerifier& operator=(VendChunkDigestVerifier&&) noexcept;
  VendChunkDigestVerifier(const VendChunkDigestVerifier&) = delete;
  VendChunkDigestVerifier& operator=(const VendChunkDigestVerifier&) = delete;

  // Takes the next bytes. False once anything has failed; later calls do
  // nothing and keep the first failure.
  bool update(std::span<const std::uint8_t> bytes);
  // Checks the last, short chunk and the totals. True when the whole file
  // matched.
  bool finish();

  [[nodiscard]] bool failed() const { return failure_ != Failure::kNone; }
  [[nodiscard]] Failure failure() const { return failure_; }
  // For people: which chunk, at which offset, what was expected.
  [[nodiscard]] const std::string& failureDescription() const { return failureDescription_; }
  [[nodiscard]] std::uint64_t bytesReceived() const { return received_; }
  [[nodiscard]] std::uint64_t fileSize() const { return fileSize_; }

 private:
  struct Hasher;

  void completeChunk();
  bool fail(Failure failure, std::string description);

  std::uint64_t fileSize_;
  std::uint64_t chunkSize_;
  std::size_t digestLength_ = 0;
  std::vector<std::uint8_t> expected_;  // digests back to back
  std::size_t expectedCount_ = 0;
  std::unique_ptr<Hasher> hasher_;
  std::uint64_t received_ = 0;
  std::uint64_t inChunk_ = 0;
  std::size_t chunkIndex_ = 0;
  Failure failure_ = Failure::kNone;
  std::string failureDescription_;
};

}  // namespace larder
