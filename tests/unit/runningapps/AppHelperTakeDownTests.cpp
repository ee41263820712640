#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <fstream>
#include <sstream>

#include "platform/system/Mutex.h"
#include "running-apps/AppHelper.h"
#include "running-apps/PlugInHost.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/LedgerTraceMessage.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PreferenceStore.h"
#include "tests/unit/runningapps/AppTestSupport.h"

namespace larder {
namespace {

using namespace std::chrono_literals;
using testing::AppTestRoot;
using testing::eventually;
using testing::processIsGone;
using Answer = AppHelperQuitPrompt::Answer;

// Answers each run with the next of its answers (cancel when they run
// out); when told, it first makes an application quit by itself and waits
// for the helper to take it down.
class FakePrompt : public AppHelperQuitPrompt {
 public:
  explicit FakePrompt(std::vector<Answer> answers) : answers_(std::move(answers)) {}

  void quitWhileShowing(pid_t pid) { quitWhileShowing_ = pid; }

  Answer run(const std::vector<std::shared_ptr<RunningApplication>>& appsToQuit,
             bool allowUserToSkip, const std::vector<SysupQuaymartUpdate>& /*osUpdates*/,
             bool* didForceFinish) override {
    MutexLock lock(mutex_);
    std::vector<pid_t> shown;
    for (const auto& application : appsToQuit) shown.push_back(application->pid());
    shownPids_.push_back(shown);
    allowedSkip_ = allowUserToSkip;
    if (quitWhileShowing_ > 0) {
      ::kill(quitWhileShowing_, SIGTERM);
      quitWhileShowing_ = 0;
      forced_.wait_for(lock, 10s, [this]() REQUIRES(mutex_) { return forceFinishCalls_ > 0; });
      *didForceFinish = forceFinishCalls_ > 0;
      return Answer::kNone;
    }
    std::size_t run = shownPids_.size() - 1;
    return run < answers_.size() ? answers_[run] : Answer::kCancel;
  }

  void forceFinish() override {
    MutexLock lock(mutex_);
    ++forceFinishCalls_;
    forced_.notify_all();
  }

  std::vector<std::vector<pid_t>> shownPids() {
    MutexLock lock(mutex_);
    return shownPids_;
  }
  int forceFinishCalls() {
    MutexLock lock(mutex_);
    return forceFinishCalls_;
  }
  bool allowedSkip() {
    MutexLock lock(mutex_);
    return allowedSkip_;
  }

 private:
  Mutex mutex_;
  ConditionVariable forced_;
  std::vector<Answer> answers_;
  pid_t quitWhileShowing_ = 0;
  std::vector<std::vector<pid_t>> shownPids_ GUARDED_BY(mutex_);
  int forceFinishCalls_ GUARDED_BY(mutex_) = 0;
  bool allowedSkip_ GUARDED_BY(mutex_) = false;
};

class AppHelperTakeDownTest : public ::testing::Test {
 protected:
  std::shared_ptr<AppHelper> helperFor(std::vector<std::string> identifiers,
                                       std::chrono::milliseconds quitTimeout = 10s) {
    auto helper = AppHelper::initWithBundleIdentifiers(std::move(identifiers), VendStoreClient());
    helper->setTiming({10ms, quitTimeout, quitTimeout});
    return helper;
  }

  std::string traceLog() {
    LedgerTraceMessageWaitUntilWritten();
    std::ifstream in(LedgerTraceMessageLogPath());
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
  }

  static bool running(const std::string& identifier) {
    return !RunningApplication::runningApplicationsWithBundleIdentifier(identifier).empty();
  }

  AppTestRoot apps_;
};

TEST_F(AppHelperTakeDownTest, QuitWithoutPromptIsObeyedAndTheAppComesBack) {
  std::string bundle = apps_.makeBundle("Foo", "test.apphelper.foo");
  pid_t pid = apps_.launch(bundle);
  auto helper = helperFor({"test.apphelper.foo"});

  EXPECT_TRUE(helper->ensureAppsAreNotRunningWithPromptToConfirm(false));
  EXPECT_TRUE(processIsGone(pid));
  EXPECT_EQ(helper->terminatedAppBundleURLs(), std::vector<std::string>{bundle});
  EXPECT_TRUE(helper->immortalRunningApplications().empty());
  EXPECT_TRUE(helper->needsRelaunch());
  // Its plug-ins are held until it comes back.
  PlistDictionary holds = PlugInHost::holds();
  ASSERT_EQ(holds.size(), 1u);
  EXPECT_EQ(*holds.begin()->second["bundlePath"].string(), bundle);
  std::string trace = traceLog();
  EXPECT_NE(trace.find("com.orvane.Quaymart.autoupdate.terminate_app"), std::string::npos) << trace;
  EXPECT_NE(trace.find("\"bundle_id\":\"Third Party App\""), std::string::npos) << trace;
  EXPECT_NE(trace.find("\"terminated_successfully\":true"), std::string::npos) << trace;

  helper->relaunchTerminatedApps();
  std::vector<std::shared_ptr<RunningApplication>> again;
  EXPECT_TRUE(eventually([&] {
    again = RunningApplication::runningApplicationsWithBundleIdentifier("test.apphelper.foo");
    return !again.empty() && AppTestRoot::runsSleepOf(again.front()->pid(), bundle);
  }));
  ASSERT_FALSE(again.empty());
  EXPECT_NE(again.front()->pid(), pid);
  EXPECT_TRUE(PlugInHost::holds().empty());
}

TEST_F(AppHelperTakeDownTest, AnAppThatIgnoresTheQuitIsImmortalAndStopsThePass) {
  pid_t stubborn = apps_.launch(
      apps_.makeBundle("Stubborn", "test.apphelper.stubborn", AppTestRoot::Program::kIgnoresTerm));
  pid_t behind = apps_.launch(apps_.makeBundle("Behind", "test.apphelper.behind"));
  auto helper = helperFor({"test.apphelper.stubborn", "test.apphelper.behind"}, 300ms);

  EXPECT_FALSE(helper->ensureAppsAreNotRunningWithPromptToConfirm(false));
  auto immortal = helper->immortalRunningApplications();
  ASSERT_EQ(immortal.size(), 1u);
  EXPECT_EQ(immortal.front()->pid(), stubborn);
  // Nothing is killed on that account, and the application behind it was
  // not tried in this pass.
  EXPECT_FALSE(processIsGone(stubborn));
  EXPECT_FALSE(processIsGone(behind));
  EXPECT_TRUE(helper->terminatedAppBundleURLs().empty());
  EXPECT_NE(traceLog().find("\"terminated_successfully\":false"), std::string::npos);
}

struct ForceCase {
  const char* name;
  bool preference;
  bool stopped;
  bool proxied;
};

class AppHelperForceTest : public AppHelperTakeDownTest,
                           public ::testing::WithParamInterface<ForceCase> {};

TEST_P(AppHelperForceTest, ForcedTerminationKillsWithoutQuitRequestAndDoesNotRelaunch) {
  const ForceCase& forced = GetParam();
  const std::string identifier = "test.apphelper.forced";
  pid_t pid =
      apps_.launch(apps_.makeBundle("Forced", identifier, AppTestRoot::Program::kIgnoresTerm));
  if (forced.preference) {
    ASSERT_TRUE(
        PreferenceStore::setValue(kDefaultsAlwaysForceTerminateAppsKey, true, kDaemonDefaultsID));
  }
  ASSERT_TRUE(RunningApplicationFacts::setStopped(identifier, forced.stopped));
  ASSERT_TRUE(RunningApplicationFacts::setProxied(identifier, forced.proxied));
  // A quit request would be ignored and time out; only SIGKILL makes this
  // take-down succeed.
  auto helper = helperFor({identifier}, 200ms);

  EXPECT_TRUE(helper->ensureAppsAreNotRunningWithPromptToConfirm(false));
  EXPECT_TRUE(eventually([&] { return processIsGone(pid); }));
  EXPECT_TRUE(helper->terminatedAppBundleURLs().empty());
  EXPECT_FALSE(helper->needsRelaunch());
  EXPECT_TRUE(PlugInHost::holds().empty());
  EXPECT_EQ(traceLog().find("terminate_app"), std::string::npos);
}

INSTANTIATE_TEST_SUITE_P(States, AppHelperForceTest,
                         ::testing::Values(ForceCase{"Preference", true, false, false},
                                           ForceCase{"Stopped", false, true, false},
                                           ForceCase{"Proxied", false, false, true}),
                         [](const auto& info) { return std::string(info.param.name); });

// Cancel, and a prompt that went away without an answer and without an
// application quitting, leave everything as it was.
TEST_F(AppHelperTakeDownTest, CancelLeavesTheAppsRunning) {
  pid_t pid = apps_.launch(apps_.makeBundle("Foo", "test.apphelper.foo"));
  for (Answer answer : {Answer::kCancel, Answer::kNone}) {
    auto prompt = std::make_shared<FakePrompt>(std::vector<Answer>{answer});
    auto helper = helperFor({"test.apphelper.foo"});
    helper->setQuitPrompt(prompt);

    EXPECT_FALSE(helper->ensureAppsAreNotRunningWithPromptToConfirm(true));
    EXPECT_EQ(prompt->shownPids(), (std::vector<std::vector<pid_t>>{{pid}}));
    EXPECT_FALSE(processIsGone(pid));
    EXPECT_FALSE(helper->needsRelaunch());
  }
}

TEST_F(AppHelperTakeDownTest, AppsThatWouldLoseDataAreAskedAboutFirst) {
  pid_t calm = apps_.launch(apps_.makeBundle("Calm", "test.apphelper.calm"));
  pid_t noisy = apps_.launch(apps_.makeBundle("Noisy", "test.apphelper.noisy"));
  ASSERT_TRUE(RunningApplicationFacts::setQuittingLosesData("test.apphelper.noisy", "Recording"));
  auto prompt = std::make_shared<FakePrompt>(std::vector<Answer>{Answer::kCancel});
  auto helper = helperFor({"test.apphelper.calm", "test.apphelper.noisy"});
  helper->setQuitPrompt(prompt);

  EXPECT_FALSE(helper->ensureAppsAreNotRunningWithPromptToConfirm(true));
  EXPECT_EQ(prompt->shownPids(), (std::vector<std::vector<pid_t>>{{noisy, calm}}));
}

// All of this user's applications are asked about and the answer is
// cancel: other applications of the machine's user are never touched.
TEST_F(AppHelperTakeDownTest, AllRunningAppsLeaveOutTheWhiteListWhenTold) {
  pid_t ordinary = apps_.launch(apps_.makeBundle("Ordinary", "test.apphelper.ordinary"));
  pid_t store = apps_.launch(apps_.makeBundle("Store", "com.orvane.quaymart"));
  for (bool ignoreWhitelisted : {true, false}) {
    auto prompt = std::make_shared<FakePrompt>(std::vector<Answer>{Answer::kCancel});
    auto helper =
        AppHelper::initWithAllRunningApplicationsIgnoringWhitelistedApps(ignoreWhitelisted, {});
    helper->setTiming({10ms, 1s, 1s});
    helper->setQuitPrompt(prompt);
    EXPECT_FALSE(helper->ensureAppsAreNotRunningWithPromptToConfirm(true));
    ASSERT_EQ(prompt->shownPids().size(), 1u);
    const std::vector<pid_t> shown = prompt->shownPids().front();
    EXPECT_NE(std::find(shown.begin(), shown.end(), ordinary), shown.end());
    EXPECT_EQ(std::find(shown.begin(), shown.end(), store) != shown.end(), !ignoreWhitelisted);
  }
  EXPECT_FALSE(processIsGone(ordinary));
  EXPECT_FALSE(processIsGone(store));
}

TEST_F(AppHelperTakeDownTest, APromptThatCannotBeShownCountsAsCancel) {
  pid_t pid = apps_.launch(apps_.makeBundle("Foo", "test.apphelper.foo"));
  auto helper = helperFor({"test.apphelper.foo"});

  EXPECT_FALSE(helper->ensureAppsAreNotRunningWithPromptToConfirm(true));
  EXPECT_FALSE(processIsGone(pid));
}

TEST_F(AppHelperTakeDownTest, SkipLeavesTheAppsAndSucceeds) {
  pid_t pid = apps_.launch(apps_.makeBundle("Foo", "test.apphelper.foo"));
  auto prompt = std::make_shared<FakePrompt>(std::vector<Answer>{Answer::kSkip});
  auto helper = helperFor({"test.apphelper.foo"});
  helper->setQuitPrompt(prompt);
  helper->setAllowUserToSkipApps(true);

  EXPECT_TRUE(helper->ensureAppsAreNotRunningWithPromptToConfirm(true));
  EXPECT_TRUE(prompt->allowedSkip());
  EXPECT_EQ(helper->skippedAppBundleIdentifiers(), std::vector<std::string>{"test.apphelper.foo"});
  EXPECT_FALSE(processIsGone(pid));
}

TEST_F(AppHelperTakeDownTest, AnAppQuittingByItselfTakesThePromptDownAndThePassGoesOn) {
  std::string firstBundle = apps_.makeBundle("First", "test.apphelper.first");
  std::string secondBundle = apps_.makeBundle("Second", "test.apphelper.second");
  pid_t first = apps_.launch(firstBundle);
  pid_t second = apps_.launch(secondBundle);
  auto prompt = std::make_shared<FakePrompt>(std::vector<Answer>{});
  prompt->quitWhileShowing(first);
  auto helper = helperFor({"test.apphelper.first", "test.apphelper.second"});
  helper->setQuitPrompt(prompt);

  EXPECT_TRUE(helper->ensureAppsAreNotRunningWithPromptToConfirm(true));
  EXPECT_GE(prompt->forceFinishCalls(), 1);
  EXPECT_EQ(prompt->shownPids().size(), 1u);
  EXPECT_TRUE(processIsGone(second));
  std::vector<std::string> terminated = helper->terminatedAppBundleURLs();
  std::sort(terminated.begin(), terminated.end());
  EXPECT_EQ(terminated, (std::vector<std::string>{firstBundle, secondBundle}));
}

TEST_F(AppHelperTakeDownTest, WithPromptAnAppThatTimedOutIsOfferedAgain) {
  pid_t pid = apps_.launch(
      apps_.makeBundle("Stubborn", "test.apphelper.stubborn", AppTestRoot::Program::kIgnoresTerm));
  auto prompt = std::make_shared<FakePrompt>(std::vector<Answer>{Answer::kQuit, Answer::kCancel});
  auto helper = helperFor({"test.apphelper.stubborn"}, 200ms);
  helper->setQuitPrompt(prompt);

  EXPECT_FALSE(helper->ensureAppsAreNotRunningWithPromptToConfirm(true));
  EXPECT_EQ(prompt->shownPids(), (std::vector<std::vector<pid_t>>{{pid}, {pid}}));
}

TEST_F(AppHelperTakeDownTest, NothingToTerminateSucceedsWithoutAskingAfterThePause) {
  auto prompt = std::make_shared<FakePrompt>(std::vector<Answer>{Answer::kCancel});
  auto helper = AppHelper::initWithRunningApplications({}, VendStoreClient());
  helper->setTiming({200ms, 1s, 1s});
  helper->setQuitPrompt(prompt);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_TRUE(helper->ensureAppsAreNotRunningWithPromptToConfirm(true));
  EXPECT_GE(std::chrono::steady_clock::now() - start, 200ms);
  EXPECT_TRUE(prompt->shownPids().empty());
  EXPECT_FALSE(helper->needsRelaunch());
}

TEST_F(AppHelperTakeDownTest, TheCompanionsOfTheEditorGoWithIt) {
  pid_t editor = apps_.launch(apps_.makeBundle("Reelcut", "com.orvane.ReelcutApp"));
  pid_t companion = apps_.launch(apps_.makeBundle("Reelcut7", "com.orvane.Reelcut7"));
  auto helper = helperFor({"com.orvane.ReelcutApp"});
  EXPECT_TRUE(helper->ensureAppsAreNotRunningWithPromptToConfirm(false));
  EXPECT_TRUE(processIsGone(editor));
  EXPECT_TRUE(processIsGone(companion));
}

TEST_F(AppHelperTakeDownTest, ABusyPlugInAfterTheQuitKeepsTheAppBlocked) {
  std::string bundle = apps_.makeBundle("Foo", "test.apphelper.foo");
  std::string plugIn =
      apps_.makeBundle("Ext", "test.apphelper.foo.ext", AppTestRoot::Program::kSleeps, {}, bundle);
  pid_t pid = apps_.launch(bundle);
  ASSERT_TRUE(PlugInHost::addBusyPlugIn({{"containingIdentifier", "test.apphelper.foo"},
                                         {"containingPath", bundle},
                                         {"plugInIdentifier", "test.apphelper.foo.ext"},
                                         {"plugInPath", plugIn},
                                         {"hostIdentifier", "test.apphelper.host"},
                                         {"hostPath", apps_.applications() + "/Host.app"},
                                         {"service-pid", 4242}}));
  auto helper = helperFor({"test.apphelper.foo"});

  EXPECT_FALSE(helper->ensureAppsAreNotRunningWithPromptToConfirm(false));
  EXPECT_TRUE(processIsGone(pid));
  auto immortal = helper->immortalRunningApplications();
  ASSERT_EQ(immortal.size(), 1u);
  EXPECT_EQ(immortal.front()->pid(), pid);
  EXPECT_TRUE(PlugInHost::holds().empty());
}

TEST_F(AppHelperTakeDownTest, ABusyFileBrowserExtensionDoesNotBlock) {
  std::string bundle = apps_.makeBundle("Foo", "test.apphelper.foo");
  std::string plugIn = apps_.makeBundle(
      "Sync", "test.apphelper.foo.sync", AppTestRoot::Program::kSleeps,
      {{"HostExtension",
        PlistDictionary{{"HostExtensionPointIdentifier", "com.orvane.FilewalkerSync"}}}},
      bundle);
  pid_t pid = apps_.launch(bundle);
  ASSERT_TRUE(PlugInHost::addBusyPlugIn({{"containingIdentifier", "test.apphelper.foo"},
                                         {"containingPath", bundle},
                                         {"plugInPath", plugIn},
                                         {"service-pid", 4242}}));
  auto helper = helperFor({"test.apphelper.foo"});

  EXPECT_TRUE(helper->ensureAppsAreNotRunningWithPromptToConfirm(false));
  EXPECT_TRUE(processIsGone(pid));
  EXPECT_TRUE(helper->immortalRunningApplications().empty());
}

TEST_F(AppHelperTakeDownTest, TheQuitWaitIsLongerInADimWake) {
  auto helper = AppHelper::initWithBundleIdentifier("test.apphelper.foo", VendStoreClient());
  EXPECT_EQ(helper->terminationWaitTimeout(), 20s);
  ASSERT_TRUE(
      PlatformStateFile::named("system-state.plist").updateDictionary([](PlistDictionary& state) {
        state["dimWake"] = true;
      }));
  EXPECT_EQ(helper->terminationWaitTimeout(), 60s);
}

}  // namespace
}  // namespace larder
