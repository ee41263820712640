#include "store-runtime/services/VendDialogOperation.h"

#include <chrono>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/services/VendServiceProxy.h"
#include "store-runtime/services/VendUIService.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "VendDialogOperation";

// How often a waiting operation looks whether it has been cancelled or
// taken down.
constexpr std::chrono::milliseconds kCancelPollInterval{100};

// Lives as long as the longer of the waiting operation and the reply, so a
// late reply never signals a semaphore that is gone.
struct PendingAnswer {
  DispatchSemaphore answered;
  Mutex mutex;
  std::int64_t exitCode = VendDialogButton::kCancel;
};

}  // namespace

VendDialogOperation::VendDialogOperation(VendDialog dialog, VendStoreClient storeClient)
    : VendOperation(std::move(storeClient)), dialog_(std::move(dialog)) {}

std::shared_ptr<VendDialogOperation> VendDialogOperation::operationWithDialog(
    VendDialog dialog, VendStoreClient storeClient) {
  return std::make_shared<VendDialogOperation>(std::move(dialog), std::move(storeClient));
}

std::optional<VendDialogButton> VendDialogOperation::selectedButton() const {
  MutexLock lock(mutex_);
  return selectedButton_;
}

void VendDialogOperation::setPerformDefaultActions(bool performDefaultActions) {
  MutexLock lock(mutex_);
  performDefaultActions_ = performDefaultActions;
}

bool VendDialogOperation::performDefaultActions() const {
  MutexLock lock(mutex_);
  return performDefaultActions_;
}

void VendDialogOperation::dismissWithExitCode(std::int64_t exitCode) {
  {
    MutexLock lock(mutex_);
    dismissalExitCode_ = exitCode;
  }
  // At once, for a dialog that is up; the waiting run sends it again for
  // one still on its way.
  serviceProxy()->uiService()->dismissDialog(dialog_, exitCode);
}

std::optional<std::int64_t> VendDialogOperation::dismissalExitCode() const {
  MutexLock lock(mutex_);
  return dismissalExitCode_;
}

void VendDialogOperation::run() {
  if (isCancelled()) {
    TILL_LOG(2, "%@: Dialog %@ not shown: the operation was cancelled", kSpeaker,
             dialog_.identifier());
    setError(VendError::make(VendError::kCancelledCode, std::nullopt,
                             "The dialog was not shown: the operation was cancelled."));
    return;
  }
  if (dismissalExitCode()) {
    TILL_LOG(2, "%@: Dialog %@ not shown: it was taken down before it went up", kSpeaker,
             dialog_.identifier());
    setError(VendError::make(VendError::kCancelledCode, std::nullopt,
                             "The dialog was taken down before it was shown."));
    return;
  }
  TILL_LOG(3, "%@: Running dialog %@ \"%@\" (default actions %@)", kSpeaker, dialog_.identifier(),
           dialog_.message(), performDefaultActions() ? "on" : "off");
  recordExitCode(waitForExitCode());
}

std::int64_t VendDialogOperation::waitForExitCode() {
  std::shared_ptr<VendUIService> ui = serviceProxy()->uiService();
  auto pending = std::make_shared<PendingAnswer>();
  ui->displayDialog(dialog_, delegate(), [pending](std::int64_t exitCode) {
    {
      MutexLock lock(pending->mutex);
      pending->exitCode = exitCode;
    }
    pending->answered.signal();
  });
  bool dismissedOnCancel = false;
  while (!pending->answered.waitFor(kCancelPollInterval)) {
    if (!dismissedOnCancel && isCancelled()) {
      TILL_LOG(2, "%@: Operation cancelled; taking dialog %@ down", kSpeaker, dialog_.identifier());
      ui->dismissDialog(dialog_, VendDialogButton::kCancel);
      dismissedOnCancel = true;
    }
    if (const std::optional<std::int64_t> exitCode = dismissalExitCode()) {
      ui->dismissDialog(dialog_, *exitCode);
    }
  }
  MutexLock lock(pending->mutex);
  return pending->exitCode;
}

void VendDialogOperation::recordExitCode(std::int64_t exitCode) {
  std::optional<VendDialogButton> button = dialog_.buttonForExitCode(exitCode);
  {
    MutexLock lock(mutex_);
    selectedButton_ = button;
  }
  if (!button) {
    TILL_LOG(2, "%@: Dialog %@ ended with exit code %@ and no button of its own", kSpeaker,
             dialog_.identifier(), exitCode);
    setError(VendError::make(VendError::kCancelledCode, std::nullopt,
                             "The dialog ended without a choice."));
    setSuccess(false);
    return;
  }
  TILL_LOG(2, "%@: Dialog %@ ended with button \"%@\" (%@)", kSpeaker, dialog_.identifier(),
           button->title, exitCode);
  setSuccess(true);
}

}  // namespace larder
