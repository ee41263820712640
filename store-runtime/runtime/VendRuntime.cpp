#include "store-runtime/runtime/VendRuntime.h"

#include "store-runtime/accounts/VendAccountStore.h"
#include "store-runtime/core/VendElasticQueue.h"
#include "store-runtime/download/VendDownloadManager.h"
#include "store-runtime/http/VendURLBag.h"

namespace larder {
namespace {

Mutex& sharedRuntimeMutex() {
  static Mutex mutex;
  return mutex;
}

std::shared_ptr<VendRuntime>& sharedRuntimeSlot() {
  static std::shared_ptr<VendRuntime> runtime;
  return runtime;
}

}  // namespace

VendRuntime::VendRuntime(VendRuntimeConfiguration configuration)
    : configuration_(std::move(configuration)),
      urlBag_(std::make_unique<VendURLBag>(configuration_)),
      accountStore_(std::make_unique<VendAccountStore>(configuration_)),
      downloadManager_(std::make_unique<VendDownloadManager>(configuration_)),
      serviceQueue_(std::make_shared<VendElasticQueue>("com.orvane.larderd.VendServices")) {}

VendRuntime::~VendRuntime() = default;

std::shared_ptr<VendRuntime> VendRuntime::shared() {
  MutexLock lock(sharedRuntimeMutex());
  auto& runtime = sharedRuntimeSlot();
  if (!runtime)
    runtime = std::make_shared<VendRuntime>(VendRuntimeConfiguration::fromEnvironment());
  return runtime;
}

void VendRuntime::setShared(std::shared_ptr<VendRuntime> runtime) {
  MutexLock lock(sharedRuntimeMutex());
  sharedRuntimeSlot() = std::move(runtime);
}

void VendRuntime::setDialogPresenter(std::shared_ptr<VendDialogPresenter> presenter) {
  MutexLock lock(hooksMutex_);
  dialogPresenter_ = std::move(presenter);
}

std::shared_ptr<VendDialogPresenter> VendRuntime::dialogPresenter() const {
  MutexLock lock(hooksMutex_);
  return dialogPresenter_;
}

void VendRuntime::setAssetService(std::shared_ptr<VendAssetService> service) {
  MutexLock lock(hooksMutex_);
  assetService_ = std::move(service);
}

std::shared_ptr<VendAssetService> VendRuntime::assetService() const {
  MutexLock lock(hooksMutex_);
  return assetService_;
}

}  // namespace larder
