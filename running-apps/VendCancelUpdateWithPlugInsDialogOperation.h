#pragma once

#include <memory>

#include "running-apps/AppHelper.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/services/VendDialogOperation.h"

namespace larder {

// The dialog that tells the user an application cannot be updated while
// other applications use its plug-ins. It only informs: its one button
// changes nothing, so a caller may queue it and not wait for the answer.
class VendCancelUpdateWithPlugInsDialogOperation : public VendDialogOperation {
 public:
  using VendDialogOperation::VendDialogOperation;

  // `hosts` as AppHelper::isAppRunningWithBundleID gives them: each host
  // application's display name to what the plug-in host knows of the
  // plug-in it runs. Null when there is no host to name.
  static std::shared_ptr<VendDialogOperation> operationWithDictionary(const PlugInHostApps& hosts,
                                                                      VendStoreClient storeClient);
};

}  // namespace larder
