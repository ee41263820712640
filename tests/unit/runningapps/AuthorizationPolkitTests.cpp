// The authorization controller against polkit: a fake authority on a bus of
// the test's own stands in for the system bus's. The backend is chosen
// once per process, and the controller keeps its authorization for the
// process's life, so each case runs in a process of its own (a death test
// that exits normally) and reports on its standard error what it saw. That
// process stops its bus before it exits: a bus left running would hold the
// report's pipe open.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <memory>

#include "running-apps/AuthorizationController.h"
#include "store-runtime/host/LedgerAuthorizationService.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"
#include "tests/integration/notifications/NotificationTestProcesses.h"
#include "tests/unit/FakeSystemServices.h"
#include "tests/unit/ScopedEnvironment.h"
#include "tests/unit/TemporaryFolder.h"

namespace larder::testing {
namespace {

using Verdict = FakePolkitAuthority::Verdict;
constexpr const char* kInstall = "com.orvane.larderd.install-software";
constexpr const char* kStandardUser = "com.orvane.larderd.install-software.standard-user";

class AuthorizationThroughPolkitTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ::testing::GTEST_FLAG(death_test_style) = "threadsafe";
    std::filesystem::create_directories(folder_ / "root");
    environment_.set("LARDER_ROOT", folder_ / "root");
    environment_.set("HOME", folder_ / "home");
    environment_.set("XDG_CONFIG_HOME", folder_ / "config");
    environment_.set("XDG_STATE_HOME", folder_ / "state");
    environment_.unset("__OSINSTALL_ENVIRONMENT");
    environment_.set("DBUS_SYSTEM_BUS_ADDRESS", bus_->address());
    environment_.set(LedgerAuthorizationService::kPolkitSwitchVariable, "1");
    // Not a guest, whatever the account running the tests is called.
    ASSERT_TRUE(
        PlatformStateFile::named("system-state.plist").updateDictionary([](PlistDictionary& s) {
          s["guestUser"] = false;
        }));
  }

  void restrictToAdministrators() {
    ASSERT_TRUE(PlatformStateFile(folder_ / "root/etc/larder/restrictions.plist")
                    .updateDictionary(
                        [](PlistDictionary& s) { s["RequireAdminForSoftwareInstall"] = true; }));
  }

  // Asks as the installers do, then writes what polkit was asked
  // ("action/flags" each), the answer, whether the system update framework
  // was given the authorization and which backend answered.
  [[noreturn]] void authorizeAndReport(std::unique_ptr<FakePolkitAuthority> fake) {
    const bool authorized = AuthorizationController::sharedInstance().authorizeForSoftwareInstall();
    std::string report = "checks:";
    if (fake) {
      for (const FakePolkitAuthority::Check& check : fake->checks()) {
        report += " " + check.action + "/" + std::to_string(check.flags);
      }
    }
    report += authorized ? " -> authorized" : " -> refused";
    const bool handedOn =
        SysupQuaymartUpdateController::sharedUpdateController().authorization().has_value();
    report += handedOn ? ", handed on" : ", kept";
    const bool usedPolkit = LedgerAuthorizationService::processBackend() ==
                            LedgerAuthorizationService::Backend::kPolkit;
    report += usedPolkit ? ", polkit" : ", simulated";
    const PlistValue simulated(
        PlatformStateFile(LedgerAuthorizationService::stateFilePath()).readDictionary());
    const PlistArray* requests = simulated["requests"].array();
    report += ", " + std::to_string(requests ? requests->size() : 0) + " simulated requests";
    fake.reset();
    bus_.reset();
    std::fprintf(stderr, "%s\n", report.c_str());
    std::_Exit(0);
  }

  std::unique_ptr<FakePolkitAuthority> fake(std::map<std::string, Verdict> verdicts) const {
    return std::make_unique<FakePolkitAuthority>(bus_->address(), std::move(verdicts));
  }

  TemporaryFolder folder_{"larder-authorization"};
  ScopedEnvironment environment_;
  std::unique_ptr<PrivateSessionBus> bus_ = std::make_unique<PrivateSessionBus>();
};

TEST_F(AuthorizationThroughPolkitTest, AnAdministratorIsAuthorizedQuietly) {
  EXPECT_EXIT(authorizeAndReport(fake({{kInstall, Verdict::kYes}})), ::testing::ExitedWithCode(0),
              "checks: com.orvane.larderd.install-software/0 -> authorized, handed on, polkit, "
              "0 simulated requests");
}

TEST_F(AuthorizationThroughPolkitTest, AStandardUserIsAskedOnlyAtTheThirdAttempt) {
  EXPECT_EXIT(authorizeAndReport(
                  fake({{kInstall, Verdict::kAfterAuthentication}, {kStandardUser, Verdict::kNo}})),
              ::testing::ExitedWithCode(0),
              "checks: com.orvane.larderd.install-software/0 "
              "com.orvane.larderd.install-software.standard-user/0 "
              "com.orvane.larderd.install-software/1 -> authorized, handed on, polkit");
}

TEST_F(AuthorizationThroughPolkitTest, TheStandardUsersActionIsEnoughWithoutTheRestriction) {
  EXPECT_EXIT(authorizeAndReport(fake({{kStandardUser, Verdict::kYes}})),
              ::testing::ExitedWithCode(0),
              "checks: com.orvane.larderd.install-software/0 "
              "com.orvane.larderd.install-software.standard-user/0 -> authorized, handed on");
}

TEST_F(AuthorizationThroughPolkitTest, UnderTheRestrictionOnlyAnAdministratorsAnswerCounts) {
  restrictToAdministrators();
  EXPECT_EXIT(authorizeAndReport(fake({{kStandardUser, Verdict::kYes}})),
              ::testing::ExitedWithCode(0),
              "checks: com.orvane.larderd.install-software/0 "
              "com.orvane.larderd.install-software/1 -> refused, kept, polkit");
}

TEST_F(AuthorizationThroughPolkitTest, WithoutPolkitOnTheBusTheSimulatedServiceAnswers) {
  // Nobody owns polkit's name: the simulated authority grants the quiet
  // rights when its file says nothing.
  EXPECT_EXIT(authorizeAndReport(nullptr), ::testing::ExitedWithCode(0),
              "checks: -> authorized, handed on, simulated, 1 simulated requests");
}

}  // namespace
}  // namespace larder::testing
