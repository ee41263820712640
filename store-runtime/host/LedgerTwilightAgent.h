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
//   handledArmedDate       date      the arming the agent acted on (fired
//                                    or let pass); it never acts twice on
//                                    one arming
//   laterOutcome           string    "fired" or "missed", for that arming
//   laterOutcomeDate       date      when the agent decided so
//   limitedPowerArmedDate  date      the arming whose window the agent saw
//                                    on battery
//
// A countdown that runs out without an answer gives 1, restart. The agent
// itself is `larderctl later-agent` (tools/larderctl/LaterAgentCommand).
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

  // The user's answer to the countdown on screen (or the next one): the
  // countdown ends with it.
  static void answerRestartCountdown(std::int64_t result);

  // What the agent needs of the present arming.
  struct Arming {
    std::int64_t mode = 0;
    PlistDate date;
    // The agent fired or let pass this arming already.
    bool handled = false;
    // The agent saw the machine on battery during its window.
    bool sawLimitedPower = false;
  };
  // Nothing when not armed, or armed without mode or date.
  static std::optional<Arming> currentArming();
  // Marks the arming of `armedDate` fired or missed ("fired", "missed");
  // false when the agent has been armed anew since.
  static bool markArmingHandled(PlistDate armedDate, std::string_view outcome);
  static void noteLimitedPowerDuringArming(PlistDate armedDate);

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
  static constexpr std::string_view kHandledArmedDateKey = "handledArmedDate";
  static constexpr std::string_view kLaterOutcomeKey = "laterOutcome";
  static constexpr std::string_view kLaterOutcomeDateKey = "laterOutcomeDate";
  static constexpr std::string_view kLimitedPowerArmedDateKey = "limitedPowerArmedDate";
};

}  // namespace larder
