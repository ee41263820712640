#pragma once

#include <functional>
#include <memory>
#include <optional>

#include "platform/value/PlistValue.h"
#include "store-runtime/http/VendURLRequest.h"
#include "store-runtime/http/VendURLResponse.h"
#include "store-runtime/services/VendDataProvider.h"
#include "store-runtime/services/VendOperation.h"

namespace larder {

// Performs one request. The data provider turns the answer into the
// output, which goes to the delegate's `operationFinishedWithOutput` and
// to the output handler before the operation ends. An answer with a status
// of 400 or more fails with the store's error and reaches no provider.
class VendURLOperation : public VendOperation {
 public:
  using OutputHandler = std::function<void(VendURLOperation& operation, const PlistValue& output)>;

  using VendOperation::VendOperation;

  void setRequest(VendURLRequest request) { request_ = std::move(request); }
  [[nodiscard]] const VendURLRequest& request() const { return request_; }
  void setDataProvider(std::shared_ptr<VendDataProvider> provider) {
    provider_ = std::move(provider);
  }
  // A plain provider (raw bytes) unless one was set.
  [[nodiscard]] std::shared_ptr<VendDataProvider> dataProvider();
  void setOutputHandler(OutputHandler handler) { outputHandler_ = std::move(handler); }

  // The head of the answer, once it has come.
  [[nodiscard]] const std::optional<VendURLResponse>& response() const { return response_; }
  // The answer's bytes as they came.
  [[nodiscard]] const PlistData& rawData() const { return rawData_; }

 protected:
  void run() override;
  // Completes the request before it goes out (URL from the bag, signature).
  virtual bool prepareRequest(VendURLRequest& request, OptionalError* error);
  // Judges a successful answer before it is parsed (signature check).
  virtual bool acceptAnswer(const VendURLResponse& response, const PlistData& body,
                            OptionalError* error);

 private:
  bool perform(const VendURLRequest& request, OptionalError* error);
  void deliver(const PlistValue& output);
  std::shared_ptr<VendURLOperationDelegate> urlDelegate() const;

  VendURLRequest request_;
  std::shared_ptr<VendDataProvider> provider_;
  OutputHandler outputHandler_;
  std::optional<VendURLResponse> response_;
  PlistData rawData_;
};

}  // namespace larder
