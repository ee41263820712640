#pragma once

#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

// The client's preference overrides in the service's own domain
// (`kDaemonDefaultsID`): the user's file
// ($XDG_CONFIG_HOME/larder/com.orvane.larderd.plist) first, then the
// system's (<root>/etc/larder/com.orvane.larderd.plist). Read at each use,
// never cached, so that a changed preference counts from the next timer
// that is made.
class DAAPClientPreferences {
 public:
  // Seconds between polls; overrides the bag's "update-polling-frequency-secs".
  static constexpr std::string_view kDefaultsDAAPPollingIntervalKey = "DAAPPollingInterval";
  // Minutes between forced refreshes; overrides the bag's
  // "forced-refresh-frequency-minutes".
  static constexpr std::string_view kDefaultsDAAPForcedRefreshIntervalKey =
      "DAAPForcedRefreshInterval";

  // The value under `key`, null when neither scope has it.
  static PlistValue valueForKey(std::string_view key);

  static std::string userPreferencesPath();
  static std::string systemPreferencesPath();

 private:
  static PlistValue valueInFile(const std::string& path, std::string_view key);
};

}  // namespace larder
