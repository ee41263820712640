#pragma once

#include <chrono>
#include <string>

namespace larder {

// Where the runtime talks to and keeps its files.
struct VendRuntimeConfiguration {
  // The URL of the store's URL bag (LARDER_STORE_URL); empty: no store.
  std::string bagURL;
  // accounts.plist lives here ($XDG_STATE_HOME/larder).
  std::string stateDirectory;
  // Partial and staged downloads ($XDG_CACHE_HOME/com.orvane.larderd/Downloads).
  std::string downloadsDirectory;
  std::chrono::milliseconds connectTimeout{10000};
  // Seconds without progress after which a store request fails
  // (LARDER_STORE_TIMEOUT).
  double requestTimeout = 60;

  static VendRuntimeConfiguration fromEnvironment();
};

}  // namespace larder
