#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

// The deferred-install agent: it is armed to install updates later (Do It
// Later modes 1 tonight, 2 in an hour, 3 remind tomorrow) and shows the
// restart countdown. This platform has no such agent, so its state lives in
// "<root>/var/lib/larder-platform/twilight.plist", where the demo, the
// command-line tool and tests can read it and answer the countdown:
//
//   armed                  boolean   armed for a later install
//   armedMode              integer   the mode it was armed with
//   armedDate              date      when it was armed
//   restartCountdownShown  boolean   a countdown is on screen right now
//   countdownSeconds       number    how long a countdown runs (default 0)
//   countdownAnswer        integer   the user's answer; taken (and removed)
//                                    as soon as it is there, before or
//                                    during a countdown
//   countdownCount         integer   countdowns shown so far
//   lastCountdownResult    integer   what the last countdown gave
//
// A countdown that runs out without an answer gives 1, restart.
class LedgerTwilightAgent {
 public:
  static constexpr std::int64_t kCountdownRanOut = 1;

  static bool isRestartCountdownShown();
  static bool isArmedForInstallLater();
  // Shows the countdown and returns its result when it is over: 1 or 2
  // restart, 3 to 5 the Do It Later mode the user chose instead.
  static std::int64_t showRestartCountdownNotification();
  static void armObserverWithMode(std::int64_t mode);
  static void disarmObserver();

  // The mode it is armed with; nullopt when not armed.
  static std::optional<std::int64_t> armedMode();

  static std::string stateFilePath();

  // Keys of the state file, for tools that drive the simulation.
  static constexpr std::string_view kArmedKey = "armed";
  static constexpr std::string_view kArmedModeKey = "armedMode";
  static constexpr std::string_view kArmedDateKey = "armedDate";
  static constexpr std::string_view kCountdownShownKey = "restartCountdownShown";
  static constexpr std::string_view kCountdownSecondsKey = "countdownSeconds";
  static constexpr std::string_view kCountdownAnswerKey = "countdownAnswer";
  static constexpr std::string_view kCountdownCountKey = "countdownCount";
  static constexpr std::string_view kLastCountdownResultKey = "lastCountdownResult";
};

}  // namespace larder
