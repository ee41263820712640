// What the deferred-install agent decides for an arming at a given moment,
// in a fixed time zone.
#include <gtest/gtest.h>

#include <ctime>

#include "store-runtime/records/RecordDateText.h"
#include "tests/unit/ScopedEnvironment.h"
#include "tools/larderctl/LaterAgentDecision.h"

namespace larder::testing {
namespace {

using Action = LaterAgentDecision::Action;

PlistDate date(std::string_view text) {
  std::optional<PlistDate> parsed = RecordDateText::parse(text);
  EXPECT_TRUE(parsed) << text;
  return parsed.value_or(PlistDate{});
}

LaterAgentDecision::Clock::time_point moment(std::string_view text) {
  return LaterAgentDecision::Clock::time_point(
      std::chrono::duration_cast<LaterAgentDecision::Clock::duration>(
          std::chrono::duration<double>(date(text).secondsSince1970)));
}

struct DecisionCase {
  const char* name;
  std::int64_t mode;
  const char* armed;
  const char* now;
  bool onMains;
  bool sawLimitedPower;
  bool handled;
  Action action;
  bool dueToACPower;
};

class LaterAgentDecisionTest : public ::testing::TestWithParam<DecisionCase> {
 protected:
  void SetUp() override {
    environment_.set("TZ", "UTC");
    ::tzset();
  }
  void TearDown() override {
    environment_.restore();
    ::tzset();
  }
  ScopedEnvironment environment_;
};

TEST_P(LaterAgentDecisionTest, Decides) {
  const DecisionCase& c = GetParam();
  LedgerTwilightAgent::Arming arming{c.mode, date(c.armed), c.handled, c.sawLimitedPower};
  const LaterAgentDecision decision = LaterAgentDecision::decide(arming, moment(c.now), c.onMains);
  EXPECT_EQ(LaterAgentDecision::actionName(decision.action),
            LaterAgentDecision::actionName(c.action));
  if (c.action == Action::kMissed) {
    EXPECT_EQ(decision.dueToACPower, c.dueToACPower);
  }
}

// Armed at 14:00 for tonight: the window is 02:00-05:00 the next morning.
INSTANTIATE_TEST_SUITE_P(
    Modes, LaterAgentDecisionTest,
    ::testing::Values(
        DecisionCase{"TonightBeforeTheWindow", 1, "2026-11-26T14:00:00Z", "2026-11-27T01:59:59Z",
                     true, false, false, Action::kWait, false},
        DecisionCase{"TonightInsideOnMains", 1, "2026-11-26T14:00:00Z", "2026-11-27T02:00:00Z",
                     true, false, false, Action::kFire, false},
        DecisionCase{"TonightInsideOnBattery", 1, "2026-11-26T14:00:00Z", "2026-11-27T03:30:00Z",
                     false, false, false, Action::kWaitForPower, false},
        DecisionCase{"TonightEndedAfterBattery", 1, "2026-11-26T14:00:00Z", "2026-11-27T05:00:00Z",
                     true, true, false, Action::kMissed, true},
        DecisionCase{"TonightEndedUnseen", 1, "2026-11-26T14:00:00Z", "2026-11-28T09:00:00Z", false,
                     false, false, Action::kMissed, false},
        // Armed inside a window: tonight is the next one.
        DecisionCase{"TonightArmedInAWindow", 1, "2026-11-27T03:00:00Z", "2026-11-27T04:00:00Z",
                     true, false, false, Action::kWait, false},
        DecisionCase{"TonightArmedInAWindowNextNight", 1, "2026-11-27T03:00:00Z",
                     "2026-11-28T02:10:00Z", true, false, false, Action::kFire, false},
        DecisionCase{"HourNotYet", 2, "2026-11-26T14:00:00Z", "2026-11-26T14:59:59Z", true, false,
                     false, Action::kWait, false},
        DecisionCase{"HourPassedOnBattery", 2, "2026-11-26T14:00:00Z", "2026-11-26T15:00:00Z",
                     false, false, false, Action::kFire, false},
        DecisionCase{"HourFiredAlready", 2, "2026-11-26T14:00:00Z", "2026-11-26T16:00:00Z", true,
                     false, true, Action::kNothing, false},
        DecisionCase{"TonightMissedAlready", 1, "2026-11-26T14:00:00Z", "2026-11-27T06:00:00Z",
                     true, false, true, Action::kNothing, false},
        DecisionCase{"ReminderIsNeverActedOn", 3, "2026-11-26T14:00:00Z", "2026-11-28T14:00:00Z",
                     true, false, false, Action::kNothing, false}),
    [](const ::testing::TestParamInfo<DecisionCase>& info) { return info.param.name; });

}  // namespace
}  // namespace larder::testing
