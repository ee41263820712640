// larder-store as a client of the store sees it: a real server process on
// 127.0.0.1, spoken to over HTTP with the runtime's own transport; the
// update check gets the request body of a real software map too.
#include <archive.h>
#include <archive_entry.h>
#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <sys/stat.h>

#include <array>
#include <atomic>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <thread>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/http/VendGzip.h"
#include "store-runtime/http/VendHTTPTransfer.h"
#include "store-runtime/http/VendRequestSigner.h"
#include "tests/integration/StoreCatalogueBuilder.h"
#include "tests/integration/StoreServerProcess.h"
#include "tests/unit/ScopedEnvironment.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

constexpr std::uint64_t kAccountID = 7001;
constexpr std::uint64_t kOtherAccountID = 7002;
constexpr std::uint64_t kAppID = 1001;
constexpr std::uint64_t kAccountLessID = 1002;
constexpr std::uint64_t kPreflightID = 1003;
constexpr std::uint64_t kNewerID = 2001;         // catalogue 2.10
constexpr std::uint64_t kSameID = 2002;          // catalogue 3.0
constexpr std::uint64_t kOlderID = 2003;         // catalogue 1.0
constexpr std::uint64_t kIncompatibleID = 2004;  // catalogue 5.0, incompatible
constexpr std::uint64_t kByBundleID = 2005;      // catalogue 1.1
constexpr std::uint64_t kUnknownID = 999999;
const PlistData kAccountKey{'k', 'e', 'y', '-', 'o', 'f', '-', 'a', 'd', 'a'};
constexpr std::string_view kUpdatePath = "/available-software-updates";

PlistData fileBytes(const std::string& path) {
  return FileIO::read(path, 1u << 30u).value_or(PlistData{});
}
std::string xml(const PlistValue& value) {
  return PropertyListSerialization::writeXml(value);
}
PlistDictionary credentials(const std::string& name, const std::string& password) {
  return {{"accountName", name}, {"password", password}};
}

std::vector<std::string> chunkHashes(const PlistData& bytes, std::size_t chunkSize) {
  std::vector<std::string> hashes;
  for (std::size_t offset = 0; offset < bytes.size(); offset += chunkSize) {
    std::array<unsigned char, EVP_MAX_MD_SIZE> digest{};
    unsigned int length = 0;
    EVP_Digest(bytes.data() + offset, std::min(chunkSize, bytes.size() - offset), digest.data(),
               &length, EVP_sha256(), nullptr);
    std::string hex;
    for (unsigned int i = 0; i < length; ++i) {
      hex.push_back("0123456789abcdef"[digest[i] >> 4U]);
      hex.push_back("0123456789abcdef"[digest[i] & 0xFU]);
    }
    hashes.push_back(hex);
  }
  return hashes;
}

// Null-safe access, so that a wrong answer fails a test instead of the run.
const PlistValue& element(const PlistValue& array, std::size_t index) {
  const PlistArray* elements = array.array();
  return elements && index < elements->size() ? (*elements)[index] : PlistValue::null();
}
std::size_t countOf(const PlistValue& container) {
  if (const PlistArray* elements = container.array()) return elements->size();
  if (const PlistDictionary* entries = container.dictionary()) return entries->size();
  return 0;
}
std::vector<std::string> stringsOf(const PlistValue& array) {
  std::vector<std::string> strings;
  for (std::size_t i = 0; i < countOf(array); ++i) strings.push_back(text(element(array, i)));
  return strings;
}
// The ware ids of the entries of a list, in order; 0 for an entry without
// an integer one.
std::vector<std::uint64_t> wareIDsOf(const PlistValue& list) {
  std::vector<std::uint64_t> identifiers;
  for (std::size_t i = 0; i < countOf(list); ++i) {
    const PlistValue& wareID = element(list, i)["ware-id"];
    identifiers.push_back(wareID.isInteger() ? wareID.uint64Value() : 0);
  }
  return identifiers;
}

// One entry of an update check report, as the service writes it; a key is
// left out where the value is absent.
PlistDictionary reported(PlistValue wareID, std::string bundleID,
                         std::optional<std::string> version) {
  PlistDictionary entry{{"ware-id", std::move(wareID)},
                        {"installed-version-identifier", std::int64_t{7}},
                        {"HostBundleIdentifier", std::move(bundleID)}};
  if (version) entry.emplace("HostBundleShortVersionString", *version);
  return entry;
}
PlistDictionary localSoftware(PlistArray entries) {
  return {{"local-software", std::move(entries)}};
}

class StoreServerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    catalogue.addAccount(
        {kAccountID, "ada@example.com", "lovelace", "143441", kAccountKey, "opaque ada&co"});
    catalogue.addAccount({kOtherAccountID, "alan@example.com", "turing"});
    appPackage = catalogue.addItem({.wareID = kAppID,
                                    .bundleID = "com.example.app",
                                    .title = "App",
                                    .version = "2.0",
                                    .payloadBytes = 50'000,
                                    .actionParams = "productType=C&price=0&itemId=1001&vers=2"});
    catalogue.addItem({.wareID = kAccountLessID,
                       .bundleID = "com.example.free",
                       .title = "Free",
                       .accountLess = true});
    catalogue.addItem(
        {.wareID = kPreflightID,
         .bundleID = "com.example.checked",
         .title = "Checked",
         .preflight = PlistDictionary{{"allowed", false}, {"minimumSystemVersion", "14.2"}}});
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

  PlistValue bag() {
    const auto result = get(store->bagURL());
    EXPECT_FALSE(result.error) << result.error->description;
    return plistOf(result);
  }

  // POSTs `body` below the store, signed for `signer` when given and then
  // changed by `tamper`; gzip bodies go with their Content-Encoding, as the
  // service sends them.
  using Signer = std::pair<PlistData, std::uint64_t>;
  using Tamper = std::function<void(VendURLRequest&)>;
  VendHTTPTransfer::Result post(std::string_view path, PlistData body,
                                const std::optional<Signer>& signer = std::nullopt,
                                bool gzipped = false, const Tamper& tamper = {}) {
    VendURLRequest request(store->baseURL() + std::string(path));
    request.setMethod("POST");
    if (gzipped) request.setValue("gzip", "Content-Encoding");
    request.setBody(std::move(body));
    request.setTimeoutInterval(10);
    if (signer) VendRequestSigner(signer->first).sign(request, signer->second);
    if (tamper) tamper(request);
    return VendHTTPTransfer::perform(request);
  }
  VendHTTPTransfer::Result buy(const PlistValue& body,
                               std::optional<Signer> signer = Signer{kAccountKey, kAccountID}) {
    return post("/buy-product", dataOf(xml(body)), signer);
  }
  static PlistDictionary purchaseOf(std::uint64_t wareID) {
    return {{"buyParams", "productType=C&itemId=" + std::to_string(wareID)},
            {"itemIdentifier", wareID},
            {"isRedownload", false}};
  }
  // The first asset of the purchase of the app.
  PlistValue appAsset() {
    return element(element(plistOf(buy(purchaseOf(kAppID)))["downloads"], 0)["assets"], 0);
  }
  PlistValue answerTo(const PlistValue& report) {
    const auto result = post(kUpdatePath, dataOf(xml(report)));
    EXPECT_EQ(result.response.statusCode, 200) << text(plistOf(result)["customerMessage"]);
    return plistOf(result);
  }
  VendHTTPTransfer::Result lookUp(std::string_view query) {
    return get(store->baseURL() + "/orvane-id-lookup" + std::string(query));
  }

  StoreCatalogueBuilder catalogue;
  std::string appPackage;
  std::unique_ptr<StoreServerProcess> store;
};

// MARK: the bag

TEST_F(StoreServerTest, BagURLsAreAbsoluteOnTheHostAndPortTheClientUsed) {
  startStore();
  PlistValue offered = bag();
  ASSERT_TRUE(offered.isDictionary());
  for (const char* key : {"authenticate", "buy-product", "orvane-id-lookup"}) {
    EXPECT_EQ(text(offered[key]), store->baseURL() + "/" + key);
  }
  EXPECT_EQ(text(offered["available-software-updates-extended"]),
            store->baseURL() + std::string(kUpdatePath));
  // The service compresses only for a number whose value is true.
  EXPECT_TRUE(offered["available-software-updates-compress-request"].isNumber());
  EXPECT_TRUE(offered["available-software-updates-compress-request"].boolValue());
  EXPECT_EQ(offered["da-do-not-update-list"], PlistValue(PlistArray{}));
  EXPECT_TRUE(offered["ovp-licensing-invitation-url-pattern"].isString());

  // Asked under another name for the same address, the URLs follow the name.
  const std::string byName = "http://localhost:" + std::to_string(store->port());
  EXPECT_EQ(text(plistOf(get(byName + "/bag.plist?type=3"))["authenticate"]),
            byName + "/authenticate");
  EXPECT_EQ(store->requestCount("bag"), 2u);
}

TEST_F(StoreServerTest, TheCataloguesBagEntriesWinOverTheStoresOwn) {
  // Values of any type are taken as they are; a path becomes a URL on this
  // store, a URL stays.
  for (const PlistValue& compress : {PlistValue("yes"), PlistValue(false)}) {
    const PlistValue doNotUpdate =
        compress.isString() ? PlistValue("com.example.same") : PlistValue(PlistArray{"2001"});
    catalogue.setStoreSettings({{"available-software-updates-compress-request", compress},
                                {"da-do-not-update-list", doNotUpdate},
                                {"available-software-updates-extended", "/updates"},
                                {"item-lookup", "http://elsewhere.example/lookup"}});
    startStore();
    const PlistValue offered = bag();
    EXPECT_EQ(offered["available-software-updates-compress-request"], compress);
    EXPECT_EQ(offered["da-do-not-update-list"], doNotUpdate);
    EXPECT_EQ(text(offered["available-software-updates-extended"]), store->baseURL() + "/updates");
    EXPECT_EQ(text(offered["item-lookup"]), "http://elsewhere.example/lookup");
  }
}

// MARK: requests the store refuses

// A request the store must refuse, and how.
struct Refusal {
  const char* name;
  std::string path;                 // below the store's base URL
  std::optional<std::string> body;  // POSTed when given, else a GET
  int status;
  std::string failureType = "";                                    // "": not checked
  std::optional<std::pair<PlistData, std::uint64_t>> signer = {};  // key, account
  bool gzipped = false;
  std::function<void(VendURLRequest&)> tamper = {};  // after signing
};

TEST_F(StoreServerTest, RefusalsNameTheirFailureAndAreCountedOnTheirRoute) {
  const std::string auth = "/authenticate", buy = "/buy-product", update(kUpdatePath),
                    owner = "/orvane-id-lookup?";
  const std::optional<std::string> kGet;
  const std::optional<Signer> kUnsigned;
  const Signer ada{kAccountKey, kAccountID};
  const std::string kCredentials = "invalid-credentials", kSignature = "invalid-signature",
                    kInvalid = "invalid-request";
  const auto creds = [](const char* name, const char* password) {
    return xml(credentials(name, password));
  };
  const std::string buyApp = xml(purchaseOf(kAppID));
  const std::vector<Refusal> refusals{
      {"wrong password", auth, creds("ada@example.com", "babbage"), 401, kCredentials},
      {"unknown account", auth, creds("nobody@example.com", "lovelace"), 401, kCredentials},
      {"no name", auth, creds("", ""), 401, kCredentials},
      {"credentials in an array", auth, xml(PlistArray{"ada@example.com", "lovelace"}), 400},
      {"unsigned purchase", buy, buyApp, 401, kSignature},
      {"purchase with a wrong key", buy, buyApp, 401, kSignature, Signer{dataOf("x"), kAccountID}},
      {"purchase for an unknown account", buy, buyApp, 401, kSignature, Signer{kAccountKey, 999}},
      {"purchase for another account", buy, buyApp, 401, kSignature,
       Signer{kAccountKey, kOtherAccountID}},
      {"purchase body changed after signing", buy, buyApp, 401, kSignature, ada, false,
       [&](VendURLRequest& request) { request.setBody(dataOf(xml(purchaseOf(kAccountLessID)))); }},
      {"purchase signed for another path", buy + "?x=1", buyApp, 401, kSignature, ada, false,
       [](VendURLRequest& request) {
         request.setValue(VendRequestSigner(kAccountKey)
                              .requestSignature("POST", "/buy-product", request.body()),
                          VendRequestSigner::kSignatureHeader);
       }},
      {"account-less purchase, bad signature", buy, xml(purchaseOf(kAccountLessID)), 401,
       kSignature, Signer{dataOf("bad"), kAccountID}},
      {"purchase of an unknown item", buy, xml(purchaseOf(424242)), 404, "unknown-item", ada},
      {"purchase that is no property list", buy, "this is <not> a plist", 400, kInvalid, ada},
      {"empty purchase", buy, "", 400, kInvalid, ada},
      {"purchase in an array", buy, xml(PlistArray{purchaseOf(kAppID)}), 400, kInvalid, ada},
      {"purchase naming no item", buy, xml(PlistDictionary{{"buyParams", "price=0"}}), 400,
       kInvalid, ada},
      {"purchase of item zero", buy, xml(PlistDictionary{{"itemIdentifier", 0}}), 400, kInvalid,
       ada},
      {"asset of another name", "/assets/1001/Other.tar", kGet, 404},
      {"asset of another item", "/assets/5/App.tar", kGet, 404},
      {"item lookup without key", "/lookup?p=lockup", kGet, 400},
      {"preflight of an unknown item", "/preflight/77", kGet, 404},
      {"update report that is no property list", update, "no property list", 400, kInvalid},
      {"update report in an array", update, xml(PlistArray{1, 2}), 400, kInvalid},
      {"update check without body", update, "", 400, kInvalid},
      {"bad gzip", update, "\x1f\x8b this is no gzip stream", 400, kInvalid, kUnsigned, true},
      {"plain body sent as gzip", update, xml(localSoftware({})), 400, kInvalid, kUnsigned, true},
      // An account with an opaque id of its own is not found by its number.
      {"owner by the account number", owner + "ware-id=2001&account=7001", kGet, 404,
       "unknown-account"},
      {"owner without account", owner + "ware-id=2001", kGet, 400, kInvalid},
      {"owner without item", owner + "account=7002", kGet, 400, kInvalid},
      {"owner of a bad item", owner + "ware-id=x&account=7002", kGet, 400, kInvalid},
      {"owner of an empty account", owner + "ware-id=2001&account=", kGet, 400, kInvalid},
      {"owner without query", owner, kGet, 400, kInvalid},
  };
  startStore();
  std::map<std::string, std::uint64_t> perRoute;
  for (const Refusal& refusal : refusals) {
    SCOPED_TRACE(refusal.name);
    const auto result = refusal.body ? post(refusal.path, dataOf(*refusal.body), refusal.signer,
                                            refusal.gzipped, refusal.tamper)
                                     : get(store->baseURL() + refusal.path);
    EXPECT_EQ(result.response.statusCode, refusal.status);
    if (!refusal.failureType.empty()) {
      EXPECT_EQ(failureTypeOf(result), refusal.failureType);
      EXPECT_TRUE(plistOf(result)["customerMessage"].isString());
    }
    std::string route = refusal.path.substr(1, refusal.path.find_first_of("/?", 1) - 1);
    ++perRoute[route == "lookup" ? "item-lookup" : route];
  }
  for (const auto& [route, count] : perRoute) {
    EXPECT_EQ(store->requestCount(route), count) << route;
  }
}

// MARK: sign-in and purchase

TEST_F(StoreServerTest, AuthenticateGivesTheAccountAndAKeyThatSurvivesARestart) {
  startStore();
  auto result = post("/authenticate", dataOf(xml(credentials("ada@example.com", "lovelace"))));
  ASSERT_EQ(result.response.statusCode, 200);
  EXPECT_EQ(result.response.mimeType(), "application/x-plist");
  const PlistValue account = plistOf(result);
  EXPECT_EQ(account["accountID"].uint64Value(), kAccountID);
  EXPECT_EQ(text(account["orvaneID"]), "ada@example.com");
  EXPECT_EQ(text(account["storeFrontID"]), "143441");
  EXPECT_EQ(account["signingKey"], PlistValue(kAccountKey));

  const auto derivedKey = [&] {
    const auto answer =
        post("/authenticate", dataOf(xml(credentials("alan@example.com", "turing"))));
    EXPECT_EQ(answer.response.statusCode, 200);
    return plistOf(answer)["signingKey"];
  };
  const PlistValue derived = derivedKey();
  ASSERT_TRUE(derived.isData());
  EXPECT_GE(derived.data()->size(), 16u);
  EXPECT_NE(*derived.data(), kAccountKey);
  startStore();
  EXPECT_EQ(derivedKey(), derived);
}

TEST_F(StoreServerTest, SignedPurchaseAnswersTheDownloadSignedWithTheAccountKey) {
  startStore();
  auto result = buy(purchaseOf(kAppID));
  ASSERT_EQ(result.response.statusCode, 200) << failureTypeOf(result);
  ASSERT_TRUE(VendRequestSigner(kAccountKey).verifiedBody(result.response, result.body));
  // The signature covers status and body: another key does not verify it.
  EXPECT_FALSE(VendRequestSigner(dataOf("another key")).verifiedBody(result.response, result.body));

  const PlistValue answer = plistOf(result);
  ASSERT_EQ(countOf(answer["downloads"]), 1u);
  const PlistValue& download = element(answer["downloads"], 0);
  const PlistValue& metadata = download["metadata"];
  EXPECT_EQ(metadata["itemIdentifier"].uint64Value(), kAppID);
  EXPECT_EQ(text(metadata["bundleIdentifier"]), "com.example.app");
  EXPECT_EQ(text(metadata["bundleVersion"]), "2.0");
  EXPECT_EQ(text(metadata["title"]), "App");
  EXPECT_TRUE(metadata["preflightPackageURL"].isNull());
  const PlistValue& asset = element(download["assets"], 0);
  EXPECT_EQ(asset["type"].int64Value(), 10);
  EXPECT_EQ(text(asset["URL"]), store->baseURL() + "/assets/1001/App.tar");
  EXPECT_EQ(asset["fileSize"].uint64Value(), fs::file_size(appPackage));

  // Failures of a signed request are signed too.
  result = buy(purchaseOf(424242));
  EXPECT_TRUE(VendRequestSigner(kAccountKey).verifiedBody(result.response, result.body));

  // The item can also be named by the buy parameters alone, and an item
  // with a preflight says where to ask.
  result = buy(PlistDictionary{{"buyParams", "productType=C&itemId=1003&price=0"}});
  ASSERT_EQ(result.response.statusCode, 200) << failureTypeOf(result);
  const PlistValue checked = element(plistOf(result)["downloads"], 0)["metadata"];
  EXPECT_EQ(checked["itemIdentifier"].uint64Value(), kPreflightID);
  EXPECT_EQ(text(checked["preflightPackageURL"]), store->baseURL() + "/preflight/1003");

  // An account-less item needs no signature, and its answer carries none.
  const auto free = buy(purchaseOf(kAccountLessID), std::nullopt);
  ASSERT_EQ(free.response.statusCode, 200) << failureTypeOf(free);
  EXPECT_FALSE(free.response.valueForHeaderField(VendRequestSigner::kSignatureHeader));
  EXPECT_EQ(element(plistOf(free)["downloads"], 0)["metadata"]["itemIdentifier"].uint64Value(),
            kAccountLessID);
  EXPECT_EQ(store->requestCount("buy-product"), 4u);
}

// MARK: assets

TEST_F(StoreServerTest, HashesInTheAnswerMatchThePackageBytes) {
  constexpr std::uint64_t kChunk = 3000;
  catalogue.setStoreSettings({}, kChunk);
  startStore();
  const PlistValue asset = appAsset();
  EXPECT_EQ(asset["numberOfBytesToHash"].uint64Value(), kChunk);

  const auto downloaded = get(text(asset["URL"]));
  ASSERT_FALSE(downloaded.error);
  ASSERT_EQ(downloaded.response.statusCode, 200);
  EXPECT_EQ(downloaded.response.mimeType(), "application/x-tar");
  EXPECT_EQ(downloaded.body, fileBytes(appPackage));
  EXPECT_EQ(asset["fileSize"].uint64Value(), downloaded.body.size());
  const auto expected = chunkHashes(downloaded.body, kChunk);
  ASSERT_GT(expected.size(), 10u);  // many chunks, the last one short
  EXPECT_NE(downloaded.body.size() % kChunk, 0u);
  EXPECT_EQ(stringsOf(asset["hashes"]), expected);
}

TEST_F(StoreServerTest, AssetsHonourRanges) {
  startStore();
  const PlistData package = fileBytes(appPackage);
  const std::size_t size = package.size();
  const std::string url = store->baseURL() + "/assets/1001/App.tar";
  struct Case {
    const char* name;
    std::string range;  // "" : none
    std::uint64_t resumeFrom;
    std::size_t first, end;
  };
  for (const Case& c :
       {Case{"resumed", "", 10'000, 10'000, size}, Case{"middle", "bytes=100-199", 0, 100, 200},
        Case{"suffix", "bytes=-50", 0, size - 50, size}}) {
    SCOPED_TRACE(c.name);
    VendURLRequest request(url);
    if (!c.range.empty()) request.setValue(c.range, "Range");
    VendHTTPTransfer::Options options;
    options.resumeFrom = c.resumeFrom;
    const auto result = VendHTTPTransfer::perform(request, options);
    ASSERT_FALSE(result.error);
    EXPECT_EQ(result.response.statusCode, 206);
    EXPECT_EQ(result.response.valueForHeaderField("Content-Range"),
              "bytes " + std::to_string(c.first) + "-" + std::to_string(c.end - 1) + "/" +
                  std::to_string(size));
    EXPECT_EQ(result.body, PlistData(package.begin() + c.first, package.begin() + c.end));
  }
  VendURLRequest beyond(url);
  beyond.setValue("bytes=" + std::to_string(size + 10) + "-", "Range");
  EXPECT_EQ(VendHTTPTransfer::perform(beyond).response.statusCode, 416);
}

TEST_F(StoreServerTest, TruncatedAssetEndsTheTransferWithAnError) {
  startStore({"assets=truncate"});
  const PlistData package = fileBytes(appPackage);
  std::optional<std::string> declaredLength;
  VendHTTPTransfer::Options options;
  options.onResponse = [&](const VendURLResponse& response) {
    declaredLength = response.valueForHeaderField("Content-Length");
  };
  PlistData received;
  options.onData = [&](std::span<const std::uint8_t> bytes) {
    received.insert(received.end(), bytes.begin(), bytes.end());
    return true;
  };
  VendURLRequest request(store->baseURL() + "/assets/1001/App.tar");
  request.setTimeoutInterval(10);
  const auto result = VendHTTPTransfer::perform(request, options);
  EXPECT_TRUE(result.error);
  EXPECT_EQ(declaredLength, std::to_string(package.size()));
  EXPECT_EQ(received.size(), package.size() / 2);
  EXPECT_TRUE(std::equal(received.begin(), received.end(), package.begin()));
}

TEST_F(StoreServerTest, CorruptAssetArrivesWholeButFailsItsDigests) {
  constexpr std::uint64_t kChunk = 3000;
  catalogue.setStoreSettings({}, kChunk);
  startStore({"assets=corrupt"});
  const PlistValue asset = appAsset();
  const auto result = get(text(asset["URL"]));
  ASSERT_FALSE(result.error);
  EXPECT_EQ(result.response.statusCode, 200);
  const PlistData package = fileBytes(appPackage);
  ASSERT_EQ(result.body.size(), package.size());
  EXPECT_NE(result.body, package);

  // Only the middle of the file is damaged; the answer's digests are the
  // true ones, so a client sees exactly the chunks there fail.
  const auto advertised = stringsOf(asset["hashes"]);
  const auto arrived = chunkHashes(result.body, kChunk);
  ASSERT_EQ(advertised.size(), arrived.size());
  std::vector<std::size_t> failing;
  for (std::size_t i = 0; i < arrived.size(); ++i) {
    if (arrived[i] != advertised[i]) failing.push_back(i);
  }
  std::vector<std::size_t> middle;
  for (std::size_t chunk = (package.size() / 2) / kChunk;
       chunk <= (package.size() / 2 + 15) / kChunk; ++chunk) {
    middle.push_back(chunk);
  }
  EXPECT_EQ(failing, middle);
}

// MARK: item lookup and preflight

TEST_F(StoreServerTest, ItemLookupAndPreflightAnswerFromTheCatalogue) {
  startStore();
  auto result =
      get(text(bag()["item-lookup"]) + "?id=1001&caller=com.orvane.larderd&p=lockup&version=1");
  ASSERT_EQ(result.response.statusCode, 200);
  PlistValue results = plistOf(result)["results"];
  ASSERT_TRUE(results.isDictionary());
  ASSERT_EQ(countOf(results), 1u);
  const PlistValue& app = results["1001"];
  EXPECT_EQ(app["id"].uint64Value(), kAppID);
  EXPECT_EQ(text(app["bundleId"]), "com.example.app");
  EXPECT_EQ(text(app["title"]), "App");
  EXPECT_EQ(text(app["version"]), "2.0");
  const PlistValue& offer = element(app["offers"], 0);
  EXPECT_EQ(text(offer["type"]), "redownload");
  EXPECT_EQ(text(offer["buyParams"]), "productType=C&price=0&itemId=1001&vers=2");

  results =
      plistOf(get(store->baseURL() + "/lookup?bundleId=com.example.free&p=lockup"))["results"];
  ASSERT_EQ(countOf(results), 1u);
  // Without action-params in the catalogue the offer still names the item.
  EXPECT_NE(text(element(results["1002"]["offers"], 0)["buyParams"]).find("itemId=1002"),
            std::string::npos);
  results = plistOf(get(store->baseURL() + "/lookup?bundleId=com.example.nothing"))["results"];
  ASSERT_TRUE(results.isDictionary());
  EXPECT_EQ(countOf(results), 0u);

  PlistValue preflight = plistOf(get(store->baseURL() + "/preflight/1003"));
  EXPECT_TRUE(preflight["allowed"].isBoolean());
  EXPECT_FALSE(preflight["allowed"].boolValue());
  EXPECT_EQ(text(preflight["minimumSystemVersion"]), "14.2");
  EXPECT_TRUE(plistOf(get(store->baseURL() + "/preflight/1001"))["allowed"].boolValue());
  EXPECT_EQ(store->requestCount("item-lookup"), 3u);
  EXPECT_EQ(store->requestCount("preflight"), 2u);
}

// MARK: update check

TEST_F(StoreServerTest, OnlyGreaterVersionsAreOfferedInTheOrderOfTheReport) {
  startStore();
  const PlistValue answer = answerTo(localSoftware({
      // Unknown ware id, known bundle identifier: found by the bundle.
      reported(std::to_string(kUnknownID), "com.example.bybundle", "1.0"),
      reported(std::to_string(kSameID), "com.example.same", "3.0"),
      // 2.10 is greater than 2.9 only when runs of digits are numbers.
      reported(std::to_string(kNewerID), "com.example.newer", "2.9"),
      reported(std::to_string(kOlderID), "com.example.older", "1.5"),
      reported(std::to_string(kIncompatibleID), "com.example.incompatible", "4.0"),
      reported(std::to_string(kUnknownID + 1), "com.example.unknown", "0.1"),
      "not an entry",
  }));
  EXPECT_EQ(wareIDsOf(answer["items"]), (std::vector<std::uint64_t>{kByBundleID, kNewerID}));
  EXPECT_EQ(wareIDsOf(answer["incompatible-items"]), (std::vector<std::uint64_t>{kIncompatibleID}));

  const PlistValue& newer = element(answer["items"], 1);
  EXPECT_EQ(text(newer["bundle-id"]), "com.example.newer");
  EXPECT_EQ(text(newer["title"]), "Newer");
  EXPECT_EQ(text(newer["version"]), "2.10");
  EXPECT_EQ(text(newer["installed-version"]), "2.9");
  EXPECT_EQ(text(newer["action-params"]),
            "productType=C&price=0&pricingParameters=STDRDL&itemId=2001");
  EXPECT_EQ(newer["release-date"], PlistValue(PlistDate{1700000000}));  // the builder's date
  EXPECT_EQ(text(element(answer["items"], 0)["action-params"]), "itemId=2005&vers=1.1");
}

TEST_F(StoreServerTest, MissingVersionsAndBundledSoftwareAreOfferedOnce) {
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
  EXPECT_TRUE(element(answer["items"], 0)["installed-version"].isNull());
  EXPECT_EQ(answer["incompatible-items"], PlistValue(PlistArray{}));
}

TEST_F(StoreServerTest, XmlBinaryAndGzipBodiesGiveTheSameAnswer) {
  startStore();
  const PlistDictionary report =
      localSoftware({reported(std::to_string(kNewerID), "com.example.newer", "2.0"),
                     reported(std::to_string(kIncompatibleID), "com.example.incompatible", "1")});
  const PlistValue fromXml = answerTo(report);
  EXPECT_EQ(wareIDsOf(fromXml["items"]), std::vector<std::uint64_t>{kNewerID});
  const auto gzipped = VendCopyGzippedDataForData(dataOf(xml(report)));
  ASSERT_TRUE(gzipped);
  for (const auto& result : {post(kUpdatePath, PropertyListSerialization::writeBinary(report)),
                             post(kUpdatePath, *gzipped, std::nullopt, true)}) {
    EXPECT_EQ(result.response.statusCode, 200);
    EXPECT_EQ(plistOf(result), fromXml);
  }
}

TEST_F(StoreServerTest, ExtraUpdateItemsAreAppendedAsTheyAre) {
  const PlistArray extras{"a string among the items",
                          PlistDictionary{{"ware-id", "not a number"}, {"title", "Broken"}},
                          std::int64_t{42}};
  catalogue.writeStoreSettings({{"extraUpdateItems", extras}});
  startStore();
  const PlistValue answer =
      answerTo(localSoftware({reported(std::to_string(kNewerID), "com.example.newer", "1.0")}));
  PlistArray expected{element(answer["items"], 0)};
  expected.insert(expected.end(), extras.begin(), extras.end());
  EXPECT_EQ(answer["items"], PlistValue(expected));
  EXPECT_EQ(wareIDsOf(answer["items"]).front(), kNewerID);

  // With nothing to offer the extras are the whole list; a store.plist
  // without a bag leaves the bag's defaults alone.
  EXPECT_EQ(answerTo(localSoftware({}))["items"], PlistValue(extras));
  EXPECT_TRUE(bag()["available-software-updates-compress-request"].boolValue());
}

// Extra items that are no array, and an incompatible mark that is no
// boolean: each is left out, with a line on standard error.
TEST_F(StoreServerTest, UpdateSettingsOfTheWrongTypeAreLeftOut) {
  catalogue.writeStoreSettings({{"extraUpdateItems", "not an array"}});
  addItem(2006, "com.example.marked", "Marked", "9.0", {{"incompatible", "yes"}});
  startStore();
  const PlistValue answer =
      answerTo(localSoftware({reported("2006", "com.example.marked", "1.0")}));
  EXPECT_EQ(answer["items"], PlistValue(PlistArray{}));
  EXPECT_TRUE(wareIDsOf(answer["incompatible-items"]).empty());
  EXPECT_NE(store->errorOutput().find("extraUpdateItems"), std::string::npos);
  EXPECT_NE(store->errorOutput().find("incompatible is not a boolean"), std::string::npos);
}

TEST_F(StoreServerTest, TheSoftwareMapsBodyIsUnderstoodPlainAndCompressed) {
  TemporaryPlatform platform;
  ScopedEnvironment environment;
  environment.set("LARDER_ROOT", platform.root());
  environment.set("HOME", platform.home());
  environment.set("XDG_CACHE_HOME", platform.cacheHome());
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
    const auto result = post(kUpdatePath, *body, std::nullopt, compressed);
    ASSERT_EQ(result.response.statusCode, 200) << text(plistOf(result)["customerMessage"]);
    const PlistValue answer = plistOf(result);
    EXPECT_EQ(wareIDsOf(answer["items"]), std::vector<std::uint64_t>{kNewerID});
    EXPECT_EQ(text(element(answer["items"], 0)["installed-version"]), "2.2");
    EXPECT_EQ(wareIDsOf(answer["incompatible-items"]), std::vector<std::uint64_t>{kIncompatibleID});
  }
}

// MARK: account lookup

TEST_F(StoreServerTest, TheLookupNamesTheAccountOfAnOpaqueIDUnsigned) {
  startStore();
  const auto ada = lookUp("?ware-id=2001&account=opaque%20ada%26co");
  EXPECT_EQ(ada.response.statusCode, 200);
  EXPECT_EQ(plistOf(ada), PlistValue(PlistDictionary{{"orvaneID", "ada@example.com"},
                                                     {"accountID", std::int64_t{7001}}}));
  // Not signed: the owner need not be signed in.
  EXPECT_FALSE(ada.response.valueForHeaderField(VendRequestSigner::kSignatureHeader));
  // Without an opaque id of its own an account goes by its id in decimal.
  EXPECT_EQ(text(plistOf(lookUp("?ware-id=2001&account=7002"))["orvaneID"]), "alan@example.com");
}

// MARK: faults

TEST_F(StoreServerTest, ServerErrorNotPlistAndWrongShapeFaultsHitOnlyTheirRoute) {
  startStore({"bag=500", "authenticate=not-plist", "item-lookup=wrong-shape",
              "available-software-updates=500", "orvane-id-lookup=wrong-shape"});
  auto result = get(store->bagURL());
  EXPECT_EQ(result.response.statusCode, 500);
  EXPECT_EQ(failureTypeOf(result), "server-error");

  result = post("/authenticate", dataOf(xml(credentials("ada@example.com", "lovelace"))));
  EXPECT_EQ(result.response.statusCode, 200);
  EXPECT_FALSE(result.body.empty());
  EXPECT_FALSE(PropertyListSerialization::read(result.body));

  result = get(store->baseURL() + "/lookup?id=1001");
  EXPECT_EQ(result.response.statusCode, 200);
  const auto shape = PropertyListSerialization::read(result.body);
  ASSERT_TRUE(shape);
  EXPECT_FALSE(shape->isDictionary());

  result = post(kUpdatePath, dataOf(xml(PlistDictionary{})));
  EXPECT_EQ(result.response.statusCode, 500);
  EXPECT_EQ(failureTypeOf(result), "server-error");
  result = lookUp("?ware-id=1&account=1");
  EXPECT_EQ(result.response.statusCode, 200);
  EXPECT_TRUE(plistOf(result).isArray());

  EXPECT_EQ(get(store->baseURL() + "/preflight/1001").response.statusCode, 200);
  for (const char* route :
       {"bag", "authenticate", "item-lookup", "available-software-updates", "orvane-id-lookup"}) {
    EXPECT_EQ(store->requestCount(route), 1u) << route;
  }
}

TEST_F(StoreServerTest, StalledRouteTimesOutWithoutBlockingOtherRoutesOrShutdown) {
  startStore({"item-lookup=stall"});
  // A stalled request that outlives the test's patience: it must not keep
  // the store from stopping.
  std::atomic<bool> longOneEnded{false};
  std::jthread longOne([&] {
    get(store->baseURL() + "/lookup?id=1001", 60);
    longOneEnded = true;
  });
  ASSERT_TRUE(eventually([&] { return store->requestCount("item-lookup") == 1; }));

  const auto start = Clock::now();
  const auto stalled = get(store->baseURL() + "/lookup?id=1001", 1);
  const auto waited = Clock::now() - start;
  ASSERT_TRUE(stalled.error);
  EXPECT_EQ(stalled.error->domain, VendHTTPTransfer::kErrorDomain);
  EXPECT_GE(waited, std::chrono::milliseconds(900));
  EXPECT_LT(waited, std::chrono::seconds(10));

  const auto bagStart = Clock::now();
  EXPECT_EQ(get(store->bagURL()).response.statusCode, 200);
  EXPECT_LT(Clock::now() - bagStart, std::chrono::seconds(2));
  EXPECT_FALSE(longOneEnded);

  const auto stopStart = Clock::now();
  EXPECT_EQ(store->stop(std::chrono::seconds(10)), 0);
  EXPECT_LT(Clock::now() - stopStart, std::chrono::seconds(5));
  longOne.join();
  EXPECT_TRUE(longOneEnded);
}

TEST_F(StoreServerTest, FaultsThatMakeNoSenseAreRefusedAtStart) {
  const std::string out = catalogue.scratchDirectory() + "/refused-out";
  const std::string err = catalogue.scratchDirectory() + "/refused-err";
  for (const std::string fault : {"assets=explode", "nowhere=500", "bag=truncate", "bag", "=500"}) {
    SCOPED_TRACE(fault);
    ChildProcess refused(
        {LARDER_STORE_PATH, "--catalogue", catalogue.directory(), "--fault", fault}, {}, out, err);
    EXPECT_EQ(refused.wait(), 2);
    EXPECT_EQ(fs::file_size(out), 0u);
    EXPECT_NE(readFile(err).find('"' + fault + '"'), std::string::npos);
  }
  // The harness reports a store that never listens.
  EXPECT_THROW(StoreServerProcess(catalogue.directory(), {"assets=explode"}), std::runtime_error);
}

// MARK: the store process

TEST_F(StoreServerTest, RequestCountsAreExactUnderConcurrency) {
  startStore();
  for (const char* route :
       {"bag", "authenticate", "buy-product", "item-lookup", "assets", "preflight"}) {
    EXPECT_EQ(store->requestCount(route), 0u) << route;
  }
  constexpr int kThreads = 16;
  constexpr int kRequestsEach = 12;
  std::atomic<int> answered{0};
  std::vector<std::thread> threads;
  for (int thread = 0; thread < kThreads; ++thread) {
    threads.emplace_back([&, thread] {
      for (int i = 0; i < kRequestsEach; ++i) {
        const std::string url =
            thread % 2 == 0 ? store->bagURL() : store->baseURL() + "/preflight/1001";
        if (get(url).response.statusCode == 200) ++answered;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(answered, kThreads * kRequestsEach);
  EXPECT_EQ(store->requestCount("bag"), std::uint64_t{kThreads / 2 * kRequestsEach});
  EXPECT_EQ(store->requestCount("preflight"), std::uint64_t{kThreads / 2 * kRequestsEach});
  EXPECT_EQ(store->requestCount("assets"), 0u);
}

TEST_F(StoreServerTest, MalformedCatalogueEntriesAreSkippedWithALine) {
  const std::string good = catalogue.scratchDirectory() + "/good.tar";
  StoreCatalogueBuilder::pack(catalogue.makeBundle("Spare", "com.example.spare", "1", 9, 100),
                              good);
  const PlistDictionary valid{{"bundle-id", "com.example.spare"},
                              {"title", "Spare"},
                              {"version", "1"},
                              {"package", "Spare.tar"}};
  const auto itemWith = [&](const std::string& folder, const std::string& key,
                            const PlistValue& value) {
    fs::create_directories(catalogue.directory() + "/items/" + folder);
    fs::copy_file(good, catalogue.directory() + "/items/" + folder + "/Spare.tar");
    PlistDictionary entry = valid;
    if (!key.empty()) entry[key] = value;
    catalogue.writeFile("items/" + folder + "/item.plist", xml(entry));
  };
  itemWith("3001", "", {});  // the ware id comes from the folder
  itemWith("3002", "ware-id", 3003);
  itemWith("3004", "package", "Missing.tar");
  itemWith("3005", "package", "../3001/Spare.tar");
  itemWith("3006", "preflight", "yes");
  itemWith("3007", "title", 42);
  itemWith("not-a-number", "", {});
  fs::create_directories(catalogue.directory() + "/items/3008");
  catalogue.writeFile("items/3008/item.plist", xml(PlistArray{valid}));
  fs::create_directories(catalogue.directory() + "/items/3009");
  catalogue.writeFile("items/3009/item.plist", "<plist><dict><key>title</key>");
  fs::create_directories(catalogue.directory() + "/items/3010");  // no item.plist at all
  const auto account = [](std::int64_t id, const char* name) {
    return PlistDictionary{{"accountID", id}, {"orvaneID", name}, {"password", "pw"}};
  };
  auto badKey = account(3, "badkey@example.com");
  badKey["signingKey"] = "text";
  auto takenOpaque = account(4, "taken@example.com");  // the first account's default opaque id
  takenOpaque["opaqueID"] = "1";
  auto emptyOpaque = account(5, "empty@example.com");
  emptyOpaque["opaqueID"] = "";
  catalogue.writeFile(
      "accounts.plist",
      xml(PlistArray{account(1, "ok@example.com"), "not an account",
                     PlistDictionary{{"accountID", 2}, {"orvaneID", "nopw@x.com"}},
                     account(1, "twin@example.com"), badKey, takenOpaque, emptyOpaque}));
  catalogue.writeFile("store.plist", xml(PlistDictionary{{"chunkSize", "big"}, {"bag", 5}}));

  startStore();
  const auto found = [&](std::uint64_t id) {
    return countOf(plistOf(get(store->baseURL() + "/lookup?id=" + std::to_string(id)))["results"]);
  };
  EXPECT_EQ(found(kAppID), 1u);  // the builder's items are there
  EXPECT_EQ(found(3001), 1u);
  for (std::uint64_t skipped : {3002, 3003, 3004, 3005, 3006, 3007, 3008, 3009, 3010}) {
    EXPECT_EQ(found(skipped), 0u) << skipped;
  }
  const std::string errors = store->errorOutput();
  for (const char* folder :
       {"3002", "3004", "3005", "3006", "3007", "3008", "3009", "3010", "not-a-number"}) {
    EXPECT_NE(errors.find("skipping item " + catalogue.directory() + "/items/" + folder),
              std::string::npos)
        << folder << "\n"
        << errors;
  }
  for (const char* line :
       {"skipping account entry 1", "skipping account entry 2", "skipping account entry 3",
        "skipping account entry 4", "skipping account entry 5: its opaqueID is taken",
        "skipping account entry 6: opaqueID is not a non-empty string", "chunkSize"}) {
    EXPECT_NE(errors.find(line), std::string::npos) << line << "\n" << errors;
  }
  // The good account signs in and keeps its opaque id; the default chunk
  // size stands.
  EXPECT_EQ(
      post("/authenticate", dataOf(xml(credentials("ok@example.com", "pw")))).response.statusCode,
      200);
  EXPECT_EQ(text(plistOf(lookUp("?ware-id=1&account=1"))["orvaneID"]), "ok@example.com");
  EXPECT_EQ(lookUp("?ware-id=1&account=5").response.statusCode, 404);
  const auto free = buy(purchaseOf(kAccountLessID), std::nullopt);
  EXPECT_EQ(element(element(plistOf(free)["downloads"], 0)["assets"], 0)["numberOfBytesToHash"]
                .uint64Value(),
            10u << 20u);
  EXPECT_EQ(store->stop(), 0);
}

// SIGTERM is how the harness stops a store; the tests that stop one check
// its status 0.
TEST_F(StoreServerTest, StopsCleanlyOnSigint) {
  const std::string out = catalogue.scratchDirectory() + "/out";
  ChildProcess process({LARDER_STORE_PATH, "--catalogue", catalogue.directory()}, {}, out,
                       catalogue.scratchDirectory() + "/err");
  ASSERT_TRUE(eventually([&] { return !readFile(out).empty(); }));
  EXPECT_EQ(process.stop(SIGINT), 0);
}

TEST_F(StoreServerTest, ExitWithParentStopsTheStoreWhenItsStarterEnds) {
  const std::string output = catalogue.scratchDirectory() + "/orphan-out";
  // The shell starts the store, lingers until it listens, and ends.
  ChildProcess starter(
      {"/bin/sh", "-c",
       std::string(LARDER_STORE_PATH) + " --catalogue '" + catalogue.directory() +
           "' --exit-with-parent > '" + output + "' & while ! grep -q listening '" + output +
           "' 2>/dev/null; do sleep 0.05; done"},
      {}, "/dev/null", catalogue.scratchDirectory() + "/orphan-err");
  EXPECT_EQ(starter.wait(), 0);
  std::string line;
  std::getline(std::ifstream(output) >> std::ws, line);
  const std::string prefix = "larder-store listening on ";
  ASSERT_TRUE(line.starts_with(prefix)) << line;
  const std::string bag = line.substr(prefix.size()) + "/bag.plist";
  EXPECT_TRUE(eventually([&] { return get(bag, 1).error.has_value(); }))
      << "the store outlived the process that started it";
}

// The entries of the archive at `path`, or of the tree at `root` with the
// archive's names: name -> (mode, contents or link target).
using Entries = std::map<std::string, std::pair<mode_t, std::string>>;
Entries archiveEntries(const std::string& path) {
  Entries entries;
  std::unique_ptr<archive, decltype(&archive_read_free)> reader(archive_read_new(),
                                                                archive_read_free);
  archive_read_support_format_tar(reader.get());
  if (archive_read_open_filename(reader.get(), path.c_str(), 1 << 16) != ARCHIVE_OK) return entries;
  archive_entry* entry = nullptr;
  while (archive_read_next_header(reader.get(), &entry) == ARCHIVE_OK) {
    std::string contents;
    if (const char* target = archive_entry_symlink(entry)) {
      contents = target;
    } else {
      std::array<char, 8192> block{};
      for (la_ssize_t got;
           (got = archive_read_data(reader.get(), block.data(), block.size())) > 0;) {
        contents.append(block.data(), static_cast<std::size_t>(got));
      }
    }
    entries[archive_entry_pathname(entry)] = {archive_entry_mode(entry), contents};
  }
  return entries;
}
Entries treeEntries(const std::string& root, const std::string& topName) {
  Entries entries;
  const auto add = [&](const fs::path& path, std::string name) {
    struct stat status {};
    lstat(path.c_str(), &status);
    std::string contents;
    if (S_ISLNK(status.st_mode)) contents = fs::read_symlink(path).string();
    if (S_ISREG(status.st_mode)) contents = readFile(path.string());
    if (S_ISDIR(status.st_mode)) name += "/";
    entries[name] = {status.st_mode, contents};
  };
  add(root, topName);
  for (const auto& entry : fs::recursive_directory_iterator(root)) {
    add(entry.path(), topName + "/" + entry.path().lexically_relative(root).string());
  }
  return entries;
}

TEST_F(StoreServerTest, PackOutputExtractsToTheSameTree) {
  const std::string bundle =
      catalogue.makeBundle("Packed", "com.example.packed", "3.1", 55, 300'000);
  fs::create_directories(bundle + "/resources/deep/deeper");
  EXPECT_TRUE(FileIO::writeAtomically(bundle + "/resources/deep/deeper/notes.txt", "some notes\n"));
  EXPECT_TRUE(FileIO::writeAtomically(bundle + "/resources/empty", ""));
  fs::permissions(bundle + "/resources/deep/deeper/notes.txt", fs::perms::owner_read);
  fs::create_symlink("../bin/Packed", bundle + "/resources/launcher");
  fs::create_symlink("/nonexistent/target", bundle + "/resources/dangling");
  const std::string longName(120, 'n');
  EXPECT_TRUE(FileIO::writeAtomically(bundle + "/resources/deep/" + longName, "long name"));

  const std::string package = catalogue.scratchDirectory() + "/Packed.tar";
  StoreCatalogueBuilder::pack(bundle + "/", package);
  const auto archived = archiveEntries(package);
  EXPECT_EQ(archived, treeEntries(bundle, "Packed.app"));
  EXPECT_EQ(archived.at("Packed.app/bin/Packed").first & 07777, 0755u);
  EXPECT_TRUE(S_ISLNK(archived.at("Packed.app/resources/launcher").first));
  EXPECT_EQ(archived.at("Packed.app/resources/launcher").second, "../bin/Packed");
  // Every entry lies inside the one top-level folder.
  for (const auto& [name, entry] : archived) EXPECT_TRUE(name.starts_with("Packed.app/")) << name;

  // Packing something that is not a folder fails and leaves nothing behind.
  const std::string nothing = catalogue.scratchDirectory() + "/nothing.tar";
  EXPECT_THROW(StoreCatalogueBuilder::pack(bundle + "/bundle.plist", nothing), std::runtime_error);
  EXPECT_FALSE(fs::exists(nothing));
}

}  // namespace
}  // namespace larder::testing
