#include "AssetService/NotificationsInterface.h"

#include "AssetService/BusMethodExport.h"
#include "client/DBusValueCodec.h"
#include "client/NotificationsProtocol.h"
#include "notifications/center/UserNotificationCenter.h"
#include "platform/log/TillLogManager.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "NotificationsInterface";

std::shared_ptr<UserNotificationCenter> serviceCenter() {
  return UserNotificationCenter::centerForIdentifier(
      std::string(UserNotificationCenter::kServiceIdentifier),
      UserNotificationCenter::kSystemCenter);
}

}  // namespace

NotificationsInterface::NotificationsInterface(std::shared_ptr<UserNotificationCenter> center)
    : center_(center ? std::move(center) : serviceCenter()) {}

void NotificationsInterface::exportOn(sdbus::IObject& object) {
  exportBusMethods<NotificationsInterface>(
      object, NotificationsProtocol::kInterfaceName, NotificationsProtocol::methods(),
      {{"DeliveredNotifications", &NotificationsInterface::deliveredNotifications},
       {"ActivateNotification", &NotificationsInterface::activateNotification}},
      shared_from_this());
}

void NotificationsInterface::deliveredNotifications(sdbus::MethodCall call) {
  PlistArray list;
  for (const UserNotification& notification : center_->deliveredNotifications()) {
    list.emplace_back(notification.toDictionary());
  }
  // One argument, the list: spelled out, since a braced list of one array
  // would be taken for the array itself.
  DBusValueCodec::reply(call, "aa{sv}", PlistArray{PlistValue(std::move(list))});
}

// Answered after the delegate has been told, so that a script that
// activates and then looks sees the effect.
void NotificationsInterface::activateNotification(sdbus::MethodCall call) {
  const PlistArray arguments = DBusValueCodec::readAll(call, "ss");
  const std::string& identifier = *arguments[0].string();
  const std::string& actionKey = *arguments[1].string();
  TILL_LOG(2, "%@: Activating notification %@ with %@ for %@", kSpeaker, identifier, actionKey,
           call.getSender());
  Result<void> activated = center_->activate(identifier, actionKey);
  DBusValueCodec::reply(call, "a{sv}",
                        {activated ? PlistDictionary{} : activated.error().toDictionary()});
}

}  // namespace larder
