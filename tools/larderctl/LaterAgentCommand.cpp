#include "tools/larderctl/LaterAgentCommand.h"

#include <CLI/CLI.hpp>
#include <iostream>
#include <nlohmann/json.hpp>

#include "store-runtime/host/LedgerPowerSource.h"
#include "store-runtime/records/RecordDateText.h"
#include "tools/larderctl/ExitStatus.h"

namespace larder {

namespace {

bool onMainsPower() {
  return LedgerPowerSource::remainingTimeEstimate() == LedgerPowerSource::kUnlimitedRemainingTime;
}

// The agent shows no countdown of its own: the service's run shows it.
constexpr bool kCountdownDeferred = true;

}  // namespace

LaterAgentCommand::Clock::time_point LaterAgentCommand::momentFrom(
    const std::optional<std::string>& nowText) {
  if (!nowText) return Clock::now();
  std::optional<PlistDate> date = RecordDateText::parse(*nowText);
  if (!date) throw CLI::ValidationError("--now takes an ISO 8601 date, not '" + *nowText + "'");
  return Clock::time_point(std::chrono::duration_cast<Clock::duration>(
      std::chrono::duration<double>(date->secondsSince1970)));
}

int LaterAgentCommand::run(Clock::time_point now) const {
  const std::optional<LedgerTwilightAgent::Arming> arming = LedgerTwilightAgent::currentArming();
  LaterAgentDecision decision;
  if (arming) decision = LaterAgentDecision::decide(*arming, now, onMainsPower());
  using Action = LaterAgentDecision::Action;
  if (decision.action == Action::kWaitForPower) {
    LedgerTwilightAgent::noteLimitedPowerDuringArming(arming->date);
  } else if (decision.action == Action::kFire) {
    ServiceClient client = connect_();
    client.call(std::string(kFireRequest), {arming->mode, kCountdownDeferred});
    LedgerTwilightAgent::markArmingHandled(arming->date, "fired");
  } else if (decision.action == Action::kMissed) {
    ServiceClient client = connect_();
    client.call(std::string(kMissedRequest), {decision.dueToACPower});
    LedgerTwilightAgent::markArmingHandled(arming->date, "missed");
  }
  print(decision, arming);
  return kExitSuccess;
}

void LaterAgentCommand::print(const LaterAgentDecision& decision,
                              const std::optional<LedgerTwilightAgent::Arming>& arming) const {
  const std::string action(LaterAgentDecision::actionName(decision.action));
  if (json_) {
    nlohmann::json report{{"action", action}, {"armed", arming.has_value()}};
    if (arming) report["mode"] = arming->mode;
    if (decision.action == LaterAgentDecision::Action::kMissed) {
      report["dueToACPower"] = decision.dueToACPower;
    }
    std::cout << report.dump() << std::endl;
    return;
  }
  if (!arming) {
    std::cout << "not armed" << std::endl;
    return;
  }
  std::cout << "mode " << arming->mode << ": " << action;
  if (decision.action == LaterAgentDecision::Action::kMissed) {
    std::cout << (decision.dueToACPower ? " (on battery)" : "");
  }
  std::cout << std::endl;
}

}  // namespace larder
