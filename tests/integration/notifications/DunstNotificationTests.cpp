// The center against a real notification server of the desktop: dunst on
// a virtual X display (Xvfb), both on the test's private bus.
#include <gtest/gtest.h>

#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <optional>

#include <sdbus-c++/sdbus-c++.h>

#include "notifications/center/FreedesktopNotificationServer.h"
#include "notifications/center/UserNotificationCenter.h"
#include "tests/integration/notifications/NotificationTestProcesses.h"
#include "tests/unit/notifications/NotificationCenterTestSupport.h"

namespace larder::testing {
namespace {

constexpr const char* kXvfb = "/usr/bin/Xvfb";
constexpr const char* kDunst = "/usr/bin/dunst";
constexpr const char* kServerInterface = "org.freedesktop.Notifications";
// dunst's own control interface, the one dunstctl uses.
constexpr const char* kDunstInterface = "org.dunstproject.cmd0";

// What the test sees of the server from outside, and what it does as the
// user would. dunst sends its signals to the client that posted, so they
// are seen by the center only.
class ServerControl {
 public:
  explicit ServerControl(const PrivateSessionBus& bus)
      : connection_(bus.connect()),
        proxy_(
            sdbus::createProxy(*connection_, kServerInterface, "/org/freedesktop/Notifications")) {}

  // The server's name, once it answers.
  std::optional<std::string> serverName() {
    try {
      std::string name, vendor, version, specVersion;
      proxy_->callMethod("GetServerInformation")
          .onInterface(kServerInterface)
          .withTimeout(std::chrono::seconds(2))
          .storeResultsTo(name, vendor, version, specVersion);
      return name;
    } catch (const sdbus::Error&) {
      return std::nullopt;
    }
  }

  // How many notifications dunst has on screen; none when it cannot say.
  std::optional<std::uint32_t> displayedCount() {
    try {
      return proxy_->getProperty("displayedLength")
          .onInterface(kDunstInterface)
          .get<std::uint32_t>();
    } catch (const sdbus::Error&) {
      return std::nullopt;
    }
  }

  // The default action of the first notification on screen, as a click.
  void clickFirstNotification() {
    proxy_->callMethod("NotificationAction").onInterface(kDunstInterface).withArguments(0u);
  }
  // Every notification on screen closed, as the user would close them.
  void closeAll() { proxy_->callMethod("NotificationCloseAll").onInterface(kDunstInterface); }

 private:
  std::unique_ptr<sdbus::IConnection> connection_;
  std::unique_ptr<sdbus::IProxy> proxy_;
};

class DunstNotificationTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (access(kXvfb, X_OK) != 0) GTEST_SKIP() << kXvfb << " is not installed (package xvfb)";
    if (access(kDunst, X_OK) != 0) GTEST_SKIP() << kDunst << " is not installed (package dunst)";

    // Xvfb picks a free display itself and writes its number to fd 3.
    int ends[2];
    ASSERT_EQ(pipe2(ends, O_CLOEXEC), 0);
    xvfb_ = std::make_unique<ChildProcess>(
        std::vector<std::string>{kXvfb, "-displayfd", "3", "-nolisten", "tcp", "-screen", "0",
                                 "800x600x24"},
        std::map<std::string, std::string>{}, bus_.folder() / "xvfb.log", ends[1]);
    close(ends[1]);
    const std::string display = PrivateSessionBus::readLine(ends[0], std::chrono::seconds(10));
    close(ends[0]);
    if (display.empty()) GTEST_SKIP() << "Xvfb did not start: " << xvfb_->log();

    const std::string config = bus_.folder() / "dunstrc";
    std::ofstream(config) << "[global]\n    font = Monospace 8\n";
    dunst_ = std::make_unique<ChildProcess>(
        std::vector<std::string>{kDunst, "-config", config},
        std::map<std::string, std::string>{{"DISPLAY", ":" + display},
                                           {"DBUS_SESSION_BUS_ADDRESS", bus_.address()}},
        bus_.folder() / "dunst.log");
    control_ = std::make_unique<ServerControl>(bus_);
    std::optional<std::string> name;
    eventually([&] { return (name = control_->serverName()).has_value() || !dunst_->isRunning(); },
               std::chrono::seconds(10));
    if (!name) GTEST_SKIP() << "dunst did not come on the bus: " << dunst_->log();
    ASSERT_EQ(*name, "dunst");
    // dunstctl's interface: older dunst has none.
    if (!control_->displayedCount()) {
      GTEST_SKIP() << "this dunst has no control interface (" << kDunstInterface << ")";
    }

    center_ = UserNotificationCenter::makeForTesting(
        "com.example.dunst", UserNotificationCenter::kSystemCenter, bus_.folder() / "list.plist");
    center_->setServer(std::make_shared<FreedesktopNotificationServer>(bus_.address()));
    center_->setDelegate(delegate_);
  }

  // Delivers and waits until the server has given it its identifier.
  UserNotification deliverShown(const std::string& title) {
    UserNotification notification;
    notification.title = title;
    notification.informativeText = "From the dunst test";
    const std::string identifier = center_->deliverNotification(notification).identifier;
    UserNotification shown;
    EXPECT_TRUE(eventually([&] {
      for (const UserNotification& record : center_->displayedNotifications()) {
        if (record.identifier == identifier) shown = record;
      }
      return shown.serverIdentifier != 0;
    })) << dunst_->log();
    return shown;
  }

  // Built in this order, torn down in the reverse one: the center and the
  // watcher leave the bus before dunst, Xvfb and the bus stop.
  PrivateSessionBus bus_;
  std::unique_ptr<ChildProcess> xvfb_;
  std::unique_ptr<ChildProcess> dunst_;
  std::unique_ptr<ServerControl> control_;
  std::shared_ptr<RecordingDelegate> delegate_ = std::make_shared<RecordingDelegate>();
  std::shared_ptr<UserNotificationCenter> center_;
};

TEST_F(DunstNotificationTest, DeliveredNotificationsAppearAndRemovalClosesThem) {
  LogLines log;
  const UserNotification first = deliverShown("First");
  ASSERT_NE(first.serverIdentifier, 0u);
  EXPECT_TRUE(eventually([&] { return control_->displayedCount() == 1u; })) << dunst_->log();
  center_->removeDeliveredNotification(first);
  EXPECT_TRUE(eventually([&] { return control_->displayedCount() == 0u; })) << dunst_->log();
  // dunst's NotificationClosed came back with reason 3: closed by our call.
  const auto closedLine = [](const UserNotification& notification) {
    return "UserNotificationCenter: The notification server closed " +
           std::to_string(notification.serverIdentifier) + " (reason 3)";
  };
  EXPECT_TRUE(eventually([&] { return log.has(3, closedLine(first)); }));

  const UserNotification second = deliverShown("Second");
  EXPECT_NE(second.serverIdentifier, first.serverIdentifier);
  EXPECT_TRUE(eventually([&] { return control_->displayedCount() == 1u; })) << dunst_->log();
  center_->removeDeliveredNotification(second);
  EXPECT_TRUE(eventually([&] { return control_->displayedCount() == 0u; })) << dunst_->log();
  EXPECT_TRUE(eventually([&] { return log.has(3, closedLine(second)); }));
  EXPECT_TRUE(center_->deliveredNotifications().empty());
}

TEST_F(DunstNotificationTest, WhatTheUserDoesOnTheServerReachesTheCenter) {
  const UserNotification clicked = deliverShown("Click me");
  ASSERT_TRUE(eventually([&] { return control_->displayedCount() == 1u; })) << dunst_->log();
  control_->clickFirstNotification();
  const std::vector<RecordingDelegate::Call> calls = delegate_->waitForCalls(1);
  ASSERT_EQ(calls.size(), 1u) << dunst_->log();
  EXPECT_EQ(calls[0].notification.identifier, clicked.identifier);
  EXPECT_EQ(calls[0].notification.activationType, UserNotification::kContentsClicked);
  EXPECT_TRUE(calls[0].wasInList);

  // Closed by the user on the server: off the screen, still in the list.
  control_->closeAll();
  EXPECT_TRUE(eventually([&] { return center_->displayedNotifications().empty(); }))
      << dunst_->log();
  ASSERT_EQ(center_->deliveredNotifications().size(), 1u);
  EXPECT_EQ(center_->deliveredNotifications()[0].identifier, clicked.identifier);
}

}  // namespace
}  // namespace larder::testing
