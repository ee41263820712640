#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/background/BackgroundActivity.h"
#include "platform/background/BackgroundActivityClock.h"
#include "platform/background/BackgroundActivityPowerSource.h"
#include "platform/dispatch/DispatchQueue.h"

namespace larder {

// Runs named activities of the process at moments that suit the machine, with in-process timers.
//
// An activity comes due `delay` after its registration. Then:
//  - If its conditions hold (it is allowed on battery, or the machine is on mains power), its
//    handler is called with Run at once.
//  - If it must not run on battery and the machine is on battery, it waits for mains power,
//    which is checked every `powerCheckInterval` and whenever `powerSourceDidChange` is called.
//    Should its grace period pass while it waits, its handler hears Deferred, once; it still
//    runs, with Run, as soon as mains power returns. Battery is never overridden: the work that
//    asks for mains power is the work that costs enough to drain a battery, and a repeating one
//    loses nothing but freshness by waiting.
//  - A repeating activity comes due again one interval after its run began; occurrences that
//    passed while it waited or ran are not made up, so a long wait gives one run, not a burst.
//    Runs of one activity never overlap: one that comes due while its handler still runs, runs
//    when the handler returns.
// A run ends when its handler returns. Handlers run on the handler queue (by default a serial
// queue of the scheduler's own); activities due at the same moment are handed over utility
// before maintenance, each in order of name. Nothing is called after the scheduler is destroyed.
class BackgroundActivityScheduler {
 public:
  using Handler =
      std::function<void(const BackgroundActivity& activity, BackgroundActivityState state)>;

  struct Options {
    // Null members take the system's: boot-time clock, kernel power supplies, a serial queue.
    std::shared_ptr<BackgroundActivityClock> clock;
    std::shared_ptr<BackgroundActivityPowerSource> powerSource;
    std::shared_ptr<DispatchQueue> handlerQueue;
    BackgroundActivityClock::Duration powerCheckInterval = std::chrono::minutes(1);
  };

  BackgroundActivityScheduler();
  explicit BackgroundActivityScheduler(Options options);
  ~BackgroundActivityScheduler();
  BackgroundActivityScheduler(const BackgroundActivityScheduler&) = delete;
  BackgroundActivityScheduler& operator=(const BackgroundActivityScheduler&) = delete;

  // Registers, or replaces, the activity of that name. False for an empty name, a missing
  // handler, a negative delay or grace period, or a repeating activity without an interval.
  bool registerActivity(std::string name, BackgroundActivityCriteria criteria, Handler handler);
  // False when there was no such activity. A run in progress finishes.
  bool unregisterActivity(std::string_view name);

  [[nodiscard]] std::optional<BackgroundActivity> activity(std::string_view name) const;
  [[nodiscard]] std::vector<std::string> activityNames() const;

  // Looks at the power source now rather than at the next check.
  void powerSourceDidChange();

 private:
  class Core;
  std::shared_ptr<BackgroundActivityClock> clock_;
  std::shared_ptr<Core> core_;
};

}  // namespace larder
