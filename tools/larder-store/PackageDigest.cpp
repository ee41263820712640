#include "larder-store/PackageDigest.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <memory>
#include <span>

#include "platform/system/FileDescriptor.h"
#include "store-runtime/core/VendStringHelpers.h"

namespace larder {
namespace {

constexpr std::size_t kReadBlockSize = 4u << 20u;

struct DigestContextDeleter {
  void operator()(EVP_MD_CTX* context) const { EVP_MD_CTX_free(context); }
};
using DigestContext = std::unique_ptr<EVP_MD_CTX, DigestContextDeleter>;

// Feeds bytes to SHA-256 and closes a chunk every `chunkSize` bytes.
class ChunkHasher {
 public:
  explicit ChunkHasher(std::uint64_t chunkSize)
      : chunkSize_(chunkSize), context_(EVP_MD_CTX_new()) {
    restart();
  }

  void add(std::span<const unsigned char> bytes) {
    while (!bytes.empty()) {
      const auto take =
          static_cast<std::size_t>(std::min<std::uint64_t>(bytes.size(), chunkSize_ - inChunk_));
      EVP_DigestUpdate(context_.get(), bytes.data(), take);
      inChunk_ += take;
      bytes = bytes.subspan(take);
      if (inChunk_ == chunkSize_) finishChunk();
    }
  }

  std::vector<std::string> finish() {
    if (inChunk_ > 0) finishChunk();
    return std::move(hashes_);
  }

 private:
  void restart() {
    EVP_DigestInit_ex(context_.get(), EVP_sha256(), nullptr);
    inChunk_ = 0;
  }

  void finishChunk() {
    std::array<unsigned char, EVP_MAX_MD_SIZE> digest{};
    unsigned int length = 0;
    EVP_DigestFinal_ex(context_.get(), digest.data(), &length);
    hashes_.push_back(hexString({digest.data(), length}));
    restart();
  }

  std::uint64_t chunkSize_;
  DigestContext context_;
  std::uint64_t inChunk_ = 0;
  std::vector<std::string> hashes_;
};

}  // namespace

Result<PackageDigest> PackageDigest::compute(const std::string& path, std::uint64_t chunkSize) {
  const auto failed = [](int code, std::string why) {
    return VendError::withDomain(std::string(kErrorDomain), code, std::move(why));
  };
  if (chunkSize == 0) return failed(EINVAL, "the chunk size is 0");
  FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!file.valid()) return failed(errno, "cannot open " + path + ": " + std::strerror(errno));
  ::posix_fadvise(file.get(), 0, 0, POSIX_FADV_SEQUENTIAL);
  std::vector<unsigned char> block(kReadBlockSize);
  ChunkHasher hasher(chunkSize);
  PackageDigest digest;
  digest.chunkSize = chunkSize;
  for (;;) {
    const ssize_t got = ::read(file.get(), block.data(), block.size());
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return failed(errno, "cannot read " + path + ": " + std::strerror(errno));
    if (got == 0) break;
    hasher.add({block.data(), static_cast<std::size_t>(got)});
    digest.fileSize += static_cast<std::uint64_t>(got);
  }
  digest.hashes = hasher.finish();
  return digest;
}

}  // namespace larder
