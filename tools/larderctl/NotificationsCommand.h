#pragma once

#include <optional>
#include <string>

#include "client/ServiceClient.h"
#include "platform/value/PlistValue.h"

namespace larder {

// `larderctl notifications`: what the service told the user, as it keeps
// it; and, with --activate, a user's action on one of them as the desktop's
// notification server would report it.
class NotificationsCommand {
 public:
  NotificationsCommand(ServiceClient& client, bool json) : client_(client), json_(json) {}

  // 0 with notifications listed, 3 when there are none.
  int list();
  // `action` is "default" (the contents, when not given), "action",
  // "other", or the number of an entry of the main button's menu.
  int activate(const std::string& identifier, const std::optional<std::string>& action);

  // The action key the service expects for the --action word.
  static std::string actionKeyFor(const std::optional<std::string>& action);
  // The lines of one notification in the listing.
  static std::string describe(const PlistValue& notification);

 private:
  ServiceClient& client_;
  bool json_;
};

}  // namespace larder
