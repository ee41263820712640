#pragma once

#include <string_view>

namespace larder {

// Notifications the service passes on to every process of the session that
// listens (the store application's badge): one signal of the service object.
struct DistributedNotificationProtocol {
  static constexpr std::string_view kInterfaceName = "com.orvane.larderd.DistributedNotifications";
  static constexpr std::string_view kSignal = "Notification";
  // Name, object, user info.
  static constexpr std::string_view kSignature = "ssa{sv}";
  static constexpr std::string_view kBadgeName = "com.orvane.quaymart";
  static constexpr std::string_view kBadgeObject = "updateDockTile";
  static constexpr std::string_view kBadgeCountKey = "badgeCount";
};

}  // namespace larder
