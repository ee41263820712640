#pragma once

#include <cstddef>

namespace larder {

// The login sessions of the machine. Under the platform root "/" with
// logind on the system bus, logind's sessions; otherwise (and under any
// other platform root) "<root>/var/lib/larder-platform/sessions.plist", an
// array of dictionaries { "user" (string), "state" (string: "opening",
// "online", "active" or "closing") }.
class LedgerSessionList {
 public:
  // Sessions whose login has finished: state online or active (of logind's,
  // only those of a user class: no login screen, lock screen, background
  // job or service manager).
  static std::size_t loggedInSessionCount();
};

}  // namespace larder
