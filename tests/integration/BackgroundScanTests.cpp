// The software update agent as its timer runs it: larderctl background-scan
// scans the simulated system update framework and sends the report to the
// service. What the service does with the report is its own tests' concern;
// these check what is sent and how the command ends.
#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "store-runtime/host/PlatformStateFile.h"
#include "tests/integration/StoreAndService.h"

namespace larder::testing {
namespace {

using BackgroundScanTest = StoreAndServiceTest;

std::string firstLine(const std::string& text) {
  return text.substr(0, text.find('\n'));
}

TEST_F(BackgroundScanTest, TheReportOfAScanIsSentAndTheLogoutResultsAreTakenOnce) {
  const PlatformStateFile state(platform_.root() + "/var/lib/larder-platform/system-updates.plist");
  ASSERT_TRUE(state.updateDictionary([](PlistDictionary& stored) {
    stored["catalog"] = PlistArray{
        PlistDictionary{{"productKey", "A"}, {"isCritical", true}, {"restartRequired", true}},
        PlistDictionary{{"productKey", "B"}}};
    stored["later"] = PlistArray{"B"};
    stored["postLogoutResults"] =
        PlistDictionary{{"C", PlistDictionary{{"State", 2}, {"InstalledLater", true}}}};
  }));
  const LarderctlRun absent = run({"background-scan"});
  EXPECT_EQ(absent.status, 1);
  EXPECT_TRUE(firstLine(absent.errors).starts_with("larderctl: larderd is not running"))
      << absent.errors;

  startService(kNoStoreURL);
  const LarderctlRun ran = run({"--json", "background-scan"});
  ASSERT_EQ(ran.status, 0) << ran.errors << service_->log();
  EXPECT_EQ(nlohmann::json::parse(ran.output), nlohmann::json::parse(R"({
      "criticalUpdatesCount": 1, "criticalUpdatesRequireRestart": true,
      "osUpdatesToPerformLater": ["B"],
      "postLogoutUpdatesInstalled": {"C": {"State": 2, "InstalledLater": true}}})"));
  EXPECT_EQ(PlistValue(state.readDictionary())["available"], PlistValue(PlistArray{"A", "B"}));

  const LarderctlRun again = run({"background-scan"});
  ASSERT_EQ(again.status, 0) << again.errors;
  EXPECT_EQ(again.output,
            "criticalUpdatesCount: 1\ncriticalUpdatesRequireRestart: true\n"
            "osUpdatesToPerformLater: [\"B\"]\n");
}

TEST_F(BackgroundScanTest, AGivenReportIsSentAsItIsAndOneThatIsNoObjectIsAUsageError) {
  startService(kNoStoreURL);
  const LarderctlRun given =
      run({"--json", "background-scan", "--info", R"({"criticalUpdatesCount": 3})"});
  ASSERT_EQ(given.status, 0) << given.errors;
  EXPECT_EQ(nlohmann::json::parse(given.output),
            nlohmann::json::parse(R"({"criticalUpdatesCount": 3})"));
  const LarderctlRun wrong = run({"background-scan", "--info", "[3]"});
  EXPECT_EQ(wrong.status, 2);
  EXPECT_EQ(firstLine(wrong.errors),
            "larderctl: --info takes a JSON object, not '[3]'; see `larderctl background-scan "
            "--help`");
}

}  // namespace
}  // namespace larder::testing
