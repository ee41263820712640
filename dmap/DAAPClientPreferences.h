#pragma once

#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

// The client's preference overrides in the service's own domain
// (`kDaemonDefaultsID`), as an application sees them: the user's value,
// else the machine's. Read at each use, never cached, so that a changed
// preference counts from the next timer that is made.
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
};

}  // namespace larder
