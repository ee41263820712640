// What each kind of update notification says, leaves in its user info and
// takes away, as delivered to a center of the test's own.
#include <gtest/gtest.h>

#include <map>

#include "ServiceTestSupport.h"
#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "notifications/center/NotificationServer.h"
#include "notifications/center/UserNotificationCenter.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/host/VendDevice.h"
#include "store-runtime/host/VendManagedRestrictions.h"

namespace larder::testing {
namespace {

std::string text(std::string_view key) {
  return LedgerLocalizedString(key, nullptr);
}

LedgerUpdateRef appUpdate(std::uint64_t item, const std::optional<std::string>& title,
                          const std::string& bundleID = "", std::int64_t abortCode = 0) {
  PlistDictionary record{
      {"ware-id", item},
      {"bundle-id", bundleID.empty() ? "com.example.app" + std::to_string(item) : bundleID}};
  if (title) record["title"] = *title;
  if (abortCode != 0) record[std::string(LedgerUpdate::kAutoUpdateAbortCodeKey)] = abortCode;
  return LedgerUpdate::initWithDictionary(std::move(record));
}

class FakeContext final : public UpdateNotificationContext {
 public:
  bool autoUpdate = false;
  bool autoRestart = false;
  bool laterOffered = true;
  std::map<std::string, PlistDictionary> cached;

  bool isAutoUpdatedEnabled() const override { return autoUpdate; }
  bool isAutoUpdatedOfRestartRequiredUpdatesEnabled() const override { return autoRestart; }
  bool shouldOfferDoItLaterForAppUpdates(const std::vector<LedgerUpdateRef>&,
                                         const std::vector<SysupQuaymartUpdate>&) const override {
    return laterOffered;
  }
  bool shouldOfferDoItLaterForAvailableUpdates() const override { return laterOffered; }
  std::optional<std::string> cacheUpdateAuditInfo(const PlistDictionary& auditInfo) override {
    const std::string key = "audit-" + std::to_string(cached.size());
    cached[key] = auditInfo;
    return key;
  }
  void resetUpdatesAvailableNotificationTimestamp() override { ++timestampResets; }
  int timestampResets = 0;
};

// Shows every notification at once, numbering them as a server does.
class ShowingServer final : public NotificationServer {
 public:
  void setHandlers(Handlers) override {}
  Result<std::uint32_t> notify(const NotificationRequest&) override { return ++lastIdentifier_; }
  Result<void> closeNotification(std::uint32_t) override { return {}; }

 private:
  std::atomic<std::uint32_t> lastIdentifier_{0};
};

class UpdateNotificationCatalogueTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    center_ = UserNotificationCenter::makeForTesting("com.orvane.larderd",
                                                     UserNotificationCenter::kSystemCenter,
                                                     temporary() + "/delivered.plist");
    catalogue_.emplace(client_, context_, center_);
  }

  [[nodiscard]] std::vector<UserNotification> delivered() const {
    return center_->deliveredNotifications();
  }
  // The one delivered notification; fails the test when there is not
  // exactly one.
  [[nodiscard]] UserNotification only() const {
    std::vector<UserNotification> list = delivered();
    EXPECT_EQ(list.size(), 1u);
    return list.empty() ? UserNotification{} : list.front();
  }
  [[nodiscard]] std::vector<std::string> sources() const {
    std::vector<std::string> list;
    for (const UserNotification& notification : delivered()) list.push_back(notification.source());
    return list;
  }
  void markFirstNotificationPosted() {
    ASSERT_TRUE(PreferenceStore::setValue(kDefaultsLastUpdateNotificationOSMajorVersionKey,
                                          VendDevice::osMajorVersionString(), kDaemonDefaultsID,
                                          PreferenceScope::User));
  }

  VendStoreClient client_ = VendStoreClient::fromDictionary(
      {{"identifier", "test-client"}, {"clientType", 0}, {"frameworkVersion", 3}});
  FakeContext context_;
  std::shared_ptr<UserNotificationCenter> center_;
  std::optional<UpdateNotificationCatalogue> catalogue_;
};

struct RegularTextsCase {
  const char* name;
  bool autoUpdate;
  bool autoRestart;
  bool laterOffered;
  bool restartRequired;
  std::int64_t abortCode;
  const char* titleKey;
  const char* bodyKey;
  bool failure;
};

TEST_F(UpdateNotificationCatalogueTest, UpdatesAvailablePicksItsTextsAndButtonsByTheSwitches) {
  markFirstNotificationPosted();
  const RegularTextsCase cases[] = {
      {"plain with later", false, false, true, false, 0, "UPDATES_AVAILABLE_NOTIFICATION_TITLE",
       "UPDATES_AVAILABLE_NOTIFICATION_TEXT", false},
      {"restart without later", false, false, false, true, 0,
       "UPDATES_AVAILABLE_NOTIFICATION_TITLE",
       "UPDATES_AVAILABLE_NOTIFICATION_LATER_NOT_OFFERED_RESTART_TEXT", false},
      {"restart rule before the running app", true, false, true, true, 3,
       "UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TITLE",
       "UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TEXT_RESTART", true},
      {"running app", true, true, true, false, 3,
       "UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TITLE",
       "UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TEXT_APP_RUNNING", true},
      {"other failure", true, false, false, false, 0,
       "UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TITLE",
       "UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TEXT_GENERIC", true},
  };
  for (const RegularTextsCase& c : cases) {
    SCOPED_TRACE(c.name);
    context_.autoUpdate = c.autoUpdate;
    context_.autoRestart = c.autoRestart;
    context_.laterOffered = c.laterOffered;
    catalogue_->postUpdatesAvailableNotification({appUpdate(1, "Ledgerly", "", c.abortCode)}, {},
                                                 c.restartRequired, PlistDictionary{{"run", 1}});
    const UserNotification n = only();
    EXPECT_EQ(n.title, text(c.titleKey));
    EXPECT_EQ(n.informativeText, text(c.bodyKey));
    EXPECT_EQ(n.userInfo.contains("isAutoUpdateFailure"), c.failure);
    EXPECT_EQ(n.displayStyle, UserNotification::kAlert);
    EXPECT_FALSE(n.poofsOnCancel);
    EXPECT_EQ(*n.userInfo.at("storeClientIdentifier").string(), "test-client");
    EXPECT_EQ(n.userInfo.at("storeClientFrameworkVersion").int64Value(), 3);
    EXPECT_EQ(*n.userInfo.at("osVersion").string(), VendDevice::osMajorVersionString());
    ASSERT_TRUE(n.userInfo.contains("auditInfoCacheKey"));
    EXPECT_EQ(
        context_.cached.at(*n.userInfo.at("auditInfoCacheKey").string()).at("run").int64Value(), 1);
    const std::string install = text(c.restartRequired ? "UPDATE_NOTIFICATION_RESTART_BUTTON"
                                                       : "UPDATE_NOTIFICATION_INSTALL_BUTTON");
    if (c.laterOffered) {
      EXPECT_EQ(n.actionButtonTitle, text("UPDATE_NOTIFICATION_LATER_BUTTON"));
      EXPECT_EQ(n.otherButtonTitle, install);
      std::vector<std::string> menu{text("UPDATE_NOTIFICATION_LATER_OPTION_1HOUR"),
                                    text("UPDATE_NOTIFICATION_LATER_OPTION_TONIGHT"),
                                    text("UPDATE_NOTIFICATION_LATER_OPTION_REMIND")};
      if (!c.autoUpdate) {
        menu.push_back(text("UPDATE_NOTIFICATION_LATER_OPTION_AUTOUPDATE_OPTIN"));
      } else if (!c.autoRestart) {
        menu.push_back(text("UPDATE_NOTIFICATION_LATER_OPTION_AUTOUPDATE_RESTART_REQUIRED_OPTIN"));
      }
      EXPECT_EQ(n.alternateActionButtonTitles, menu);
      EXPECT_TRUE(n.alwaysShowAlternateActionMenu);
    } else {
      EXPECT_EQ(n.actionButtonTitle, install);
      EXPECT_EQ(n.otherButtonTitle, text("UPDATE_NOTIFICATION_DETAILS_BUTTON"));
      EXPECT_TRUE(n.userInfo.at("OtherButtonIsDetails").boolValue());
      EXPECT_TRUE(n.alternateActionButtonTitles.empty());
    }
  }
  // Each post replaced the one before it and moved the timestamp.
  EXPECT_EQ(context_.timestampResets, 5);
}

struct FirstNotificationCase {
  const char* name;
  std::vector<std::pair<const char*, const char*>> apps;  // bundle identifier, title
  bool withOSUpdate;
  const char* body;
};

TEST_F(UpdateNotificationCatalogueTest, FirstNotificationUnderAVersionNamesTheSuiteApplications) {
  const FirstNotificationCase cases[] = {
      {"one of the suite, an OS update and two others",
       {{"com.orvane.Snapbox", "Snapbox"}, {"com.example.a", "A"}, {"com.example.b", "B"}},
       true,
       "New versions of Snapbox and 3 other apps are ready to install."},
      {"three of the suite alone",
       {{"com.orvane.Anvil", "Anvil"},
        {"com.orvane.Snapbox", "Snapbox"},
        {"com.orvane.Loopforge", "Loopforge"}},
       false,
       "New versions of Snapbox, Loopforge and Anvil are ready to install."},
      {"four of the suite",
       {{"com.orvane.ReelcutApp", "Reelcut"},
        {"com.orvane.Anvil", "Anvil"},
        {"com.orvane.Snapbox", "Snapbox"},
        {"com.orvane.Loopforge", "Loopforge"}},
       false,
       "New versions of Snapbox, Loopforge, Anvil and 1 other app are ready to install."},
      {"one of the suite alone",
       {{"com.orvane.Snapbox.pro", "Snapbox Pro"}},
       false,
       "A new version of Snapbox Pro is ready to install."},
  };
  for (const FirstNotificationCase& c : cases) {
    SCOPED_TRACE(c.name);
    ASSERT_TRUE(PreferenceStore::removeValue(kDefaultsLastUpdateNotificationOSMajorVersionKey,
                                             kDaemonDefaultsID, PreferenceScope::User));
    std::vector<LedgerUpdateRef> apps;
    for (const auto& [bundleID, title] : c.apps) {
      apps.push_back(appUpdate(apps.size() + 1, title, bundleID));
    }
    std::vector<SysupQuaymartUpdate> os;
    if (c.withOSUpdate) {
      os.push_back(*SysupQuaymartUpdate::fromDictionary({{"productKey", "os-1"}}));
    }
    catalogue_->postUpdatesAvailableNotification(apps, os, false, std::nullopt);
    const UserNotification n = only();
    EXPECT_EQ(n.title, text("UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TITLE"));
    EXPECT_EQ(n.informativeText, c.body);
    EXPECT_FALSE(n.userInfo.contains("auditInfoCacheKey"));
    EXPECT_TRUE(UpdateNotificationCatalogue::firstUpdatesAvailableNotificationHasBeenPosted());
  }
  // Once per version: the next one has the regular texts.
  catalogue_->postUpdatesAvailableNotification({appUpdate(1, "Snapbox", "com.orvane.Snapbox")}, {},
                                               false, std::nullopt);
  EXPECT_EQ(only().title, text("UPDATES_AVAILABLE_NOTIFICATION_TITLE"));
}

TEST_F(UpdateNotificationCatalogueTest, AFirstNotificationWithoutTheSuiteStillUsesUpTheVersion) {
  catalogue_->postUpdatesAvailableNotification({appUpdate(1, "Ledgerly")}, {}, false, std::nullopt);
  EXPECT_EQ(only().title, text("UPDATES_AVAILABLE_NOTIFICATION_TITLE"));
  EXPECT_TRUE(UpdateNotificationCatalogue::firstUpdatesAvailableNotificationHasBeenPosted());
}

TEST_F(UpdateNotificationCatalogueTest, FailuresCarryTheirFlagAuditAndInstallNowMenu) {
  context_.autoUpdate = true;
  catalogue_->postUpdatesFailedToInstallPostLogoutNotification({{{"productKey", "os-1"}}});
  UserNotification n = only();
  EXPECT_EQ(n.title, text("UPDATES_AVAILABLE_POSTLOGOUT_FAILED_NOTIFICATION_TITLE"));
  EXPECT_TRUE(n.userInfo.at("isPostLogoutUpdateFailure").boolValue());
  EXPECT_TRUE(n.userInfo.at("alternateActionsIncludeInstallNow").boolValue());
  EXPECT_TRUE(n.userInfo.at("OtherButtonIsDetails").boolValue());
  EXPECT_EQ(n.actionButtonTitle, text("UPDATE_NOTIFICATION_INSTALL_BUTTON"));
  const PlistDictionary& audit = context_.cached.at(*n.userInfo.at("auditInfoCacheKey").string());
  EXPECT_EQ(*(*audit.at("postLogoutUpdatesFailed").array())[0]["productKey"].string(), "os-1");
  EXPECT_EQ(n.alternateActionButtonTitles,
            (std::vector<std::string>{
                text("UPDATE_NOTIFICATION_LATER_OPTION_NOW"),
                text("UPDATE_NOTIFICATION_LATER_OPTION_1HOUR_SHORT"),
                text("UPDATE_NOTIFICATION_LATER_OPTION_TONIGHT_SHORT"),
                text("UPDATE_NOTIFICATION_LATER_OPTION_REMIND"),
                text("UPDATE_NOTIFICATION_LATER_OPTION_AUTOUPDATE_RESTART_REQUIRED_OPTIN")}));

  // The twin replaces it; without a later offer it has no menu.
  context_.laterOffered = false;
  catalogue_->postDoItLaterFailedNotificationWithAuditInfo(std::nullopt);
  n = only();
  EXPECT_EQ(n.title, text("UPDATES_AVAILABLE_LATER_FAILED_NOTIFICATION_TITLE"));
  EXPECT_TRUE(n.userInfo.at("isDoItLaterFailure").boolValue());
  EXPECT_FALSE(n.userInfo.contains("isPostLogoutUpdateFailure"));
  EXPECT_FALSE(n.userInfo.contains("auditInfoCacheKey"));
  EXPECT_TRUE(n.alternateActionButtonTitles.empty());
}

TEST_F(UpdateNotificationCatalogueTest, CriticalNotificationsPickByCountAndRestart) {
  catalogue_->postUpdatesAvailableNotification({appUpdate(1, "Ledgerly")}, {}, false, std::nullopt);
  catalogue_->postCriticalUpdateNotification(0, std::nullopt, std::nullopt, true, false);
  UserNotification n = only();  // the updates available notification went
  EXPECT_EQ(n.title, text("CRITICAL_UPDATES_NOTIFICATION_TITLE"));
  EXPECT_EQ(n.informativeText, text("CRITICAL_UPDATES_NOTIFICATION_TEXT"));
  EXPECT_FALSE(n.userInfo.at("CriticalUpdate").boolValue());
  EXPECT_TRUE(n.userInfo.at("CriticalUpdateDelayed").boolValue());
  EXPECT_EQ(n.source(), "AppUpdate");
  EXPECT_EQ(n.actionButtonTitle, text("UPDATE_NOTIFICATION_UPDATE_BUTTON"));

  catalogue_->postCriticalUpdateNotification(1, "Given title", std::nullopt, false, true);
  n = only();
  EXPECT_EQ(n.title, "Given title");
  EXPECT_EQ(n.informativeText, text("CRITICAL_UPDATE_RESTART_NOTIFICATION_TEXT"));
  EXPECT_TRUE(n.userInfo.at("CriticalUpdate").boolValue());
  EXPECT_EQ(n.actionButtonTitle, text("UPDATE_NOTIFICATION_RESTART_BUTTON"));
  EXPECT_NE(n.imageURL, "");

  // Install now: its one button is the dismissing one.
  catalogue_->postCriticalUpdateInstallNowNotification(1, true);
  n = only();
  EXPECT_EQ(n.source(), "CriticalUpdateInstallNow");
  EXPECT_EQ(n.title, text("CRITICAL_UPDATE_INSTALL_NOW_TITLE"));
  EXPECT_EQ(n.informativeText, text("CRITICAL_UPDATE_INSTALL_NOW_RESTART_TEXT"));
  EXPECT_FALSE(n.hasActionButton);
  EXPECT_EQ(n.otherButtonTitle, text("UPDATE_NOTIFICATION_RESTART_BUTTON"));
  EXPECT_TRUE(n.userInfo.at("InstallOnDismiss").boolValue());
}

TEST_F(UpdateNotificationCatalogueTest, TheRestrictionSilencesUpdateNotificationsButNotInstallNow) {
  catalogue_->postAdminInstallNotification(2, false);
  fs::create_directories(fs::path(VendManagedRestrictions::restrictionsFilePath()).parent_path());
  writeBytes(VendManagedRestrictions::restrictionsFilePath(),
             PropertyListSerialization::writeBinary(PlistDictionary{
                 {std::string(LedgerRestrictStoreToDisableSoftwareUpdateNotifications), true}}));
  catalogue_->postUpdatesAvailableNotification({appUpdate(1, "Ledgerly")}, {}, false, std::nullopt);
  catalogue_->postDoItLaterFailedNotificationWithAuditInfo(std::nullopt);
  catalogue_->postCriticalUpdateNotification(1, std::nullopt, std::nullopt, false, false);
  EXPECT_EQ(sources(), std::vector<std::string>{"adminInstalledUpdates"});
  catalogue_->postCriticalUpdateInstallNowNotification(2, false);
  EXPECT_EQ(sources(),
            (std::vector<std::string>{"adminInstalledUpdates", "CriticalUpdateInstallNow"}));
}

TEST_F(UpdateNotificationCatalogueTest, RemovalByVersionKeepsOnlyThePresentVersion) {
  for (const std::optional<std::string>& version :
       {std::optional<std::string>(VendDevice::osMajorVersionString()),
        std::optional<std::string>("older"), std::optional<std::string>()}) {
    UserNotification n;
    n.userInfo = {{"Source", "AppUpdate"}};
    if (version) n.userInfo["osVersion"] = *version;
    center_->deliverNotification(n);
  }
  catalogue_->removeUpdatesAvailableNotificationFromOlderOSVersions();
  const UserNotification left = only();
  EXPECT_EQ(*left.userInfo.at("osVersion").string(), VendDevice::osMajorVersionString());
  catalogue_->removeUpdatesAvailableNotifications();
  EXPECT_TRUE(delivered().empty());
}

struct AutoInstalledCase {
  std::vector<std::optional<std::string>> titles;
  const char* title;
  const char* body;
};

TEST_F(UpdateNotificationCatalogueTest, AppsUpdatedNamesAtMostTwo) {
  const AutoInstalledCase cases[] = {
      {{"Ledgerly"}, "Ledgerly Updated", "The app was updated automatically."},
      {{"Ledgerly", "Tally"}, "2 Apps Updated", "Ledgerly and Tally were updated automatically."},
      {{"Ledgerly", "Tally", "Abacus"},
       "3 Apps Updated",
       "Ledgerly, Tally and others were updated automatically."},
      {{std::nullopt, "Tally"}, "2 Apps Updated", "Tally and others were updated automatically."},
  };
  for (const AutoInstalledCase& c : cases) {
    std::vector<LedgerUpdateRef> updates;
    for (const std::optional<std::string>& title : c.titles) {
      updates.push_back(appUpdate(updates.size() + 1, title));
    }
    catalogue_->postNotificationForAutoInstalledUpdates(updates);
    const UserNotification n = only();
    EXPECT_EQ(n.title, c.title);
    EXPECT_EQ(n.informativeText, c.body);
    EXPECT_FALSE(n.hasActionButton);
  }
}

TEST_F(UpdateNotificationCatalogueTest, OffersHelpersAndInstallsReplaceTheirOwnKind) {
  catalogue_->postNotificationForAutoUpdateOptIn();
  catalogue_->postNotificationForAutoUpdateOfRestartRequiredUpdatesOptIn();
  catalogue_->postPowerLaterHelperNotification();
  catalogue_->postOtherUsersLoggedInLaterHelperNotification();
  catalogue_->postSilentInstallNotification(1, std::nullopt, std::nullopt, "https://example.org");
  catalogue_->postAdminInstallNotification(1, true);
  catalogue_->postDoItLaterSuccessNotificationWithUpdates({});
  EXPECT_EQ(sources(),
            (std::vector<std::string>{"autoUpdateRestartRequiredOptIn", "DoItLaterHelper",
                                      "CriticalUpdatePostInstall", "adminInstalledUpdates",
                                      "postLogoutUpdatesInstalledLater"}));
  const std::vector<UserNotification> list = delivered();
  EXPECT_EQ(list[1].title, text("DOITLATER_HELPER_OTHER_USERS_TITLE"));
  EXPECT_EQ(list[2].style, UserNotification::kPostInstallStyle);
  EXPECT_TRUE(list[2].hasActionButton);
  EXPECT_EQ(*list[2].userInfo.at("URL").string(), "https://example.org");
  EXPECT_EQ(list[3].title,
            text("ADMIN_INSTALLED_POST_LOGOUT_UPDATE_POSTINSTALL_NOTIFICATION_TITLE"));
  EXPECT_EQ(*list[3].userInfo.at("URL").string(), UpdateNotificationCatalogue::kUpdatesPageURL);
  EXPECT_FALSE(list[3].hasActionButton);
}

TEST_F(UpdateNotificationCatalogueTest, AFailureOnScreenIsSeen) {
  center_->setServer(std::make_shared<ShowingServer>());
  catalogue_->postUpdatesAvailableNotification({appUpdate(1, "Ledgerly")}, {}, false, std::nullopt);
  ASSERT_TRUE(eventually([&] { return only().displayed; }));
  EXPECT_FALSE(catalogue_->updateFailureNotificationIsDisplayed());
  catalogue_->postDoItLaterFailedNotificationWithAuditInfo(std::nullopt);
  EXPECT_TRUE(eventually([&] { return catalogue_->updateFailureNotificationIsDisplayed(); }));
}

}  // namespace
}  // namespace larder::testing
