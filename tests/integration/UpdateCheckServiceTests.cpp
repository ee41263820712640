// Update checks through the running service: larder-store with a
// catalogue, larderd on a private bus with installed bundles, and clients
// that ask the way the store application and larderctl do.
#include <gtest/gtest.h>

#include <barrier>
#include <filesystem>
#include <memory>
#include <thread>

#include "platform/log/TillLogManager.h"
#include "platform/plist/JsonConversion.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "tests/integration/LarderctlProcess.h"
#include "tests/integration/ServiceHarness.h"
#include "tests/integration/StoreCatalogueBuilder.h"
#include "tests/integration/StoreServerProcess.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr char kUpdateRoute[] = "available-software-updates";
constexpr std::uint64_t kCheckTimeout = 60'000'000;

std::vector<std::uint64_t> identifiersOf(const PlistValue& updates) {
  std::vector<std::uint64_t> identifiers;
  if (const PlistArray* list = updates.array()) {
    for (const PlistValue& update : *list)
      identifiers.push_back(update["itemIdentifier"].uint64Value());
  }
  return identifiers;
}

class UpdateCheckServiceTest : public ::testing::Test {
 protected:
  void SetUp() override {
    // The installed bundles' purchase records name the opaque id "account-1".
    catalogue_.addAccount({.accountID = 4711,
                           .orvaneID = "owner@example.org",
                           .password = "secret",
                           .opaqueID = "account-1"});
    catalogue_.addItem(
        {.wareID = 101, .bundleID = "com.example.atlas", .title = "Atlas", .version = "2.0"});
    catalogue_.addItem({.wareID = 102,
                        .bundleID = "com.example.birch",
                        .title = "Birch",
                        .version = "3.0",
                        .extraEntries = {{"incompatible", true}}});
    catalogue_.addItem(
        {.wareID = 103, .bundleID = "com.example.cedar", .title = "Cedar", .version = "1.0"});
    const std::string applications = platform_.root() + "/Applications";
    fs::create_directories(applications);
    platform_.installBundle({applications, "Atlas", "com.example.atlas", "1.0", 101});
    platform_.installBundle({applications, "Birch", "com.example.birch", "1.0", 102});
    platform_.installBundle({applications, "Cedar", "com.example.cedar", "1.0", 103});
    writeStoreSettings();
    store_ = std::make_unique<StoreServerProcess>(catalogue_.directory(), storeFaults());
    startService();
  }

  [[nodiscard]] virtual std::vector<std::string> storeFaults() const { return {}; }
  virtual void writeStoreSettings() {}

  void startService() {
    service_.reset();
    service_ = std::make_unique<ServiceProcess>(
        platform_, bus_, std::vector<std::string>{},
        std::map<std::string, std::string>{{"LARDER_STORE_URL", store_->bagURL()},
                                           {"LARDER_STORE_TIMEOUT", "5"}});
    ASSERT_TRUE(service_->waitUntilServing()) << service_->log();
    ASSERT_TRUE(service_->waitForLog("MetadataQuery initial load took", 20s)) << service_->log();
  }

  std::unique_ptr<ServiceClient> client() {
    auto made = connectClient(bus_);
    made->presentStoreClient(0);
    return made;
  }

  int run(const std::vector<std::string>& arguments, std::string* output = nullptr,
          std::string* errors = nullptr) {
    LarderctlRun ran =
        runLarderctl(platform_, bus_, arguments, "larderctl-" + std::to_string(++runs_), 90s);
    if (output) *output = std::move(ran.output);
    if (errors) *errors = std::move(ran.errors);
    return ran.status;
  }

  StoreCatalogueBuilder catalogue_;
  std::unique_ptr<StoreServerProcess> store_;
  TemporaryPlatform platform_;
  PrivateBus bus_;
  std::unique_ptr<ServiceProcess> service_;
  int runs_ = 0;
};

// The store takes a second over every update check, so that all callers
// arrive while the first check is in flight, however slow the machine.
class SlowStoreUpdateCheckTest : public UpdateCheckServiceTest {
 protected:
  [[nodiscard]] std::vector<std::string> storeFaults() const override {
    return {std::string(kUpdateRoute) + "=slow"};
  }
};

TEST_F(SlowStoreUpdateCheckTest, TenClientsCheckingAtOnceCauseOneStoreRequestAndShareTheAnswer) {
  constexpr int kClients = 10;
  std::vector<std::unique_ptr<ServiceClient>> clients;
  for (int i = 0; i < kClients; ++i) clients.push_back(client());
  std::vector<PlistArray> replies(kClients);
  std::barrier start(kClients);
  std::vector<std::thread> callers;
  for (int i = 0; i < kClients; ++i) {
    callers.emplace_back([&, i] {
      start.arrive_and_wait();
      replies[i] =
          clients[i]->call("CheckForUpdatesWithUserHasSeenUpdates", {false}, kCheckTimeout);
    });
  }
  for (std::thread& caller : callers) caller.join();
  for (const PlistArray& reply : replies) {
    ASSERT_EQ(reply.size(), 3U);
    EXPECT_TRUE(reply[0].boolValue()) << describePlistValue(reply[2]) << service_->log();
    EXPECT_EQ(identifiersOf(reply[1]), (std::vector<std::uint64_t>{101}));
    EXPECT_EQ(reply[1], replies.front()[1]) << "every caller gets the same records";
  }
  EXPECT_EQ(store_->requestCount(kUpdateRoute), 1U) << service_->log();

  const PlistArray incompatible = clients[0]->call("IncompatibleUpdates", {});
  EXPECT_EQ(identifiersOf(incompatible.at(0)), (std::vector<std::uint64_t>{102}));
  const PlistArray one =
      clients[0]->call("AvailableUpdateWithItemIdentifier", {std::uint64_t{101}});
  EXPECT_EQ(*one.at(0)["version"].string(), "2.0");
  EXPECT_EQ(*one.at(0)["bundleID"].string(), "com.example.atlas");
}

// The store's answer carries, after its own items, entries that make no
// update record and one that does.
class MalformedAnswerUpdateCheckTest : public UpdateCheckServiceTest {
 protected:
  void writeStoreSettings() override {
    catalogue_.writeStoreSettings(PlistDictionary{
        {"extraUpdateItems", PlistArray{"not an item", PlistDictionary{{"ware-id", "not a number"}},
                                        PlistDictionary{{"bundle-id", "com.example.nowareid"}},
                                        PlistDictionary{{"ware-id", 104},
                                                        {"bundle-id", "com.example.dune"},
                                                        {"title", "Dune"},
                                                        {"version", "4.0"}}}}});
  }
};

TEST_F(MalformedAnswerUpdateCheckTest, TheGoodItemsOfAnAnswerAreKeptAndTheOthersDropped) {
  auto asking = client();
  const PlistArray reply =
      asking->call("CheckForUpdatesWithUserHasSeenUpdates", {false}, kCheckTimeout);
  ASSERT_TRUE(reply.at(0).boolValue()) << service_->log();
  EXPECT_EQ(identifiersOf(reply.at(1)), (std::vector<std::uint64_t>{101, 104}));
  EXPECT_EQ(identifiersOf(asking->call("AvailableUpdates", {}).at(0)),
            (std::vector<std::uint64_t>{101, 104}));
}

TEST_F(UpdateCheckServiceTest, LarderctlListsTheUpdatesAndTheyOutliveARestartOfTheService) {
  std::string output;
  std::string errors;
  ASSERT_EQ(run({"updates", "--check"}, &output, &errors), 0) << errors << service_->log();
  EXPECT_NE(output.find("com.example.atlas"), std::string::npos) << output;
  EXPECT_NE(output.find("2.0"), std::string::npos) << output;
  EXPECT_EQ(output.find("com.example.cedar"), std::string::npos) << "Cedar is up to date";
  const auto incompatibleAt = output.find("Incompatible");
  ASSERT_NE(incompatibleAt, std::string::npos) << output;
  EXPECT_GT(output.find("com.example.birch"), incompatibleAt) << output;
  EXPECT_TRUE(fs::exists(platform_.cacheHome() + "/com.orvane.larderd/updates.plist"));

  service_->stop();
  startService();
  ASSERT_EQ(run({"--json", "updates"}, &output, &errors), 0) << errors;
  const PlistValue listed = JsonConversion::fromJson(nlohmann::json::parse(output));
  EXPECT_EQ(identifiersOf(listed["updates"]), (std::vector<std::uint64_t>{101}));
  EXPECT_EQ(identifiersOf(listed["incompatibleUpdates"]), (std::vector<std::uint64_t>{102}));
  EXPECT_EQ(store_->requestCount(kUpdateRoute), 1U) << "the list came from the cache";
}

TEST_F(UpdateCheckServiceTest, SeenUpdatesStayMarkedAndAFailedCheckKeepsTheCachedList) {
  auto first = client();
  PlistArray reply = first->call("CheckForUpdatesWithUserHasSeenUpdates", {true}, kCheckTimeout);
  ASSERT_TRUE(reply.at(0).boolValue()) << service_->log();
  ASSERT_EQ(identifiersOf(reply.at(1)), (std::vector<std::uint64_t>{101}));
  EXPECT_TRUE(reply.at(1).array()->front()["hasBeenSeenByUser"].boolValue());

  const std::string cache = platform_.cacheHome() + "/com.orvane.larderd/updates.plist";
  const auto modified = fs::last_write_time(cache);
  store_->stop();
  std::string output;
  std::string errors;
  EXPECT_EQ(run({"updates", "--check"}, &output, &errors), 1);
  EXPECT_NE(errors.find("the update check failed"), std::string::npos) << errors;
  EXPECT_NE(output.find("com.example.atlas"), std::string::npos) << output;
  EXPECT_NE(output.find("seen"), std::string::npos) << output;
  EXPECT_EQ(fs::last_write_time(cache), modified);
}

TEST_F(UpdateCheckServiceTest, TheStoreNamesTheAccountThatOwnsAnInstalledProduct) {
  auto asking = client();
  const PlistValue atlas =
      asking->call("ProductForBundleIdentifier", {std::string("com.example.atlas")}).at(0);
  ASSERT_TRUE(atlas.dictionary() && !atlas.dictionary()->empty()) << service_->log();
  EXPECT_EQ(*asking->call("LookupOrvaneIDForApp", {atlas}, kCheckTimeout).at(0).string(),
            "owner@example.org");
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 1U);
  // No product, and a store that has gone: no name.
  EXPECT_EQ(*asking->call("LookupOrvaneIDForApp", {PlistDictionary{}}).at(0).string(), "");
  store_->stop();
  EXPECT_EQ(*asking->call("LookupOrvaneIDForApp", {atlas}, kCheckTimeout).at(0).string(), "");
  EXPECT_TRUE(
      service_->waitForLog("App may be from wrong environment! Lookup failed with error - "))
      << service_->log();
}

}  // namespace
}  // namespace larder::testing
