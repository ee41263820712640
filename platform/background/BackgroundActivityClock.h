#pragma once

#include <chrono>
#include <functional>
#include <memory>

namespace larder {

// The time base of the background activity scheduler, injectable so that tests can run ten hours
// in a moment.
//
// The system clock counts from boot, suspended time included, so an activity due "ten hours
// from now" comes due after ten hours of wall time even when the laptop slept through some of
// them; it wakes at least once a minute to notice a resume.
class BackgroundActivityClock {
 public:
  using Duration = std::chrono::nanoseconds;
  using TimePoint = std::chrono::time_point<BackgroundActivityClock, Duration>;

  virtual ~BackgroundActivityClock() = default;

  [[nodiscard]] virtual TimePoint now() const = 0;

  // Calls `wake` once, on a thread of the clock's choosing, when `now()` has reached `time`. A
  // later request replaces the one before. Safe to call from within `wake`.
  virtual void scheduleWakeUp(TimePoint time, std::function<void()> wake) = 0;

  // Drops the pending request. When it returns, no `wake` is running or will run, unless it is
  // called from within `wake` itself.
  virtual void cancelWakeUp() = 0;

  static std::shared_ptr<BackgroundActivityClock> system();
};

}  // namespace larder
