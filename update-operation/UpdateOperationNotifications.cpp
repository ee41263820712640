// The closing step of a background run: which notification the situation
// calls for, posted through the controller's catalogue.
#include <algorithm>

#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/PreferenceStore.h"
#include "update-operation/UpdateListDescription.h"
#include "update-operation/UpdateOperation.h"
#include "update-queue/UpdateQueue.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateOperation";

bool contains(const PlistArray& identifiers, const std::string& identifier) {
  return std::ranges::any_of(identifiers, [&](const PlistValue& value) {
    const std::string* text = value.string();
    return (text && *text == identifier) ||
           (value.isInteger() && std::to_string(value.uint64Value()) == identifier);
  });
}

}  // namespace

bool UpdateOperation::updatesAreInProgressOrQueuedForLater() {
  std::shared_ptr<UpdateOperationController> controller = updateController();
  if (controller && controller->updatesAreInProgress()) {
    TILL_LOG(2,
             "%@: _updatesAreInProgressOrQueuedForLater returning YES due to App and/or OS Updates "
             "in progress",
             kSpeaker);
    return true;
  }
  if (LedgerTwilightAgent::isArmedForInstallLater()) {
    TILL_LOG(
        2,
        "%@: _updatesAreInProgressOrQueuedForLater returning YES due to TwilightAgent being "
        "armed. App installs queued for later is %@. OS updates queued for later is %@",
        kSpeaker,
        describeList(controller ? controller->appUpdatesToInstallLater()
                                : std::vector<std::string>{}),
        describeList(
            SysupQuaymartUpdateController::sharedUpdateController().updatesToBeInstalledLater()));
    return true;
  }
  return false;
}

void UpdateOperation::validateAndPostAvailableUpdatesNotification() {
  const UpdateOperationSettings s = settings();
  if (s.userInitiated || !LedgerIsClientAppAllowedToLaunch(storeClient().identifier()) ||
      LedgerCurrentUserIsGuestUser()) {
    return;
  }
  std::shared_ptr<UpdateOperationController> controller = updateController();
  if (!controller) return;
  UpdateNotificationCatalogue& notifications = controller->notificationCatalogue();
  if (s.shouldUpdateNotificationsOnly) {
    notifications.removeUpdatesAvailableNotificationFromOlderOSVersions();
  }
  if (s.criticalOSUpdateCount > 0) {
    if (!s.shouldPostAvailableUpdatesNotification) return;
    if (s.criticalOSUpdatesShouldBeInstalledImmediately) {
      notifications.postCriticalUpdateInstallNowNotification(s.criticalOSUpdateCount,
                                                             s.criticalOSUpdatesRequireRestart);
    } else {
      notifications.postCriticalUpdateNotification(
          s.criticalOSUpdateCount, s.criticalOSUpdateNotificationTitle,
          s.criticalOSUpdateNotificationText, s.criticalOSUpdatesHaveDelayedAutoInstall,
          s.criticalOSUpdatesRequireRestart);
    }
    return;
  }
  TILL_LOG(2,
           "%@: softwareUpdateDidFinishBackgroundScanWithMessage: removing all critical update "
           "notification (except post-install) due to critical update count being 0",
           kSpeaker);
  notifications.removeCriticalUpdateNotificationsIncludingPostInstall(false);

  bool posted = false;
  const std::uint64_t badgeCount = controller->availableUpdatesBadgeCount();
  if (s.shouldPostAvailableUpdatesNotification && !s.shouldUpdateNotificationsOnly &&
      badgeCount != 0) {
    if (updatesAreInProgressOrQueuedForLater()) {
      TILL_LOG(2,
               "%@: Suppressed Available Updates notification because updates are in progress or "
               "queued for later",
               kSpeaker);
    } else if (controller->updateFailureNotificationIsDisplayed()) {
      TILL_LOG(2,
               "%@: Suppressed Available Updates notification because a Do It Later failure "
               "notification is displayed",
               kSpeaker);
    } else {
      posted = postAvailableUpdatesNotification(*controller);
    }
  } else if (badgeCount == 0) {
    TILL_LOG(2, "%@: Removing all updates available notifications because the badge count is 0",
             kSpeaker);
    notifications.removeUpdatesAvailableNotifications();
  }

  if (s.shouldUpdateNotificationsOnly && !s.postLogoutFailedUpdates.empty()) {
    notifications.postUpdatesFailedToInstallPostLogoutNotification(s.postLogoutFailedUpdates);
    return;
  }
  if (s.shouldUpdateNotificationsOnly && !s.postLogoutInstalledLaterUpdates.empty()) {
    notifications.postDoItLaterSuccessNotificationWithUpdates(s.postLogoutInstalledLaterUpdates);
    return;
  }
  if (s.shouldUpdateNotificationsOnly && !s.postLogoutInstalledUpdates.empty() &&
      UpdatePolicy::shouldPromptForAutoUpdateOfRestartRequiredUpdatesOptIn()) {
    controller->promptUserToOptInForAutoUpdateOfRestartRequiredUpdatesWithShowNotification(true);
    return;
  }
  const std::vector<LedgerUpdateRef> autoInstalled = runState().autoInstalledAppUpdates;
  if (!posted && !autoInstalled.empty()) {
    TILL_LOG(2, "%@: Posting auto installed app updates notification for %@", kSpeaker,
             describeList(autoInstalled));
    notifications.postNotificationForAutoInstalledUpdates(autoInstalled);
  }
}

bool UpdateOperation::postAvailableUpdatesNotification(UpdateOperationController& controller) {
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  std::vector<SysupQuaymartUpdate> osUpdates = sysup.availableUpdates();
  const bool restartRequired = !osUpdates.empty() && sysup.actionRequiredForUpdates(osUpdates) != 0;
  const std::shared_ptr<const UpdateQueue::UpdateList> available =
      controller.updateQueue()->availableUpdates();
  std::vector<LedgerUpdateRef> appUpdates = *available;
  const bool newOnly = UpdatePolicy::shouldNotifyForNewUpdatesOnly();
  const PlistValue stored = PreferenceStore::valueForKey(
      kDefaultsAvailableUpdatesAtLastNotificationKey, kDaemonDefaultsID, PreferenceScope::User);
  const PlistArray lastNotified = stored.array() ? *stored.array() : PlistArray{};
  if (newOnly) {
    std::erase_if(appUpdates, [&](const LedgerUpdateRef& update) {
      return contains(lastNotified, std::to_string(update->itemIdentifierValue()));
    });
    std::erase_if(osUpdates, [&](const SysupQuaymartUpdate& update) {
      return contains(lastNotified, update.productKey());
    });
  }
  PlistArray present;
  for (const LedgerUpdateRef& update : *available) present.emplace_back(update->itemIdentifier());
  for (const SysupQuaymartUpdate& update : sysup.availableUpdates()) {
    present.emplace_back(update.productKey());
  }
  (void)PreferenceStore::setValue(kDefaultsAvailableUpdatesAtLastNotificationKey, present,
                                  kDaemonDefaultsID, PreferenceScope::User);
  TILL_LOG(2, "%@: Recording updates present at time of notification as %@", kSpeaker,
           PlistValue(present));
  if (!appUpdates.empty() || !osUpdates.empty()) {
    TILL_LOG(2, "%@: Notifying the user of %@ updates - %@ / %@", kSpeaker, newOnly ? "NEW" : "ALL",
             describeList(appUpdates), describeList(osUpdates));
    controller.notificationCatalogue().postUpdatesAvailableNotification(
        appUpdates, osUpdates, restartRequired, auditInfo());
    return true;
  }
  if (newOnly) {
    TILL_LOG(
        2,
        "%@: No new updates were found to notify the user of (%li were in the last notification)",
        kSpeaker, static_cast<long>(lastNotified.size()));
  } else {
    TILL_LOG(2, "%@: No updates are available to notify the user of", kSpeaker);
  }
  return false;
}

}  // namespace larder
