#pragma once

#include <string_view>

namespace larder {

// Restrictions an administrator can set for the store.
inline constexpr std::string_view LedgerRestrictStoreToDisableSoftwareUpdateNotifications =
    "DisableSoftwareUpdateNotifications";
inline constexpr std::string_view LedgerRestrictStoreToRequireAdminForSoftwareInstall =
    "RequireAdminForSoftwareInstall";

// Managed restrictions, from the property list
// "<root>/etc/larder/restrictions.plist": a dictionary from restriction to
// boolean. Read at every call, so a change applies at once; safe from any
// thread.
class VendManagedRestrictions {
 public:
  // True when the file holds true (a boolean, or a non-zero number) for
  // `restriction`. A missing file, a damaged one or any other value means
  // no restriction.
  static bool isRestrictedTo(std::string_view restriction);

  static std::string restrictionsFilePath();
};

}  // namespace larder
