#include "store-runtime/services/VendUIService.h"
#include "store-runtime/dialogs/VendCancellingDialogPresenter.h"

#include <atomic>
#include <exception>

#include "platform/log/TillLogManager.h"
#include "store-runtime/dialogs/VendDialogPresenter.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendOperationDelegate.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "VendUIService";

VendDialogAnswer cancelledAnswer() {
  return VendDialogAnswer{VendDialogButton::kCancel, {}};
}

// Travels with a dialog to the presenter and lets exactly one answer
// through. A presenter that drops the dialog unanswered (the last copy of
// its reply goes away) answers "cancelled", so no caller waits forever on
// a dialog nobody holds any more.
class AnswerOnce {
 public:
  AnswerOnce(std::string dialogIdentifier, std::function<void(VendDialogAnswer)> reply)
      : dialogIdentifier_(std::move(dialogIdentifier)), reply_(std::move(reply)) {}
  AnswerOnce(const AnswerOnce&) = delete;
  AnswerOnce& operator=(const AnswerOnce&) = delete;

  ~AnswerOnce() {
    if (delivered_.load()) return;
    TILL_LOG(1, "%@: Dialog %@ was let go without an answer; it counts as cancelled", kSpeaker,
             dialogIdentifier_);
    try {
      deliver(cancelledAnswer());
    } catch (const std::exception& exception) {
      TILL_LOG(1, "%@: Reply of dialog %@ failed: %@", kSpeaker, dialogIdentifier_,
               exception.what());
    }
  }

  void deliver(VendDialogAnswer answer) {
    if (delivered_.exchange(true)) {
      TILL_LOG(3, "%@: Dialog %@ was already answered; exit code %@ dropped", kSpeaker,
               dialogIdentifier_, answer.exitCode);
      return;
    }
    TILL_LOG(2, "%@: Dialog %@ answered with exit code %@", kSpeaker, dialogIdentifier_,
             answer.exitCode);
    if (reply_) reply_(std::move(answer));
  }

 private:
  std::string dialogIdentifier_;
  std::function<void(VendDialogAnswer)> reply_;
  std::atomic<bool> delivered_{false};
};

}  // namespace

VendUIService::VendUIService(VendStoreClient storeClient, std::shared_ptr<VendRuntime> runtime)
    : storeClient_(std::move(storeClient)),
      runtime_(runtime ? std::move(runtime) : VendRuntime::shared()) {}

std::shared_ptr<VendDialogPresenter> VendUIService::presenter() const {
  return VendCancellingDialogPresenter::presenterOf(*runtime_);
}

void VendUIService::presentDialog(const VendDialog& dialog,
                                  std::function<void(VendDialogAnswer)> reply) {
  auto once = std::make_shared<AnswerOnce>(dialog.identifier(), std::move(reply));
  TILL_LOG(2, "%@: Showing dialog %@ \"%@\" for %@", kSpeaker, dialog.identifier(),
           dialog.message(), storeClient_.identifier());
  try {
    presenter()->present(dialog,
                         [once](VendDialogAnswer answer) { once->deliver(std::move(answer)); });
  } catch (const std::exception& exception) {
    TILL_LOG(1, "%@: Cannot show dialog %@: %@", kSpeaker, dialog.identifier(), exception.what());
    once->deliver(cancelledAnswer());
  }
}

void VendUIService::displayDialog(const VendDialog& dialog,
                                  std::shared_ptr<VendOperationDelegate> delegate,
                                  std::function<void(std::int64_t exitCode)> reply) {
  presentDialog(
      dialog, [delegate = std::move(delegate), reply = std::move(reply)](VendDialogAnswer answer) {
        if (reply) reply(answer.exitCode);
      });
}

void VendUIService::dismissDialog(const VendDialog& dialog, std::int64_t exitCode) {
  TILL_LOG(2, "%@: Dismissing dialog %@ with exit code %@", kSpeaker, dialog.identifier(),
           exitCode);
  presenter()->dismiss(dialog.identifier(), exitCode);
}

void VendUIService::displayFirmwareWarningWithTitle(const std::string& title,
                                                    const std::string& content,
                                                    std::function<void(bool agreed)> reply) {
  VendDialog dialog = VendDialog::dialogWithDictionary(
      {{"message", title}, {"okButtonString", "Continue"}, {"cancelButtonString", "Cancel"}});
  dialog.setKind(VendDialog::kFirmwareWarning);
  displayAgreement(std::move(dialog), content, std::move(reply));
}

void VendUIService::displayLicenseAgreementWithTitle(const std::string& title,
                                                     const std::string& content,
                                                     std::function<void(bool agreed)> reply) {
  VendDialog dialog = VendDialog::dialogWithDictionary(
      {{"message", title}, {"okButtonString", "Agree"}, {"cancelButtonString", "Disagree"}});
  dialog.setKind(VendDialog::kLicenseAgreement);
  displayAgreement(std::move(dialog), content, std::move(reply));
}

void VendUIService::displayAgreement(VendDialog dialog, const std::string& content,
                                     std::function<void(bool agreed)> reply) {
  dialog.setContent(content);
  presentDialog(dialog, [reply = std::move(reply)](VendDialogAnswer answer) {
    if (reply) reply(answer.exitCode == VendDialogButton::kOK);
  });
}

}  // namespace larder
