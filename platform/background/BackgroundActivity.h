#pragma once

#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/background/BackgroundActivityClock.h"

namespace larder {

enum class BackgroundActivityPriority {
  // Work that keeps things tidy and can wait: runs after utility work due at the same moment.
  Maintenance,
  // Work the user will notice the result of.
  Utility,
};

struct BackgroundActivityCriteria {
  bool repeating = false;
  // Until the first run after registration; for a repeating activity also the interval, counted
  // from the start of one run to the next.
  BackgroundActivityClock::Duration delay{0};
  // How long a due activity may wait for its conditions before its handler hears that it is
  // deferred. It still runs as soon as the conditions hold.
  BackgroundActivityClock::Duration gracePeriod{0};
  BackgroundActivityPriority priority = BackgroundActivityPriority::Maintenance;
  bool allowBattery = true;
};

enum class BackgroundActivityState {
  // Registered, not due yet, or due and waiting for mains power within its grace period.
  Waiting,
  // Due, past its grace period, and still held back by battery power.
  Deferred,
  // Its handler has been called to do the work.
  Run,
  // A one-time activity that has run.
  Done,
};

std::string_view toString(BackgroundActivityState state);

// What the scheduler knows of an activity, as handed to its handler and to callers that ask.
struct BackgroundActivity {
  std::string name;
  BackgroundActivityCriteria criteria;
  BackgroundActivityState state = BackgroundActivityState::Waiting;
  // When it is due next (for a Run, the next occurrence after this one).
  BackgroundActivityClock::TimePoint due;
  std::uint64_t runCount = 0;
};

}  // namespace larder
