#include "store-runtime/host/LedgerSessionList.h"

#include <systemd/sd-login.h>
#include <unistd.h>

#include <cstdlib>
#include <optional>
#include <string>
#include <string_view>

#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerSessionList";

bool isLoggedInState(std::string_view state) {
  return state == "online" || state == "active";
}

// logind keeps a folder per seat while it runs; sd-login reads its files and would report an
// absent logind as no sessions at all, which would wrongly tell the updater nobody is logged in.
bool logindIsRunning() {
  return ::access("/run/systemd/seats/", F_OK) == 0;
}

// sd-login hands out text it allocated with malloc.
std::string takeText(char* text) {
  std::string taken = text ? std::string(text) : std::string();
  std::free(text);  // NOLINT(cppcoreguidelines-no-malloc)
  return taken;
}

// logind also keeps sessions that are nobody's login: the login screen ("greeter"), the lock
// screen, cron jobs ("background") and, in newer versions, each user's service manager
// ("manager"), which would count every user twice. Only the "user" classes are logins; a
// session whose class cannot be read is taken as one.
bool isLoggedInLogindSession(const char* session) {
  char* state = nullptr;
  if (sd_session_get_state(session, &state) < 0) return false;
  if (!isLoggedInState(takeText(state))) return false;
  char* sessionClass = nullptr;
  if (sd_session_get_class(session, &sessionClass) < 0) return true;
  return std::string_view(takeText(sessionClass)).starts_with("user");
}

std::optional<std::size_t> logindSessionCount() {
  if (!logindIsRunning()) return std::nullopt;
  char** sessions = nullptr;
  const int count = sd_get_sessions(&sessions);
  if (count < 0) {
    TILL_LOG(1, "%@: logind gave no sessions (error %@)", kSpeaker, -count);
    return std::nullopt;
  }
  std::size_t loggedIn = 0;
  for (int index = 0; index < count; ++index) {
    if (isLoggedInLogindSession(sessions[index])) ++loggedIn;
    std::free(sessions[index]);  // NOLINT(cppcoreguidelines-no-malloc): sd-login's allocation
  }
  std::free(sessions);  // NOLINT(cppcoreguidelines-no-malloc)
  return loggedIn;
}

std::size_t sessionFileCount() {
  const PlatformStateFile file = PlatformStateFile::named("sessions.plist");
  const PlistValue stored = file.read();
  const PlistArray* sessions = stored.array();
  if (!sessions) {
    if (!stored.isNull()) TILL_LOG(1, "%@: %@ is not a list of sessions", kSpeaker, file.path());
    return 0;
  }
  std::size_t loggedIn = 0;
  for (const PlistValue& session : *sessions) {
    const std::string* state = session["state"].string();
    if (state && isLoggedInState(*state)) ++loggedIn;
  }
  return loggedIn;
}

}  // namespace

std::size_t LedgerSessionList::loggedInSessionCount() {
  if (Environment::platformRoot() == "/") {
    if (std::optional<std::size_t> count = logindSessionCount()) {
      TILL_LOG(3, "%@: logind has %@ logged-in sessions", kSpeaker, *count);
      return *count;
    }
  }
  const std::size_t count = sessionFileCount();
  TILL_LOG(3, "%@: The session file has %@ logged-in sessions", kSpeaker, count);
  return count;
}

}  // namespace larder
