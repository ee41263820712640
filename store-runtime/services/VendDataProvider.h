#pragma once

#include <memory>

#include "platform/error/VendError.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/http/VendURLResponse.h"

namespace larder {

// Turns the bytes of an answer into the output of a URL operation. The
// base provider's output is the bytes themselves, as data.
class VendDataProvider {
 public:
  explicit VendDataProvider(VendStoreClient storeClient) : storeClient_(std::move(storeClient)) {}
  virtual ~VendDataProvider() = default;

  static std::shared_ptr<VendDataProvider> providerWithStoreClient(VendStoreClient storeClient) {
    return std::make_shared<VendDataProvider>(std::move(storeClient));
  }

  [[nodiscard]] const VendStoreClient& storeClient() const { return storeClient_; }

  // Sets the output; false with an error when the bytes cannot be used.
  virtual bool parseData(const PlistData& data, OptionalError* error);

  [[nodiscard]] const PlistValue& output() const { return output_; }
  void setOutput(PlistValue output) { output_ = std::move(output); }

  // The head of the answer being parsed, for providers that look at it.
  [[nodiscard]] const VendURLResponse& response() const { return response_; }
  void setResponse(VendURLResponse response) { response_ = std::move(response); }

  // Copies the settings of another provider of the same kind.
  virtual void configureFromProvider(const VendDataProvider& /*other*/) {}
  // Takes over the results of a provider that was used inside this one.
  virtual void migrateOutputFromSubProvider(const VendDataProvider& subProvider) {
    output_ = subProvider.output();
  }

 private:
  VendStoreClient storeClient_;
  PlistValue output_;
  VendURLResponse response_;
};

}  // namespace larder
