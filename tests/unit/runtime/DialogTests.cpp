// Dialogs of the store runtime: the dialog record, the UI service's
// promise of exactly one answer, and the operation that waits for one.
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <future>
#include <map>
#include <mutex>
#include <set>
#include <stdexcept>
#include <thread>
#include <vector>

#include "store-runtime/dialogs/VendCancellingDialogPresenter.h"
#include "store-runtime/dialogs/VendDialog.h"
#include "store-runtime/dialogs/VendDialogPresenter.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendDialogOperation.h"
#include "store-runtime/services/VendUIService.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

const VendStoreClient kClient = VendStoreClient::initWithStoreClientType(0);

// A presenter whose behaviour each test chooses. Dialogs it holds can be
// answered or dismissed later; it records everything it was given.
class ScriptedPresenter final : public VendDialogPresenter {
 public:
  enum class Behaviour { kAnswer, kAnswerTwice, kHold, kDropUnanswered, kThrow };

  explicit ScriptedPresenter(Behaviour behaviour, std::int64_t exitCode = 1,
                             PlistDictionary values = {})
      : behaviour_(behaviour), exitCode_(exitCode), values_(std::move(values)) {}

  void present(const VendDialog& dialog, Reply reply) override {
    {
      std::lock_guard lock(mutex_);
      presented_.push_back(dialog);
      // Held before anyone hears of the dialog, so a dismissal finds it.
      if (behaviour_ == Behaviour::kHold) held_.emplace(dialog.identifier(), std::move(reply));
    }
    presentedChanged_.notify_all();
    switch (behaviour_) {
      case Behaviour::kAnswer:
        reply(VendDialogAnswer{exitCode_, values_});
        return;
      case Behaviour::kAnswerTwice:
        reply(VendDialogAnswer{exitCode_, values_});
        reply(VendDialogAnswer{exitCode_ + 1, {}});
        return;
      case Behaviour::kHold:
      case Behaviour::kDropUnanswered:
        return;
      case Behaviour::kThrow:
        throw std::runtime_error("no screen");
    }
  }

  void dismiss(std::string_view dialogIdentifier, std::int64_t exitCode) override {
    Reply reply;
    {
      std::lock_guard lock(mutex_);
      dismissals_.emplace_back(std::string(dialogIdentifier), exitCode);
      auto found = held_.find(std::string(dialogIdentifier));
      if (found == held_.end()) return;
      reply = std::move(found->second);
      held_.erase(found);
    }
    reply(VendDialogAnswer{exitCode, {}});
  }

  // Waits until `count` dialogs have been presented.
  bool waitForPresented(std::size_t count, std::chrono::milliseconds timeout = 5s) {
    std::unique_lock lock(mutex_);
    return presentedChanged_.wait_for(lock, timeout, [&] { return presented_.size() >= count; });
  }
  std::vector<VendDialog> presented() {
    std::lock_guard lock(mutex_);
    return presented_;
  }
  std::vector<std::pair<std::string, std::int64_t>> dismissals() {
    std::lock_guard lock(mutex_);
    return dismissals_;
  }

 private:
  Behaviour behaviour_;
  std::int64_t exitCode_;
  PlistDictionary values_;
  std::mutex mutex_;
  std::condition_variable presentedChanged_;
  std::vector<VendDialog> presented_;
  std::map<std::string, Reply> held_;
  std::vector<std::pair<std::string, std::int64_t>> dismissals_;
};

// Installs a runtime of the test's own as the shared one, so that
// operations, whose services come from the shared runtime, reach the
// test's presenter.
class DialogTest : public ::testing::Test {
 protected:
  void SetUp() override {
    directory_ = fs::temp_directory_path() /
                 ("larder-dialog-test-" + std::to_string(::getpid()) + "-" +
                  ::testing::UnitTest::GetInstance()->current_test_info()->name());
    fs::create_directories(directory_);
    VendRuntimeConfiguration configuration;
    configuration.stateDirectory = (directory_ / "state").string();
    configuration.downloadsDirectory = (directory_ / "downloads").string();
    runtime_ = std::make_shared<VendRuntime>(configuration);
    VendRuntime::setShared(runtime_);
  }

  void TearDown() override {
    // The next user makes a shared runtime from the environment again.
    VendRuntime::setShared(nullptr);
    std::error_code ignored;
    fs::remove_all(directory_, ignored);
  }

  std::shared_ptr<ScriptedPresenter> install(ScriptedPresenter::Behaviour behaviour,
                                             std::int64_t exitCode = 1) {
    auto presenter = std::make_shared<ScriptedPresenter>(behaviour, exitCode);
    runtime_->setDialogPresenter(presenter);
    return presenter;
  }

  static VendDialog threeButtonDialog() {
    return VendDialog::dialogWithDictionary({{"message", "Quit Foo?"},
                                             {"explanation", "Foo must quit to be updated."},
                                             {"okButtonString", "Quit"},
                                             {"cancelButtonString", "Not Now"},
                                             {"otherButtonString", "Skip"}});
  }

  std::shared_ptr<VendRuntime> runtime_;

 private:
  fs::path directory_;
};

// The record.

TEST(VendDialogRecord, TakesItsTextsAndOnlyTheButtonsItIsGiven) {
  VendDialog dialog = VendDialog::dialogWithDictionary({{"message", "Restart?"},
                                                        {"explanation", "Updates are ready."},
                                                        {"okButtonString", "Restart"},
                                                        {"cancelButtonString", "Later"}});
  EXPECT_EQ(dialog.message(), "Restart?");
  EXPECT_EQ(dialog.explanation(), "Updates are ready.");
  ASSERT_TRUE(dialog.okButton());
  EXPECT_EQ(dialog.okButton()->title, "Restart");
  EXPECT_EQ(dialog.okButton()->role, VendDialogButton::kOK);
  ASSERT_TRUE(dialog.cancelButton());
  EXPECT_EQ(dialog.cancelButton()->title, "Later");
  EXPECT_FALSE(dialog.otherButton()) << "no otherButtonString, no other button";
  EXPECT_EQ(dialog.kind(), VendDialog::kAlert);

  PlistDictionary wire = dialog.toDictionary();
  EXPECT_EQ(wire.count("otherButtonString"), 0u);
  EXPECT_EQ(*wire.at("okButtonString").string(), "Restart");
  EXPECT_EQ(*wire.at("identifier").string(), dialog.identifier());
  EXPECT_EQ(wire.at("kind").int64Value(), VendDialog::kAlert);
}

TEST(VendDialogRecord, ADialogWithoutButtonsGetsAnOKButton) {
  VendDialog dialog = VendDialog::dialogWithDictionary({{"message", "Done"}});
  ASSERT_TRUE(dialog.okButton());
  EXPECT_EQ(dialog.okButton()->title, "OK");
  EXPECT_FALSE(dialog.cancelButton());
  EXPECT_FALSE(dialog.otherButton());

  // Only a cancel button: no OK button is added.
  VendDialog cancelOnly =
      VendDialog::dialogWithDictionary({{"message", "x"}, {"cancelButtonString", "Close"}});
  EXPECT_FALSE(cancelOnly.okButton());
  ASSERT_TRUE(cancelOnly.cancelButton());
}

TEST(VendDialogRecord, HostileFieldsAreIgnoredAndEmptyTitlesGetTheTitleOfTheirRole) {
  VendDialog dialog = VendDialog::dialogWithDictionary({{"message", std::int64_t{42}},
                                                        {"explanation", PlistArray{"not", "text"}},
                                                        {"okButtonString", ""},
                                                        {"cancelButtonString", std::int64_t{1}},
                                                        {"otherButtonString", PlistDictionary{}},
                                                        {"kind", std::int64_t{99}},
                                                        {"identifier", "CHOSEN-BY-CALLER"},
                                                        {"accountName", "alice@example.com"}});
  EXPECT_EQ(dialog.message(), "");
  EXPECT_EQ(dialog.explanation(), "");
  ASSERT_TRUE(dialog.okButton()) << "an empty string still asks for the button";
  EXPECT_EQ(dialog.okButton()->title, "OK");
  EXPECT_FALSE(dialog.cancelButton()) << "a number is not a button title";
  EXPECT_FALSE(dialog.otherButton());
  EXPECT_EQ(dialog.kind(), VendDialog::kAlert) << "an unknown kind is a plain alert";
  EXPECT_NE(dialog.identifier(), "CHOSEN-BY-CALLER");
  EXPECT_EQ(*dialog.toDictionary().at("accountName").string(), "alice@example.com")
      << "keys the dialog does not know travel to the agent unchanged";
}

TEST(VendDialogRecord, EveryDialogHasAFreshIdentifier) {
  const PlistDictionary fields{{"message", "Same"}};
  std::set<std::string> identifiers;
  for (int i = 0; i < 100; ++i)
    identifiers.insert(VendDialog::dialogWithDictionary(fields).identifier());
  EXPECT_EQ(identifiers.size(), 100u);
  EXPECT_FALSE(identifiers.begin()->empty());
}

TEST(VendDialogRecord, ExitCodesMapToTheDialogsOwnButtons) {
  VendDialog dialog = VendDialog::dialogWithDictionary({{"message", "m"},
                                                        {"okButtonString", "Yes"},
                                                        {"cancelButtonString", "No"},
                                                        {"otherButtonString", "Skip"}});
  ASSERT_TRUE(dialog.buttonForExitCode(1));
  EXPECT_TRUE(dialog.buttonForExitCode(1)->isEqual(*dialog.okButton(), true));
  EXPECT_TRUE(dialog.buttonForExitCode(0)->isEqual(*dialog.cancelButton(), true));
  EXPECT_TRUE(dialog.buttonForExitCode(2)->isEqual(*dialog.otherButton(), true));
  EXPECT_FALSE(dialog.buttonForExitCode(-1));
  EXPECT_FALSE(dialog.buttonForExitCode(3));
  EXPECT_FALSE(dialog.buttonForExitCode(1)->isEqual(*dialog.cancelButton(), true));

  VendDialog okOnly = VendDialog::dialogWithDictionary({{"message", "m"}});
  EXPECT_FALSE(okOnly.buttonForExitCode(0)) << "no cancel button to choose";
  // Superficial comparison ignores the title; a full one does not.
  VendDialogButton renamed{"Other title", VendDialogButton::kOK};
  EXPECT_TRUE(renamed.isEqual(*okOnly.okButton(), true));
  EXPECT_FALSE(renamed.isEqual(*okOnly.okButton(), false));
}

TEST(VendDialogRecord, KindAndContentTravelToTheAgent) {
  VendDialog dialog =
      VendDialog::dialogWithDictionary({{"message", "Licence"},
                                        {"kind", std::int64_t{VendDialog::kLicenseAgreement}},
                                        {"content", "You agree."}});
  EXPECT_EQ(dialog.kind(), VendDialog::kLicenseAgreement);
  EXPECT_EQ(dialog.content(), "You agree.");
  PlistDictionary wire = dialog.toDictionary();
  EXPECT_EQ(wire.at("kind").int64Value(), VendDialog::kLicenseAgreement);
  EXPECT_EQ(*wire.at("content").string(), "You agree.");
}

// The fallback presenter.

TEST(VendCancellingDialogPresenter, AnswersEveryDialogAsCancelledAtOnce) {
  VendCancellingDialogPresenter presenter;
  std::vector<VendDialogAnswer> answers;
  presenter.present(VendDialog::dialogWithDictionary({{"message", "m"}}),
                    [&](VendDialogAnswer answer) { answers.push_back(std::move(answer)); });
  ASSERT_EQ(answers.size(), 1u) << "answered before present returned";
  EXPECT_EQ(answers[0].exitCode, VendDialogButton::kCancel);
  EXPECT_TRUE(answers[0].values.empty());
  presenter.dismiss("unknown", 1);  // nothing is up; must not fail
}

TEST_F(DialogTest, ARuntimeWithoutPresenterCancelsEveryDialog) {
  EXPECT_FALSE(runtime_->dialogPresenter());
  std::optional<std::int64_t> exitCode;
  VendUIService(kClient, runtime_)
      .displayDialog(threeButtonDialog(), nullptr, [&](std::int64_t code) { exitCode = code; });
  EXPECT_EQ(exitCode, VendDialogButton::kCancel);
}

// The UI service.

TEST_F(DialogTest, AReplyRunsExactlyOnceWhateverThePresenterDoes) {
  for (auto behaviour :
       {ScriptedPresenter::Behaviour::kAnswerTwice, ScriptedPresenter::Behaviour::kDropUnanswered,
        ScriptedPresenter::Behaviour::kThrow}) {
    install(behaviour, 1);
    std::vector<std::int64_t> exitCodes;
    VendUIService(kClient, runtime_)
        .displayDialog(threeButtonDialog(), nullptr,
                       [&](std::int64_t code) { exitCodes.push_back(code); });
    ASSERT_EQ(exitCodes.size(), 1u) << "behaviour " << static_cast<int>(behaviour);
    const std::int64_t expected = behaviour == ScriptedPresenter::Behaviour::kAnswerTwice
                                      ? std::int64_t{1}
                                      : std::int64_t{VendDialogButton::kCancel};
    EXPECT_EQ(exitCodes[0], expected) << "behaviour " << static_cast<int>(behaviour);
  }
}

TEST_F(DialogTest, PresentDialogGivesTheWholeAnswer) {
  auto presenter = std::make_shared<ScriptedPresenter>(
      ScriptedPresenter::Behaviour::kAnswer, 1,
      PlistDictionary{{"accountName", "alice"}, {"password", "secret"}});
  runtime_->setDialogPresenter(presenter);
  VendDialog signIn = VendDialog::dialogWithDictionary({{"message", "Sign in"}});
  signIn.setKind(VendDialog::kSignIn);
  std::optional<VendDialogAnswer> answer;
  VendUIService(kClient, runtime_).presentDialog(signIn, [&](VendDialogAnswer given) {
    answer = std::move(given);
  });
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->exitCode, 1);
  EXPECT_EQ(*answer->values.at("accountName").string(), "alice");
  EXPECT_EQ(presenter->presented().at(0).kind(), VendDialog::kSignIn);
}

TEST_F(DialogTest, FirmwareWarningsAndLicencesAreAgreedToOnlyWithOK) {
  for (std::int64_t exitCode : {1, 0, 2}) {
    auto presenter = install(ScriptedPresenter::Behaviour::kAnswer, exitCode);
    VendUIService service(kClient, runtime_);
    std::vector<bool> agreed;
    service.displayFirmwareWarningWithTitle("Firmware", "{\\rtf1 careful}",
                                            [&](bool yes) { agreed.push_back(yes); });
    service.displayLicenseAgreementWithTitle("Licence", "terms",
                                             [&](bool yes) { agreed.push_back(yes); });
    ASSERT_EQ(agreed.size(), 2u);
    EXPECT_EQ(agreed[0], exitCode == 1);
    EXPECT_EQ(agreed[1], exitCode == 1);
    std::vector<VendDialog> shown = presenter->presented();
    ASSERT_EQ(shown.size(), 2u);
    EXPECT_EQ(shown[0].kind(), VendDialog::kFirmwareWarning);
    EXPECT_EQ(shown[0].message(), "Firmware");
    EXPECT_EQ(shown[0].content(), "{\\rtf1 careful}");
    EXPECT_TRUE(shown[0].okButton() && shown[0].cancelButton());
    EXPECT_EQ(shown[1].kind(), VendDialog::kLicenseAgreement);
    EXPECT_EQ(shown[1].content(), "terms");
  }
}

// The dialog operation.

TEST_F(DialogTest, TheOperationSelectsTheButtonTheUserChose) {
  const std::pair<std::int64_t, VendDialogButton::Role> cases[] = {
      {1, VendDialogButton::kOK}, {0, VendDialogButton::kCancel}, {2, VendDialogButton::kOther}};
  for (const auto& [exitCode, role] : cases) {
    install(ScriptedPresenter::Behaviour::kAnswer, exitCode);
    auto operation = VendDialogOperation::operationWithDialog(threeButtonDialog(), kClient);
    operation->setPerformDefaultActions(false);
    OptionalError error;
    EXPECT_TRUE(operation->runSyncReturningError(&error)) << "exit code " << exitCode;
    EXPECT_FALSE(error);
    ASSERT_TRUE(operation->selectedButton()) << "exit code " << exitCode;
    EXPECT_EQ(operation->selectedButton()->role, role);
    const VendDialog& dialog = operation->dialog();
    std::optional<VendDialogButton> expected = role == VendDialogButton::kOK ? dialog.okButton()
                                               : role == VendDialogButton::kCancel
                                                   ? dialog.cancelButton()
                                                   : dialog.otherButton();
    EXPECT_TRUE(operation->selectedButton()->isEqual(*expected, true));
    EXPECT_FALSE(operation->performDefaultActions());
  }
}

TEST_F(DialogTest, WithNobodyToAskTheOperationSelectsCancel) {
  auto operation = VendDialogOperation::operationWithDialog(threeButtonDialog(), kClient);
  EXPECT_TRUE(operation->runSyncReturningError(nullptr));
  ASSERT_TRUE(operation->selectedButton());
  EXPECT_TRUE(operation->selectedButton()->isEqual(*operation->dialog().cancelButton(), true));
}

TEST_F(DialogTest, AnAnswerTheDialogHasNoButtonForFailsWithoutSelection) {
  install(ScriptedPresenter::Behaviour::kAnswer, 2);
  VendDialog noOther = VendDialog::dialogWithDictionary(
      {{"message", "m"}, {"okButtonString", "OK"}, {"cancelButtonString", "Cancel"}});
  VendDialogOperation operation(noOther, kClient);
  OptionalError error;
  EXPECT_FALSE(operation.runSyncReturningError(&error));
  EXPECT_FALSE(operation.selectedButton());
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->isCancellation());
}

TEST_F(DialogTest, ADialogDismissedFromOutsideEndsTheWaitWithoutAButton) {
  auto presenter = install(ScriptedPresenter::Behaviour::kHold);
  auto operation = VendDialogOperation::operationWithDialog(threeButtonDialog(), kClient);
  auto finished = std::async(std::launch::async, [&] {
    OptionalError error;
    bool success = operation->runSyncReturningError(&error);
    return std::make_pair(success, error);
  });
  ASSERT_TRUE(presenter->waitForPresented(1));
  EXPECT_EQ(finished.wait_for(200ms), std::future_status::timeout)
      << "the operation waits while the dialog is up";
  EXPECT_FALSE(operation->selectedButton());

  VendDialog::dismissDialogWithDictionary({{"identifier", operation->dialog().identifier()}});
  ASSERT_EQ(finished.wait_for(5s), std::future_status::ready);
  auto [success, error] = finished.get();
  EXPECT_FALSE(success);
  EXPECT_FALSE(operation->selectedButton()) << "taken down, not chosen";
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->isCancellation());
  ASSERT_EQ(presenter->dismissals().size(), 1u);
  EXPECT_EQ(presenter->dismissals()[0].first, operation->dialog().identifier());
}

TEST_F(DialogTest, ADismissalWithAnExitCodeSelectsThatButton) {
  auto presenter = install(ScriptedPresenter::Behaviour::kHold);
  auto operation = VendDialogOperation::operationWithDialog(threeButtonDialog(), kClient);
  auto finished =
      std::async(std::launch::async, [&] { return operation->runSyncReturningError(nullptr); });
  ASSERT_TRUE(presenter->waitForPresented(1));
  // The UI service's dismissal, as a power-source change ends a dialog.
  VendUIService(kClient, runtime_).dismissDialog(operation->dialog(), 1);
  ASSERT_EQ(finished.wait_for(5s), std::future_status::ready);
  EXPECT_TRUE(finished.get());
  ASSERT_TRUE(operation->selectedButton());
  EXPECT_EQ(operation->selectedButton()->role, VendDialogButton::kOK);
}

TEST_F(DialogTest, CancellingTheOperationTakesItsDialogDown) {
  auto presenter = install(ScriptedPresenter::Behaviour::kHold);
  auto operation = VendDialogOperation::operationWithDialog(threeButtonDialog(), kClient);
  auto finished =
      std::async(std::launch::async, [&] { return operation->runSyncReturningError(nullptr); });
  ASSERT_TRUE(presenter->waitForPresented(1));
  operation->cancel();
  ASSERT_EQ(finished.wait_for(5s), std::future_status::ready);
  EXPECT_TRUE(finished.get());
  ASSERT_TRUE(operation->selectedButton());
  EXPECT_EQ(operation->selectedButton()->role, VendDialogButton::kCancel);
  ASSERT_EQ(presenter->dismissals().size(), 1u);
  EXPECT_EQ(presenter->dismissals()[0].second, VendDialogButton::kCancel);
}

TEST_F(DialogTest, ACancelledOperationShowsNothing) {
  auto presenter = install(ScriptedPresenter::Behaviour::kAnswer, 1);
  VendDialogOperation operation(threeButtonDialog(), kClient);
  operation.cancel();
  OptionalError error;
  EXPECT_FALSE(operation.runSyncReturningError(&error));
  EXPECT_TRUE(presenter->presented().empty());
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->isCancellation());
}

TEST_F(DialogTest, ManyDialogsAtOnceEachGetTheirOwnAnswer) {
  auto presenter = install(ScriptedPresenter::Behaviour::kHold);
  constexpr int kDialogs = 8;
  std::vector<std::shared_ptr<VendDialogOperation>> operations;
  std::vector<std::future<bool>> results;
  for (int i = 0; i < kDialogs; ++i) {
    operations.push_back(VendDialogOperation::operationWithDialog(threeButtonDialog(), kClient));
    results.push_back(std::async(std::launch::async, [operation = operations.back()] {
      return operation->runSyncReturningError(nullptr);
    }));
  }
  ASSERT_TRUE(presenter->waitForPresented(kDialogs));
  for (int i = 0; i < kDialogs; ++i) {
    presenter->dismiss(operations[i]->dialog().identifier(), i % 3);
  }
  for (int i = 0; i < kDialogs; ++i) {
    ASSERT_EQ(results[i].wait_for(5s), std::future_status::ready);
    EXPECT_TRUE(results[i].get());
    ASSERT_TRUE(operations[i]->selectedButton());
    EXPECT_EQ(operations[i]->selectedButton()->role, i % 3) << "dialog " << i;
  }
}

}  // namespace
}  // namespace larder
