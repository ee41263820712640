#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace larder {

// Ends the session so that updates install after the logout: a logout, or
// a restart when an update needs one. Only with LARDER_ALLOW_RESTART=1 in
// the environment and platform root "/" does it ask logind
// (TerminateSession of the caller's session, or Reboot(false)); otherwise,
// and so always in tests, demos and under any other root, the request is
// only recorded in "<root>/var/lib/larder-platform/restart-requests.plist",
// an array of { date, kind ("logout" or "restart"), productKeys }, and
// logged.
class LedgerSessionRestart {
 public:
  enum class Kind { kLogout, kRestart };

  static constexpr const char* kAllowVariable = "LARDER_ALLOW_RESTART";

  // True when the request was recorded or logind accepted it.
  static bool request(Kind kind, const std::vector<std::string>& productKeys);

  // Whether this process may reach logind at all: the variable and the root.
  static bool mayAskLogind();

  static std::string requestsFilePath();
  static std::string_view kindName(Kind kind);
};

}  // namespace larder
