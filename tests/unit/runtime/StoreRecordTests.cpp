// The shared store records: their archive and wire forms, what they refuse,
// and the behaviour the update queue, the book library, the purchase and
// the download paths rely on.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <functional>
#include <limits>
#include <set>
#include <string>
#include <tuple>
#include <vector>

#include "platform/log/TillLogManager.h"
#include "platform/plist/KeyedArchive.h"
#include "store-runtime/records/LedgerBook.h"
#include "store-runtime/records/LedgerDAAPPurchasedItem.h"
#include "store-runtime/records/LedgerSoftwareUpdateStatus.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/records/TillPurchase.h"
#include "store-runtime/records/TillPurchaseResponse.h"

namespace larder {
namespace {

using ::testing::ElementsAre;
using ::testing::UnorderedElementsAreArray;
using Fields = std::vector<std::pair<std::string, PlistValue>>;

constexpr std::uint64_t kHugeIdentifier = std::numeric_limits<std::uint64_t>::max();
const std::set<std::string, std::less<>> kRecordClasses{"dictionary",
                                                        "array",
                                                        "LedgerUpdate",
                                                        "SysupQuaymartUpdate",
                                                        "LedgerBook",
                                                        "TillPurchase",
                                                        "LedgerDAAPPurchasedItem",
                                                        "LedgerSoftwareUpdateStatus",
                                                        "TillDownload",
                                                        "TillDownloadAsset",
                                                        "TillDownloadMetadata",
                                                        "TillPurchaseResponse"};

// Through a real archive: binary property list out and back in.
PlistValue throughArchive(const PlistValue& root) {
  auto decoded = KeyedArchive::unarchivedRoot(KeyedArchive::archivedData(root), kRecordClasses);
  EXPECT_TRUE(decoded) << decoded.errorDescription();
  return decoded.value_or(PlistValue());
}

std::vector<std::string> keysOf(const PlistDictionary& dictionary) {
  std::vector<std::string> keys;
  for (const auto& [key, value] : dictionary) keys.push_back(key);
  return keys;
}

// `dictionary` with `key` set to `value`, or removed when `value` is null.
PlistDictionary with(PlistDictionary dictionary, std::string_view key, PlistValue value) {
  if (value.isNull())
    dictionary.erase(std::string(key));
  else
    dictionary.insert_or_assign(std::string(key), std::move(value));
  return dictionary;
}

// The wire form a decoded record writes back, or nothing when refused.
template <typename Decoded>
std::optional<PlistDictionary> writtenBack(const Decoded& record) {
  if (!record) return std::nullopt;
  return record->toDictionary();
}

// Replaces each key of a valid dictionary in turn by values of every type,
// and the awkward ones of each, that a file or a client could put there.
// Whatever the decoder makes of it must be either a refusal or a record
// whose own encoding decodes to the same encoding again: no crash, and no
// record that cannot survive its next save. Encodings are compared as
// archived bytes, so that a NaN kept verbatim compares equal to itself.
void expectRefusedOrStable(
    const PlistDictionary& valid,
    const std::function<std::optional<PlistDictionary>(const PlistDictionary&)>& decode) {
  const std::vector<PlistValue> hostile = {PlistValue("text"),
                                           PlistValue(""),
                                           PlistValue(std::int64_t{-1}),
                                           PlistValue(std::numeric_limits<std::int64_t>::min()),
                                           PlistValue(kHugeIdentifier),
                                           PlistValue(std::nan("")),
                                           PlistValue(std::numeric_limits<double>::infinity()),
                                           PlistValue(2.5),
                                           PlistValue(true),
                                           PlistValue(PlistData{0xff, 0x00}),
                                           PlistValue(PlistDate{std::nan("")}),
                                           PlistValue(PlistArray{1, "two"}),
                                           PlistValue(PlistDictionary{{"$class", "LedgerBook"}}),
                                           PlistValue(PlistUid{3})};
  for (const auto& [key, original] : valid) {
    for (const PlistValue& value : hostile) {
      const std::optional<PlistDictionary> encoded = decode(with(valid, key, value));
      if (!encoded) continue;
      const std::optional<PlistDictionary> again = decode(*encoded);
      ASSERT_TRUE(again) << "re-decoding failed after replacing " << key;
      EXPECT_EQ(KeyedArchive::archivedData(*again), KeyedArchive::archivedData(*encoded))
          << "unstable after replacing " << key;
    }
  }
}

// What every record shares: its wire form and its archive give the same
// record back, archives of anything else are refused, and so is a field of
// the wrong type.
struct RecordShape {
  std::string name;
  PlistDictionary wire;  // of a record with every field set
  PlistDictionary archive;
  std::function<std::optional<PlistDictionary>(const PlistDictionary&)> fromWire;
  std::function<std::optional<PlistDictionary>(const PlistValue&)> fromArchive;
  Fields refused;  // fields that make the whole record be refused
};

template <typename Record, typename Made>
RecordShape shapeOf(std::string name, const Made& record, Fields refused) {
  return {std::move(name),
          record.toDictionary(),
          record.encodeWithCoder(),
          [](const PlistDictionary& wire) { return writtenBack(Record::fromDictionary(wire)); },
          [](const PlistValue& encoded) { return writtenBack(Record::initWithCoder(encoded)); },
          std::move(refused)};
}

void PrintTo(const RecordShape& shape, std::ostream* out) {
  *out << shape.name;
}

class StoreRecordShape : public ::testing::TestWithParam<RecordShape> {};

TEST_P(StoreRecordShape, WireAndArchiveGiveTheSameRecordBack) {
  const RecordShape& shape = GetParam();
  const auto expectWire = [&](const std::optional<PlistDictionary>& back, const char* from) {
    EXPECT_TRUE(back == shape.wire)
        << "from the " << from << ":\n  " << (back ? describePlistValue(*back) : "refused")
        << "\nexpected:\n  " << describePlistValue(shape.wire);
  };
  expectWire(shape.fromWire(shape.wire), "wire");
  expectWire(shape.fromArchive(throughArchive(shape.archive)), "archive");
}

TEST_P(StoreRecordShape, OtherArchivesAndFieldsOfTheWrongTypeAreRefused) {
  const RecordShape& shape = GetParam();
  EXPECT_FALSE(shape.fromArchive(PlistValue(42)));
  EXPECT_FALSE(shape.fromArchive(shape.wire)) << "no \"$class\"";
  // Every field in place, but named as a record of another class.
  const bool isBook = shape.archive.at("$class") == PlistValue("LedgerBook");
  EXPECT_FALSE(
      shape.fromArchive(with(shape.archive, "$class", isBook ? "TillPurchase" : "LedgerBook")));
  for (const auto& [key, value] : shape.refused) {
    EXPECT_FALSE(shape.fromWire(with(shape.wire, key, value)))
        << key << " = " << describePlistValue(value);
  }
}

TEST_P(StoreRecordShape, AnyHostileFieldIsRefusedOrGivesAStableRecord) {
  expectRefusedOrStable(GetParam().wire, GetParam().fromWire);
}

PlistDictionary storeItem(std::uint64_t wareID = 409183694) {
  return PlistDictionary{
      {"ware-id", PlistValue(wareID)},
      {"bundle-id", "com.example.Keynote"},
      {"title", "Keynote"},
      {"version", "13.1"},
      {"action-params", "productType=C&itemId=409183694&price=0"},
      {"release-date", PlistDate{1700000000}},
      // Keys the service does not know are the store's business and stay.
      {"size", std::int64_t{123456789}},
      {"whats-new", PlistDictionary{{"text", "Bug fixes"}, {"links", PlistArray{"a", "b"}}}},
  };
}

LedgerUpdateRef markedUpdate() {
  LedgerUpdateRef update = LedgerUpdate::initWithDictionary(storeItem(kHugeIdentifier));
  update->setIsStaged(true);
  update->setHasBeenSeenByUser(true);
  update->setAutoUpdateAbortCode(-7);
  update->setFirstAutoUpdateAttemptDate(PlistDate{1700000500.25});
  update->setDidFailToAutoInstall(true);
  return update;
}

TEST(StoreRecordLedgerUpdate, ReadsTheStoreItemThroughItsAccessors) {
  LedgerUpdateRef update = LedgerUpdate::initWithDictionary(storeItem(kHugeIdentifier));
  ASSERT_TRUE(update);
  EXPECT_EQ(
      std::tuple(update->itemIdentifierValue(), update->itemIdentifier(), update->bundleID(),
                 update->title(), update->version(), update->actionParams(), update->releaseDate()),
      std::tuple(kHugeIdentifier, PlistValue(kHugeIdentifier), "com.example.Keynote", "Keynote",
                 "13.1", "productType=C&itemId=409183694&price=0", PlistDate{1700000000}));
  // A fresh item has no marks, and its dictionary is the item unchanged.
  EXPECT_FALSE(update->isStaged() || update->hasBeenSeenByUser() ||
               update->didFailToAutoInstall() || update->autoUpdateAbortCode() ||
               update->firstAutoUpdateAttemptDate());
  EXPECT_EQ(update->dictionary(), storeItem(kHugeIdentifier));

  // Only the identifier is required.
  LedgerUpdateRef bare = LedgerUpdate::initWithDictionary({{"ware-id", 7}});
  ASSERT_TRUE(bare);
  EXPECT_EQ(bare->itemIdentifierValue(), 7u);
  EXPECT_FALSE(bare->bundleID() || bare->releaseDate());
}

TEST(StoreRecordLedgerUpdate, LocalMarksLiveInTheDictionaryAndSurviveMergeAndArchive) {
  const LedgerUpdateRef cached = markedUpdate();
  // The update queue's merge: start from the cached dictionary and let every
  // key the store sends win. The store's new values arrive, the marks stay,
  // which they can only if they live in the dictionary.
  PlistDictionary merged = cached->dictionary();
  PlistDictionary fromStore = with(with(storeItem(), "version", "13.2"), "new-key", "new");
  for (const auto& [key, value] : fromStore) merged.insert_or_assign(key, value);
  LedgerUpdateRef renewed = LedgerUpdate::initWithDictionary(merged);
  ASSERT_TRUE(renewed);
  EXPECT_EQ(std::tuple(renewed->version(), renewed->isStaged(), renewed->hasBeenSeenByUser(),
                       renewed->autoUpdateAbortCode(), renewed->firstAutoUpdateAttemptDate(),
                       renewed->didFailToAutoInstall(), renewed->dictionary().at("new-key")),
            std::tuple("13.2", true, true, -7, PlistDate{1700000500.25}, true, PlistValue("new")));

  // Clearing the date removes its key; the other marks keep explicit values.
  renewed->setFirstAutoUpdateAttemptDate(std::nullopt);
  renewed->setIsStaged(false);
  EXPECT_FALSE(renewed->dictionary().contains(LedgerUpdate::kFirstAutoUpdateAttemptDateKey));
  EXPECT_FALSE(renewed->isStaged());
  EXPECT_EQ(renewed->dictionary().at(std::string(LedgerUpdate::kIsStagedKey)), PlistValue(false));
}

TEST(StoreRecordLedgerUpdate, ItemsWithoutIdentifierAreRefused) {
  for (const PlistValue& wareID :
       {PlistValue(), PlistValue("not a number"), PlistValue(std::int64_t{-5}), PlistValue(0),
        PlistValue(5.5), PlistValue(true)}) {
    const PlistDictionary item = with(storeItem(), "ware-id", wareID);
    EXPECT_FALSE(LedgerUpdate::isValidItem(item)) << describePlistValue(wareID);
    EXPECT_FALSE(LedgerUpdate::initWithDictionary(item)) << describePlistValue(wareID);
  }
  PlistDictionary noItem = KeyedArchive::record(LedgerUpdate::kClassName);
  EXPECT_FALSE(LedgerUpdate::initWithCoder(noItem));
  EXPECT_FALSE(LedgerUpdate::initWithCoder(with(noItem, "dictionary", PlistArray{storeItem()})));
  for (const PlistDictionary& refused :
       {PlistDictionary{{"bundleID", "com.example.App"}}, PlistDictionary{}}) {
    EXPECT_FALSE(LedgerUpdate::fromDictionary(refused)) << describePlistValue(refused);
  }
  expectRefusedOrStable(storeItem(), [](const PlistDictionary& item) {
    LedgerUpdateRef update = LedgerUpdate::initWithDictionary(item);
    return update ? std::optional(update->dictionary()) : std::nullopt;
  });
}

TEST(StoreRecordLedgerUpdate, AFieldOfAnotherTypeIsConvertedOrSkippedAndTheItemKept) {
  const struct {
    std::string_view key;
    PlistValue sent;
    PlistValue kept;  // null: the field is skipped
  } cases[] = {
      {"ware-id", "409183694", PlistValue(std::uint64_t{409183694})},
      {"version", 13.1, "13.1"},
      {"version", 13, "13"},
      {"bundle-id", 12, "12"},
      {"release-date", "2023-11-14", PlistDate{1699920000}},
      {"release-date", "2023-11-14T22:13:20Z", PlistDate{1700000000}},
      {"release-date", "2023-11-15T00:13:20.5+02:00", PlistDate{1700000000.5}},
      {LedgerUpdate::kIsStagedKey, "YES", true},
      {LedgerUpdate::kAutoUpdateAbortCodeKey, 3.0, std::int64_t{3}},
      {LedgerUpdate::kAutoUpdateAbortCodeKey, "-4", std::int64_t{-4}},
      {"title", PlistArray{"Keynote"}, {}},
      {"action-params", PlistData{1, 2}, {}},
      {"release-date", "soon", {}},
      {"release-date", "2023-02-30", {}},
      {"release-date", PlistDate{std::nan("")}, {}},
      {LedgerUpdate::kAutoUpdateAbortCodeKey, 3.5, {}},
      {LedgerUpdate::kFirstAutoUpdateAttemptDateKey, PlistDictionary{}, {}},
  };
  for (const auto& test : cases) {
    SCOPED_TRACE(std::string(test.key) + " = " + describePlistValue(test.sent));
    LedgerUpdateRef update =
        LedgerUpdate::initWithDictionary(with(storeItem(), test.key, test.sent));
    ASSERT_TRUE(update);
    EXPECT_EQ(update->bundleID(), test.key == "bundle-id" ? "12" : "com.example.Keynote");
    const PlistDictionary kept = update->dictionary();
    const auto found = kept.find(test.key);
    EXPECT_EQ(found == kept.end() ? PlistValue() : found->second, test.kept);
    EXPECT_EQ(kept.at("whats-new"), storeItem().at("whats-new"));
  }
}

TEST(StoreRecordLedgerUpdate, WireFormUsesFieldNamesAndCarriesTheWholeItem) {
  const LedgerUpdateRef update = markedUpdate();
  PlistDictionary wire = update->toDictionary();
  EXPECT_THAT(keysOf(wire),
              UnorderedElementsAreArray<std::string>(
                  {"itemIdentifier", "bundleID", "title", "version", "actionParams", "releaseDate",
                   "isStaged", "hasBeenSeenByUser", "autoUpdateAbortCode", "didFailToAutoInstall",
                   "dictionary", "firstAutoUpdateAttemptDate"}));
  EXPECT_EQ(wire.at("itemIdentifier"), PlistValue(kHugeIdentifier));
  EXPECT_EQ(wire.at("dictionary"), PlistValue(update->dictionary()));

  // A client may send only field names, with the date as seconds, the way
  // the bus carries dates.
  LedgerUpdateRef sent = LedgerUpdate::fromDictionary({{"itemIdentifier", std::uint64_t{55}},
                                                       {"bundleID", "com.example.App"},
                                                       {"releaseDate", 1600000000.5},
                                                       {"isStaged", true}});
  ASSERT_TRUE(sent);
  EXPECT_EQ(std::tuple(sent->itemIdentifierValue(), sent->bundleID(), sent->releaseDate(),
                       sent->isStaged()),
            std::tuple(55u, "com.example.App", PlistDate{1600000000.5}, true));

  // A field given by name wins over the same value inside "dictionary".
  LedgerUpdateRef renamed = LedgerUpdate::fromDictionary(with(wire, "title", "Renamed"));
  ASSERT_TRUE(renamed);
  EXPECT_EQ(renamed->title(), "Renamed");
  EXPECT_EQ(renamed->dictionary().at("size"), PlistValue(std::int64_t{123456789}));
}

SysupQuaymartUpdateFields osUpdateFields() {
  SysupQuaymartUpdateFields fields;
  fields.productKey = "041-12345";
  fields.tags = {"SysupBUNDLE:com.example.SetupHerald", "major"};
  fields.title = "System Update";
  fields.versionString = "14.2";
  fields.longDescription = "Fixes.";
  fields.action = 2;
  fields.isCritical = true;
  fields.isRecommended = true;
  fields.firmwareWarning = "Keep the machine plugged in.";
  fields.licenseAgreement = "Terms.";
  fields.applicationIdentifiersToClose = {"com.example.Mail", "com.example.Notes"};
  fields.allowedToUseInstallLater = true;
  fields.downloadMetadata = {{"thumbnailImageURL", "https://store.example/icon.png"},
                             {"itemIdentifier", std::uint64_t{9}}};
  return fields;
}

TEST(StoreRecordSysupQuaymartUpdate, WireFormTakesTheFieldsAndLeavesAbsentOnesOut) {
  const SysupQuaymartUpdate update(osUpdateFields());
  EXPECT_EQ(update.thumbnailImageURL(), "https://store.example/icon.png");
  const PlistDictionary wire = update.toDictionary();
  EXPECT_EQ(wire.at("tags"),
            PlistValue(PlistArray{"SysupBUNDLE:com.example.SetupHerald", "major"}));
  EXPECT_EQ(wire.at("action"), PlistValue(std::int64_t{2}));

  // Absent texts and metadata are left out, not sent empty.
  SysupQuaymartUpdateFields plain;
  plain.productKey = "041-0";
  PlistDictionary plainWire = SysupQuaymartUpdate(plain).toDictionary();
  for (const char* key : {"title", "firmwareWarning", "licenseAgreement", "downloadMetadata"}) {
    EXPECT_FALSE(plainWire.contains(key)) << key;
  }
  std::optional<SysupQuaymartUpdate> plainBack = SysupQuaymartUpdate::fromDictionary(plainWire);
  ASSERT_TRUE(plainBack);
  EXPECT_FALSE(plainBack->thumbnailImageURL() || plainBack->firmwareWarning());
}

using Status = LedgerSoftwareUpdateStatus;
const Status kProgressStatus =
    Status::initWithProgress(37.5, PlistDictionary{{"currentState", "downloading"}}, true);
const Status kFailedStatus = Status::initWithError(
    VendError{.code = -128, .description = "Cancelled", .userInfo = {{"extra", "x"}}});

TEST(StoreRecordSoftwareUpdateStatus, PhaseAndProgressFollowWhatTheFrameworkSays) {
  const struct {
    double progress;
    std::optional<PlistDictionary> info;
    std::int64_t state;
    double percent;
  } cases[] = {
      {40, PlistDictionary{{"currentState", "downloading"}}, Status::kStateDownloading, 40},
      {40, PlistDictionary{{"currentState", "installing"}}, Status::kStateInstalling, 40},
      // A numeric state wins over the word, and is kept even if unknown to us.
      {10, PlistDictionary{{"state", 6}, {"currentState", "downloading"}}, 6, 10},
      {10, PlistDictionary{{"state", 9}}, 9, 10},
      {50, PlistDictionary{{"currentState", 7}}, Status::kStateInstalling, 50},
      // Without a say from the framework: finished only at 100 percent.
      {100, std::nullopt, Status::kStateFinished, 100},
      {99.9, std::nullopt, Status::kStateInstalling, 99.9},
      {-5, std::nullopt, Status::kStateInstalling, 0},
      {250, std::nullopt, Status::kStateFinished, 100},
      {std::nan(""), std::nullopt, Status::kStateInstalling, 0},
  };
  for (const auto& c : cases) {
    const Status status = Status::initWithProgress(c.progress, c.info, true);
    EXPECT_EQ(status.state(), c.state) << c.progress;
    EXPECT_EQ(status.percentComplete(), c.percent) << c.progress;
  }
  // Out-of-range progress from outside is clamped like local progress.
  std::optional<Status> clamped = Status::fromDictionary({{"percentComplete", 1e9}});
  ASSERT_TRUE(clamped);
  EXPECT_EQ(clamped->percentComplete(), 100);

  EXPECT_TRUE(Status::initWithProgress(100, std::nullopt, false).hasEnded());
  VendError failure{.code = 4, .description = "Authorization failed"};
  Status failed = Status::initWithError(failure);
  EXPECT_EQ(failed.state(), Status::kStateFailed);
  EXPECT_TRUE(failed.hasEnded());
  EXPECT_FALSE(failed.canCancel());
  EXPECT_EQ(failed.error(), failure);
  EXPECT_FALSE(kProgressStatus.toDictionary().contains("error"));
  EXPECT_FALSE(kFailedStatus.toDictionary().contains("statusInfo"));
}

LedgerCloudItemFields cloudFields() {
  LedgerCloudItemFields fields;
  fields.itemIdentifier = kHugeIdentifier;
  fields.title = "The Book";
  fields.uniqueIdentifier = std::to_string(kHugeIdentifier);
  fields.publicationVersion = 3;
  fields.publicationDisplayVersion = "1.2";
  fields.author = "A. Writer";
  fields.category = "Fiction";
  fields.sortName = "Book, The";
  fields.coverImageURL = "https://store.example/cover.jpg";
  fields.purchaseDate = PlistDate{1500000000};
  fields.daapDictionary = PlistDictionary{{"dmap.itemid", 77}, {"daap.songgenre", "Fiction"}};
  fields.daapItemIdentifier = 77;
  fields.daapPurchasedToken = 4294967295u;
  fields.oaxenItemIdentifier = 88;
  fields.expectedReleaseDate = PlistDate{1800000000};
  fields.downloadAssetSize = 5'000'000'000ull;
  fields.redownloadBuyParams = "itemId=1234&pricingParameters=RDWN";
  fields.updateBuyParams = "itemId=1234&pricingParameters=UPDT";
  return fields;
}

LedgerBook localBook() {
  LedgerBookFields fields;
  static_cast<LedgerCloudItemFields&>(fields) = cloudFields();
  fields.isLocal = true;
  fields.path = "/home/u/Books/book.epub";
  fields.bookInfo = PlistDictionary{{"publication-version", 3}};
  fields.sonorelMetaData =
      PlistDictionary{{"itemId", 1234}, {"book-info", PlistDictionary{{"publication-version", 3}}}};
  return LedgerBook(std::move(fields));
}

Fields bookRefusals() {
  Fields refused = {{"expectedReleaseDate", PlistDate{std::numeric_limits<double>::infinity()}},
                    {"isLocal", "YES"}};
  for (const char* key : {"itemIdentifier", "publicationVersion", "daapItemIdentifier",
                          "daapPurchasedToken", "oaxenItemIdentifier", "downloadAssetSize"}) {
    refused.emplace_back(key, std::int64_t{-1});
    refused.emplace_back(key, "12");
  }
  for (const char* key : {"title", "path", "author", "coverImageURL", "redownloadBuyParams"})
    refused.emplace_back(key, 5);
  for (const char* key : {"bookInfo", "sonorelMetaData", "daapDictionary"})
    refused.emplace_back(key, PlistArray{PlistDictionary{}});
  return refused;
}

TEST(StoreRecordLedgerBook, EqualityCoversEveryFieldAndCopiesAreIndependent) {
  const LedgerBook original = localBook();
  EXPECT_TRUE(original.isEqualToBook(localBook()));
  EXPECT_TRUE(LedgerBook().isEqualToBook(LedgerBook()));

  const std::vector<std::pair<std::string, std::function<void(LedgerBookFields&)>>> changes = {
      {"isLocal", [](auto& f) { f.isLocal = false; }},
      {"path", [](auto& f) { f.path = "/elsewhere.epub"; }},
      {"bookInfo", [](auto& f) { (*f.bookInfo)["publication-version"] = 4; }},
      {"sonorelMetaData", [](auto& f) { f.sonorelMetaData.reset(); }},
      {"itemIdentifier", [](auto& f) { f.itemIdentifier = 1; }},
      {"title", [](auto& f) { f.title = "Other"; }},
      {"publicationVersion", [](auto& f) { f.publicationVersion = 4; }},
      {"purchaseDate", [](auto& f) { f.purchaseDate = PlistDate{1500000000.5}; }},
      {"daapDictionary", [](auto& f) { (*f.daapDictionary)["dmap.itemid"] = 78; }},
      {"daapPurchasedToken", [](auto& f) { f.daapPurchasedToken.reset(); }},
      {"updateBuyParams", [](auto& f) { f.updateBuyParams = ""; }},
  };
  for (const auto& [field, change] : changes) {
    LedgerBook changed = localBook();
    change(changed.fields());
    EXPECT_FALSE(original.isEqualToBook(changed)) << field;
    EXPECT_FALSE(changed.isEqualToBook(original)) << field;

    // What the library's merge does: the record it holds takes the rebuilt
    // values and stays the same object, which observers already hold.
    LedgerBookRef held = localBook().copy();
    const LedgerBook* identity = held.get();
    held->copyLibraryPropertiesFromBook(changed);
    EXPECT_EQ(held.get(), identity);
    EXPECT_TRUE(held->isEqualToBook(changed)) << field;
  }

  // A copy is a new record: changing it leaves the original alone.
  LedgerBookRef copy = original.copy();
  ASSERT_TRUE(copy);
  EXPECT_NE(copy.get(), &original);
  EXPECT_TRUE(copy->isEqualToBook(original));
  copy->fields().title = "Changed";
  (*copy->fields().bookInfo)["publication-version"] = 9;
  EXPECT_EQ(original.title(), "The Book");
  EXPECT_EQ(original.fields().bookInfo->at("publication-version"), PlistValue(3));
}

TEST(StoreRecordLedgerBook, WireFormLeavesAbsentFieldsOutAndTheLibraryFileKeepsBothKinds) {
  const LedgerBook book = localBook();
  PlistDictionary wire = book.toDictionary();
  EXPECT_EQ(wire.at("itemIdentifier").uint64Value(), kHugeIdentifier);
  EXPECT_EQ(wire.at("downloadAssetSize"), PlistValue(std::uint64_t{5'000'000'000ull}));

  // A book made with nothing says only that it is not local.
  EXPECT_THAT(keysOf(LedgerBook().toDictionary()), ElementsAre("isLocal"));
  LedgerBookRef empty = LedgerBook::fromDictionary({});
  ASSERT_TRUE(empty);
  EXPECT_TRUE(empty->isEqualToBook(LedgerBook()));
  // Dates arrive from the bus as seconds.
  LedgerBookRef dated = LedgerBook::fromDictionary({{"purchaseDate", 1500000000.0}});
  ASSERT_TRUE(dated);
  EXPECT_EQ(dated->fields().purchaseDate, PlistDate{1500000000});

  // The library's own file: a dictionary of records of both kinds.
  LedgerDAAPPurchasedItem item(cloudFields());
  PlistValue decoded = throughArchive(KeyedArchive::dictionary(
      {{"localBooksByPath",
        KeyedArchive::dictionary({{"/home/u/Books/book.epub", book.encodeWithCoder()}})},
       {"purchasedBooksByItemID", KeyedArchive::dictionary({{"88", item.encodeWithCoder()}})}}));
  LedgerBookRef fromFile =
      LedgerBook::initWithCoder(decoded["localBooksByPath"]["/home/u/Books/book.epub"]);
  ASSERT_TRUE(fromFile);
  EXPECT_TRUE(fromFile->isEqualToBook(book));
  LedgerDAAPPurchasedItemRef itemFromFile =
      LedgerDAAPPurchasedItem::initWithCoder(decoded["purchasedBooksByItemID"]["88"]);
  ASSERT_TRUE(itemFromFile);
  EXPECT_TRUE(itemFromFile->isEqualToBook(item));
  // Each kind refuses the other's archive.
  EXPECT_FALSE(LedgerBook::initWithCoder(decoded["purchasedBooksByItemID"]["88"]));
  EXPECT_FALSE(LedgerDAAPPurchasedItem::initWithCoder(book.encodeWithCoder()));
}

TEST(StoreRecordLedgerBook, RedownloadPurchaseNeedsParametersAndIsARedownload) {
  LedgerBook book = localBook();
  std::optional<TillPurchase> purchase = book.redownloadPurchase();
  ASSERT_TRUE(purchase);
  // The record's own identifier wins over the one in the parameters.
  EXPECT_EQ(std::tuple(purchase->buyParameters(), purchase->itemIdentifier(),
                       purchase->isRedownload(), purchase->isUpdate()),
            std::tuple("itemId=1234&pricingParameters=RDWN", kHugeIdentifier, true, false));
  EXPECT_EQ(LedgerDAAPPurchasedItem(cloudFields()).redownloadPurchase(), purchase);

  book.fields().itemIdentifier.reset();
  ASSERT_TRUE(book.redownloadPurchase());
  EXPECT_EQ(book.redownloadPurchase()->itemIdentifier(), 1234u);

  book.fields().redownloadBuyParams = "";
  EXPECT_FALSE(book.redownloadPurchase());
  EXPECT_FALSE(LedgerBook().redownloadPurchase());
}

TEST(StoreRecordDAAPPurchasedItem, HasExactlyTheCloudFieldsOfABook) {
  LedgerDAAPPurchasedItem item(cloudFields());
  EXPECT_FALSE(item.isLocal());
  EXPECT_EQ(item.path(), "daap:88");
  EXPECT_FALSE(LedgerDAAPPurchasedItem().path());

  // The keys and values of a book, less the ones only a local file gives.
  PlistDictionary bookWire = localBook().toDictionary();
  for (const char* key : {"isLocal", "path", "bookInfo", "sonorelMetaData"}) bookWire.erase(key);
  EXPECT_EQ(item.toDictionary(), bookWire);

  LedgerDAAPPurchasedItemRef copy = item.copy();
  copy->fields().daapDictionary->insert_or_assign("dmap.itemid", 1);
  EXPECT_FALSE(copy->isEqualToBook(item));
  copy->copyLibraryPropertiesFromBook(item);
  EXPECT_TRUE(copy->isEqualToBook(item));
}

TEST(StoreRecordTillPurchase, ItemIdentifierComesFromTheBuyParameters) {
  const std::pair<const char*, std::optional<std::uint64_t>> cases[] = {
      {"itemId=123", 123},
      {"productType=C&itemId=5&price=0", 5},
      {"?itemId=9", 9},
      {"itemId=18446744073709551615", kHugeIdentifier},
      {"salableWareId=5&appExtVrsId=7", 5},
      // "itemId" is preferred wherever it stands, and a broken one falls back.
      {"salableWareId=5&itemId=6", 6},
      {"itemId=&salableWareId=3", 3},
      {"itemId=1&itemId=2", 1},  // the first of two wins
  };
  for (const auto& [parameters, expected] : cases) {
    EXPECT_EQ(TillPurchase::itemIdentifierFromBuyParameters(parameters), expected) << parameters;
  }
  for (const char* broken : {"", "itemId", "itemId=", "itemId=12abc", "itemId=-1", "itemId=+4",
                             "itemId= 4", "itemId=18446744073709551616", "xitemId=4", "ItemId=4",
                             "bids=com.example.App", "itemId=0x10", "&&&", "=4"}) {
    EXPECT_FALSE(TillPurchase::itemIdentifierFromBuyParameters(broken)) << broken;
  }

  TillPurchase purchase = TillPurchase::purchaseWithBuyParameters("productType=C&itemId=42");
  EXPECT_EQ(purchase.buyParameters(), "productType=C&itemId=42");
  EXPECT_EQ(purchase.itemIdentifier(), 42u);
  EXPECT_EQ(TillPurchase::purchaseWithBuyParameters("bids=com.example.App").itemIdentifier(), 0u);
}

TEST(StoreRecordTillPurchase, PreflightCheckFollowsTheAccountLessOptions) {
  const std::string preflight(TillPurchaseAccountLessOptionPerformPreflightCheck);
  TillPurchase purchase;
  EXPECT_FALSE(purchase.checkPreflightAterPurchase());

  PlistDictionary options{{preflight, true},
                          {std::string(TillPurchaseAccountLessOptionAllowRedownload), false}};
  purchase.setAccountLessOptions(options);
  EXPECT_TRUE(purchase.checkPreflightAterPurchase());
  EXPECT_FALSE(TillPurchase::accountLessOption(purchase.accountLessOptions(),
                                               TillPurchaseAccountLessOptionAllowRedownload));
  // An explicit setting after the options wins.
  purchase.setCheckPreflightAterPurchase(false);
  EXPECT_FALSE(purchase.checkPreflightAterPurchase());

  // Integers count as C counts them; text and other types do not count.
  for (const auto& [value, counts] : {std::pair{PlistValue(1), true}, {PlistValue("YES"), false}}) {
    purchase.setAccountLessOptions(PlistDictionary{{preflight, value}});
    EXPECT_EQ(purchase.checkPreflightAterPurchase(), counts) << describePlistValue(value);
  }
  purchase.setAccountLessOptions(PlistDictionary{{preflight, true}});
  purchase.setAccountLessOptions(std::nullopt);
  EXPECT_FALSE(purchase.checkPreflightAterPurchase());

  // The wire form: a missing flag is implied by the options, a present one
  // is taken as sent.
  PlistDictionary wire{{"buyParams", "salableWareId=5"},
                       {"accountLessOptions", PlistDictionary{{preflight, true}}}};
  std::optional<TillPurchase> implied = TillPurchase::fromDictionary(wire);
  ASSERT_TRUE(implied);
  EXPECT_TRUE(implied->checkPreflightAterPurchase());
  std::optional<TillPurchase> overridden =
      TillPurchase::fromDictionary(with(wire, "checkPreflightAterPurchase", false));
  ASSERT_TRUE(overridden);
  EXPECT_FALSE(overridden->checkPreflightAterPurchase());
}

TillPurchase fullPurchase() {
  TillPurchase purchase = TillPurchase::purchaseWithBuyParameters("itemId=7&appExtVrsId=3");
  purchase.setItemIdentifier(kHugeIdentifier);
  purchase.setPurchaseType(TillPurchase::kPurchaseTypeBackground);
  purchase.setParentalControls(PlistDictionary{{"rating", 300}});
  purchase.setIsUpdate(true);
  purchase.setIsOVP(true);
  purchase.setIsAccountLessPurchase(true);
  purchase.setAccountLessOptions(
      PlistDictionary{{std::string(TillPurchaseAccountLessOptionAllowRedownload), true}});
  purchase.setOrvaneID("someone@example.org");
  purchase.setAccountIdentifier(99);
  return purchase;
}

TEST(StoreRecordTillPurchase, WireDictionaryIsTheBuyRequestWithAbsentOptionalsLeftOut) {
  const PlistDictionary wire = fullPurchase().toDictionary();
  EXPECT_THAT(keysOf(wire),
              UnorderedElementsAreArray<std::string>(
                  {"buyParams", "itemIdentifier", "purchaseType", "parentalControls", "isUpdate",
                   "isRedownload", "isOVP", "isAccountLessPurchase", "accountLessOptions",
                   "checkPreflightAterPurchase", "orvaneID", "accountIdentifier"}));
  EXPECT_EQ(wire.at("purchaseType"), PlistValue(std::int64_t{3}));
  EXPECT_EQ(wire.at("isRedownload"), PlistValue(false));

  PlistDictionary plain = TillPurchase().toDictionary();
  for (const char* key : {"parentalControls", "accountLessOptions", "orvaneID"}) {
    EXPECT_FALSE(plain.contains(key)) << key;
  }
  EXPECT_EQ(plain.at("accountIdentifier"), PlistValue(std::int64_t{0}));
  EXPECT_EQ(TillPurchase::fromDictionary(plain), TillPurchase());
}

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

PlistDictionary& metadataOf(PlistDictionary& download) {
  return *download["metadata"].dictionary();
}
PlistDictionary& firstAsset(PlistDictionary& download) {
  return *(*download["assets"].array())[0].dictionary();
}

TEST(TillDownloadRecord, ReadsTheStoresDownloadAndWritesItBackWithTheLocalFields) {
  std::shared_ptr<TillDownload> download = TillDownload::fromDictionary(storeDownload());
  ASSERT_NE(download, nullptr);
  const TillDownloadMetadata metadata = download->metadata();
  EXPECT_EQ(std::tuple(metadata.itemIdentifier(), metadata.bundleIdentifier(),
                       metadata.bundleVersion(), metadata.preflightPackageURL(),
                       metadata.isMDMProvided(), download->downloadType()),
            std::tuple(42u, "com.example.thing", "2.1", "http://store.test/preflight/42", false,
                       TillDownload::kInstall));
  ASSERT_EQ(download->assets().size(), 1u);
  const TillDownloadAsset asset = download->assets().front();
  EXPECT_EQ(std::tuple(asset.URLRequest().url(), asset.fileSize(), asset.numberOfBytesToHash(),
                       asset.hashes()),
            std::tuple("http://store.test/assets/42/Thing.tar", 1500, 1000,
                       std::vector<std::string>{kDigestA, kDigestB}));

  const PlistDictionary written = download->toDictionary();
  // Every key the store sent comes back with its value...
  EXPECT_EQ(written.at("metadata"), PlistValue(with(storeMetadata(), "isMDMProvided", false)));
  EXPECT_EQ(written.at("assets"), PlistValue(PlistArray{with(storeAsset(), "external", false)}));
  // ...and the local fields are added.
  EXPECT_EQ(written.at("downloadType"), PlistValue(1));
  EXPECT_EQ(written.at("skipAssetDownloadIfNotAlreadyOnDisk"), PlistValue(false));
  EXPECT_EQ(written.at("status"),
            PlistValue(PlistDictionary{{"isPaused", false}, {"isFailed", false}}));
  EXPECT_FALSE(written.contains("relaunchAppWithBundleURL"));
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

TEST(TillDownloadRecord, EveryFieldSurvivesAndNestedRecordsMustBeOfTheirClass) {
  std::shared_ptr<TillDownload> fromWire =
      TillDownload::fromDictionary(TillDownload(everyFieldSet()).toDictionary());
  ASSERT_NE(fromWire, nullptr);
  EXPECT_EQ(fromWire->snapshot(), everyFieldSet());
  // The request that is more than a plain fetch keeps its header and limit.
  EXPECT_EQ(fromWire->assets()[0].URLRequest().valueForHeaderField("x-token"), "secret");
  EXPECT_EQ(fromWire->assets()[0].URLRequest().timeoutInterval(), 5);

  const PlistDictionary encoded = TillDownload(everyFieldSet()).encodeWithCoder();
  ASSERT_NE(TillDownload::initWithCoder(encoded), nullptr);
  const PlistValue asset(everyFieldSet().assets[0].encodeWithCoder());
  EXPECT_EQ(TillDownload::initWithCoder(with(encoded, "metadata", asset)), nullptr);
  const PlistValue plainAsset(everyFieldSet().assets[0].toDictionary());
  EXPECT_EQ(TillDownload::initWithCoder(with(encoded, "assets", PlistArray{plainAsset})), nullptr);
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
    target = with(target, malformation.key, malformation.value);
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
  std::optional<TillPurchaseResponse> none =
      TillPurchaseResponse::fromDictionary(PlistDictionary{{"downloads", PlistArray{}}});
  ASSERT_TRUE(none);
  EXPECT_TRUE(none->downloads().empty());
}

TillPurchaseResponse twoDownloads() {
  std::optional<TillPurchaseResponse> response = TillPurchaseResponse::fromDictionary(
      PlistDictionary{{"downloads", PlistArray{storeDownload(), storeDownload()}}});
  response->downloads()[1]->setDownloadType(TillDownload::kStageOnly);
  return *response;
}

std::vector<RecordShape> recordShapes() {
  return {
      shapeOf<LedgerUpdate>("LedgerUpdate", *markedUpdate(),
                            {{"itemIdentifier", "55"}, {"isStaged", "yes"}, {"dictionary", 1}}),
      shapeOf<SysupQuaymartUpdate>("SysupQuaymartUpdate", SysupQuaymartUpdate(osUpdateFields()),
                                   {{"productKey", PlistValue()},
                                    {"productKey", ""},
                                    {"tags", PlistArray{"ok", 3}},
                                    {"tags", "SysupBUNDLE:x"},
                                    {"action", "2"},
                                    {"isCritical", "true"},
                                    {"downloadMetadata", PlistArray{}}}),
      shapeOf<Status>("SoftwareUpdateStatusFailed", kFailedStatus,
                      {{"percentComplete", "37"},
                       {"state", 4.0},
                       {"error", "failed"},
                       {"statusInfo", PlistArray{}}}),
      shapeOf<Status>("SoftwareUpdateStatusInProgress", kProgressStatus, {}),
      shapeOf<LedgerBook>("LedgerBook", localBook(), bookRefusals()),
      shapeOf<LedgerDAAPPurchasedItem>("LedgerDAAPPurchasedItem",
                                       LedgerDAAPPurchasedItem(cloudFields()),
                                       {{"oaxenItemIdentifier", -88}}),
      shapeOf<TillPurchase>("TillPurchase", fullPurchase(),
                            {{"itemIdentifier", std::int64_t{-1}},
                             {"itemIdentifier", "7"},
                             {"buyParams", 7},
                             {"isUpdate", "true"},
                             {"accountLessOptions", PlistArray{}},
                             {"orvaneID", 1},
                             {"purchaseType", 2.5}}),
      shapeOf<TillDownload>("TillDownload", TillDownload(everyFieldSet()), {}),
      shapeOf<TillPurchaseResponse>("TillPurchaseResponse", twoDownloads(),
                                    {{"downloads", storeDownload()}}),
  };
}

INSTANTIATE_TEST_SUITE_P(EveryRecord, StoreRecordShape, ::testing::ValuesIn(recordShapes()),
                         [](const auto& info) { return info.param.name; });

}  // namespace
}  // namespace larder
