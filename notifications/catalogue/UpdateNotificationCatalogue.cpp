#include "notifications/catalogue/UpdateNotificationCatalogue.h"

#include <algorithm>
#include <array>
#include <filesystem>
#include <locale>
#include <sstream>

#include "notifications/center/UserNotificationCenter.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/dialogs/LocalizedStringBundle.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/host/VendDevice.h"
#include "store-runtime/host/VendManagedRestrictions.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateController";

// Icons by their freedesktop names, which every icon theme carries.
constexpr std::string_view kUpdatesIcon = "software-update-available";
constexpr std::string_view kCriticalUpdateIcon = "software-update-urgent";
// The icon the desktop shows for managed settings, standing for the
// machine's manager.
constexpr std::string_view kManagedSettingsIcon = "preferences-system";

// The applications of the suite that the first notification under a new
// major version names, by bundle identifier prefix, in the order they are
// named.
constexpr std::array<std::string_view, 4> kSuitePrefixes = {
    "com.orvane.Snapbox", "com.orvane.Loopforge", "com.orvane.Anvil", "com.orvane.ReelcutApp"};

std::string orNull(const std::optional<std::string>& text) {
  return text.value_or("(null)");
}

std::optional<std::size_t> suiteRank(const LedgerUpdateRef& update) {
  const std::optional<std::string>& bundleID = update->bundleID();
  if (!bundleID) return std::nullopt;
  for (std::size_t rank = 0; rank < kSuitePrefixes.size(); ++rank) {
    if (bundleID->starts_with(kSuitePrefixes[rank])) return rank;
  }
  return std::nullopt;
}

// A count as the user's locale writes numbers.
std::string localizedNumber(std::size_t number) {
  std::ostringstream text;
  try {
    text.imbue(std::locale(""));
  } catch (const std::runtime_error&) {
    // An unknown locale in the environment: plain digits.
  }
  text << number;
  return text.str();
}

bool flagOf(const PlistDictionary& userInfo, std::string_view key) {
  auto found = userInfo.find(key);
  return found != userInfo.end() && found->second.boolValue();
}

std::optional<std::string> stringOf(const PlistDictionary& userInfo, std::string_view key) {
  auto found = userInfo.find(key);
  if (found == userInfo.end() || !found->second.string()) return std::nullopt;
  return *found->second.string();
}

bool osUpdatesRequireAction(const std::vector<SysupQuaymartUpdate>& osUpdates) {
  return SysupQuaymartUpdateController::sharedUpdateController().actionRequiredForUpdates(
             osUpdates) != 0;
}

}  // namespace

UpdateNotificationCatalogue::UpdateNotificationCatalogue(
    VendStoreClient storeClient, UpdateNotificationContext& context,
    std::shared_ptr<UserNotificationCenter> center)
    : storeClient_(std::move(storeClient)),
      context_(context),
      center_(center ? std::move(center)
                     : UserNotificationCenter::centerForIdentifier(
                           std::string(UserNotificationCenter::kServiceIdentifier),
                           UserNotificationCenter::kSystemCenter)) {}

// --- Builders ---

std::string UpdateNotificationCatalogue::text(std::string_view key) const {
  return LedgerLocalizedString(key, &storeClient_);
}

std::string UpdateNotificationCatalogue::format(
    std::string_view key, std::initializer_list<std::string_view> arguments) const {
  return LedgerLocalizedFormat(text(key), arguments);
}

UserNotification UpdateNotificationCatalogue::bannerNotification() const {
  UserNotification notification;
  notification.displayStyle = UserNotification::kBanner;
  notification.imageURL = kUpdatesIcon;
  return notification;
}

UserNotification UpdateNotificationCatalogue::alertNotification() const {
  UserNotification notification = bannerNotification();
  notification.displayStyle = UserNotification::kAlert;
  return notification;
}

UserNotification UpdateNotificationCatalogue::criticalUpdateNotification() const {
  UserNotification notification = alertNotification();
  notification.imageURL = kCriticalUpdateIcon;
  return notification;
}

// The first keys tie the notification to its update controller across a
// restart of the service.
PlistDictionary UpdateNotificationCatalogue::userInfoIncludingStoreClient(
    std::string_view source, bool withOSVersion) const {
  PlistDictionary userInfo{
      {"storeClientIdentifier", storeClient_.identifier()},
      {"storeClientFrameworkVersion", storeClient_.frameworkVersion()},
      {"Source", std::string(source)},
  };
  if (withOSVersion) userInfo.emplace("osVersion", VendDevice::osMajorVersionString());
  return userInfo;
}

std::vector<std::string> UpdateNotificationCatalogue::laterOptions(
    std::initializer_list<std::string_view> keys) const {
  std::vector<std::string> options;
  for (std::string_view key : keys) options.push_back(text(key));
  const bool autoUpdate = context_.isAutoUpdatedEnabled();
  if (!autoUpdate) {
    options.push_back(text("UPDATE_NOTIFICATION_LATER_OPTION_AUTOUPDATE_OPTIN"));
  } else if (!context_.isAutoUpdatedOfRestartRequiredUpdatesEnabled()) {
    options.push_back(text("UPDATE_NOTIFICATION_LATER_OPTION_AUTOUPDATE_RESTART_REQUIRED_OPTIN"));
  }
  return options;
}

std::vector<LedgerUpdateRef> UpdateNotificationCatalogue::suiteUpdatesIncludedInAppUpdates(
    const std::vector<LedgerUpdateRef>& appUpdates) {
  std::vector<LedgerUpdateRef> suite;
  std::ranges::copy_if(appUpdates, std::back_inserter(suite),
                       [](const LedgerUpdateRef& update) { return suiteRank(update).has_value(); });
  std::ranges::stable_sort(suite, {},
                           [](const LedgerUpdateRef& update) { return *suiteRank(update); });
  return suite;
}

// Posted once per major version of the system: names the suite
// applications that are new for the user.
void UpdateNotificationCatalogue::setFirstNotificationTexts(
    UserNotification& notification, const std::vector<LedgerUpdateRef>& appUpdates,
    const std::vector<SysupQuaymartUpdate>& osUpdates) const {
  TILL_LOG(1,
           "%@: Posting Hearth/Anvil updates available notification for first update "
           "notification with updates: %@",
           kSpeaker, PlistValue(static_cast<std::int64_t>(appUpdates.size())));
  notification.title = text("UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TITLE");
  const std::vector<LedgerUpdateRef> suite = suiteUpdatesIncludedInAppUpdates(appUpdates);
  const std::size_t named = std::min<std::size_t>(3, suite.size());
  // All OS updates together count as one.
  const std::size_t total = appUpdates.size() + (osUpdates.empty() ? 0 : 1);
  const bool more = total > suite.size() || named < appUpdates.size();
  std::vector<std::string> titles;
  for (std::size_t i = 0; i < named; ++i) titles.push_back(suite[i]->title().value_or(""));
  std::string names;
  if (named == 1) {
    names = titles[0];
  } else if (named == 2) {
    names = format(more ? "UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_2_UPDATES_AND_MORE_FORMAT"
                        : "UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_2_UPDATES_FORMAT",
                   {titles[0], titles[1]});
  } else {
    names = format(more ? "UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_3_UPDATES_AND_MORE_FORMAT"
                        : "UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_3_UPDATES_FORMAT",
                   {titles[0], titles[1], titles[2]});
  }
  if (more) {
    const std::size_t others = total - named;
    notification.informativeText =
        format(others == 1 ? "UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TEXT_AND_ONE_OTHER_FORMAT"
                           : "UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TEXT_AND_OTHERS_FORMAT",
               {names, localizedNumber(others)});
  } else {
    notification.informativeText = format(
        appUpdates.size() == 1 ? "UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TEXT_SINGLE_FORMAT"
                               : "UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TEXT_FORMAT",
        {names});
  }
}

void UpdateNotificationCatalogue::setRegularTexts(UserNotification& notification,
                                                  const std::vector<LedgerUpdateRef>& appUpdates,
                                                  const std::vector<SysupQuaymartUpdate>& osUpdates,
                                                  bool restartRequired, bool laterOffered) const {
  const bool autoUpdate = context_.isAutoUpdatedEnabled();
  const bool autoRestart = context_.isAutoUpdatedOfRestartRequiredUpdatesEnabled();
  const bool action = osUpdatesRequireAction(osUpdates);
  // Automatic updates were on for what is left to do, so something stopped
  // them.
  const bool failed = (autoUpdate && !appUpdates.empty()) ||
                      (autoUpdate && !osUpdates.empty() && !action) ||
                      (autoRestart && !osUpdates.empty() && action);
  if (!failed) {
    TILL_LOG(1, "%@: Auto update is NOT enabled, posting updates available notification", kSpeaker);
    notification.title = text("UPDATES_AVAILABLE_NOTIFICATION_TITLE");
    if (restartRequired) {
      notification.informativeText =
          text(laterOffered ? "UPDATES_AVAILABLE_NOTIFICATION_TEXT_RESTART"
                            : "UPDATES_AVAILABLE_NOTIFICATION_LATER_NOT_OFFERED_RESTART_TEXT");
    } else {
      notification.informativeText =
          text(laterOffered ? "UPDATES_AVAILABLE_NOTIFICATION_TEXT"
                            : "UPDATES_AVAILABLE_NOTIFICATION_LATER_NOT_OFFERED_TEXT");
    }
    return;
  }
  TILL_LOG(1, "%@: Auto update is enabled, posting auto update failed notification", kSpeaker);
  notification.userInfo.insert_or_assign("isAutoUpdateFailure", true);
  notification.title = text("UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TITLE");
  const bool appRunning = std::ranges::any_of(
      appUpdates, [](const LedgerUpdateRef& update) { return update->autoUpdateAbortCode() == 3; });
  std::string_view key = "UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TEXT_GENERIC";
  if (restartRequired && !autoRestart) {
    key = laterOffered ? "UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TEXT_RESTART"
                       : "UPDATES_AVAILABLE_NOTIFICATION_LATER_NOT_OFFERED_RESTART_TEXT";
  } else if (appRunning || (action && autoRestart)) {
    key = "UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TEXT_APP_RUNNING";
  }
  notification.informativeText = text(key);
}

// The menu's positions are what the activation reads the user's choice
// from.
void UpdateNotificationCatalogue::setUpdatesAvailableButtons(UserNotification& notification,
                                                             bool restartRequired,
                                                             bool laterOffered) const {
  const std::string install = text(restartRequired ? "UPDATE_NOTIFICATION_RESTART_BUTTON"
                                                   : "UPDATE_NOTIFICATION_INSTALL_BUTTON");
  if (laterOffered) {
    notification.otherButtonTitle = install;
    notification.actionButtonTitle = text("UPDATE_NOTIFICATION_LATER_BUTTON");
    notification.alternateActionButtonTitles = laterOptions(
        {"UPDATE_NOTIFICATION_LATER_OPTION_1HOUR", "UPDATE_NOTIFICATION_LATER_OPTION_TONIGHT",
         "UPDATE_NOTIFICATION_LATER_OPTION_REMIND"});
  } else {
    notification.actionButtonTitle = install;
    notification.otherButtonTitle = text("UPDATE_NOTIFICATION_DETAILS_BUTTON");
    notification.userInfo.insert_or_assign("OtherButtonIsDetails", true);
  }
  notification.alwaysShowAlternateActionMenu = !notification.alternateActionButtonTitles.empty();
}

// --- Posts ---

void UpdateNotificationCatalogue::postUpdatesAvailableNotification(
    const std::vector<LedgerUpdateRef>& appUpdates,
    const std::vector<SysupQuaymartUpdate>& osUpdates, bool restartRequired,
    const std::optional<PlistDictionary>& auditInfo) {
  if (updateNotificationsAreRestricted()) return;
  removeSources({kSourceAppUpdate, kSourceAutoInstalledUpdates, kSourceClaimedButNotDownloaded});
  const std::optional<std::string> auditKey =
      cacheAuditInfo(auditInfo, "updates available notification");
  UserNotification notification = alertNotification();
  notification.poofsOnCancel = false;
  notification.userInfo = userInfoIncludingStoreClient(kSourceAppUpdate, true);
  if (auditKey) notification.userInfo.emplace("auditInfoCacheKey", *auditKey);
  const bool laterOffered = context_.shouldOfferDoItLaterForAppUpdates(appUpdates, osUpdates);
  if (!firstUpdatesAvailableNotificationHasBeenPosted() &&
      !suiteUpdatesIncludedInAppUpdates(appUpdates).empty()) {
    setFirstNotificationTexts(notification, appUpdates, osUpdates);
  } else {
    setRegularTexts(notification, appUpdates, osUpdates, restartRequired, laterOffered);
  }
  setUpdatesAvailableButtons(notification, restartRequired, laterOffered);
  TILL_LOG(1, "%@: (Updates Available) deliverNotification:%@ with auditInfo (%@) %@", kSpeaker,
           PlistValue(notification.toDictionary()), auditKey.value_or("(null)"),
           auditInfo ? PlistValue(*auditInfo) : PlistValue());
  deliver(std::move(notification));
  context_.resetUpdatesAvailableNotificationTimestamp();
  selfDidPostUpdatesAvailableNotification();
}

void UpdateNotificationCatalogue::postUpdatesFailedToInstallPostLogoutNotification(
    const std::vector<PlistDictionary>& failedUpdates) {
  PlistArray failed(failedUpdates.begin(), failedUpdates.end());
  postFailure(true, PlistDictionary{{"postLogoutUpdatesFailed", std::move(failed)}});
}

void UpdateNotificationCatalogue::postDoItLaterFailedNotificationWithAuditInfo(
    const std::optional<PlistDictionary>& auditInfo) {
  postFailure(false, auditInfo);
}

// The post-logout failure and the Do It Later failure are twins that
// differ in their texts, their flag and their log lines.
void UpdateNotificationCatalogue::postFailure(bool postLogout,
                                              const std::optional<PlistDictionary>& auditInfo) {
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  const bool action = osUpdatesRequireAction(sysup.availableUpdates());
  if (updateNotificationsAreRestricted()) return;
  removeSources({kSourceAppUpdate, kSourceAutoInstalledUpdates});
  const std::optional<std::string> auditKey =
      cacheAuditInfo(auditInfo, postLogout ? "post-logout update failure notification"
                                           : "DIL failure notification");
  UserNotification notification = alertNotification();
  notification.poofsOnCancel = false;
  notification.userInfo = userInfoIncludingStoreClient(kSourceAppUpdate, true);
  notification.userInfo.emplace(postLogout ? "isPostLogoutUpdateFailure" : "isDoItLaterFailure",
                                true);
  if (auditKey) notification.userInfo.emplace("auditInfoCacheKey", *auditKey);
  notification.title = text(postLogout ? "UPDATES_AVAILABLE_POSTLOGOUT_FAILED_NOTIFICATION_TITLE"
                                       : "UPDATES_AVAILABLE_LATER_FAILED_NOTIFICATION_TITLE");
  notification.informativeText =
      text(postLogout ? "UPDATES_AVAILABLE_POSTLOGOUT_FAILED_NOTIFICATION_TEXT"
                      : "UPDATES_AVAILABLE_LATER_FAILED_NOTIFICATION_TEXT");
  notification.otherButtonTitle = text("UPDATE_NOTIFICATION_DETAILS_BUTTON");
  notification.userInfo.emplace("OtherButtonIsDetails", true);
  notification.actionButtonTitle = text("UPDATE_NOTIFICATION_INSTALL_BUTTON");
  notification.userInfo.emplace("alternateActionsIncludeInstallNow", true);
  if (context_.shouldOfferDoItLaterForAvailableUpdates()) {
    notification.alternateActionButtonTitles =
        laterOptions({action ? "UPDATE_NOTIFICATION_LATER_OPTION_RESTART_NOW"
                             : "UPDATE_NOTIFICATION_LATER_OPTION_NOW",
                      "UPDATE_NOTIFICATION_LATER_OPTION_1HOUR_SHORT",
                      "UPDATE_NOTIFICATION_LATER_OPTION_TONIGHT_SHORT",
                      "UPDATE_NOTIFICATION_LATER_OPTION_REMIND"});
    notification.alwaysShowAlternateActionMenu = true;
  }
  const PlistValue described(notification.toDictionary());
  const PlistValue audit = auditInfo ? PlistValue(*auditInfo) : PlistValue();
  if (postLogout) {
    TILL_LOG(1, "%@: (Post-Logout Update Failure) deliverNotification:%@ with auditInfo (%@) %@",
             kSpeaker, described, auditKey.value_or("(null)"), audit);
  } else {
    TILL_LOG(1, "%@: (DIL Failure) deliverNotification:%@ with auditInfo (%@) %@", kSpeaker,
             described, auditKey.value_or("(null)"), audit);
  }
  deliver(std::move(notification));
}

void UpdateNotificationCatalogue::postDoItLaterSuccessNotificationWithUpdates(
    const std::vector<PlistDictionary>&) {
  removeSources({kSourceLaterSuccess, kSourceAutoInstalledUpdates});
  UserNotification notification = alertNotification();
  notification.userInfo = userInfoIncludingStoreClient(kSourceLaterSuccess, false);
  notification.title = text("DOITLATER_POSTLOGOUTINSTALLED_NOTIFICATION_TITLE");
  notification.informativeText = text("DOITLATER_POSTLOGOUTINSTALLED_NOTIFICATION_TEXT");
  notification.actionButtonTitle = text("UPDATE_NOTIFICATION_DETAILS_BUTTON");
  notification.otherButtonTitle = text("UPDATE_NOTIFICATION_CLOSE_BUTTON");
  deliver(std::move(notification));
}

void UpdateNotificationCatalogue::postCriticalUpdateNotification(
    std::int64_t count, const std::optional<std::string>& title,
    const std::optional<std::string>& text, bool delayedAutoInstall, bool restartRequired) {
  if (updateNotificationsAreRestricted()) return;
  removeSources({kSourceAutoInstalledUpdates, kSourceAppUpdate});
  removeCriticalUpdateNotificationsIncludingPostInstall(false);
  UserNotification notification = criticalUpdateNotification();
  notification.poofsOnCancel = false;
  notification.userInfo = userInfoIncludingStoreClient(kSourceAppUpdate, true);
  notification.userInfo.emplace("CriticalUpdate", count >= 1);
  notification.userInfo.emplace("CriticalUpdateDelayed", delayedAutoInstall);
  const bool one = count == 1;
  notification.title = title ? *title
                             : this->text(one ? "CRITICAL_UPDATE_NOTIFICATION_TITLE"
                                              : "CRITICAL_UPDATES_NOTIFICATION_TITLE");
  if (text) {
    notification.informativeText = *text;
  } else if (one) {
    notification.informativeText =
        this->text(restartRequired ? "CRITICAL_UPDATE_RESTART_NOTIFICATION_TEXT"
                                   : "CRITICAL_UPDATE_NOTIFICATION_TEXT");
  } else {
    notification.informativeText =
        this->text(restartRequired ? "CRITICAL_UPDATES_RESTART_NOTIFICATION_TEXT"
                                   : "CRITICAL_UPDATES_NOTIFICATION_TEXT");
  }
  notification.actionButtonTitle = this->text(
      restartRequired ? "UPDATE_NOTIFICATION_RESTART_BUTTON" : "UPDATE_NOTIFICATION_UPDATE_BUTTON");
  notification.otherButtonTitle = this->text("UPDATE_NOTIFICATION_DETAILS_BUTTON");
  TILL_LOG(1, "%@: postCriticalUpdateNotificationWithTitle:text:delayedAutoInstall delivering %@",
           kSpeaker, PlistValue(notification.toDictionary()));
  deliver(std::move(notification));
  context_.resetUpdatesAvailableNotificationTimestamp();
}

// Not subject to the restriction: the install goes ahead whatever the
// notification says, and the user should know.
void UpdateNotificationCatalogue::postCriticalUpdateInstallNowNotification(std::int64_t count,
                                                                           bool restartRequired) {
  removeSources({kSourceAppUpdate, kSourceAutoInstalledUpdates});
  removeCriticalUpdateNotificationsIncludingPostInstall(false);
  UserNotification notification = criticalUpdateNotification();
  notification.poofsOnCancel = false;
  notification.userInfo = userInfoIncludingStoreClient(kSourceCriticalInstallNow, false);
  notification.userInfo.emplace("InstallOnDismiss", true);
  const bool one = count == 1;
  notification.title =
      text(one ? "CRITICAL_UPDATE_INSTALL_NOW_TITLE" : "CRITICAL_UPDATES_INSTALL_NOW_TITLE");
  if (one) {
    notification.informativeText = text(restartRequired ? "CRITICAL_UPDATE_INSTALL_NOW_RESTART_TEXT"
                                                        : "CRITICAL_UPDATE_INSTALL_NOW_TEXT");
  } else {
    notification.informativeText =
        text(restartRequired ? "CRITICAL_UPDATES_INSTALL_NOW_RESTART_TEXT"
                             : "CRITICAL_UPDATES_INSTALL_NOW_TEXT");
  }
  // The one button dismisses, and dismissing starts the install.
  notification.hasActionButton = false;
  notification.otherButtonTitle = text(restartRequired ? "UPDATE_NOTIFICATION_RESTART_BUTTON"
                                                       : "UPDATE_NOTIFICATION_UPDATE_BUTTON");
  TILL_LOG(1, "%@: _postNotificationWithCriticalUpdates delivering %@", kSpeaker,
           PlistValue(notification.toDictionary()));
  deliver(std::move(notification));
  context_.resetUpdatesAvailableNotificationTimestamp();
}

void UpdateNotificationCatalogue::postSilentInstallNotification(
    std::int64_t count, const std::optional<std::string>& title,
    const std::optional<std::string>& text, const std::optional<std::string>& url) {
  removeCriticalUpdateNotificationsIncludingPostInstall(true);
  UserNotification notification = criticalUpdateNotification();
  notification.userInfo = userInfoIncludingStoreClient(kSourceCriticalPostInstall, false);
  const bool one = count == 1;
  notification.title = title ? *title
                             : this->text(one ? "CRITICAL_UPDATE_POSTINSTALL_NOTIFICATION_TITLE"
                                              : "CRITICAL_UPDATES_POSTINSTALL_NOTIFICATION_TITLE");
  notification.informativeText =
      text ? *text
           : this->text(one ? "CRITICAL_UPDATE_POSTINSTALL_NOTIFICATION_TEXT"
                            : "CRITICAL_UPDATES_POSTINSTALL_NOTIFICATION_TEXT");
  notification.hasActionButton = false;
  notification.style = UserNotification::kPostInstallStyle;
  if (url) {
    // The main button opens the link.
    notification.userInfo.emplace("URL", *url);
    notification.hasActionButton = true;
    notification.actionButtonTitle = this->text("UPDATE_NOTIFICATION_DETAILS_BUTTON");
  }
  deliver(std::move(notification));
}

void UpdateNotificationCatalogue::postAdminInstallNotification(std::int64_t count,
                                                               bool restartRequired) {
  removeSources({kSourceAdminInstalled});
  UserNotification notification = alertNotification();
  notification.hasActionButton = false;
  notification.userInfo = userInfoIncludingStoreClient(kSourceAdminInstalled, false);
  notification.userInfo.emplace("URL", std::string(kUpdatesPageURL));
  const bool one = count == 1;
  if (one && restartRequired) {
    notification.title = text("ADMIN_INSTALLED_POST_LOGOUT_UPDATE_POSTINSTALL_NOTIFICATION_TITLE");
    notification.informativeText =
        text("ADMIN_INSTALLED_POST_LOGOUT_UPDATE_POSTINSTALL_NOTIFICATION_TEXT");
  } else if (one) {
    notification.title = text("ADMIN_INSTALLED_UPDATE_POSTINSTALL_NOTIFICATION_TITLE");
    notification.informativeText = text("ADMIN_INSTALLED_UPDATE_POSTINSTALL_NOTIFICATION_TEXT");
  } else if (restartRequired) {
    notification.title = text("ADMIN_INSTALLED_POST_LOGOUT_UPDATES_POSTINSTALL_NOTIFICATION_TITLE");
    notification.informativeText =
        text("ADMIN_INSTALLED_POST_LOGOUT_UPDATES_POSTINSTALL_NOTIFICATION_TEXT");
  } else {
    notification.title = text("ADMIN_INSTALLED_UPDATES_POSTINSTALL_NOTIFICATION_TITLE");
    notification.informativeText = text("ADMIN_INSTALLED_UPDATES_POSTINSTALL_NOTIFICATION_TEXT");
  }
  deliver(std::move(notification));
}

void UpdateNotificationCatalogue::postNotificationForAutoInstalledUpdates(
    const std::vector<LedgerUpdateRef>& updates) {
  removeSources({kSourceAutoInstalledUpdates});
  UserNotification notification = alertNotification();
  notification.hasActionButton = false;
  notification.userInfo = userInfoIncludingStoreClient(kSourceAutoInstalledUpdates, false);
  if (updates.size() == 1) {
    notification.title = format("AUTOUPDATE_POSTUPDATE_NOTIFICATION_TITLE_SINGLE",
                                {updates[0]->title().value_or("")});
    notification.informativeText = text("AUTOUPDATE_POSTUPDATE_NOTIFICATION_TEXT_SINGLE");
    deliver(std::move(notification));
    return;
  }
  notification.title = format("AUTOUPDATE_POSTUPDATE_NOTIFICATION_TITLE_MULTIPLE",
                              {localizedNumber(updates.size())});
  // At most two names; the last of the list is joined with "and".
  std::string body;
  std::size_t names = 0;
  for (std::size_t i = 0; i < updates.size() && names < 2; ++i) {
    const std::optional<std::string> title = updates[i]->title();
    if (!title) continue;
    ++names;
    if (names > 1) {
      const bool last = i + 1 == updates.size() && updates.size() <= names;
      body += last ? text("AUTOUPDATE_POSTUPDATE_NOTIFICATION_TEXT_MULTIPLE_AND") : ", ";
    }
    body += *title;
  }
  if (updates.size() > names) {
    body += " " + text("AUTOUPDATE_POSTUPDATE_NOTIFICATION_TEXT_MULTIPLE_AND_OTHERS");
  }
  body += " " + text("AUTOUPDATE_POSTUPDATE_NOTIFICATION_TEXT_MULTIPLE_WERE_UPDATED");
  notification.informativeText = std::move(body);
  deliver(std::move(notification));
}

void UpdateNotificationCatalogue::postNotificationForAutoUpdateOptIn() {
  postOptIn(kSourceAutoUpdateOptIn, "AUTOUPDATE_OPTIN_NOTIFICATION_");
}

void UpdateNotificationCatalogue::postNotificationForAutoUpdateOfRestartRequiredUpdatesOptIn() {
  postOptIn(kSourceRestartRequiredOptIn, "AUTOUPDATE_RESTARTREQUIRED_OPTIN_NOTIFICATION_");
}

// The two offers differ in their source and their texts, whose keys share
// a prefix.
void UpdateNotificationCatalogue::postOptIn(std::string_view source, std::string_view keyPrefix) {
  auto keyed = [&](std::string_view suffix) { return text(std::string(keyPrefix) += suffix); };
  UserNotification notification = alertNotification();
  notification.userInfo = userInfoIncludingStoreClient(source, false);
  notification.title = keyed("TITLE");
  notification.informativeText = keyed("BODY");
  notification.actionButtonTitle = keyed("ENABLE");
  notification.otherButtonTitle = keyed("CLOSE");
  // At most one offer is around.
  removeSources({kSourceAutoUpdateOptIn, kSourceRestartRequiredOptIn});
  deliver(std::move(notification));
}

void UpdateNotificationCatalogue::postOtherUsersLoggedInLaterHelperNotification() {
  postLaterHelper("DOITLATER_HELPER_OTHER_USERS_TITLE", "DOITLATER_HELPER_OTHER_USERS_TEXT");
}

void UpdateNotificationCatalogue::postPowerLaterHelperNotification() {
  postLaterHelper("DOITLATER_HELPER_POWER_TITLE", "DOITLATER_HELPER_POWER_TEXT");
}

std::int64_t UpdateNotificationCatalogue::showRestartCountdownNotification() {
  // One left over from a service that ended during a countdown answers
  // nothing any more.
  removeSources({kSourceRestartCountdown});
  UserNotification notification = alertNotification();
  notification.poofsOnCancel = false;
  notification.userInfo = userInfoIncludingStoreClient(kSourceRestartCountdown, false);
  notification.title = text("RESTART_COUNTDOWN_NOTIFICATION_TITLE");
  notification.informativeText = text("RESTART_COUNTDOWN_NOTIFICATION_TEXT");
  notification.actionButtonTitle = text("RESTART_COUNTDOWN_NOTIFICATION_RESTART_BUTTON");
  notification.otherButtonTitle = text("RESTART_COUNTDOWN_NOTIFICATION_LATER_BUTTON");
  const UserNotification posted = center_->deliverNotification(std::move(notification));
  const std::int64_t result = LedgerTwilightAgent::showRestartCountdownNotification();
  center_->removeDeliveredNotification(posted);
  TILL_LOG(2, "%@: Restart countdown notification %@ ended with %ld", kSpeaker, posted.identifier,
           result);
  return result;
}

std::optional<std::int64_t> UpdateNotificationCatalogue::restartCountdownAnswer(
    const UserNotification& notification, bool dismissed) {
  if (notification.source() != kSourceRestartCountdown) return std::nullopt;
  if (dismissed) return kCountdownLater;
  if (notification.activationType == UserNotification::kActionButtonClicked) {
    return kCountdownRestartNow;
  }
  return std::nullopt;
}

// What would keep a Do It Later install from happening.
void UpdateNotificationCatalogue::postLaterHelper(std::string_view titleKey,
                                                  std::string_view textKey) {
  removeSources({kSourceLaterHelper});
  UserNotification notification = alertNotification();
  notification.hasActionButton = false;
  notification.userInfo = userInfoIncludingStoreClient(kSourceLaterHelper, false);
  notification.title = text(titleKey);
  notification.informativeText = text(textKey);
  deliver(std::move(notification));
}

// --- Major OS update ---

UserNotification UpdateNotificationCatalogue::majorOSUpdateNotificationOfType(
    std::string_view type) const {
  UserNotification notification = alertNotification();
  notification.poofsOnCancel = false;
  notification.userInfo = userInfoIncludingStoreClient(kSourceMajorOSUpdate, true);
  notification.userInfo.emplace(std::string(kMajorOSUpdateTypeKey), std::string(type));
  return notification;
}

// The texts are the update's, not the store's: the bundle comes with the
// update and speaks for it.
void UpdateNotificationCatalogue::postMajorOSUpdateAvailableNotificationOfType(
    std::string_view type, const std::optional<Bundle>& bundle) {
  UserNotification notification = majorOSUpdateNotificationOfType(type);
  auto textOf = [&](std::string_view word) -> std::optional<std::string> {
    if (!bundle) return std::nullopt;
    return LocalizedStringBundle::atPath(bundle->path())
        .textForKey(std::string(type) + "." + std::string(word), std::nullopt, std::nullopt);
  };
  const std::optional<std::string> title = textOf("Title");
  const std::optional<std::string> body = textOf("InformativeText");
  const std::optional<std::string> otherButton = textOf("OtherButtonText");
  const std::optional<std::string> actionButton = textOf("ActionButtonText");
  if (!title || !body || !otherButton) {
    TILL_LOG(1,
             "%@: ERROR: Unable to show major OS update notification due to missing strings: %@ "
             ": %@ : %@ : %@",
             kSpeaker, orNull(title), orNull(body), orNull(otherButton), orNull(actionButton));
    return;
  }
  notification.title = *title;
  notification.informativeText = *body;
  notification.otherButtonTitle = *otherButton;
  notification.hasActionButton = actionButton.has_value();
  if (actionButton) notification.actionButtonTitle = *actionButton;
  if (const std::optional<std::string> badge = textOf("BadgeKey"); badge && !badge->empty()) {
    const std::string icon =
        bundle->path() + "/" + std::string(Bundle::kResourcesFolder) + "/" + *badge + ".icns";
    std::error_code error;
    if (std::filesystem::is_regular_file(icon, error)) notification.imageURL = icon;
  }
  removeSources({kSourceMajorOSUpdate});
  TILL_LOG(1, "%@: (Major OS Update) deliverNotification:%@ of type %@", kSpeaker,
           PlistValue(notification.toDictionary()), type);
  deliver(std::move(notification));
}

void UpdateNotificationCatalogue::postMajorOSUpdateMDMInstallNotification() {
  removeSources({kSourceAppUpdate, kSourceAutoInstalledUpdates, kSourceClaimedButNotDownloaded});
  UserNotification notification = majorOSUpdateNotificationOfType(kMajorOSUpdatePending);
  notification.title = text("ADMIN_INSTALLED_POST_LOGOUT_UPDATE_POSTINSTALL_NOTIFICATION_TITLE");
  notification.informativeText =
      text("ADMIN_INSTALLED_POST_LOGOUT_UPDATE_POSTINSTALL_NOTIFICATION_TEXT");
  notification.otherButtonTitle = text("UPDATE_NOTIFICATION_RESTART_BUTTON");
  notification.hasActionButton = false;
  notification.imageURL = kManagedSettingsIcon;
  TILL_LOG(1, "%@: (Major OS Update) deliverNotification:%@ of type %@", kSpeaker,
           PlistValue(notification.toDictionary()), kMajorOSUpdatePending);
  deliver(std::move(notification));
}

// --- Removals ---

void UpdateNotificationCatalogue::removeDeliveredNotificationsWithSource(
    std::string_view source, const std::optional<std::string>& excludingOSVersion) {
  removeNotifications({source}, excludingOSVersion);
}

void UpdateNotificationCatalogue::removeSources(std::initializer_list<std::string_view> sources) {
  removeNotifications(sources, std::nullopt);
}

// One walk over the list, then one over the screen, for every source: a
// notification can be on screen after it left the list.
void UpdateNotificationCatalogue::removeNotifications(
    std::initializer_list<std::string_view> sources,
    const std::optional<std::string>& excludingOSVersion) {
  for (const bool onScreen : {false, true}) {
    const std::vector<UserNotification> notifications =
        onScreen ? center_->displayedNotifications() : center_->deliveredNotifications();
    for (const UserNotification& notification : notifications) {
      const std::optional<std::string> osVersion = stringOf(notification.userInfo, "osVersion");
      if (std::ranges::find(sources, notification.source()) == sources.end() ||
          (excludingOSVersion && osVersion == excludingOSVersion)) {
        continue;
      }
      if (excludingOSVersion) {
        TILL_LOG(1,
                 "%@: Removing %@ notification with info %@ as its osVersion info (%@) doesn't "
                 "match the specified OS version (%@)",
                 kSpeaker, onScreen ? "on-screen" : "delivered", PlistValue(notification.userInfo),
                 osVersion.value_or("(null)"), *excludingOSVersion);
      }
      if (onScreen) {
        center_->removeDisplayedNotification(notification);
      } else {
        center_->removeDeliveredNotification(notification);
      }
    }
  }
}

void UpdateNotificationCatalogue::removeUpdatesAvailableNotifications() {
  removeSources({kSourceAppUpdate});
}

void UpdateNotificationCatalogue::removeUpdatesAvailableNotificationFromOlderOSVersions() {
  removeDeliveredNotificationsWithSource(kSourceAppUpdate, VendDevice::osMajorVersionString());
}

void UpdateNotificationCatalogue::removeCriticalUpdateNotificationsIncludingPostInstall(
    bool includingPostInstall) {
  if (includingPostInstall) {
    removeSources({kSourceCriticalUpdate, kSourceCriticalInstallNow, kSourceCriticalPostInstall});
  } else {
    removeSources({kSourceCriticalUpdate, kSourceCriticalInstallNow});
  }
}

// --- Questions ---

bool UpdateNotificationCatalogue::updateFailureNotificationIsDisplayed() const {
  return std::ranges::any_of(center_->displayedNotifications(),
                             [](const UserNotification& notification) {
                               return flagOf(notification.userInfo, "isDoItLaterFailure") ||
                                      flagOf(notification.userInfo, "isPostLogoutUpdateFailure");
                             });
}

bool UpdateNotificationCatalogue::firstUpdatesAvailableNotificationHasBeenPosted() {
  const PlistValue stored = PreferenceStore::valueForKey(
      kDefaultsLastUpdateNotificationOSMajorVersionKey, kDaemonDefaultsID, PreferenceScope::User);
  return stored.string() && *stored.string() == VendDevice::osMajorVersionString();
}

void UpdateNotificationCatalogue::selfDidPostUpdatesAvailableNotification() {
  (void)PreferenceStore::setValue(kDefaultsLastUpdateNotificationOSMajorVersionKey,
                                  VendDevice::osMajorVersionString(), kDaemonDefaultsID,
                                  PreferenceScope::User);
}

bool UpdateNotificationCatalogue::updateNotificationsAreRestricted() {
  return VendManagedRestrictions::isRestrictedTo(
      LedgerRestrictStoreToDisableSoftwareUpdateNotifications);
}

std::optional<std::string> UpdateNotificationCatalogue::cacheAuditInfo(
    const std::optional<PlistDictionary>& auditInfo, std::string_view notificationName) {
  if (!auditInfo) {
    TILL_LOG(3, "%@: No audit info supplied for %@", kSpeaker, notificationName);
    return std::nullopt;
  }
  std::optional<std::string> key = context_.cacheUpdateAuditInfo(*auditInfo);
  if (key) {
    TILL_LOG(1, "%@: Cached audit info with key %@ for %@", kSpeaker, *key, notificationName);
  } else {
    TILL_LOG(1, "%@: Failed to cache audit info for %@", kSpeaker, notificationName);
  }
  return key;
}

void UpdateNotificationCatalogue::deliver(UserNotification notification) {
  center_->deliverNotification(std::move(notification));
}

}  // namespace larder
