#include "store-runtime/services/VendRuntime.h"

#include <cstdlib>

#include "platform/system/Environment.h"
#include "store-runtime/accounts/VendAccountStore.h"
#include "store-runtime/core/VendElasticQueue.h"
#include "store-runtime/dialogs/VendCancellingDialogPresenter.h"
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

VendRuntimeConfiguration VendRuntimeConfiguration::fromEnvironment() {
  VendRuntimeConfiguration configuration;
  configuration.bagURL = Environment::variable("LARDER_STORE_URL");
  configuration.stateDirectory = Environment::stateDirectory();
  configuration.downloadsDirectory = Environment::cacheHome() + "/com.orvane.larderd/Downloads";
  const std::string timeout = Environment::variable("LARDER_STORE_TIMEOUT");
  if (!timeout.empty()) {
    const double seconds = std::strtod(timeout.c_str(), nullptr);
    if (seconds > 0) configuration.requestTimeout = seconds;
  }
  return configuration;
}

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
  if (dialogPresenter_) return dialogPresenter_;
  static const auto cancelling = std::make_shared<VendCancellingDialogPresenter>();
  return cancelling;
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
