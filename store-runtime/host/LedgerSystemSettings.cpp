#include "store-runtime/host/LedgerSystemSettings.h"

#include <string_view>

#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerSystemSettings";
constexpr std::string_view kMajorOSUpdatesManagedKey = "areMajorOSUpdatesManaged";

}  // namespace

std::string LedgerSystemSettings::powerSettingsPath() {
  return Environment::rootedPath("/etc/larder/power-settings.plist");
}

std::string LedgerSystemSettings::configurationProfilesPath() {
  return Environment::rootedPath("/etc/larder/configuration-profiles.plist");
}

// Read as state files: the size limit and the damaged-file rule are theirs, and a tool that
// changes them through PlatformStateFile lands each change by atomic rename.
PlistDictionary LedgerSystemSettings::systemPowerSettings() {
  return PlatformStateFile(powerSettingsPath()).readDictionary();
}

bool LedgerSystemSettings::areMajorOSUpdatesManaged() {
  const PlistDictionary profiles = PlatformStateFile(configurationProfilesPath()).readDictionary();
  const auto managed = profiles.find(kMajorOSUpdatesManagedKey);
  const bool answer =
      managed != profiles.end() && managed->second.isBoolean() && managed->second.boolValue();
  TILL_LOG(3, "%@: Major OS updates managed: %@", kSpeaker, answer);
  return answer;
}

}  // namespace larder
