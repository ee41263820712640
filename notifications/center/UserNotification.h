#pragma once

#include <chrono>
#include <cstdint>
#include <limits>
#include <optional>
#include <string>
#include <vector>

#include "platform/value/PlistValue.h"

namespace larder {

// One notification as the service builds it and the center keeps it. The
// first group of fields is what the poster sets; the second is the center's
// (filled in at delivery and at activation).
struct UserNotification {
  enum DisplayStyle : std::int64_t { kBanner = 1, kAlert = 2 };
  // How the user reached the notification.
  enum ActivationType : std::int64_t {
    kActivationNone = 0,
    kContentsClicked = 1,
    kActionButtonClicked = 2,
  };
  static constexpr std::int64_t kNoAlternateAction = std::numeric_limits<std::int64_t>::max();
  // The only style value set: the notification after a silent install.
  static constexpr std::int64_t kPostInstallStyle = 100000;

  std::string title;
  std::string informativeText;
  std::string actionButtonTitle;
  std::string otherButtonTitle;
  // False hides the main button.
  bool hasActionButton = true;
  // Kept with the notification and given back at activation.
  PlistDictionary userInfo;
  std::int64_t displayStyle = kBanner;
  // A file path or file URL of the icon; empty for none.
  std::string imageURL;
  // False on alerts that stay until the user acts.
  bool poofsOnCancel = true;
  // The entries of the main button's menu, in order.
  std::vector<std::string> alternateActionButtonTitles;
  bool alwaysShowAlternateActionMenu = false;
  std::int64_t style = 0;
  // The user may clear it from the store application's list.
  bool clearable = false;

  // --- Set by the center ---
  // Unique per center; given at delivery.
  std::string identifier;
  std::optional<std::chrono::system_clock::time_point> actualDeliveryDate;
  // The notification server's own number for it, 0 when no server showed it.
  std::uint32_t serverIdentifier = 0;
  // On screen: shown by the server and not closed since.
  bool displayed = false;
  std::int64_t activationType = kActivationNone;
  // The chosen menu entry, or kNoAlternateAction.
  std::int64_t alternateActionIndex = kNoAlternateAction;

  // The user info's "Source", or empty.
  [[nodiscard]] std::string source() const;

  // The stored and wire form: every field under its own name.
  [[nodiscard]] PlistDictionary toDictionary() const;
  // Fields that are missing or of the wrong type keep their defaults; no
  // identifier means no notification.
  static std::optional<UserNotification> fromDictionary(const PlistDictionary& dictionary);

  friend bool operator==(const UserNotification&, const UserNotification&) = default;
};

}  // namespace larder
