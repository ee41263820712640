#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

// Questions about the state of the machine and the session, and the few
// small files that go with them. All are read afresh at each call and are
// safe from any thread.

// The machine woke only partly (display off, e.g. for maintenance). This
// platform has no such state; it is "dimWake" (boolean) of
// "<root>/var/lib/larder-platform/system-state.plist".
bool LedgerIsDimWake();
// How often the machine has woken only partly because it ran too hot:
// "dimWakeThermalEmergencyCount" (integer) of the same file; 0 when absent.
std::int64_t LedgerDimWakeThermalEmergencyCount();

// The main display sleeps, so a countdown put on it would go unseen. This
// platform has no such state; it is "displayAsleep" (boolean) of the same
// file, false when absent.
bool LedgerIsMainDisplayAsleep();

// The process runs from an OS install environment: the variable
// __OSINSTALL_ENVIRONMENT is set, to any value, the empty one included.
bool LedgerOnRecoveryPartition();

// The session is a guest session: "guestUser" (boolean) of the system
// state file when present, otherwise the login name of the process's user
// is a guest name (LedgerIsGuestUserName).
bool LedgerCurrentUserIsGuestUser();
// "guest", or a name beginning with "guest-" as display managers give
// their throw-away guest accounts.
bool LedgerIsGuestUserName(std::string_view userName);

// False while the download layer keeps the applications of this bundle
// identifier from starting because they are being replaced: the identifier
// is in the array of "<root>/var/lib/larder-platform/locked-applications.plist".
bool LedgerIsClientAppAllowedToLaunch(std::string_view bundleIdentifier);
std::string LedgerLockedApplicationsFilePath();

// Where the launcher bar keeps the icon it loaded for `identifier` (a
// product key or an item identifier) on behalf of a store client:
// "<cache home>/com.orvane.larderd/Icons/<client>/<identifier>". Both parts
// are made safe as file names; the file may not exist.
std::string LedgerIconLocationForIdentifier(std::string_view clientIdentifier,
                                            std::string_view identifier);

// The date a delayed critical update was first shown to this user, or
// nothing; kept in "<user config folder>/CriticalUpdate.plist".
std::optional<PlistDate> LedgerCriticalUpdateTimeStamp();
// Stores the present date as that date.
void LedgerCreateCriticalUpdateTimeStamp();

}  // namespace larder
