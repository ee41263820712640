// The center against a notification server in memory: delivery, the list
// file, activation and the server's signals.
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "notifications/center/DeliveredNotificationList.h"
#include "notifications/center/NotificationServer.h"
#include "notifications/center/UserNotificationCenter.h"
#include "tests/unit/ScopedEnvironment.h"
#include "tests/unit/TemporaryFolder.h"
#include "tests/unit/notifications/FakeNotificationServer.h"
#include "tests/unit/notifications/NotificationCenterTestSupport.h"

namespace larder::testing {
namespace {

using Call = FakeNotificationServer::Call;

UserNotification makeNotification(std::string title, std::int64_t style = UserNotification::kBanner,
                                  std::vector<std::string> menu = {}) {
  UserNotification notification;
  notification.title = std::move(title);
  notification.informativeText = "Some text";
  notification.actionButtonTitle = "Open";
  notification.otherButtonTitle = "Close";
  notification.displayStyle = style;
  notification.alternateActionButtonTitles = std::move(menu);
  notification.userInfo = PlistDictionary{{"Source", "update-controller"},
                                          {"bundles", PlistArray{"com.example.one", 42}}};
  return notification;
}

bool contains(const std::vector<UserNotification>& notifications, const std::string& identifier) {
  return std::ranges::any_of(notifications, [&](const UserNotification& notification) {
    return notification.identifier == identifier;
  });
}

class UserNotificationCenterTest : public ::testing::Test {
 protected:
  std::shared_ptr<UserNotificationCenter> makeCenter(
      UserNotificationCenter::Type type = UserNotificationCenter::kSystemCenter) {
    auto center = UserNotificationCenter::makeForTesting("com.example.tests", type, listPath());
    center->setServer(server_);
    center->setDelegate(delegate_);
    return center;
  }
  [[nodiscard]] std::string listPath() const { return folder_ / "notifications/list.plist"; }

  // Delivers and waits until the server shows it; the record as shown.
  UserNotification deliverShown(UserNotificationCenter& center, UserNotification notification) {
    const std::string identifier = center.deliverNotification(std::move(notification)).identifier;
    EXPECT_TRUE(eventually([&] { return contains(center.displayedNotifications(), identifier); }));
    for (const UserNotification& shown : center.displayedNotifications()) {
      if (shown.identifier == identifier) return shown;
    }
    return {};
  }

  TemporaryFolder folder_{"larder-notifications"};
  std::shared_ptr<FakeNotificationServer> server_ = std::make_shared<FakeNotificationServer>();
  std::shared_ptr<RecordingDelegate> delegate_ = std::make_shared<RecordingDelegate>();
};

TEST_F(UserNotificationCenterTest, DeliveryReturnsWhileTheServerIsBusyAndRecordsItsIdentifier) {
  auto center = makeCenter();
  server_->hold();
  const UserNotification delivered = center->deliverNotification(makeNotification("First"));
  // Back while the server has not answered yet.
  EXPECT_FALSE(delivered.identifier.empty());
  EXPECT_TRUE(delivered.actualDeliveryDate.has_value());
  ASSERT_EQ(center->deliveredNotifications().size(), 1u);
  EXPECT_TRUE(center->displayedNotifications().empty());
  server_->release();

  ASSERT_TRUE(eventually([&] { return center->displayedNotifications().size() == 1; }));
  const UserNotification shown = center->displayedNotifications().front();
  EXPECT_EQ(shown.identifier, delivered.identifier);
  EXPECT_EQ(shown.serverIdentifier, 1u);
  const std::vector<Call> calls = server_->waitForCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].request, NotificationRequest::forNotification(delivered));
}

TEST_F(UserNotificationCenterTest, ListSurvivesTheCenterAndARemovalClosesTheStoredIdentifier) {
  std::vector<UserNotification> before;
  {
    auto center = makeCenter();
    const UserNotification one = deliverShown(*center, makeNotification("One"));
    // Every field away from its default, so that each must survive.
    UserNotification two = makeNotification("Two", UserNotification::kAlert, {"Tonight"});
    two.hasActionButton = false;
    two.imageURL = "file:///usr/share/icons/larder.png";
    two.poofsOnCancel = false;
    two.alwaysShowAlternateActionMenu = true;
    two.style = UserNotification::kPostInstallStyle;
    two.clearable = true;
    deliverShown(*center, two);
    // A click on the contents is kept on the record.
    ASSERT_TRUE(center->activate(one.identifier, "default"));
    // A record that was never shown, with nothing of the server's.
    UserNotification hidden = makeNotification("Hidden");
    hidden.userInfo["hidden"] = true;
    center->deliverNotification(hidden);
    before = center->deliveredNotifications();
    ASSERT_TRUE(eventually([&] { return DeliveredNotificationList(listPath()).read() == before; }));
  }
  ASSERT_EQ(before.size(), 3u);

  auto again = UserNotificationCenter::makeForTesting(
      "com.example.tests", UserNotificationCenter::kSystemCenter, listPath());
  auto newServer = std::make_shared<FakeNotificationServer>();
  again->setServer(newServer);
  EXPECT_EQ(again->deliveredNotifications(), before);
  EXPECT_EQ(again->deliveredNotifications()[0].source(), "update-controller");
  EXPECT_EQ(again->deliveredNotifications()[0].activationType, UserNotification::kContentsClicked);
  EXPECT_EQ(again->deliveredNotifications()[1].style, UserNotification::kPostInstallStyle);
  EXPECT_EQ(again->deliveredNotifications()[1].serverIdentifier, 2u);

  again->removeDeliveredNotification(before[1]);
  const std::vector<Call> calls = newServer->waitForCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].kind, Call::kClose);
  EXPECT_EQ(calls[0].serverIdentifier, 2u);
  EXPECT_FALSE(contains(again->deliveredNotifications(), before[1].identifier));
  // The hidden one was never shown: removing it asks nothing of the server.
  again->removeDeliveredNotification(before[2]);
  again->removeDeliveredNotification(before[0]);
  ASSERT_EQ(newServer->waitForCalls(2).size(), 2u);
  EXPECT_EQ(newServer->waitForCalls(2)[1].serverIdentifier, 1u);
  EXPECT_TRUE(again->deliveredNotifications().empty());
}

struct ActivationCase {
  std::string key;
  std::int64_t style;
  RecordingDelegate::Call::Kind call;
  std::int64_t activationType;
  std::int64_t alternateIndex;
  bool leavesList;
};

TEST_F(UserNotificationCenterTest, ActivationKeysReachTheDelegate) {
  using enum RecordingDelegate::Call::Kind;
  constexpr auto kNone = UserNotification::kNoAlternateAction;
  constexpr auto kBanner = UserNotification::kBanner;
  constexpr auto kAlert = UserNotification::kAlert;
  const std::vector<ActivationCase> cases{
      {"default", kBanner, kActivated, UserNotification::kContentsClicked, kNone, false},
      {"default", kAlert, kActivated, UserNotification::kContentsClicked, kNone, false},
      {"action", kBanner, kActivated, UserNotification::kActionButtonClicked, kNone, false},
      {"action", kAlert, kActivated, UserNotification::kActionButtonClicked, kNone, true},
      {"alternate-0", kAlert, kActivated, UserNotification::kActionButtonClicked, 0, true},
      {"alternate-1", kAlert, kActivated, UserNotification::kActionButtonClicked, 1, true},
      {"other", kAlert, kDismissed, UserNotification::kActivationNone, kNone, true},
      {"other", kBanner, kDismissed, UserNotification::kActivationNone, kNone, true},
      {"snooze", kAlert, kSnoozed, UserNotification::kActivationNone, kNone, false},
      {"snooze", kBanner, kSnoozed, UserNotification::kActivationNone, kNone, false},
  };
  auto center = makeCenter(UserNotificationCenter::kApplicationCenter);
  for (std::size_t row = 0; row < cases.size(); ++row) {
    const ActivationCase& expected = cases[row];
    SCOPED_TRACE(expected.key + " style " + std::to_string(expected.style));
    const UserNotification delivered = center->deliverNotification(
        makeNotification("Row " + std::to_string(row), expected.style, {"Tonight", "Tomorrow"}));
    ASSERT_TRUE(center->activate(delivered.identifier, expected.key));
    const std::vector<RecordingDelegate::Call> calls = delegate_->waitForCalls(row + 1);
    ASSERT_EQ(calls.size(), row + 1);
    const RecordingDelegate::Call& call = calls.back();
    EXPECT_EQ(call.kind, expected.call);
    EXPECT_EQ(call.notification.identifier, delivered.identifier);
    EXPECT_EQ(call.notification.userInfo, delivered.userInfo);
    EXPECT_EQ(call.notification.activationType, expected.activationType);
    EXPECT_EQ(call.notification.alternateActionIndex, expected.alternateIndex);
    // Out of the list before the delegate hears of it.
    EXPECT_EQ(call.wasInList, !expected.leavesList);
    EXPECT_EQ(contains(center->deliveredNotifications(), delivered.identifier),
              !expected.leavesList);
  }
}

TEST_F(UserNotificationCenterTest, UnknownNotificationsAndKeysAreErrorsThatChangeNothing) {
  auto center = makeCenter(UserNotificationCenter::kApplicationCenter);
  const UserNotification delivered = center->deliverNotification(
      makeNotification("Menu", UserNotification::kAlert, {"Tonight", "Tomorrow"}));

  const Result<void> unknownNotification = center->activate("NOT-A-NOTIFICATION", "default");
  ASSERT_FALSE(unknownNotification);
  EXPECT_EQ(unknownNotification.error().domain, UserNotificationCenter::kErrorDomain);
  EXPECT_EQ(unknownNotification.error().code, UserNotificationCenter::kUnknownNotificationCode);
  EXPECT_NE(unknownNotification.error().description.find("NOT-A-NOTIFICATION"), std::string::npos);
  for (const std::string key :
       {"", "close", "Default", "alternate-", "alternate-2", "alternate--1", "alternate-+1",
        "alternate-1x", "alternate- 1", "alternate-99999999999999999999"}) {
    SCOPED_TRACE(key);
    const Result<void> result = center->activate(delivered.identifier, key);
    ASSERT_FALSE(result);
    EXPECT_EQ(result.error().code, UserNotificationCenter::kUnknownActionCode);
  }
  EXPECT_EQ(center->deliveredNotifications(), std::vector<UserNotification>{delivered});
  // The delegate's queue keeps order: had an error reached it, it would
  // have come before this.
  ASSERT_TRUE(center->activate(delivered.identifier, "default"));
  const std::vector<RecordingDelegate::Call> calls = delegate_->waitForCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].notification.activationType, UserNotification::kContentsClicked);
}

TEST_F(UserNotificationCenterTest, WithoutADelegateAnActivationIsOnlyLogged) {
  LogLines log;
  auto center = UserNotificationCenter::makeForTesting(
      "com.example.tests", UserNotificationCenter::kApplicationCenter, listPath());
  const UserNotification alert =
      center->deliverNotification(makeNotification("Alert", UserNotification::kAlert));
  ASSERT_TRUE(center->activate(alert.identifier, "other"));
  EXPECT_TRUE(log.has(2, "UserNotificationCenter: Notification " + alert.identifier +
                             " activated with \"other\"; no delegate to tell"));
  EXPECT_EQ(center->deliveredNotifications(), std::vector<UserNotification>{alert});
}

TEST_F(UserNotificationCenterTest, ServerSignalsActivateAndCloseTheirNotifications) {
  auto center = makeCenter();
  const UserNotification banner = deliverShown(*center, makeNotification("Banner"));
  const UserNotification alert =
      deliverShown(*center, makeNotification("Alert", UserNotification::kAlert, {"Tonight"}));

  // Another application's notification, then ours.
  server_->emitActionInvoked(77, "default");
  server_->emitActionInvoked(alert.serverIdentifier, "alternate-0");
  const std::vector<RecordingDelegate::Call> calls = delegate_->waitForCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].notification.identifier, alert.identifier);
  EXPECT_EQ(calls[0].notification.alternateActionIndex, 0);
  EXPECT_FALSE(calls[0].wasInList);
  // The alert left the list while on screen: the center closes it.
  const std::vector<Call> serverCalls = server_->waitForCalls(3);
  ASSERT_EQ(serverCalls.size(), 3u);
  EXPECT_EQ(serverCalls[2].kind, Call::kClose);
  EXPECT_EQ(serverCalls[2].serverIdentifier, alert.serverIdentifier);

  // Closed on the server (dismissed by the user): off the screen, still listed.
  server_->emitClosed(banner.serverIdentifier, 2);
  ASSERT_TRUE(eventually([&] { return center->displayedNotifications().empty(); }));
  ASSERT_EQ(center->deliveredNotifications().size(), 1u);
  EXPECT_EQ(center->deliveredNotifications()[0].identifier, banner.identifier);
  EXPECT_FALSE(center->deliveredNotifications()[0].displayed);
}

// A snooze puts the notification away: off the screen, still listed.
TEST_F(UserNotificationCenterTest, ASnoozeClosesOnTheServerAndKeepsTheRecord) {
  auto center = makeCenter();
  const UserNotification alert =
      deliverShown(*center, makeNotification("Alert", UserNotification::kAlert));
  server_->emitActionInvoked(alert.serverIdentifier, "snooze");
  const std::vector<RecordingDelegate::Call> calls = delegate_->waitForCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].kind, RecordingDelegate::Call::kSnoozed);
  EXPECT_TRUE(calls[0].wasInList);
  const std::vector<Call> serverCalls = server_->waitForCalls(2);
  ASSERT_EQ(serverCalls.size(), 2u);
  EXPECT_EQ(serverCalls[1].kind, Call::kClose);
  EXPECT_EQ(serverCalls[1].serverIdentifier, alert.serverIdentifier);
  ASSERT_EQ(center->deliveredNotifications().size(), 1u);
  EXPECT_FALSE(center->deliveredNotifications()[0].displayed);
}

TEST_F(UserNotificationCenterTest, RemovingFromTheScreenOrReplacingTheListClosesOnTheServer) {
  auto center = makeCenter();
  const UserNotification first = deliverShown(*center, makeNotification("First"));
  const UserNotification second = deliverShown(*center, makeNotification("Second"));
  const UserNotification third = deliverShown(*center, makeNotification("Third"));

  center->removeDisplayedNotification(first);
  ASSERT_EQ(server_->waitForCalls(4).size(), 4u);
  EXPECT_EQ(server_->waitForCalls(4)[3].serverIdentifier, first.serverIdentifier);
  EXPECT_EQ(center->deliveredNotifications().size(), 3u);
  EXPECT_EQ(center->displayedNotifications().size(), 2u);

  center->setDeliveredNotifications({first, third});
  const std::vector<Call> calls = server_->waitForCalls(5);
  ASSERT_EQ(calls.size(), 5u);
  EXPECT_EQ(calls[4].kind, Call::kClose);
  EXPECT_EQ(calls[4].serverIdentifier, second.serverIdentifier);
  EXPECT_EQ(center->deliveredNotifications(), (std::vector<UserNotification>{first, third}));
}

TEST_F(UserNotificationCenterTest, DelegateThatDeclinesAndApplicationCentersShowNothing) {
  auto application = makeCenter(UserNotificationCenter::kApplicationCenter);
  application->deliverNotification(makeNotification("Listed only"));
  auto center = makeCenter();
  UserNotification hidden = makeNotification("Hidden");
  hidden.userInfo["hidden"] = true;
  center->deliverNotification(hidden);
  const UserNotification shown = center->deliverNotification(makeNotification("Shown"));
  // Every server call is made in delivery order: the first one the server
  // sees is the last delivery.
  const std::vector<Call> calls = server_->waitForCalls(1);
  ASSERT_GE(calls.size(), 1u);
  EXPECT_EQ(calls[0].request.summary, "Shown");
  ASSERT_TRUE(eventually([&] { return center->displayedNotifications().size() == 1; }));
  EXPECT_EQ(center->deliveredNotifications().size(), 2u);
  EXPECT_EQ(application->deliveredNotifications().size(), 1u);
}

TEST_F(UserNotificationCenterTest, WithoutAServerThePostIsRecordedAndLogged) {
  LogLines log;
  server_->failWith(VendError::withDomain(std::string(NotificationServer::kErrorDomain),
                                          NotificationServer::kNoServerCode, "ServiceUnknown"));
  auto center = makeCenter();
  const UserNotification delivered = center->deliverNotification(makeNotification("Nobody"));
  const std::string line =
      "UserNotificationCenter: No notification server on the session bus; "
      "notification " +
      delivered.identifier + " recorded, not shown";
  ASSERT_TRUE(eventually([&] { return log.has(2, line); }));
  EXPECT_EQ(center->deliveredNotifications().size(), 1u);
  EXPECT_TRUE(center->displayedNotifications().empty());
}

TEST_F(UserNotificationCenterTest, DamagedOrMissingListIsAnEmptyList) {
  LogLines log;
  EXPECT_TRUE(makeCenter()->deliveredNotifications().empty());
  std::filesystem::create_directories(folder_ / "notifications");
  for (const std::string contents : {"bplist00 this is not a property list",
                                     "<?xml version=\"1.0\"?><plist><array><string>x</string>"
                                     "</array></plist>"}) {
    std::ofstream(listPath(), std::ios::binary | std::ios::trunc) << contents;
    auto center = makeCenter();
    EXPECT_TRUE(center->deliveredNotifications().empty());
    // And the center still works, and writes a good list over the bad one.
    center->deliverNotification(makeNotification("After"));
    ASSERT_TRUE(
        eventually([&] { return DeliveredNotificationList(listPath()).read().size() == 1; }));
  }
  EXPECT_TRUE(log.hasContaining(1, "is damaged"));
  const std::vector<UserNotification> reread = DeliveredNotificationList(listPath()).read();
  ASSERT_EQ(reread.size(), 1u);
  EXPECT_EQ(reread[0].title, "After");
}

TEST(UserNotificationCenterRegistryTest, OneCenterPerIdentifierAndTypeWithItsListInTheStateFolder) {
  TemporaryFolder state{"larder-notification-state"};
  ScopedEnvironment environment;
  environment.set("XDG_STATE_HOME", state.path());
  // The process keeps its centers: a name of this run's own.
  const std::string identifier =
      "com.example.registry." + std::filesystem::path(state.path()).filename().string();
  auto center = UserNotificationCenter::centerForIdentifier(
      identifier, UserNotificationCenter::kApplicationCenter);
  EXPECT_EQ(center, UserNotificationCenter::centerForIdentifier(
                        identifier, UserNotificationCenter::kApplicationCenter));
  EXPECT_NE(center, UserNotificationCenter::centerForIdentifier(
                        identifier + ".other", UserNotificationCenter::kApplicationCenter));
  const UserNotification delivered = center->deliverNotification(makeNotification("Stored"));
  const DeliveredNotificationList list(state / ("larder/notifications/" + identifier + ".plist"));
  ASSERT_TRUE(eventually([&] { return list.read().size() == 1; }));
  EXPECT_EQ(list.read()[0], delivered);
  // The shared center outlives the folder: leave it with an empty list.
  center->setDeliveredNotifications({});
  ASSERT_TRUE(eventually([&] { return list.read().empty(); }));
}

}  // namespace
}  // namespace larder::testing
