#pragma once

#include <chrono>
#include <string_view>
#include <vector>

#include "platform/value/PlistValue.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"

namespace larder {

// The answers of the update policy that are read from the preferences and
// the machine at the moment of the question: intervals, the switches of
// automatic updates and their opt-in questions, the failed-logout flag.
// Nothing is kept in memory. Both the update controller and its runs ask
// them, so they sit below both.
class UpdatePolicy {
 public:
  using Clock = std::chrono::system_clock;
  // Every interval test allows this much slack.
  static constexpr double kTimestampSlackSeconds = 300;

  static Clock::time_point timePointOf(PlistDate date);
  static PlistDate plistDateOf(Clock::time_point time);
  static Clock::time_point dateWhenDateExceedsInterval(Clock::time_point date, double seconds);

  // --- Intervals, in seconds ---
  [[nodiscard]] static double timeIntervalWithPreferenceKey(std::string_view key,
                                                            double defaultValue);
  [[nodiscard]] static double criticalUpdateNotificationMinimumInterval();
  [[nodiscard]] static double availableUpdatesNotificationMinimumInterval();
  [[nodiscard]] static double checkForAndStageAppUpdatesMinimumInterval();
  [[nodiscard]] static double autoInstallUpdatesMinimumInterval();
  [[nodiscard]] static double autoInstallUpdateMinimumReleaseTimeInterval();

  // --- Switches ---
  [[nodiscard]] static bool shouldNotifyForNewUpdatesOnly();
  [[nodiscard]] static bool isUpdateStagingEnabled();
  [[nodiscard]] static bool isAutoUpdatedEnabled();
  [[nodiscard]] static bool isAutoUpdatedOfRestartRequiredUpdatesEnabled();
  [[nodiscard]] static bool isSysupScanAutomaticCheckEnabled();
  static void setAutoUpdateEnabled(bool enabled);
  static void setAutoUpdateOfRestartRequiredUpdatesEnabled(bool enabled);
  [[nodiscard]] static bool shouldPromptForAutoUpdateOptIn();
  [[nodiscard]] static bool shouldPromptForAutoUpdateOfRestartRequiredUpdatesOptIn();
  [[nodiscard]] static bool lastDoItLaterLogoutFailed();
  static void setLastDoItLaterLogoutFailed(bool failed);
  // The updates available notification went out now; the next one is due
  // an interval later.
  static void resetUpdatesAvailableNotificationTimestamp();
  // Whether the user can put these updates off to later: any app update
  // can, an OS update when it is recommended and needs no restart, or when
  // it allows it. Never on a machine that destroys its disk seal key on
  // standby.
  [[nodiscard]] static bool shouldOfferDoItLaterForAppUpdates(
      const std::vector<LedgerUpdateRef>& appUpdates,
      const std::vector<SysupQuaymartUpdate>& osUpdates);

  // --- Questions about the machine ---
  static bool runningOnACPower();
  // More than one session whose login has finished.
  static bool otherUsersAreLoggedIn();
  static bool diskSealKeyIsDestroyedOnStandby();
};

}  // namespace larder
