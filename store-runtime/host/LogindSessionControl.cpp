#include "store-runtime/host/LogindSessionControl.h"

#include <systemd/sd-login.h>
#include <unistd.h>

#include <sdbus-c++/sdbus-c++.h>
#include <cstdlib>

#include "platform/system/Environment.h"

namespace larder {

namespace {

constexpr const char* kDestination = "org.freedesktop.login1";
constexpr const char* kPath = "/org/freedesktop/login1";
constexpr const char* kManager = "org.freedesktop.login1.Manager";
constexpr std::string_view kErrorDomain = "LogindSessionControl";
constexpr std::int64_t kRefusedCode = 1;

template <typename... Arguments>
Result<void> callManager(sdbus::IConnection& connection, const std::string& member,
                         const Arguments&... arguments) {
  try {
    auto proxy = sdbus::createProxy(connection, kDestination, kPath);
    proxy->callMethod(member).onInterface(kManager).withArguments(arguments...);
    return {};
  } catch (const sdbus::Error& error) {
    return VendError::withDomain(std::string(kErrorDomain), kRefusedCode,
                                 "logind refused " + member + ": " + error.getMessage());
  }
}

}  // namespace

LogindSessionControl::LogindSessionControl(std::unique_ptr<sdbus::IConnection> connection)
    : connection_(std::move(connection)) {}

LogindSessionControl::~LogindSessionControl() = default;

Result<void> LogindSessionControl::terminateSession(const std::string& sessionIdentifier) {
  return callManager(*connection_, "TerminateSession", sessionIdentifier);
}

Result<void> LogindSessionControl::reboot() {
  return callManager(*connection_, "Reboot", false);
}

std::string LogindSessionControl::currentSessionIdentifier() {
  char* session = nullptr;
  if (sd_pid_get_session(0, &session) >= 0 && session != nullptr) {
    std::string identifier(session);
    std::free(session);
    return identifier;
  }
  // A service started by the user's service manager is outside every
  // session: the user's graphical session is the one to end.
  if (sd_uid_get_display(::getuid(), &session) >= 0 && session != nullptr) {
    std::string identifier(session);
    std::free(session);
    return identifier;
  }
  return Environment::variable("XDG_SESSION_ID");
}

}  // namespace larder
