#include "store-runtime/download/VendChunkDigestVerifier.h"

#include <algorithm>
#include <cstring>

#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/http/CryptoLibrary.h"
#include "store-runtime/records/VendChunkDigestRules.h"

namespace larder {

namespace {

bool appendHex(std::string_view hex, std::vector<std::uint8_t>& out) {
  if (hex.size() % 2 != 0) return false;
  for (std::size_t i = 0; i < hex.size(); i += 2) {
    const int high = hexDigitValue(hex[i]);
    const int low = hexDigitValue(hex[i + 1]);
    if (high < 0 || low < 0) return false;
    out.push_back(static_cast<std::uint8_t>(high * 16 + low));
  }
  return true;
}

const EVP_MD* digestForLength(std::size_t length) {
  if (length == VendChunkDigestRules::kSha256Length) return CryptoLibrary::shared().sha256();
  if (length == VendChunkDigestRules::kMd5Length) return CryptoLibrary::shared().md5();
  return nullptr;
}

}  // namespace

struct VendChunkDigestVerifier::Hasher {
  struct ContextDeleter {
    void operator()(EVP_MD_CTX* context) const { CryptoLibrary::shared().contextFree(context); }
  };
  explicit Hasher(const EVP_MD* algorithm)
      : algorithm(algorithm), context(CryptoLibrary::shared().contextNew()) {}

  void start() { CryptoLibrary::shared().digestInit(context.get(), algorithm, nullptr); }

  const EVP_MD* algorithm;
  std::unique_ptr<EVP_MD_CTX, ContextDeleter> context;
};

VendChunkDigestVerifier::VendChunkDigestVerifier(std::uint64_t fileSize, std::uint64_t chunkSize,
                                                 const std::vector<std::string>& hexDigests)
    : fileSize_(fileSize), chunkSize_(chunkSize), expectedCount_(hexDigests.size()) {
  if (std::optional<std::string> problem = VendChunkDigestRules::chunkSizeProblem(chunkSize_)) {
    fail(Failure::kBadManifest, "the manifest's " + *problem);
    return;
  }
  if (std::optional<std::string> problem = VendChunkDigestRules::digestListProblem(hexDigests)) {
    fail(Failure::kBadManifest, "the manifest's " + *problem);
    return;
  }
  digestLength_ = hexDigests.front().size() / 2;
  expected_.reserve(digestLength_ * hexDigests.size());
  for (const std::string& hex : hexDigests) appendHex(hex, expected_);
  hasher_ = std::make_unique<Hasher>(digestForLength(digestLength_));
  hasher_->start();
}

VendChunkDigestVerifier::~VendChunkDigestVerifier() = default;
VendChunkDigestVerifier::VendChunkDigestVerifier(VendChunkDigestVerifier&&) noexcept = default;
VendChunkDigestVerifier& VendChunkDigestVerifier::operator=(VendChunkDigestVerifier&&) noexcept =
    default;

bool VendChunkDigestVerifier::fail(Failure failure, std::string description) {
  if (failure_ == Failure::kNone) {
    failure_ = failure;
    failureDescription_ = std::move(description);
  }
  return false;
}

void VendChunkDigestVerifier::completeChunk() {
  const std::uint64_t chunkOffset = received_ - inChunk_;
  if (chunkIndex_ >= expectedCount_) {
    fail(Failure::kChunkCount,
         "chunk " + std::to_string(chunkIndex_) + " at offset " + std::to_string(chunkOffset) +
             " has no digest in the manifest (" + std::to_string(expectedCount_) + " digests)");
    return;
  }
  std::uint8_t digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  CryptoLibrary::shared().digestFinal(hasher_->context.get(), digest, &length);
  const std::uint8_t* expected = expected_.data() + chunkIndex_ * digestLength_;
  if (length != digestLength_ || std::memcmp(digest, expected, digestLength_) != 0) {
    fail(Failure::kDigestMismatch,
         "chunk " + std::to_string(chunkIndex_) + " (bytes " + std::to_string(chunkOffset) + "-" +
             std::to_string(received_ - 1) + ") has digest " + hexString({digest, length}) +
             ", the manifest lists " + hexString({expected, digestLength_}));
    return;
  }
  ++chunkIndex_;
  inChunk_ = 0;
  hasher_->start();
}

bool VendChunkDigestVerifier::update(std::span<const std::uint8_t> bytes) {
  if (failed()) return false;
  if (bytes.size() > fileSize_ - received_) {
    return fail(Failure::kTooLong, "the file is longer than the " + std::to_string(fileSize_) +
                                       " bytes the manifest announces");
  }
  while (!bytes.empty()) {
    const std::size_t take =
        static_cast<std::size_t>(std::min<std::uint64_t>(bytes.size(), chunkSize_ - inChunk_));
    CryptoLibrary::shared().digestUpdate(hasher_->context.get(), bytes.data(), take);
    received_ += take;
    inChunk_ += take;
    bytes = bytes.subspan(take);
    if (inChunk_ == chunkSize_) {
      completeChunk();
      if (failed()) return false;
    }
  }
  return true;
}

bool VendChunkDigestVerifier::finish() {
  if (failed()) return false;
  if (received_ < fileSize_) {
    return fail(Failure::kTooShort, "the file ended after " + std::to_string(received_) + " of " +
                                        std::to_string(fileSize_) + " bytes");
  }
  if (inChunk_ > 0) {
    completeChunk();
    if (failed()) return false;
  }
  if (chunkIndex_ != expectedCount_) {
    return fail(Failure::kChunkCount, "the file has " + std::to_string(chunkIndex_) +
                                          " chunks, the manifest lists " +
                                          std::to_string(expectedCount_) + " digests");
  }
  return true;
}

}  // namespace larder
