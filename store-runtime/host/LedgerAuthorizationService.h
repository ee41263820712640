#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace larder {

class PolkitAuthority;

// The platform's authorization service, as the installers need it: asking
// for a set of rights, quietly or with the user's help. It has two
// backends, chosen once per process (chooseBackend):
//
// polkit, when the platform root is "/" and org.freedesktop.PolicyKit1 is
// on the system bus. Each right is one of two actions of
// data/polkit/com.orvane.larderd.policy (polkitActionForRight): the
// standard user's rights (names ending in ".standard-user") are
// "com.orvane.larderd.install-software.standard-user", every other right
// "com.orvane.larderd.install-software". The set is granted when every
// action is; only an interactive request lets polkit ask the user.
// LARDER_AUTHORIZATION_POLKIT=1 selects polkit under another root as well,
// but only together with DBUS_SYSTEM_BUS_ADDRESS, so that a test that sets
// it reaches the authority on its own bus and never the machine's.
//
// Simulated otherwise: the machine's answers are kept in
// "<root>/var/lib/larder-platform/authorization.plist":
//
//   grantedRights     array of right names granted without asking; when the
//                     file or the key is missing, every right but the
//                     interactive "system.install.software", as on a machine
//                     whose user administers it
//   interactiveGrant  boolean: what the user answers when asked (default
//                     false: nobody is there to answer)
//   requests          appended by each request: { rights, interactive }, so
//                     that one can see who asked for what
//
// In both, the managed restriction RequireAdminForSoftwareInstall denies
// the standard user's rights without asking anyone.
class LedgerAuthorizationService {
 public:
  static constexpr std::int32_t kGranted = 0;
  static constexpr std::int32_t kDenied = -60005;
  static constexpr std::int32_t kCanceled = -60006;
  // The authority could not be asked.
  static constexpr std::int32_t kInternalError = -60008;

  enum class Backend { kSimulated, kPolkit };

  static constexpr std::string_view kInstallAction = "com.orvane.larderd.install-software";
  static constexpr std::string_view kStandardUserInstallAction =
      "com.orvane.larderd.install-software.standard-user";
  static constexpr const char* kPolkitSwitchVariable = "LARDER_AUTHORIZATION_POLKIT";

  // 0 when every right of the set is granted, through the process's backend.
  static std::int32_t copyRights(const std::vector<std::string>& rights, bool interactionAllowed);
  // The same through a given authority.
  static std::int32_t copyRightsFromPolkit(PolkitAuthority& authority,
                                           const std::vector<std::string>& rights,
                                           bool interactionAllowed);

  // The backend of this process, chosen at the first request.
  static Backend processBackend();
  // The choice as it falls now (the process's is this, made once).
  static Backend chooseBackend();

  static std::string_view polkitActionForRight(std::string_view right);

  static std::string stateFilePath();
};

}  // namespace larder
