#include "store-runtime/services/VendOperation.h"

#include <exception>

#include "platform/log/TillLogManager.h"
#include "store-runtime/accounts/VendAccountStore.h"
#include "store-runtime/http/VendURLBag.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendServiceProxy.h"

namespace larder {
namespace {
constexpr std::string_view kSpeaker = "VendOperation";
}

VendOperation::VendOperation(VendStoreClient storeClient)
    : storeClient_(std::move(storeClient)), requiredBagType_(storeClient_.requiredBagType()) {}

void VendOperation::setSuccess(bool success) {
  MutexLock lock(mutex_);
  success_ = success;
}

bool VendOperation::success() const {
  MutexLock lock(mutex_);
  return success_;
}

void VendOperation::setError(OptionalError error) {
  MutexLock lock(mutex_);
  error_ = std::move(error);
}

OptionalError VendOperation::error() const {
  MutexLock lock(mutex_);
  return error_;
}

void VendOperation::setCompletionHandler(CompletionHandler handler) {
  MutexLock lock(mutex_);
  completionHandler_ = std::move(handler);
}

void VendOperation::setDelegate(std::shared_ptr<VendOperationDelegate> delegate) {
  MutexLock lock(mutex_);
  delegate_ = std::move(delegate);
}

std::shared_ptr<VendOperationDelegate> VendOperation::delegate() const {
  MutexLock lock(mutex_);
  return delegate_;
}

bool VendOperation::isCancelled() const {
  if (cancelled_) return true;
  const VendOperation* parent = parent_.load();
  return parent != nullptr && parent->isCancelled();
}

std::shared_ptr<VendServiceProxy> VendOperation::serviceProxy() {
  MutexLock lock(mutex_);
  if (!serviceProxy_) serviceProxy_ = std::make_shared<VendServiceProxy>(storeClient_);
  return serviceProxy_;
}

std::optional<VendAccount> VendOperation::storeAccount() {
  return serviceProxy()->runtime()->accountStore().primaryAccount();
}

PlistValue VendOperation::valueForURLBagKey(std::string_view key) {
  return serviceProxy()->runtime()->urlBag().valueForKey(requiredBagType(), key);
}

void VendOperation::reportProgress(double fraction) {
  if (auto observer = delegate()) observer->operationUpdatedProgress(*this, fraction);
}

bool VendOperation::runSubOperation(VendOperation& subOperation, OptionalError* error) {
  // The work runs for this operation, so it reads the bag this one reads:
  // an update check's request URL must come from the bag its switches came
  // from.
  subOperation.setRequiredBagType(requiredBagType());
  subOperation.parent_ = this;
  subOperation.start();
  subOperation.parent_ = nullptr;
  if (error) *error = subOperation.error();
  return subOperation.success();
}

bool VendOperation::runSyncReturningError(OptionalError* error) {
  start();
  if (error) *error = this->error();
  return success();
}

void VendOperation::start() {
  if (started_.exchange(true)) return;
  runOnce();
  finish();
}

void VendOperation::runOnce() {
  try {
    run();
  } catch (const std::exception& exception) {
    TILL_LOG(1, "%@: Exception running %@ - %@", kSpeaker, storeClient_.identifier(),
             exception.what());
    failForException(exception.what());
  } catch (...) {
    TILL_LOG(1, "%@: Unknown exception running %@", kSpeaker, storeClient_.identifier());
    failForException("unknown exception");
  }
}

// A run cut short by an exception has failed, whatever it had set before;
// the caller and the delegate learn why unless the run had already said.
void VendOperation::failForException(const std::string& what) {
  setSuccess(false);
  if (!error()) setError(VendError::make(0, std::nullopt, "The operation stopped: " + what));
}

void VendOperation::finish() {
  CompletionHandler handler;
  bool succeeded = false;
  OptionalError failure;
  {
    MutexLock lock(mutex_);
    handler = std::move(completionHandler_);
    completionHandler_ = nullptr;
    succeeded = success_;
    failure = error_;
  }
  if (auto observer = delegate()) {
    if (!succeeded && failure) observer->operationFailedWithError(*this, *failure);
    observer->operationFinished(*this);
  }
  if (handler) handler(*this, succeeded, failure);
}

}  // namespace larder
