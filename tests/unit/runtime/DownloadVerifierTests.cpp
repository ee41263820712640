// Chunk digests checked while bytes arrive, and the limits that keep what a
// store announces from filling the disk: digests cover bounded chunks, a
// file that cannot fit is not fetched, and bytes beyond the announced size
// are never written.
#include <gtest/gtest.h>
#include <sys/statvfs.h>

#include <random>
#include <string>
#include <vector>

#include "RuntimeTestSupport.h"
#include "store-runtime/download/VendAssetFetcher.h"
#include "store-runtime/download/VendAssetFileWriter.h"
#include "store-runtime/download/VendChunkDigestVerifier.h"
#include "store-runtime/download/VendDownloadError.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using testing::bytesOf;
using testing::chunkDigests;
using testing::randomBytes;
using Failure = VendChunkDigestVerifier::Failure;
constexpr std::uint64_t kMaxChunk = VendChunkDigestVerifier::kMaxChunkSize;

TEST(VendChunkDigestVerifier, VerifiesGoodFilesAndNamesWhatIsWrongWithOthers) {
  // SHA-256 and MD5 of "abc", from their standards' test vectors.
  const std::string sha256 = "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad";
  const std::string md5 = "900150983cd24fb0d6963f7d28e17f72";
  std::string upper = sha256;
  for (char& c : upper) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  const std::string file = randomBytes(2500, 9);
  std::string badEnd = file;
  badEnd.back() ^= 0x80;
  const std::vector<std::string> d = chunkDigests(file, 1000);
  const std::string a64(64, 'a');
  enum Outcome { kVerifies, kFailsOnUpdate, kFailsOnFinish, kBadManifest };
  const struct {
    const char* name;
    std::uint64_t size, chunk;
    std::vector<std::string> digests;
    std::string fed;
    Outcome outcome;
    Failure failure;
    const char* phrase;
  } cases[] = {
      {"SHA-256", 3, 3, {sha256}, "abc", kVerifies},
      {"upper case, chunk beyond the file", 3, 1024, {upper}, "abc", kVerifies},
      {"MD5", 3, 3, {md5}, "abc", kVerifies},
      {"wrong bytes", 3, 3, {sha256}, "abd", kFailsOnUpdate, Failure::kDigestMismatch},
      {"bad short last chunk", 2500, 1000, d, badEnd, kFailsOnFinish, Failure::kDigestMismatch},
      {"longer than announced", 2499, 1000, d, file, kFailsOnUpdate, Failure::kTooLong},
      {"shorter than announced", 2500, 1000, d, file.substr(0, 2000), kFailsOnFinish,
       Failure::kTooShort},
      {"fewer digests than chunks",
       2500,
       1000,
       {d[0], d[1]},
       file,
       kFailsOnFinish,
       Failure::kChunkCount},
      {"more digests than chunks",
       2500,
       1000,
       {d[0], d[1], d[2], d[0]},
       file,
       kFailsOnFinish,
       Failure::kChunkCount},
      {"chunk at the limit", kMaxChunk, kMaxChunk, {a64}, "", kFailsOnFinish, Failure::kTooShort},
      {"no digests", 3, 3, {}, "abc", kBadManifest, Failure::kBadManifest},
      {"digest not hex", 3, 3, {std::string(64, 'z')}, "abc", kBadManifest, Failure::kBadManifest},
      {"digest of no known length",
       3,
       3,
       {std::string(40, 'a')},
       "abc",
       kBadManifest,
       Failure::kBadManifest},
      {"digests of two lengths",
       3,
       3,
       {a64, std::string(32, 'a')},
       "abc",
       kBadManifest,
       Failure::kBadManifest},
      {"chunk size 0", 3, 0, {sha256}, "abc", kBadManifest, Failure::kBadManifest},
      {"chunk over the limit",
       kMaxChunk + 1,
       kMaxChunk + 1,
       {a64},
       "abc",
       kBadManifest,
       Failure::kBadManifest,
       "over the limit"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    VendChunkDigestVerifier verifier(c.size, c.chunk, c.digests);
    EXPECT_EQ(verifier.failed(), c.outcome == kBadManifest) << "before any byte";
    const bool updated = verifier.update(bytesOf(c.fed));
    EXPECT_EQ(updated, c.outcome == kVerifies || c.outcome == kFailsOnFinish);
    if (c.outcome != kFailsOnUpdate && c.outcome != kBadManifest) {
      EXPECT_EQ(verifier.finish(), c.outcome == kVerifies) << verifier.failureDescription();
    }
    EXPECT_EQ(verifier.failure(), c.outcome == kVerifies ? Failure::kNone : c.failure)
        << verifier.failureDescription();
    if (c.phrase) {
      EXPECT_NE(verifier.failureDescription().find(c.phrase), std::string::npos);
    }
  }
}

TEST(VendChunkDigestVerifier, AnySplitOfTheInputVerifies) {
  const std::string file = randomBytes(100'003, 7);
  std::mt19937 generator(11);
  for (std::size_t chunkSize : {1000u, 1024u, 100'003u, 250'000u}) {
    VendChunkDigestVerifier verifier(file.size(), chunkSize, chunkDigests(file, chunkSize));
    for (std::size_t offset = 0, piece = 0; offset < file.size(); offset += piece) {
      piece = std::min<std::size_t>(file.size() - offset, 1 + generator() % 3000);
      ASSERT_TRUE(verifier.update(bytesOf(std::string_view(file).substr(offset, piece))))
          << "chunk size " << chunkSize << " at " << offset << ": "
          << verifier.failureDescription();
    }
    EXPECT_TRUE(verifier.finish()) << verifier.failureDescription();
    EXPECT_EQ(verifier.bytesReceived(), file.size());
  }
}

TEST(VendChunkDigestVerifier, StopsAtTheFirstBadChunk) {
  const std::size_t chunk = 4096;
  const std::string good = randomBytes(10 * chunk, 3);
  std::string bad = good;
  bad[2 * chunk + 17] ^= 1;  // in the third chunk
  VendChunkDigestVerifier verifier(good.size(), chunk, chunkDigests(good, chunk));
  EXPECT_TRUE(verifier.update(bytesOf(std::string_view(bad).substr(0, 2 * chunk))));
  // The bad chunk fails when its last byte arrives, not at the end.
  EXPECT_TRUE(verifier.update(bytesOf(std::string_view(bad).substr(2 * chunk, chunk - 1))));
  EXPECT_FALSE(verifier.update(bytesOf(std::string_view(bad).substr(3 * chunk - 1, 1))));
  EXPECT_EQ(verifier.failure(), Failure::kDigestMismatch);
  EXPECT_NE(verifier.failureDescription().find("chunk 2 "), std::string::npos)
      << verifier.failureDescription();
  // Later bytes, even good ones, change nothing.
  EXPECT_FALSE(verifier.update(bytesOf(std::string_view(good).substr(3 * chunk, chunk))));
  EXPECT_FALSE(verifier.finish());
  EXPECT_EQ(verifier.failure(), Failure::kDigestMismatch);
}

// An asset of `size` bytes in chunks of `chunkSize`, with as many digests
// as that takes; the digests need not match, as no byte should be read.
TillDownloadAsset announcedAsset(const std::string& url, std::uint64_t size,
                                 std::uint64_t chunkSize) {
  TillDownloadAsset asset = testing::assetFor(url, "", chunkSize);
  asset.setFileSize(static_cast<std::int64_t>(size));
  asset.setHashes(std::vector<std::string>((size - 1) / chunkSize + 1, std::string(64, 'a')));
  return asset;
}

TEST(DownloadLimits, AnAssetWhoseDigestCoversMoreThanTheChunkLimitIsUnusable) {
  const TillDownloadAsset whole = announcedAsset("http://127.0.0.1/a", 1ULL << 40, 1ULL << 40);
  ASSERT_TRUE(whole.unusableReason());
  EXPECT_NE(whole.unusableReason()->find("over the limit"), std::string::npos);
  EXPECT_FALSE(announcedAsset("http://127.0.0.1/a", 1ULL << 30, kMaxChunk).unusableReason());
}

TEST(DownloadLimits, BytesBeyondTheAnnouncedSizeAreNotWritten) {
  testing::PrivateRoot root;
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
  testing::PrivateRoot root;
  testing::StoreServer server;
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
  EXPECT_EQ(server.totalRequests(), 0u);
}

}  // namespace
}  // namespace larder
