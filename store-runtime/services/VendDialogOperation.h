#pragma once

#include <memory>
#include <optional>

#include "platform/system/Mutex.h"
#include "store-runtime/dialogs/VendDialog.h"
#include "store-runtime/services/VendOperation.h"

namespace larder {

// An operation that shows one dialog and waits for the user's answer. It
// is run as a sub-operation or with `runSyncReturningError`, and blocks its
// thread for as long as the dialog is up.
//
// The outcome says whether the dialog came back with one of its buttons:
// success with `selectedButton` set, the cancel button included (a dialog
// nobody could be shown to comes back as cancelled). A dialog that ends
// with no button of its own (taken down from outside without an exit code,
// or answered with a code it has no button for) fails with a cancellation
// error and leaves `selectedButton` empty. Cancelling the operation while
// the dialog is up takes the dialog down with the cancel exit code.
class VendDialogOperation : public VendOperation {
 public:
  VendDialogOperation(VendDialog dialog, VendStoreClient storeClient);
  static std::shared_ptr<VendDialogOperation> operationWithDialog(VendDialog dialog,
                                                                  VendStoreClient storeClient);

  [[nodiscard]] const VendDialog& dialog() const { return dialog_; }
  // The button the user chose; empty until the dialog has come back.
  [[nodiscard]] std::optional<VendDialogButton> selectedButton() const;

  // With false, the runtime does not act on the chosen button itself. The
  // buttons of this runtime's dialogs carry no actions of their own, so the
  // caller always acts on `selectedButton`; the flag is kept for callers
  // that state it, and reported in the log.
  void setPerformDefaultActions(bool performDefaultActions);
  [[nodiscard]] bool performDefaultActions() const;

  // Takes the dialog down from outside, as if `exitCode` had been chosen
  // (`VendDialog::kNoButtonExitCode` ends it with no choice); any thread,
  // does not wait for the dialog. A dismissal can reach the presenter
  // before the dialog does, so the waiting run sends it again until the
  // dialog has come back; a dialog taken down before it went up is never
  // shown.
  void dismissWithExitCode(std::int64_t exitCode);

 protected:
  void run() override;

 private:
  std::int64_t waitForExitCode();
  [[nodiscard]] std::optional<std::int64_t> dismissalExitCode() const;
  void recordExitCode(std::int64_t exitCode);

  VendDialog dialog_;
  mutable Mutex mutex_;
  std::optional<VendDialogButton> selectedButton_ GUARDED_BY(mutex_);
  bool performDefaultActions_ GUARDED_BY(mutex_) = true;
  std::optional<std::int64_t> dismissalExitCode_ GUARDED_BY(mutex_);
};

}  // namespace larder
