#include <gtest/gtest.h>

#include <atomic>
#include <chrono>

#include "platform/dispatch/DispatchSemaphore.h"
#include "running-apps/RunningApplication.h"
#include "running-apps/RunningApplicationFacts.h"
#include "tests/unit/runningapps/AppTestSupport.h"

namespace larder {
namespace {

using testing::AppTestRoot;
using testing::eventually;

class RunningApplicationTest : public ::testing::Test {
 protected:
  AppTestRoot apps_;
};

TEST_F(RunningApplicationTest, ABundleProgramIsFoundWithItsFacts) {
  std::string bundle = apps_.makeBundle("Foo", "com.example.foo", AppTestRoot::Program::kSleeps,
                                        {{"HostBundleName", "Foo Editor"}});
  const auto before = std::chrono::system_clock::now();
  pid_t pid = apps_.launch(bundle);
  auto found = RunningApplication::runningApplicationsWithBundleIdentifier("com.example.foo");
  ASSERT_EQ(found.size(), 1u);
  const auto& application = *found.front();
  EXPECT_EQ(application.pid(), pid);
  EXPECT_EQ(application.bundleIdentifier(), "com.example.foo");
  EXPECT_EQ(application.bundleURL(), bundle);
  EXPECT_EQ(application.localizedName(), "Foo Editor");
  ASSERT_TRUE(application.launchDate());
  const double started = std::chrono::duration<double>(before.time_since_epoch()).count();
  // /proc counts in clock ticks and the boot time in whole seconds.
  EXPECT_NEAR(application.launchDate()->secondsSince1970, started, 2.0);
  EXPECT_FALSE(application.isTerminated());
  Result<ApplicationSerialNumber> serial = application.applicationSerialNumber();
  ASSERT_TRUE(serial);
  EXPECT_EQ((static_cast<std::uint64_t>(serial->high) << 32U) | serial->low,
            static_cast<std::uint64_t>(pid));

  auto all = RunningApplication::allRunningApplications();
  EXPECT_TRUE(
      std::any_of(all.begin(), all.end(), [&](const auto& app) { return app->pid() == pid; }));
  EXPECT_TRUE(
      RunningApplication::runningApplicationsWithBundleIdentifier("com.example.other").empty());
}

TEST_F(RunningApplicationTest, NameFallsBackToTheFolderName) {
  pid_t pid = apps_.launch(apps_.makeBundle("PlainTool", "com.example.plain"));
  std::shared_ptr<RunningApplication> application = RunningApplication::withPid(pid);
  ASSERT_TRUE(application);
  EXPECT_EQ(application->localizedName(), "PlainTool");
  // This test's own process runs from no bundle.
  EXPECT_EQ(RunningApplication::withPid(::getpid()), nullptr);
}

TEST_F(RunningApplicationTest, TerminationIsObservedAndTheAppIsNoLongerFound) {
  pid_t pid = apps_.launch(apps_.makeBundle("Foo", "com.example.foo"));
  auto application = RunningApplication::withPid(pid);
  ASSERT_TRUE(application);
  DispatchSemaphore observed;
  std::atomic<pid_t> observedPid{0};
  application->addTerminationObserver([&](const std::shared_ptr<RunningApplication>& gone) {
    observedPid = gone->pid();
    observed.signal();
  });
  ASSERT_TRUE(application->requestQuit());
  ASSERT_TRUE(observed.waitFor(std::chrono::seconds(10)));
  EXPECT_EQ(observedPid.load(), pid);
  EXPECT_TRUE(application->isTerminated());
  EXPECT_FALSE(application->applicationSerialNumber());
  EXPECT_FALSE(application->forceTerminate());
  EXPECT_TRUE(
      RunningApplication::runningApplicationsWithBundleIdentifier("com.example.foo").empty());
}

TEST_F(RunningApplicationTest, ForceTerminateKillsAProgramThatIgnoresQuit) {
  pid_t pid = apps_.launch(
      apps_.makeBundle("Stubborn", "com.example.stubborn", AppTestRoot::Program::kIgnoresTerm));
  auto application = RunningApplication::withPid(pid);
  ASSERT_TRUE(application);
  ASSERT_TRUE(application->forceTerminate());
  EXPECT_TRUE(eventually([&] { return application->isTerminated(); }));
}

TEST_F(RunningApplicationTest, DesktopFactsComeFromThePlatformState) {
  pid_t pid = apps_.launch(apps_.makeBundle("Foo", "com.example.foo"));
  auto application = RunningApplication::withPid(pid);
  ASSERT_TRUE(application);
  EXPECT_FALSE(application->isActive());
  EXPECT_FALSE(application->quittingWillBeNoisyOrLoseData());
  EXPECT_FALSE(application->isStoppedInApplicationRegistry());
  EXPECT_FALSE(application->isProxied());

  ASSERT_TRUE(RunningApplicationFacts::setForemost("com.example.foo"));
  ASSERT_TRUE(RunningApplicationFacts::setQuittingLosesData("com.example.foo", "unsaved work"));
  ASSERT_TRUE(RunningApplicationFacts::setStopped("com.example.foo", true));
  ASSERT_TRUE(RunningApplicationFacts::setProxied("com.example.foo", true));
  EXPECT_TRUE(application->isActive());
  EXPECT_EQ(application->reasonThatQuittingWillBeNoisyOrLoseData(), "unsaved work");
  EXPECT_TRUE(application->isStoppedInApplicationRegistry());
  EXPECT_TRUE(application->isProxied());

  ASSERT_TRUE(RunningApplicationFacts::setQuittingLosesData("com.example.foo", std::nullopt));
  ASSERT_TRUE(RunningApplicationFacts::setStopped("com.example.foo", false));
  EXPECT_FALSE(application->quittingWillBeNoisyOrLoseData());
  EXPECT_FALSE(application->isStoppedInApplicationRegistry());
  EXPECT_TRUE(application->isProxied());
}

// The service blocks SIGTERM in its threads to wait for it; what it starts
// must still obey it.
TEST_F(RunningApplicationTest, ALaunchedProgramDoesNotInheritBlockedSignals) {
  std::string bundle = apps_.makeBundle("Foo", "com.example.foo");
  sigset_t term;
  sigset_t old;
  ::sigemptyset(&term);
  ::sigaddset(&term, SIGTERM);
  ASSERT_EQ(::pthread_sigmask(SIG_BLOCK, &term, &old), 0);
  pid_t pid = apps_.launch(bundle);
  ::pthread_sigmask(SIG_SETMASK, &old, nullptr);
  auto application = RunningApplication::withPid(pid);
  ASSERT_TRUE(application);
  ASSERT_TRUE(application->requestQuit());
  EXPECT_TRUE(eventually([&] { return application->isTerminated(); }));
}

TEST_F(RunningApplicationTest, LaunchOfABundleWithoutProgramFails) {
  std::string bundle = apps_.applications() + "/Empty.app";
  std::filesystem::create_directories(bundle);
  Result<pid_t> launched = RunningApplication::launchBundle(bundle);
  ASSERT_FALSE(launched);
  EXPECT_FALSE(RunningApplication::launchBundle(apps_.applications() + "/Missing.app"));
}

}  // namespace
}  // namespace larder
