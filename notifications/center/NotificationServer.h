#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>

#include "notifications/center/NotificationRequest.h"
#include "platform/error/Result.h"

namespace larder {

// The desktop's notification server as the center sees it. Calls may block
// for as long as the server takes to answer: the center makes them from a
// queue of its own, never on a caller's thread.
class NotificationServer {
 public:
  static constexpr std::string_view kErrorDomain = "NotificationServer";
  // Nobody answers for notifications: no session bus, or no server on it.
  static constexpr std::int64_t kNoServerCode = 1;
  // The server answered with an error.
  static constexpr std::int64_t kCallFailedCode = 2;

  // What the server tells of the notifications it shows. Handlers are
  // called on a thread of the server's and must not block.
  struct Handlers {
    std::function<void(std::uint32_t serverIdentifier, const std::string& actionKey)> actionInvoked;
    std::function<void(std::uint32_t serverIdentifier, std::uint32_t reason)> closed;
  };

  virtual ~NotificationServer() = default;

  // Set once, before the first call; from then on the server's signals
  // reach the handlers, also those of notifications shown before a restart
  // of the service.
  virtual void setHandlers(Handlers handlers) = 0;
  // The server's identifier of the notification it now shows.
  virtual Result<std::uint32_t> notify(const NotificationRequest& request) = 0;
  virtual Result<void> closeNotification(std::uint32_t serverIdentifier) = 0;

 protected:
  NotificationServer() = default;
};

}  // namespace larder
