#pragma once

#include <functional>
#include <memory>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/error/VendError.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/runtime/VendRuntime.h"

namespace larder {

class VendAccountService;
class VendAssetService;
class VendDownloadService;
class VendTransactionService;
class VendUIService;

// The services of one store client. Calls on a plain service are
// asynchronous and reply through their handlers. The synchronous forms
// call the block with the service and a semaphore and return only when
// the block's work has signalled it; that is how a reply becomes a plain
// result inside an operation's `run`.
class VendServiceProxy {
 public:
  template <typename Service>
  using SynchronousBlock = std::function<void(Service& service, DispatchSemaphore& semaphore)>;
  using TransportErrorHandler = std::function<void(const VendError&)>;

  explicit VendServiceProxy(VendStoreClient storeClient,
                            std::shared_ptr<VendRuntime> runtime = VendRuntime::shared());

  [[nodiscard]] const VendStoreClient& storeClient() const { return storeClient_; }
  [[nodiscard]] const std::shared_ptr<VendRuntime>& runtime() const { return runtime_; }

  std::shared_ptr<VendAccountService> accountService();
  std::shared_ptr<VendDownloadService> downloadService();
  std::shared_ptr<VendTransactionService> transactionService();
  // The services run in this process, so there is no transport that could
  // fail apart from the store's, whose failures every reply carries: the
  // handler is kept for callers written against a remote runtime and is
  // never called.
  std::shared_ptr<VendTransactionService> transactionServiceWithErrorHandler(
      const TransportErrorHandler& handler);
  std::shared_ptr<VendUIService> uiService();
  // Null when the service has not installed its asset service.
  std::shared_ptr<VendAssetService> assetService();

  void accountServiceSynchronousBlock(const SynchronousBlock<VendAccountService>& block);
  void downloadServiceSynchronousBlock(const SynchronousBlock<VendDownloadService>& block);
  void transactionServiceSynchronousBlock(const SynchronousBlock<VendTransactionService>& block);
  void uiServiceSynchronousBlock(const SynchronousBlock<VendUIService>& block);
  // Returns at once, without calling the block, when there is no asset service.
  void assetServiceSynchronousBlock(const SynchronousBlock<VendAssetService>& block);

 private:
  template <typename Service>
  static void runSynchronously(Service& service, const SynchronousBlock<Service>& block) {
    DispatchSemaphore semaphore;
    block(service, semaphore);
    semaphore.wait();
  }

  VendStoreClient storeClient_;
  std::shared_ptr<VendRuntime> runtime_;
};

}  // namespace larder
