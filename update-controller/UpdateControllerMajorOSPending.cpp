// The major OS update notification's buttons, until the major OS update
// work of the controller lands: what they were asked is logged, nothing
// else happens.
#include "notifications/center/UserNotification.h"
#include "platform/log/TillLogManager.h"
#include "update-controller/UpdateController.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateController";

}  // namespace

void UpdateController::didActivateMajorOSUpdateNotification(const UserNotification& notification) {
  TILL_LOG(1,
           "%@: Major OS update notification %@ activated (type %ld); not acted on in this build",
           kSpeaker, notification.identifier, notification.activationType);
}

void UpdateController::didDismissMajorOSUpdateNotification(const UserNotification& notification) {
  TILL_LOG(1, "%@: Major OS update notification %@ dismissed; not acted on in this build", kSpeaker,
           notification.identifier);
}

}  // namespace larder
