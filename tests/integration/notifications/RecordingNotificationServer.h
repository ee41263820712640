// A notification server on a test's session bus: it owns
// org.freedesktop.Notifications, records each Notify and CloseNotification
// with its arguments exactly as they came over the bus, and sends the
// server's signals when the test asks.
#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <sdbus-c++/sdbus-c++.h>

#include "platform/system/Mutex.h"

namespace larder::testing {

class RecordingNotificationServer {
 public:
  static constexpr const char* kName = "org.freedesktop.Notifications";
  static constexpr const char* kPath = "/org/freedesktop/Notifications";
  static constexpr const char* kInterface = "org.freedesktop.Notifications";

  struct NotifyCall {
    std::string appName;
    std::uint32_t replacesId = 0;
    std::string appIcon;
    std::string summary;
    std::string body;
    std::vector<std::string> actions;
    // Each hint as its D-Bus type and its value as text: "y 2", "b 1", "s text".
    std::map<std::string, std::string> hints;
    std::int32_t expireTimeout = 0;
    // What the server answered.
    std::uint32_t identifier = 0;
    friend bool operator==(const NotifyCall&, const NotifyCall&) = default;
  };

  // Owns the name on the bus at `address`; identifiers are handed out from
  // `firstIdentifier`.
  RecordingNotificationServer(const std::string& address, std::uint32_t firstIdentifier)
      : nextIdentifier_(firstIdentifier) {
    connection_ = sdbus::createSessionBusConnectionWithAddress(address);
    connection_->requestName(kName);
    object_ = sdbus::createObject(*connection_, kPath);
    object_->registerMethod("Notify")
        .onInterface(kInterface)
        .implementedAs([this](const std::string& appName, const std::uint32_t& replacesId,
                              const std::string& appIcon, const std::string& summary,
                              const std::string& body, const std::vector<std::string>& actions,
                              const std::map<std::string, sdbus::Variant>& hints,
                              const std::int32_t& expireTimeout) {
          NotifyCall call{appName, replacesId, appIcon, summary, body, actions, {}, expireTimeout};
          for (const auto& [key, value] : hints) call.hints[key] = describe(value);
          MutexLock lock(mutex_);
          call.identifier = nextIdentifier_++;
          notifyCalls_.push_back(call);
          changed_.notify_all();
          return call.identifier;
        });
    object_->registerMethod("CloseNotification")
        .onInterface(kInterface)
        .implementedAs([this](const std::uint32_t& identifier) {
          MutexLock lock(mutex_);
          closeCalls_.push_back(identifier);
          changed_.notify_all();
        });
    object_->registerSignal("ActionInvoked")
        .onInterface(kInterface)
        .withParameters<std::uint32_t, std::string>();
    object_->registerSignal("NotificationClosed")
        .onInterface(kInterface)
        .withParameters<std::uint32_t, std::uint32_t>();
    object_->finishRegistration();
    connection_->enterEventLoopAsync();
  }
  ~RecordingNotificationServer() {
    connection_->leaveEventLoop();
    object_.reset();
    connection_.reset();
  }
  RecordingNotificationServer(const RecordingNotificationServer&) = delete;
  RecordingNotificationServer& operator=(const RecordingNotificationServer&) = delete;

  // The calls once there are at least `count`; fewer when they do not come
  // within a few seconds.
  std::vector<NotifyCall> waitForNotifyCalls(std::size_t count) {
    MutexLock lock(mutex_);
    changed_.wait_for(lock, std::chrono::seconds(5),
                      [&]() REQUIRES(mutex_) { return notifyCalls_.size() >= count; });
    return notifyCalls_;
  }
  std::vector<std::uint32_t> waitForCloseCalls(std::size_t count) {
    MutexLock lock(mutex_);
    changed_.wait_for(lock, std::chrono::seconds(5),
                      [&]() REQUIRES(mutex_) { return closeCalls_.size() >= count; });
    return closeCalls_;
  }

  void emitActionInvoked(std::uint32_t identifier, const std::string& actionKey) {
    object_->emitSignal("ActionInvoked")
        .onInterface(kInterface)
        .withArguments(identifier, actionKey);
  }
  void emitClosed(std::uint32_t identifier, std::uint32_t reason) {
    object_->emitSignal("NotificationClosed")
        .onInterface(kInterface)
        .withArguments(identifier, reason);
  }

 private:
  static std::string describe(const sdbus::Variant& value) {
    const std::string type = value.peekValueType();
    if (type == "y") return "y " + std::to_string(value.get<std::uint8_t>());
    if (type == "b") return std::string("b ") + (value.get<bool>() ? "true" : "false");
    if (type == "s") return "s " + value.get<std::string>();
    if (type == "i") return "i " + std::to_string(value.get<std::int32_t>());
    return type + " ?";
  }

  std::unique_ptr<sdbus::IConnection> connection_;
  std::unique_ptr<sdbus::IObject> object_;
  Mutex mutex_;
  ConditionVariable changed_;
  std::uint32_t nextIdentifier_ GUARDED_BY(mutex_);
  std::vector<NotifyCall> notifyCalls_ GUARDED_BY(mutex_);
  std::vector<std::uint32_t> closeCalls_ GUARDED_BY(mutex_);
};

}  // namespace larder::testing
