#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/PlistValue.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"

namespace larder {

// The privileged helper: it writes what belongs to all users of the
// machine. Calls return nothing; a write that fails is logged. Here the
// helper writes directly, atomically, below the platform root:
//
//   <root>/etc/larder/<kSystemPreferencesDomain>.plist
//       system-scope preferences of the service's domain (keys below)
//   <root>/var/lib/larder-platform/locked-file-paths.plist
//       array of paths that must not be opened while they are replaced
//
// Placeholders of the launcher bar are also made through the helper; they
// land in the launcher bar's state (LedgerDockMessaging).
class LedgerRootHelper {
 public:
  static constexpr std::string_view kSystemPreferencesDomain = kDaemonDefaultsID;

  // Keys the helper writes in that domain.
  static constexpr std::string_view kAutoUpdateEnabledKey = kDefaultsAutoUpdateEnabledKey;
  static constexpr std::string_view kAutoUpdateEnabledMajorOSVersionKey =
      kDefaultsAutoUpdateEnabledMajorOSVersionKey;
  static constexpr std::string_view kAutoUpdateRestartRequiredEnabledKey =
      kDefaultsAutoUpdateRestartRequiredEnabledKey;
  static constexpr std::string_view kAutoUpdateRestartRequiredMajorOSVersionKey =
      kDefaultsAutoUpdateRestartRequiredMajorOSVersionKey;
  static constexpr std::string_view kLastDoItLaterLogoutFailedKey =
      kDefaultsLastDoItLaterLogoutFailedKey;
  static constexpr std::string_view kOVPInviteURLKey = "OVPInviteURL";
  static constexpr std::string_view kOVPInviteOrgNameKey = "OVPInviteOrgName";

  class Proxy {
   public:
    // Stores the boolean together with the current OS major version, so
    // that a refusal can be asked again after a major upgrade.
    void setAutoUpdateEnabledPreference(bool enabled);
    void setAutoUpdateRestartRequiredEnabledPreference(bool enabled);
    // Adds the paths to the locked list (true) or takes them out (false).
    void updateLockedFilePaths(const std::vector<std::string>& paths, bool addOrDelete);
    void setLastDoItLaterLogoutFailed(bool failed);
    // Removes the stored organisation invitation (URL and name).
    void deleteOVPInviteFromPreferences();
    void createPlaceholderWithName(std::string_view name, std::int64_t identifier,
                                   const PlistData& iconData);
    void removePlaceholderWithName(std::string_view name);
  };

  static LedgerRootHelper& sharedInstance();
  Proxy& proxy() { return proxy_; }

  static std::string systemPreferencesPath();
  static std::string lockedFilePathsPath();

 private:
  LedgerRootHelper() = default;
  Proxy proxy_;
};

}  // namespace larder
