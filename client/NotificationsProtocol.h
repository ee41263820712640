#pragma once

#include <span>
#include <string_view>

#include "client/BusMethod.h"

namespace larder {

// "com.orvane.larderd.Notifications" on the service object: the
// notifications the service delivered, and their activation as the
// desktop's notification server would report it, for tools and scripts.
class NotificationsProtocol {
 public:
  static constexpr std::string_view kInterfaceName = "com.orvane.larderd.Notifications";

  static std::span<const BusMethod> methods();
  static const BusMethod* findMethod(std::string_view member);
};

}  // namespace larder
