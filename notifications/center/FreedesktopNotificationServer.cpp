#include "notifications/center/FreedesktopNotificationServer.h"

#include <systemd/sd-bus.h>

#include <cstring>
#include <map>

#include <sdbus-c++/sdbus-c++.h>

#include "platform/log/TillLogManager.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "FreedesktopNotificationServer";

// Errors that mean nobody is there to answer, rather than a server that
// said no.
bool meansNoServer(const sdbus::Error& error) {
  const std::string& name = error.getName();
  return name == "org.freedesktop.DBus.Error.ServiceUnknown" ||
         name == "org.freedesktop.DBus.Error.NameHasNoOwner" ||
         name == "org.freedesktop.DBus.Error.NoReply" ||
         name == "org.freedesktop.DBus.Error.Timeout" ||
         name == "org.freedesktop.DBus.Error.Disconnected" ||
         name.starts_with("org.freedesktop.DBus.Error.Spawn.") || name.starts_with("System.Error.");
}

VendError serverError(const sdbus::Error& error) {
  return VendError::withDomain(std::string(NotificationServer::kErrorDomain),
                               meansNoServer(error) ? NotificationServer::kNoServerCode
                                                    : NotificationServer::kCallFailedCode,
                               error.getName() + ": " + error.getMessage());
}

// sdbus-c++ 1.2 does not free its bus object when a connection to a given
// address fails, and a center retries at each call while there is no bus:
// a bus of our own, freed either way, asks first whether anyone answers.
Result<void> probeAddress(const std::string& address) {
  sd_bus* bus = nullptr;
  int result = sd_bus_new(&bus);
  if (result >= 0) result = sd_bus_set_address(bus, address.c_str());
  if (result >= 0) result = sd_bus_set_bus_client(bus, 1);
  if (result >= 0) result = sd_bus_start(bus);
  sd_bus_flush_close_unref(bus);
  if (result >= 0) return {};
  return VendError::withDomain(std::string(NotificationServer::kErrorDomain),
                               NotificationServer::kNoServerCode,
                               "No session bus at " + address + ": " + std::strerror(-result));
}

std::map<std::string, sdbus::Variant> hintsOf(const NotificationRequest& request) {
  std::map<std::string, sdbus::Variant> hints{
      {"urgency", sdbus::Variant(request.urgency)},
      {"desktop-entry", sdbus::Variant(request.desktopEntry)},
  };
  if (request.resident) hints.emplace("resident", sdbus::Variant(true));
  if (!request.imagePath.empty()) hints.emplace("image-path", sdbus::Variant(request.imagePath));
  return hints;
}

}  // namespace

FreedesktopNotificationServer::FreedesktopNotificationServer(std::string busAddress)
    : busAddress_(std::move(busAddress)) {}

FreedesktopNotificationServer::~FreedesktopNotificationServer() {
  MutexLock lock(mutex_);
  disconnectLocked();
}

void FreedesktopNotificationServer::disconnectLocked() {
  // The event loop thread goes first: it may be inside a signal handler of
  // the proxy.
  if (connection_) connection_->leaveEventLoop();
  if (eventLoop_.joinable()) eventLoop_.join();
  proxy_.reset();
  connection_.reset();
}

void FreedesktopNotificationServer::setHandlers(Handlers handlers) {
  MutexLock lock(mutex_);
  handlers_ = std::make_shared<const Handlers>(std::move(handlers));
  disconnectLocked();
  // Listening from the start lets a notification shown before a restart
  // of the service still be acted on.
  if (Result<void> connected = connectLocked(); !connected) {
    TILL_LOG(2, "%@: Not connected to the session bus yet: %@", kSpeaker,
             connected.errorDescription());
  }
}

Result<void> FreedesktopNotificationServer::connectLocked() {
  if (proxy_) return {};
  if (!busAddress_.empty()) {
    if (Result<void> answers = probeAddress(busAddress_); !answers) return answers;
  }
  try {
    std::unique_ptr<sdbus::IConnection> connection =
        busAddress_.empty() ? sdbus::createSessionBusConnection()
                            : sdbus::createSessionBusConnectionWithAddress(busAddress_);
    std::unique_ptr<sdbus::IProxy> proxy =
        sdbus::createProxy(*connection, std::string(kBusName), std::string(kObjectPath));
    if (handlers_) {
      const std::string interface(kInterfaceName);
      // The handlers are copied in: the signals need no lock of ours.
      std::shared_ptr<const Handlers> handlers = handlers_;
      proxy->uponSignal("ActionInvoked")
          .onInterface(interface)
          .call([handlers](std::uint32_t identifier, const std::string& actionKey) {
            if (handlers->actionInvoked) handlers->actionInvoked(identifier, actionKey);
          });
      proxy->uponSignal("NotificationClosed")
          .onInterface(interface)
          .call([handlers](std::uint32_t identifier, std::uint32_t reason) {
            if (handlers->closed) handlers->closed(identifier, reason);
          });
    }
    proxy->finishRegistration();
    eventLoop_ = std::thread([bus = connection.get()] {
      try {
        bus->enterEventLoop();
      } catch (const sdbus::Error& error) {
        TILL_LOG(1, "%@: Lost the session bus: %@: %@", kSpeaker, error.getName(),
                 error.getMessage());
      }
    });
    connection_ = std::move(connection);
    proxy_ = std::move(proxy);
    TILL_LOG(3, "%@: Connected to the session bus", kSpeaker);
    return {};
  } catch (const sdbus::Error& error) {
    return VendError::withDomain(std::string(kErrorDomain), kNoServerCode,
                                 "No session bus: " + error.getName() + ": " + error.getMessage());
  }
}

Result<std::uint32_t> FreedesktopNotificationServer::notify(const NotificationRequest& request) {
  MutexLock lock(mutex_);
  if (Result<void> connected = connectLocked(); !connected) return connected.error();
  try {
    std::uint32_t identifier = 0;
    proxy_->callMethod("Notify")
        .onInterface(std::string(kInterfaceName))
        .withTimeout(kCallTimeout)
        .withArguments(request.appName, request.replacesId, request.appIcon, request.summary,
                       request.body, request.actions, hintsOf(request), request.expireTimeout)
        .storeResultsTo(identifier);
    return identifier;
  } catch (const sdbus::Error& error) {
    // A broken connection is made again at the next call.
    if (error.getName().starts_with("System.Error.")) disconnectLocked();
    return serverError(error);
  }
}

Result<void> FreedesktopNotificationServer::closeNotification(std::uint32_t serverIdentifier) {
  MutexLock lock(mutex_);
  if (Result<void> connected = connectLocked(); !connected) return connected.error();
  try {
    proxy_->callMethod("CloseNotification")
        .onInterface(std::string(kInterfaceName))
        .withTimeout(kCallTimeout)
        .withArguments(serverIdentifier);
    return {};
  } catch (const sdbus::Error& error) {
    if (error.getName().starts_with("System.Error.")) disconnectLocked();
    return serverError(error);
  }
}

}  // namespace larder
