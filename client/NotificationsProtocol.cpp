#include "client/NotificationsProtocol.h"

#include <vector>

namespace larder {

namespace {

const std::vector<BusMethod>& methodTable() {
  static const std::vector<BusMethod> table{
      {"DeliveredNotifications", "", {}, "aa{sv}", {"notifications"}},
      // The action key: "default" (the contents), "action" (the main
      // button), "other" (the second button), "alternate-N" (menu entry N).
      {"ActivateNotification", "ss", {"identifier", "actionKey"}, "a{sv}", {"error"}},
  };
  return table;
}

}  // namespace

std::span<const BusMethod> NotificationsProtocol::methods() {
  return methodTable();
}

const BusMethod* NotificationsProtocol::findMethod(std::string_view member) {
  return findBusMethod(methodTable(), member);
}

}  // namespace larder
