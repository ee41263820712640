// The major OS update in the running service: the agent's report that
// announces a notification bundle, and the requests of the managed path and
// of purchases by hand, as clients send them on the bus.
#include <gtest/gtest.h>

#include <filesystem>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "tests/integration/StoreAndService.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

class MajorOSUpdateServiceTest : public StoreAndServiceTest {
 protected:
  [[nodiscard]] PlistValue systemPreferences() const {
    const std::string path = platform_.root() + "/etc/larder/com.orvane.larderd.plist";
    std::optional<PlistData> bytes = FileIO::read(path, 1u << 20u).optional();
    if (!bytes) return {};
    return PropertyListSerialization::read(*bytes).value_or(PlistValue());
  }
  [[nodiscard]] PlistValue installService() const {
    const std::string path = platform_.root() + "/var/lib/larder-platform/major-os-install.plist";
    std::optional<PlistData> bytes = FileIO::read(path, 1u << 20u).optional();
    if (!bytes) return {};
    return PropertyListSerialization::read(*bytes).value_or(PlistValue());
  }
};

// A bundle that asks for no delay is evaluated at once; without tags that
// evaluation fails and counts a retry, in the state the install service
// stores for the machine.
TEST_F(MajorOSUpdateServiceTest, TheAgentsAnnouncementIsEvaluatedAtOnceWithoutDelay) {
  const std::string bundle = platform_.directory() + "/NextOS.bundle";
  fs::create_directories(bundle);
  ASSERT_TRUE(FileIO::writeAtomically(bundle + "/bundle.plist",
                                      PropertyListSerialization::writeXml(PlistDictionary{
                                          {"SHBundleIdentifier", "com.example.nextos"},
                                          {"MaximumNotificationDelay", std::int64_t{-1}}})));
  start();
  LarderctlRun report =
      run({"background-scan", "--info", "{\"majorOSUpdateAvailableAtPath\":\"" + bundle + "\"}"});
  ASSERT_EQ(report.status, 0) << report.errors;
  ASSERT_TRUE(service_->waitForLog("Delay was set to 0. Triggering evaluation now."))
      << service_->log();
  ASSERT_TRUE(eventually(
      [&] {
        return systemPreferences()["MajorOSUpdate"]["EvaluationRetryCount"].int64Value() == 1;
      },
      10s))
      << service_->log();
  EXPECT_EQ(*systemPreferences()["MajorOSUpdate"]["BundlePath"].string(), bundle);
}

// An installer that is already there goes straight to the install service;
// the status and a purchase by hand answer on the bus.
TEST_F(MajorOSUpdateServiceTest, TheManagedPathAndPurchasesAnswerOnTheBus) {
  const std::string installer = platform_.installBundle(
      {applications(), "Install Next OS", "com.example.nextos", "1.0", 4242});
  start();
  auto caller = client();
  caller->call("DownloadSetupHeraldForTagsBundleIdentifier",
               {PlistArray{"next-os"}, "com.example.nextos"});
  ASSERT_TRUE(eventually(
      [&] {
        const PlistValue requests = installService()["installationRequests"];
        return requests.array() && requests.array()->size() == 1;
      },
      10s))
      << service_->log();
  EXPECT_EQ(*installService()["installationRequests"].array()->at(0)["setupHerald"].string(),
            installer);
  EXPECT_EQ(caller->call("CheckSHDownloadStatus", {}).at(0),
            PlistValue(PlistDictionary{{"bundleIdentifier", "com.example.nextos"}}));
  EXPECT_EQ(caller->call("WillInteractivelyPurchaseItemIdentifier", {std::uint64_t{7}}).at(0),
            PlistValue(false));
}

}  // namespace
}  // namespace larder::testing
