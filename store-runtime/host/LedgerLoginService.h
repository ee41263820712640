#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace larder {

// The login service's snapshot of the running applications that the
// session brings back after the next login (the "TAL" snapshot). An update
// that quits every application before a restart takes it first, so that
// the applications come back afterwards, and disposes of it when it
// started them again itself. This platform's session manager keeps no such
// snapshot the service can ask for, so it is simulated in
// "<root>/var/lib/larder-platform/login-service.plist":
//
//   snapshotTaken   boolean  a final snapshot is held
//   snapshotDate    date     when the held snapshot was taken
//   takenCount      integer  snapshots taken so far
//   disposedCount   integer  snapshots disposed of so far
//   snapshotFails   boolean  set by hand or by a test: every call fails
//
// The running applications themselves are not listed: their facility lies
// above this layer, and the session restores them on its own.
class LedgerLoginService {
 public:
  static constexpr int kSuccess = 0;
  // The snapshot could not be taken or disposed of (snapshotFails).
  static constexpr int kSnapshotFailed = 1;
  // Disposing when no snapshot is held.
  static constexpr int kNoSnapshot = 2;
  // An argument other than 0 and 1, or a state file that cannot be written.
  static constexpr int kInvalidRequest = 22;

  // 1 takes the final snapshot, 0 disposes of it; 0 is success.
  static int setFinalTALSnapshot(int take);

  static std::string stateFilePath();

  static constexpr std::string_view kTakenKey = "snapshotTaken";
  static constexpr std::string_view kDateKey = "snapshotDate";
  static constexpr std::string_view kTakenCountKey = "takenCount";
  static constexpr std::string_view kDisposedCountKey = "disposedCount";
  static constexpr std::string_view kFailsKey = "snapshotFails";
};

}  // namespace larder
