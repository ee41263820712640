#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <memory>
#include <span>
#include <string>
#include <thread>
#include <vector>

#include "platform/error/VendError.h"
#include "platform/system/Mutex.h"
#include "store-runtime/download/VendChunkDigestVerifier.h"

namespace larder {

// Writes an asset to its partial file and checks its digests on a thread of
// its own: the transfer thread writes each piece as it arrives and gathers
// a copy into large buffers for the hashing thread, so that hashing
// overlaps with receiving and writing. At most a few buffers wait to be
// hashed; a transfer that outruns the hashing waits in `append`.
class VendAssetFileWriter {
 public:
  // Opens `path` for appending, creating it. Bytes already in the file (a
  // transfer that was paused) are read back through the verifier first, so
  // that the finished file is checked as a whole. nullptr with `error` set
  // when the file cannot be opened or its bytes already fail the check.
  static std::unique_ptr<VendAssetFileWriter> open(const std::string& path,
                                                   VendChunkDigestVerifier verifier,
                                                   OptionalError& error);
  // Reads a finished file, without changing it, through `verifier` and
  // makes the final checks.
  static OptionalError verifyFile(const std::string& path, VendChunkDigestVerifier verifier);

  ~VendAssetFileWriter();
  VendAssetFileWriter(const VendAssetFileWriter&) = delete;
  VendAssetFileWriter& operator=(const VendAssetFileWriter&) = delete;

  // Bytes that were in the file when it was opened.
  [[nodiscard]] std::uint64_t existingBytes() const { return existingBytes_; }

  // Takes the next bytes of the transfer. False once a digest, the size or
  // the disk has failed: the transfer should stop. Bytes beyond the size
  // the manifest announces fail at once and are not written.
  bool append(std::span<const std::uint8_t> bytes);
  [[nodiscard]] bool failed() const { return failed_.load(std::memory_order_relaxed); }

  // Writes everything taken, then checks the last chunk and the totals.
  // The first failure, or nullopt when the file is complete and matches.
  OptionalError finish();
  // Writes everything taken and stops, without the final checks: the file
  // then holds every byte accepted, ready for a later resume. Returns the
  // failure, if any happened on the way.
  OptionalError close();

 private:
  using Buffer = std::vector<std::uint8_t>;

  VendAssetFileWriter(int fd, std::string path, VendChunkDigestVerifier verifier,
                      std::uint64_t existingBytes);
  void handOver();
  Buffer takeFreeBuffer() REQUIRES(mutex_);
  void consume();
  void recordFailure(VendError error);
  OptionalError drain();

  int fd_;
  std::string path_;
  VendChunkDigestVerifier verifier_;  // touched by the hashing thread only, until drained
  std::uint64_t existingBytes_;
  std::uint64_t declaredSize_;  // the manifest's, fixed when opened
  std::uint64_t written_;       // in the file, the existing bytes included
  Buffer filling_;

  Mutex mutex_;
  ConditionVariable changed_;
  std::deque<Buffer> full_ GUARDED_BY(mutex_);
  std::vector<Buffer> free_ GUARDED_BY(mutex_);
  bool closing_ GUARDED_BY(mutex_) = false;
  OptionalError failure_ GUARDED_BY(mutex_);
  std::atomic<bool> failed_{false};
  std::thread consumer_;
  bool drained_ = false;
};

}  // namespace larder
