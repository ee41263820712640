#include "notifications/center/NotificationRequest.h"

namespace larder {

NotificationRequest NotificationRequest::forNotification(const UserNotification& notification) {
  NotificationRequest request;
  request.summary = notification.title;
  // Servers differ in the markup they take; the text goes as the poster
  // wrote it.
  request.body = notification.informativeText;

  auto addAction = [&](std::string key, const std::string& label) {
    request.actions.push_back(std::move(key));
    request.actions.push_back(label);
  };
  // A click on the contents has no button of its own.
  addAction(std::string(kDefaultAction), "");
  if (notification.hasActionButton && !notification.actionButtonTitle.empty()) {
    addAction(std::string(kMainAction), notification.actionButtonTitle);
  }
  if (!notification.otherButtonTitle.empty()) {
    addAction(std::string(kOtherAction), notification.otherButtonTitle);
  }
  for (std::size_t index = 0; index < notification.alternateActionButtonTitles.size(); ++index) {
    addAction(std::string(kAlternateActionPrefix) + std::to_string(index),
              notification.alternateActionButtonTitles[index]);
  }

  const bool isAlert = notification.displayStyle == UserNotification::kAlert;
  const bool staysUntilAnswered = isAlert && !notification.poofsOnCancel;
  request.urgency = !isAlert ? kLow : staysUntilAnswered ? kCritical : kNormal;
  request.resident = staysUntilAnswered;
  request.imagePath = notification.imageURL;
  request.expireTimeout = staysUntilAnswered ? kNeverExpires : kServerDefaultTimeout;
  return request;
}

}  // namespace larder
