// larder-store as a client of the store sees it: a real server process on
// 127.0.0.1, spoken to over HTTP with the runtime's own transport.
#include <archive.h>
#include <archive_entry.h>
#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <sys/stat.h>

#include <array>
#include <atomic>
#include <filesystem>
#include <fstream>
#include <map>
#include <thread>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/http/VendHTTPTransfer.h"
#include "store-runtime/http/VendRequestSigner.h"
#include "tests/integration/StoreCatalogueBuilder.h"
#include "tests/integration/StoreServerProcess.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

constexpr std::uint64_t kAccountID = 7001;
constexpr std::uint64_t kOtherAccountID = 7002;
constexpr std::uint64_t kAppID = 1001;
constexpr std::uint64_t kAccountLessID = 1002;
constexpr std::uint64_t kPreflightID = 1003;
const PlistData kAccountKey{'k', 'e', 'y', '-', 'o', 'f', '-', 'a', 'd', 'a'};

PlistData fileBytes(const std::string& path) {
  return FileIO::read(path, 1u << 30u).value_or(PlistData{});
}

std::string sha256Hex(std::span<const std::uint8_t> bytes) {
  std::array<unsigned char, EVP_MAX_MD_SIZE> digest{};
  unsigned int length = 0;
  EVP_Digest(bytes.data(), bytes.size(), digest.data(), &length, EVP_sha256(), nullptr);
  std::string hex;
  for (unsigned int i = 0; i < length; ++i) {
    static constexpr char kDigits[] = "0123456789abcdef";
    hex.push_back(kDigits[digest[i] >> 4U]);
    hex.push_back(kDigits[digest[i] & 0xFU]);
  }
  return hex;
}

std::vector<std::string> chunkHashes(const PlistData& bytes, std::size_t chunkSize) {
  std::vector<std::string> hashes;
  for (std::size_t offset = 0; offset < bytes.size(); offset += chunkSize) {
    const std::size_t length = std::min(chunkSize, bytes.size() - offset);
    hashes.push_back(sha256Hex({bytes.data() + offset, length}));
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

PlistData bytesIn(const PlistValue& value) {
  return value.data() ? *value.data() : PlistData{};
}

std::vector<std::string> stringsOf(const PlistValue& array) {
  std::vector<std::string> strings;
  if (const PlistArray* elements = array.array()) {
    for (const PlistValue& entry : *elements) strings.push_back(text(entry));
  }
  return strings;
}

class StoreServerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    catalogue.addAccount({kAccountID, "ada@example.com", "lovelace", "143441", kAccountKey});
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
  }

  std::unique_ptr<StoreServerProcess> startStore(const std::vector<std::string>& faults = {}) {
    return std::make_unique<StoreServerProcess>(catalogue.directory(), faults);
  }

  PlistValue bagOf(const StoreServerProcess& store) {
    const auto result = get(store.bagURL());
    EXPECT_FALSE(result.error) << result.error->description;
    return plistOf(result);
  }

  VendHTTPTransfer::Result buy(const StoreServerProcess& store, const PlistValue& body,
                               std::optional<PlistData> key = kAccountKey,
                               std::uint64_t accountID = kAccountID) {
    VendURLRequest request = postRequest(text(bagOf(store)["buy-product"]), body);
    if (key) VendRequestSigner(*key).sign(request, accountID);
    return VendHTTPTransfer::perform(request);
  }

  static PlistDictionary purchaseOf(std::uint64_t wareID) {
    return {{"buyParams", "productType=C&itemId=" + std::to_string(wareID)},
            {"itemIdentifier", wareID},
            {"isRedownload", false}};
  }

  StoreCatalogueBuilder catalogue;
  std::string appPackage;
};

TEST_F(StoreServerTest, BagURLsAreAbsoluteOnTheHostAndPortTheClientUsed) {
  catalogue.setStoreSettings({{"available-software-updates-extended", "/updates"},
                              {"available-software-updates-compress-request", true},
                              {"item-lookup", "http://elsewhere.example/lookup"}});
  auto store = startStore();
  const PlistValue bag = bagOf(*store);
  ASSERT_TRUE(bag.isDictionary());
  EXPECT_EQ(text(bag["authenticate"]), store->baseURL() + "/authenticate");
  EXPECT_EQ(text(bag["buy-product"]), store->baseURL() + "/buy-product");
  // Extra entries are merged in, win over the store's own, and a path
  // becomes a URL on this store.
  EXPECT_EQ(text(bag["item-lookup"]), "http://elsewhere.example/lookup");
  EXPECT_EQ(text(bag["available-software-updates-extended"]), store->baseURL() + "/updates");
  EXPECT_TRUE(bag["available-software-updates-compress-request"].boolValue());
  ASSERT_TRUE(bag["ovp-licensing-invitation-url-pattern"].isString());

  // Asked under another name for the same address, the URLs follow the name.
  const std::string byName = "http://localhost:" + std::to_string(store->port());
  const PlistValue bagByName = plistOf(get(byName + "/bag.plist?type=3"));
  EXPECT_EQ(text(bagByName["authenticate"]), byName + "/authenticate");
  EXPECT_EQ(store->requestCount("bag"), 2u);
}

TEST_F(StoreServerTest, AuthenticateGivesTheAccountAndItsKeyOrRefuses) {
  PlistData derivedKey;
  {
    auto store = startStore();
    const std::string url = text(bagOf(*store)["authenticate"]);
    auto result = VendHTTPTransfer::perform(postRequest(
        url, PlistDictionary{{"accountName", "ada@example.com"}, {"password", "lovelace"}}));
    ASSERT_EQ(result.response.statusCode, 200);
    EXPECT_EQ(result.response.mimeType(), "application/x-plist");
    PlistValue account = plistOf(result);
    EXPECT_EQ(account["accountID"].uint64Value(), kAccountID);
    EXPECT_EQ(text(account["orvaneID"]), "ada@example.com");
    EXPECT_EQ(text(account["storeFrontID"]), "143441");
    EXPECT_EQ(bytesIn(account["signingKey"]), kAccountKey);

    result = VendHTTPTransfer::perform(postRequest(
        url, PlistDictionary{{"accountName", "alan@example.com"}, {"password", "turing"}}));
    ASSERT_EQ(result.response.statusCode, 200);
    ASSERT_TRUE(plistOf(result)["signingKey"].isData());
    derivedKey = bytesIn(plistOf(result)["signingKey"]);
    EXPECT_GE(derivedKey.size(), 16u);
    EXPECT_NE(derivedKey, kAccountKey);

    for (const auto& [name, password] :
         {std::pair{"ada@example.com", "babbage"}, std::pair{"nobody@example.com", "lovelace"},
          std::pair{"", ""}}) {
      result = VendHTTPTransfer::perform(
          postRequest(url, PlistDictionary{{"accountName", name}, {"password", password}}));
      EXPECT_EQ(result.response.statusCode, 401) << name;
      EXPECT_EQ(failureTypeOf(result), "invalid-credentials") << name;
      EXPECT_TRUE(plistOf(result)["customerMessage"].isString());
    }
    result = VendHTTPTransfer::perform(postRequest(url, PlistArray{"ada@example.com", "lovelace"}));
    EXPECT_EQ(result.response.statusCode, 400);
    EXPECT_EQ(store->requestCount("authenticate"), 6u);
  }
  // A derived key survives a restart of the store.
  auto store = startStore();
  const auto result = VendHTTPTransfer::perform(
      postRequest(store->baseURL() + "/authenticate",
                  PlistDictionary{{"accountName", "alan@example.com"}, {"password", "turing"}}));
  ASSERT_EQ(result.response.statusCode, 200);
  EXPECT_EQ(bytesIn(plistOf(result)["signingKey"]), derivedKey);
}

TEST_F(StoreServerTest, SignedPurchaseAnswersTheDownloadSignedWithTheAccountKey) {
  auto store = startStore();
  auto result = buy(*store, purchaseOf(kAppID));
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

  // The item can also be named by the buy parameters alone, and an item
  // with a preflight says where to ask.
  result = buy(*store, PlistDictionary{{"buyParams", "productType=C&itemId=1003&price=0"}});
  ASSERT_EQ(result.response.statusCode, 200) << failureTypeOf(result);
  const PlistValue checked = element(plistOf(result)["downloads"], 0)["metadata"];
  EXPECT_EQ(checked["itemIdentifier"].uint64Value(), kPreflightID);
  EXPECT_EQ(text(checked["preflightPackageURL"]), store->baseURL() + "/preflight/1003");
  EXPECT_EQ(store->requestCount("buy-product"), 2u);
}

TEST_F(StoreServerTest, PurchaseWithoutAGoodSignatureIsRefused) {
  auto store = startStore();
  const auto expectRefused = [](const VendHTTPTransfer::Result& result, const char* what) {
    EXPECT_EQ(result.response.statusCode, 401) << what;
    EXPECT_EQ(failureTypeOf(result), "invalid-signature") << what;
  };
  expectRefused(buy(*store, purchaseOf(kAppID), std::nullopt), "unsigned");
  expectRefused(buy(*store, purchaseOf(kAppID), dataOf("not the key")), "wrong key");
  expectRefused(buy(*store, purchaseOf(kAppID), kAccountKey, 999), "unknown account");
  expectRefused(buy(*store, purchaseOf(kAppID), kAccountKey, kOtherAccountID), "other account");

  // A body changed after signing.
  VendURLRequest request = postRequest(store->baseURL() + "/buy-product", purchaseOf(kAppID));
  VendRequestSigner(kAccountKey).sign(request, kAccountID);
  request.setBody(dataOf(PropertyListSerialization::writeXml(purchaseOf(kAccountLessID))));
  expectRefused(VendHTTPTransfer::perform(request), "altered body");

  // A signed path differs from the one asked.
  request = postRequest(store->baseURL() + "/buy-product?x=1", purchaseOf(kAppID));
  request.setValue(std::to_string(kAccountID), VendRequestSigner::kAccountHeader);
  request.setValue(
      VendRequestSigner(kAccountKey).requestSignature("POST", "/buy-product", request.body()),
      VendRequestSigner::kSignatureHeader);
  expectRefused(VendHTTPTransfer::perform(request), "other path");

  // An account-less item needs no signature, and its answer carries none.
  const auto free = buy(*store, purchaseOf(kAccountLessID), std::nullopt);
  ASSERT_EQ(free.response.statusCode, 200) << failureTypeOf(free);
  EXPECT_FALSE(free.response.valueForHeaderField(VendRequestSigner::kSignatureHeader));
  EXPECT_EQ(element(plistOf(free)["downloads"], 0)["metadata"]["itemIdentifier"].uint64Value(),
            kAccountLessID);
  // ...but a bad signature is refused even there.
  expectRefused(buy(*store, purchaseOf(kAccountLessID), dataOf("bad")), "account-less, bad key");
}

TEST_F(StoreServerTest, PurchaseOfUnknownItemIs404AndMalformedBodyIs400) {
  auto store = startStore();
  auto result = buy(*store, purchaseOf(424242));
  EXPECT_EQ(result.response.statusCode, 404);
  EXPECT_EQ(failureTypeOf(result), "unknown-item");
  // Failures of a signed request are signed too.
  EXPECT_TRUE(VendRequestSigner(kAccountKey).verifiedBody(result.response, result.body));

  const std::string url = store->baseURL() + "/buy-product";
  const std::vector<std::pair<std::string, std::string>> bodies{
      {"not a property list", "this is <not> a plist"},
      {"empty", ""},
      {"array", PropertyListSerialization::writeXml(PlistArray{purchaseOf(kAppID)})},
      {"no item", PropertyListSerialization::writeXml(PlistDictionary{{"buyParams", "price=0"}})},
      {"item zero", PropertyListSerialization::writeXml(PlistDictionary{{"itemIdentifier", 0}})},
  };
  for (const auto& [what, body] : bodies) {
    VendURLRequest request(url);
    request.setMethod("POST");
    request.setBody(dataOf(body));
    VendRequestSigner(kAccountKey).sign(request, kAccountID);
    result = VendHTTPTransfer::perform(request);
    EXPECT_EQ(result.response.statusCode, 400) << what;
    EXPECT_EQ(failureTypeOf(result), "invalid-request") << what;
  }
}

TEST_F(StoreServerTest, HashesInTheAnswerMatchThePackageBytes) {
  constexpr std::uint64_t kChunk = 3000;
  catalogue.setStoreSettings({}, kChunk);
  auto store = startStore();
  const auto answer = plistOf(buy(*store, purchaseOf(kAppID)));
  const PlistValue& asset = element(element(answer["downloads"], 0)["assets"], 0);
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
  auto store = startStore();
  const PlistData package = fileBytes(appPackage);
  const std::string url = store->baseURL() + "/assets/1001/App.tar";

  VendHTTPTransfer::Options resume;
  resume.resumeFrom = 10'000;
  auto result = VendHTTPTransfer::perform(VendURLRequest(url), resume);
  ASSERT_FALSE(result.error);
  EXPECT_EQ(result.response.statusCode, 206);
  EXPECT_EQ(
      result.response.valueForHeaderField("Content-Range"),
      "bytes 10000-" + std::to_string(package.size() - 1) + "/" + std::to_string(package.size()));
  EXPECT_EQ(result.body, PlistData(package.begin() + 10'000, package.end()));

  VendURLRequest middle(url);
  middle.setValue("bytes=100-199", "Range");
  result = VendHTTPTransfer::perform(middle);
  EXPECT_EQ(result.response.statusCode, 206);
  EXPECT_EQ(result.body, PlistData(package.begin() + 100, package.begin() + 200));

  VendURLRequest suffix(url);
  suffix.setValue("bytes=-50", "Range");
  result = VendHTTPTransfer::perform(suffix);
  EXPECT_EQ(result.response.statusCode, 206);
  EXPECT_EQ(result.body, PlistData(package.end() - 50, package.end()));

  VendURLRequest beyond(url);
  beyond.setValue("bytes=" + std::to_string(package.size() + 10) + "-", "Range");
  result = VendHTTPTransfer::perform(beyond);
  EXPECT_EQ(result.response.statusCode, 416);

  EXPECT_EQ(get(store->baseURL() + "/assets/1001/Other.tar").response.statusCode, 404);
  EXPECT_EQ(get(store->baseURL() + "/assets/5/App.tar").response.statusCode, 404);
  EXPECT_EQ(store->requestCount("assets"), 6u);
}

TEST_F(StoreServerTest, ItemLookupAndPreflightAnswerFromTheCatalogue) {
  auto store = startStore();
  auto result = get(text(bagOf(*store)["item-lookup"]) +
                    "?id=1001&caller=com.orvane.larderd&p=lockup&version=1");
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
  EXPECT_EQ(get(store->baseURL() + "/lookup?p=lockup").response.statusCode, 400);

  PlistValue preflight = plistOf(get(store->baseURL() + "/preflight/1003"));
  EXPECT_FALSE(preflight["allowed"].boolValue());
  EXPECT_TRUE(preflight["allowed"].isBoolean());
  EXPECT_EQ(text(preflight["minimumSystemVersion"]), "14.2");
  preflight = plistOf(get(store->baseURL() + "/preflight/1001"));
  EXPECT_TRUE(preflight["allowed"].boolValue());
  EXPECT_EQ(get(store->baseURL() + "/preflight/77").response.statusCode, 404);
  EXPECT_EQ(store->requestCount("item-lookup"), 4u);
  EXPECT_EQ(store->requestCount("preflight"), 3u);
}

TEST_F(StoreServerTest, ServerErrorNotPlistAndWrongShapeFaults) {
  auto store = startStore({"bag=500", "authenticate=not-plist", "item-lookup=wrong-shape",
                           "available-software-updates=500", "orvane-id-lookup=wrong-shape"});
  auto result = get(store->bagURL());
  EXPECT_EQ(result.response.statusCode, 500);
  EXPECT_EQ(failureTypeOf(result), "server-error");

  result = VendHTTPTransfer::perform(
      postRequest(store->baseURL() + "/authenticate",
                  PlistDictionary{{"accountName", "ada@example.com"}, {"password", "lovelace"}}));
  EXPECT_EQ(result.response.statusCode, 200);
  EXPECT_FALSE(result.body.empty());
  EXPECT_FALSE(PropertyListSerialization::read(result.body));

  result = get(store->baseURL() + "/lookup?id=1001");
  EXPECT_EQ(result.response.statusCode, 200);
  const auto shape = PropertyListSerialization::read(result.body);
  ASSERT_TRUE(shape);
  EXPECT_FALSE(shape->isDictionary());

  result = VendHTTPTransfer::perform(
      postRequest(store->baseURL() + "/available-software-updates", PlistDictionary{}));
  EXPECT_EQ(result.response.statusCode, 500);
  EXPECT_EQ(failureTypeOf(result), "server-error");
  result = get(store->baseURL() + "/orvane-id-lookup?ware-id=1&account=1");
  EXPECT_EQ(result.response.statusCode, 200);
  EXPECT_TRUE(plistOf(result).isArray());

  // Routes without a fault are untouched.
  EXPECT_EQ(get(store->baseURL() + "/preflight/1001").response.statusCode, 200);
  for (const char* route :
       {"bag", "authenticate", "item-lookup", "available-software-updates", "orvane-id-lookup"}) {
    EXPECT_EQ(store->requestCount(route), 1u) << route;
  }
}

TEST_F(StoreServerTest, StalledRouteTimesOutWithoutBlockingOtherRoutesOrShutdown) {
  auto store = startStore({"item-lookup=stall"});
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

TEST_F(StoreServerTest, TruncatedAssetEndsTheTransferWithAnError) {
  auto store = startStore({"assets=truncate"});
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
  auto store = startStore({"assets=corrupt"});
  const auto answer = plistOf(buy(*store, purchaseOf(kAppID)));
  const PlistValue& asset = element(element(answer["downloads"], 0)["assets"], 0);
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

TEST_F(StoreServerTest, FaultsThatMakeNoSenseAreRefusedAtStart) {
  const std::string out = catalogue.scratchDirectory() + "/refused-out";
  const std::string err = catalogue.scratchDirectory() + "/refused-err";
  for (const char* fault : {"assets=explode", "nowhere=500", "bag=truncate", "bag", "=500"}) {
    ChildProcess store({LARDER_STORE_PATH, "--catalogue", catalogue.directory(), "--fault", fault},
                       {}, out, err);
    EXPECT_EQ(store.wait(), 2) << fault;
    EXPECT_EQ(fs::file_size(out), 0u) << fault;
    const PlistData message = fileBytes(err);
    EXPECT_NE(std::string(message.begin(), message.end()).find('"' + std::string(fault) + '"'),
              std::string::npos)
        << fault;
  }
  // The harness reports a store that never listens.
  EXPECT_THROW(StoreServerProcess(catalogue.directory(), {"assets=explode"}), std::runtime_error);
}

TEST_F(StoreServerTest, RequestCountsAreExactUnderConcurrency) {
  auto store = startStore();
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

TEST_F(StoreServerTest, MalformedCatalogueEntriesAreSkipped) {
  const std::string good = catalogue.scratchDirectory() + "/good.tar";
  StoreCatalogueBuilder::pack(catalogue.makeBundle("Spare", "com.example.spare", "1", 9, 100),
                              good);
  const auto itemWith = [&](const std::string& folder, const PlistValue& entry) {
    fs::create_directories(catalogue.directory() + "/items/" + folder);
    fs::copy_file(good, catalogue.directory() + "/items/" + folder + "/Spare.tar");
    catalogue.writeFile("items/" + folder + "/item.plist",
                        PropertyListSerialization::writeXml(entry));
  };
  const PlistDictionary valid{{"bundle-id", "com.example.spare"},
                              {"title", "Spare"},
                              {"version", "1"},
                              {"package", "Spare.tar"}};
  const auto with = [&](const std::string& key, const PlistValue& value) {
    PlistDictionary entry = valid;
    entry[key] = value;
    return entry;
  };
  itemWith("2001", valid);  // the ware id comes from the folder
  itemWith("2002", with("ware-id", 2003));
  itemWith("2004", with("package", "Missing.tar"));
  itemWith("2005", with("package", "../2001/Spare.tar"));
  itemWith("2006", with("preflight", "yes"));
  itemWith("2007", with("title", 42));
  itemWith("2008", PlistArray{valid});
  itemWith("not-a-number", valid);
  fs::create_directories(catalogue.directory() + "/items/2009");
  catalogue.writeFile("items/2009/item.plist", "<plist><dict><key>title</key>");
  fs::create_directories(catalogue.directory() + "/items/2010");  // no item.plist at all
  catalogue.writeFile(
      "accounts.plist",
      PropertyListSerialization::writeXml(PlistArray{
          PlistDictionary{{"accountID", 1}, {"orvaneID", "ok@example.com"}, {"password", "pw"}},
          "not an account",
          PlistDictionary{{"accountID", 2}, {"orvaneID", "nopassword@example.com"}},
          PlistDictionary{{"accountID", 1}, {"orvaneID", "twin@example.com"}, {"password", "pw"}},
          PlistDictionary{{"accountID", 3},
                          {"orvaneID", "badkey@example.com"},
                          {"password", "pw"},
                          {"signingKey", "text"}},
      }));
  catalogue.writeFile("store.plist", PropertyListSerialization::writeXml(
                                         PlistDictionary{{"chunkSize", "big"}, {"bag", 5}}));

  auto store = startStore();
  const auto lookup = [&](std::uint64_t id) {
    return plistOf(get(store->baseURL() + "/lookup?id=" + std::to_string(id)))["results"];
  };
  EXPECT_EQ(countOf(lookup(kAppID)), 1u);  // the builder's items are there
  EXPECT_EQ(countOf(lookup(2001)), 1u);
  for (std::uint64_t skipped : {2002, 2003, 2004, 2005, 2006, 2007, 2008, 2009, 2010}) {
    EXPECT_TRUE(lookup(skipped).isDictionary()) << skipped;
    EXPECT_EQ(countOf(lookup(skipped)), 0u) << skipped;
  }
  const std::string errors = store->errorOutput();
  for (const char* folder :
       {"2002", "2004", "2005", "2006", "2007", "2008", "2009", "2010", "not-a-number"}) {
    EXPECT_NE(errors.find("skipping item " + catalogue.directory() + "/items/" + folder),
              std::string::npos)
        << folder << "\n"
        << errors;
  }
  for (const char* line : {"skipping account entry 1", "skipping account entry 2",
                           "skipping account entry 3", "skipping account entry 4", "chunkSize"}) {
    EXPECT_NE(errors.find(line), std::string::npos) << line << "\n" << errors;
  }

  // The good account signs in; the default chunk size stands.
  const auto signIn = VendHTTPTransfer::perform(
      postRequest(store->baseURL() + "/authenticate",
                  PlistDictionary{{"accountName", "ok@example.com"}, {"password", "pw"}}));
  EXPECT_EQ(signIn.response.statusCode, 200);
  const auto free = buy(*store, purchaseOf(kAccountLessID), std::nullopt);
  EXPECT_EQ(element(element(plistOf(free)["downloads"], 0)["assets"], 0)["numberOfBytesToHash"]
                .uint64Value(),
            10u << 20u);
  EXPECT_EQ(store->stop(), 0);
}

// SIGTERM is how the harness stops a store; the tests that stop one check
// its status 0.
TEST_F(StoreServerTest, StopsCleanlyOnSigint) {
  ChildProcess process({LARDER_STORE_PATH, "--catalogue", catalogue.directory()}, {},
                       catalogue.scratchDirectory() + "/out",
                       catalogue.scratchDirectory() + "/err");
  ASSERT_TRUE(eventually([&] {
    return fs::exists(catalogue.scratchDirectory() + "/out") &&
           fs::file_size(catalogue.scratchDirectory() + "/out") > 0;
  }));
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

// The archive's entries: name -> (mode, contents or link target).
std::map<std::string, std::pair<mode_t, std::string>> archiveEntries(const std::string& path) {
  std::map<std::string, std::pair<mode_t, std::string>> entries;
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

std::map<std::string, std::pair<mode_t, std::string>> treeEntries(const std::string& root,
                                                                  const std::string& topName) {
  std::map<std::string, std::pair<mode_t, std::string>> entries;
  const auto add = [&](const fs::path& path, std::string name) {
    struct stat status {};
    lstat(path.c_str(), &status);
    std::string contents;
    if (S_ISLNK(status.st_mode)) contents = fs::read_symlink(path).string();
    if (S_ISREG(status.st_mode)) {
      const PlistData bytes = fileBytes(path.string());
      contents.assign(bytes.begin(), bytes.end());
    }
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
  const auto tree = treeEntries(bundle, "Packed.app");
  EXPECT_EQ(archived.size(), tree.size());
  EXPECT_EQ(archived, tree);
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
