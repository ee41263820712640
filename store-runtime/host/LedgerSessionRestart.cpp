#include "store-runtime/host/LedgerSessionRestart.h"

#include <sdbus-c++/sdbus-c++.h>
#include <chrono>

#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "store-runtime/host/LogindSessionControl.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerSessionRestart";
constexpr std::string_view kFileName = "restart-requests.plist";

bool record(LedgerSessionRestart::Kind kind, const std::vector<std::string>& productKeys) {
  PlistArray keys(productKeys.begin(), productKeys.end());
  PlistDictionary entry{{"date", PlistDate::now()},
                        {"kind", std::string(LedgerSessionRestart::kindName(kind))},
                        {"productKeys", std::move(keys)}};
  return PlatformStateFile(LedgerSessionRestart::requestsFilePath())
      .updateValue([&entry](PlistValue& requests) {
        if (!requests.array()) requests = PlistArray{};
        requests.array()->push_back(entry);
      });
}

Result<void> askLogind(LedgerSessionRestart::Kind kind) {
  try {
    LogindSessionControl logind(sdbus::createSystemBusConnection());
    if (kind == LedgerSessionRestart::Kind::kRestart) return logind.reboot();
    const std::string session = LogindSessionControl::currentSessionIdentifier();
    if (session.empty()) {
      return VendError::withDomain("LedgerSessionRestart", 1, "this process has no session");
    }
    return logind.terminateSession(session);
  } catch (const sdbus::Error& error) {
    return VendError::withDomain("LedgerSessionRestart", 2, "no system bus: " + error.getMessage());
  }
}

}  // namespace

std::string LedgerSessionRestart::requestsFilePath() {
  return PlatformStateFile::pathForName(kFileName);
}

std::string_view LedgerSessionRestart::kindName(Kind kind) {
  return kind == Kind::kRestart ? "restart" : "logout";
}

bool LedgerSessionRestart::mayAskLogind() {
  return Environment::variable(kAllowVariable) == "1" && Environment::platformRoot() == "/";
}

bool LedgerSessionRestart::request(Kind kind, const std::vector<std::string>& productKeys) {
  if (mayAskLogind()) {
    Result<void> asked = askLogind(kind);
    if (asked) {
      TILL_LOG(1, "%@: logind accepted the %@ for %zu updates", kSpeaker, kindName(kind),
               productKeys.size());
      return true;
    }
    TILL_LOG(1, "%@: %@ refused: %@", kSpeaker, kindName(kind), asked.error().descriptionText());
    return false;
  }
  const bool stored = record(kind, productKeys);
  TILL_LOG(1, "%@: %@ for %zu updates %@ (only %@=1 under platform root / reaches logind)",
           kSpeaker, kindName(kind), productKeys.size(),
           stored ? "recorded, not performed" : "could not be recorded", kAllowVariable);
  return stored;
}

}  // namespace larder
