#include "store-runtime/host/LedgerLoginService.h"

#include <chrono>

#include "platform/log/TillLogManager.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerLoginService";

PlatformStateFile stateFile() {
  return PlatformStateFile::named("login-service.plist");
}

void increment(PlistDictionary& state, std::string_view key) {
  state[std::string(key)] = PlistValue(state)[key].int64Value() + 1;
}

// The whole decision is taken under the file's lock, so two callers never
// both dispose of the one snapshot.
int change(PlistDictionary& state, bool take) {
  if (PlistValue(state)[LedgerLoginService::kFailsKey].boolValue()) {
    return LedgerLoginService::kSnapshotFailed;
  }
  if (take) {
    state[std::string(LedgerLoginService::kTakenKey)] = true;
    state[std::string(LedgerLoginService::kDateKey)] = PlistDate::now();
    increment(state, LedgerLoginService::kTakenCountKey);
    return LedgerLoginService::kSuccess;
  }
  if (!PlistValue(state)[LedgerLoginService::kTakenKey].boolValue()) {
    return LedgerLoginService::kNoSnapshot;
  }
  state[std::string(LedgerLoginService::kTakenKey)] = false;
  state.erase(std::string(LedgerLoginService::kDateKey));
  increment(state, LedgerLoginService::kDisposedCountKey);
  return LedgerLoginService::kSuccess;
}

}  // namespace

std::string LedgerLoginService::stateFilePath() {
  return stateFile().path();
}

int LedgerLoginService::setFinalTALSnapshot(int take) {
  if (take != 0 && take != 1) return kInvalidRequest;
  int result = kInvalidRequest;
  if (!stateFile().updateDictionary(
          [&](PlistDictionary& state) { result = change(state, take == 1); })) {
    result = kInvalidRequest;
  }
  TILL_LOG(2, "%@: %@ the final snapshot: %i", kSpeaker, take == 1 ? "Taking" : "Disposing of",
           result);
  return result;
}

}  // namespace larder
