#include "store-runtime/host/LedgerMajorOSInstallService.h"

#include <chrono>

#include "platform/log/TillLogManager.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PreferenceStore.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerMajorOSInstallService";
constexpr std::string_view kErrorDomain = "LedgerMajorOSInstallService";
// The codes of kErrorDomain: the connection was ended, the state could not
// be written.
constexpr std::int64_t kInvalidatedCode = 1;
constexpr std::int64_t kStateWriteCode = 2;

PlatformStateFile stateFile() {
  return PlatformStateFile::named(LedgerMajorOSInstallService::kStateFileName);
}

}  // namespace

LedgerMajorOSInstallService::LedgerMajorOSInstallService(std::string serviceName,
                                                         std::uint64_t options)
    : serviceName_(std::move(serviceName)), options_(options) {}

std::string LedgerMajorOSInstallService::stateFilePath() {
  return stateFile().path();
}

void LedgerMajorOSInstallService::setInterruptionHandler(std::function<void()> handler) {
  MutexLock lock(mutex_);
  interruptionHandler_ = std::move(handler);
}

void LedgerMajorOSInstallService::setInvalidationHandler(std::function<void()> handler) {
  MutexLock lock(mutex_);
  invalidationHandler_ = std::move(handler);
}

void LedgerMajorOSInstallService::invalidate() {
  std::function<void()> handler;
  {
    MutexLock lock(mutex_);
    if (invalidated_) return;
    invalidated_ = true;
    handler = std::move(invalidationHandler_);
    interruptionHandler_ = nullptr;
  }
  // Outside the lock: the handler drops the owner's reference to this
  // connection, which may be the last.
  if (handler) handler();
}

Result<void> LedgerMajorOSInstallService::checkValid() const {
  MutexLock lock(mutex_);
  if (!invalidated_) return {};
  return VendError::withDomain(std::string(kErrorDomain), kInvalidatedCode,
                               "The connection to " + serviceName_ + " was invalidated");
}

Result<void> LedgerMajorOSInstallService::appendRecord(std::string_view listKey,
                                                       PlistValue record) const {
  bool stored = stateFile().updateDictionary([&](PlistDictionary& state) {
    PlistValue& list = state[std::string(listKey)];
    if (!list.isArray()) list = PlistArray{};
    PlistArray& entries = *list.array();
    entries.push_back(std::move(record));
    if (entries.size() > kRecordedEntries) {
      entries.erase(entries.begin(), entries.begin() + static_cast<std::ptrdiff_t>(
                                                           entries.size() - kRecordedEntries));
    }
  });
  if (stored) return {};
  return VendError::withDomain(std::string(kErrorDomain), kStateWriteCode,
                               "Cannot write " + stateFilePath());
}

// The state goes where the controller reads it, so that the service and
// both modes of the process agree on one dictionary.
Result<void> LedgerMajorOSInstallService::writeMajorOSUpdatePrefs(const PlistDictionary& prefs) {
  if (Result<void> valid = checkValid(); !valid) return valid;
  Result<void> written = PreferenceStore::setValue(kDefaultsMajorOSUpdateKey, PlistValue(prefs),
                                                   kDaemonDefaultsID, PreferenceScope::System);
  if (!written) {
    TILL_LOG(1, "%@: Cannot store the major OS update state: %@", kSpeaker,
             written.errorDescription());
  }
  return written;
}

void LedgerMajorOSInstallService::readMajorOSUpdatePrefsWithReply(PrefsReply reply) {
  PlistValue stored = PreferenceStore::valueForKey(kDefaultsMajorOSUpdateKey, kDaemonDefaultsID,
                                                   PreferenceScope::System);
  if (!checkValid()) stored = PlistValue();
  if (reply) reply(stored.dictionary() ? *stored.dictionary() : PlistDictionary{});
}

Result<void> LedgerMajorOSInstallService::requestInstallationWithSetupHerald(
    const std::string& setupHeraldPath, const std::string& targetMountPoint,
    const std::optional<std::vector<std::string>>& authorization) {
  if (Result<void> valid = checkValid(); !valid) return valid;
  TILL_LOG(2, "%@: Installation requested with %@ onto %@", kSpeaker, setupHeraldPath,
           targetMountPoint);
  return appendRecord("installationRequests",
                      PlistDictionary{{"setupHerald", setupHeraldPath},
                                      {"targetMountPoint", targetMountPoint},
                                      {"authorized", authorization.has_value()},
                                      {"date", PlistDate::now()}});
}

void LedgerMajorOSInstallService::agentIsActiveWithReply(BoolReply reply) {
  bool active = checkValid() && stateFile().readDictionary()["agentIsActive"].boolValue();
  if (reply) reply(active);
}

Result<void> LedgerMajorOSInstallService::userHasAllowedInstallToProceed() {
  if (Result<void> valid = checkValid(); !valid) return valid;
  return appendRecord("installAllowedDates", PlistValue(PlistDate::now()));
}

void LedgerMajorOSInstallService::checkInAgent(const std::string& agentIdentifier,
                                               BoolReply reply) {
  bool recorded =
      checkValid() && appendRecord("agentCheckIns", PlistDictionary{{"agent", agentIdentifier},
                                                                    {"date", PlistDate::now()}});
  if (reply) reply(recorded);
}

}  // namespace larder
