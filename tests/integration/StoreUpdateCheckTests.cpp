// The update check and account lookup routes of larder-store, spoken to
// over HTTP on 127.0.0.1 as the service speaks to them, the update request
// body of a real software map included.
#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <vector>

#include "platform/plist/PropertyListSerialization.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/http/VendGzip.h"
#include "store-runtime/http/VendHTTPTransfer.h"
#include "store-runtime/http/VendRequestSigner.h"
#include "tests/integration/ServiceHarness.h"
#include "tests/integration/StoreCatalogueBuilder.h"
#include "tests/integration/StoreServerProcess.h"

namespace larder::testing {
namespace {

constexpr std::uint64_t kNewerID = 2001;         // catalogue 2.10
constexpr std::uint64_t kSameID = 2002;          // catalogue 3.0
constexpr std::uint64_t kOlderID = 2003;         // catalogue 1.0
constexpr std::uint64_t kIncompatibleID = 2004;  // catalogue 5.0, incompatible
constexpr std::uint64_t kByBundleID = 2005;      // catalogue 1.1
constexpr std::uint64_t kUnknownID = 999999;
const PlistDate kReleaseDate{1700000000};  // what the catalogue builder writes

constexpr std::string_view kUpdatePath = "/available-software-updates";
constexpr std::string_view kLookupPath = "/orvane-id-lookup";

// One entry of a report, as the service writes it; a key is left out
// where the value is absent.
PlistDictionary reported(PlistValue wareID, std::string bundleID,
                         std::optional<std::string> version) {
  PlistDictionary entry{{"ware-id", std::move(wareID)},
                        {"installed-version-identifier", std::int64_t{7}},
                        {"HostBundleIdentifier", std::move(bundleID)}};
  if (version) entry.emplace("HostBundleShortVersionString", *version);
  return entry;
}

// The ware ids of the entries of a list, in order; 0 for an entry
// without an integer one.
std::vector<std::uint64_t> wareIDsOf(const PlistValue& list) {
  std::vector<std::uint64_t> identifiers;
  if (const PlistArray* entries = list.array()) {
    for (const PlistValue& entry : *entries) {
      identifiers.push_back(entry["ware-id"].isInteger() ? entry["ware-id"].uint64Value() : 0);
    }
  }
  return identifiers;
}

class StoreUpdateCheckTest : public ::testing::Test {
 protected:
  void SetUp() override {
    addItem(kNewerID, "com.example.newer", "Newer", "2.10");
    addItem(kSameID, "com.example.same", "Same", "3.0");
    addItem(kOlderID, "com.example.older", "Older", "1.0");
    addItem(kIncompatibleID, "com.example.incompatible", "Incompatible", "5.0",
            {{"incompatible", true}});
    addItem(kByBundleID, "com.example.bybundle", "By Bundle", "1.1",
            {{"action-params", "itemId=2005&vers=1.1"}});
  }

  void addItem(std::uint64_t wareID, std::string bundleID, std::string title, std::string version,
               PlistDictionary extraEntries = {}) {
    catalogue.addItem({.wareID = wareID,
                       .bundleID = std::move(bundleID),
                       .title = std::move(title),
                       .version = std::move(version),
                       .extraEntries = std::move(extraEntries)});
  }

  void startStore(const std::vector<std::string>& faults = {}) {
    store = std::make_unique<StoreServerProcess>(catalogue.directory(), faults);
  }

  [[nodiscard]] PlistValue bag() const {
    const auto result = get(store->bagURL());
    EXPECT_FALSE(result.error);
    return plistOf(result);
  }

  // POSTs `body` to the update check as the service does: a gzip body
  // with its two header fields, a plain one with neither.
  [[nodiscard]] VendHTTPTransfer::Result check(PlistData body, bool gzipped = false) const {
    VendURLRequest request(store->baseURL() + std::string(kUpdatePath));
    request.setMethod("POST");
    request.setCachePolicy(1);
    if (gzipped) {
      request.setValue("gzip", "Content-Encoding");
      request.setValue("application/x-orvane-plist", "Content-Type");
    }
    request.setBody(std::move(body));
    request.setTimeoutInterval(10);
    return VendHTTPTransfer::perform(request);
  }

  [[nodiscard]] PlistValue answerTo(const PlistValue& report) const {
    const auto result = check(dataOf(PropertyListSerialization::writeXml(report)));
    EXPECT_FALSE(result.error);
    EXPECT_EQ(result.response.statusCode, 200) << text(plistOf(result)["customerMessage"]);
    return plistOf(result);
  }

  [[nodiscard]] VendHTTPTransfer::Result lookUp(std::string_view query) const {
    return get(store->baseURL() + std::string(kLookupPath) + std::string(query));
  }

  StoreCatalogueBuilder catalogue;
  std::unique_ptr<StoreServerProcess> store;
};

// MARK: bag

TEST_F(StoreUpdateCheckTest, TheBagOffersTheCheckWithCompressionOnAndNothingHeldBack) {
  startStore();
  const PlistValue offered = bag();
  EXPECT_EQ(text(offered["available-software-updates-extended"]),
            store->baseURL() + std::string(kUpdatePath));
  EXPECT_EQ(text(offered["orvane-id-lookup"]), store->baseURL() + std::string(kLookupPath));
  // The service compresses only for a number whose value is true.
  const PlistValue& compress = offered["available-software-updates-compress-request"];
  EXPECT_TRUE(compress.isNumber());
  EXPECT_TRUE(compress.boolValue());
  ASSERT_TRUE(offered["da-do-not-update-list"].isArray());
  EXPECT_TRUE(offered["da-do-not-update-list"].array()->empty());
}

TEST_F(StoreUpdateCheckTest, TheCataloguesBagEntriesWinOverTheStoresOwn) {
  catalogue.setStoreSettings({{"available-software-updates-compress-request", "yes"},
                              {"da-do-not-update-list", "com.example.same"}});
  startStore();
  PlistValue offered = bag();
  EXPECT_EQ(offered["available-software-updates-compress-request"], PlistValue("yes"));
  EXPECT_EQ(offered["da-do-not-update-list"], PlistValue("com.example.same"));
  store.reset();

  catalogue.setStoreSettings({{"available-software-updates-compress-request", false},
                              {"da-do-not-update-list", PlistArray{"com.example.same", "2001"}},
                              {"orvane-id-lookup", "/elsewhere"}});
  startStore();
  offered = bag();
  EXPECT_EQ(offered["available-software-updates-compress-request"], PlistValue(false));
  EXPECT_EQ(offered["da-do-not-update-list"], PlistValue(PlistArray{"com.example.same", "2001"}));
  EXPECT_EQ(text(offered["orvane-id-lookup"]), store->baseURL() + "/elsewhere");
}

// MARK: update check

TEST_F(StoreUpdateCheckTest, OnlyGreaterVersionsAreOfferedInTheOrderOfTheReport) {
  startStore();
  const PlistValue answer = answerTo(PlistDictionary{
      {"local-software",
       PlistArray{
           // Unknown ware id, known bundle identifier: found by the bundle.
           reported(std::to_string(kUnknownID), "com.example.bybundle", "1.0"),
           reported(std::to_string(kSameID), "com.example.same", "3.0"),
           // 2.10 is greater than 2.9 only when runs of digits are numbers.
           reported(std::to_string(kNewerID), "com.example.newer", "2.9"),
           reported(std::to_string(kOlderID), "com.example.older", "1.5"),
           reported(std::to_string(kIncompatibleID), "com.example.incompatible", "4.0"),
           reported(std::to_string(kUnknownID + 1), "com.example.unknown", "0.1"),
           "not an entry",
       }}});
  EXPECT_EQ(wareIDsOf(answer["items"]), (std::vector<std::uint64_t>{kByBundleID, kNewerID}));
  EXPECT_EQ(wareIDsOf(answer["incompatible-items"]), (std::vector<std::uint64_t>{kIncompatibleID}));

  const PlistValue& newer = answer["items"].array()->at(1);
  EXPECT_EQ(text(newer["bundle-id"]), "com.example.newer");
  EXPECT_EQ(text(newer["title"]), "Newer");
  EXPECT_EQ(text(newer["version"]), "2.10");
  EXPECT_EQ(text(newer["installed-version"]), "2.9");
  EXPECT_EQ(text(newer["action-params"]),
            "productType=C&price=0&pricingParameters=STDRDL&itemId=2001");
  ASSERT_TRUE(newer["release-date"].isDate());
  EXPECT_EQ(*newer["release-date"].date(), kReleaseDate);
  const PlistValue& byBundle = answer["items"].array()->at(0);
  EXPECT_EQ(text(byBundle["action-params"]), "itemId=2005&vers=1.1");
  EXPECT_EQ(store->requestCount("available-software-updates"), 1u);
}

TEST_F(StoreUpdateCheckTest, MissingVersionsAndBundledSoftwareAreOfferedOnce) {
  startStore();
  const PlistValue answer = answerTo(PlistDictionary{
      {"bundled-software",
       PlistArray{reported(std::int64_t{kSameID}, "com.example.same", "2.0"),
                  reported(std::to_string(kNewerID), "com.example.newer", "1.0")}},
      {"local-software",
       PlistArray{reported(std::to_string(kNewerID), "com.example.newer", std::nullopt),
                  reported(std::to_string(kOlderID), "com.example.older", "1.0")}}});
  // Local software first, whatever the order of the keys; an item
  // reported twice is listed once, as its first report has it.
  EXPECT_EQ(wareIDsOf(answer["items"]), (std::vector<std::uint64_t>{kNewerID, kSameID}));
  EXPECT_TRUE(answer["items"].array()->at(0)["installed-version"].isNull());
  ASSERT_TRUE(answer["incompatible-items"].isArray());
  EXPECT_TRUE(answer["incompatible-items"].array()->empty());
}

TEST_F(StoreUpdateCheckTest, XmlBinaryAndGzipBodiesGiveTheSameAnswer) {
  startStore();
  const PlistDictionary report{
      {"local-software",
       PlistArray{reported(std::to_string(kNewerID), "com.example.newer", "2.0"),
                  reported(std::to_string(kIncompatibleID), "com.example.incompatible", "1")}}};
  const PlistValue fromXml = answerTo(report);
  EXPECT_EQ(wareIDsOf(fromXml["items"]), std::vector<std::uint64_t>{kNewerID});

  const auto fromBinary = check(PropertyListSerialization::writeBinary(report));
  EXPECT_EQ(fromBinary.response.statusCode, 200);
  EXPECT_EQ(plistOf(fromBinary), fromXml);

  const std::string xml = PropertyListSerialization::writeXml(report);
  const auto gzipped = VendCopyGzippedDataForData(dataOf(xml));
  ASSERT_TRUE(gzipped);
  const auto fromGzip = check(*gzipped, true);
  EXPECT_EQ(fromGzip.response.statusCode, 200);
  EXPECT_EQ(plistOf(fromGzip), fromXml);
  EXPECT_EQ(store->requestCount("available-software-updates"), 3u);
}

TEST_F(StoreUpdateCheckTest, ABodyThatIsNoReportIsAnInvalidRequest) {
  startStore();
  const std::vector<std::pair<std::string, VendHTTPTransfer::Result>> results{
      {"not a plist", check(dataOf("this is no property list"))},
      {"an array", check(dataOf(PropertyListSerialization::writeXml(PlistArray{1, 2})))},
      {"no body", check({})},
      {"bad gzip", check(dataOf("\x1f\x8b this is no gzip stream"), true)},
      {"plain body sent as gzip", check(dataOf(PropertyListSerialization::writeXml(
                                            PlistDictionary{{"local-software", PlistArray{}}})),
                                        true)},
  };
  for (const auto& [what, result] : results) {
    EXPECT_EQ(result.response.statusCode, 400) << what;
    EXPECT_EQ(failureTypeOf(result), "invalid-request") << what;
  }
  // Every one reached the route.
  EXPECT_EQ(store->requestCount("available-software-updates"), results.size());
}

TEST_F(StoreUpdateCheckTest, ExtraItemsOfTheCatalogueAreAppendedAsTheyAre) {
  const PlistArray extras{"a string among the items",
                          PlistDictionary{{"ware-id", "not a number"}, {"title", "Broken"}},
                          std::int64_t{42}};
  catalogue.writeStoreSettings({{"extraUpdateItems", extras}});
  startStore();
  const PlistValue answer = answerTo(PlistDictionary{
      {"local-software",
       PlistArray{reported(std::to_string(kNewerID), "com.example.newer", "1.0")}}});
  ASSERT_TRUE(answer["items"].isArray());
  const PlistArray& items = *answer["items"].array();
  ASSERT_EQ(items.size(), 1 + extras.size());
  EXPECT_EQ(items[0]["ware-id"], PlistValue(kNewerID));
  EXPECT_EQ(PlistArray(items.begin() + 1, items.end()), extras);

  // With nothing to offer the extras are the whole list; a store.plist
  // without a bag leaves the bag's defaults alone.
  const PlistValue nothingNewer = answerTo(PlistDictionary{{"local-software", PlistArray{}}});
  EXPECT_EQ(nothingNewer["items"], PlistValue(extras));
  EXPECT_TRUE(bag()["available-software-updates-compress-request"].boolValue());
}

// Extra items that are no array, and an incompatible mark that is no
// boolean: each is left out, with a line on standard error.
TEST_F(StoreUpdateCheckTest, SettingsOfTheWrongTypeAreLeftOut) {
  catalogue.writeStoreSettings({{"extraUpdateItems", "not an array"}});
  addItem(2006, "com.example.marked", "Marked", "9.0", {{"incompatible", "yes"}});
  startStore();
  const PlistValue answer = answerTo(PlistDictionary{
      {"local-software", PlistArray{reported("2006", "com.example.marked", "1.0")}}});
  ASSERT_TRUE(answer["items"].isArray());
  EXPECT_TRUE(answer["items"].array()->empty());
  EXPECT_TRUE(wareIDsOf(answer["incompatible-items"]).empty());
  EXPECT_NE(store->errorOutput().find("extraUpdateItems"), std::string::npos);
  EXPECT_NE(store->errorOutput().find("incompatible is not a boolean"), std::string::npos);
}

// MARK: account lookup

TEST_F(StoreUpdateCheckTest, TheLookupNamesTheAccountOfAnOpaqueID) {
  catalogue.addAccount({.accountID = 7001,
                        .orvaneID = "ada@example.com",
                        .password = "lovelace",
                        .opaqueID = "opaque ada&co"});
  catalogue.addAccount({.accountID = 7002, .orvaneID = "alan@example.com", .password = "turing"});
  startStore();

  const auto ada = lookUp("?ware-id=2001&account=opaque%20ada%26co");
  EXPECT_EQ(ada.response.statusCode, 200);
  EXPECT_EQ(plistOf(ada), PlistValue(PlistDictionary{{"orvaneID", "ada@example.com"},
                                                     {"accountID", std::int64_t{7001}}}));
  // Not signed: the owner need not be signed in.
  EXPECT_FALSE(ada.response.valueForHeaderField(VendRequestSigner::kSignatureHeader));

  // Without an opaque id of its own an account goes by its id in decimal.
  const auto alan = lookUp("?ware-id=2001&account=7002");
  EXPECT_EQ(text(plistOf(alan)["orvaneID"]), "alan@example.com");

  const auto byID = lookUp("?ware-id=2001&account=7001");
  EXPECT_EQ(byID.response.statusCode, 404);
  EXPECT_EQ(failureTypeOf(byID), "unknown-account");

  for (const char* query : {"?ware-id=2001", "?account=7002", "?ware-id=x&account=7002",
                            "?ware-id=2001&account=", ""}) {
    const auto refused = lookUp(query);
    EXPECT_EQ(refused.response.statusCode, 400) << query;
    EXPECT_EQ(failureTypeOf(refused), "invalid-request") << query;
  }
  EXPECT_EQ(store->requestCount("orvane-id-lookup"), 8u);
}

TEST_F(StoreUpdateCheckTest, AccountsWithAnUnusableOrTakenOpaqueIDAreSkipped) {
  catalogue.addAccount({.accountID = 7001, .orvaneID = "ada@example.com", .password = "a"});
  // Takes the first account's default opaque id.
  catalogue.addAccount(
      {.accountID = 7002, .orvaneID = "alan@example.com", .password = "b", .opaqueID = "7001"});
  catalogue.addAccount(
      {.accountID = 7003, .orvaneID = "grace@example.com", .password = "c", .opaqueID = ""});
  startStore();
  EXPECT_EQ(text(plistOf(lookUp("?ware-id=1&account=7001"))["orvaneID"]), "ada@example.com");
  EXPECT_EQ(lookUp("?ware-id=1&account=7003").response.statusCode, 404);
  const std::string errors = store->errorOutput();
  EXPECT_NE(errors.find("skipping account entry 1: its opaqueID is taken"), std::string::npos)
      << errors;
  EXPECT_NE(errors.find("skipping account entry 2: opaqueID is not a non-empty string"),
            std::string::npos)
      << errors;
}

// MARK: the service's own body

TEST_F(StoreUpdateCheckTest, TheSoftwareMapsBodyIsUnderstoodPlainAndCompressed) {
  TemporaryPlatform platform;
  const ScopedEnvironment environment({{"LARDER_ROOT", platform.root()},
                                       {"HOME", platform.home()},
                                       {"XDG_CACHE_HOME", platform.cacheHome()}});
  const std::string applications = platform.root() + "/Applications";
  platform.installBundle({applications, "Newer", "com.example.newer", "2.2", kNewerID});
  platform.installBundle({applications, "Same", "com.example.same", "3.0", kSameID});
  platform.installBundle(
      {applications, "Incompatible", "com.example.incompatible", "4.9", kIncompatibleID});
  SoftwareMap map({.persistedStorePath = platform.persistedStorePath(),
                   .discoverApplications = true,
                   .liveQueries = false,
                   .periodicReload = false});
  map.waitUntilIdle();
  ASSERT_EQ(map.allProducts().size(), 3u);
  startStore();

  for (const bool compress : {false, true}) {
    SCOPED_TRACE(compress ? "compressed" : "plain");
    bool compressed = !compress;
    const auto body =
        map.updateRequestBodyData(&compressed, true, false, false, nullptr, compress, {});
    ASSERT_TRUE(body);
    ASSERT_EQ(compressed, compress);
    const auto result = check(*body, compressed);
    ASSERT_EQ(result.response.statusCode, 200) << text(plistOf(result)["customerMessage"]);
    const PlistValue answer = plistOf(result);
    EXPECT_EQ(wareIDsOf(answer["items"]), std::vector<std::uint64_t>{kNewerID});
    EXPECT_EQ(text(answer["items"].array()->at(0)["installed-version"]), "2.2");
    EXPECT_EQ(wareIDsOf(answer["incompatible-items"]), std::vector<std::uint64_t>{kIncompatibleID});
  }
}

}  // namespace
}  // namespace larder::testing
