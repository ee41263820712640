#include "store-runtime/services/VendServiceProxy.h"

#include "store-runtime/services/VendAccountService.h"
#include "store-runtime/services/VendAssetService.h"
#include "store-runtime/services/VendDownloadService.h"
#include "store-runtime/services/VendTransactionService.h"
#include "store-runtime/services/VendUIService.h"

namespace larder {

VendServiceProxy::VendServiceProxy(VendStoreClient storeClient,
                                   std::shared_ptr<VendRuntime> runtime)
    : storeClient_(std::move(storeClient)), runtime_(std::move(runtime)) {}

std::shared_ptr<VendAccountService> VendServiceProxy::accountService() {
  return std::make_shared<VendAccountService>(storeClient_, runtime_);
}

std::shared_ptr<VendDownloadService> VendServiceProxy::downloadService() {
  return std::make_shared<VendDownloadService>(storeClient_, runtime_);
}

std::shared_ptr<VendTransactionService> VendServiceProxy::transactionService() {
  return std::make_shared<VendTransactionService>(storeClient_, runtime_);
}

std::shared_ptr<VendTransactionService> VendServiceProxy::transactionServiceWithErrorHandler(
    const TransportErrorHandler& /*handler*/) {
  return transactionService();
}

std::shared_ptr<VendUIService> VendServiceProxy::uiService() {
  return std::make_shared<VendUIService>(storeClient_, runtime_);
}

std::shared_ptr<VendAssetService> VendServiceProxy::assetService() {
  return runtime_->assetService();
}

void VendServiceProxy::accountServiceSynchronousBlock(
    const SynchronousBlock<VendAccountService>& block) {
  runSynchronously(*accountService(), block);
}

void VendServiceProxy::downloadServiceSynchronousBlock(
    const SynchronousBlock<VendDownloadService>& block) {
  runSynchronously(*downloadService(), block);
}

void VendServiceProxy::transactionServiceSynchronousBlock(
    const SynchronousBlock<VendTransactionService>& block) {
  runSynchronously(*transactionService(), block);
}

void VendServiceProxy::uiServiceSynchronousBlock(const SynchronousBlock<VendUIService>& block) {
  runSynchronously(*uiService(), block);
}

void VendServiceProxy::assetServiceSynchronousBlock(
    const SynchronousBlock<VendAssetService>& block) {
  if (auto service = assetService()) runSynchronously(*service, block);
}

}  // namespace larder
