// A notification server in memory: it records what the center asks of it,
// hands out identifiers from 1, and sends the signals a test asks for.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "notifications/center/NotificationServer.h"
#include "platform/system/Mutex.h"

namespace larder::testing {

class FakeNotificationServer final : public NotificationServer {
 public:
  struct Call {
    enum Kind { kNotify, kClose };
    Kind kind = kNotify;
    NotificationRequest request;         // kNotify
    std::uint32_t serverIdentifier = 0;  // given by kNotify, asked by kClose
  };

  void setHandlers(Handlers handlers) override {
    MutexLock lock(mutex_);
    handlers_ = std::move(handlers);
    changed_.notify_all();
  }

  Result<std::uint32_t> notify(const NotificationRequest& request) override {
    MutexLock lock(mutex_);
    changed_.wait(lock, [&]() REQUIRES(mutex_) { return !held_; });
    if (const std::chrono::milliseconds delay = delay_; delay.count() > 0) {
      // A slow server: the center's queue waits, its callers must not.
      lock.unlock();
      std::this_thread::sleep_for(delay);
      lock.lock();
    }
    if (failure_) return *failure_;
    const std::uint32_t identifier = nextIdentifier_++;
    calls_.push_back({Call::kNotify, request, identifier});
    changed_.notify_all();
    return identifier;
  }

  Result<void> closeNotification(std::uint32_t serverIdentifier) override {
    MutexLock lock(mutex_);
    calls_.push_back({Call::kClose, {}, serverIdentifier});
    changed_.notify_all();
    return {};
  }

  // Notify calls wait until `release`.
  void hold() {
    MutexLock lock(mutex_);
    held_ = true;
  }
  void release() {
    MutexLock lock(mutex_);
    held_ = false;
    changed_.notify_all();
  }
  void failWith(VendError error) {
    MutexLock lock(mutex_);
    failure_ = std::move(error);
  }
  void setDelay(std::chrono::milliseconds delay) {
    MutexLock lock(mutex_);
    delay_ = delay;
  }

  // The calls so far once there are at least `count` of them; fewer when
  // they do not come within a few seconds.
  std::vector<Call> waitForCalls(std::size_t count) {
    MutexLock lock(mutex_);
    changed_.wait_for(lock, std::chrono::seconds(5),
                      [&]() REQUIRES(mutex_) { return calls_.size() >= count; });
    return calls_;
  }

  // Sends a signal as the server would, once the center listens.
  void emitActionInvoked(std::uint32_t serverIdentifier, const std::string& actionKey) {
    Handlers handlers = waitForHandlers();
    if (handlers.actionInvoked) handlers.actionInvoked(serverIdentifier, actionKey);
  }
  void emitClosed(std::uint32_t serverIdentifier, std::uint32_t reason) {
    Handlers handlers = waitForHandlers();
    if (handlers.closed) handlers.closed(serverIdentifier, reason);
  }

 private:
  Handlers waitForHandlers() {
    MutexLock lock(mutex_);
    changed_.wait_for(lock, std::chrono::seconds(5),
                      [&]() REQUIRES(mutex_) { return static_cast<bool>(handlers_.closed); });
    return handlers_;
  }

  Mutex mutex_;
  ConditionVariable changed_;
  Handlers handlers_ GUARDED_BY(mutex_);
  std::vector<Call> calls_ GUARDED_BY(mutex_);
  std::uint32_t nextIdentifier_ GUARDED_BY(mutex_) = 1;
  bool held_ GUARDED_BY(mutex_) = false;
  std::optional<VendError> failure_ GUARDED_BY(mutex_);
  std::chrono::milliseconds delay_ GUARDED_BY(mutex_){0};
};

}  // namespace larder::testing
