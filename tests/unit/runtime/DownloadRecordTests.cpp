// The download records: the store's download dictionary read and written
// back, the archive form, and the malformed dictionaries that must be
// refused as a whole.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/plist/KeyedArchive.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/records/TillPurchaseResponse.h"

namespace larder {
namespace {

const std::string kDigestA(64, 'a');
const std::string kDigestB = "0123456789abcdef0123456789ABCDEF0123456789abcdef0123456789abcdef";

PlistDictionary storeAsset() {
  return PlistDictionary{{"type", 10},
                         {"URL", "http://store.test/assets/42/Thing.tar"},
                         {"fileSize", 1500},
                         {"numberOfBytesToHash", 1000},
                         {"hashes", PlistArray{kDigestA, kDigestB}}};
}

PlistDictionary storeMetadata() {
  return PlistDictionary{{"itemIdentifier", 42},
                         {"bundleIdentifier", "com.example.thing"},
                         {"bundleVersion", "2.1"},
                         {"title", "Thing"},
                         {"thumbnailImageURL", "http://store.test/icons/42.png"},
                         {"preflightPackageURL", "http://store.test/preflight/42"}};
}

// A download exactly as the store's purchase answer holds it.
PlistDictionary storeDownload() {
  return PlistDictionary{{"metadata", storeMetadata()}, {"assets", PlistArray{storeAsset()}}};
}

TEST(TillDownloadRecord, ReadsTheStoresDownloadAndWritesItBackWithTheLocalFields) {
  std::shared_ptr<TillDownload> download = TillDownload::fromDictionary(storeDownload());
  ASSERT_NE(download, nullptr);
  const TillDownloadMetadata metadata = download->metadata();
  EXPECT_EQ(metadata.itemIdentifier(), 42u);
  EXPECT_EQ(metadata.bundleIdentifier(), "com.example.thing");
  EXPECT_EQ(metadata.bundleVersion(), "2.1");
  EXPECT_EQ(metadata.preflightPackageURL(), "http://store.test/preflight/42");
  EXPECT_FALSE(metadata.isMDMProvided());
  ASSERT_EQ(download->assets().size(), 1u);
  const TillDownloadAsset asset = download->assets().front();
  EXPECT_EQ(asset.URLRequest().url(), "http://store.test/assets/42/Thing.tar");
  EXPECT_EQ(asset.fileSize(), 1500);
  EXPECT_EQ(asset.numberOfBytesToHash(), 1000);
  EXPECT_EQ(asset.hashes(), (std::vector<std::string>{kDigestA, kDigestB}));
  EXPECT_EQ(download->downloadType(), TillDownload::kInstall);

  const PlistDictionary written = download->toDictionary();
  // Every key the store sent comes back with its value...
  PlistDictionary expectedMetadata = storeMetadata();
  expectedMetadata.emplace("isMDMProvided", false);
  EXPECT_EQ(PlistValue(written.at("metadata")), PlistValue(expectedMetadata));
  PlistDictionary expectedAsset = storeAsset();
  expectedAsset.emplace("external", false);
  EXPECT_EQ(written.at("assets"), PlistValue(PlistArray{expectedAsset}));
  // ...and the local fields are added.
  EXPECT_EQ(written.at("downloadType"), PlistValue(1));
  EXPECT_EQ(written.at("skipAssetDownloadIfNotAlreadyOnDisk"), PlistValue(false));
  EXPECT_EQ(written.at("status"),
            PlistValue(PlistDictionary{{"isPaused", false}, {"isFailed", false}}));
  EXPECT_FALSE(written.contains("relaunchAppWithBundleURL"));

  // The written form reads back to the same record.
  std::shared_ptr<TillDownload> again = TillDownload::fromDictionary(written);
  ASSERT_NE(again, nullptr);
  EXPECT_EQ(again->snapshot(), download->snapshot());
}

TillDownloadFields everyFieldSet() {
  TillDownloadMetadata metadata;
  metadata.setItemIdentifier(0xFFFFFFFFFFFFFFF0ull);
  metadata.setBundleIdentifier("com.example.managed");
  metadata.setBundleVersion("7");
  metadata.setTitle("Managed");
  metadata.setThumbnailImageURL("http://store.test/t.png");
  metadata.setAuxInfo(PlistDictionary{{"SystemVersion", "12.4"}, {"nested", PlistArray{1, "two"}}});
  metadata.setIsMDMProvided(true);
  TillDownloadAsset asset;
  VendURLRequest request("http://store.test/a.tar");
  request.setValue("secret", "X-Token");
  request.setTimeoutInterval(5);
  asset.setURLRequest(request);
  asset.setFileSize(3);
  asset.setNumberOfBytesToHash(2);
  asset.setHashes({kDigestA, kDigestB});
  TillDownloadFields fields;
  fields.metadata = metadata;
  fields.assets = {asset, asset};
  fields.downloadType = TillDownload::kStageOnly;
  fields.relaunchAppWithBundleURL = "/Applications/Managed.app";
  fields.skipAssetDownloadIfNotAlreadyOnDisk = true;
  fields.status = {true, true};
  fields.progress = 0.25;
  return fields;
}

TEST(TillDownloadRecord, EveryFieldSurvivesTheArchiveAndTheWire) {
  const TillDownload original(everyFieldSet());

  const PlistData archived = KeyedArchive::archivedData(original.encodeWithCoder());
  auto root = KeyedArchive::unarchivedRoot(archived, {"TillDownload"});
  ASSERT_TRUE(root) << root.errorDescription();
  std::shared_ptr<TillDownload> fromArchive = TillDownload::initWithCoder(*root);
  ASSERT_NE(fromArchive, nullptr);
  EXPECT_EQ(fromArchive->snapshot(), everyFieldSet());

  std::shared_ptr<TillDownload> fromWire = TillDownload::fromDictionary(original.toDictionary());
  ASSERT_NE(fromWire, nullptr);
  EXPECT_EQ(fromWire->snapshot(), everyFieldSet());
  // The request that is more than a plain fetch keeps its header and limit.
  EXPECT_EQ(fromWire->assets()[0].URLRequest().valueForHeaderField("x-token"), "secret");
  EXPECT_EQ(fromWire->assets()[0].URLRequest().timeoutInterval(), 5);
}

TEST(TillDownloadRecord, ArchiveRefusesNestedRecordsOfTheWrongClass) {
  PlistDictionary encoded = TillDownload(everyFieldSet()).encodeWithCoder();
  ASSERT_NE(TillDownload::initWithCoder(encoded), nullptr);

  PlistDictionary swapped = encoded;
  swapped["metadata"] = PlistValue(everyFieldSet().assets[0].encodeWithCoder());
  EXPECT_EQ(TillDownload::initWithCoder(swapped), nullptr);

  PlistDictionary plainAssets = encoded;
  plainAssets["assets"] = PlistArray{PlistValue(everyFieldSet().assets[0].toDictionary())};
  EXPECT_EQ(TillDownload::initWithCoder(plainAssets), nullptr);

  PlistDictionary otherClass = encoded;
  otherClass["$class"] = "LedgerSoftwareProduct";
  EXPECT_EQ(TillDownload::initWithCoder(otherClass), nullptr);
}

PlistDictionary& metadataOf(PlistDictionary& download) {
  return *download["metadata"].dictionary();
}
PlistDictionary& firstAsset(PlistDictionary& download) {
  return *(*download["assets"].array())[0].dictionary();
}

TEST(TillDownloadRecord, MalformedDownloadsAreRefusedAsAWhole) {
  enum Part { kDownload, kMetadata, kAsset };
  const struct {
    const char* name;
    Part part;
    const char* key;
    PlistValue value;  // null: the key is removed
  } malformations[] = {
      {"no metadata", kDownload, "metadata", {}},
      {"metadata is a string", kDownload, "metadata", "thing"},
      {"item identifier is text", kMetadata, "itemIdentifier", "42"},
      {"item identifier is negative", kMetadata, "itemIdentifier", -1},
      {"title is a number", kMetadata, "title", 5},
      {"auxInfo is an array", kMetadata, "auxInfo", PlistArray{}},
      {"no assets", kDownload, "assets", {}},
      {"empty assets", kDownload, "assets", PlistArray{}},
      {"assets is a dictionary", kDownload, "assets", storeAsset()},
      {"an asset is a string", kDownload, "assets", PlistArray{storeAsset(), "x"}},
      {"no URL", kAsset, "URL", {}},
      {"URL is a number", kAsset, "URL", 3},
      {"file size is text", kAsset, "fileSize", "1500"},
      {"file size is zero", kAsset, "fileSize", 0},
      {"file size is negative", kAsset, "fileSize", -1500},
      {"chunk size is zero", kAsset, "numberOfBytesToHash", 0},
      {"chunk size is a real", kAsset, "numberOfBytesToHash", 1000.0},
      {"one digest short", kAsset, "hashes", PlistArray{kDigestA}},
      {"one digest too many", kAsset, "hashes", PlistArray{kDigestA, kDigestB, kDigestA}},
      {"digest is not hex", kAsset, "hashes", PlistArray{kDigestA, std::string(64, 'g')}},
      {"digest of odd length", kAsset, "hashes", PlistArray{kDigestA, std::string(63, 'a')}},
      {"digests of two lengths", kAsset, "hashes", PlistArray{kDigestA, std::string(32, 'a')}},
      {"digest is a number", kAsset, "hashes", PlistArray{kDigestA, 7}},
      {"type is not a package", kAsset, "type", 11},
      {"download type is text", kDownload, "downloadType", "1"},
      {"status is a bool", kDownload, "status", true},
      {"isPaused is text", kDownload, "status", PlistDictionary{{"isPaused", "yes"}}},
      {"progress beyond 1", kDownload, "progress", 1.5},
  };
  for (const auto& malformation : malformations) {
    PlistDictionary download = storeDownload();
    PlistDictionary& target = malformation.part == kMetadata ? metadataOf(download)
                              : malformation.part == kAsset  ? firstAsset(download)
                                                             : download;
    if (malformation.value.isNull())
      target.erase(malformation.key);
    else
      target[malformation.key] = malformation.value;
    EXPECT_EQ(TillDownload::fromDictionary(download), nullptr) << malformation.name;
  }
  // The unchanged dictionary, and one with MD5 digests, are accepted: the
  // refusals above are the malformations' doing.
  EXPECT_NE(TillDownload::fromDictionary(storeDownload()), nullptr);
  PlistDictionary md5 = storeDownload();
  firstAsset(md5)["hashes"] = PlistArray{std::string(32, 'a'), std::string(32, 'b')};
  EXPECT_NE(TillDownload::fromDictionary(md5), nullptr);
}

TEST(TillPurchaseResponseRecord, KeepsTheWellFormedDownloadsOfAnAnswer) {
  PlistDictionary second = storeDownload();
  metadataOf(second)["itemIdentifier"] = 43;
  PlistDictionary broken = storeDownload();
  firstAsset(broken)["fileSize"] = "big";
  const PlistDictionary answer{
      {"downloads", PlistArray{storeDownload(), broken, "not a download", second}}};

  std::size_t dropped = 0;
  std::optional<TillPurchaseResponse> response =
      TillPurchaseResponse::fromDictionary(answer, &dropped);
  ASSERT_TRUE(response);
  EXPECT_EQ(dropped, 2u);
  ASSERT_EQ(response->downloads().size(), 2u);
  EXPECT_EQ(response->downloads()[0]->metadata().itemIdentifier(), 42u);
  EXPECT_EQ(response->downloads()[1]->metadata().itemIdentifier(), 43u);

  EXPECT_FALSE(TillPurchaseResponse::fromDictionary(PlistDictionary{{"failureType", "x"}}));
  EXPECT_FALSE(
      TillPurchaseResponse::fromDictionary(PlistDictionary{{"downloads", storeDownload()}}));
  std::optional<TillPurchaseResponse> none =
      TillPurchaseResponse::fromDictionary(PlistDictionary{{"downloads", PlistArray{}}});
  ASSERT_TRUE(none);
  EXPECT_TRUE(none->downloads().empty());
}

TEST(TillPurchaseResponseRecord, ArchiveAndWireKeepEveryDownload) {
  std::optional<TillPurchaseResponse> response = TillPurchaseResponse::fromDictionary(
      PlistDictionary{{"downloads", PlistArray{storeDownload(), storeDownload()}}});
  ASSERT_TRUE(response);
  response->downloads()[1]->setDownloadType(TillDownload::kStageOnly);

  const PlistData archived = KeyedArchive::archivedData(response->encodeWithCoder());
  std::optional<PlistValue> root = KeyedArchive::unarchivedRoot(archived, {"TillPurchaseResponse"});
  ASSERT_TRUE(root);
  std::optional<TillPurchaseResponse> decoded = TillPurchaseResponse::initWithCoder(*root);
  ASSERT_TRUE(decoded);
  ASSERT_EQ(decoded->downloads().size(), 2u);
  EXPECT_EQ(decoded->downloads()[0]->snapshot(), response->downloads()[0]->snapshot());
  EXPECT_EQ(decoded->downloads()[1]->downloadType(), TillDownload::kStageOnly);

  std::optional<TillPurchaseResponse> overTheWire =
      TillPurchaseResponse::fromDictionary(response->toDictionary());
  ASSERT_TRUE(overTheWire);
  ASSERT_EQ(overTheWire->downloads().size(), 2u);
  EXPECT_EQ(overTheWire->downloads()[1]->snapshot(), response->downloads()[1]->snapshot());
}

}  // namespace
}  // namespace larder
