#pragma once

#include <memory>
#include <string>

#include "platform/error/Result.h"

namespace sdbus {
class IConnection;
}

namespace larder {

// The two requests of logind that end a session for an install after
// logout: terminating the caller's session, and rebooting. It only speaks
// to the connection it is given; whether it may be used at all is
// LedgerSessionRestart's decision.
class LogindSessionControl {
 public:
  explicit LogindSessionControl(std::unique_ptr<sdbus::IConnection> connection);
  ~LogindSessionControl();
  LogindSessionControl(const LogindSessionControl&) = delete;
  LogindSessionControl& operator=(const LogindSessionControl&) = delete;

  // TerminateSession of `sessionIdentifier`.
  Result<void> terminateSession(const std::string& sessionIdentifier);
  // Reboot(false): without asking the user, who asked already.
  Result<void> reboot();

  // The logind session of this process; empty when it has none.
  static std::string currentSessionIdentifier();

 private:
  std::unique_ptr<sdbus::IConnection> connection_;
};

}  // namespace larder
