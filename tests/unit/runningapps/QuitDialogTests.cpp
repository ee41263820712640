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
// A gated presenter takes a dialog in only once the gate opens: until then
// the dialog is on its way and a dismissal finds nothing.
class TestPresenter final : public VendDialogPresenter {
 public:
  TestPresenter(std::optional<std::int64_t> exitCode, bool gated)
      : exitCode_(exitCode), gateOpen_(!gated) {}

  void present(const VendDialog& dialog, Reply reply) override {
    MutexLock lock(mutex_);
    presented_.push_back(dialog);
    changed_.notify_all();
    changed_.wait(lock, [this]() REQUIRES(mutex_) { return gateOpen_; });
    if (exitCode_) {
      lock.unlock();
      reply(VendDialogAnswer{*exitCode_, {}});
      return;
    }
    held_.emplace(dialog.identifier(), std::move(reply));
  }

  void dismiss(std::string_view identifier, std::int64_t exitCode) override {
    Reply reply;
    {
      MutexLock lock(mutex_);
      dismissals_.push_back(exitCode);
      changed_.notify_all();
      if (auto found = held_.find(std::string(identifier)); found != held_.end()) {
        reply = std::move(found->second);
        held_.erase(found);
      }
    }
    if (reply) reply(VendDialogAnswer{exitCode, {}});
  }

  // Opens the gate and cancels what is held, so that no run stays blocked.
  void releaseAll() {
    std::map<std::string, Reply> held;
    {
      MutexLock lock(mutex_);
      gateOpen_ = true;
      changed_.notify_all();
      held.swap(held_);
    }
    for (auto& entry : held) entry.second(VendDialogAnswer{VendDialogButton::kCancel, {}});
  }
  bool waitFor(std::size_t presented, std::size_t dismissals = 0) {
    MutexLock lock(mutex_);
    return changed_.wait_for(lock, 10s, [&]() REQUIRES(mutex_) {
      return presented_.size() >= presented && dismissals_.size() >= dismissals;
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
  EXPECT_EQ(LedgerLocalizedFormat("%@ uses %@.", {"A%@", "B"}), "A%@ uses B.");
  EXPECT_EQ(LedgerLocalizedFormat("%@ uses %@.", {"A"}), "A uses .");
  EXPECT_EQ(LedgerLocalizedFormat("100% of %@", {"it", "more"}), "100% of it");
}

TEST_F(QuitDialogTest, TheQuitDialogNamesTheAppsAndOffersSkipOnlyWhenAllowed) {
  const std::vector<SysupQuaymartUpdate> osUpdates{
      SysupQuaymartUpdate({.productKey = "A", .applicationIdentifiersToClose = {"x.other"}}),
      SysupQuaymartUpdate({.productKey = "B", .applicationIdentifiersToClose = {"x.atlas"}})};
  const auto atlas = app("Atlas", "/Applications/Atlas.app", "x.atlas");
  const auto mustQuit = [](const std::string& name) {
    return name + " must quit before it can be updated. Changes you haven't saved may be lost.";
  };
  const struct {
    const char* name;
    std::vector<std::shared_ptr<RunningApplication>> apps;
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
       mustQuit("Atlas"),
       "Skip Atlas"},
      {"no name: the bundle's file name",
       {app("", "/Applications/Sea Charts.app/")},
       true,
       osUpdates,
       "Quit Sea Charts to Update It?",
       mustQuit("Sea Charts"),
       "Skip Sea Charts"},
      {"needed closed by an OS update",
       {atlas},
       true,
       osUpdates,
       "Quit Atlas to Update It?",
       mustQuit("Atlas"),
       "Skip System Updates"},
      {"no skip",
       {atlas},
       false,
       osUpdates,
       "Quit Atlas to Update It?",
       mustQuit("Atlas"),
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
  }
}

TEST_F(QuitDialogTest, TheCannotUpdateDialogNamesTheAppAndItsHosts) {
  const PlistDictionary atlas{
      {"containingPath", apps_.makeBundle("Atlas", "x.atlas", AppTestRoot::Program::kSleeps,
                                          {{"HostBundleDisplayName", "Atlas Maps"}})}};
  const PlistDictionary charts{{"containingPath", "/Applications/Sea Charts.app"}};
  const std::string inUse = " can't be updated right now because ";
  const struct {
    PlugInHostApps hosts;
    std::string title, explanation;
  } cases[] = {
      {{{"Mail", atlas}},
       "Atlas Maps Can't Be Updated",
       "Atlas Maps" + inUse +
           "one of its extensions is in use by Mail. Quit that application and "
           "try again."},
      {{{"Mail", atlas}, {"Calendar", atlas}},
       "Atlas Maps Can't Be Updated",
       "Atlas Maps" + inUse +
           "its extensions are in use by these applications: "
           "<br><br><ul><li>Calendar</li><li>Mail</li></ul>"},
      // No bundle on disk: the name is its file name.
      {{{"Mail", charts}},
       "Sea Charts Can't Be Updated",
       "Sea Charts" + inUse +
           "one of its extensions is in use by Mail. Quit that application and "
           "try again."},
  };
  for (const auto& c : cases) {
    auto operation =
        VendCancelUpdateWithPlugInsDialogOperation::operationWithDictionary(c.hosts, {});
    ASSERT_TRUE(operation);
    const VendDialog& dialog = operation->dialog();
    EXPECT_EQ(dialog.message(), c.title);
    EXPECT_EQ(dialog.explanation(), c.explanation);
    EXPECT_EQ(titleOf(dialog.okButton()), "OK");
    EXPECT_FALSE(dialog.cancelButton() || dialog.otherButton());
  }
  EXPECT_FALSE(VendCancelUpdateWithPlugInsDialogOperation::operationWithDictionary({}, {}));
}

// Each button is its answer. Finished from another thread, as a termination
// notice arrives, the dialog ends with no answer: with the dialog up, or
// still on its way to the presenter, where the first dismissal finds
// nothing and a later one takes it down.
TEST_F(QuitDialogTest, TheQuitPromptAnswersWithTheButtonOrWithNoneWhenFinished) {
  const struct {
    const char* name;
    std::optional<std::int64_t> exitCode;
    bool gated;
    Answer answer;
    std::size_t dismissals;
  } cases[] = {{"OK", VendDialogButton::kOK, false, Answer::kQuit, 0},
               {"cancel", VendDialogButton::kCancel, false, Answer::kCancel, 0},
               {"other", VendDialogButton::kOther, false, Answer::kSkip, 0},
               {"finished while up", std::nullopt, false, Answer::kNone, 1},
               {"finished on its way", std::nullopt, true, Answer::kNone, 2}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    auto presenter = install(c.exitCode, c.gated);
    QuitAppDialogPrompt prompt({});
    // With no dialog up there is nothing to finish, now or in the next run.
    prompt.forceFinish();
    bool forced = !c.dismissals;
    auto answer = std::async(std::launch::async, [&] {
      return prompt.run({app("Atlas", "/Applications/Atlas.app")}, true, {}, &forced);
    });
    const std::shared_ptr<void> release(nullptr, [&](void*) { presenter->releaseAll(); });
    ASSERT_TRUE(presenter->waitFor(1));
    std::future<void> finishing;
    if (c.dismissals) finishing = std::async(std::launch::async, [&] { prompt.forceFinish(); });
    if (c.gated) {
      ASSERT_TRUE(presenter->waitFor(1, 1));
      presenter->releaseAll();
    }
    ASSERT_EQ(answer.wait_for(10s), std::future_status::ready);
    EXPECT_EQ(answer.get(), c.answer);
    EXPECT_EQ(forced, c.dismissals > 0);
    EXPECT_EQ(presenter->presented().at(0).message(), "Quit Atlas to Update It?");
    const std::vector<std::int64_t> dismissals = presenter->dismissals();
    EXPECT_EQ(dismissals.empty(), c.dismissals == 0);
    EXPECT_GE(dismissals.size(), c.dismissals);
    for (std::int64_t code : dismissals) EXPECT_EQ(code, -1) << "no button of the dialog's";
  }
}

// The default prompt is the quit dialog: OK quits the apps; an app that
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
    const std::shared_ptr<void> release(nullptr, [&](void*) { presenter->releaseAll(); });
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
