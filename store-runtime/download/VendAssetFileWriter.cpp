#include "store-runtime/download/VendAssetFileWriter.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/system/FileDescriptor.h"
#include "store-runtime/download/VendDownloadError.h"

namespace larder {

namespace {

// Large enough that the hashing thread wakes rarely and each write is one
// big system call; small enough that a few in flight cost little memory.
constexpr std::size_t kBufferSize = 4u << 20u;
constexpr std::size_t kMaxWaitingBuffers = 3;

VendError verificationError(const VendChunkDigestVerifier& verifier, const std::string& path) {
  using Failure = VendChunkDigestVerifier::Failure;
  const VendDownloadError::Code code = [&] {
    switch (verifier.failure()) {
      case Failure::kDigestMismatch:
        return VendDownloadError::kDigestMismatch;
      case Failure::kBadManifest:
        return VendDownloadError::kInvalidDownload;
      default:
        return VendDownloadError::kSizeMismatch;
    }
  }();
  return VendDownloadError::make(
      code, "The downloaded file " + path +
                " does not match its manifest: " + verifier.failureDescription());
}

VendError fileError(const std::string& what, const std::string& path, int error) {
  return VendDownloadError::make(VendDownloadError::kFileSystem,
                                 "Cannot " + what + " " + path + ": " + std::strerror(error));
}

bool writeAll(int fd, const std::uint8_t* bytes, std::size_t length) {
  while (length > 0) {
    const ssize_t written = ::write(fd, bytes, length);
    if (written < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    bytes += written;
    length -= static_cast<std::size_t>(written);
  }
  return true;
}

// Feeds what a partial file already holds through the verifier.
OptionalError verifyExistingBytes(int fd, std::uint64_t size, VendChunkDigestVerifier& verifier,
                                  const std::string& path) {
  std::vector<std::uint8_t> block(kBufferSize);
  std::uint64_t offset = 0;
  while (offset < size) {
    const ssize_t got = ::pread(fd, block.data(), block.size(), static_cast<off_t>(offset));
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) return fileError("read back", path, got < 0 ? errno : EIO);
    if (!verifier.update({block.data(), static_cast<std::size_t>(got)})) {
      return verificationError(verifier, path);
    }
    offset += static_cast<std::uint64_t>(got);
  }
  return std::nullopt;
}

}  // namespace

std::unique_ptr<VendAssetFileWriter> VendAssetFileWriter::open(const std::string& path,
                                                               VendChunkDigestVerifier verifier,
                                                               OptionalError& error) {
  if (verifier.failed()) {
    error = verificationError(verifier, path);
    return nullptr;
  }
  FileDescriptor fd(::open(path.c_str(), O_RDWR | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
  if (!fd.valid()) {
    error = fileError("open", path, errno);
    return nullptr;
  }
  struct stat info {};
  if (::fstat(fd.get(), &info) != 0) {
    error = fileError("inspect", path, errno);
    return nullptr;
  }
  const auto existing = static_cast<std::uint64_t>(info.st_size);
  if (existing > 0) {
    error = verifyExistingBytes(fd.get(), existing, verifier, path);
    if (error) return nullptr;
  }
  return std::unique_ptr<VendAssetFileWriter>(
      new VendAssetFileWriter(fd.release(), path, std::move(verifier), existing));
}

OptionalError VendAssetFileWriter::verifyFile(const std::string& path,
                                              VendChunkDigestVerifier verifier) {
  if (verifier.failed()) return verificationError(verifier, path);
  FileDescriptor fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) return fileError("open", path, errno);
  struct stat info {};
  if (::fstat(fd.get(), &info) != 0) return fileError("inspect", path, errno);
  if (OptionalError error =
          verifyExistingBytes(fd.get(), static_cast<std::uint64_t>(info.st_size), verifier, path)) {
    return error;
  }
  if (!verifier.finish()) return verificationError(verifier, path);
  return std::nullopt;
}

VendAssetFileWriter::VendAssetFileWriter(int fd, std::string path, VendChunkDigestVerifier verifier,
                                         std::uint64_t existingBytes)
    : fd_(fd),
      path_(std::move(path)),
      verifier_(std::move(verifier)),
      existingBytes_(existingBytes),
      declaredSize_(verifier_.fileSize()),
      written_(existingBytes) {
  filling_.reserve(kBufferSize);
  consumer_ = std::thread([this] { consume(); });
}

VendAssetFileWriter::~VendAssetFileWriter() {
  drain();
  ::close(fd_);
}

bool VendAssetFileWriter::append(std::span<const std::uint8_t> bytes) {
  if (failed()) return false;
  // The verifier would catch a longer file too, but only on the hashing
  // thread, after the bytes were on disk: a store that sends without end
  // would fill it first.
  if (bytes.size() > declaredSize_ - written_) {
    recordFailure(VendDownloadError::make(
        VendDownloadError::kSizeMismatch,
        "The download " + path_ + " is longer than the " + std::to_string(declaredSize_) +
            " bytes its manifest announces; the rest was not written"));
    return false;
  }
  // Written straight from the transfer's own buffer while its bytes are
  // still in the processor's cache; the copy for the hashing thread then
  // reads them from there too.
  if (!writeAll(fd_, bytes.data(), bytes.size())) {
    recordFailure(fileError("write", path_, errno));
    return false;
  }
  written_ += bytes.size();
  while (!bytes.empty()) {
    const std::size_t take = std::min(bytes.size(), kBufferSize - filling_.size());
    filling_.insert(filling_.end(), bytes.begin(),
                    bytes.begin() + static_cast<std::ptrdiff_t>(take));
    bytes = bytes.subspan(take);
    if (filling_.size() == kBufferSize) handOver();
  }
  return !failed();
}

VendAssetFileWriter::Buffer VendAssetFileWriter::takeFreeBuffer() {
  if (free_.empty()) {
    Buffer buffer;
    buffer.reserve(kBufferSize);
    return buffer;
  }
  Buffer buffer = std::move(free_.back());
  free_.pop_back();
  buffer.clear();
  return buffer;
}

void VendAssetFileWriter::handOver() {
  MutexLock lock(mutex_);
  changed_.wait(lock, [this]() REQUIRES(mutex_) { return full_.size() < kMaxWaitingBuffers; });
  full_.push_back(std::move(filling_));
  filling_ = takeFreeBuffer();
  changed_.notify_all();
}

void VendAssetFileWriter::consume() {
  MutexLock lock(mutex_);
  for (;;) {
    changed_.wait(lock, [this]() REQUIRES(mutex_) { return !full_.empty() || closing_; });
    if (full_.empty()) return;
    Buffer buffer = std::move(full_.front());
    full_.pop_front();
    changed_.notify_all();
    lock.unlock();
    // After a failure the rest is only drained, so that `append` and
    // `finish` never wait for a consumer that has given up.
    if (!failed() && !verifier_.update(buffer)) recordFailure(verificationError(verifier_, path_));
    lock.lock();
    free_.push_back(std::move(buffer));
  }
}

void VendAssetFileWriter::recordFailure(VendError error) {
  MutexLock lock(mutex_);
  if (!failure_) failure_ = std::move(error);
  failed_.store(true, std::memory_order_relaxed);
}

OptionalError VendAssetFileWriter::drain() {
  if (!drained_) {
    drained_ = true;
    if (!filling_.empty()) handOver();
    {
      MutexLock lock(mutex_);
      closing_ = true;
    }
    changed_.notify_all();
    consumer_.join();
  }
  MutexLock lock(mutex_);
  return failure_;
}

OptionalError VendAssetFileWriter::close() {
  return drain();
}

OptionalError VendAssetFileWriter::finish() {
  if (OptionalError failure = drain()) return failure;
  if (!verifier_.finish()) return verificationError(verifier_, path_);
  return std::nullopt;
}

}  // namespace larder
