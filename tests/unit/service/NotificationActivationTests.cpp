// What the user does with a notification: the delegate's decision by
// source, activation type, menu entry and flags, seen by its effects on the
// update controller (a run enqueued, the later plans, the preference), on
// the store application (the launcher's record), on the trace log and on
// the notification itself.
#include <gtest/gtest.h>

#include <cmath>
#include <fstream>
#include <nlohmann/json.hpp>

#include "ServiceTestSupport.h"
#include "notifications/activation/UserNotificationCenterDelegate.h"
#include "notifications/center/UserNotificationCenter.h"
#include "platform/dispatch/DispatchQueue.h"
#include "platform/system/FileIO.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/LedgerQuaymartLauncher.h"
#include "store-runtime/host/LedgerTraceMessage.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/services/VendOperationQueue.h"
#include "tests/unit/OSUpdateOffers.h"
#include "tests/unit/notifications/FakeNotificationServer.h"
#include "update-controller/UpdateController.h"

namespace larder::testing {
namespace {

constexpr std::int64_t kNone = UserNotification::kNoAlternateAction;
constexpr const char* kUpdatesPage = "quaymart://showUpdatesPage?source=notification";

// What the controller was asked, as its effects show it.
enum class Call {
  kNothing,
  kInstallAll,
  kInstallCritical,
  kLaterTonight,
  kLaterInAnHour,
  kRemindMe,
  kAutoUpdateOn
};
// Where the notification is afterwards.
enum class Fate { kOnScreen, kOffScreen, kRemoved };

struct Case {
  const char* name;
  PlistDictionary userInfo;
  std::vector<std::string> menu;
  std::int64_t activationType;
  std::int64_t menuIndex;
  Call call;
  const char* url;          // opened in the store application, or none
  const char* actionTaken;  // of the click trace, or none sent
  Fate fate;
  // Hours on screen before the activation, and as the trace tells them.
  int hoursShown = 0;
  std::int64_t tracedInterval = 0;
};

PlistDate nowDate() {
  using Seconds = std::chrono::duration<double>;
  return PlistDate{Seconds(std::chrono::system_clock::now().time_since_epoch()).count()};
}

PlistDictionary info(std::initializer_list<std::pair<const std::string, PlistValue>> extra) {
  PlistDictionary userInfo{{"storeClientIdentifier", "com.orvane.quaymart"},
                           {"storeClientFrameworkVersion", 3}};
  for (const auto& [key, value] : extra) userInfo[key] = value;
  return userInfo;
}

const std::vector<std::string> kLaterMenu{"In an Hour", "Tonight", "Remind Me Tomorrow",
                                          "Turn On Automatic Updates"};
const std::vector<std::string> kFailureMenu{"Install Now", "In an Hour", "Tonight",
                                            "Remind Me Tomorrow"};

class NotificationActivationTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    writeText("sys/class/power_supply/AC/type", "Mains\n");
    writeText("sys/class/power_supply/AC/online", "1\n");
    ASSERT_TRUE(PlatformStateFile::named("sessions.plist").updateValue([](PlistValue& value) {
      value = PlistArray{PlistDictionary{{"user", "user0"}, {"state", "active"}}};
    }));
    offerPlainUpdate();
    map_.emplace(options(storePath(), false));
    map_->waitUntilIdle();
    // The controller posts into a list of its own, apart from the one the
    // user acts on, so that a run's notifications do not mix with it.
    controller_ = UpdateController::make(
        *VendStoreClient::knownClientWithIdentifier("com.orvane.quaymart", 3), *map_,
        UserNotificationCenter::makeForTesting("com.orvane.larderd",
                                               UserNotificationCenter::kSystemCenter,
                                               temporary() + "/controller.plist"));
    center_ = UserNotificationCenter::makeForTesting(
        "com.orvane.larderd", UserNotificationCenter::kSystemCenter, temporary() + "/system.plist");
    center_->setServer(server_);
    applicationCenter_ = UserNotificationCenter::makeForTesting(
        "com.orvane.quaymart", UserNotificationCenter::kApplicationCenter,
        temporary() + "/application.plist");
    delegate_ = UserNotificationCenterDelegate::makeForTesting(
        [this](const VendStoreClient& client) {
          return client.identifier() == controller_->storeClient().identifier() ? controller_
                                                                                : nullptr;
        },
        applicationCenter_);
  }
  void TearDown() override {
    VendOperationQueue::mainQueue().waitUntilAllOperationsAreFinished();
    delegate_.reset();
    controller_.reset();
    // Their last writes land in the folder before it goes.
    for (auto* center : {&center_, &applicationCenter_}) {
      if (*center) (*center)->finishPendingWrites();
      center->reset();
    }
    DispatchQueue::globalQueue().barrierSync([] {});
    map_.reset();
    ServiceTest::TearDown();
  }

  void writeText(const std::string& rootedPath, std::string_view text) const {
    const fs::path path = fs::path(temporary()) / "root" / rootedPath;
    fs::create_directories(path.parent_path());
    ASSERT_TRUE(FileIO::writeAtomically(path.string(), text));
  }

  // Delivered and on screen, as the user finds it.
  UserNotification deliverShown(PlistDictionary userInfo, std::vector<std::string> menu = {}) {
    UserNotification notification;
    notification.title = "Updates";
    notification.userInfo = std::move(userInfo);
    notification.alternateActionButtonTitles = std::move(menu);
    const std::string identifier = center_->deliverNotification(notification).identifier;
    UserNotification shown;
    EXPECT_TRUE(eventually([&] {
      for (const UserNotification& record : center_->displayedNotifications()) {
        if (record.identifier == identifier) shown = record;
      }
      return shown.displayed;
    }));
    return shown;
  }

  [[nodiscard]] std::optional<UserNotification> listed(const std::string& identifier) const {
    for (const UserNotification& record : center_->deliveredNotifications()) {
      if (record.identifier == identifier) return record;
    }
    return std::nullopt;
  }

  static std::vector<std::string> launchedURLs() {
    std::vector<std::string> urls;
    const PlistValue state(
        PlatformStateFile(LedgerQuaymartLauncher::stateFilePath()).readDictionary());
    if (const PlistArray* launches = state["launches"].array()) {
      for (const PlistValue& launch : *launches) urls.push_back(*launch["url"].string());
    }
    return urls;
  }

  static std::vector<nlohmann::json> traces(std::string_view domain) {
    LedgerTraceMessageWaitUntilWritten();
    std::vector<nlohmann::json> found;
    std::ifstream file(LedgerTraceMessageLogPath());
    for (std::string line; std::getline(file, line);) {
      nlohmann::json record = nlohmann::json::parse(line);
      if (record["domain"] == domain) found.push_back(record["message"]);
    }
    return found;
  }

  static bool autoUpdateSwitchedOn() {
    return PreferenceStore::booleanForKey(kDefaultsAutoUpdateEnabledKey, kDaemonDefaultsID)
        .value_or(false);
  }

  // What the controller was asked, from what it left behind.
  Call observedCall(const LogCapture& log) const {
    const std::vector<LogCapture::Line> runs = log.linesContaining("Enqueuing UpdateOperation");
    if (!runs.empty()) {
      EXPECT_EQ(runs.size(), 1u) << log.dump();
      EXPECT_NE(runs[0].text.find("userInitiated"), std::string::npos) << runs[0].text;
      return runs[0].text.find("shouldInstallCriticalUpdatesOnly") != std::string::npos
                 ? Call::kInstallCritical
                 : Call::kInstallAll;
    }
    if (std::optional<std::int64_t> mode = LedgerTwilightAgent::armedMode()) {
      return *mode == UpdateController::kLaterTonight ? Call::kLaterTonight : Call::kLaterInAnHour;
    }
    // Tomorrow moves the last notification's date by a day less the
    // interval: away from the date the case began with.
    const std::optional<PlistDate> due = PreferenceStore::dateForKey(
        kDefaultsDidPostUpdatesAvailableNotificationDateKey, kDaemonDefaultsID);
    if (due && std::abs(due->secondsSince1970 - resetDate_.secondsSince1970) > 3600) {
      return Call::kRemindMe;
    }
    if (autoUpdateSwitchedOn()) return Call::kAutoUpdateOn;
    return Call::kNothing;
  }

  // Something that may wait for later, so that a later plan arms the agent.
  static void offerPlainUpdate() {
    // A case's install left it installed; offered again, it is new.
    ASSERT_TRUE(PlatformStateFile::named(SysupQuaymartUpdateController::kStateFileName)
                    .updateDictionary([](PlistDictionary& state) { state.erase("installed"); }));
    offerOSUpdates({PlistDictionary{{"productKey", "PLAIN"},
                                    {"title", "Plain"},
                                    {"versionString", "1"},
                                    {"isRecommended", true}}});
  }

  // Back to no plans and no switch between cases, and the update offered
  // again after a case installed it.
  void forgetCalls() {
    VendOperationQueue::mainQueue().waitUntilAllOperationsAreFinished();
    offerPlainUpdate();
    controller_->cancelUpdatesToBeInstalledLater();
    for (PreferenceScope scope : {PreferenceScope::App, PreferenceScope::System}) {
      ASSERT_TRUE(
          PreferenceStore::removeValue(kDefaultsAutoUpdateEnabledKey, kDaemonDefaultsID, scope));
    }
    resetDate_ = nowDate();
    ASSERT_TRUE(PreferenceStore::setValue(kDefaultsDidPostUpdatesAvailableNotificationDateKey,
                                          resetDate_, kDaemonDefaultsID, PreferenceScope::App));
  }

  std::optional<SoftwareMap> map_;
  std::shared_ptr<UpdateController> controller_;
  std::shared_ptr<FakeNotificationServer> server_ = std::make_shared<FakeNotificationServer>();
  std::shared_ptr<UserNotificationCenter> center_;
  std::shared_ptr<UserNotificationCenter> applicationCenter_;
  std::unique_ptr<UserNotificationCenterDelegate> delegate_;
  PlistDate resetDate_;
};

TEST_F(NotificationActivationTest, EachActivationAsksTheControllerOpensTracesAndPlacesAsItShould) {
  // clang-format off
  const PlistDictionary failure = info({{"Source", "AppUpdate"}, {"isDoItLaterFailure", true},
                                        {"alternateActionsIncludeInstallNow", true}});
  const PlistDictionary update = info({{"Source", "AppUpdate"}});
  const Case cases[] = {
      // name, user info, menu, activation type, menu entry -> call, URL, action taken, fate
      {"failure menu, the button", failure, kFailureMenu, 2, kNone, Call::kInstallAll, nullptr, "InstallUpdates", Fate::kRemoved},
      {"failure menu, entry 0", failure, kFailureMenu, 2, 0, Call::kInstallAll, nullptr, "InstallUpdates", Fate::kRemoved},
      {"failure menu, entry 1", failure, kFailureMenu, 2, 1, Call::kLaterInAnHour, nullptr, "DoItLater-1Hour", Fate::kRemoved},
      {"later menu, the button", update, kLaterMenu, 2, kNone, Call::kLaterTonight, nullptr, "DoItLater", Fate::kRemoved},
      {"later menu, entry 0", update, kLaterMenu, 2, 0, Call::kLaterInAnHour, nullptr, "DoItLater-1Hour", Fate::kRemoved},
      {"later menu, entry 2", update, kLaterMenu, 2, 2, Call::kRemindMe, nullptr, "DoItLater-RemindMe", Fate::kRemoved},
      {"later menu, entry 3", update, kLaterMenu, 2, 3, Call::kAutoUpdateOn, nullptr, "DoItLater-EnableAutoUpdate", Fate::kRemoved},
      {"no later offer", info({{"Source", "AppUpdate"}, {"OtherButtonIsDetails", true}}), {}, 2, kNone,
       Call::kInstallAll, nullptr, "InstallUpdates", Fate::kRemoved},
      {"critical, the button", info({{"Source", "AppUpdate"}, {"CriticalUpdate", true}}), {}, 2, kNone,
       Call::kInstallCritical, nullptr, "InstallCriticalUpdates", Fate::kRemoved},
      {"install now, contents", info({{"Source", "CriticalUpdateInstallNow"}, {"InstallOnDismiss", true}}), {}, 1, kNone,
       Call::kNothing, kUpdatesPage, "LaunchToUpdates", Fate::kOnScreen},
      {"admin installed, contents", info({{"Source", "adminInstalledUpdates"}, {"URL", "quaymart://showInstalled"}}), {}, 1, kNone,
       Call::kNothing, "quaymart://showInstalled", nullptr, Fate::kOffScreen},
      {"admin installed, no URL", info({{"Source", "adminInstalledUpdates"}, {"URL", "not a url"}}), {}, 1, kNone,
       Call::kNothing, nullptr, nullptr, Fate::kOffScreen},
      {"no source, contents, 123 hours on screen", info({}), {}, 1, kNone,
       Call::kNothing, kUpdatesPage, "LaunchToUpdates", Fate::kOffScreen, 123, 120},
      {"failure, contents", info({{"Source", "AppUpdate"}, {"isPostLogoutUpdateFailure", true}, {"auditInfoCacheKey", "K-1"}}), {}, 1, kNone,
       Call::kNothing, "quaymart://showUpdateFailure?auditInfoToken=K-1", "LaunchToUpdateFailureDetails", Fate::kOffScreen},
      {"claimed, contents", info({{"Source", "UTDClaimedButNotDownloaded"}}), {}, 1, kNone,
       Call::kNothing, "quaymart://showPurchasesPage", nullptr, Fate::kOffScreen},
      {"opt-in, the button", info({{"Source", "autoUpdateOptIn"}}), {}, 2, kNone,
       Call::kAutoUpdateOn, nullptr, nullptr, Fate::kRemoved},
      {"unknown source, the button", info({{"Source", "Elsewhere"}}), {}, 2, kNone,
       Call::kNothing, nullptr, nullptr, Fate::kRemoved},
  };
  // clang-format on
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    forgetCalls();
    const std::size_t launchesBefore = launchedURLs().size();
    const std::size_t tracesBefore =
        traces(UserNotificationCenterDelegate::kClickTraceDomain).size();
    UserNotification activated = deliverShown(c.userInfo, c.menu);
    activated.activationType = c.activationType;
    activated.alternateActionIndex = c.menuIndex;
    *activated.actualDeliveryDate -= std::chrono::hours(c.hoursShown);
    LogCapture log;
    delegate_->didActivateNotification(*center_, activated);

    EXPECT_EQ(observedCall(log), c.call) << log.dump();
    const std::vector<std::string> urls = launchedURLs();
    if (c.url) {
      ASSERT_EQ(urls.size(), launchesBefore + 1);
      EXPECT_EQ(urls.back(), c.url);
    } else {
      EXPECT_EQ(urls.size(), launchesBefore);
    }
    const std::vector<nlohmann::json> clicks =
        traces(UserNotificationCenterDelegate::kClickTraceDomain);
    if (c.actionTaken) {
      ASSERT_EQ(clicks.size(), tracesBefore + 1);
      const nlohmann::json& trace = clicks.back();
      EXPECT_EQ(trace["action_taken"], c.actionTaken);
      const PlistValue userInfo(c.userInfo);
      const std::string* source = userInfo["Source"].string();
      EXPECT_EQ(trace["source"], source ? *source : "");
      EXPECT_EQ(trace["button_clicked"], c.activationType == 1 ? "false" : "true");
      EXPECT_EQ(trace["is_critical_update"], userInfo["CriticalUpdate"].boolValue());
      EXPECT_EQ(trace["displayed_interval"], c.tracedInterval);
      EXPECT_TRUE(log.countContaining("UserNotificationCenterDelegate: Message tracing "
                                      "com.orvane.Quaymart.update_notification.clicked - ",
                                      3) == 1);
    } else {
      EXPECT_EQ(clicks.size(), tracesBefore);
    }
    const std::optional<UserNotification> after = listed(activated.identifier);
    switch (c.fate) {
      case Fate::kOnScreen:
        ASSERT_TRUE(after);
        EXPECT_TRUE(after->displayed);
        break;
      case Fate::kOffScreen:
        ASSERT_TRUE(after);
        EXPECT_FALSE(after->displayed);
        break;
      case Fate::kRemoved:
        EXPECT_FALSE(after);
        break;
    }
  }
  // The offer's answer went out for the one opt-in case.
  const std::vector<nlohmann::json> offers =
      traces(UserNotificationCenterDelegate::kOptInTraceDomain);
  ASSERT_EQ(offers.size(), 1u);
  EXPECT_EQ(offers[0]["result"], "pass");
}

// An alert's second button: install, or the details; either way the store
// application's list keeps it, clearable, unless it installed.
TEST_F(NotificationActivationTest, TheSecondButtonInstallsOrShowsDetailsAndKeepsTheNotification) {
  LogCapture log;
  UserNotification install = deliverShown(info({{"Source", "AppUpdate"}}), kLaterMenu);
  center_->removeDeliveredNotification(install);  // as the center does before telling
  delegate_->didDismissAlert(*center_, install);
  EXPECT_EQ(observedCall(log), Call::kInstallAll) << log.dump();
  EXPECT_TRUE(applicationCenter_->deliveredNotifications().empty());

  forgetCalls();
  log.clear();
  UserNotification details = deliverShown(info({{"Source", "AppUpdate"},
                                                {"OtherButtonIsDetails", true},
                                                {"isDoItLaterFailure", true},
                                                {"auditInfoCacheKey", "K-2"}}));
  center_->removeDeliveredNotification(details);
  delegate_->didDismissAlert(*center_, details);
  EXPECT_EQ(observedCall(log), Call::kNothing);
  ASSERT_FALSE(launchedURLs().empty());
  EXPECT_EQ(launchedURLs().back(), "quaymart://showUpdateFailure?auditInfoToken=K-2");
  const std::vector<UserNotification> kept = applicationCenter_->deliveredNotifications();
  ASSERT_EQ(kept.size(), 1u);
  EXPECT_EQ(kept[0].identifier, details.identifier);
  EXPECT_TRUE(kept[0].clearable);
  const std::vector<nlohmann::json> clicks =
      traces(UserNotificationCenterDelegate::kClickTraceDomain);
  ASSERT_EQ(clicks.size(), 2u);
  EXPECT_EQ(clicks[0]["action_taken"], "InstallUpdates");
  EXPECT_EQ(clicks[1]["action_taken"], "LaunchToUpdateFailureDetails");
  EXPECT_EQ(log.countContaining("UserNotificationCenterDelegate: Got didDismissAlert for "
                                "notification: " +
                                    details.identifier + " with userInfo: ",
                                1),
            1u)
      << log.dump();
}

// The one button of the install-now notification installs the critical
// updates, and its trace tells the time on screen in seconds.
TEST_F(NotificationActivationTest, TheInstallNowButtonInstallsCriticalUpdatesAndTracesSeconds) {
  LogCapture log;
  UserNotification installNow =
      deliverShown(info({{"Source", "CriticalUpdateInstallNow"}, {"InstallOnDismiss", true}}));
  center_->removeDeliveredNotification(installNow);
  *installNow.actualDeliveryDate -= std::chrono::seconds(95);
  delegate_->didDismissAlert(*center_, installNow);
  EXPECT_EQ(observedCall(log), Call::kInstallCritical) << log.dump();
  const std::vector<nlohmann::json> clicks =
      traces(UserNotificationCenterDelegate::kClickTraceDomain);
  ASSERT_EQ(clicks.size(), 1u);
  EXPECT_EQ(clicks[0]["action_taken"], "InstallCriticalUpdates");
  const std::int64_t seconds = clicks[0]["displayed_interval"];
  EXPECT_GE(seconds, 95);
  EXPECT_LT(seconds, 110);
}

// The automatic update offers: the main button switches on and traces a
// pass, the second button traces a refusal; the switches stay as they were.
TEST_F(NotificationActivationTest, TheAutomaticUpdateOffersAreAnsweredAndTraced) {
  forgetCalls();
  UserNotification restartRequired =
      deliverShown(info({{"Source", "autoUpdateRestartRequiredOptIn"}}));
  restartRequired.activationType = UserNotification::kActionButtonClicked;
  delegate_->didActivateNotification(*center_, restartRequired);
  EXPECT_TRUE(autoUpdateSwitchedOn());
  EXPECT_TRUE(PreferenceStore::booleanForKey(kDefaultsAutoUpdateRestartRequiredEnabledKey,
                                             kDaemonDefaultsID)
                  .value_or(false));
  EXPECT_FALSE(listed(restartRequired.identifier));

  forgetCalls();
  UserNotification refused = deliverShown(info({{"Source", "autoUpdateOptIn"}}));
  center_->removeDeliveredNotification(refused);
  delegate_->didDismissAlert(*center_, refused);
  EXPECT_FALSE(autoUpdateSwitchedOn());

  const std::vector<nlohmann::json> restartRequiredAnswers =
      traces(UserNotificationCenterDelegate::kRestartRequiredOptInTraceDomain);
  ASSERT_EQ(restartRequiredAnswers.size(), 1u);
  EXPECT_EQ(restartRequiredAnswers[0]["result"], "pass");
  const std::vector<nlohmann::json> answers =
      traces(UserNotificationCenterDelegate::kOptInTraceDomain);
  ASSERT_EQ(answers.size(), 1u);
  EXPECT_EQ(answers[0]["result"], "fail");
  EXPECT_TRUE(traces(UserNotificationCenterDelegate::kClickTraceDomain).empty());
}

// Snoozing brings back only the restart countdown.
TEST_F(NotificationActivationTest, OnlyTheRestartCountdownComesBackFromASnooze) {
  const UserNotification plain = deliverShown(info({{"Source", "AppUpdate"}}));
  delegate_->didSnoozeAlert(*center_, plain);
  std::vector<UserNotification> listedNow = center_->deliveredNotifications();
  ASSERT_EQ(listedNow.size(), 1u);
  EXPECT_EQ(listedNow[0].identifier, plain.identifier);

  const UserNotification countdown =
      deliverShown(info({{"Source", "RestartCountdown"}, {"isRestartCountdown", true}}));
  delegate_->didSnoozeAlert(*center_, countdown);
  listedNow = center_->deliveredNotifications();
  ASSERT_EQ(listedNow.size(), 2u);
  EXPECT_EQ(listedNow[0].identifier, plain.identifier);
  EXPECT_NE(listedNow[1].identifier, countdown.identifier);
  EXPECT_EQ(listedNow[1].source(), "RestartCountdown");
}

TEST_F(NotificationActivationTest, UpdateNotificationsAreNotShownUnderTheRestriction) {
  UserNotification update;
  update.userInfo = info({{"Source", "AppUpdate"}});
  UserNotification other;
  other.userInfo = info({{"Source", "autoUpdateOptIn"}});
  EXPECT_TRUE(delegate_->shouldPresentNotification(*center_, update));
  writeText("etc/larder/restrictions.plist",
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?><plist version=\"1.0\"><dict>"
            "<key>DisableSoftwareUpdateNotifications</key><true/></dict></plist>");
  EXPECT_FALSE(delegate_->shouldPresentNotification(*center_, update));
  EXPECT_TRUE(delegate_->shouldPresentNotification(*center_, other));
  EXPECT_TRUE(delegate_->shouldPresentNotification(*center_, UserNotification{}));
}

TEST(NotificationDisplayedIntervalTest, HoursKeepTwoSignificantDigitsAndSecondsAreWhole) {
  const auto delivered = std::chrono::system_clock::time_point(std::chrono::hours(500000));
  UserNotification notification;
  notification.actualDeliveryDate = delivered;
  using std::chrono::hours;
  using std::chrono::seconds;
  const struct {
    std::chrono::system_clock::duration shown;
    std::int64_t hours;
  } cases[] = {{seconds(3599), 0}, {hours(1), 1},     {hours(99), 99},     {hours(123), 120},
               {hours(125), 120},  {hours(135), 140}, {hours(1949), 1900}, {hours(1951), 2000}};
  for (const auto& c : cases) {
    EXPECT_EQ(
        UserNotificationCenterDelegate::displayedIntervalInHours(notification, delivered + c.shown),
        c.hours);
  }
  EXPECT_EQ(UserNotificationCenterDelegate::displayedIntervalInSeconds(
                notification, delivered + std::chrono::milliseconds(123456)),
            123);
  EXPECT_EQ(UserNotificationCenterDelegate::displayedIntervalInHours(UserNotification{}, delivered),
            0);
}

// After a restart the controller is found from the user info alone.
TEST(NotificationControllerLookupTest, TheStoreClientComesFromTheUserInfo) {
  UserNotification notification;
  notification.userInfo = info({});
  const std::optional<VendStoreClient> client =
      UserNotificationCenterDelegate::storeClientForNotification(notification);
  ASSERT_TRUE(client);
  EXPECT_EQ(client->identifier(), "com.orvane.quaymart");
  EXPECT_EQ(client->frameworkVersion(), 3);
  notification.userInfo["storeClientIdentifier"] = "com.example.unknown";
  EXPECT_FALSE(UserNotificationCenterDelegate::storeClientForNotification(notification));
  EXPECT_EQ(UserNotificationCenterDelegate::sharedInstance().updateControllerForNotification(
                notification),
            nullptr);
}

}  // namespace
}  // namespace larder::testing
