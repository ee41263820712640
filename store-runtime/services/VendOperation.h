#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string_view>

#include "platform/error/VendError.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/accounts/VendAccount.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/services/VendOperationDelegate.h"

namespace larder {

class VendServiceProxy;

// One unit of work of the store runtime. A subclass overrides `run`, which
// does the work on the operation's thread and records the outcome with
// `setSuccess` and `setError`; the base class runs it once, tells the
// delegate and calls the completion handler. A `run` that ends without
// `setSuccess(true)` has failed.
class VendOperation : public std::enable_shared_from_this<VendOperation> {
 public:
  using CompletionHandler =
      std::function<void(VendOperation& operation, bool success, const OptionalError& error)>;

  explicit VendOperation(VendStoreClient storeClient);
  virtual ~VendOperation() = default;
  VendOperation(const VendOperation&) = delete;
  VendOperation& operator=(const VendOperation&) = delete;

  [[nodiscard]] const VendStoreClient& storeClient() const { return storeClient_; }

  void setSuccess(bool success);
  [[nodiscard]] bool success() const;
  void setError(OptionalError error);
  [[nodiscard]] OptionalError error() const;

  // Called once, after `run` has ended, with the outcome.
  void setCompletionHandler(CompletionHandler handler);
  // Held strongly until cleared; callers clear it after a run.
  void setDelegate(std::shared_ptr<VendOperationDelegate> delegate);
  [[nodiscard]] std::shared_ptr<VendOperationDelegate> delegate() const;

  // Runs `subOperation` within this one, on this thread, and gives its
  // success and error. The sub-operation takes this one's required bag
  // type. This operation's own outcome does not change.
  bool runSubOperation(VendOperation& subOperation, OptionalError* error);
  // Runs this operation on the calling thread, outside any queue.
  bool runSyncReturningError(OptionalError* error);

  // A cancel request reaches the operations this one runs as well.
  void cancel() { cancelled_ = true; }
  [[nodiscard]] bool isCancelled() const;

  // The services of the operation's store client, made on first use.
  std::shared_ptr<VendServiceProxy> serviceProxy();
  // The primary account, if one is signed in.
  std::optional<VendAccount> storeAccount();
  // The value under `key` in the URL bag of `requiredBagType`; null when the
  // bag cannot be loaded or lacks the key.
  PlistValue valueForURLBagKey(std::string_view key);

  // That of the store client unless set.
  void setRequiredBagType(std::int64_t type) { requiredBagType_.store(type); }
  [[nodiscard]] std::int64_t requiredBagType() const { return requiredBagType_.load(); }

  // For the queue: runs the operation once; later calls do nothing.
  void start();
  [[nodiscard]] bool hasRun() const { return started_.load(); }

 protected:
  // Overridden by subclasses; the base operation does nothing (and so fails).
  virtual void run() {}

  // Tells the delegate of progress, 0 to 1.
  void reportProgress(double fraction);

 private:
  void runOnce();
  void failForException(const std::string& what);
  void finish();

  VendStoreClient storeClient_;
  mutable Mutex mutex_;
  bool success_ GUARDED_BY(mutex_) = false;
  OptionalError error_ GUARDED_BY(mutex_);
  CompletionHandler completionHandler_ GUARDED_BY(mutex_);
  std::shared_ptr<VendOperationDelegate> delegate_ GUARDED_BY(mutex_);
  std::shared_ptr<VendServiceProxy> serviceProxy_ GUARDED_BY(mutex_);
  std::atomic<std::int64_t> requiredBagType_{0};
  std::atomic<bool> started_{false};
  std::atomic<bool> cancelled_{false};
  // The operation running this one as a sub-operation, while it does.
  std::atomic<const VendOperation*> parent_{nullptr};
};

}  // namespace larder
