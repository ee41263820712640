#pragma once

#include <atomic>

namespace larder {

// Receives the activations of the notifications the service posted. It is
// started before the listener exists, so that an activation that arrives
// with the first requests already has its delegate.
class UserNotificationCenterDelegate {
 public:
  static UserNotificationCenterDelegate& sharedInstance();

  void start();
  [[nodiscard]] bool isStarted() const { return started_.load(); }

 private:
  UserNotificationCenterDelegate() = default;
  std::atomic<bool> started_{false};
};

}  // namespace larder
