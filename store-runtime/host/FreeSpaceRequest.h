#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/error/VendError.h"
#include "platform/system/Mutex.h"

namespace larder {

// The platform's storage management as an installer asks it for room: a
// request for a number of free bytes on the file system of the platform
// root. This platform has no such service, so the request makes the room
// itself, from the service's own caches, and then measures.
//
// What it may remove, by urgency:
//   1   nothing: it only measures;
//   2   once, before measuring: download folders under
//       "<cache home>/com.orvane.larderd/Downloads/" in which no file has
//       changed for kStaleAge (a download that was neither resumed nor
//       finished for that long is no longer wanted: a live or recently
//       paused one has newer files), and the side files of run audits
//       ("UpdateOperationAuditInfoCache-*.plist" in the service's cache
//       folder) older than kStaleAge;
//   3   the same, and then it keeps measuring every kPollInterval, since
//       another process may free space, until there is room or the bound.
//
// Statuses, each handed to the handler with an error or none:
//   kMeasuring (2), kReclaiming (3), kWaitingForSpace (9): under way;
//   kSatisfied (1): there is room, final;
//   kInsufficient (4): no room after reclaiming (urgency 1 and 2), final;
//   kTimedOut (5): urgency 3 found no room within the bound, final;
//   kUnmeasurable (6): the free space could not be read, final, with an
//   error. 7 and 8 are final too but never sent here.
// The handler is called on a thread of the request's own, never on the
// caller's, and the last call always carries a final status: the request
// never leaves its caller waiting beyond the bound (kDefaultTimeout).
//
// The free space is that of the file system that holds the platform root.
// Tests and demonstrations override it in "<root>/var/lib/larder-platform/
// free-space.plist", read afresh at each measurement:
//   freeBytes        the free bytes to report instead of the file system's
//   timeoutSeconds   the bound of one request, instead of kDefaultTimeout
class FreeSpaceRequest : public std::enable_shared_from_this<FreeSpaceRequest> {
 public:
  enum Status : std::int64_t {
    kSatisfied = 1,
    kMeasuring = 2,
    kReclaiming = 3,
    kInsufficient = 4,
    kTimedOut = 5,
    kUnmeasurable = 6,
    kWaitingForSpace = 9,
  };
  using StatusHandler = std::function<void(std::int64_t status, const OptionalError& error)>;

  static constexpr std::string_view kStateFileName = "free-space.plist";
  static constexpr std::chrono::seconds kDefaultTimeout{60};
  static constexpr std::chrono::milliseconds kPollInterval{200};
  static constexpr std::chrono::hours kStaleAge{24 * 7};
  static constexpr std::int64_t kDefaultUrgency = 2;

  static std::shared_ptr<FreeSpaceRequest> requestFreeSpace(std::uint64_t bytes);
  // Use requestFreeSpace; public for make_shared only.
  explicit FreeSpaceRequest(std::uint64_t bytes) : bytes_(bytes) {}

  // How hard it may try (1 to 3, see above); values outside are clamped.
  void setUrgency(std::int64_t urgency);
  [[nodiscard]] std::int64_t urgency() const;
  [[nodiscard]] std::uint64_t bytes() const { return bytes_; }
  // Starts the request; a second begin is ignored.
  void begin(StatusHandler handler);

  // 1 and 4 to 8: the request has ended.
  [[nodiscard]] static bool isFinalStatus(std::int64_t status);
  // Free bytes on the file system of the platform root, or the override;
  // nothing when it cannot be read.
  [[nodiscard]] static std::optional<std::uint64_t> freeBytes();
  // Removes what urgency 2 may remove; the bytes it freed.
  static std::uint64_t reclaimServiceCaches();

 private:
  void run(const StatusHandler& handler) const;

  const std::uint64_t bytes_;
  mutable Mutex mutex_;
  std::int64_t urgency_ GUARDED_BY(mutex_) = kDefaultUrgency;
  bool begun_ GUARDED_BY(mutex_) = false;
};

}  // namespace larder
