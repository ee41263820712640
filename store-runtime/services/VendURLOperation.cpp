#include "store-runtime/services/VendURLOperation.h"

#include "platform/log/TillLogManager.h"
#include "store-runtime/http/VendHTTPTransfer.h"
#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendServiceProxy.h"

namespace larder {
namespace {
constexpr std::string_view kSpeaker = "VendURLOperation";
}

std::shared_ptr<VendDataProvider> VendURLOperation::dataProvider() {
  if (!provider_) provider_ = VendDataProvider::providerWithStoreClient(storeClient());
  return provider_;
}

std::shared_ptr<VendURLOperationDelegate> VendURLOperation::urlDelegate() const {
  return std::dynamic_pointer_cast<VendURLOperationDelegate>(delegate());
}

bool VendURLOperation::prepareRequest(VendURLRequest& request, OptionalError* error) {
  if (!request.url().empty()) return true;
  if (error) *error = VendStoreAnswer::error(VendStoreAnswer::kNoStore, "The request has no URL");
  return false;
}

bool VendURLOperation::acceptAnswer(const VendURLResponse&, const PlistData&, OptionalError*) {
  return true;
}

void VendURLOperation::run() {
  OptionalError failure;
  VendURLRequest request = request_;
  if (!prepareRequest(request, &failure) || !perform(request, &failure)) {
    TILL_LOG(2, "%@: %@ %@ failed: %@", kSpeaker, request.method(), request.url(),
             failure ? failure->descriptionText() : "no error");
    setError(std::move(failure));
    return;
  }
  setSuccess(true);
}

bool VendURLOperation::perform(const VendURLRequest& request, OptionalError* error) {
  if (auto observer = urlDelegate()) observer->operationWillSendRequest(*this, request);
  if (isCancelled()) {
    VendError cancelled;
    cancelled.code = VendError::kCancelledCode;
    cancelled.description = "The request was cancelled";
    *error = cancelled;
    return false;
  }
  const auto& configuration = serviceProxy()->runtime()->configuration();
  VendHTTPTransfer::Options options;
  options.connectTimeout = configuration.connectTimeout;
  options.onProgress = [this](std::uint64_t, std::uint64_t) { return !isCancelled(); };
  VendURLRequest effective = request;
  // A request that did not choose its own limit gets the runtime's.
  if (request.timeoutInterval() == VendURLRequest::kDefaultTimeoutInterval) {
    effective.setTimeoutInterval(configuration.requestTimeout);
  }
  auto answer = VendHTTPTransfer::perform(effective, options);
  if (answer.error) {
    *error = answer.error;
    return false;
  }
  response_ = answer.response;
  rawData_ = std::move(answer.body);
  if (auto observer = urlDelegate()) observer->operationDidReceiveResponse(*this, *response_);
  if (!response_->isSuccess()) {
    *error = VendStoreAnswer::failure(*response_, rawData_);
    return false;
  }
  if (!acceptAnswer(*response_, rawData_, error)) return false;
  auto provider = dataProvider();
  provider->setResponse(*response_);
  if (!provider->parseData(rawData_, error)) return false;
  deliver(provider->output());
  return true;
}

void VendURLOperation::deliver(const PlistValue& output) {
  if (auto observer = urlDelegate()) observer->operationFinishedWithOutput(*this, output);
  if (outputHandler_) outputHandler_(*this, output);
}

}  // namespace larder
