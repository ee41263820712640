// When things may happen and whether the user allowed them: timestamps
// against intervals, the switches of automatic updates and their opt-in
// prompts. Nothing is kept in memory; every answer is read from the
// preferences when the question is asked.
#include <algorithm>
#include <cmath>

#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/dialogs/VendDialog.h"
#include "store-runtime/host/LedgerRootHelper.h"
#include "store-runtime/host/LedgerTraceMessage.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/host/VendDevice.h"
#include "store-runtime/services/VendUIService.h"
#include "update-controller/UpdateController.h"

namespace larder {

namespace {

constexpr std::string_view kOptInTraceName = "com.orvane.Quaymart.autoupdate.opt_in";

using Clock = UpdateController::Clock;

bool isAbsentOrEmpty(const std::optional<std::string>& text) {
  return !text || text->empty();
}

Mutex& autoUpdatePromptLock() {
  static Mutex lock;
  return lock;
}

Mutex& restartRequiredPromptLock() {
  static Mutex lock;
  return lock;
}

}  // namespace

// --- Timestamps ---

std::optional<Clock::time_point> UpdateController::dateForTimestampKey(std::string_view key) const {
  std::optional<PlistDate> date = PreferenceStore::dateForKey(key, kDaemonDefaultsID);
  return date ? std::optional(UpdatePolicy::timePointOf(*date)) : std::nullopt;
}

bool UpdateController::timestampWithKeyHasExceededCheckInterval(std::string_view key,
                                                                double seconds) const {
  std::optional<Clock::time_point> stored = dateForTimestampKey(key);
  if (!stored) return true;
  Clock::time_point due = dateWhenDateExceedsInterval(*stored, seconds - kTimestampSlackSeconds);
  return due <= Clock::now();
}

bool UpdateController::isTimeToPostCriticalUpdateNotification() const {
  return timestampWithKeyHasExceededCheckInterval(
      kDefaultsDidPostUpdatesAvailableNotificationDateKey,
      criticalUpdateNotificationMinimumInterval());
}

bool UpdateController::isTimeToPostUpdatesAvailableNotification() const {
  return timestampWithKeyHasExceededCheckInterval(
      kDefaultsDidPostUpdatesAvailableNotificationDateKey,
      availableUpdatesNotificationMinimumInterval());
}

bool UpdateController::isTimeToStageAppUpdates() const {
  return timestampWithKeyHasExceededCheckInterval(kDefaultsDidStageAppUpdatesDateKey,
                                                  checkForAndStageAppUpdatesMinimumInterval());
}

bool UpdateController::isTimeToAutoUpdate() const {
  return timestampWithKeyHasExceededCheckInterval(kDefaultsDidStartAutoUpdateDateKey,
                                                  autoInstallUpdatesMinimumInterval());
}

// --- Switches ---

void UpdateController::promptUserToOptInForAutoUpdateWithShowNotification(bool showNotification) {
  MutexLock lock(autoUpdatePromptLock());
  if (!shouldPromptForAutoUpdateOptIn()) return;
  // Before any answer: a prompt that is never answered counts as refused.
  setAutoUpdateEnabled(false);
  if (showNotification) {
    notificationCatalogue_->postNotificationForAutoUpdateOptIn();
    return;
  }
  auto text = [this](std::string_view key) { return LedgerLocalizedString(key, &storeClient_); };
  VendDialog dialog =
      VendDialog::dialogWithDictionary({{"message", text("AUTOUPDATE_OPTIN_TITLE")},
                                        {"explanation", text("AUTOUPDATE_OPTIN_BODY")},
                                        {"okButtonString", text("AUTOUPDATE_OPTIN_OK")},
                                        {"cancelButtonString", text("AUTOUPDATE_OPTIN_CANCEL")}});
  // The answer comes later, without the lock.
  serviceProxy_->uiService()->displayDialog(dialog, nullptr, [](std::int64_t exitCode) {
    bool agreed = exitCode == 1;
    setAutoUpdateEnabled(agreed);
    LedgerTraceMessage(kOptInTraceName, {{"result", agreed ? "pass" : "fail"}});
  });
}

void UpdateController::promptUserToOptInForAutoUpdateOfRestartRequiredUpdatesWithShowNotification(
    bool) {
  MutexLock lock(restartRequiredPromptLock());
  if (!shouldPromptForAutoUpdateOfRestartRequiredUpdatesOptIn()) return;
  setAutoUpdateOfRestartRequiredUpdatesEnabled(false);
  notificationCatalogue_->postNotificationForAutoUpdateOfRestartRequiredUpdatesOptIn();
}

UpdateController::OSUpdateList
UpdateController::availableOSUpdatesEligibleForAutoInstallOfRestartRequiredUpdates() const {
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  OSUpdateList eligible;
  for (const SysupQuaymartUpdate& update : sysup.availableUpdates()) {
    OSUpdateList single{update};
    if (sysup.actionRequiredForUpdates(single) != 0 &&
        shouldOfferDoItLaterForAppUpdates({}, single) &&
        isAbsentOrEmpty(update.firmwareWarning()) && isAbsentOrEmpty(update.licenseAgreement())) {
      eligible.push_back(update);
    }
  }
  return eligible;
}

}  // namespace larder
