#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "notifications/center/UserNotification.h"

namespace larder {

// The arguments of one Notify call of the desktop's notification server,
// made from a notification by the rules below; the server sends them as
// they are.
struct NotificationRequest {
  static constexpr std::string_view kApplicationName = "larder";
  static constexpr std::string_view kDesktopEntry = "larder";
  // The action keys: the contents, the main button, the second button and
  // the prefix of the main button's menu entries ("alternate-0", ...).
  static constexpr std::string_view kDefaultAction = "default";
  static constexpr std::string_view kMainAction = "action";
  static constexpr std::string_view kOtherAction = "other";
  static constexpr std::string_view kAlternateActionPrefix = "alternate-";
  // Put away for now. Never offered as a button: it comes from servers
  // or tools that can snooze.
  static constexpr std::string_view kSnoozeAction = "snooze";

  enum Urgency : std::uint8_t { kLow = 0, kNormal = 1, kCritical = 2 };
  // The server's own default, and never.
  static constexpr std::int32_t kServerDefaultTimeout = -1;
  static constexpr std::int32_t kNeverExpires = 0;

  std::string appName{kApplicationName};
  std::uint32_t replacesId = 0;
  std::string appIcon;
  std::string summary;
  std::string body;
  // Key and label, one after the other, as the server takes them.
  std::vector<std::string> actions;
  // The hints: "urgency" (a byte), "resident" (only when true),
  // "image-path" (only when not empty) and "desktop-entry".
  std::uint8_t urgency = kNormal;
  bool resident = false;
  std::string imagePath;
  std::string desktopEntry{kDesktopEntry};
  std::int32_t expireTimeout = kServerDefaultTimeout;

  // Banners are low urgency and go when the server likes; an alert that
  // does not go by itself is critical and resident, and never expires, so
  // that it waits for the user as the poster asked.
  static NotificationRequest forNotification(const UserNotification& notification);

  friend bool operator==(const NotificationRequest&, const NotificationRequest&) = default;
};

}  // namespace larder
