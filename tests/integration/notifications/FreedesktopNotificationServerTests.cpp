// The center with its real connection to the session bus, against a
// recording notification server on a private bus: what goes over the bus,
// and what comes back.
#include <gtest/gtest.h>

#include <chrono>

#include <sdbus-c++/sdbus-c++.h>

#include "notifications/center/FreedesktopNotificationServer.h"
#include "notifications/center/UserNotificationCenter.h"
#include "tests/integration/notifications/NotificationTestProcesses.h"
#include "tests/integration/notifications/RecordingNotificationServer.h"
#include "tests/unit/notifications/NotificationCenterTestSupport.h"

namespace larder::testing {
namespace {

UserNotification alertWithMenu() {
  UserNotification notification;
  notification.title = "Updates could not be installed";
  notification.informativeText = "Try again <i>tonight</i>?";
  notification.actionButtonTitle = "Details";
  notification.otherButtonTitle = "Close";
  notification.displayStyle = UserNotification::kAlert;
  notification.poofsOnCancel = false;
  notification.alternateActionButtonTitles = {"Try Tonight", "Remind Me Tomorrow"};
  notification.imageURL = "/usr/share/icons/hicolor/48x48/apps/larder.png";
  notification.userInfo = PlistDictionary{{"Source", "update-controller"}};
  return notification;
}

class FreedesktopNotificationServerTest : public ::testing::Test {
 protected:
  // Delivers and waits until the server shows it; the record as shown.
  UserNotification deliverShown(UserNotification notification) {
    const std::string identifier = center_->deliverNotification(std::move(notification)).identifier;
    UserNotification shown;
    EXPECT_TRUE(eventually([&] {
      for (const UserNotification& record : center_->displayedNotifications()) {
        if (record.identifier == identifier) shown = record;
      }
      return !shown.identifier.empty();
    }));
    return shown;
  }

  // Destroyed in reverse: the center leaves the bus before the server and
  // the bus go.
  PrivateSessionBus bus_;
  RecordingNotificationServer server_{bus_.address(), 41};
  std::shared_ptr<RecordingDelegate> delegate_ = std::make_shared<RecordingDelegate>();
  std::shared_ptr<UserNotificationCenter> center_ = [this] {
    auto center = UserNotificationCenter::makeForTesting("com.example.desktop",
                                                         UserNotificationCenter::kSystemCenter,
                                                         bus_.folder() / "notifications.plist");
    center->setServer(std::make_shared<FreedesktopNotificationServer>(bus_.address()));
    center->setDelegate(delegate_);
    return center;
  }();
};

TEST_F(FreedesktopNotificationServerTest, NotifyCarriesTheExactArgumentsAndRemovalClosesTheId) {
  const UserNotification shown = deliverShown(alertWithMenu());
  EXPECT_EQ(shown.serverIdentifier, 41u);

  const std::vector<RecordingNotificationServer::NotifyCall> calls = server_.waitForNotifyCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  const RecordingNotificationServer::NotifyCall expected{
      "larder",
      0,
      "",
      "Updates could not be installed",
      "Try again <i>tonight</i>?",
      {"default", "", "action", "Details", "other", "Close", "alternate-0", "Try Tonight",
       "alternate-1", "Remind Me Tomorrow"},
      {{"urgency", "y 2"},
       {"resident", "b true"},
       {"image-path", "s /usr/share/icons/hicolor/48x48/apps/larder.png"},
       {"desktop-entry", "s larder"}},
      0,
      41};
  EXPECT_EQ(calls[0], expected);

  center_->removeDeliveredNotification(shown);
  EXPECT_EQ(server_.waitForCloseCalls(1), std::vector<std::uint32_t>{41});
  EXPECT_TRUE(center_->deliveredNotifications().empty());
}

TEST_F(FreedesktopNotificationServerTest, SignalsOfTheServerReachTheCenterAndAnImpostorsDoNot) {
  const UserNotification alert = deliverShown(alertWithMenu());
  UserNotification banner = alertWithMenu();
  banner.displayStyle = UserNotification::kBanner;
  const UserNotification shownBanner = deliverShown(banner);

  // A peer that does not own the server's name sends the server's signal.
  auto impostor = bus_.connect();
  auto object = sdbus::createObject(*impostor, RecordingNotificationServer::kPath);
  object->registerSignal("ActionInvoked")
      .onInterface(RecordingNotificationServer::kInterface)
      .withParameters<std::uint32_t, std::string>();
  object->finishRegistration();
  object->emitSignal("ActionInvoked")
      .onInterface(RecordingNotificationServer::kInterface)
      .withArguments(alert.serverIdentifier, std::string("other"));
  // The bus has routed the impostor's signal once it answers its next call.
  std::string busIdentifier;
  sdbus::createProxy(*impostor, "org.freedesktop.DBus", "/org/freedesktop/DBus")
      ->callMethod("GetId")
      .onInterface("org.freedesktop.DBus")
      .storeResultsTo(busIdentifier);
  server_.emitActionInvoked(alert.serverIdentifier, "alternate-1");

  // Had the impostor's signal come through, its dismissal would be first.
  const std::vector<RecordingDelegate::Call> calls = delegate_->waitForCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].kind, RecordingDelegate::Call::kActivated);
  EXPECT_EQ(calls[0].notification.identifier, alert.identifier);
  EXPECT_EQ(calls[0].notification.activationType, UserNotification::kActionButtonClicked);
  EXPECT_EQ(calls[0].notification.alternateActionIndex, 1);
  EXPECT_EQ(calls[0].notification.userInfo, alert.userInfo);
  // The alert is done with, and the center takes it off the screen.
  EXPECT_EQ(server_.waitForCloseCalls(1), std::vector<std::uint32_t>{alert.serverIdentifier});

  server_.emitClosed(shownBanner.serverIdentifier, 2);
  ASSERT_TRUE(eventually([&] { return center_->displayedNotifications().empty(); }));
  ASSERT_EQ(center_->deliveredNotifications().size(), 1u);
  EXPECT_EQ(center_->deliveredNotifications()[0].identifier, shownBanner.identifier);
}

struct AbsentServerCase {
  std::string name;
  // Empty: the test's bus, where nobody owns the server's name.
  std::string busAddress;
};

TEST(FreedesktopNotificationServerAbsentTest, PostIsRecordedAndLoggedWithNoServer) {
  PrivateSessionBus bus;
  const std::vector<AbsentServerCase> cases{
      {"no server on the bus", ""},
      {"no session bus", "unix:path=" + (bus.folder() / "no-bus-here")},
  };
  for (std::size_t index = 0; index < cases.size(); ++index) {
    const AbsentServerCase& row = cases[index];
    SCOPED_TRACE(row.name);
    LogLines log;
    auto center = UserNotificationCenter::makeForTesting(
        "com.example.absent", UserNotificationCenter::kSystemCenter,
        bus.folder() / ("absent-" + std::to_string(index) + ".plist"));
    center->setServer(std::make_shared<FreedesktopNotificationServer>(
        row.busAddress.empty() ? bus.address() : row.busAddress));
    UserNotification notification;
    notification.title = "Nobody sees this";
    // That the post does not wait for the server is proven in the center's
    // unit tests with a server held busy, and measured in its benchmark.
    const UserNotification delivered = center->deliverNotification(notification);

    const std::string line =
        "UserNotificationCenter: No notification server on the session bus; notification " +
        delivered.identifier + " recorded, not shown";
    EXPECT_TRUE(eventually([&] { return log.has(2, line); }));
    ASSERT_EQ(center->deliveredNotifications().size(), 1u);
    EXPECT_EQ(center->deliveredNotifications()[0].identifier, delivered.identifier);
    EXPECT_TRUE(center->displayedNotifications().empty());
    center->removeDeliveredNotification(delivered);
  }
}

}  // namespace
}  // namespace larder::testing
