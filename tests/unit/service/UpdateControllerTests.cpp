// The update controller: the badge and who hears of changes, the report of
// a background scan, the time tests and switches, and OS update scans.
#include <gtest/gtest.h>

#include <future>

#include "ServiceTestSupport.h"
#include "notifications/center/UserNotificationCenter.h"
#include "platform/dispatch/DispatchQueue.h"
#include "platform/system/FileIO.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/host/LedgerDistributedNotificationCenter.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendOperationQueue.h"
#include "tests/unit/AnsweringDialogPresenter.h"
#include "tests/unit/OSUpdateOffers.h"
#include "update-controller/UpdateController.h"
#include "update-operation/UpdateOperation.h"

namespace larder::testing {
namespace {

using Clock = UpdateController::Clock;

PlistDate secondsAgo(double seconds) {
  using Seconds = std::chrono::duration<double>;
  return PlistDate{Seconds(Clock::now().time_since_epoch()).count() - seconds};
}

// An app update as the update queue keeps it.
PlistDictionary appUpdate(std::uint64_t item, bool seen = false, bool failedToAutoInstall = false) {
  PlistDictionary update{{"ware-id", item},
                         {"bundle-id", "com.example.app" + std::to_string(item)},
                         {"version", "2.0"},
                         {"release-date", PlistDate{1700000000}}};
  if (seen) update[std::string(LedgerUpdate::kHasBeenSeenByUserKey)] = true;
  if (failedToAutoInstall) update[std::string(LedgerUpdate::kDidFailToAutoInstallKey)] = true;
  return update;
}

// An OS update the system offers.
PlistDictionary osUpdate(const std::string& key, PlistDictionary extra = {}) {
  PlistDictionary update{{"productKey", key}, {"title", "Update " + key}, {"versionString", "1"}};
  for (auto& [name, value] : extra) update[name] = value;
  return update;
}

class BadgeMessages {
 public:
  BadgeMessages() {
    LedgerDistributedNotificationCenter::defaultCenter().setPoster(
        [this](const std::string& name, const std::string& object, const PlistDictionary& info) {
          if (name != "com.orvane.quaymart" || object != "updateDockTile") return;
          std::lock_guard lock(mutex_);
          counts_.push_back(PlistValue(info)["badgeCount"].uint64Value());
        });
  }
  ~BadgeMessages() { LedgerDistributedNotificationCenter::defaultCenter().setPoster(nullptr); }
  std::vector<std::uint64_t> counts() const {
    std::lock_guard lock(mutex_);
    return counts_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::uint64_t> counts_;
};

class RecordingUpdatesObserver final : public VendAvailableUpdatesObserver {
 public:
  struct Call {
    std::size_t apps;
    std::size_t os;
    std::uint64_t badge;
  };
  void availableUpdatesDidChangedWithUpdates(
      const std::shared_ptr<const AvailableUpdatesChange>& change) override {
    std::lock_guard lock(mutex_);
    calls_.push_back({change->updates().size(), change->osUpdates().size(), change->badgeCount()});
  }
  std::vector<Call> calls() const {
    std::lock_guard lock(mutex_);
    return calls_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<Call> calls_;
};

class UpdateControllerTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    map_.emplace(options(storePath(), false));
    map_->waitUntilIdle();
  }
  void TearDown() override {
    // A run that a report enqueued ends inside the test, not at the exit
    // of the process, where the shared facilities it uses are torn down.
    VendOperationQueue::mainQueue().waitUntilAllOperationsAreFinished();
    controller_.reset();
    // The framework tells its observers on the global queue: the telling
    // that a test's last change started ends before the test does.
    DispatchQueue::globalQueue().barrierSync([] {});
    map_.reset();
    ServiceTest::TearDown();
  }

  UpdateController& controller(std::int64_t clientType = 0) {
    VendStoreClient client = VendStoreClient::fromDictionary(
        {{"identifier", "test-client-" + std::to_string(++clients_)}, {"clientType", clientType}});
    center_ = UserNotificationCenter::makeForTesting(
        "com.orvane.larderd", UserNotificationCenter::kSystemCenter,
        temporary() + "/notifications-" + std::to_string(clients_) + ".plist");
    controller_ = UpdateController::make(client, *map_, center_);
    return *controller_;
  }

  // Lays out what the update queue finds at start: made before the controller.
  static void cacheAppUpdates(const PlistArray& updates) {
    std::string folder = VendFileManager::cacheDirectoryPathWithName(kDaemonDefaultsID);
    fs::create_directories(folder);
    writeBytes(folder + "/updates.plist",
               PropertyListSerialization::writeBinary(
                   PlistDictionary{{"updates", updates}, {"incompatibleUpdates", PlistArray{}}}));
  }

  static void setPreference(std::string_view key, PlistValue value,
                            std::string_view domain = kDaemonDefaultsID,
                            PreferenceScope scope = PreferenceScope::App) {
    ASSERT_TRUE(PreferenceStore::setValue(key, std::move(value), domain, scope).has_value());
  }

  std::optional<SoftwareMap> map_;
  std::shared_ptr<UserNotificationCenter> center_;
  std::shared_ptr<UpdateController> controller_;
  int clients_ = 0;
};

TEST_F(UpdateControllerTest, TheBadgeCountsWhatTheUserIsToHearOf) {
  struct Case {
    const char* name;
    PlistArray apps;
    PlistArray os;
    bool autoUpdate = false;
    bool restartRequiredAutoUpdate = false;
    std::int64_t clientType = 0;
    PlistArray osSeen = {};
    std::uint64_t expected = 0;
  };
  const PlistDictionary restart{{"restartRequired", true}, {"allowedToUseInstallLater", true}};
  const Case cases[] = {
      {"three OS updates count as one",
       {appUpdate(1), appUpdate(2)},
       {osUpdate("A"), osUpdate("B"), osUpdate("C")},
       false,
       false,
       0,
       {},
       3},
      {"with auto update an unseen app update waits",
       {appUpdate(1), appUpdate(2, true), appUpdate(3, false, true)},
       {},
       true,
       false,
       0,
       {},
       2},
      {"a book client never counts OS updates",
       {appUpdate(1)},
       {osUpdate("A")},
       false,
       false,
       1,
       {},
       1},
      {"restart-required updates that will install by themselves wait",
       {},
       {osUpdate("R", restart)},
       false,
       true,
       0,
       {},
       0},
      {"until the user has seen them", {}, {osUpdate("R", restart)}, false, true, 0, {"R"}, 1},
      {"one with a licence is not installed by itself",
       {},
       {osUpdate("L", {{"restartRequired", true},
                       {"allowedToUseInstallLater", true},
                       {"licenseAgreement", "terms"}})},
       false,
       true,
       0,
       {},
       1},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    cacheAppUpdates(c.apps);
    offerOSUpdates(c.os);
    setPreference(kDefaultsAutoUpdateEnabledKey, c.autoUpdate);
    setPreference(kDefaultsAutoUpdateRestartRequiredEnabledKey, c.restartRequiredAutoUpdate);
    setPreference(kDefaultsOSUpdatesSeenByUserKey, c.osSeen, kQuaymartDefaultsID,
                  PreferenceScope::User);
    EXPECT_EQ(controller(c.clientType).availableUpdatesBadgeCount(), c.expected);
  }
}

TEST_F(UpdateControllerTest, ChangesReachTheBadgeThePreferenceAndEveryObserverOnce) {
  cacheAppUpdates({appUpdate(1), appUpdate(2)});
  offerOSUpdates({osUpdate("A")});
  BadgeMessages badge;
  UpdateController& updates = controller();
  auto observer = std::make_shared<RecordingUpdatesObserver>();
  auto removed = std::make_shared<RecordingUpdatesObserver>();
  updates.addAvailableUpdatesObserver(observer);
  updates.addAvailableUpdatesObserver(removed);
  updates.addAvailableUpdatesObserver(removed);
  updates.removeAvailableUpdatesObserver(removed);

  updates.availableUpdatesDidChange();
  updates.availableUpdatesDidChange();  // unchanged: no second badge message
  EXPECT_EQ(badge.counts(), (std::vector<std::uint64_t>{3}));
  EXPECT_EQ(PreferenceStore::numberForKey(kDefaultsQuaymartBadgeCountKey, kQuaymartDefaultsID), 3);
  ASSERT_EQ(observer->calls().size(), 2U);
  EXPECT_EQ(observer->calls()[0].apps, 2U);
  EXPECT_EQ(observer->calls()[0].os, 1U);
  EXPECT_EQ(observer->calls()[0].badge, 3U);
  EXPECT_TRUE(removed->calls().empty()) << "removing takes off every entry of the observer";

  // Held back during a run, sent when it ends; the store application's own
  // switch sends 0 while observers still hear the real lists.
  updates.disableDockBadgeUpdates();
  setPreference(kDefaultsDisableQuaymartBadgeKey, true, kQuaymartDefaultsID);
  updates.availableUpdatesDidChange();
  EXPECT_EQ(badge.counts().size(), 1U);
  updates.enableDockBadgeUpdates();
  EXPECT_EQ(badge.counts(), (std::vector<std::uint64_t>{3, 0}));
  EXPECT_EQ(observer->calls().back().badge, 0U);
  EXPECT_EQ(observer->calls().back().apps, 2U);
  // A clear is sent whatever was sent before.
  updates.clearAvailableUpdatesBadgeCount();
  EXPECT_EQ(badge.counts(), (std::vector<std::uint64_t>{3, 0, 0}));
  EXPECT_EQ(updates.lastDockBadgeCount(), 0U);
}

TEST_F(UpdateControllerTest, ABackgroundScanReportConfiguresOneRunByTheTimeTests) {
  offerOSUpdates({osUpdate("A"), osUpdate("B")});
  // The last notification two days ago: time for a critical one (daily),
  // not for the weekly one. Staged an hour ago: not time to stage again.
  setPreference(kDefaultsDidPostUpdatesAvailableNotificationDateKey, secondsAgo(2 * 86400));
  setPreference(kDefaultsDidStageAppUpdatesDateKey, secondsAgo(3600));
  setPreference(kDefaultsFakePostLogoutUpdateFailureKey, false);
  struct Case {
    const char* name;
    PlistDictionary report;
    bool post;
    std::vector<std::string> later;
  };
  const Case cases[] = {
      {"plain", {}, false, {}},
      {"critical updates follow the daily test", {{"criticalUpdatesCount", 2}}, true, {}},
      {"unknown keys to install later vanish",
       {{"osUpdatesToPerformLater", PlistArray{"B", "gone", "A"}}},
       false,
       {"B", "A"}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    auto operation = controller().softwareUpdateDidFinishBackgroundScanWithInfo(c.report);
    ASSERT_TRUE(operation);
    UpdateOperationSettings s = operation->settings();
    EXPECT_FALSE(s.shouldCheckForAndStageAppUpdates);
    EXPECT_TRUE(s.shouldStartAutoInstallOfUpdates) << "never auto-updated: the time has come";
    EXPECT_EQ(s.shouldPostAvailableUpdatesNotification, c.post);
    std::vector<std::string> later;
    for (const auto& update : s.osUpdatesToInstallLater.value_or(UpdateController::OSUpdateList{}))
      later.push_back(update.productKey());
    EXPECT_EQ(later, c.later);
    EXPECT_TRUE(PreferenceStore::dateForKey(kDefaultsLastAutoUpdateInvocationKey, kDaemonDefaultsID,
                                            PreferenceScope::User));
  }

  // Post-logout results: installed ones are confirmed unless failure is
  // faked, which turns every result into a failure.
  const PlistDictionary results{
      {"A", PlistDictionary{{"State", "Installed"}, {"InstalledLater", true}}},
      {"B", PlistDictionary{{"State", "Error"}}},
      {"C", PlistDictionary{{"State", "Pending"}}}};
  UpdateOperationSettings s =
      controller()
          .softwareUpdateDidFinishBackgroundScanWithInfo(
              {{"postLogoutUpdatesInstalled", results}, {"updateNotificationsOnly", true}})
          ->settings();
  EXPECT_TRUE(s.shouldUpdateNotificationsOnly);
  EXPECT_EQ(s.postLogoutInstalledUpdates.size(), 1U);
  EXPECT_EQ(s.postLogoutInstalledLaterUpdates.size(), 1U);
  EXPECT_EQ(s.postLogoutFailedUpdates.size(), 1U);
  setPreference(kDefaultsFakePostLogoutUpdateFailureKey, true);
  s = controller()
          .softwareUpdateDidFinishBackgroundScanWithInfo({{"postLogoutUpdatesInstalled", results}})
          ->settings();
  EXPECT_EQ(s.postLogoutFailedUpdates.size(), 3U);
  EXPECT_TRUE(s.postLogoutInstalledUpdates.empty());
}

TEST_F(UpdateControllerTest, AMajorOSUpdateNoticeIsAboutNothingElse) {
  LogCapture log;
  auto operation = controller().softwareUpdateDidFinishBackgroundScanWithInfo(
      {{"majorOSUpdateAvailableAtPath", "/tmp/major"}, {"criticalUpdatesCount", 1}});
  EXPECT_FALSE(operation);
  EXPECT_FALSE(PreferenceStore::dateForKey(kDefaultsLastAutoUpdateInvocationKey, kDaemonDefaultsID,
                                           PreferenceScope::User));
  EXPECT_EQ(log.countContaining("Enqueuing UpdateOperation"), 0U);
  EXPECT_EQ(log.countContaining("Received notice of new major OS update availability"), 1U);
}

TEST_F(UpdateControllerTest, TimestampsAllowFiveMinutesOfSlackAndIntervalsComeFromTheMachine) {
  UpdateController& updates = controller();
  const std::string_view key = kDefaultsDidStageAppUpdatesDateKey;
  EXPECT_TRUE(updates.timestampWithKeyHasExceededCheckInterval(key, 3600)) << "never: due";
  setPreference(key, secondsAgo(3600 - 300 + 2));
  EXPECT_TRUE(updates.timestampWithKeyHasExceededCheckInterval(key, 3600));
  setPreference(key, secondsAgo(3600 - 300 - 2));
  EXPECT_FALSE(updates.timestampWithKeyHasExceededCheckInterval(key, 3600));
  setPreference(key, "yesterday");
  EXPECT_TRUE(updates.timestampWithKeyHasExceededCheckInterval(key, 3600)) << "not a date: none";

  struct Case {
    PlistValue stored;
    double expected;
  } const intervals[] = {{PlistValue(), 604800}, {"3600", 3600},   {std::int64_t{0}, 0},
                         {PlistDate{5}, 604800}, {"soon", 604800}, {2.5, 2.5}};
  for (const auto& [stored, expected] : intervals) {
    setPreference(kDefaultsAvailableUpdatesNotificationIntervalKey, stored, kDaemonDefaultsID,
                  PreferenceScope::System);
    EXPECT_EQ(UpdateController::availableUpdatesNotificationMinimumInterval(), expected);
  }
  // Per-user values of machine settings have no effect.
  setPreference(kDefaultsNotifyUserOfNewUpdatesOnlyKey, true, kDaemonDefaultsID,
                PreferenceScope::User);
  EXPECT_FALSE(UpdateController::shouldNotifyForNewUpdatesOnly());
}

TEST_F(UpdateControllerTest, AutomaticUpdatesAskOnceAndAgainOnlyAfterARefusalAndAMajorUpgrade) {
  writeText(temporary() + "/root/etc/os-release", "VERSION_ID=\"13.1\"\n");
  EXPECT_FALSE(UpdateController::isAutoUpdatedEnabled());
  EXPECT_TRUE(UpdateController::shouldPromptForAutoUpdateOptIn()) << "never asked";

  UpdateController::setAutoUpdateEnabled(false);  // refused on 13
  EXPECT_FALSE(UpdateController::shouldPromptForAutoUpdateOptIn());
  writeText(temporary() + "/root/etc/os-release", "VERSION_ID=\"14.0\"\n");
  EXPECT_TRUE(UpdateController::shouldPromptForAutoUpdateOptIn()) << "asked again on 14";

  UpdateController::setAutoUpdateEnabled(true);
  EXPECT_TRUE(UpdateController::isAutoUpdatedEnabled());
  writeText(temporary() + "/root/etc/os-release", "VERSION_ID=\"15.0\"\n");
  EXPECT_FALSE(UpdateController::shouldPromptForAutoUpdateOptIn()) << "an answer yes stands";
  EXPECT_TRUE(UpdateController::shouldPromptForAutoUpdateOfRestartRequiredUpdatesOptIn());

  // Without staging nothing installs by itself, whatever the switches say.
  setPreference(kDefaultsAutoUpdateRestartRequiredEnabledKey, true);
  setPreference(kDefaultsAutomaticDownloadKey, false, kSoftwareUpdateDefaultsID);
  EXPECT_FALSE(UpdateController::isAutoUpdatedEnabled());
  EXPECT_FALSE(UpdateController::isAutoUpdatedOfRestartRequiredUpdatesEnabled());
  setPreference(kDefaultsAutomaticDownloadKey, "no", kSoftwareUpdateDefaultsID);
  EXPECT_TRUE(UpdateController::isAutoUpdatedEnabled()) << "a switch of another type is on";
  // The automatic check off: nobody is asked.
  setPreference(kDefaultsSysupScanAutomaticCheckEnabledKey, false, kSoftwareUpdateDefaultsID);
  UpdateController::setAutoUpdateEnabled(false);
  writeText(temporary() + "/root/etc/os-release", "VERSION_ID=\"16.0\"\n");
  EXPECT_FALSE(UpdateController::shouldPromptForAutoUpdateOptIn());
}

class RecordingScanObserver final : public VendOSUpdateScanObserver {
 public:
  void osUpdateScanForTags(const std::vector<std::string>& tags, float percent, bool finished,
                           const OptionalError& error) override {
    std::lock_guard lock(mutex_);
    if (finished) finishes_.push_back({tags, percent, error.has_value()});
  }
  struct Finish {
    std::vector<std::string> tags;
    float percent;
    bool failed;
  };
  std::vector<Finish> finishes() const {
    std::lock_guard lock(mutex_);
    return finishes_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<Finish> finishes_;
};

TEST_F(UpdateControllerTest, OneScanRunsAtATimeAndTheUserHasSeenWhatItFound) {
  ASSERT_TRUE(PlatformStateFile::named(SysupQuaymartUpdateController::kStateFileName)
                  .updateDictionary([](PlistDictionary& state) {
                    state["catalog"] =
                        PlistArray{osUpdate("A", {{"tags", PlistArray{"t"}}}), osUpdate("B")};
                    state["scanSeconds"] = 0.5;
                  }));
  UpdateController& updates = controller();
  auto observer = std::make_shared<RecordingScanObserver>();
  updates.addOSUpdateScanObserver(observer);
  std::promise<void> first;
  std::promise<void> second;
  updates.startOSUpdateScanForTags(std::vector<std::string>{"t"}, true, false, false, true,
                                   [&](const OptionalError&) { first.set_value(); });
  EXPECT_FALSE(updates.osUpdateScanInProgress()) << "a quiet scan shows after 2.5 seconds";
  // A second request joins the running scan; asking for progress shows it.
  updates.startOSUpdateScanForTags(std::vector<std::string>{"other"}, true, true, false, false,
                                   [&](const OptionalError&) { second.set_value(); });
  EXPECT_TRUE(updates.osUpdateScanInProgress());
  first.get_future().get();
  second.get_future().get();
  EXPECT_FALSE(updates.osUpdateScanInProgress());
  ASSERT_EQ(observer->finishes().size(), 1U) << "one scan ran";
  EXPECT_EQ(observer->finishes()[0].tags, std::vector<std::string>{"t"});
  EXPECT_EQ(observer->finishes()[0].percent, 100.0F);
  EXPECT_EQ(updates.osUpdateProductKeysSeenByUser(), (std::vector<std::string>{"A", "B"}));

  std::promise<std::vector<std::string>> tagged;
  updates.updatesForTags({"t"}, [&](const UpdateController::OSUpdateList& list) {
    std::vector<std::string> keys;
    for (const auto& update : list) keys.push_back(update.productKey());
    tagged.set_value(keys);
  });
  EXPECT_EQ(tagged.get_future().get(), std::vector<std::string>{"A"});
}

TEST_F(UpdateControllerTest, HidingNeedsAuthorizationAndPassesOverUnknownKeys) {
  offerOSUpdates({osUpdate("A"), osUpdate("B")});
  UpdateController& updates = controller();
  std::vector<bool> outcomes;
  updates.hideOSUpdatesWithProductKeys({"A", "unknown"}, [&](bool ok) { outcomes.push_back(ok); });
  auto available = SysupQuaymartUpdateController::sharedUpdateController().availableUpdates();
  ASSERT_EQ(available.size(), 1U);
  EXPECT_EQ(available[0].productKey(), "B");
  updates.unhideAllOSUpdates([&](bool ok) { outcomes.push_back(ok); });
  EXPECT_EQ(SysupQuaymartUpdateController::sharedUpdateController().availableUpdates().size(), 2U);
  EXPECT_EQ(outcomes, (std::vector<bool>{true, true}));
}

TEST_F(UpdateControllerTest, TheRestartIsConfirmedOnlyByItsRestartButton) {
  UpdateController& updates = controller();
  struct Case {
    bool willDownload;
    std::int64_t exitCode;
    const char* title;
    bool confirmed;
  } const cases[] = {{true, 1, "Download and Restart to Install Updates?", true},
                     {false, 1, "Restart to Install Updates?", true},
                     {false, 0, "Restart to Install Updates?", false},
                     {true, 2, "Download and Restart to Install Updates?", false}};
  for (const Case& c : cases) {
    auto presenter = std::make_shared<AnsweringDialogPresenter>(c.exitCode);
    VendRuntime::shared()->setDialogPresenter(presenter);
    EXPECT_EQ(updates.confirmRestartWithUpdatesWillDownload(c.willDownload), c.confirmed);
    ASSERT_EQ(presenter->shown().size(), 1u);
    const PlistValue shown(presenter->shown()[0]);
    EXPECT_EQ(*shown["message"].string(), c.title);
    EXPECT_EQ(*shown["okButtonString"].string(), c.willDownload ? "Download & Restart" : "Restart");
  }
  VendRuntime::shared()->setDialogPresenter(nullptr);
  // Nobody to ask: not now.
  EXPECT_FALSE(updates.confirmRestartWithUpdatesWillDownload(false));
}

// --- Do It Later ---

class DoItLaterTest : public UpdateControllerTest {
 protected:
  void SetUp() override {
    UpdateControllerTest::SetUp();
    onMains(true);
    loggedInUsers(1);
  }

  void onMains(bool mains) const {
    writeText("sys/class/power_supply/AC/type", "Mains\n");
    writeText("sys/class/power_supply/AC/online", mains ? "1\n" : "0\n");
  }
  void loggedInUsers(int count) const {
    PlistArray sessions;
    for (int user = 0; user < count; ++user) {
      sessions.emplace_back(
          PlistDictionary{{"user", "user" + std::to_string(user)}, {"state", "active"}});
    }
    ASSERT_TRUE(PlatformStateFile::named("sessions.plist").updateValue([&](PlistValue& value) {
      value = sessions;
    }));
  }
  void writeText(const std::string& rootedPath, std::string_view text) const {
    const fs::path path = fs::path(temporary()) / "root" / rootedPath;
    fs::create_directories(path.parent_path());
    ASSERT_TRUE(FileIO::writeAtomically(path.string(), text));
  }
  static std::vector<std::string> osLaterKeys() {
    std::vector<std::string> keys;
    for (const SysupQuaymartUpdate& update :
         SysupQuaymartUpdateController::sharedUpdateController().updatesToBeInstalledLater()) {
      keys.push_back(update.productKey());
    }
    return keys;
  }
  static std::vector<std::string> storedAppLater() {
    std::vector<std::string> identifiers;
    const PlistValue stored = PreferenceStore::valueForKey(
        kDefaultsAppUpdatesToInstallLaterKey, kDaemonDefaultsID, PreferenceScope::User);
    if (const PlistArray* array = stored.array()) {
      for (const PlistValue& value : *array) identifiers.push_back(*value.string());
    }
    return identifiers;
  }
  [[nodiscard]] std::vector<std::string> titles() const {
    std::vector<std::string> list;
    for (const UserNotification& notification : center_->deliveredNotifications()) {
      list.push_back(notification.title);
    }
    return list;
  }
  [[nodiscard]] std::string text(std::string_view key) const {
    return LedgerLocalizedString(key, &controller_->storeClient());
  }
};

// Tomorrow makes the updates-available notification come due in 24 hours
// whatever its interval, and touches nothing else.
TEST_F(DoItLaterTest, TomorrowOnlyMakesTheNotificationComeDueInADay) {
  setPreference(kDefaultsAppUpdatesToInstallLaterKey, PlistArray{"com.example.kept"},
                kDaemonDefaultsID, PreferenceScope::User);
  for (const auto& [interval, offset] : {std::pair{604800.0, -518400.0}, {3600.0, 82800.0}}) {
    setPreference(kDefaultsAvailableUpdatesNotificationIntervalKey, interval, kDaemonDefaultsID,
                  PreferenceScope::System);
    UpdateController& updates = controller();
    updates.installAvailableUpdatesLaterWithMode(UpdateController::kLaterRemindTomorrow);
    const std::optional<PlistDate> stored = PreferenceStore::dateForKey(
        kDefaultsDidPostUpdatesAvailableNotificationDateKey, kDaemonDefaultsID);
    ASSERT_TRUE(stored);
    EXPECT_NEAR(stored->secondsSince1970 - secondsAgo(0).secondsSince1970, offset, 5);
    EXPECT_FALSE(updates.isTimeToPostUpdatesAvailableNotification());
  }
  EXPECT_FALSE(LedgerTwilightAgent::armedMode());
  EXPECT_EQ(storedAppLater(), std::vector<std::string>{"com.example.kept"});
}

// The later lists take every app update of the queue, in place of the
// earlier list, and the OS updates that may wait: recommended, needing no
// restart or opted in, texts accepted.
TEST_F(DoItLaterTest, TonightFillsBothListsAndArmsTheAgent) {
  PlistDictionary noBundle = appUpdate(3);
  noBundle.erase("bundle-id");
  cacheAppUpdates({appUpdate(1), appUpdate(2), noBundle});
  setPreference(kDefaultsAppUpdatesToInstallLaterKey, PlistArray{"com.example.earlier"},
                kDaemonDefaultsID, PreferenceScope::User);
  offerOSUpdates({osUpdate("PLAIN", {{"isRecommended", true}}),
                  osUpdate("RESTART", {{"isRecommended", true}, {"restartRequired", true}}),
                  osUpdate("OPTED", {{"isRecommended", true},
                                     {"restartRequired", true},
                                     {"allowedToUseInstallLater", true}}),
                  osUpdate("OPTIONAL"),
                  osUpdate("FIRMWARE", {{"isRecommended", true}, {"firmwareWarning", "Plug in."}}),
                  osUpdate("LICENCE", {{"isRecommended", true}, {"licenseAgreement", "Terms."}})});
  UpdateController& updates = controller();
  auto presenter = std::make_shared<AnsweringDialogPresenter>(VendDialogButton::kCancel);
  VendRuntime::shared()->setDialogPresenter(presenter);
  updates.installAvailableUpdatesLaterWithMode(UpdateController::kLaterTonight);
  VendRuntime::shared()->setDialogPresenter(nullptr);

  EXPECT_EQ(osLaterKeys(), (std::vector<std::string>{"PLAIN", "OPTED"}));
  EXPECT_EQ(storedAppLater(), (std::vector<std::string>{"com.example.app1", "com.example.app2"}));
  EXPECT_EQ(presenter->shown().size(), 2u);  // the firmware warning, then the licence
  EXPECT_EQ(LedgerTwilightAgent::armedMode(), UpdateController::kLaterTonight);
  EXPECT_TRUE(updates.hasUpdatesToBeInstalledLater());
  EXPECT_TRUE(titles().empty());  // on mains power, alone: nothing stands in the way

  updates.removeUpdateFromInstallLaterWithBundleID("com.example.app1");
  EXPECT_EQ(updates.appUpdatesToInstallLater(), std::vector<std::string>{"com.example.app2"});
  updates.cancelUpdatesToBeInstalledLater();
  EXPECT_FALSE(updates.hasUpdatesToBeInstalledLater());
  EXPECT_FALSE(LedgerTwilightAgent::armedMode());
}

// What would keep the install from happening is told when the user asked;
// other users logged in outweigh the battery.
TEST_F(DoItLaterTest, TheHelperNotificationSaysWhatStandsInTheWay) {
  offerOSUpdates({osUpdate("PLAIN", {{"isRecommended", true}})});
  struct Case {
    bool mains;
    int users;
    const char* titleKey;
  } const cases[] = {{false, 1, "DOITLATER_HELPER_POWER_TITLE"},
                     {false, 2, "DOITLATER_HELPER_OTHER_USERS_TITLE"},
                     {true, 2, "DOITLATER_HELPER_OTHER_USERS_TITLE"}};
  for (const Case& c : cases) {
    onMains(c.mains);
    loggedInUsers(c.users);
    UpdateController& updates = controller();
    updates.installAvailableUpdatesLaterWithMode(UpdateController::kLaterInAnHour);
    EXPECT_EQ(titles(), std::vector<std::string>{text(c.titleKey)}) << c.titleKey;
    EXPECT_EQ(LedgerTwilightAgent::armedMode(), UpdateController::kLaterInAnHour);
    updates.cancelUpdatesToBeInstalledLater();
  }
  // Asked for by the machine rather than the user: armed, nothing posted.
  onMains(false);
  loggedInUsers(1);
  UpdateController& updates = controller();
  updates.installAvailableUpdatesLaterWithMode(UpdateController::kLaterTonight, false);
  EXPECT_TRUE(titles().empty());
  EXPECT_EQ(LedgerTwilightAgent::armedMode(), UpdateController::kLaterTonight);
}

TEST_F(DoItLaterTest, NothingToPutOffArmsNothing) {
  offerOSUpdates({osUpdate("OPTIONAL")});
  controller().installAvailableUpdatesLaterWithMode(UpdateController::kLaterTonight);
  EXPECT_FALSE(LedgerTwilightAgent::armedMode());
  EXPECT_TRUE(storedAppLater().empty());
}

// The agent's moment makes a run of what was put off; a missed moment
// tells the user why, with the reason in the audit the notification keeps.
TEST_F(DoItLaterTest, TheAgentsMomentMakesARunAndAMissedOneIsTold) {
  offerOSUpdates({osUpdate("PLAIN", {{"isRecommended", true}})});
  UpdateController& updates = controller();
  updates.installAvailableUpdatesLaterWithMode(UpdateController::kLaterInAnHour);
  updates.laterDidNotOccurWithDueToACPower(true);
  const std::vector<UserNotification> delivered = center_->deliveredNotifications();
  ASSERT_EQ(delivered.size(), 1u);
  const PlistValue info(delivered.front().userInfo);
  EXPECT_TRUE(info["isDoItLaterFailure"].boolValue());
  const std::optional<PlistDictionary> audit =
      updates.cachedUpdateAuditInfoWithKey(*info["auditInfoCacheKey"].string());
  ASSERT_TRUE(audit);
  EXPECT_TRUE(PlistValue(*audit)["missedLaterWindow"].boolValue());
  EXPECT_TRUE(PlistValue(*audit)["dueToNotBeingOnACPower"].boolValue());
  EXPECT_EQ(osLaterKeys(), std::vector<std::string>{"PLAIN"});  // the lists stay

  std::shared_ptr<UpdateOperation> run = updates.nowIsLaterWithMode(2, true);
  const UpdateOperationSettings s = run->settings();
  EXPECT_TRUE(s.nowIsLater);
  EXPECT_EQ(s.doItLaterMode, 2);
  EXPECT_TRUE(s.restartCountdownWasDeferred);
  ASSERT_TRUE(s.osUpdatesToInstallLater);
  ASSERT_EQ(s.osUpdatesToInstallLater->size(), 1u);
  EXPECT_EQ(s.osUpdatesToInstallLater->front().productKey(), "PLAIN");
}

}  // namespace
}  // namespace larder::testing
