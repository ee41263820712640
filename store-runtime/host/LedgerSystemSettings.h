#pragma once

#include <optional>
#include <string>

#include "platform/value/PlistValue.h"

namespace larder {

// Settings of the machine that belong to its administrator, as small
// property lists under the platform root:
//
//   <root>/etc/larder/power-settings.plist       the system power settings
//   <root>/etc/larder/configuration-profiles.plist  what a management profile
//                                                  installed ("areMajorOSUpdatesManaged")
//
// Read afresh at every call; a missing or damaged file is no setting.
class LedgerSystemSettings {
 public:
  static PlistDictionary systemPowerSettings();
  // The configuration profile service's answer: the boolean
  // "areMajorOSUpdatesManaged" of the profiles file, false when absent.
  static bool areMajorOSUpdatesManaged();

  static std::string powerSettingsPath();
  static std::string configurationProfilesPath();
};

}  // namespace larder
