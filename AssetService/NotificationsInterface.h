#pragma once

#include <memory>

#include <sdbus-c++/IObject.h>
#include <sdbus-c++/Message.h>

namespace larder {

class UserNotificationCenter;

// The service's delivered notifications for tools and scripts on the bus
// (`larderctl notifications`): the list as the service keeps it, and an
// activation as the desktop's notification server would report it.
class NotificationsInterface : public std::enable_shared_from_this<NotificationsInterface> {
 public:
  // A null center means the service's own.
  explicit NotificationsInterface(std::shared_ptr<UserNotificationCenter> center = nullptr);

  // Adds the methods to the service object before its registration ends.
  void exportOn(sdbus::IObject& object);

 private:
  void deliveredNotifications(sdbus::MethodCall call);
  void activateNotification(sdbus::MethodCall call);

  std::shared_ptr<UserNotificationCenter> center_;
};

}  // namespace larder
