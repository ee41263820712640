#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/system/Mutex.h"

namespace larder {

// The one authorization of the process for installing software. It is
// asked for quietly first, with the rights the machine grants store
// software without asking, and interactively only as a last resort; once
// granted it stays for the life of the process.
class AuthorizationController {
 public:
  static AuthorizationController& sharedInstance();

  // True when authorization is there. May ask the user, and blocks until
  // the user has answered; the lock is held meanwhile, so that one dialog at
  // most is up.
  bool authorizeForSoftwareInstall();
  // True when the quiet attempt fails.
  bool interactiveAuthRequiredForSoftwareInstall();
  [[nodiscard]] bool hasAuthorization() const;

 private:
  AuthorizationController() = default;

  bool attemptNonInteractiveAuthorization() REQUIRES(authLock_);
  bool attemptNonInteractiveAuthorizationForNonAdminUser() REQUIRES(authLock_);
  bool attemptInteractiveAuthorization() REQUIRES(authLock_);
  bool ask(const std::vector<std::string>& rights, bool interactive, const char* successLog)
      REQUIRES(authLock_);
  static bool allowSoftwareInstallForNonAdminUser();

  mutable Mutex authLock_;
  // The granted rights: this platform's authorization reference.
  std::optional<std::vector<std::string>> authorization_ GUARDED_BY(authLock_);
  // The status of the last refused request, for the log.
  std::int32_t lastStatus_ GUARDED_BY(authLock_) = 0;
};

}  // namespace larder
