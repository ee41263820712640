#pragma once

#include <chrono>
#include <cstdint>
#include <string_view>

#include "store-runtime/host/LedgerTwilightAgent.h"

namespace larder {

// What the deferred-install agent does with the present arming at a given
// moment. Pure: the clock, the power and the arming are given.
//
//   mode 1, tonight   the first 02:00-05:00 local window that begins after
//                     the arming. Inside it on mains power: fire. Inside it
//                     on battery: wait, and remember that the window saw
//                     battery. After it: missed, with dueToACPower true when
//                     the window was seen on battery.
//   mode 2, in an     fire once an hour has passed since the arming.
//   hour
//   other modes       nothing: mode 3 reminds through a notification and is
//                     never armed.
//
// An arming already fired or missed gives nothing.
struct LaterAgentDecision {
  enum class Action {
    kNothing,       // not an arming the agent acts on, or handled already
    kWait,          // the moment has not come
    kWaitForPower,  // the window is open, but on battery
    kFire,          // NowIsLaterWithModeCountdownDeferred
    kMissed,        // LaterDidNotOccurWithDueToACPower
  };

  using Clock = std::chrono::system_clock;

  static constexpr std::int64_t kTonightMode = 1;
  static constexpr std::int64_t kInAnHourMode = 2;
  static constexpr int kWindowStartHour = 2;
  static constexpr int kWindowEndHour = 5;
  static constexpr std::chrono::hours kInAnHourDelay{1};

  Action action = Action::kNothing;
  // For kMissed.
  bool dueToACPower = false;

  static LaterAgentDecision decide(const LedgerTwilightAgent::Arming& arming, Clock::time_point now,
                                   bool onMainsPower);

  // The night window of an arming at `armedAt`, in the local time zone.
  struct Window {
    Clock::time_point start;
    Clock::time_point end;
  };
  static Window tonightWindow(Clock::time_point armedAt);

  static std::string_view actionName(Action action);
};

}  // namespace larder
