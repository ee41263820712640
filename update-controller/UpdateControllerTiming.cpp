// When things may happen and whether the user allowed them: timestamps
// against intervals, the switches of automatic updates and their opt-in
// prompts. Nothing is kept in memory; every answer is read from the
// preferences when the question is asked.
#include <algorithm>
#include <cmath>

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

constexpr std::string_view kSpeaker = "UpdateController";
constexpr std::string_view kOptInTraceName = "com.orvane.Quaymart.autoupdate.opt_in";

using Clock = UpdateController::Clock;

Clock::time_point timePointOf(PlistDate date) {
  return Clock::time_point(std::chrono::duration_cast<Clock::duration>(
      std::chrono::duration<double>(date.secondsSince1970)));
}

PlistDate plistDateOf(Clock::time_point time) {
  using Seconds = std::chrono::duration<double>;
  return PlistDate{Seconds(time.time_since_epoch()).count()};
}

// A boolean switch that is on unless it holds the boolean false.
bool switchIsOn(std::string_view key) {
  return PreferenceStore::booleanForKey(key, kSoftwareUpdateDefaultsID).value_or(true);
}

bool booleanIsTrue(std::string_view key) {
  return PreferenceStore::booleanForKey(key, kDaemonDefaultsID).value_or(false);
}

// Whether a user who refused is to be asked again: only once the OS has
// moved to another major version since the refusal.
bool refusalIsFromAnotherOSVersion(std::string_view versionKey) {
  std::optional<std::string> version = PreferenceStore::stringForKey(versionKey, kDaemonDefaultsID);
  return !(version && *version == VendDevice::osMajorVersionString());
}

// Absent: ask. A refusal: ask again after a major OS upgrade. Anything else
// (agreed, or a value of another type): never ask.
bool shouldAskForSwitch(std::string_view key, std::string_view versionKey) {
  PlistValue value = PreferenceStore::valueForKey(key, kDaemonDefaultsID);
  if (value.isNull()) return true;
  if (!value.isNumber() || value.boolValue()) return false;
  return refusalIsFromAnotherOSVersion(versionKey);
}

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
  return date ? std::optional(timePointOf(*date)) : std::nullopt;
}

Clock::time_point UpdateController::dateWhenDateExceedsInterval(Clock::time_point date,
                                                                double seconds) {
  return date + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
}

bool UpdateController::timestampWithKeyHasExceededCheckInterval(std::string_view key,
                                                                double seconds) const {
  std::optional<Clock::time_point> stored = dateForTimestampKey(key);
  if (!stored) return true;
  Clock::time_point due = dateWhenDateExceedsInterval(*stored, seconds - kTimestampSlackSeconds);
  return due <= Clock::now();
}

double UpdateController::timeIntervalWithPreferenceKey(std::string_view key, double defaultValue) {
  PlistValue value = PreferenceStore::valueForKey(key, kDaemonDefaultsID, PreferenceScope::System);
  // A number, or a string that holds one, read as the single-precision
  // float it would be boxed in.
  if (value.isInteger() || value.isReal()) return static_cast<float>(value.doubleValue());
  if (const std::string* text = value.string()) {
    char* end = nullptr;
    float parsed = std::strtof(text->c_str(), &end);
    if (end != text->c_str() && std::isfinite(parsed)) return parsed;
  }
  return defaultValue;
}

double UpdateController::criticalUpdateNotificationMinimumInterval() {
  return timeIntervalWithPreferenceKey(kDefaultsCriticalUpdateNotificationIntervalKey, 86400);
}

double UpdateController::availableUpdatesNotificationMinimumInterval() {
  return timeIntervalWithPreferenceKey(kDefaultsAvailableUpdatesNotificationIntervalKey, 604800);
}

double UpdateController::checkForAndStageAppUpdatesMinimumInterval() {
  return timeIntervalWithPreferenceKey(kDefaultsStageAppUpdatesIntervalKey, 86400);
}

double UpdateController::autoInstallUpdatesMinimumInterval() {
  return timeIntervalWithPreferenceKey(kDefaultsAutoUpdateIntervalKey, 604800);
}

double UpdateController::autoInstallUpdateMinimumReleaseTimeInterval() {
  return timeIntervalWithPreferenceKey(kDefaultsAutoUpdateMinimumAgeKey, 172800);
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

void UpdateController::resetUpdatesAvailableNotificationTimestamp() {
  (void)PreferenceStore::setValue(kDefaultsDidPostUpdatesAvailableNotificationDateKey,
                                  plistDateOf(Clock::now()), kDaemonDefaultsID);
}

bool UpdateController::shouldNotifyForNewUpdatesOnly() {
  return PreferenceStore::booleanForKey(kDefaultsNotifyUserOfNewUpdatesOnlyKey, kDaemonDefaultsID,
                                        PreferenceScope::System)
      .value_or(false);
}

// --- Switches ---

bool UpdateController::isUpdateStagingEnabled() {
  return switchIsOn(kDefaultsAutomaticDownloadKey);
}

bool UpdateController::isAutoUpdatedEnabled() {
  return booleanIsTrue(kDefaultsAutoUpdateEnabledKey) && isUpdateStagingEnabled();
}

bool UpdateController::isAutoUpdatedOfRestartRequiredUpdatesEnabled() {
  return booleanIsTrue(kDefaultsAutoUpdateRestartRequiredEnabledKey) && isUpdateStagingEnabled();
}

bool UpdateController::isSysupScanAutomaticCheckEnabled() {
  bool enabled = switchIsOn(kDefaultsSysupScanAutomaticCheckEnabledKey);
  TILL_LOG(3, "%@: SysupScanAutomaticCheckEnabled %d", kSpeaker, enabled);
  return enabled;
}

void UpdateController::setAutoUpdateEnabled(bool enabled) {
  LedgerRootHelper::sharedInstance().proxy().setAutoUpdateEnabledPreference(enabled);
}

void UpdateController::setAutoUpdateOfRestartRequiredUpdatesEnabled(bool enabled) {
  LedgerRootHelper::sharedInstance().proxy().setAutoUpdateRestartRequiredEnabledPreference(enabled);
}

bool UpdateController::shouldPromptForAutoUpdateOptIn() {
  if (!isSysupScanAutomaticCheckEnabled()) return false;
  return shouldAskForSwitch(kDefaultsAutoUpdateEnabledKey,
                            kDefaultsAutoUpdateEnabledMajorOSVersionKey);
}

bool UpdateController::shouldPromptForAutoUpdateOfRestartRequiredUpdatesOptIn() {
  if (!isAutoUpdatedEnabled() && !shouldPromptForAutoUpdateOptIn()) return false;
  return shouldAskForSwitch(kDefaultsAutoUpdateRestartRequiredEnabledKey,
                            kDefaultsAutoUpdateRestartRequiredMajorOSVersionKey);
}

void UpdateController::promptUserToOptInForAutoUpdateWithShowNotification(bool showNotification) {
  MutexLock lock(autoUpdatePromptLock());
  if (!shouldPromptForAutoUpdateOptIn()) return;
  // Before any answer: a prompt that is never answered counts as refused.
  setAutoUpdateEnabled(false);
  if (showNotification) {
    postNotificationForAutoUpdateOptIn();
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
  postNotificationForAutoUpdateOfRestartRequiredUpdatesOptIn();
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

bool UpdateController::shouldOfferDoItLaterForAppUpdates(const std::vector<LedgerUpdateRef>& apps,
                                                         const OSUpdateList& osUpdates) {
  if (diskSealKeyIsDestroyedOnStandby()) return false;
  if (!apps.empty()) return true;
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  return std::ranges::any_of(osUpdates, [&](const SysupQuaymartUpdate& update) {
    return (update.isRecommended() && sysup.actionRequiredForUpdates({update}) == 0) ||
           update.allowedToUseInstallLater();
  });
}

bool UpdateController::lastDoItLaterLogoutFailed() {
  return PreferenceStore::booleanForKey(kDefaultsLastDoItLaterLogoutFailedKey, kDaemonDefaultsID,
                                        PreferenceScope::System)
      .value_or(false);
}

void UpdateController::setLastDoItLaterLogoutFailed(bool failed) {
  LedgerRootHelper::sharedInstance().proxy().setLastDoItLaterLogoutFailed(failed);
}

}  // namespace larder
