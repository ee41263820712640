#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace larder {

// The platform's authorization service, as the installers need it: asking
// for a set of rights, quietly or with the user's help. This platform has
// no such service the service can talk to yet, so the machine's answers
// are kept in "<root>/var/lib/larder-platform/authorization.plist":
//
//   grantedRights     array of right names granted without asking; when the
//                     file or the key is missing, every right but the
//                     interactive "system.install.software", as on a machine
//                     whose user administers it
//   interactiveGrant  boolean: what the user answers when asked (default
//                     false: nobody is there to answer)
//   requests          appended by each request: { rights, interactive }, so
//                     that one can see who asked for what
class LedgerAuthorizationService {
 public:
  static constexpr std::int32_t kGranted = 0;
  static constexpr std::int32_t kDenied = -60005;
  static constexpr std::int32_t kCanceled = -60006;

  // 0 when every right of the set is granted.
  static std::int32_t copyRights(const std::vector<std::string>& rights, bool interactionAllowed);

  static std::string stateFilePath();
};

}  // namespace larder
