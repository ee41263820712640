#include "store-runtime/host/FreeSpaceRequest.h"

#include <sys/statvfs.h>

#include <algorithm>
#include <filesystem>
#include <thread>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

namespace fs = std::filesystem;

constexpr std::string_view kSpeaker = "FreeSpaceRequest";
constexpr std::string_view kAuditSideFilePrefix = "UpdateOperationAuditInfoCache-";
constexpr std::int64_t kMinimumUrgency = 1;
constexpr std::int64_t kKeepTryingUrgency = 3;

std::string serviceCacheFolder() {
  return Environment::cacheHome() + "/" + std::string(kDaemonDefaultsID);
}

bool isOlderThan(const fs::file_time_type& written, fs::file_time_type::duration age) {
  return written < fs::file_time_type::clock::now() - age;
}

// The newest change of anything inside `folder`; nothing for an empty one,
// which counts as stale.
std::optional<fs::file_time_type> newestChangeIn(const fs::path& folder) {
  std::optional<fs::file_time_type> newest;
  std::error_code code;
  for (fs::recursive_directory_iterator it(folder, code), end; !code && it != end;
       it.increment(code)) {
    std::error_code timeCode;
    const fs::file_time_type written = it->last_write_time(timeCode);
    if (!timeCode && (!newest || written > *newest)) newest = written;
  }
  return newest;
}

std::uint64_t sizeOf(const fs::path& path) {
  std::error_code code;
  if (fs::is_regular_file(path, code)) return fs::file_size(path, code);
  std::uint64_t total = 0;
  for (fs::recursive_directory_iterator it(path, code), end; !code && it != end;
       it.increment(code)) {
    std::error_code sizeCode;
    if (it->is_regular_file(sizeCode)) total += it->file_size(sizeCode);
  }
  return total;
}

std::uint64_t removeCounting(const fs::path& path) {
  const std::uint64_t size = sizeOf(path);
  std::error_code code;
  fs::remove_all(path, code);
  if (code) {
    TILL_LOG(1, "%@: Could not remove %@: %@", kSpeaker, path.string(), code.message());
    return 0;
  }
  TILL_LOG(2, "%@: Removed %@ (%@ bytes)", kSpeaker, path.string(), size);
  return size;
}

std::uint64_t reclaimStaleDownloads(const fs::path& downloads) {
  std::uint64_t freed = 0;
  std::error_code code;
  for (fs::directory_iterator it(downloads, code), end; !code && it != end; it.increment(code)) {
    std::error_code kindCode;
    if (!it->is_directory(kindCode)) continue;
    const std::optional<fs::file_time_type> newest = newestChangeIn(it->path());
    if (!newest || isOlderThan(*newest, FreeSpaceRequest::kStaleAge)) {
      freed += removeCounting(it->path());
    }
  }
  return freed;
}

std::uint64_t reclaimOldAuditSideFiles(const fs::path& folder) {
  std::uint64_t freed = 0;
  std::error_code code;
  for (fs::directory_iterator it(folder, code), end; !code && it != end; it.increment(code)) {
    const std::string name = it->path().filename().string();
    if (!name.starts_with(kAuditSideFilePrefix) || !name.ends_with(".plist")) continue;
    std::error_code timeCode;
    const fs::file_time_type written = it->last_write_time(timeCode);
    if (!timeCode && isOlderThan(written, FreeSpaceRequest::kStaleAge)) {
      freed += removeCounting(it->path());
    }
  }
  return freed;
}

std::chrono::steady_clock::duration timeout() {
  const PlistValue seconds =
      PlatformStateFile::named(FreeSpaceRequest::kStateFileName).readDictionary()["timeoutSeconds"];
  if (!seconds.isNumber() || seconds.doubleValue() <= 0) return FreeSpaceRequest::kDefaultTimeout;
  return std::chrono::duration_cast<std::chrono::steady_clock::duration>(
      std::chrono::duration<double>(seconds.doubleValue()));
}

}  // namespace

std::shared_ptr<FreeSpaceRequest> FreeSpaceRequest::requestFreeSpace(std::uint64_t bytes) {
  return std::make_shared<FreeSpaceRequest>(bytes);
}

void FreeSpaceRequest::setUrgency(std::int64_t urgency) {
  MutexLock lock(mutex_);
  urgency_ = std::clamp(urgency, kMinimumUrgency, kKeepTryingUrgency);
}

std::int64_t FreeSpaceRequest::urgency() const {
  MutexLock lock(mutex_);
  return urgency_;
}

bool FreeSpaceRequest::isFinalStatus(std::int64_t status) {
  return status == kSatisfied || (status >= kInsufficient && status <= 8);
}

std::optional<std::uint64_t> FreeSpaceRequest::freeBytes() {
  const PlistValue override =
      PlatformStateFile::named(kStateFileName).readDictionary()["freeBytes"];
  if (override.isInteger()) return override.uint64Value();
  struct statvfs volume {};
  if (::statvfs(Environment::rootedPath("/").c_str(), &volume) != 0) return std::nullopt;
  return static_cast<std::uint64_t>(volume.f_bavail) * volume.f_frsize;
}

std::uint64_t FreeSpaceRequest::reclaimServiceCaches() {
  const fs::path folder = serviceCacheFolder();
  return reclaimStaleDownloads(folder / "Downloads") + reclaimOldAuditSideFiles(folder);
}

void FreeSpaceRequest::begin(StatusHandler handler) {
  {
    MutexLock lock(mutex_);
    if (begun_) return;
    begun_ = true;
  }
  // A queue of its own: urgency 3 may wait for up to the bound, which must
  // not hold a worker of a shared queue. The queue runs the work after the
  // last reference to it is dropped.
  auto queue = DispatchQueue::create("FreeSpaceRequest", DispatchQueue::Kind::Serial);
  queue->async([self = shared_from_this(), handler = std::move(handler)] { self->run(handler); });
}

void FreeSpaceRequest::run(const StatusHandler& handler) const {
  const auto deadline = std::chrono::steady_clock::now() + timeout();
  const std::int64_t level = urgency();
  auto report = [&](std::int64_t status, const OptionalError& error = std::nullopt) {
    TILL_LOG(3, "%@: %@ bytes wanted, status %@", kSpeaker, bytes_, status);
    handler(status, error);
  };
  auto measure = [&]() -> std::optional<bool> {
    report(kMeasuring);
    const std::optional<std::uint64_t> free = freeBytes();
    if (!free) return std::nullopt;
    return *free >= bytes_;
  };

  if (level >= 2) {
    report(kReclaiming);
    const std::uint64_t freed = reclaimServiceCaches();
    TILL_LOG(2, "%@: Reclaimed %@ bytes from the service's caches", kSpeaker, freed);
  }
  for (;;) {
    const std::optional<bool> enough = measure();
    if (!enough) {
      report(kUnmeasurable, VendError::withDomain("FreeSpaceRequest", kUnmeasurable,
                                                  "The free space could not be read."));
      return;
    }
    if (*enough) return report(kSatisfied);
    if (level < kKeepTryingUrgency) return report(kInsufficient);
    if (std::chrono::steady_clock::now() + kPollInterval > deadline) return report(kTimedOut);
    report(kWaitingForSpace);
    std::this_thread::sleep_for(kPollInterval);
  }
}

}  // namespace larder
