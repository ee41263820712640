// The quit dialog and the cannot-update dialog: what they say, how the
// quit dialog's answers reach a take-down, and how it is taken down when an
// application quits by itself.
#include <gtest/gtest.h>

#include <future>
#include <map>

#include "running-apps/AppHelper.h"
#include "running-apps/QuitAppDialogPrompt.h"
#include "running-apps/VendCancelUpdateWithPlugInsDialogOperation.h"
#include "running-apps/VendQuitAppDialogOperation.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/dialogs/VendDialogPresenter.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "tests/unit/runningapps/AppTestSupport.h"

namespace larder {
namespace {

using namespace std::chrono_literals;
using testing::AppTestRoot;
using Answer = AppHelperQuitPrompt::Answer;
using Apps = std::vector<std::shared_ptr<RunningApplication>>;

std::shared_ptr<RunningApplication> app(std::optional<std::string> name, std::string url,
                                        std::optional<std::string> identifier = {}) {
  return RunningApplication::make({.bundleIdentifier = std::move(identifier),
                                   .bundleURL = std::move(url),
                                   .localizedName = std::move(name)});
}

std::optional<std::string> titleOf(const std::optional<VendDialogButton>& button) {
  return button ? std::optional(button->title) : std::nullopt;
}

// Answers each dialog with `exitCode`, or holds it until it is dismissed.
// With `gate` closed, a dialog is taken in only once the gate opens: it is
// still on its way while the test acts.
class TestPresenter final : public VendDialogPresenter {
 public:
  explicit TestPresenter(std::optional<std::int64_t> exitCode, bool gated = false)
      : exitCode_(exitCode), gateOpen_(!gated) {}

  void present(const VendDialog& dialog, Reply reply) override {
    MutexLock lock(mutex_);
    presented_.push_back(dialog);
    changed_.notify_all();
    changed_.wait(lock, [this]() REQUIRES(mutex_) { return gateOpen_; });
    if (!exitCode_) {
      held_.emplace(dialog.identifier(), std::move(reply));
      return;
    }
    lock.unlock();
    reply(VendDialogAnswer{*exitCode_, {}});
  }

  void dismiss(std::string_view identifier, std::int64_t exitCode) override {
    MutexLock lock(mutex_);
    dismissals_.push_back(exitCode);
    changed_.notify_all();
    auto found = held_.find(std::string(identifier));
    if (found == held_.end()) return;
    Reply reply = std::move(found->second);
    held_.erase(found);
    lock.unlock();
    reply(VendDialogAnswer{exitCode, {}});
  }

  void openGate() {
    MutexLock lock(mutex_);
    gateOpen_ = true;
    changed_.notify_all();
  }
  // Answers whatever it still holds with cancel, so that a failed test
  // does not leave a run blocked.
  void releaseAll() {
    openGate();
    std::map<std::string, Reply> held;
    {
      MutexLock lock(mutex_);
      held.swap(held_);
    }
    for (auto& [identifier, reply] : held) reply(VendDialogAnswer{VendDialogButton::kCancel, {}});
  }
  struct ReleaseAtExit {
    TestPresenter& presenter;
    ~ReleaseAtExit() { presenter.releaseAll(); }
  };
  // Waits for `count` dialogs presented and `dismissals` dismissals.
  bool waitFor(std::size_t count, std::size_t dismissals = 0) {
    MutexLock lock(mutex_);
    return changed_.wait_for(lock, 10s, [&]() REQUIRES(mutex_) {
      return presented_.size() >= count && dismissals_.size() >= dismissals;
    });
  }
  std::vector<VendDialog> presented() {
    MutexLock lock(mutex_);
    return presented_;
  }
  std::vector<std::int64_t> dismissals() {
    MutexLock lock(mutex_);
    return dismissals_;
  }

 private:
  const std::optional<std::int64_t> exitCode_;
  Mutex mutex_;
  ConditionVariable changed_;
  bool gateOpen_ GUARDED_BY(mutex_);
  std::vector<VendDialog> presented_ GUARDED_BY(mutex_);
  std::map<std::string, Reply> held_ GUARDED_BY(mutex_);
  std::vector<std::int64_t> dismissals_ GUARDED_BY(mutex_);
};

class QuitDialogTest : public ::testing::Test {
 protected:
  void SetUp() override { VendRuntime::setShared(runtime_); }
  // The next user makes a shared runtime of its own environment.
  void TearDown() override { VendRuntime::setShared(nullptr); }

  std::shared_ptr<TestPresenter> install(std::optional<std::int64_t> exitCode, bool gated = false) {
    auto presenter = std::make_shared<TestPresenter>(exitCode, gated);
    runtime_->setDialogPresenter(presenter);
    return presenter;
  }

  AppTestRoot apps_;
  std::shared_ptr<VendRuntime> runtime_ =
      std::make_shared<VendRuntime>(VendRuntimeConfiguration::fromEnvironment());
};

TEST(LocalizedFormat, FillsPlaceholdersInOrderAndOnlyOnce) {
  EXPECT_EQ(LedgerFormatLocalizedString("%@ uses %@.", {"A%@", "B"}), "A%@ uses B.");
  EXPECT_EQ(LedgerFormatLocalizedString("%@ uses %@.", {"A"}), "A uses .");
  EXPECT_EQ(LedgerFormatLocalizedString("100% of %@", {"it", "more"}), "100% of it");
}

TEST_F(QuitDialogTest, TheQuitDialogNamesTheAppsAndOffersSkipOnlyWhenAllowed) {
  const std::vector<SysupQuaymartUpdate> osUpdates{
      SysupQuaymartUpdate({.productKey = "A", .applicationIdentifiersToClose = {"x.other"}}),
      SysupQuaymartUpdate({.productKey = "B", .applicationIdentifiersToClose = {"x.atlas"}})};
  const auto atlas = app("Atlas", "/Applications/Atlas.app", "x.atlas");
  const struct {
    const char* name;
    Apps apps;
    bool allowSkip;
    std::optional<std::vector<SysupQuaymartUpdate>> osUpdates;
    std::string title, explanation;
    std::optional<std::string> skip;
  } cases[] = {
      {"named",
       {atlas},
       true,
       std::nullopt,
       "Quit Atlas to Update It?",
       "Atlas must quit before it can be updated. Changes you haven't saved may be lost.",
       "Skip Atlas"},
      {"no name: the bundle's file name",
       {app("", "/Applications/Sea Charts.app/")},
       true,
       osUpdates,
       "Quit Sea Charts to Update It?",
       "Sea Charts must quit before it can be updated. Changes you haven't saved may be lost.",
       "Skip Sea Charts"},
      {"needed closed by an OS update",
       {atlas},
       true,
       osUpdates,
       "Quit Atlas to Update It?",
       "Atlas must quit before it can be updated. Changes you haven't saved may be lost.",
       "Skip System Updates"},
      {"no skip",
       {atlas},
       false,
       osUpdates,
       "Quit Atlas to Update It?",
       "Atlas must quit before it can be updated. Changes you haven't saved may be lost.",
       std::nullopt},
      {"two",
       {atlas, app("Notes", "/Applications/Notes.app", "x.notes")},
       true,
       osUpdates,
       "Quit Applications to Update Them?",
       "Changes you haven't saved may be lost. These applications must quit before they can be "
       "updated:<li>Atlas<li>Notes",
       "Skip These Updates"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    auto operation =
        VendQuitAppDialogOperation::operationWithAppsToQuit(c.apps, c.allowSkip, c.osUpdates, {});
    const VendDialog& dialog = operation->dialog();
    EXPECT_EQ(dialog.message(), c.title);
    EXPECT_EQ(dialog.explanation(), c.explanation);
    EXPECT_EQ(titleOf(dialog.okButton()), "Quit and Update");
    EXPECT_EQ(titleOf(dialog.cancelButton()), "Cancel");
    EXPECT_EQ(titleOf(dialog.otherButton()), c.skip);
    EXPECT_FALSE(operation->didForceFinish());
  }
}

TEST_F(QuitDialogTest, TheCannotUpdateDialogNamesTheAppAndItsHosts) {
  const std::string atlas = apps_.makeBundle("Atlas", "x.atlas", AppTestRoot::Program::kSleeps,
                                             {{"HostBundleDisplayName", "Atlas Maps"}});
  const PlistDictionary plugIn{{"containingPath", atlas}, {"hostPath", "/Applications/Mail.app"}};
  const struct {
    const char* name;
    PlugInHostApps hosts;
    std::string title, explanation;
  } cases[] = {
      {"one host",
       {{"Mail", plugIn}},
       "Atlas Maps Can't Be Updated",
       "Atlas Maps can't be updated right now because one of its extensions is in use by Mail. "
       "Quit that application and try again."},
      {"two hosts, in name order",
       {{"Mail", plugIn}, {"Calendar", plugIn}},
       "Atlas Maps Can't Be Updated",
       "Atlas Maps can't be updated right now because its extensions are in use by these "
       "applications: <br><br><ul><li>Calendar</li><li>Mail</li></ul>"},
      {"no bundle on disk: its file name",
       {{"Mail", {{"containingPath", "/Applications/Sea Charts.app"}}}},
       "Sea Charts Can't Be Updated",
       "Sea Charts can't be updated right now because one of its extensions is in use by Mail. "
       "Quit that application and try again."},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    auto operation =
        VendCancelUpdateWithPlugInsDialogOperation::operationWithDictionary(c.hosts, {});
    ASSERT_TRUE(operation);
    const VendDialog& dialog = operation->dialog();
    EXPECT_EQ(dialog.message(), c.title);
    EXPECT_EQ(dialog.explanation(), c.explanation);
    EXPECT_EQ(titleOf(dialog.okButton()), "OK");
    EXPECT_FALSE(dialog.cancelButton());
    EXPECT_FALSE(dialog.otherButton());
  }
  EXPECT_FALSE(VendCancelUpdateWithPlugInsDialogOperation::operationWithDictionary({}, {}));
}

TEST_F(QuitDialogTest, EachButtonOfTheQuitDialogIsItsAnswer) {
  const std::pair<std::int64_t, Answer> cases[] = {{VendDialogButton::kOK, Answer::kQuit},
                                                   {VendDialogButton::kCancel, Answer::kCancel},
                                                   {VendDialogButton::kOther, Answer::kSkip}};
  for (const auto& [exitCode, expected] : cases) {
    auto presenter = install(exitCode);
    QuitAppDialogPrompt prompt({});
    // With no dialog up, a take-down has nothing to finish, now or later.
    prompt.forceFinish();
    bool forced = true;
    EXPECT_EQ(prompt.run({app("Atlas", "/Applications/Atlas.app")}, true, {}, &forced), expected);
    EXPECT_FALSE(forced);
    ASSERT_EQ(presenter->presented().size(), 1u);
    EXPECT_EQ(presenter->presented()[0].message(), "Quit Atlas to Update It?");
    EXPECT_TRUE(presenter->dismissals().empty());
  }
}

// From another thread, as a termination notice arrives: once with the
// dialog up, once while it is still on its way to the presenter, where the
// first dismissal finds nothing and a later one takes it down.
TEST_F(QuitDialogTest, ForceFinishTakesTheDialogDownWithNoAnswer) {
  for (bool onItsWay : {false, true}) {
    SCOPED_TRACE(onItsWay ? "on its way" : "up");
    auto presenter = install(std::nullopt, onItsWay);
    QuitAppDialogPrompt prompt({});
    bool forced = false;
    auto answer = std::async(std::launch::async, [&] {
      return prompt.run({app("Atlas", "/Applications/Atlas.app")}, true, {}, &forced);
    });
    const TestPresenter::ReleaseAtExit release{*presenter};
    ASSERT_TRUE(presenter->waitFor(1));
    auto finishing = std::async(std::launch::async, [&] { prompt.forceFinish(); });
    if (onItsWay) {
      ASSERT_TRUE(presenter->waitFor(1, 1));
      presenter->openGate();
    }
    ASSERT_EQ(answer.wait_for(10s), std::future_status::ready);
    EXPECT_EQ(answer.get(), Answer::kNone);
    EXPECT_TRUE(forced);
    ASSERT_EQ(finishing.wait_for(10s), std::future_status::ready);
    const std::vector<std::int64_t> dismissals = presenter->dismissals();
    ASSERT_GE(dismissals.size(), onItsWay ? 2u : 1u);
    for (std::int64_t code : dismissals) EXPECT_EQ(code, -1) << "no button of the dialog's";
  }
}

// The default prompt is the quit dialog: OK quits the app; an app that
// quits by itself while the dialog is up takes it down, and the rest go.
TEST_F(QuitDialogTest, APromptedTakeDownAsksWithTheQuitDialog) {
  for (bool quitsByItself : {false, true}) {
    SCOPED_TRACE(quitsByItself ? "an app quits by itself" : "OK");
    const std::string tag = quitsByItself ? "Gone" : "Ok";
    const pid_t first = apps_.launch(apps_.makeBundle("First" + tag, "x.first." + tag));
    const pid_t second = apps_.launch(apps_.makeBundle("Second" + tag, "x.second." + tag));
    auto presenter = install(quitsByItself ? std::nullopt : std::optional<std::int64_t>(1));
    auto helper = AppHelper::initWithBundleIdentifiers({"x.first." + tag, "x.second." + tag}, {});
    helper->setTiming({10ms, 10s, 10s});
    auto done = std::async(std::launch::async, [&] {
      return helper->ensureAppsAreNotRunningWithPromptToConfirm(true);
    });
    const TestPresenter::ReleaseAtExit release{*presenter};
    ASSERT_TRUE(presenter->waitFor(1));
    if (quitsByItself) {
      ASSERT_EQ(::kill(first, SIGTERM), 0);
    }
    ASSERT_EQ(done.wait_for(20s), std::future_status::ready);
    EXPECT_TRUE(done.get());
    EXPECT_TRUE(testing::processIsGone(first));
    EXPECT_TRUE(testing::processIsGone(second));
    EXPECT_EQ(presenter->presented().size(), 1u);
    EXPECT_EQ(presenter->presented()[0].message(), "Quit Applications to Update Them?");
    EXPECT_EQ(presenter->dismissals().empty(), !quitsByItself);
  }
}

}  // namespace
}  // namespace larder
