#pragma once

#include <memory>
#include <vector>

#include "platform/system/Mutex.h"
#include "running-apps/AppHelper.h"
#include "store-runtime/core/VendStoreClient.h"

namespace larder {

class VendQuitAppDialogOperation;

// The quit prompt of a take-down as the user sees it: a quit dialog shown
// through the store client's UI service, its buttons read back as answers.
class QuitAppDialogPrompt final : public AppHelperQuitPrompt {
 public:
  explicit QuitAppDialogPrompt(VendStoreClient storeClient);

  Answer run(const std::vector<std::shared_ptr<RunningApplication>>& appsToQuit,
             bool allowUserToSkip, const std::vector<SysupQuaymartUpdate>& osUpdates,
             bool* didForceFinish) override;
  void forceFinish() override;

 private:
  const VendStoreClient storeClient_;
  Mutex mutex_;
  // The dialog of the run in progress; none between runs, when a late
  // `forceFinish` has nothing to take down.
  std::shared_ptr<VendQuitAppDialogOperation> showing_ GUARDED_BY(mutex_);
};

}  // namespace larder
