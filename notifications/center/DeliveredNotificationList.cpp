#include "notifications/center/DeliveredNotificationList.h"

#include <cerrno>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "DeliveredNotificationList";
// A list is a few hundred bytes a notification; this bounds a file that
// grew by accident, not any list the service keeps.
constexpr std::size_t kMaxFileBytes = 64u << 20u;

}  // namespace

DeliveredNotificationList::DeliveredNotificationList(std::string path) : path_(std::move(path)) {}

std::vector<UserNotification> DeliveredNotificationList::read() const {
  Result<std::vector<std::uint8_t>> bytes = FileIO::read(path_, kMaxFileBytes);
  if (!bytes) {
    if (bytes.error().code == ENOENT) {
      TILL_LOG(3, "%@: No list at %@ yet", kSpeaker, path_);
    } else {
      TILL_LOG(1, "%@: Cannot read %@ (%@); starting with an empty list", kSpeaker, path_,
               bytes.errorDescription());
    }
    return {};
  }
  Result<PlistValue> root = PropertyListSerialization::read(*bytes);
  const PlistValue* entries = root ? &(*root)["notifications"] : nullptr;
  if (!entries || !entries->isArray()) {
    TILL_LOG(1, "%@: %@ is damaged (%@); starting with an empty list", kSpeaker, path_,
             root ? std::string("no list of notifications in it") : root.errorDescription());
    return {};
  }
  std::vector<UserNotification> notifications;
  notifications.reserve(entries->array()->size());
  std::size_t dropped = 0;
  for (const PlistValue& entry : *entries->array()) {
    std::optional<UserNotification> notification =
        entry.isDictionary() ? UserNotification::fromDictionary(*entry.dictionary()) : std::nullopt;
    if (notification) {
      notifications.push_back(std::move(*notification));
    } else {
      ++dropped;
    }
  }
  if (dropped > 0) {
    TILL_LOG(1, "%@: Dropped %@ damaged entries of %@", kSpeaker, dropped, path_);
  }
  return notifications;
}

void DeliveredNotificationList::removeLeftovers() const {
  FileIO::removeStaleTemporaries(path_);
}

std::vector<std::uint8_t> DeliveredNotificationList::encode(
    const std::vector<UserNotification>& notifications) {
  PlistArray entries;
  entries.reserve(notifications.size());
  for (const UserNotification& notification : notifications) {
    entries.emplace_back(notification.toDictionary());
  }
  return PropertyListSerialization::writeBinary(
      PlistDictionary{{"version", kVersion}, {"notifications", std::move(entries)}});
}

std::vector<std::uint8_t> DeliveredNotificationList::encode(const Records& notifications) {
  PlistArray entries;
  entries.reserve(notifications.size());
  for (const auto& notification : notifications) entries.emplace_back(notification->toDictionary());
  return PropertyListSerialization::writeBinary(
      PlistDictionary{{"version", kVersion}, {"notifications", std::move(entries)}});
}

Result<void> DeliveredNotificationList::write(const std::vector<UserNotification>& notifications) {
  MutexLock lock(mutex_);
  return FileIO::writeAtomically(path_, encode(notifications));
}

Result<void> DeliveredNotificationList::write(const Records& notifications,
                                              std::uint64_t revision) {
  MutexLock lock(mutex_);
  if (revision <= writtenRevision_) return {};
  Result<void> written = FileIO::writeAtomically(path_, encode(notifications));
  if (written) writtenRevision_ = revision;
  return written;
}

}  // namespace larder
