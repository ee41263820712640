#include "notifications/activation/UserNotificationCenterDelegate.h"

#include "platform/log/TillLogManager.h"

namespace larder {

UserNotificationCenterDelegate& UserNotificationCenterDelegate::sharedInstance() {
  static UserNotificationCenterDelegate instance;
  return instance;
}

void UserNotificationCenterDelegate::start() {
  if (started_.exchange(true)) return;
  TILL_LOG(3, "%@: started", "UserNotificationCenterDelegate");
}

}  // namespace larder
