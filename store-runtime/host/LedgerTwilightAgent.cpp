#include "store-runtime/host/LedgerTwilightAgent.h"

#include <algorithm>
#include <chrono>
#include <thread>

#include "platform/log/TillLogManager.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerTwilightAgent";
constexpr auto kAnswerPollInterval = std::chrono::milliseconds(50);

PlatformStateFile stateFile() {
  return PlatformStateFile::named("twilight.plist");
}

bool storedFlag(std::string_view key) {
  PlistValue state(stateFile().readDictionary());
  return state[key].boolValue();
}

// Takes the user's answer out of the state, if one is there.
std::optional<std::int64_t> takeCountdownAnswer() {
  if (PlistValue(stateFile().readDictionary())[LedgerTwilightAgent::kCountdownAnswerKey].isNull()) {
    return std::nullopt;
  }
  std::optional<std::int64_t> answer;
  stateFile().updateDictionary([&](PlistDictionary& state) {
    auto found = state.find(LedgerTwilightAgent::kCountdownAnswerKey);
    if (found == state.end()) return;
    if (found->second.isNumber()) answer = found->second.int64Value();
    state.erase(found);
  });
  return answer;
}

std::chrono::milliseconds countdownLength() {
  double seconds =
      PlistValue(stateFile().readDictionary())[LedgerTwilightAgent::kCountdownSecondsKey]
          .doubleValue();
  if (!(seconds > 0)) return std::chrono::milliseconds(0);
  constexpr double kLongestCountdownSeconds = 24 * 3600;
  return std::chrono::milliseconds(
      static_cast<std::int64_t>(std::min(seconds, kLongestCountdownSeconds) * 1000));
}

std::int64_t waitForCountdownResult() {
  auto deadline = std::chrono::steady_clock::now() + countdownLength();
  while (true) {
    if (std::optional<std::int64_t> answer = takeCountdownAnswer()) return *answer;
    if (std::chrono::steady_clock::now() >= deadline) return LedgerTwilightAgent::kCountdownRanOut;
    std::this_thread::sleep_for(kAnswerPollInterval);
  }
}

}  // namespace

std::string LedgerTwilightAgent::stateFilePath() {
  return stateFile().path();
}

bool LedgerTwilightAgent::isRestartCountdownShown() {
  return storedFlag(kCountdownShownKey);
}

bool LedgerTwilightAgent::isArmedForInstallLater() {
  return storedFlag(kArmedKey);
}

std::optional<std::int64_t> LedgerTwilightAgent::armedMode() {
  PlistValue state(stateFile().readDictionary());
  if (!state[kArmedKey].boolValue() || !state[kArmedModeKey].isNumber()) return std::nullopt;
  return state[kArmedModeKey].int64Value();
}

std::int64_t LedgerTwilightAgent::showRestartCountdownNotification() {
  TILL_LOG(2, "%@: Showing the restart countdown", kSpeaker);
  stateFile().updateDictionary([](PlistDictionary& state) {
    state[std::string(kCountdownShownKey)] = true;
    PlistValue count = PlistValue(state)[kCountdownCountKey];
    state[std::string(kCountdownCountKey)] = count.int64Value() + 1;
  });
  std::int64_t result = waitForCountdownResult();
  stateFile().updateDictionary([result](PlistDictionary& state) {
    state[std::string(kCountdownShownKey)] = false;
    state[std::string(kLastCountdownResultKey)] = result;
  });
  TILL_LOG(2, "%@: Restart countdown ended with %ld", kSpeaker, result);
  return result;
}

void LedgerTwilightAgent::armObserverWithMode(std::int64_t mode) {
  TILL_LOG(2, "%@: Armed for install later with mode %ld", kSpeaker, mode);
  stateFile().updateDictionary([mode](PlistDictionary& state) {
    state[std::string(kArmedKey)] = true;
    state[std::string(kArmedModeKey)] = mode;
    state[std::string(kArmedDateKey)] = PlistDate::now();
  });
}

void LedgerTwilightAgent::disarmObserver() {
  TILL_LOG(2, "%@: Disarmed", kSpeaker);
  stateFile().updateDictionary([](PlistDictionary& state) {
    state[std::string(kArmedKey)] = false;
    state.erase(std::string(kArmedModeKey));
    state.erase(std::string(kArmedDateKey));
  });
}

void LedgerTwilightAgent::answerRestartCountdown(std::int64_t result) {
  TILL_LOG(2, "%@: The user answered the restart countdown with %ld", kSpeaker, result);
  stateFile().updateDictionary(
      [result](PlistDictionary& state) { state[std::string(kCountdownAnswerKey)] = result; });
}

namespace {

bool sameDate(const PlistValue& stored, PlistDate date) {
  return stored.date() && stored.date()->secondsSince1970 == date.secondsSince1970;
}

}  // namespace

std::optional<LedgerTwilightAgent::Arming> LedgerTwilightAgent::currentArming() {
  PlistValue state(stateFile().readDictionary());
  if (!state[kArmedKey].boolValue() || !state[kArmedModeKey].isNumber() ||
      !state[kArmedDateKey].date()) {
    return std::nullopt;
  }
  Arming arming{state[kArmedModeKey].int64Value(), *state[kArmedDateKey].date()};
  arming.handled = sameDate(state[kHandledArmedDateKey], arming.date);
  arming.sawLimitedPower = sameDate(state[kLimitedPowerArmedDateKey], arming.date);
  return arming;
}

bool LedgerTwilightAgent::markArmingHandled(PlistDate armedDate, std::string_view outcome) {
  bool marked = false;
  stateFile().updateDictionary([&](PlistDictionary& state) {
    if (!sameDate(PlistValue(state)[kArmedDateKey], armedDate)) return;
    state[std::string(kHandledArmedDateKey)] = armedDate;
    state[std::string(kLaterOutcomeKey)] = std::string(outcome);
    state[std::string(kLaterOutcomeDateKey)] = PlistDate::now();
    marked = true;
  });
  TILL_LOG(2, "%@: Later install %@%@", kSpeaker, outcome,
           marked ? "" : ", but the agent was armed anew meanwhile");
  return marked;
}

void LedgerTwilightAgent::noteLimitedPowerDuringArming(PlistDate armedDate) {
  stateFile().updateDictionary([armedDate](PlistDictionary& state) {
    state[std::string(kLimitedPowerArmedDateKey)] = armedDate;
  });
}

}  // namespace larder
