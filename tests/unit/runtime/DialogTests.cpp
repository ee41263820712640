// Dialogs of the store runtime: the dialog record, the UI service's
// promise of exactly one answer, and the operation that waits for one.
#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <future>
#include <map>
#include <mutex>
#include <set>
#include <stdexcept>
#include <vector>

#include "RuntimeTestSupport.h"
#include "store-runtime/dialogs/VendCancellingDialogPresenter.h"
#include "store-runtime/dialogs/VendDialog.h"
#include "store-runtime/dialogs/VendDialogPresenter.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendDialogOperation.h"
#include "store-runtime/services/VendUIService.h"

namespace larder {
namespace {

using namespace std::chrono_literals;
using Button = VendDialogButton;

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
    if (behaviour_ == Behaviour::kThrow) throw std::runtime_error("no screen");
    if (behaviour_ == Behaviour::kAnswer || behaviour_ == Behaviour::kAnswerTwice)
      reply(VendDialogAnswer{exitCode_, values_});
    if (behaviour_ == Behaviour::kAnswerTwice) reply(VendDialogAnswer{exitCode_ + 1, {}});
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

  bool waitForPresented(std::size_t count) {
    std::unique_lock lock(mutex_);
    return presentedChanged_.wait_for(lock, 5s, [&] { return presented_.size() >= count; });
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

VendDialog threeButtonDialog() {
  return VendDialog::dialogWithDictionary({{"message", "Quit Foo?"},
                                           {"explanation", "Foo must quit to be updated."},
                                           {"okButtonString", "Quit"},
                                           {"cancelButtonString", "Not Now"},
                                           {"otherButtonString", "Skip"}});
}

// The dialog's own button of `role`, if it has one.
std::optional<Button> buttonOf(const VendDialog& dialog, std::int64_t role) {
  return role == Button::kOK       ? dialog.okButton()
         : role == Button::kCancel ? dialog.cancelButton()
                                   : dialog.otherButton();
}

class DialogTest : public ::testing::Test {
 protected:
  std::shared_ptr<ScriptedPresenter> install(ScriptedPresenter::Behaviour behaviour,
                                             std::int64_t exitCode = 1,
                                             PlistDictionary values = {}) {
    auto presenter = std::make_shared<ScriptedPresenter>(behaviour, exitCode, std::move(values));
    runtime_->setDialogPresenter(presenter);
    return presenter;
  }

  testing::SharedRuntime shared_;
  const std::shared_ptr<VendRuntime>& runtime_ = shared_.get();
};

TEST(VendDialogRecord, HasOnlyTheButtonsItIsGivenAndAnOKButtonWhenGivenNone) {
  using Title = std::optional<std::string>;
  constexpr std::nullopt_t none = std::nullopt;
  const struct {
    const char* name;
    PlistDictionary fields;
    Title ok, cancel, other;
  } cases[] = {
      {"two", {{"okButtonString", "Go"}, {"cancelButtonString", "No"}}, "Go", "No", none},
      {"three buttons", threeButtonDialog().toDictionary(), "Quit", "Not Now", "Skip"},
      {"no buttons", {{"message", "Done"}}, "OK", none, none},
      {"a cancel button alone", {{"cancelButtonString", "Close"}}, none, "Close", none},
      {"an empty title still asks for the button", {{"okButtonString", ""}}, "OK", none, none},
      {"a number is no title", {{"cancelButtonString", std::int64_t{1}}}, "OK", none, none},
      {"a dictionary is no title", {{"otherButtonString", PlistDictionary{}}}, "OK", none, none},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    const VendDialog dialog = VendDialog::dialogWithDictionary(c.fields);
    const std::pair<std::int64_t, Title> expected[] = {
        {Button::kOK, c.ok}, {Button::kCancel, c.cancel}, {Button::kOther, c.other}};
    for (const auto& [role, title] : expected) {
      const std::optional<Button> button = buttonOf(dialog, role);
      ASSERT_EQ(button.has_value(), title.has_value()) << "role " << role;
      if (!button) continue;
      EXPECT_EQ(button->title, *title);
      EXPECT_EQ(button->role, role);
    }
    // The agent draws the buttons the wire form names, and only those.
    const PlistDictionary wire = dialog.toDictionary();
    for (const auto& [key, title] : {std::pair{"okButtonString", c.ok},
                                     {"cancelButtonString", c.cancel},
                                     {"otherButtonString", c.other}}) {
      EXPECT_EQ(wire.contains(key) ? std::optional(*wire.at(key).string()) : std::nullopt, title)
          << key;
    }
  }
}

TEST(VendDialogRecord, TextsAndKindAreTakenOnlyWhenWellTyped) {
  const VendDialog licence =
      VendDialog::dialogWithDictionary({{"message", "Licence"},
                                        {"explanation", "Read it."},
                                        {"kind", std::int64_t{VendDialog::kLicenseAgreement}},
                                        {"content", "You agree."}});
  EXPECT_EQ(licence.message(), "Licence");
  EXPECT_EQ(licence.explanation(), "Read it.");
  EXPECT_EQ(licence.kind(), VendDialog::kLicenseAgreement);
  EXPECT_EQ(licence.content(), "You agree.");
  EXPECT_EQ(licence.toDictionary().at("kind").int64Value(), VendDialog::kLicenseAgreement);
  EXPECT_EQ(licence.toDictionary().at("content"), PlistValue("You agree."));

  const VendDialog hostile =
      VendDialog::dialogWithDictionary({{"message", std::int64_t{42}},
                                        {"explanation", PlistArray{"not", "text"}},
                                        {"content", PlistData{1}},
                                        {"kind", std::int64_t{99}}});
  EXPECT_EQ(hostile.message(), "");
  EXPECT_EQ(hostile.explanation(), "");
  EXPECT_EQ(hostile.content(), "");
  EXPECT_EQ(hostile.kind(), VendDialog::kAlert) << "an unknown kind is a plain alert";
  EXPECT_EQ(hostile.toDictionary().at("kind").int64Value(), VendDialog::kAlert);
}

TEST(VendDialogRecord, IdentifiersAreFreshAndUnknownKeysTravelToTheAgent) {
  const PlistDictionary fields{{"message", "Same"},
                               {"identifier", "CHOSEN-BY-CALLER"},
                               {"accountName", "alice@example.com"}};
  std::set<std::string> identifiers;
  for (int i = 0; i < 100; ++i) {
    const VendDialog dialog = VendDialog::dialogWithDictionary(fields);
    identifiers.insert(dialog.identifier());
    EXPECT_EQ(dialog.toDictionary().at("identifier"), PlistValue(dialog.identifier()));
    EXPECT_EQ(dialog.toDictionary().at("accountName"), PlistValue("alice@example.com"));
  }
  EXPECT_EQ(identifiers.size(), 100u);
  EXPECT_FALSE(identifiers.contains("CHOSEN-BY-CALLER"));
  EXPECT_FALSE(identifiers.contains(""));
}

TEST(VendDialogRecord, SuperficialButtonComparisonIgnoresOnlyTheTitle) {
  const Button ok = *VendDialog::dialogWithDictionary({{"message", "m"}}).okButton();
  const Button renamed{"Other title", Button::kOK};
  const Button cancel{ok.title, Button::kCancel};
  EXPECT_TRUE(renamed.isEqual(ok, true));
  EXPECT_FALSE(renamed.isEqual(ok, false));
  EXPECT_FALSE(cancel.isEqual(ok, true));
}

// With nobody to ask, every dialog is cancelled at once, by the fallback
// presenter, by the UI service and by the operation alike.
TEST_F(DialogTest, WithoutAPresenterEveryDialogIsCancelledAtOnce) {
  VendCancellingDialogPresenter presenter;
  std::vector<VendDialogAnswer> answers;
  presenter.present(threeButtonDialog(), [&](VendDialogAnswer a) { answers.push_back(a); });
  ASSERT_EQ(answers.size(), 1u) << "answered before present returned";
  EXPECT_EQ(answers[0].exitCode, Button::kCancel);
  EXPECT_TRUE(answers[0].values.empty());
  presenter.dismiss("unknown", 1);  // nothing is up; must not fail

  EXPECT_FALSE(runtime_->dialogPresenter());
  std::optional<std::int64_t> exitCode;
  VendUIService(kClient, runtime_).displayDialog(threeButtonDialog(), nullptr, [&](auto code) {
    exitCode = code;
  });
  EXPECT_EQ(exitCode, Button::kCancel);

  auto operation = VendDialogOperation::operationWithDialog(threeButtonDialog(), kClient);
  EXPECT_TRUE(operation->runSyncReturningError(nullptr));
  ASSERT_TRUE(operation->selectedButton());
  EXPECT_TRUE(operation->selectedButton()->isEqual(*operation->dialog().cancelButton(), true));
}

TEST_F(DialogTest, AReplyRunsExactlyOnceWhateverThePresenterDoes) {
  using B = ScriptedPresenter::Behaviour;
  const std::pair<B, std::int64_t> cases[] = {
      {B::kAnswerTwice, 1}, {B::kDropUnanswered, Button::kCancel}, {B::kThrow, Button::kCancel}};
  for (const auto& [behaviour, expected] : cases) {
    install(behaviour, 1);
    std::vector<std::int64_t> exitCodes;
    VendUIService(kClient, runtime_).displayDialog(threeButtonDialog(), nullptr, [&](auto code) {
      exitCodes.push_back(code);
    });
    EXPECT_EQ(exitCodes, std::vector<std::int64_t>{expected}) << static_cast<int>(behaviour);
  }
}

TEST_F(DialogTest, PresentDialogGivesTheWholeAnswer) {
  auto presenter = install(ScriptedPresenter::Behaviour::kAnswer, 1,
                           {{"accountName", "alice"}, {"password", "secret"}});
  VendDialog signIn = VendDialog::dialogWithDictionary({{"message", "Sign in"}});
  signIn.setKind(VendDialog::kSignIn);
  std::optional<VendDialogAnswer> answer;
  VendUIService(kClient, runtime_).presentDialog(signIn, [&](VendDialogAnswer a) { answer = a; });
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->exitCode, 1);
  EXPECT_EQ(answer->values.at("accountName"), PlistValue("alice"));
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
    EXPECT_EQ(agreed, std::vector<bool>(2, exitCode == 1)) << exitCode;
    const std::vector<VendDialog> shown = presenter->presented();
    ASSERT_EQ(shown.size(), 2u);
    EXPECT_EQ(shown[0].kind(), VendDialog::kFirmwareWarning);
    EXPECT_EQ(shown[0].message(), "Firmware");
    EXPECT_EQ(shown[0].content(), "{\\rtf1 careful}");
    EXPECT_TRUE(shown[0].okButton() && shown[0].cancelButton());
    EXPECT_EQ(shown[1].kind(), VendDialog::kLicenseAgreement);
    EXPECT_EQ(shown[1].content(), "terms");
  }
}

TEST_F(DialogTest, TheOperationSelectsTheButtonTheUserChoseOrFailsWithoutOne) {
  const VendDialog noOther = VendDialog::dialogWithDictionary(
      {{"message", "m"}, {"okButtonString", "OK"}, {"cancelButtonString", "Cancel"}});
  const VendDialog okOnly = VendDialog::dialogWithDictionary({{"message", "m"}});
  const struct {
    VendDialog dialog;
    std::int64_t exitCode;
    bool selects;  // false: the answer names no button of the dialog
  } cases[] = {{threeButtonDialog(), 1, true},
               {threeButtonDialog(), 0, true},
               {threeButtonDialog(), 2, true},
               {threeButtonDialog(), 3, false},
               {threeButtonDialog(), -1, false},
               {noOther, 2, false},
               {okOnly, 0, false}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.exitCode);
    install(ScriptedPresenter::Behaviour::kAnswer, c.exitCode);
    auto operation = VendDialogOperation::operationWithDialog(c.dialog, kClient);
    operation->setPerformDefaultActions(false);
    OptionalError error;
    EXPECT_EQ(operation->runSyncReturningError(&error), c.selects);
    EXPECT_FALSE(operation->performDefaultActions());
    if (!c.selects) {
      EXPECT_FALSE(operation->selectedButton());
      ASSERT_TRUE(error);
      EXPECT_TRUE(error->isCancellation());
      continue;
    }
    EXPECT_FALSE(error);
    ASSERT_TRUE(operation->selectedButton());
    EXPECT_EQ(operation->selectedButton()->role, c.exitCode);
    EXPECT_TRUE(
        operation->selectedButton()->isEqual(*buttonOf(operation->dialog(), c.exitCode), true));
  }
}

// A dialog that is up ends in one of three ways while the operation waits.
// The rows whose outcome is a button prove that the operation waited for
// the end: that button exists only once the dialog has been taken down.
TEST_F(DialogTest, ADialogTakenDownWhileUpEndsTheWaitWithItsOutcome) {
  using Operation = VendDialogOperation;
  const struct {
    const char* name;
    std::function<void(Operation&, const std::shared_ptr<VendRuntime>&)> takeDown;
    bool success;
    std::optional<std::int64_t> selected;
    std::int64_t dismissalCode;
  } cases[] = {
      {"dismissed from outside without an answer",
       [](Operation& o, const auto&) {
         VendDialog::dismissDialogWithDictionary({{"identifier", o.dialog().identifier()}});
       },
       false, std::nullopt, Button::kCancel},
      // The UI service's dismissal, as a power-source change ends a dialog.
      {"dismissed with an exit code",
       [](Operation& o, const std::shared_ptr<VendRuntime>& runtime) {
         VendUIService(kClient, runtime).dismissDialog(o.dialog(), 1);
       },
       true, Button::kOK, 1},
      {"operation cancelled", [](Operation& o, const auto&) { o.cancel(); }, true, Button::kCancel,
       Button::kCancel},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    auto presenter = install(ScriptedPresenter::Behaviour::kHold);
    auto operation = Operation::operationWithDialog(threeButtonDialog(), kClient);
    auto finished = std::async(std::launch::async, [&] {
      OptionalError error;
      const bool success = operation->runSyncReturningError(&error);
      return std::make_pair(success, error);
    });
    ASSERT_TRUE(presenter->waitForPresented(1));
    c.takeDown(*operation, runtime_);
    ASSERT_EQ(finished.wait_for(5s), std::future_status::ready);
    const auto [success, error] = finished.get();
    EXPECT_EQ(success, c.success);
    if (c.selected) {
      ASSERT_TRUE(operation->selectedButton());
      EXPECT_EQ(operation->selectedButton()->role, *c.selected);
    } else {
      EXPECT_FALSE(operation->selectedButton()) << "taken down, not chosen";
      ASSERT_TRUE(error);
      EXPECT_TRUE(error->isCancellation());
    }
    const auto dismissals = presenter->dismissals();
    ASSERT_EQ(dismissals.size(), 1u);
    EXPECT_EQ(dismissals[0].first, operation->dialog().identifier());
    if (c.selected) {
      EXPECT_EQ(dismissals[0].second, c.dismissalCode);
    }
  }
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
  for (int i = 0; i < kDialogs; ++i)
    presenter->dismiss(operations[i]->dialog().identifier(), i % 3);
  for (int i = 0; i < kDialogs; ++i) {
    ASSERT_EQ(results[i].wait_for(5s), std::future_status::ready);
    EXPECT_TRUE(results[i].get());
    ASSERT_TRUE(operations[i]->selectedButton());
    EXPECT_EQ(operations[i]->selectedButton()->role, i % 3) << "dialog " << i;
  }
}

}  // namespace
}  // namespace larder
