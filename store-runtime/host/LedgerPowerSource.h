#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/dispatch/RunLoop.h"

namespace larder {

// The machine's power as the update machinery asks about it. Read afresh at
// every question from the kernel's power supplies under the platform root
// ("<root>/sys/class/power_supply/*/", the rule of
// BackgroundActivityPowerSource for mains power).
class LedgerPowerSource {
 public:
  // The platform's value of remainingTimeEstimate for unlimited time: the
  // machine runs on mains power.
  static constexpr double kUnlimitedRemainingTime = -2.0;
  // Nothing could be estimated (a battery that gives no rate).
  static constexpr double kUnknownRemainingTime = -1.0;

  // The kernel offers no change notification for these files, so a change
  // is seen by asking again this often.
  static constexpr std::chrono::seconds kPollInterval{5};

  // kUnlimitedRemainingTime on mains power; otherwise the batteries' energy
  // (or charge) over their draw, in seconds, or kUnknownRemainingTime.
  static double remainingTimeEstimate();
  // The same rule applied to one folder of supplies.
  static double remainingTimeEstimateInSupplyFolder(const std::string& folder);

  // The warning the machine gives about its battery.
  enum BatteryWarningLevel : std::int64_t {
    kNoWarning = 1,
    kEarlyWarning = 2,
    kFinalWarning = 3,
  };
  // Below these percentages of charge a battery whose driver names no
  // capacity level is low (early warning) or critical (final warning).
  static constexpr std::int64_t kEarlyWarningPercent = 10;
  static constexpr std::int64_t kFinalWarningPercent = 5;

  // kNoWarning on mains power or without a system battery. Otherwise each
  // battery's level comes from its driver's "capacity_level" ("Low" early,
  // "Critical" final), or failing that from its "capacity" percentage and
  // the thresholds above; the machine warns only as much as its fullest
  // battery, since it draws on whichever still holds charge.
  static std::int64_t batteryWarningLevel();
  // The same rule applied to one folder of supplies.
  static std::int64_t batteryWarningLevelInSupplyFolder(const std::string& folder);

  // Calls `callback` on the main run loop each time the machine moves
  // between mains and limited power, until the returned source is released.
  // Null when no source could be made.
  class Observation {
   public:
    virtual ~Observation() = default;
  };
  static std::unique_ptr<Observation> observeLimitedPowerChanges(std::function<void()> callback);
  // The same on `loop`, asking every `interval`. Once the returned source is
  // gone the callback does not start again, and a callback running on
  // another thread has finished.
  static std::unique_ptr<Observation> observeLimitedPowerChanges(std::function<void()> callback,
                                                                 RunLoop& loop,
                                                                 RunLoop::Clock::duration interval);
};

}  // namespace larder
