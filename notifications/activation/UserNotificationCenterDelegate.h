#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "notifications/center/UserNotification.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/core/VendStoreClient.h"

namespace larder {

class UpdateController;
class UserNotificationCenter;

// The process's one receiver of what the user does with a notification.
// Notifications outlive the run of the service that posted them, so the
// delegate keeps nothing about them: everything it needs stands in the
// notification's user info, the update controller concerned included, which
// is found again from there after a restart. It decides by the "Source", by
// how the notification was activated and by a few flags; it calls the
// controller or opens the store application, and traces what the user did.
//
// It is started before the listener exists, so that an activation that
// arrives with the first requests already has its delegate. Callbacks come
// on the center's delegate queue and return at once: the controller's work
// runs on the controller's own queues.
class UserNotificationCenterDelegate {
 public:
  // Finds the update controller of a store client.
  using ControllerFinder =
      std::function<std::shared_ptr<UpdateController>(const VendStoreClient& storeClient)>;

  // The identifier of the store application's own list (type 1).
  static constexpr std::string_view kApplicationIdentifier = "com.orvane.quaymart";

  // Domains of the traces.
  static constexpr std::string_view kClickTraceDomain =
      "com.orvane.Quaymart.update_notification.clicked";
  static constexpr std::string_view kOptInTraceDomain = "com.orvane.Quaymart.autoupdate.opt_in";
  static constexpr std::string_view kRestartRequiredOptInTraceDomain =
      "com.orvane.Quaymart.autoupdate.restart_required.opt_in";

  // The pages of the store application that activations open.
  static constexpr std::string_view kUpdatesPageURL =
      "quaymart://showUpdatesPage?source=notification";
  static constexpr std::string_view kPurchasesPageURL = "quaymart://showPurchasesPage";

  static UserNotificationCenterDelegate& sharedInstance();
  // A delegate of its own, outside the process's centers: controllers come
  // from `finder`, and the store application's list is `applicationCenter`.
  // For tests.
  static std::unique_ptr<UserNotificationCenterDelegate> makeForTesting(
      ControllerFinder finder, std::shared_ptr<UserNotificationCenter> applicationCenter);
  ~UserNotificationCenterDelegate();
  UserNotificationCenterDelegate(const UserNotificationCenterDelegate&) = delete;
  UserNotificationCenterDelegate& operator=(const UserNotificationCenterDelegate&) = delete;

  // Becomes the delegate of the store application's list and of the
  // service's center.
  void start();
  // Becomes the delegate of `center` (start does this for the process's).
  void attachTo(UserNotificationCenter& center);
  [[nodiscard]] bool isStarted() const { return started_.load(); }

  // The client named by "storeClientIdentifier" and
  // "storeClientFrameworkVersion" of the user info; nothing for an unknown one.
  [[nodiscard]] static std::optional<VendStoreClient> storeClientForNotification(
      const UserNotification& notification);
  // That client's controller, made on first use; null without a client.
  [[nodiscard]] std::shared_ptr<UpdateController> updateControllerForNotification(
      const UserNotification& notification) const;

  // --- What the center tells ---
  [[nodiscard]] bool shouldPresentNotification(UserNotificationCenter& center,
                                               const UserNotification& notification) const;
  void didActivateNotification(UserNotificationCenter& center,
                               const UserNotification& notification) const;
  void didDismissAlert(UserNotificationCenter& center, const UserNotification& notification) const;
  void didSnoozeAlert(UserNotificationCenter& center, const UserNotification& notification) const;

  // The hours since the notification was delivered, as a click trace
  // carries them: whole hours with two significant digits (123 is 120).
  [[nodiscard]] static std::int64_t displayedIntervalInHours(
      const UserNotification& notification, std::chrono::system_clock::time_point now);
  // Whole seconds since delivery, 0 without a delivery date.
  [[nodiscard]] static std::int64_t displayedIntervalInSeconds(
      const UserNotification& notification, std::chrono::system_clock::time_point now);

 private:
  class Responder;
  struct Activation;

  UserNotificationCenterDelegate(ControllerFinder finder,
                                 std::shared_ptr<UserNotificationCenter> applicationCenter);

  [[nodiscard]] std::shared_ptr<UserNotificationCenter> applicationCenter() const;

  // The steps of an activation, by how it came.
  void activateByMainButton(UserNotificationCenter& center, const Activation& activation) const;
  void activateAppUpdateButton(UserNotificationCenter& center, const Activation& activation) const;
  void activateByContentsClick(UserNotificationCenter& center, const Activation& activation) const;
  void dismissAppUpdate(UserNotificationCenter& center, const Activation& activation) const;
  // The store application's list keeps only this notification, clearable.
  void keepInApplicationList(const UserNotification& notification) const;

  const ControllerFinder finder_;
  // Null for the shared instance, which uses the process's center.
  const std::shared_ptr<UserNotificationCenter> applicationCenterForTesting_;
  std::atomic<bool> started_{false};
  // What the centers hold, weakly; it lives as long as the delegate.
  const std::shared_ptr<Responder> responder_;
};

}  // namespace larder
