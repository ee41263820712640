#pragma once

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "client/ServiceClient.h"
#include "tools/larderctl/LaterAgentDecision.h"

namespace larder {

// `larderctl later-agent --once [--now DATE]`: the deferred-install agent.
// Its timer runs it every few minutes; each run looks at the agent's state
// (LedgerTwilightAgent), decides (LaterAgentDecision) and, when the armed
// moment has come, sends NowIsLaterWithModeCountdownDeferred (the mode; true:
// the agent showed no countdown of its own, so the service shows it), or
// LaterDidNotOccurWithDueToACPower when the moment passed unused. The
// arming is then marked, so no later run acts on it again; a request the
// service did not take leaves it unmarked for the next run. --now stands in
// for the clock, for tests and demonstrations.
class LaterAgentCommand {
 public:
  static constexpr std::string_view kFireRequest = "NowIsLaterWithModeCountdownDeferred";
  static constexpr std::string_view kMissedRequest = "LaterDidNotOccurWithDueToACPower";

  using Clock = LaterAgentDecision::Clock;
  // Connects to the service; called only when there is something to send.
  using Connect = std::function<ServiceClient()>;

  LaterAgentCommand(bool json, Connect connect) : json_(json), connect_(std::move(connect)) {}

  // The moment of --now (ISO 8601; UTC without a zone), or the clock's; a
  // usage error (CLI::ValidationError) when the text is no date.
  static Clock::time_point momentFrom(const std::optional<std::string>& nowText);

  int run(Clock::time_point now) const;

 private:
  void print(const LaterAgentDecision& decision,
             const std::optional<LedgerTwilightAgent::Arming>& arming) const;

  bool json_;
  Connect connect_;
};

}  // namespace larder
