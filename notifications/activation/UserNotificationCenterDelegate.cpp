#include "notifications/activation/UserNotificationCenterDelegate.h"

#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "notifications/center/UserNotificationCenter.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/host/LedgerTwilightAgent.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UserNotificationCenterDelegate";

}  // namespace

class UserNotificationCenterDelegate::Responder : public UserNotificationCenter::Delegate {
 public:
  void didActivateNotification(UserNotificationCenter& /*center*/,
                               const UserNotification& notification) override {
    answer(notification, false);
  }
  void didDismissAlert(UserNotificationCenter& /*center*/,
                       const UserNotification& notification) override {
    answer(notification, true);
  }
  bool shouldPresentNotification(UserNotificationCenter& /*center*/,
                                 const UserNotification& /*notification*/) override {
    return true;
  }

 private:
  static void answer(const UserNotification& notification, bool dismissed) {
    std::optional<std::int64_t> result =
        UpdateNotificationCatalogue::restartCountdownAnswer(notification, dismissed);
    if (!result) {
      TILL_LOG(2, "%@: Notification %@ (%@) activated; nothing acts on it yet", kSpeaker,
               notification.identifier, notification.source());
      return;
    }
    LedgerTwilightAgent::answerRestartCountdown(*result);
  }
};

UserNotificationCenterDelegate::UserNotificationCenterDelegate()
    : responder_(std::make_shared<Responder>()) {}

UserNotificationCenterDelegate& UserNotificationCenterDelegate::sharedInstance() {
  static UserNotificationCenterDelegate instance;
  return instance;
}

void UserNotificationCenterDelegate::start() {
  if (started_.exchange(true)) return;
  attachTo(*UserNotificationCenter::centerForIdentifier(
      std::string(UserNotificationCenter::kServiceIdentifier),
      UserNotificationCenter::kSystemCenter));
  TILL_LOG(3, "%@: started", kSpeaker);
}

void UserNotificationCenterDelegate::attachTo(UserNotificationCenter& center) {
  center.setDelegate(responder_);
}

}  // namespace larder
