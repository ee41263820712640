#include "store-runtime/host/LedgerSystemState.h"

#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <vector>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerSystemState";
constexpr std::string_view kCriticalUpdateTimeStampKey = "CriticalUpdateTimeStamp";
constexpr std::size_t kMaxFileNameBytes = 200;

PlistValue systemState() {
  return PlistValue(PlatformStateFile::named("system-state.plist").readDictionary());
}

std::string currentUserName() {
  std::vector<char> buffer(16384);
  passwd entry{};
  passwd* found = nullptr;
  if (::getpwuid_r(::getuid(), &entry, buffer.data(), buffer.size(), &found) != 0 || !found) {
    return {};
  }
  return found->pw_name ? std::string(found->pw_name) : std::string();
}

// Keeps a name from leaving its folder: separators, leading dots and
// control characters become "_".
std::string safeFileName(std::string_view name) {
  std::string safe;
  for (char c : name.substr(0, kMaxFileNameBytes)) {
    bool unsafe = c == '/' || c == '\\' || static_cast<unsigned char>(c) < 0x20;
    safe.push_back(unsafe ? '_' : c);
  }
  if (safe.empty()) return "_";
  if (safe.front() == '.') safe.front() = '_';
  return safe;
}

std::string criticalUpdateFilePath() {
  return Environment::userConfigDirectory() + "/CriticalUpdate.plist";
}

}  // namespace

bool LedgerIsDimWake() {
  return systemState()["dimWake"].boolValue();
}

std::int64_t LedgerDimWakeThermalEmergencyCount() {
  return systemState()["dimWakeThermalEmergencyCount"].int64Value();
}

bool LedgerIsMainDisplayAsleep() {
  return systemState()["displayAsleep"].boolValue();
}

bool LedgerOnRecoveryPartition() {
  return Environment::variableIfSet("__OSINSTALL_ENVIRONMENT").has_value();
}

bool LedgerIsGuestUserName(std::string_view userName) {
  constexpr std::string_view kGuest = "guest";
  if (userName == kGuest) return true;
  return userName.size() > kGuest.size() + 1 && userName.substr(0, kGuest.size() + 1) == "guest-";
}

bool LedgerCurrentUserIsGuestUser() {
  PlistValue state = systemState();
  const PlistValue& override = state["guestUser"];
  if (override.isBoolean()) return override.boolValue();
  return LedgerIsGuestUserName(currentUserName());
}

std::string LedgerLockedApplicationsFilePath() {
  return PlatformStateFile::pathForName("locked-applications.plist");
}

bool LedgerIsClientAppAllowedToLaunch(std::string_view bundleIdentifier) {
  PlistValue locked = PlatformStateFile(LedgerLockedApplicationsFilePath()).read();
  const PlistArray* identifiers = locked.array();
  if (!identifiers) return true;
  bool isLocked = std::any_of(identifiers->begin(), identifiers->end(), [&](const PlistValue& v) {
    const std::string* text = v.string();
    return text && *text == bundleIdentifier;
  });
  if (isLocked)
    TILL_LOG(2, "%@: %@ is locked while it is being replaced", kSpeaker, bundleIdentifier);
  return !isLocked;
}

std::string LedgerIconLocationForIdentifier(std::string_view clientIdentifier,
                                            std::string_view identifier) {
  return Environment::cacheHome() + "/com.orvane.larderd/Icons/" + safeFileName(clientIdentifier) +
         "/" + safeFileName(identifier);
}

std::optional<PlistDate> LedgerCriticalUpdateTimeStamp() {
  std::optional<PlistData> bytes = FileIO::read(criticalUpdateFilePath(), 1u << 20u).optional();
  if (!bytes) return std::nullopt;
  std::optional<PlistValue> stored = PropertyListSerialization::read(*bytes);
  if (!stored) return std::nullopt;
  const PlistDate* date = (*stored)[kCriticalUpdateTimeStampKey].date();
  return date ? std::optional<PlistDate>(*date) : std::nullopt;
}

void LedgerCreateCriticalUpdateTimeStamp() {
  auto since = std::chrono::system_clock::now().time_since_epoch();
  PlistDictionary stored;
  stored[std::string(kCriticalUpdateTimeStampKey)] =
      PlistDate{std::chrono::duration<double>(since).count()};
  if (auto written = FileIO::writeAtomically(
          criticalUpdateFilePath(),
          PropertyListSerialization::writeXml(PlistValue(std::move(stored))));
      !written) {
    TILL_LOG(1, "%@: Cannot store the critical update time stamp: %@", kSpeaker,
             written.error().description);
  }
}

}  // namespace larder
