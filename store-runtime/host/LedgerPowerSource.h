#pragma once

#include <functional>
#include <memory>

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

  // kUnlimitedRemainingTime on mains power; otherwise the batteries' energy
  // (or charge) over their draw, in seconds, or kUnknownRemainingTime.
  static double remainingTimeEstimate();

  // Calls `callback` on the main run loop each time the machine moves
  // between mains and limited power, until the returned source is released.
  // Null when no source could be made.
  class Observation {
   public:
    virtual ~Observation() = default;
  };
  static std::unique_ptr<Observation> observeLimitedPowerChanges(std::function<void()> callback);
};

}  // namespace larder
