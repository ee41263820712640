#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "notifications/center/UserNotification.h"
#include "platform/error/Result.h"
#include "platform/system/Mutex.h"

namespace larder {

// The file that keeps a center's delivered notifications across restarts
// of the service: a binary property list
//   { version: 1, notifications: [ <UserNotification::toDictionary()>... ] }
// replaced as a whole, by atomic rename, at each write. XML written by
// hand reads as well.
//
// Writes may come from several threads (a queue of the center, and its
// destructor): each carries the revision of the list it holds, and one
// older than the file's is dropped, so that the file never goes back.
class DeliveredNotificationList {
 public:
  static constexpr std::int64_t kVersion = 1;
  // The center's own form of a list: records shared with the list it keeps
  // in memory, so that taking a copy to write costs no copy of a record.
  using Records = std::vector<std::shared_ptr<const UserNotification>>;

  explicit DeliveredNotificationList(std::string path);

  [[nodiscard]] const std::string& path() const { return path_; }

  // The notifications in the file, in their order. A missing file is an
  // empty list; so is a damaged one, which is logged: a list that cannot be
  // read must never keep the service from posting.
  [[nodiscard]] std::vector<UserNotification> read() const;
  [[nodiscard]] Result<void> write(const std::vector<UserNotification>& notifications);
  // The same, unless revision `revision` or a later one is already written.
  [[nodiscard]] Result<void> write(const Records& notifications, std::uint64_t revision);

  // Removes the temporary files of writes that a process died in. Only
  // for the one owner of the file, before its first write: the writes of
  // this process bear its process identifier too.
  void removeLeftovers() const;

  // The bytes `write` puts in the file.
  static std::vector<std::uint8_t> encode(const std::vector<UserNotification>& notifications);
  static std::vector<std::uint8_t> encode(const Records& notifications);

 private:
  const std::string path_;
  Mutex mutex_;
  std::uint64_t writtenRevision_ GUARDED_BY(mutex_) = 0;
};

}  // namespace larder
