// The platform pieces around a later install: polkit as the authorization
// service, the end of the session for an install after logout, the login
// service's snapshot, the display's sleep and the agent's record of an
// arming. polkit and logind are fakes on a bus of the test's own; the real
// system bus is never reached.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/host/LedgerAuthorizationService.h"
#include "store-runtime/host/LedgerLoginService.h"
#include "store-runtime/host/LedgerSessionRestart.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/LogindSessionControl.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PolkitAuthority.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"
#include "tests/integration/notifications/NotificationTestProcesses.h"
#include "tests/unit/FakeSystemServices.h"
#include "tests/unit/ScopedEnvironment.h"
#include "tests/unit/TemporaryFolder.h"

namespace larder::testing {
namespace {

using Verdict = FakePolkitAuthority::Verdict;

class PlatformSessionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::filesystem::create_directories(folder_ / "root");
    environment_.set("LARDER_ROOT", folder_ / "root");
    environment_.set("HOME", folder_ / "home");
    for (const char* kind : {"CACHE", "STATE", "CONFIG"}) {
      environment_.set(std::string("XDG_") + kind + "_HOME", folder_ / kind);
    }
    // Whatever the test's own environment says, the machine's system bus is
    // out of reach.
    environment_.set("DBUS_SYSTEM_BUS_ADDRESS", bus_.address());
    environment_.unset(LedgerSessionRestart::kAllowVariable);
    environment_.unset(LedgerAuthorizationService::kPolkitSwitchVariable);
  }

  PlatformStateFile state(std::string_view name) const {
    return PlatformStateFile(folder_ / "root/var/lib/larder-platform/" + std::string(name));
  }

  TemporaryFolder folder_{"larder-platform-session"};
  ScopedEnvironment environment_;
  PrivateSessionBus bus_;
};

// --- polkit ---

const std::vector<std::string> kInstallRights = {"system.install.quaymart-software",
                                                 "system.install.orvane-software",
                                                 "system.install.software.mdm-provided"};
const std::vector<std::string> kStandardUserRights = {
    "system.install.quaymart-software.standard-user",
    "system.install.orvane-software.standard-user"};

struct PolkitCase {
  const char* name;
  Verdict verdict;
  bool interactive;
  std::int32_t status;
};

class PolkitAuthorizationTest : public PlatformSessionTest,
                                public ::testing::WithParamInterface<PolkitCase> {};

TEST_P(PolkitAuthorizationTest, OneCheckOfTheInstallActionForThisProcess) {
  FakePolkitAuthority fake(bus_.address(),
                           {{"com.orvane.larderd.install-software", GetParam().verdict}});
  PolkitAuthority authority(bus_.connect());
  EXPECT_EQ(LedgerAuthorizationService::copyRightsFromPolkit(authority, kInstallRights,
                                                             GetParam().interactive),
            GetParam().status);

  const std::vector<FakePolkitAuthority::Check> checks = fake.checks();
  ASSERT_EQ(checks.size(), 1u) << "three rights of one action are one check";
  EXPECT_EQ(checks[0].subjectKind, "unix-process");
  EXPECT_EQ(checks[0].pid, static_cast<std::uint32_t>(::getpid()));
  EXPECT_GT(checks[0].startTime, 0u);
  EXPECT_EQ(checks[0].action, "com.orvane.larderd.install-software");
  EXPECT_TRUE(checks[0].details.empty());
  EXPECT_EQ(checks[0].flags, GetParam().interactive ? 1u : 0u);
  EXPECT_EQ(checks[0].cancellationId, "");
}

INSTANTIATE_TEST_SUITE_P(
    Verdicts, PolkitAuthorizationTest,
    ::testing::Values(
        PolkitCase{"Granted", Verdict::kYes, false, LedgerAuthorizationService::kGranted},
        PolkitCase{"Denied", Verdict::kNo, false, LedgerAuthorizationService::kDenied},
        PolkitCase{"ChallengeQuietlyIsDenied", Verdict::kAfterAuthentication, false,
                   LedgerAuthorizationService::kDenied},
        PolkitCase{"ChallengeWithTheUserIsGranted", Verdict::kAfterAuthentication, true,
                   LedgerAuthorizationService::kGranted},
        PolkitCase{"DismissedIsCanceled", Verdict::kDismissed, true,
                   LedgerAuthorizationService::kCanceled}),
    [](const ::testing::TestParamInfo<PolkitCase>& info) { return info.param.name; });

TEST_F(PlatformSessionTest, TheStandardUsersRightsAreTheirOwnAction) {
  FakePolkitAuthority fake(bus_.address(),
                           {{"com.orvane.larderd.install-software.standard-user", Verdict::kYes}});
  PolkitAuthority authority(bus_.connect());
  EXPECT_EQ(LedgerAuthorizationService::copyRightsFromPolkit(authority, kStandardUserRights, false),
            LedgerAuthorizationService::kGranted);
  EXPECT_EQ(
      LedgerAuthorizationService::copyRightsFromPolkit(
          authority, {"system.install.quaymart-software.standard-user", "system.install.software"},
          false),
      LedgerAuthorizationService::kDenied)
      << "every action of the set must be granted";
  const std::vector<FakePolkitAuthority::Check> checks = fake.checks();
  ASSERT_EQ(checks.size(), 3u);
  EXPECT_EQ(checks[0].action, "com.orvane.larderd.install-software.standard-user");
  EXPECT_EQ(checks[2].action, "com.orvane.larderd.install-software");
}

TEST_F(PlatformSessionTest, PolkitIsChosenOnlyWhereItIsAndWhereItMayBe) {
  using Backend = LedgerAuthorizationService::Backend;
  // A tree of its own, no switch: simulated, though polkit is on the bus.
  FakePolkitAuthority fake(bus_.address(), {});
  EXPECT_EQ(LedgerAuthorizationService::chooseBackend(), Backend::kSimulated);
  environment_.set(LedgerAuthorizationService::kPolkitSwitchVariable, "1");
  EXPECT_EQ(LedgerAuthorizationService::chooseBackend(), Backend::kPolkit);
  // The switch without a bus of the test's own is not enough.
  environment_.unset("DBUS_SYSTEM_BUS_ADDRESS");
  EXPECT_EQ(LedgerAuthorizationService::chooseBackend(), Backend::kSimulated);
  // No one owns polkit's name on this bus: simulated.
  PrivateSessionBus empty;
  environment_.set("DBUS_SYSTEM_BUS_ADDRESS", empty.address());
  EXPECT_EQ(LedgerAuthorizationService::chooseBackend(), Backend::kSimulated);
  EXPECT_TRUE(fake.checks().empty());
}

TEST_F(PlatformSessionTest, TheAdministratorsRestrictionDeniesTheStandardUserWithoutAsking) {
  PlatformStateFile restrictions(folder_ / "root/etc/larder/restrictions.plist");
  ASSERT_TRUE(restrictions.updateDictionary(
      [](PlistDictionary& stored) { stored["RequireAdminForSoftwareInstall"] = true; }));
  EXPECT_EQ(LedgerAuthorizationService::copyRights(kStandardUserRights, false),
            LedgerAuthorizationService::kDenied);
  EXPECT_TRUE(PlistValue(state("authorization.plist").readDictionary())["requests"].isNull())
      << "no backend was asked";
  // The others' rights are asked for as before (simulated here: granted).
  EXPECT_EQ(LedgerAuthorizationService::copyRights(kInstallRights, false),
            LedgerAuthorizationService::kGranted);
}

// --- the end of the session ---

PlistArray restartRequests(const PlatformStateFile& file) {
  const PlistValue stored = file.read();
  return stored.array() ? *stored.array() : PlistArray{};
}

TEST_F(PlatformSessionTest, WithoutTheVariableARestartIsOnlyRecorded) {
  FakeLogind logind(bus_.address());
  const PlatformStateFile requests = state("restart-requests.plist");
  // The variable alone does not do under a test's tree, nor a value other
  // than 1 anywhere.
  for (const char* allow : {"", "yes", "1"}) {
    if (*allow != '\0') environment_.set(LedgerSessionRestart::kAllowVariable, allow);
    EXPECT_FALSE(LedgerSessionRestart::mayAskLogind()) << allow;
    EXPECT_TRUE(LedgerSessionRestart::request(LedgerSessionRestart::Kind::kRestart, {"A", "B"}));
    EXPECT_TRUE(LedgerSessionRestart::request(LedgerSessionRestart::Kind::kLogout, {"C"}));
  }
  EXPECT_TRUE(logind.calls().empty());

  const PlistArray recorded = restartRequests(requests);
  ASSERT_EQ(recorded.size(), 6u);
  PlistValue first(recorded[0]);
  EXPECT_EQ(first["kind"], PlistValue("restart"));
  EXPECT_EQ(first["productKeys"], PlistValue(PlistArray{"A", "B"}));
  EXPECT_TRUE(first["date"].isDate());
  EXPECT_EQ(PlistValue(recorded[1])["kind"], PlistValue("logout"));
}

TEST_F(PlatformSessionTest, LogindHearsTheTwoRequestsAsItExpectsThem) {
  // Straight to the fake's connection: the gate is LedgerSessionRestart's.
  FakeLogind logind(bus_.address());
  LogindSessionControl control(bus_.connect());
  EXPECT_TRUE(control.terminateSession("c7"));
  EXPECT_TRUE(control.reboot());
  EXPECT_EQ(logind.calls(), (std::vector<std::string>{"TerminateSession c7", "Reboot false"}));
}

TEST_F(PlatformSessionTest, AnInstallAfterLogoutRestartingNowEndsTheSession) {
  ASSERT_TRUE(state("system-updates.plist").updateDictionary([](PlistDictionary& stored) {
    stored["catalog"] = PlistArray{PlistDictionary{{"productKey", "A"}, {"restartRequired", true}},
                                   PlistDictionary{{"productKey", "B"}}};
    stored["available"] = PlistArray{"A", "B"};
  }));
  SysupQuaymartUpdateController& controller =
      SysupQuaymartUpdateController::sharedUpdateController();
  const auto available = controller.availableUpdates();
  ASSERT_EQ(available.size(), 2u);
  const PlatformStateFile requests = state("restart-requests.plist");

  EXPECT_TRUE(controller.installUpdatesAfterNextLogout({available[1]}, false, false));
  EXPECT_TRUE(restartRequests(requests).empty()) << "not restarting now: nothing ends";
  EXPECT_TRUE(controller.installUpdatesAfterNextLogout({available[1]}, true, true));
  EXPECT_TRUE(controller.installUpdatesAfterNextLogout(available, true, false));

  const PlistArray recorded = restartRequests(requests);
  ASSERT_EQ(recorded.size(), 2u);
  EXPECT_EQ(PlistValue(recorded[0])["kind"], PlistValue("logout"));
  EXPECT_EQ(PlistValue(recorded[0])["productKeys"], PlistValue(PlistArray{"B"}));
  EXPECT_EQ(PlistValue(recorded[1])["kind"], PlistValue("restart"));
  EXPECT_EQ(PlistValue(recorded[1])["productKeys"], PlistValue(PlistArray{"A", "B"}));
  // The install after logout is recorded first, as before.
  EXPECT_EQ(PlistValue(
                state("system-updates.plist").readDictionary())["postLogout"]["A"]["restartingNow"],
            PlistValue(true));
}

// --- snapshot, display, agent ---

TEST_F(PlatformSessionTest, TheSnapshotIsTakenAndDisposedOfOnce) {
  struct Step {
    int take;
    int result;
  };
  for (const Step step : {Step{1, 0}, Step{0, 0}, Step{0, LedgerLoginService::kNoSnapshot},
                          Step{7, LedgerLoginService::kInvalidRequest}, Step{1, 0}}) {
    EXPECT_EQ(LedgerLoginService::setFinalTALSnapshot(step.take), step.result) << step.take;
  }
  PlistValue stored(state("login-service.plist").readDictionary());
  EXPECT_TRUE(stored["snapshotTaken"].boolValue());
  EXPECT_TRUE(stored["snapshotDate"].isDate());
  EXPECT_EQ(stored["takenCount"].int64Value(), 2);
  EXPECT_EQ(stored["disposedCount"].int64Value(), 1);

  ASSERT_TRUE(state("login-service.plist").updateDictionary([](PlistDictionary& s) {
    s["snapshotFails"] = true;
  }));
  EXPECT_EQ(LedgerLoginService::setFinalTALSnapshot(0), LedgerLoginService::kSnapshotFailed);
  EXPECT_EQ(LedgerLoginService::setFinalTALSnapshot(1), LedgerLoginService::kSnapshotFailed);
  stored = PlistValue(state("login-service.plist").readDictionary());
  EXPECT_TRUE(stored["snapshotTaken"].boolValue()) << "a failure changes nothing";
  EXPECT_EQ(stored["takenCount"].int64Value(), 2);
}

TEST_F(PlatformSessionTest, TheDisplaySleepsWhenTheStateSaysSo) {
  EXPECT_FALSE(LedgerIsMainDisplayAsleep());
  const PlatformStateFile system = state("system-state.plist");
  ASSERT_TRUE(system.updateDictionary([](PlistDictionary& s) { s["displayAsleep"] = true; }));
  EXPECT_TRUE(LedgerIsMainDisplayAsleep());
  ASSERT_TRUE(system.updateDictionary([](PlistDictionary& s) { s["displayAsleep"] = false; }));
  EXPECT_FALSE(LedgerIsMainDisplayAsleep());
}

TEST_F(PlatformSessionTest, AnArmingIsHandledOnceAndANewArmingIsNew) {
  EXPECT_FALSE(LedgerTwilightAgent::currentArming());
  LedgerTwilightAgent::armObserverWithMode(2);
  std::optional<LedgerTwilightAgent::Arming> first = LedgerTwilightAgent::currentArming();
  ASSERT_TRUE(first);
  EXPECT_EQ(first->mode, 2);
  EXPECT_FALSE(first->handled);
  LedgerTwilightAgent::noteLimitedPowerDuringArming(first->date);
  EXPECT_TRUE(LedgerTwilightAgent::markArmingHandled(first->date, "fired"));
  std::optional<LedgerTwilightAgent::Arming> handled = LedgerTwilightAgent::currentArming();
  ASSERT_TRUE(handled);
  EXPECT_TRUE(handled->handled);
  EXPECT_TRUE(handled->sawLimitedPower);
  EXPECT_EQ(PlistValue(state("twilight.plist").readDictionary())["laterOutcome"],
            PlistValue("fired"));

  // Armed anew, a second later: a new arming, and the old one's mark does
  // not reach it.
  ASSERT_TRUE(state("twilight.plist").updateDictionary([&](PlistDictionary& s) {
    s["armedDate"] = PlistDate{first->date.secondsSince1970 + 1};
  }));
  std::optional<LedgerTwilightAgent::Arming> second = LedgerTwilightAgent::currentArming();
  ASSERT_TRUE(second);
  EXPECT_FALSE(second->handled);
  EXPECT_FALSE(second->sawLimitedPower);
  EXPECT_FALSE(LedgerTwilightAgent::markArmingHandled(first->date, "missed"));
  EXPECT_FALSE(LedgerTwilightAgent::currentArming()->handled);
}

}  // namespace
}  // namespace larder::testing
