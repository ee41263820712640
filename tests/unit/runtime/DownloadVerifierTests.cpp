// Chunk digests checked while bytes arrive: known answers, any split of the
// input, the first bad chunk stopping the transfer, and files of the wrong
// length.
#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

#include "DownloadTestSupport.h"
#include "store-runtime/download/VendChunkDigestVerifier.h"

namespace larder {
namespace {

using testing::chunkDigests;
using testing::randomBytes;
using Failure = VendChunkDigestVerifier::Failure;

std::span<const std::uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

TEST(VendChunkDigestVerifier, KnownAnswersInEitherCase) {
  // SHA-256 and MD5 of "abc", from their standards' test vectors.
  const std::string sha256 = "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad";
  VendChunkDigestVerifier lower(3, 3, {sha256});
  EXPECT_TRUE(lower.update(bytesOf("abc")));
  EXPECT_TRUE(lower.finish()) << lower.failureDescription();

  std::string upper = sha256;
  for (char& c : upper) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  VendChunkDigestVerifier shouting(3, 1024, {upper});
  EXPECT_TRUE(shouting.update(bytesOf("abc")));
  EXPECT_TRUE(shouting.finish()) << shouting.failureDescription();

  VendChunkDigestVerifier md5(3, 3, {"900150983cd24fb0d6963f7d28e17f72"});
  EXPECT_TRUE(md5.update(bytesOf("abc")));
  EXPECT_TRUE(md5.finish()) << md5.failureDescription();

  VendChunkDigestVerifier wrong(3, 3, {sha256});
  EXPECT_FALSE(wrong.update(bytesOf("abd")));
  EXPECT_EQ(wrong.failure(), Failure::kDigestMismatch);
}

TEST(VendChunkDigestVerifier, AnySplitOfTheInputVerifies) {
  const std::string file = randomBytes(100'003, 7);
  std::mt19937 generator(11);
  for (std::size_t chunkSize :
       {std::size_t{1000}, std::size_t{1024}, std::size_t{100'003}, std::size_t{250'000}}) {
    VendChunkDigestVerifier verifier(file.size(), chunkSize, chunkDigests(file, chunkSize));
    std::size_t offset = 0;
    while (offset < file.size()) {
      const std::size_t piece = std::min<std::size_t>(file.size() - offset, 1 + generator() % 3000);
      ASSERT_TRUE(verifier.update(bytesOf(std::string_view(file).substr(offset, piece))))
          << "chunk size " << chunkSize << " at " << offset << ": "
          << verifier.failureDescription();
      offset += piece;
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

TEST(VendChunkDigestVerifier, ABadShortLastChunkFailsAtTheEnd) {
  const std::string good = randomBytes(2500, 5);
  std::string bad = good;
  bad.back() ^= 0x80;
  VendChunkDigestVerifier verifier(good.size(), 1000, chunkDigests(good, 1000));
  EXPECT_TRUE(verifier.update(bytesOf(bad)));
  EXPECT_FALSE(verifier.finish());
  EXPECT_EQ(verifier.failure(), Failure::kDigestMismatch);
}

TEST(VendChunkDigestVerifier, WrongLengthsAndCountsFail) {
  const std::string file = randomBytes(2500, 9);
  const auto digests = chunkDigests(file, 1000);

  VendChunkDigestVerifier longer(file.size() - 1, 1000, digests);
  EXPECT_FALSE(longer.update(bytesOf(file)));
  EXPECT_EQ(longer.failure(), Failure::kTooLong);

  VendChunkDigestVerifier shorter(file.size(), 1000, digests);
  EXPECT_TRUE(shorter.update(bytesOf(std::string_view(file).substr(0, 2000))));
  EXPECT_FALSE(shorter.finish());
  EXPECT_EQ(shorter.failure(), Failure::kTooShort);

  // A manifest with fewer digests than chunks fails when the extra chunk
  // completes; one with more fails at the end.
  VendChunkDigestVerifier fewer(file.size(), 1000, {digests[0], digests[1]});
  EXPECT_TRUE(fewer.update(bytesOf(file)));
  EXPECT_FALSE(fewer.finish());
  EXPECT_EQ(fewer.failure(), Failure::kChunkCount);

  std::vector<std::string> extra = digests;
  extra.push_back(digests[0]);
  VendChunkDigestVerifier more(file.size(), 1000, extra);
  EXPECT_TRUE(more.update(bytesOf(file)));
  EXPECT_FALSE(more.finish());
  EXPECT_EQ(more.failure(), Failure::kChunkCount);
}

TEST(VendChunkDigestVerifier, UnusableManifestsFailBeforeAnyByte) {
  const std::string file = "abc";
  const std::vector<std::vector<std::string>> manifests = {
      {},
      {std::string(64, 'z')},
      {std::string(40, 'a')},
      {std::string(64, 'a'), std::string(32, 'a')},
  };
  for (const auto& digests : manifests) {
    VendChunkDigestVerifier verifier(3, 3, digests);
    EXPECT_TRUE(verifier.failed());
    EXPECT_EQ(verifier.failure(), Failure::kBadManifest);
    EXPECT_FALSE(verifier.update(bytesOf(file)));
  }
  VendChunkDigestVerifier zeroChunk(3, 0, chunkDigests(file, 3));
  EXPECT_EQ(zeroChunk.failure(), Failure::kBadManifest);
}

}  // namespace
}  // namespace larder
