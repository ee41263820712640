// What a store announces about a download cannot make it fill the disk:
// digests cover bounded chunks, a file that cannot fit is not fetched, and
// bytes beyond the announced size are never written.
#include <gtest/gtest.h>
#include <sys/statvfs.h>

#include <string>
#include <vector>

#include "DownloadTestSupport.h"
#include "store-runtime/download/VendAssetFetcher.h"
#include "store-runtime/download/VendAssetFileWriter.h"
#include "store-runtime/download/VendChunkDigestVerifier.h"
#include "store-runtime/download/VendDownloadError.h"
#include "store-runtime/records/TillDownloadAsset.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using testing::chunkDigests;
using testing::PackageServer;
using testing::PrivateRoot;
using testing::randomBytes;

constexpr std::uint64_t kMaxChunk = VendChunkDigestVerifier::kMaxChunkSize;

std::span<const std::uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

// An asset of `size` bytes in chunks of `chunkSize`, with as many digests
// as that takes; the digests need not match, as no byte should be read.
TillDownloadAsset announcedAsset(const std::string& url, std::uint64_t size,
                                 std::uint64_t chunkSize) {
  TillDownloadAsset asset;
  asset.setType(TillDownloadAsset::kTypeSoftwarePackage);
  asset.setURLRequest(VendURLRequest(url));
  asset.setFileSize(static_cast<std::int64_t>(size));
  asset.setNumberOfBytesToHash(static_cast<std::int64_t>(chunkSize));
  asset.setHashes(std::vector<std::string>((size - 1) / chunkSize + 1, std::string(64, 'a')));
  return asset;
}

TEST(DownloadLimits, OneDigestMayNotCoverMoreThanTheChunkLimit) {
  const std::string digest(64, 'a');
  EXPECT_FALSE(VendChunkDigestVerifier(kMaxChunk, kMaxChunk, {digest}).failed());
  VendChunkDigestVerifier over(kMaxChunk + 1, kMaxChunk + 1, {digest});
  EXPECT_EQ(over.failure(), VendChunkDigestVerifier::Failure::kBadManifest);
  EXPECT_NE(over.failureDescription().find("over the limit"), std::string::npos)
      << over.failureDescription();

  const TillDownloadAsset whole = announcedAsset("http://127.0.0.1/a", 1ULL << 40, 1ULL << 40);
  ASSERT_TRUE(whole.unusableReason());
  EXPECT_NE(whole.unusableReason()->find("over the limit"), std::string::npos);
  EXPECT_FALSE(announcedAsset("http://127.0.0.1/a", 1ULL << 30, kMaxChunk).unusableReason());
}

TEST(DownloadLimits, BytesBeyondTheAnnouncedSizeAreNotWritten) {
  PrivateRoot root;
  fs::create_directories(root.scratch());
  const std::string path = (root.scratch() / "0.partial").string();
  const std::string file = randomBytes(10'000, 3);
  OptionalError error;
  auto writer = VendAssetFileWriter::open(
      path, VendChunkDigestVerifier(file.size(), 4096, chunkDigests(file, 4096)), error);
  ASSERT_TRUE(writer) << error->description;
  EXPECT_TRUE(writer->append(bytesOf(file)));
  EXPECT_FALSE(writer->append(bytesOf("one more")));
  const OptionalError failure = writer->finish();
  ASSERT_TRUE(failure);
  EXPECT_EQ(failure->code, VendDownloadError::kSizeMismatch) << failure->description;
  EXPECT_EQ(fs::file_size(path), file.size());
}

TEST(DownloadLimits, AFileLargerThanTheFreeSpaceIsNotFetched) {
  PrivateRoot root;
  PackageServer server;
  fs::create_directories(root.downloads());
  struct statvfs info {};
  ASSERT_EQ(::statvfs(root.downloads().c_str(), &info), 0);
  const std::uint64_t available = static_cast<std::uint64_t>(info.f_bavail) * info.f_frsize;
  const std::string url = server.add("/big.tar", randomBytes(100'000, 4));
  const TillDownloadAsset asset = announcedAsset(url, available + (1ULL << 30), kMaxChunk);
  ASSERT_FALSE(asset.unusableReason()) << *asset.unusableReason();

  const VendAssetFetcher::Result result = VendAssetFetcher::fetch(
      asset, (root.downloads() / "0.partial").string(), {}, VendAssetFetcher::Control{});
  EXPECT_EQ(result.outcome, VendAssetFetcher::Outcome::kFailed);
  ASSERT_TRUE(result.error);
  EXPECT_EQ(result.error->code, VendDownloadError::kFileSystem) << result.error->description;
  EXPECT_NE(result.error->description.find("free"), std::string::npos) << result.error->description;
  EXPECT_EQ(server.totalRequests(), 0);
}

}  // namespace
}  // namespace larder
