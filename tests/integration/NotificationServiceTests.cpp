// The service's notifications end to end: the software update agent's
// reports lead to runs that post, replace and take away a notification on
// a notification server of the test's private bus, and the service's list
// of what it delivered outlives a restart of the service.
#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "tests/integration/StoreAndService.h"
#include "tests/integration/notifications/RecordingNotificationServer.h"

namespace larder::testing {
namespace {

class NotificationServiceTest : public StoreAndServiceTest {
 protected:
  // The agent's report `info`, as if the notification intervals had passed.
  void reportAfterTheInterval(const std::string& info) {
    run({"prefs", "delete", "com.orvane.larderd", "DidPostUpdatesAvailableNotificationDate"});
    backgroundRun(info);
  }

  nlohmann::json delivered() {
    const LarderctlRun listed = run({"--json", "notifications"});
    return nlohmann::json::parse(listed.output);
  }
};

TEST_F(NotificationServiceTest, ARunsNotificationIsShownReplacedKeptAcrossARestartAndClosed) {
  RecordingNotificationServer server(bus_.address(), 41);
  start();

  reportAfterTheInterval(R"({"criticalUpdatesCount": 1})");
  std::vector<RecordingNotificationServer::NotifyCall> shown = server.waitForNotifyCalls(1);
  ASSERT_EQ(shown.size(), 1u) << service_->log();
  const RecordingNotificationServer::NotifyCall expected{
      .appName = "larder",
      .replacesId = 0,
      .appIcon = "",
      .summary = "Important Update Available",
      .body = "An important security update is ready to install.",
      .actions = {"default", "", "action", "Update", "other", "Details"},
      .hints = {{"desktop-entry", "s larder"},
                {"image-path", "s software-update-urgent"},
                {"resident", "b true"},
                {"urgency", "y 2"}},
      .expireTimeout = 0,
      .identifier = 41};
  EXPECT_EQ(shown[0], expected);
  nlohmann::json list = delivered();
  ASSERT_EQ(list.size(), 1u) << list.dump();
  EXPECT_EQ(list[0]["serverIdentifier"], 41);
  EXPECT_EQ(list[0]["displayed"], true);
  EXPECT_EQ(list[0]["userInfo"]["Source"], "AppUpdate");
  EXPECT_EQ(list[0]["userInfo"]["storeClientIdentifier"], "com.orvane.quaymart");

  // A second report replaces it: the first is closed, the new one shown.
  reportAfterTheInterval(R"({"criticalUpdatesCount": 2})");
  shown = server.waitForNotifyCalls(2);
  ASSERT_EQ(shown.size(), 2u) << service_->log();
  EXPECT_EQ(shown[1].summary, "Important Updates Available");
  EXPECT_EQ(server.waitForCloseCalls(1), std::vector<std::uint32_t>{41});

  // The list outlives the service; the server still shows what it showed.
  ASSERT_EQ(service_->stop(), 0);
  startService(store_->bagURL());
  list = delivered();
  ASSERT_EQ(list.size(), 1u) << list.dump();
  EXPECT_EQ(list[0]["serverIdentifier"], 42);

  // Nothing left to update: the notification goes, from the server too.
  reportAfterTheInterval("{}");
  EXPECT_EQ(server.waitForCloseCalls(2), (std::vector<std::uint32_t>{41, 42})) << service_->log();
  EXPECT_TRUE(delivered().empty());
  EXPECT_EQ(run({"notifications"}).status, 3);
}

TEST_F(NotificationServiceTest, AnActivationNamesItsNotificationAndAKnownAction) {
  start();
  reportAfterTheInterval(R"({"criticalUpdatesCount": 1})");
  const nlohmann::json list = delivered();
  ASSERT_EQ(list.size(), 1u) << service_->log();
  EXPECT_EQ(list[0]["displayed"], false);  // no server on this bus: recorded only
  const std::string identifier = list[0]["identifier"];

  EXPECT_EQ(run({"notifications", "--activate", identifier}).status, 0);
  const LarderctlRun unknown = run({"notifications", "--activate", "no-such-notification"});
  EXPECT_EQ(unknown.status, 1);
  EXPECT_NE(unknown.errors.find("no-such-notification"), std::string::npos) << unknown.errors;
  const LarderctlRun noEntry = run({"notifications", "--activate", identifier, "--action", "3"});
  EXPECT_EQ(noEntry.status, 1) << noEntry.output;
  EXPECT_EQ(run({"notifications", "--activate", identifier, "--action", "later"}).status, 2);
}

}  // namespace
}  // namespace larder::testing
