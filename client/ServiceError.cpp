#include "client/ServiceError.h"

namespace larder {

ServiceError::ServiceError(std::string_view name, const std::string& message)
    : std::runtime_error(message), name_(name) {}

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

}  // namespace larder
