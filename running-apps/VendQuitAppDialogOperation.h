#pragma once

#include <memory>
#include <optional>
#include <vector>

#include "platform/system/Mutex.h"
#include "running-apps/RunningApplication.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"
#include "store-runtime/services/VendDialogOperation.h"

namespace larder {

// The dialog that asks the user to quit the applications an update needs
// closed: OK quits them, cancel stops the update, and the other button
// (when the user may skip) leaves them running and their updates aside.
//
// An application that quits by itself while the dialog is up makes the
// question moot: `forceFinish` takes the dialog down, and the run then ends
// with no selected button and `didForceFinish` true.
class VendQuitAppDialogOperation : public VendDialogOperation {
 public:
  VendQuitAppDialogOperation(VendDialog dialog, VendStoreClient storeClient);

  // `osUpdates`: the OS updates that are to be installed with the apps'
  // updates; skipping an application one of them needs closed skips those.
  static std::shared_ptr<VendQuitAppDialogOperation> operationWithAppsToQuit(
      const std::vector<std::shared_ptr<RunningApplication>>& apps, bool allowUserToSkip,
      const std::optional<std::vector<SysupQuaymartUpdate>>& osUpdates,
      VendStoreClient storeClient);

  [[nodiscard]] bool didForceFinish() const;
  void setDidForceFinish(bool didForceFinish);

  // Takes the dialog down without an answer; any thread, while `run`
  // blocks on another. Returns at once.
  void forceFinish();

 private:
  mutable Mutex mutex_;
  bool didForceFinish_ GUARDED_BY(mutex_) = false;
};

}  // namespace larder
