#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "notifications/center/UserNotification.h"
#include "platform/error/Result.h"
#include "platform/system/Mutex.h"

namespace larder {

class DeliveredNotificationList;
class NotificationServer;

// The notifications of one poster: those delivered, kept in a list that
// survives a restart of the service (the desktop's notification server
// keeps nothing), and shown on the desktop's notification server while one
// is on the session bus. Safe from any thread; delivering and removing
// return without waiting for the server.
class UserNotificationCenter : public std::enable_shared_from_this<UserNotificationCenter> {
 public:
  enum Type : std::int64_t {
    // The store application's own list; nothing of it is shown.
    kApplicationCenter = 1,
    // The service's notifications, shown on the desktop.
    kSystemCenter = 2,
  };

  // Told what the user did with a notification. Called on the center's
  // signal thread, never with a lock of the center held.
  class Delegate {
   public:
    virtual ~Delegate() = default;
    // The contents were clicked, or the main button or one of its menu
    // entries was used (see activationType, alternateActionIndex).
    virtual void didActivateNotification(UserNotificationCenter& center,
                                          const UserNotification& notification) = 0;
    // The second button of an alert was used.
    virtual void didDismissAlert(UserNotificationCenter& center,
                                 const UserNotification& notification) = 0;
    // Asked before a notification is shown; false keeps it in the list only.
    virtual bool shouldPresentNotification(UserNotificationCenter& center,
                                           const UserNotification& notification) = 0;
  };

  // The one center of this identifier and type in the process, made on first
  // use; its list is read from the state folder then.
  static std::shared_ptr<UserNotificationCenter> centerForIdentifier(const std::string& identifier,
                                                                     Type type);

  ~UserNotificationCenter();
  UserNotificationCenter(const UserNotificationCenter&) = delete;
  UserNotificationCenter& operator=(const UserNotificationCenter&) = delete;

  [[nodiscard]] const std::string& identifier() const { return identifier_; }
  [[nodiscard]] Type type() const { return type_; }

  void setDelegate(std::weak_ptr<Delegate> delegate);

  // Gives the notification its identifier and delivery date, records it and
  // asks the server to show it. Returns the recorded notification.
  UserNotification deliverNotification(UserNotification notification);
  [[nodiscard]] std::vector<UserNotification> deliveredNotifications() const;
  // Takes it out of the list (matched by identifier) and off the screen.
  void removeDeliveredNotification(const UserNotification& notification);
  // Those on screen at the moment.
  [[nodiscard]] std::vector<UserNotification> displayedNotifications() const;
  // Takes it off the screen; it stays in the list.
  void removeDisplayedNotification(const UserNotification& notification);
  // Replaces the whole list; what leaves it leaves the screen too.
  void setDeliveredNotifications(std::vector<UserNotification> notifications);

  // What the user does, as the notification server reports it. An action key
  // is "default" (the contents), "action" (the main button), "other" (the
  // second button) or "alternate-N" (menu entry N). Unknown identifiers and
  // keys are errors; the delegate is told of the rest.
  Result<void> activate(const std::string& notificationIdentifier, const std::string& actionKey);

  // Replaces the connection to the desktop's notification server (tests;
  // the service keeps the session bus's). Null: nothing is shown.
  void setServer(std::shared_ptr<NotificationServer> server);

 private:
  UserNotificationCenter(std::string identifier, Type type);
  // ...
  const std::string identifier_;
  const Type type_;
};

}  // namespace larder
