#include "store-runtime/core/VendRuntimeConfiguration.h"

#include <cstdlib>

#include "platform/system/Environment.h"

namespace larder {

VendRuntimeConfiguration VendRuntimeConfiguration::fromEnvironment() {
  VendRuntimeConfiguration configuration;
  configuration.bagURL = Environment::variable("LARDER_STORE_URL");
  configuration.stateDirectory = Environment::stateDirectory();
  configuration.downloadsDirectory = Environment::cacheHome() + "/com.orvane.larderd/Downloads";
  const std::string timeout = Environment::variable("LARDER_STORE_TIMEOUT");
  if (!timeout.empty()) {
    const double seconds = std::strtod(timeout.c_str(), nullptr);
    if (seconds > 0) configuration.requestTimeout = seconds;
  }
  return configuration;
}

}  // namespace larder
