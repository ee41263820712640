#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "notifications/center/UserNotification.h"
#include "platform/error/Result.h"

namespace larder {

// The file that keeps a center's delivered notifications across restarts
// of the service: a binary property list
//   { version: 1, notifications: [ <UserNotification::toDictionary()>... ] }
// replaced as a whole, by atomic rename, at each write. XML written by
// hand reads as well.
class DeliveredNotificationList {
 public:
  static constexpr std::int64_t kVersion = 1;

  explicit DeliveredNotificationList(std::string path);

  [[nodiscard]] const std::string& path() const { return path_; }

  // The notifications in the file, in their order. A missing file is an
  // empty list; so is a damaged one, which is logged: a list that cannot be
  // read must never keep the service from posting.
  [[nodiscard]] std::vector<UserNotification> read() const;
  [[nodiscard]] Result<void> write(const std::vector<UserNotification>& notifications) const;

  // The bytes `write` puts in the file.
  static std::vector<std::uint8_t> encode(const std::vector<UserNotification>& notifications);

 private:
  std::string path_;
};

}  // namespace larder
