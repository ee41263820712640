#include "client/ServiceError.h"

#include <algorithm>
#include <array>

namespace larder {

namespace {

constexpr std::array kNames = std::to_array<ServiceError::Name>({
    {ServiceError::kNoStoreClient, 1, "the connection has not called SetStoreClient"},
    {ServiceError::kNotAvailable, 2, "the object that would answer is not part of this build"},
    {ServiceError::kFailed, 3, "the work failed in a way it could not answer itself"},
    {ServiceError::kInvalidArguments, 4, "an argument has the right type but a refused value"},
    {ServiceError::kUnknownRequest, 5, "no such request on that interface"},
    {ServiceError::kStopping, 6, "the service is stopping; the request was not done"},
});

}  // namespace

ServiceError::ServiceError(std::string_view name, const std::string& message)
    : sdbus::Error(std::string(name), message) {}

std::span<const ServiceError::Name> ServiceError::names() {
  return kNames;
}

ServiceError ServiceError::noStoreClient(std::string_view request) {
  return {kNoStoreClient,
          std::string(request) + " needs a store client: call SetStoreClient first"};
}

ServiceError ServiceError::notAvailable(std::string_view request) {
  return {kNotAvailable, std::string(request) + " is not available in this build"};
}

ServiceError ServiceError::failed(std::string_view why) {
  return {kFailed, std::string(why)};
}

ServiceError ServiceError::invalidArguments(std::string_view why) {
  return {kInvalidArguments, std::string(why)};
}

ServiceError ServiceError::unknownRequest(std::string_view interfaceName, std::string_view member) {
  return {kUnknownRequest, std::string(interfaceName) + " has no request " + std::string(member)};
}

ServiceError ServiceError::stopping(std::string_view request) {
  return {kStopping, std::string(request) + " was not done: the service is stopping"};
}

VendError ServiceError::toVendError(const sdbus::Error& error) {
  const auto* known = std::ranges::find(kNames, error.getName(), &Name::name);
  if (known == kNames.end()) return VendError::withDomain(error.getName(), 0, error.getMessage());
  return VendError::withDomain(std::string(kDomain), known->code, error.getMessage());
}

}  // namespace larder
