#include "store-runtime/host/LedgerPowerAssertion.h"

#include <unistd.h>

#include <sdbus-c++/sdbus-c++.h>
#include <chrono>
#include <optional>
#include <string>

#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "platform/system/FileDescriptor.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerPowerAssertion";

bool logindIsRunning() {
  return ::access("/run/systemd/seats/", F_OK) == 0;
}

// An inhibitor lock that blocks sleep until its descriptor is closed; none
// when logind does not give one.
std::optional<int> takeInhibitorLock(std::string_view name) {
  try {
    auto connection = sdbus::createSystemBusConnection();
    auto proxy =
        sdbus::createProxy(*connection, "org.freedesktop.login1", "/org/freedesktop/login1");
    sdbus::UnixFd lock;
    proxy->callMethod("Inhibit")
        .onInterface("org.freedesktop.login1.Manager")
        .withArguments(std::string("sleep"), std::string("larderd"), std::string(name),
                       std::string("block"))
        .storeResultsTo(lock);
    if (!lock.isValid()) return std::nullopt;
    return lock.release();
  } catch (const sdbus::Error& error) {
    TILL_LOG(1, "%@: logind refused an inhibitor lock: %@", kSpeaker, error.getMessage());
    return std::nullopt;
  }
}

double now() {
  using namespace std::chrono;
  return duration<double>(system_clock::now().time_since_epoch()).count();
}

PlatformStateFile recordFile() {
  return PlatformStateFile::named(LedgerPowerAssertion::kFileName);
}

// Identifiers of records go above every one in the file, which several
// processes share; those of locks above every lock of this process.
// Records use the upper half of the range so that the two never meet.
constexpr std::uint32_t kFirstRecordIdentifier = 0x80000000U;

std::optional<std::uint32_t> storeRecord(std::string_view type, std::string_view name) {
  std::uint32_t identifier = 0;
  bool stored = recordFile().updateDictionary([&](PlistDictionary& state) {
    PlistDictionary assertions;
    if (const PlistDictionary* old = state["assertions"].dictionary()) assertions = *old;
    std::uint32_t highest = kFirstRecordIdentifier - 1;
    for (const auto& [key, value] : assertions) {
      auto existing = static_cast<std::uint32_t>(PlistValue(key).uint64Value());
      if (existing > highest) highest = existing;
    }
    identifier = highest + 1 == 0 ? kFirstRecordIdentifier : highest + 1;
    assertions[std::to_string(identifier)] = PlistDictionary{
        {"type", std::string(type)}, {"name", std::string(name)}, {"date", PlistDate{now()}}};
    state["assertions"] = std::move(assertions);
  });
  if (!stored) return std::nullopt;
  return identifier;
}

bool removeRecord(std::uint32_t identifier) {
  bool found = false;
  bool stored = recordFile().updateDictionary([&](PlistDictionary& state) {
    if (PlistDictionary* assertions = state["assertions"].dictionary()) {
      found = assertions->erase(std::to_string(identifier)) > 0;
    }
  });
  return stored && found;
}

}  // namespace

LedgerPowerAssertion& LedgerPowerAssertion::shared() {
  static LedgerPowerAssertion instance;
  return instance;
}

LedgerPowerAssertion::LedgerPowerAssertion() = default;
LedgerPowerAssertion::~LedgerPowerAssertion() = default;

Result<std::uint32_t> LedgerPowerAssertion::create(std::string_view type, std::string_view name) {
  return shared().createAssertion(type, name);
}

std::int64_t LedgerPowerAssertion::release(std::uint32_t identifier) {
  return shared().releaseAssertion(identifier);
}

Result<std::uint32_t> LedgerPowerAssertion::createAssertion(std::string_view type,
                                                            std::string_view name) {
  if (Environment::platformRoot() == "/" && logindIsRunning()) {
    if (std::optional<int> lock = takeInhibitorLock(name)) {
      MutexLock guard(mutex_);
      std::uint32_t identifier = nextLockIdentifier_++;
      locks_[identifier] = std::make_unique<FileDescriptor>(*lock);
      TILL_LOG(2, "%@: Holding a sleep inhibitor %@ for %@ (%@)", kSpeaker, identifier, name, type);
      return identifier;
    }
  }
  std::optional<std::uint32_t> identifier = storeRecord(type, name);
  if (!identifier) {
    return VendError::withDomain(std::string(kErrorDomain), kStoreFailedCode,
                                 "Could not record the power assertion " + std::string(name));
  }
  TILL_LOG(2, "%@: Recorded power assertion %@ for %@ (%@)", kSpeaker, *identifier, name, type);
  return *identifier;
}

std::int64_t LedgerPowerAssertion::releaseAssertion(std::uint32_t identifier) {
  {
    MutexLock guard(mutex_);
    if (locks_.erase(identifier) > 0) {
      TILL_LOG(2, "%@: Released sleep inhibitor %@", kSpeaker, identifier);
      return 0;
    }
  }
  if (removeRecord(identifier)) {
    TILL_LOG(2, "%@: Released power assertion %@", kSpeaker, identifier);
    return 0;
  }
  TILL_LOG(1, "%@: No power assertion %@ to release", kSpeaker, identifier);
  return kNotFoundCode;
}

}  // namespace larder
