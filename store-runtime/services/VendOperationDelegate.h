#pragma once

#include "platform/error/VendError.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/http/VendURLResponse.h"

namespace larder {

class VendOperation;

// Delegates of operations. Every call is optional: the defaults do nothing.
// Calls may arrive on any thread; the receiver does its own locking.
class VendOperationDelegate {
 public:
  virtual ~VendOperationDelegate() = default;
  virtual void operationFailedWithError(VendOperation&, const VendError&) {}
  virtual void operationUpdatedProgress(VendOperation&, double /*fraction*/) {}
  virtual void operationFinished(VendOperation&) {}
};

class VendURLOperationDelegate : public VendOperationDelegate {
 public:
  // The data provider's output, before the operation returns to its caller.
  virtual void operationFinishedWithOutput(VendOperation&, const PlistValue& /*output*/) {}
  virtual void operationDidReceiveResponse(VendOperation&, const VendURLResponse&) {}
  virtual void operationWillSendRequest(VendOperation&, const class VendURLRequest&) {}
};

class VendStoreURLOperationDelegate : public VendURLOperationDelegate {
 public:
  virtual void operationDidAuthenticateWithAccountID(VendOperation&, std::uint64_t /*accountID*/) {}
  virtual bool operationShouldSetStoreFrontID(VendOperation&, const std::string& /*storeFrontID*/) {
    return true;
  }
};

}  // namespace larder
