#include "tools/larderctl/LaterAgentDecision.h"

#include <ctime>

namespace larder {

namespace {

using Clock = LaterAgentDecision::Clock;

Clock::time_point timePointOf(PlistDate date) {
  return Clock::time_point(std::chrono::duration_cast<Clock::duration>(
      std::chrono::duration<double>(date.secondsSince1970)));
}

// `day` at `hour`:00 local time; mktime settles the day's overflow and
// daylight saving time.
std::time_t localTime(std::tm day, int hour) {
  day.tm_hour = hour;
  day.tm_min = 0;
  day.tm_sec = 0;
  day.tm_isdst = -1;
  return std::mktime(&day);
}

}  // namespace

LaterAgentDecision::Window LaterAgentDecision::tonightWindow(Clock::time_point armedAt) {
  const std::time_t armed = Clock::to_time_t(armedAt);
  std::tm day{};
  localtime_r(&armed, &day);
  if (Clock::from_time_t(localTime(day, kWindowStartHour)) <= armedAt) day.tm_mday += 1;
  return Window{Clock::from_time_t(localTime(day, kWindowStartHour)),
                Clock::from_time_t(localTime(day, kWindowEndHour))};
}

LaterAgentDecision LaterAgentDecision::decide(const LedgerTwilightAgent::Arming& arming,
                                              Clock::time_point now, bool onMainsPower) {
  if (arming.handled) return {};
  const Clock::time_point armedAt = timePointOf(arming.date);
  if (arming.mode == kInAnHourMode) {
    return {now >= armedAt + kInAnHourDelay ? Action::kFire : Action::kWait};
  }
  if (arming.mode != kTonightMode) return {};
  const Window window = tonightWindow(armedAt);
  if (now < window.start) return {Action::kWait};
  if (now >= window.end) return {Action::kMissed, arming.sawLimitedPower};
  return {onMainsPower ? Action::kFire : Action::kWaitForPower};
}

std::string_view LaterAgentDecision::actionName(Action action) {
  switch (action) {
    case Action::kNothing:
      return "nothing";
    case Action::kWait:
      return "wait";
    case Action::kWaitForPower:
      return "wait-for-power";
    case Action::kFire:
      return "fire";
    case Action::kMissed:
      return "missed";
  }
  return "nothing";
}

}  // namespace larder
