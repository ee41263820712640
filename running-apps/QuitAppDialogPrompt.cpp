#include "running-apps/QuitAppDialogPrompt.h"

#include "platform/log/TillLogManager.h"
#include "running-apps/VendQuitAppDialogOperation.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "QuitAppDialogPrompt";

bool isButton(const VendDialogButton& selected, const std::optional<VendDialogButton>& button) {
  return button && selected.isEqual(*button, true);
}

}  // namespace

QuitAppDialogPrompt::QuitAppDialogPrompt(VendStoreClient storeClient)
    : storeClient_(std::move(storeClient)) {}

AppHelperQuitPrompt::Answer QuitAppDialogPrompt::run(
    const std::vector<std::shared_ptr<RunningApplication>>& appsToQuit, bool allowUserToSkip,
    const std::vector<SysupQuaymartUpdate>& osUpdates, bool* didForceFinish) {
  std::optional<std::vector<SysupQuaymartUpdate>> updates;
  if (!osUpdates.empty()) updates = osUpdates;
  std::shared_ptr<VendQuitAppDialogOperation> operation =
      VendQuitAppDialogOperation::operationWithAppsToQuit(appsToQuit, allowUserToSkip, updates,
                                                          storeClient_);
  {
    MutexLock lock(mutex_);
    showing_ = operation;
  }
  OptionalError error;
  operation->runSyncReturningError(&error);
  {
    MutexLock lock(mutex_);
    showing_.reset();
  }
  const bool forced = operation->didForceFinish();
  if (didForceFinish) *didForceFinish = forced;
  const std::optional<VendDialogButton> selected = operation->selectedButton();
  const VendDialog& dialog = operation->dialog();
  // A button the user chose counts even when an application quit at the
  // same moment.
  Answer answer = Answer::kNone;
  if (selected) {
    if (isButton(*selected, dialog.okButton())) answer = Answer::kQuit;
    if (isButton(*selected, dialog.cancelButton())) answer = Answer::kCancel;
    if (isButton(*selected, dialog.otherButton())) answer = Answer::kSkip;
  }
  TILL_LOG(2, "%@: Quit dialog %@ ended with %@ (forced %@, error %@)", kSpeaker,
           dialog.identifier(), selected ? selected->title : std::string("no button"), forced,
           error ? error->descriptionText() : std::string("none"));
  return answer;
}

void QuitAppDialogPrompt::forceFinish() {
  std::shared_ptr<VendQuitAppDialogOperation> operation;
  {
    MutexLock lock(mutex_);
    operation = showing_;
  }
  if (!operation) {
    TILL_LOG(3, "%@: No quit dialog up; nothing to finish", kSpeaker);
    return;
  }
  operation->forceFinish();
}

}  // namespace larder
