#pragma once

#include <chrono>
#include <memory>
#include <string>
#include <string_view>
#include <thread>

#include "notifications/center/NotificationServer.h"
#include "platform/system/Mutex.h"

namespace sdbus {
class IConnection;
class IProxy;
}  // namespace sdbus

namespace larder {

// The notification server of the desktop session: whoever owns
// org.freedesktop.Notifications on the session bus. It talks to it over a
// session bus connection of its own, made at the first need and made again
// after a call found no bus, so that a bus or server that comes later is
// used. Its signals are matched on the server's well-known name, which the
// bus resolves to the name's current owner: a peer that merely claims to
// be the server reaches nobody.
class FreedesktopNotificationServer final : public NotificationServer {
 public:
  static constexpr std::string_view kBusName = "org.freedesktop.Notifications";
  static constexpr std::string_view kObjectPath = "/org/freedesktop/Notifications";
  static constexpr std::string_view kInterfaceName = "org.freedesktop.Notifications";
  // A server that does not answer in this time counts as absent for the
  // call; the center's queue waits at most this long.
  static constexpr std::chrono::seconds kCallTimeout{10};

  // The session bus of the environment, or the bus at `busAddress`.
  explicit FreedesktopNotificationServer(std::string busAddress = {});
  ~FreedesktopNotificationServer() override;
  FreedesktopNotificationServer(const FreedesktopNotificationServer&) = delete;
  FreedesktopNotificationServer& operator=(const FreedesktopNotificationServer&) = delete;

  void setHandlers(Handlers handlers) override;
  Result<std::uint32_t> notify(const NotificationRequest& request) override;
  Result<void> closeNotification(std::uint32_t serverIdentifier) override;

 private:
  // Connected and listening, or the error that says why not.
  Result<void> connectLocked() REQUIRES(mutex_);
  void disconnectLocked() REQUIRES(mutex_);

  const std::string busAddress_;
  Mutex mutex_;
  std::shared_ptr<const Handlers> handlers_ GUARDED_BY(mutex_);
  std::unique_ptr<sdbus::IConnection> connection_ GUARDED_BY(mutex_);
  std::unique_ptr<sdbus::IProxy> proxy_ GUARDED_BY(mutex_);
  // Runs the connection's event loop, which delivers the signals. Ours
  // rather than the library's, so that a bus that goes away ends the
  // thread instead of the process.
  std::thread eventLoop_ GUARDED_BY(mutex_);
};

}  // namespace larder
