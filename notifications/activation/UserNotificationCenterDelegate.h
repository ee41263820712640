#pragma once

#include <atomic>
#include <memory>

namespace larder {

class UserNotificationCenter;

// Receives the activations of the notifications the service posted. It is
// started before the listener exists, so that an activation that arrives
// with the first requests already has its delegate. For now it acts on the
// restart countdown alone, whose buttons answer the deferred-install agent;
// every other activation is only logged.
class UserNotificationCenterDelegate {
 public:
  static UserNotificationCenterDelegate& sharedInstance();

  // Becomes the delegate of the service's notification center.
  void start();
  // Becomes the delegate of `center` (start does this for the service's).
  void attachTo(UserNotificationCenter& center);
  [[nodiscard]] bool isStarted() const { return started_.load(); }

 private:
  class Responder;

  UserNotificationCenterDelegate();
  std::atomic<bool> started_{false};
  // What the center holds, weakly; it lives as long as the process.
  const std::shared_ptr<Responder> responder_;
};

}  // namespace larder
