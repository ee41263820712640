// Which account owns an installed application: the runtime's lookup
// operation and the software map's question, against larder-store on
// 127.0.0.1 and against no store at all.
#include <gtest/gtest.h>

#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/services/VendOrvaneIDLookupOperation.h"
#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "tests/integration/ServiceHarness.h"
#include "tests/integration/StoreCatalogueBuilder.h"
#include "tests/integration/StoreServerProcess.h"

namespace larder::testing {
namespace {

using namespace std::chrono_literals;

constexpr std::uint64_t kAccountID = 7001;
constexpr char kAccountName[] = "reader@example.org";
// How the purchase records of these tests name the account.
constexpr char kRecordAccount[] = "account-1";
constexpr std::uint64_t kItemID = 3001;

VendPurchaseRecord recordOf(std::optional<std::string> account, PlistValue wareID = kItemID) {
  VendPurchaseRecord record;
  record.bundleIdentifier = "com.example.owned";
  record.wareID = std::move(wareID);
  record.opaqueAccountIDString = std::move(account);
  return record;
}

// Every line the log writes while the capture lives, at every level.
class LogLines {
 public:
  LogLines() : savedLevel_(TillLogManager::sharedManager().level()) {
    TillLogManager::sharedManager().setLevel(3);
    sink_ = TillLogManager::sharedManager().addSink([this](int level, const std::string& line) {
      std::lock_guard lock(mutex_);
      lines_.emplace_back(level, line);
    });
  }
  ~LogLines() {
    sink_.reset();
    TillLogManager::sharedManager().setLevel(savedLevel_);
  }
  LogLines(const LogLines&) = delete;
  LogLines& operator=(const LogLines&) = delete;

  // The lines at `level` that begin with `prefix`.
  [[nodiscard]] std::vector<std::string> startingWith(std::string_view prefix, int level) const {
    std::lock_guard lock(mutex_);
    std::vector<std::string> found;
    for (const auto& [lineLevel, line] : lines_) {
      if (lineLevel == level && line.starts_with(prefix)) found.push_back(line);
    }
    return found;
  }

 private:
  int savedLevel_;
  std::shared_ptr<void> sink_;
  mutable std::mutex mutex_;
  std::vector<std::pair<int, std::string>> lines_;
};

// A loopback port on which nothing listens: bound, then closed.
int closedPort() {
  const int socket = ::socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  ::bind(socket, reinterpret_cast<sockaddr*>(&address), length);
  ::getsockname(socket, reinterpret_cast<sockaddr*>(&address), &length);
  ::close(socket);
  return ntohs(address.sin_port);
}

class OrvaneIDLookupTest : public ::testing::Test {
 protected:
  void SetUp() override {
    catalogue_.addAccount({.accountID = kAccountID,
                           .orvaneID = kAccountName,
                           .password = "secret",
                           .opaqueID = kRecordAccount});
    catalogue_.addAccount({.accountID = 7002,
                           .orvaneID = "other@example.org",
                           .password = "other",
                           .opaqueID = "an id/with spaces & more=signs"});
  }

  void TearDown() override { VendRuntime::setShared(nullptr); }

  void startStore(const std::vector<std::string>& faults = {}) {
    store_ = std::make_unique<StoreServerProcess>(catalogue_.directory(), faults);
    useBag(store_->bagURL());
  }

  void useBag(const std::string& bagURL) {
    VendRuntimeConfiguration configuration;
    configuration.bagURL = bagURL;
    configuration.stateDirectory = platform_.stateHome() + "/larder";
    configuration.downloadsDirectory = platform_.cacheHome() + "/downloads";
    configuration.connectTimeout = 2s;
    configuration.requestTimeout = 5;
    VendRuntime::setShared(std::make_shared<VendRuntime>(configuration));
  }

  // Runs the lookup as the map does: as the sub-operation of a plain one.
  struct Outcome {
    bool success = false;
    OptionalError error;
    std::optional<std::string> orvaneID;
  };
  Outcome lookUp(const VendPurchaseRecord& record) {
    auto lookup =
        VendOrvaneIDLookupOperation::orvaneIDLookupOperationForPurchaseRecord(record, client_);
    VendOperation host(client_);
    Outcome outcome;
    outcome.success = host.runSubOperation(*lookup, &outcome.error);
    outcome.orvaneID = lookup->orvaneID();
    return outcome;
  }

  // An installed application whose purchase record names `account`; no
  // record without one.
  LedgerSoftwareProductRef ownedProduct(std::optional<std::string> account = kRecordAccount) {
    const std::string path = platform_.installBundle(
        {platform_.root() + "/Applications", "Owned", "com.example.owned", "1.0"});
    if (account) {
      const PlistDictionary record{{"bundleIdentifier", "com.example.owned"},
                                   {"bundleVersion", "1.0"},
                                   {"wareID", kItemID},
                                   {"installerVersionID", std::int64_t{1}},
                                   {"opaqueAccountIDString", *account}};
      EXPECT_TRUE(FileIO::writeAtomically(path + "/purchase.plist",
                                          PropertyListSerialization::writeXml(record)));
    }
    auto product = SoftwareMap::createSoftwareProductForAppAtPath(path);
    EXPECT_TRUE(product);
    return product;
  }

  StoreCatalogueBuilder catalogue_;
  TemporaryPlatform platform_;
  std::unique_ptr<StoreServerProcess> store_;
  VendStoreClient client_ = VendStoreClient::initWithStoreClientType(0);
};

// MARK: the lookup operation

TEST_F(OrvaneIDLookupTest, TheStoreNamesTheAccountOfTheRecord) {
  startStore();
  const Outcome found = lookUp(recordOf(kRecordAccount));
  EXPECT_TRUE(found.success);
  EXPECT_FALSE(found.error);
  EXPECT_EQ(found.orvaneID, kAccountName);

  // Text that means something in a query arrives as it was; a ware id
  // stored as text goes as it is.
  const Outcome other = lookUp(recordOf("an id/with spaces & more=signs", "3001"));
  EXPECT_TRUE(other.success);
  EXPECT_EQ(other.orvaneID, "other@example.org");
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 2u);
}

TEST_F(OrvaneIDLookupTest, AnAccountTheStoreDoesNotKnowIsA404) {
  startStore();
  const Outcome unknown = lookUp(recordOf("nobody"));
  EXPECT_FALSE(unknown.success);
  ASSERT_TRUE(unknown.error);
  EXPECT_EQ(unknown.error->domain, VendStoreAnswer::kErrorDomain);
  EXPECT_EQ(unknown.error->code, 404);
  EXPECT_EQ(unknown.error->description, "No account owns this purchase.");
  EXPECT_FALSE(unknown.orvaneID);
}

TEST_F(OrvaneIDLookupTest, ARecordWithoutAccountIsNeverSent) {
  startStore();
  for (const auto& account : {std::optional<std::string>(), std::optional<std::string>("")}) {
    const Outcome outcome = lookUp(recordOf(account));
    EXPECT_FALSE(outcome.success);
    ASSERT_TRUE(outcome.error);
    EXPECT_EQ(outcome.error->domain, VendOrvaneIDLookupOperation::kErrorDomain);
    EXPECT_EQ(outcome.error->code, VendOrvaneIDLookupOperation::kRecordNamesNoAccountCode);
    EXPECT_FALSE(outcome.orvaneID);
  }
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 0u);
}

TEST_F(OrvaneIDLookupTest, ARecordWithoutWareIDIsRefusedByTheStore) {
  startStore();
  const Outcome outcome = lookUp(recordOf(kRecordAccount, PlistValue()));
  EXPECT_FALSE(outcome.success);
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 400);
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 1u);
}

TEST_F(OrvaneIDLookupTest, AnswersWithoutANameAndFailingStoresAreErrors) {
  const std::vector<std::pair<std::string, std::int64_t>> faults{
      {"orvane-id-lookup=wrong-shape", VendStoreAnswer::kWrongShape},
      {"orvane-id-lookup=not-plist", VendStoreAnswer::kNotPropertyList},
      {"orvane-id-lookup=500", 500}};
  for (const auto& [fault, code] : faults) {
    SCOPED_TRACE(fault);
    startStore({fault});
    const Outcome outcome = lookUp(recordOf(kRecordAccount));
    EXPECT_FALSE(outcome.success);
    ASSERT_TRUE(outcome.error);
    EXPECT_EQ(outcome.error->code, code);
    EXPECT_FALSE(outcome.error->description.empty());
    EXPECT_FALSE(outcome.orvaneID);
    EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 1u);
  }
  // A dictionary without a name is no answer either: the bag sends the
  // lookup to the bag itself.
  catalogue_.setStoreSettings({{"orvane-id-lookup", "/bag.plist"}});
  startStore();
  const Outcome nameless = lookUp(recordOf(kRecordAccount));
  EXPECT_FALSE(nameless.success);
  ASSERT_TRUE(nameless.error);
  EXPECT_EQ(nameless.error->code, VendStoreAnswer::kWrongShape);
  EXPECT_EQ(store_->requestCount("bag"), 2u);
}

TEST_F(OrvaneIDLookupTest, ABagWithoutTheLookupOrWithoutStoreFails) {
  catalogue_.setStoreSettings({{"orvane-id-lookup", std::int64_t{0}}});
  startStore();
  const Outcome noKey = lookUp(recordOf(kRecordAccount));
  EXPECT_FALSE(noKey.success);
  ASSERT_TRUE(noKey.error);
  EXPECT_EQ(noKey.error->code, 30);
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 0u);

  useBag("http://127.0.0.1:" + std::to_string(closedPort()) + "/bag.plist");
  const Outcome noStore = lookUp(recordOf(kRecordAccount));
  EXPECT_FALSE(noStore.success);
  ASSERT_TRUE(noStore.error);
  EXPECT_FALSE(noStore.orvaneID);
}

// MARK: the software map's question

TEST_F(OrvaneIDLookupTest, TheMapNamesTheOwnerOfAnInstalledApplication) {
  startStore();
  const auto product = ownedProduct();
  const LogLines log;
  EXPECT_EQ(SoftwareMap::lookupOrvaneIDForApp(product.get(), client_), kAccountName);
  EXPECT_EQ(log.startingWith("SoftwareMap: We know Orvane ID (case 3)", 3).size(), 1u);
  EXPECT_TRUE(log.startingWith("SoftwareMap: App may be from wrong environment!", 1).empty());
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 1u);
}

TEST_F(OrvaneIDLookupTest, WithoutProductOrPurchaseRecordTheStoreIsNotAsked) {
  startStore();
  const LogLines log;
  EXPECT_EQ(SoftwareMap::lookupOrvaneIDForApp(nullptr, client_), std::nullopt);
  const auto unowned = ownedProduct(std::nullopt);
  EXPECT_EQ(SoftwareMap::lookupOrvaneIDForApp(unowned.get(), client_), std::nullopt);
  const auto lines = log.startingWith("SoftwareMap: No purchase record in the bundle at ", 1);
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_NE(lines.front().find(unowned->bundlePath()), std::string::npos);
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 0u);
}

TEST_F(OrvaneIDLookupTest, WithNoStoreTheMapLogsTheFailureAndGivesNothing) {
  useBag("http://127.0.0.1:" + std::to_string(closedPort()) + "/bag.plist");
  const auto product = ownedProduct();
  const LogLines log;
  EXPECT_EQ(SoftwareMap::lookupOrvaneIDForApp(product.get(), client_), std::nullopt);
  const auto lines = log.startingWith(
      "SoftwareMap: App may be from wrong environment! Lookup failed with error - ", 1);
  ASSERT_EQ(lines.size(), 1u);
  // The error says something after the dash.
  EXPECT_GT(lines.front().size(),
            std::string_view(
                "SoftwareMap: App may be from wrong environment! Lookup failed with error - ")
                .size());
  EXPECT_TRUE(log.startingWith("SoftwareMap: We know Orvane ID", 3).empty());
}

TEST_F(OrvaneIDLookupTest, AnOwnerTheStoreDoesNotKnowGivesNothing) {
  startStore();
  const auto product = ownedProduct("an account of another store");
  const LogLines log;
  EXPECT_EQ(SoftwareMap::lookupOrvaneIDForApp(product.get(), client_), std::nullopt);
  const auto lines = log.startingWith("SoftwareMap: App may be from wrong environment!", 1);
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_NE(lines.front().find("No account owns this purchase."), std::string::npos);
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 1u);
}

}  // namespace
}  // namespace larder::testing
