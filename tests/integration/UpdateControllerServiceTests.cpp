// The update controller in the running service: the software update agent's
// report, the badge and its signal, observers on the bus, OS update scans and
// hiding, as larderctl and clients use them.
#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <mutex>

#include "client/DistributedNotificationProtocol.h"
#include "platform/plist/JsonConversion.h"
#include "tests/integration/StoreAndService.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr std::uint64_t kCheckTimeout = 60'000'000;

PlistDictionary osUpdate(const std::string& key, bool critical = false) {
  return {{"productKey", key},
          {"title", "System " + key},
          {"versionString", "1.0"},
          {"isCritical", critical},
          {"isRecommended", true}};
}

// Counts the calls that reach observers a client exported on the bus.
class ObserverCalls {
 public:
  void add(std::uint64_t badge) {
    std::lock_guard lock(mutex_);
    badges_.push_back(badge);
  }
  [[nodiscard]] std::vector<std::uint64_t> badges() const {
    std::lock_guard lock(mutex_);
    return badges_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::uint64_t> badges_;
};

class UpdateControllerServiceTest : public StoreAndServiceTest {
 protected:
  void SetUp() override {
    catalogue_.addAccount({.accountID = 4711,
                           .orvaneID = "owner@example.org",
                           .password = "secret",
                           .opaqueID = "account-1"});
    catalogue_.addItem(
        {.wareID = 101, .bundleID = "com.example.atlas", .title = "Atlas", .version = "2.0"});
    catalogue_.addItem(
        {.wareID = 103, .bundleID = "com.example.cedar", .title = "Cedar", .version = "2.0"});
    platform_.installBundle({applications(), "Atlas", "com.example.atlas", "1.0", 101});
    platform_.installBundle({applications(), "Cedar", "com.example.cedar", "1.0", 103});
    offer({osUpdate("SEC-1", true), osUpdate("APP-2"), osUpdate("KERNEL-3")});
  }

  void offer(const PlistArray& catalog) {
    const std::string path = platform_.root() + "/var/lib/larder-platform/system-updates.plist";
    fs::create_directories(fs::path(path).parent_path());
    ASSERT_TRUE(FileIO::writeAtomically(
        path, PropertyListSerialization::writeXml(PlistDictionary{{"catalog", catalog}})));
  }

  // Exports an available-updates observer at `path` of `client` and registers it.
  static void observe(ServiceClient& client, const std::string& path,
                      const std::shared_ptr<ObserverCalls>& calls) {
    client.exportCallbackObject(
        path, "VendAvailableUpdatesObserver",
        "AvailableUpdatesDidChangedWithUpdatesOsUpdatesBadgeCount", "aa{sv}aa{sv}t",
        [calls](const PlistArray& arguments) { calls->add(arguments.at(2).uint64Value()); });
    client.call("AddAvailableUpdatesObserver", {path});
  }
};

TEST_F(UpdateControllerServiceTest, TheAgentsReportEnqueuesOneRunAndTheBadgeAgreesWithItsSignal) {
  start();
  auto watcher = client();
  std::atomic<std::uint64_t> signalled{~0ULL};
  watcher->watchSignal(
      DistributedNotificationProtocol::kInterfaceName, DistributedNotificationProtocol::kSignal,
      DistributedNotificationProtocol::kSignature,
      [&](const PlistArray& values) { signalled = values.at(2)["badgeCount"].uint64Value(); });
  ASSERT_EQ(client()->call("CheckForUpdatesWithUserHasSeenUpdates", {false}, kCheckTimeout).at(0),
            PlistValue(true));

  LarderctlRun scan = run({"os-updates", "--scan"});
  ASSERT_EQ(scan.status, 0) << scan.errors << service_->log();
  for (const char* key : {"SEC-1", "APP-2", "KERNEL-3"})
    EXPECT_NE(scan.output.find(key), std::string::npos);

  LarderctlRun report = run({"background-scan"});
  ASSERT_EQ(report.status, 0) << report.errors << service_->log();
  // Nothing was ever done: every time test says yes, and one critical
  // update was reported.
  ASSERT_TRUE(service_->waitForLog("Enqueuing UpdateOperation")) << service_->log();
  const std::string log = service_->log();
  EXPECT_EQ(log.find("Enqueuing UpdateOperation"), log.rfind("Enqueuing UpdateOperation"))
      << "one run for one report";
  for (const char* flag : {"shouldCheckForAndStageAppUpdates", "shouldStartAutoInstallOfUpdates",
                           "shouldPostAvailableUpdatesNotification", "criticalOSUpdateCount=1"}) {
    EXPECT_NE(log.find(flag), std::string::npos) << flag << " in\n" << log;
  }

  // Two app updates and the OS updates, which count as one.
  LarderctlRun badge = run({"--json", "badge"});
  ASSERT_EQ(badge.status, 0) << badge.errors;
  EXPECT_EQ(
      JsonConversion::fromJson(nlohmann::json::parse(badge.output))["badgeCount"].uint64Value(),
      3U);
  EXPECT_TRUE(eventually([&] { return signalled.load() == 3; }, 10s)) << signalled.load();
}

TEST_F(UpdateControllerServiceTest, ObserversHearChecksAndHidesAndOneThatHasGoneCostsNothing) {
  start();
  ASSERT_EQ(run({"os-updates", "--scan"}).status, 0);
  auto listener = client();
  std::vector<std::shared_ptr<ObserverCalls>> calls;
  for (int index = 0; index < 9; ++index) {
    calls.push_back(std::make_shared<ObserverCalls>());
    observe(*listener, "/test/Observer" + std::to_string(index), calls.back());
  }
  {
    // A client that registers and goes away without removing its observer.
    auto gone = client();
    observe(*gone, "/test/Gone", std::make_shared<ObserverCalls>());
  }

  ASSERT_EQ(client()->call("CheckForUpdatesWithUserHasSeenUpdates", {false}, kCheckTimeout).at(0),
            PlistValue(true));
  for (const auto& observer : calls) {
    ASSERT_TRUE(eventually([&] { return !observer->badges().empty(); }, 10s));
    EXPECT_EQ(observer->badges().back(), 3U);
  }

  const auto started = std::chrono::steady_clock::now();
  LarderctlRun hide = run({"--json", "os-updates", "--hide", "SEC-1", "APP-2", "KERNEL-3"});
  ASSERT_EQ(hide.status, 3) << hide.errors << "\n" << hide.output << service_->log();
  EXPECT_LT(std::chrono::steady_clock::now() - started, 10s);
  EXPECT_EQ(JsonConversion::fromJson(nlohmann::json::parse(hide.output)), PlistValue(PlistArray{}));
  for (const auto& observer : calls) {
    EXPECT_TRUE(eventually([&] { return observer->badges().back() == 2; }, 10s))
        << "hidden OS updates leave the badge";
  }
  LarderctlRun unhide = run({"os-updates", "--unhide-all"});
  EXPECT_EQ(unhide.status, 0) << unhide.errors;
  EXPECT_NE(unhide.output.find("KERNEL-3"), std::string::npos);
}

TEST_F(UpdateControllerServiceTest, HidingIsRefusedWithoutTheMachinesAuthorization) {
  const std::string path = platform_.root() + "/var/lib/larder-platform/authorization.plist";
  ASSERT_TRUE(FileIO::writeAtomically(
      path, PropertyListSerialization::writeXml(
                PlistDictionary{{"grantedRights", PlistArray{}}, {"interactiveGrant", false}})));
  start();
  ASSERT_EQ(run({"os-updates", "--scan"}).status, 0);
  LarderctlRun hide = run({"os-updates", "--hide", "SEC-1"});
  EXPECT_EQ(hide.status, 1);
  EXPECT_NE(hide.errors.find("not authorized"), std::string::npos) << hide.errors;
  EXPECT_NE(service_->log().find("Failed to authorize to hide OS Updates"), std::string::npos);
  EXPECT_EQ(run({"os-updates"}).status, 0) << "nothing was hidden";
}

TEST_F(UpdateControllerServiceTest, PreferencesWrittenByLarderctlCountAtTheNextQuestion) {
  start();
  auto store = client();
  EXPECT_EQ(store->call("IsAutoUpdateEnabled", {}).at(0), PlistValue(false));
  EXPECT_EQ(store->call("ShouldPromptForAutoUpdateOptIn", {}).at(0), PlistValue(true));
  ASSERT_EQ(run({"prefs", "set", "com.orvane.larderd", "AutoUpdateEnabled", "true"}).status, 0);
  EXPECT_EQ(store->call("IsAutoUpdateEnabled", {}).at(0), PlistValue(true));
  EXPECT_EQ(store->call("ShouldPromptForAutoUpdateOptIn", {}).at(0), PlistValue(false));
  LarderctlRun read = run({"--json", "prefs", "get", "com.orvane.larderd", "AutoUpdateEnabled"});
  EXPECT_EQ(read.output, "true\n");
  EXPECT_EQ(run({"prefs", "delete", "com.orvane.larderd", "AutoUpdateEnabled"}).status, 0);
  EXPECT_EQ(run({"prefs", "delete", "com.orvane.larderd", "AutoUpdateEnabled"}).status, 3);
}

}  // namespace
}  // namespace larder::testing
