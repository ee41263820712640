// The running service against larder-store: purchases and update checks
// through larderctl and clients on the bus.
#include <gtest/gtest.h>

#include <barrier>
#include <filesystem>
#include <optional>
#include <thread>

#include "client/ServiceError.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/JsonConversion.h"
#include "tests/integration/StoreAndService.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr char kUpdateRoute[] = "available-software-updates";
constexpr std::uint64_t kCheckTimeout = 60'000'000;

std::vector<std::uint64_t> identifiersOf(const PlistValue& updates) {
  std::vector<std::uint64_t> identifiers;
  if (const PlistArray* list = updates.array()) {
    for (const PlistValue& update : *list) {
      identifiers.push_back(update["itemIdentifier"].uint64Value());
    }
  }
  return identifiers;
}

bool contains(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

// MARK: purchases

class StorePurchaseServiceTest : public StoreAndServiceTest {
 protected:
  [[nodiscard]] std::string bundlePath() const { return applications() + "/Atlas.app"; }
};

TEST_F(StorePurchaseServiceTest, SignedInPurchaseInstallsTheBundleAndTheMapSeesIt) {
  start();
  LarderctlRun ran = run({"signin", kShopper, "--password", kPassword});
  ASSERT_EQ(ran.status, 0) << ran.errors << service_->log();
  EXPECT_TRUE(contains(ran.output, "account 8123")) << ran.output;
  ran = run({"account"});
  ASSERT_EQ(ran.status, 0);
  EXPECT_TRUE(contains(ran.output, kShopper));

  ran = run({"purchase", "901"});
  ASSERT_EQ(ran.status, 0) << ran.errors << service_->log();
  EXPECT_TRUE(contains(ran.output, "com.example.Atlas")) << ran.output;
  // larderctl follows the install to its end.
  EXPECT_TRUE(contains(ran.output, "installed Atlas at " + bundlePath())) << ran.output;
  ASSERT_TRUE(fs::exists(bundlePath() + "/purchase.plist")) << service_->log();
  EXPECT_TRUE(eventually(
      [&] {
        return (ran = run({"product", "--bundle-id", "com.example.Atlas"})).status == 0;
      },
      20s))
      << service_->log();
  EXPECT_TRUE(contains(ran.output, "3.1")) << ran.output;
}

TEST_F(StorePurchaseServiceTest, ADialogAgentSignsTheAccountInWhenAPurchaseNeedsIt) {
  start();
  Larderctl agent(platform_, bus_,
                  {"agent", "--answer", "ok", "--account", kShopper, "--password", kPassword},
                  "agent");
  ASSERT_TRUE(agent.waitForError("registered")) << agent.errors();
  LarderctlRun ran = run({"purchase", "901"});
  ASSERT_EQ(ran.status, 0) << ran.errors << service_->log();
  ran = run({"--json", "account"});
  ASSERT_EQ(ran.status, 0);
  EXPECT_TRUE(contains(ran.output, "8123")) << ran.output;
  EXPECT_TRUE(eventually([&] { return fs::exists(bundlePath() + "/bundle.plist"); }, 20s));
}

TEST_F(StorePurchaseServiceTest, WithoutAgentOrAccountThePurchaseFailsAndSaysHowToRunAnAgent) {
  start();
  LarderctlRun ran = run({"purchase", "901"});
  EXPECT_EQ(ran.status, 1);
  EXPECT_TRUE(ran.errors.starts_with(
      "larderctl: the purchase of item 901 failed: No one was asked to sign in: no dialog agent "
      "is registered with the service. Run `larderctl agent`"))
      << ran.errors;
  EXPECT_TRUE(contains(ran.errors, "code -128")) << ran.errors;
  EXPECT_EQ(store_->requestCount("buy-product"), 0U);
  EXPECT_FALSE(fs::exists(bundlePath()));
  ran = run({"signin", kShopper, "--password", "wrong"});
  EXPECT_EQ(ran.status, 1);
  EXPECT_TRUE(contains(ran.errors, "code 401")) << ran.errors;
}

// Every package the store sends fails its digests, and an older copy of the
// item stays installed: success must come from the download, not from
// finding a bundle of the item on disk.
TEST_F(StorePurchaseServiceTest, APurchaseWhoseDownloadFailsIsAFailureEvenWithAnOlderCopy) {
  const std::string installed =
      platform_.installBundle({applications(), "Atlas", "com.example.Atlas", "2.0", 901});
  start({"assets=corrupt"});
  ASSERT_EQ(run({"signin", kShopper, "--password", kPassword}).status, 0) << service_->log();
  LarderctlRun ran = run({"purchase", "901"});
  EXPECT_EQ(ran.status, 1) << ran.output << ran.errors;
  EXPECT_TRUE(ran.errors.starts_with("larderctl: the download of Atlas (item 901) failed: "))
      << ran.errors;
  EXPECT_FALSE(contains(ran.output, "installed Atlas")) << ran.output;
  EXPECT_TRUE(contains(readFile(installed + "/bundle.plist"), "2.0"));
  // Without waiting, larderctl returns once the store has answered.
  ran = run({"purchase", "901", "--no-wait"});
  EXPECT_EQ(ran.status, 0) << ran.errors;
  EXPECT_TRUE(contains(ran.output, "downloading 901")) << ran.output;
}

// MARK: update checks

class UpdateCheckServiceTest : public StoreAndServiceTest {
 protected:
  void SetUp() override {  // instead of the shopper and Atlas
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
    platform_.installBundle({applications(), "Atlas", "com.example.atlas", "1.0", 101});
    platform_.installBundle({applications(), "Birch", "com.example.birch", "1.0", 102});
    platform_.installBundle({applications(), "Cedar", "com.example.cedar", "1.0", 103});
  }
  PlistArray check(ServiceClient& client, bool seen = false) {
    return client.call("CheckForUpdatesWithUserHasSeenUpdates", {seen}, kCheckTimeout);
  }
};

// The store takes a second over every update check, so that all callers
// arrive while the first check is in flight, however slow the machine.
TEST_F(UpdateCheckServiceTest, TenClientsCheckingAtOnceCauseOneStoreRequestAndShareTheAnswer) {
  start({std::string(kUpdateRoute) + "=slow"});
  constexpr int kClients = 10;
  std::vector<std::unique_ptr<ServiceClient>> clients;
  for (int i = 0; i < kClients; ++i) clients.push_back(client());
  std::vector<PlistArray> replies(kClients);
  std::barrier begin(kClients);
  std::vector<std::thread> callers;
  for (int i = 0; i < kClients; ++i) {
    callers.emplace_back([&, i] {
      begin.arrive_and_wait();
      replies[i] = check(*clients[i]);
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

// A stop while an update check waits for a store that never answers: the
// caller hears at once that the service is stopping, not a timeout later.
TEST_F(UpdateCheckServiceTest, ACallOpenWhenTheServiceStopsIsAnsweredAsStopping) {
  start({std::string(kUpdateRoute) + "=stall"});
  auto caller = client();
  std::optional<std::string> errorName;
  std::thread waiting([&] {
    try {
      check(*caller);
    } catch (const sdbus::Error& error) {
      errorName = error.getName();
    }
  });
  ASSERT_TRUE(eventually([&] { return store_->requestCount(kUpdateRoute) == 1; }))
      << service_->log();
  const auto stoppedAt = std::chrono::steady_clock::now();
  EXPECT_EQ(service_->stop(), 0) << service_->log();
  waiting.join();
  EXPECT_EQ(errorName, std::string(ServiceError::kStopping)) << service_->log();
  EXPECT_LT(std::chrono::steady_clock::now() - stoppedAt, 5s);
  EXPECT_FALSE(service_->logLines("open requests answered as stopping").empty()) << service_->log();
}

// The store's answer carries, after its own items, entries that make no
// update record and one that does.
TEST_F(UpdateCheckServiceTest, TheGoodItemsOfAnAnswerAreKeptAndTheOthersDropped) {
  catalogue_.writeStoreSettings(PlistDictionary{
      {"extraUpdateItems", PlistArray{"not an item", PlistDictionary{{"ware-id", "not a number"}},
                                      PlistDictionary{{"bundle-id", "com.example.nowareid"}},
                                      PlistDictionary{{"ware-id", 104},
                                                      {"bundle-id", "com.example.dune"},
                                                      {"title", "Dune"},
                                                      {"version", "4.0"}}}}});
  start();
  auto asking = client();
  const PlistArray reply = check(*asking);
  ASSERT_TRUE(reply.at(0).boolValue()) << service_->log();
  EXPECT_EQ(identifiersOf(reply.at(1)), (std::vector<std::uint64_t>{101, 104}));
  EXPECT_EQ(identifiersOf(asking->call("AvailableUpdates", {}).at(0)),
            (std::vector<std::uint64_t>{101, 104}));
}

TEST_F(UpdateCheckServiceTest, LarderctlListsTheUpdatesAndTheyOutliveARestartOfTheService) {
  start();
  LarderctlRun ran = run({"updates", "--check"});
  ASSERT_EQ(ran.status, 0) << ran.errors << service_->log();
  EXPECT_TRUE(contains(ran.output, "com.example.atlas")) << ran.output;
  EXPECT_TRUE(contains(ran.output, "2.0")) << ran.output;
  EXPECT_FALSE(contains(ran.output, "com.example.cedar")) << "Cedar is up to date";
  const auto incompatibleAt = ran.output.find("Incompatible");
  ASSERT_NE(incompatibleAt, std::string::npos) << ran.output;
  EXPECT_GT(ran.output.find("com.example.birch"), incompatibleAt) << ran.output;
  EXPECT_TRUE(fs::exists(platform_.cacheHome() + "/com.orvane.larderd/updates.plist"));

  service_->stop();
  startService(store_->bagURL());
  ran = run({"--json", "updates"});
  ASSERT_EQ(ran.status, 0) << ran.errors;
  const PlistValue listed = JsonConversion::fromJson(nlohmann::json::parse(ran.output));
  EXPECT_EQ(identifiersOf(listed["updates"]), (std::vector<std::uint64_t>{101}));
  EXPECT_EQ(identifiersOf(listed["incompatibleUpdates"]), (std::vector<std::uint64_t>{102}));
  EXPECT_EQ(store_->requestCount(kUpdateRoute), 1U) << "the list came from the cache";
}

TEST_F(UpdateCheckServiceTest, SeenUpdatesStayMarkedAndAFailedCheckKeepsTheCachedList) {
  start();
  PlistArray reply = check(*client(), true);
  ASSERT_TRUE(reply.at(0).boolValue()) << service_->log();
  ASSERT_EQ(identifiersOf(reply.at(1)), (std::vector<std::uint64_t>{101}));
  EXPECT_TRUE(reply.at(1).array()->front()["hasBeenSeenByUser"].boolValue());

  const std::string cache = platform_.cacheHome() + "/com.orvane.larderd/updates.plist";
  const auto modified = fs::last_write_time(cache);
  store_->stop();
  const LarderctlRun ran = run({"updates", "--check"});
  EXPECT_EQ(ran.status, 1);
  EXPECT_TRUE(contains(ran.errors, "the update check failed")) << ran.errors;
  EXPECT_TRUE(contains(ran.output, "com.example.atlas")) << ran.output;
  EXPECT_TRUE(contains(ran.output, "seen")) << ran.output;
  EXPECT_EQ(fs::last_write_time(cache), modified);
}

TEST_F(UpdateCheckServiceTest, TheStoreNamesTheAccountThatOwnsAnInstalledProduct) {
  start();
  auto asking = client();
  const PlistValue atlas =
      asking->call("ProductForBundleIdentifier", {std::string("com.example.atlas")}).at(0);
  ASSERT_TRUE(atlas.dictionary() && !atlas.dictionary()->empty()) << service_->log();
  const auto owner = [&](const PlistValue& product) {
    return *asking->call("LookupOrvaneIDForApp", {product}, kCheckTimeout).at(0).string();
  };
  EXPECT_EQ(owner(atlas), "owner@example.org");
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 1U);
  // No product, and a store that has gone: no name.
  EXPECT_EQ(owner(PlistDictionary{}), "");
  store_->stop();
  EXPECT_EQ(owner(atlas), "");
  EXPECT_TRUE(
      service_->waitForLog("App may be from wrong environment! Lookup failed with error - "))
      << service_->log();
}

}  // namespace
}  // namespace larder::testing
