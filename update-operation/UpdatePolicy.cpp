// When things may happen and whether the user allowed them. Nothing is
// kept in memory; every answer is read from the preferences when the
// question is asked.
#include "update-operation/UpdatePolicy.h"

#include <algorithm>
#include <cmath>
#include <cstdlib>

#include "platform/log/TillLogManager.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/LedgerPowerSource.h"
#include "store-runtime/host/LedgerRootHelper.h"
#include "store-runtime/host/LedgerSessionList.h"
#include "store-runtime/host/LedgerSystemSettings.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/host/VendDevice.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateController";

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

}  // namespace

UpdatePolicy::Clock::time_point UpdatePolicy::timePointOf(PlistDate date) {
  return Clock::time_point(std::chrono::duration_cast<Clock::duration>(
      std::chrono::duration<double>(date.secondsSince1970)));
}

PlistDate UpdatePolicy::plistDateOf(Clock::time_point time) {
  using Seconds = std::chrono::duration<double>;
  return PlistDate{Seconds(time.time_since_epoch()).count()};
}

UpdatePolicy::Clock::time_point UpdatePolicy::dateWhenDateExceedsInterval(Clock::time_point date,
                                                                          double seconds) {
  return date + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
}

double UpdatePolicy::timeIntervalWithPreferenceKey(std::string_view key, double defaultValue) {
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

double UpdatePolicy::criticalUpdateNotificationMinimumInterval() {
  return timeIntervalWithPreferenceKey(kDefaultsCriticalUpdateNotificationIntervalKey, 86400);
}

double UpdatePolicy::availableUpdatesNotificationMinimumInterval() {
  return timeIntervalWithPreferenceKey(kDefaultsAvailableUpdatesNotificationIntervalKey, 604800);
}

double UpdatePolicy::checkForAndStageAppUpdatesMinimumInterval() {
  return timeIntervalWithPreferenceKey(kDefaultsStageAppUpdatesIntervalKey, 86400);
}

double UpdatePolicy::autoInstallUpdatesMinimumInterval() {
  return timeIntervalWithPreferenceKey(kDefaultsAutoUpdateIntervalKey, 604800);
}

double UpdatePolicy::autoInstallUpdateMinimumReleaseTimeInterval() {
  return timeIntervalWithPreferenceKey(kDefaultsAutoUpdateMinimumAgeKey, 172800);
}

bool UpdatePolicy::shouldNotifyForNewUpdatesOnly() {
  return PreferenceStore::booleanForKey(kDefaultsNotifyUserOfNewUpdatesOnlyKey, kDaemonDefaultsID,
                                        PreferenceScope::System)
      .value_or(false);
}

// --- Switches ---

bool UpdatePolicy::isUpdateStagingEnabled() {
  return switchIsOn(kDefaultsAutomaticDownloadKey);
}

bool UpdatePolicy::isAutoUpdatedEnabled() {
  return booleanIsTrue(kDefaultsAutoUpdateEnabledKey) && isUpdateStagingEnabled();
}

bool UpdatePolicy::isAutoUpdatedOfRestartRequiredUpdatesEnabled() {
  return booleanIsTrue(kDefaultsAutoUpdateRestartRequiredEnabledKey) && isUpdateStagingEnabled();
}

bool UpdatePolicy::isSysupScanAutomaticCheckEnabled() {
  bool enabled = switchIsOn(kDefaultsSysupScanAutomaticCheckEnabledKey);
  TILL_LOG(3, "%@: SysupScanAutomaticCheckEnabled %d", kSpeaker, enabled);
  return enabled;
}

void UpdatePolicy::setAutoUpdateEnabled(bool enabled) {
  LedgerRootHelper::sharedInstance().proxy().setAutoUpdateEnabledPreference(enabled);
}

void UpdatePolicy::setAutoUpdateOfRestartRequiredUpdatesEnabled(bool enabled) {
  LedgerRootHelper::sharedInstance().proxy().setAutoUpdateRestartRequiredEnabledPreference(enabled);
}

bool UpdatePolicy::shouldPromptForAutoUpdateOptIn() {
  if (!isSysupScanAutomaticCheckEnabled()) return false;
  return shouldAskForSwitch(kDefaultsAutoUpdateEnabledKey,
                            kDefaultsAutoUpdateEnabledMajorOSVersionKey);
}

bool UpdatePolicy::shouldPromptForAutoUpdateOfRestartRequiredUpdatesOptIn() {
  if (!isAutoUpdatedEnabled() && !shouldPromptForAutoUpdateOptIn()) return false;
  return shouldAskForSwitch(kDefaultsAutoUpdateRestartRequiredEnabledKey,
                            kDefaultsAutoUpdateRestartRequiredMajorOSVersionKey);
}

bool UpdatePolicy::lastDoItLaterLogoutFailed() {
  return PreferenceStore::booleanForKey(kDefaultsLastDoItLaterLogoutFailedKey, kDaemonDefaultsID,
                                        PreferenceScope::System)
      .value_or(false);
}

void UpdatePolicy::setLastDoItLaterLogoutFailed(bool failed) {
  LedgerRootHelper::sharedInstance().proxy().setLastDoItLaterLogoutFailed(failed);
}

// --- Questions about the machine ---

bool UpdatePolicy::runningOnACPower() {
  return LedgerPowerSource::remainingTimeEstimate() == LedgerPowerSource::kUnlimitedRemainingTime;
}

bool UpdatePolicy::otherUsersAreLoggedIn() {
  return LedgerSessionList::loggedInSessionCount() > 1;
}

bool UpdatePolicy::diskSealKeyIsDestroyedOnStandby() {
  const PlistDictionary settings = LedgerSystemSettings::systemPowerSettings();
  auto found = settings.find("DestroyDiskSealKeyOnStandby");
  return found != settings.end() && found->second.isBoolean() && found->second.boolValue();
}

void UpdatePolicy::resetUpdatesAvailableNotificationTimestamp() {
  (void)PreferenceStore::setValue(kDefaultsDidPostUpdatesAvailableNotificationDateKey,
                                  plistDateOf(Clock::now()), kDaemonDefaultsID);
}

bool UpdatePolicy::shouldOfferDoItLaterForAppUpdates(
    const std::vector<LedgerUpdateRef>& appUpdates,
    const std::vector<SysupQuaymartUpdate>& osUpdates) {
  if (diskSealKeyIsDestroyedOnStandby()) return false;
  if (!appUpdates.empty()) return true;
  const SysupQuaymartUpdateController& sysup =
      SysupQuaymartUpdateController::sharedUpdateController();
  return std::ranges::any_of(osUpdates, [&](const SysupQuaymartUpdate& update) {
    return (update.isRecommended() && sysup.actionRequiredForUpdates({update}) == 0) ||
           update.allowedToUseInstallLater();
  });
}

}  // namespace larder
