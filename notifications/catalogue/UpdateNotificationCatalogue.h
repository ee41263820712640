#pragma once

#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "notifications/catalogue/UpdateNotificationContext.h"
#include "notifications/center/UserNotification.h"
#include "platform/system/Bundle.h"
#include "store-runtime/core/VendStoreClient.h"

namespace larder {

class UserNotificationCenter;

// Every notification the update machinery shows the user: how each kind is
// built, the texts it picks, what it leaves in its user info for the moment
// the user acts on it, and which earlier notifications it takes away. When
// to post is the callers' decision. With the managed restriction on update
// notifications set, no updates notification goes out.
//
// Posts and removals are called on their caller's thread and hold no lock:
// the center is safe for that.
class UpdateNotificationCatalogue {
 public:
  // The values of "Source", which identify a kind.
  static constexpr std::string_view kSourceAppUpdate = "AppUpdate";
  static constexpr std::string_view kSourceAutoInstalledUpdates = "autoInstalledUpdates";
  static constexpr std::string_view kSourceClaimedButNotDownloaded = "UTDClaimedButNotDownloaded";
  static constexpr std::string_view kSourceLaterSuccess = "postLogoutUpdatesInstalledLater";
  static constexpr std::string_view kSourceCriticalUpdate = "CriticalUpdate";
  static constexpr std::string_view kSourceCriticalInstallNow = "CriticalUpdateInstallNow";
  static constexpr std::string_view kSourceCriticalPostInstall = "CriticalUpdatePostInstall";
  static constexpr std::string_view kSourceAdminInstalled = "adminInstalledUpdates";
  static constexpr std::string_view kSourceAutoUpdateOptIn = "autoUpdateOptIn";
  static constexpr std::string_view kSourceRestartRequiredOptIn = "autoUpdateRestartRequiredOptIn";
  static constexpr std::string_view kSourceLaterHelper = "DoItLaterHelper";
  static constexpr std::string_view kSourceMajorOSUpdate = "MajorOSUpdate";
  static constexpr std::string_view kSourceRestartCountdown = "RestartCountdown";

  // The restart countdown's results for its two buttons.
  static constexpr std::int64_t kCountdownRestartNow = 1;
  static constexpr std::int64_t kCountdownLater = 3;

  // The link of the updates page in the store application.
  static constexpr std::string_view kUpdatesPageURL =
      "quaymart://showUpdatesPage?source=notification";

  // `context` must outlive the catalogue. A null center means the
  // service's own ("com.orvane.larderd", type 2).
  UpdateNotificationCatalogue(VendStoreClient storeClient, UpdateNotificationContext& context,
                              std::shared_ptr<UserNotificationCenter> center = nullptr);

  [[nodiscard]] const std::shared_ptr<UserNotificationCenter>& notificationCenter() const {
    return center_;
  }

  // --- Posts ---
  void postUpdatesAvailableNotification(const std::vector<LedgerUpdateRef>& appUpdates,
                                        const std::vector<SysupQuaymartUpdate>& osUpdates,
                                        bool restartRequired,
                                        const std::optional<PlistDictionary>& auditInfo);
  void postUpdatesFailedToInstallPostLogoutNotification(
      const std::vector<PlistDictionary>& failedUpdates);
  void postDoItLaterFailedNotificationWithAuditInfo(
      const std::optional<PlistDictionary>& auditInfo);
  void postDoItLaterSuccessNotificationWithUpdates(const std::vector<PlistDictionary>& updates);
  void postCriticalUpdateNotification(std::int64_t count, const std::optional<std::string>& title,
                                      const std::optional<std::string>& text,
                                      bool delayedAutoInstall, bool restartRequired);
  void postCriticalUpdateInstallNowNotification(std::int64_t count, bool restartRequired);
  void postSilentInstallNotification(std::int64_t count, const std::optional<std::string>& title,
                                     const std::optional<std::string>& text,
                                     const std::optional<std::string>& url);
  void postAdminInstallNotification(std::int64_t count, bool restartRequired);
  void postNotificationForAutoInstalledUpdates(const std::vector<LedgerUpdateRef>& updates);
  void postNotificationForAutoUpdateOptIn();
  void postNotificationForAutoUpdateOfRestartRequiredUpdatesOptIn();
  void postOtherUsersLoggedInLaterHelperNotification();
  void postPowerLaterHelperNotification();

  // --- Major OS update ---
  // The values of "Type" in a major OS update notification's user info.
  static constexpr std::string_view kMajorOSUpdateTypeKey = "Type";
  static constexpr std::string_view kMajorOSUpdateAvailableForDownload =
      "UpdateAvailableForDownloadNotification";
  static constexpr std::string_view kMajorOSUpdateAutoDownloaded =
      "UpdateAutoDownloadedNotification";
  static constexpr std::string_view kMajorOSUpdatePending = "MajorOSUpdatePendingNotification";
  // The texts come from the notification bundle's own string table, keyed
  // "<type>.Title", "<type>.InformativeText", "<type>.OtherButtonText",
  // "<type>.ActionButtonText" and "<type>.BadgeKey" (the name of an "icns"
  // resource for the icon). Without a title, a text or the second button's
  // text (or without a bundle) nothing is posted.
  void postMajorOSUpdateAvailableNotificationOfType(std::string_view type,
                                                    const std::optional<Bundle>& bundle);
  // The warning that a managed install of a major OS update is about to
  // restart the machine.
  void postMajorOSUpdateMDMInstallNotification();

  // Shows the restart countdown as a notification ("Restart Now", result 1;
  // "Later", result 3), waits for the deferred-install agent's countdown to
  // end (LedgerTwilightAgent::showRestartCountdownNotification: an answer,
  // or the time running out, which restarts), takes the notification away
  // and returns the result. Blocks its caller meanwhile. It goes out also
  // under the restriction on update notifications: a restart the user
  // chose is not to come unannounced.
  std::int64_t showRestartCountdownNotification();
  // What an activation of the countdown answers: 1 for its main button, 3
  // for its second; nothing for any other notification or a click on the
  // contents.
  static std::optional<std::int64_t> restartCountdownAnswer(const UserNotification& notification,
                                                            bool dismissed);

  // --- Removals ---
  // Takes away, from the list and from the screen, the notifications of
  // `source`; with a version, only those whose "osVersion" differs from it.
  void removeDeliveredNotificationsWithSource(std::string_view source,
                                              const std::optional<std::string>& excludingOSVersion);
  void removeUpdatesAvailableNotifications();
  void removeUpdatesAvailableNotificationFromOlderOSVersions();
  void removeCriticalUpdateNotificationsIncludingPostInstall(bool includingPostInstall);

  // --- Questions ---
  // A Do It Later or post-logout failure is on screen.
  [[nodiscard]] bool updateFailureNotificationIsDisplayed() const;
  // The updates available notification went out already under this major
  // version of the system.
  [[nodiscard]] static bool firstUpdatesAvailableNotificationHasBeenPosted();
  // The updates of the first-notification suite, by the order of their
  // prefixes.
  [[nodiscard]] static std::vector<LedgerUpdateRef> suiteUpdatesIncludedInAppUpdates(
      const std::vector<LedgerUpdateRef>& appUpdates);

 private:
  [[nodiscard]] std::string text(std::string_view key) const;
  [[nodiscard]] std::string format(std::string_view key,
                                   std::initializer_list<std::string_view> arguments) const;
  [[nodiscard]] UserNotification bannerNotification() const;
  [[nodiscard]] UserNotification alertNotification() const;
  [[nodiscard]] UserNotification criticalUpdateNotification() const;
  [[nodiscard]] UserNotification majorOSUpdateNotificationOfType(std::string_view type) const;
  [[nodiscard]] PlistDictionary userInfoIncludingStoreClient(std::string_view source,
                                                             bool withOSVersion) const;
  // The menu of the later options, ending with the automatic update offer
  // the switches call for.
  [[nodiscard]] std::vector<std::string> laterOptions(
      std::initializer_list<std::string_view> keys) const;
  void setFirstNotificationTexts(UserNotification& notification,
                                 const std::vector<LedgerUpdateRef>& appUpdates,
                                 const std::vector<SysupQuaymartUpdate>& osUpdates) const;
  void setRegularTexts(UserNotification& notification,
                       const std::vector<LedgerUpdateRef>& appUpdates,
                       const std::vector<SysupQuaymartUpdate>& osUpdates, bool restartRequired,
                       bool laterOffered) const;
  void setUpdatesAvailableButtons(UserNotification& notification, bool restartRequired,
                                  bool laterOffered) const;
  void postOptIn(std::string_view source, std::string_view keyPrefix);
  void postLaterHelper(std::string_view titleKey, std::string_view textKey);
  void postFailure(bool postLogout, const std::optional<PlistDictionary>& auditInfo);
  [[nodiscard]] std::optional<std::string> cacheAuditInfo(
      const std::optional<PlistDictionary>& auditInfo, std::string_view notificationName);
  void removeSources(std::initializer_list<std::string_view> sources);
  void removeNotifications(std::initializer_list<std::string_view> sources,
                           const std::optional<std::string>& excludingOSVersion);
  void deliver(UserNotification notification);
  static bool updateNotificationsAreRestricted();
  static void selfDidPostUpdatesAvailableNotification();

  VendStoreClient storeClient_;
  UpdateNotificationContext& context_;
  std::shared_ptr<UserNotificationCenter> center_;
};

}  // namespace larder
