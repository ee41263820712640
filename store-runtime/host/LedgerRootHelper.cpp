#include "store-runtime/host/LedgerRootHelper.h"

#include <algorithm>

#include "platform/log/TillLogManager.h"
#include "store-runtime/host/LedgerDockMessaging.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/host/VendDevice.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerRootHelper";

void updateSystemPreferences(const std::function<void(PlistDictionary&)>& change) {
  if (!PlatformStateFile(LedgerRootHelper::systemPreferencesPath()).updateDictionary(change)) {
    TILL_LOG(1, "%@: Cannot write the system preferences at %@", kSpeaker,
             LedgerRootHelper::systemPreferencesPath());
  }
}

void setBooleanWithOSVersion(std::string_view key, std::string_view versionKey, bool value) {
  std::string version = VendDevice::osMajorVersionString();
  TILL_LOG(2, "%@: Setting %@ to %d for OS %@", kSpeaker, key, value, version);
  updateSystemPreferences([&](PlistDictionary& preferences) {
    preferences[std::string(key)] = value;
    preferences[std::string(versionKey)] = version;
  });
}

std::vector<std::string> stringsOf(const PlistValue& value) {
  std::vector<std::string> strings;
  if (const PlistArray* array = value.array()) {
    for (const PlistValue& element : *array) {
      if (const std::string* text = element.string()) strings.push_back(*text);
    }
  }
  return strings;
}

}  // namespace

LedgerRootHelper& LedgerRootHelper::sharedInstance() {
  static LedgerRootHelper instance;
  return instance;
}

std::string LedgerRootHelper::systemPreferencesPath() {
  return PreferenceStore::pathFor(kSystemPreferencesDomain, PreferenceScope::System);
}

std::string LedgerRootHelper::lockedFilePathsPath() {
  return PlatformStateFile::pathForName("locked-file-paths.plist");
}

void LedgerRootHelper::Proxy::setAutoUpdateEnabledPreference(bool enabled) {
  setBooleanWithOSVersion(kAutoUpdateEnabledKey, kAutoUpdateEnabledMajorOSVersionKey, enabled);
}

void LedgerRootHelper::Proxy::setAutoUpdateRestartRequiredEnabledPreference(bool enabled) {
  setBooleanWithOSVersion(kAutoUpdateRestartRequiredEnabledKey,
                          kAutoUpdateRestartRequiredMajorOSVersionKey, enabled);
}

void LedgerRootHelper::Proxy::setLastDoItLaterLogoutFailed(bool failed) {
  TILL_LOG(2, "%@: Setting last Do It Later logout failed to %d", kSpeaker, failed);
  updateSystemPreferences([&](PlistDictionary& preferences) {
    preferences[std::string(kLastDoItLaterLogoutFailedKey)] = failed;
  });
}

void LedgerRootHelper::Proxy::deleteOVPInviteFromPreferences() {
  TILL_LOG(2, "%@: Deleting the stored organisation invitation", kSpeaker);
  updateSystemPreferences([](PlistDictionary& preferences) {
    preferences.erase(std::string(kOVPInviteURLKey));
    preferences.erase(std::string(kOVPInviteOrgNameKey));
  });
}

void LedgerRootHelper::Proxy::updateLockedFilePaths(const std::vector<std::string>& paths,
                                                    bool addOrDelete) {
  TILL_LOG(2, "%@: %@ %ld locked file paths", kSpeaker, addOrDelete ? "Adding" : "Removing",
           paths.size());
  bool written = PlatformStateFile(lockedFilePathsPath()).updateValue([&](PlistValue& stored) {
    std::vector<std::string> locked = stringsOf(stored);
    for (const std::string& path : paths) {
      auto found = std::find(locked.begin(), locked.end(), path);
      if (addOrDelete && found == locked.end()) locked.push_back(path);
      if (!addOrDelete && found != locked.end()) locked.erase(found);
    }
    stored = PlistArray(locked.begin(), locked.end());
  });
  if (!written) TILL_LOG(1, "%@: Cannot write the locked file paths", kSpeaker);
}

void LedgerRootHelper::Proxy::createPlaceholderWithName(std::string_view name,
                                                        std::int64_t identifier,
                                                        const PlistData& iconData) {
  LedgerDockMessaging::sharedInstance().createPlaceholderWithName(name, identifier, iconData);
}

void LedgerRootHelper::Proxy::removePlaceholderWithName(std::string_view name) {
  LedgerDockMessaging::sharedInstance().removePlaceholderWithName(name);
}

}  // namespace larder
