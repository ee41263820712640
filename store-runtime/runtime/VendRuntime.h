#pragma once

#include <memory>
#include <string>

#include "platform/system/Mutex.h"
#include "store-runtime/core/VendRuntimeConfiguration.h"

namespace larder {

class VendAccountStore;
class VendAssetService;
class VendDialogPresenter;
class VendDownloadManager;
class VendElasticQueue;
class VendURLBag;

// The process's store runtime: the URL bag, the account store, the
// download layer and the hooks the service installs (dialog presenter,
// asset service). Service proxies and operations take the shared runtime
// when they are made; tests install runtimes of their own.
class VendRuntime {
 public:
  explicit VendRuntime(VendRuntimeConfiguration configuration);
  ~VendRuntime();
  VendRuntime(const VendRuntime&) = delete;
  VendRuntime& operator=(const VendRuntime&) = delete;

  // Made from the environment on first use.
  static std::shared_ptr<VendRuntime> shared();
  static void setShared(std::shared_ptr<VendRuntime> runtime);

  [[nodiscard]] const VendRuntimeConfiguration& configuration() const { return configuration_; }
  [[nodiscard]] VendURLBag& urlBag() { return *urlBag_; }
  [[nodiscard]] VendAccountStore& accountStore() { return *accountStore_; }
  [[nodiscard]] VendDownloadManager& downloadManager() { return *downloadManager_; }
  // Where the services run their calls. A call may wait without a time
  // limit, for a person (a sign-in dialog) or for another service call it
  // made (a purchase waits for the sign-in), so every call gets a thread of
  // its own when none is idle: no call waits behind another.
  [[nodiscard]] const std::shared_ptr<VendElasticQueue>& serviceQueue() const {
    return serviceQueue_;
  }

  void setDialogPresenter(std::shared_ptr<VendDialogPresenter> presenter);
  // Null until the service installs one.
  [[nodiscard]] std::shared_ptr<VendDialogPresenter> dialogPresenter() const;
  void setAssetService(std::shared_ptr<VendAssetService> service);
  [[nodiscard]] std::shared_ptr<VendAssetService> assetService() const;

 private:
  VendRuntimeConfiguration configuration_;
  std::unique_ptr<VendURLBag> urlBag_;
  std::unique_ptr<VendAccountStore> accountStore_;
  std::unique_ptr<VendDownloadManager> downloadManager_;
  std::shared_ptr<VendElasticQueue> serviceQueue_;
  mutable Mutex hooksMutex_;
  std::shared_ptr<VendDialogPresenter> dialogPresenter_ GUARDED_BY(hooksMutex_);
  std::shared_ptr<VendAssetService> assetService_ GUARDED_BY(hooksMutex_);
};

}  // namespace larder
