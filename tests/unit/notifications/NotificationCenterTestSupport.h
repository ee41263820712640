// What the center's tests share: a delegate that records what it is told,
// a capture of log lines, and a wait for a condition to become true.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "notifications/center/UserNotificationCenter.h"
#include "platform/log/TillLogManager.h"
#include "platform/system/Mutex.h"

namespace larder::testing {

// True once `condition` holds, false when it does not within `timeout`.
inline bool eventually(const std::function<bool()>& condition,
                       std::chrono::milliseconds timeout = std::chrono::seconds(5)) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

class RecordingDelegate final : public UserNotificationCenter::Delegate {
 public:
  struct Call {
    enum Kind { kActivated, kDismissed, kSnoozed };
    Kind kind = kActivated;
    UserNotification notification;
    // Whether the notification was still in the center's list at the call.
    bool wasInList = false;
  };

  void didActivateNotification(UserNotificationCenter& center,
                               const UserNotification& notification) override {
    record(Call::kActivated, center, notification);
  }
  void didDismissAlert(UserNotificationCenter& center,
                       const UserNotification& notification) override {
    record(Call::kDismissed, center, notification);
  }
  void didSnoozeAlert(UserNotificationCenter& center,
                      const UserNotification& notification) override {
    record(Call::kSnoozed, center, notification);
  }
  bool shouldPresentNotification(UserNotificationCenter&,
                                 const UserNotification& notification) override {
    return notification.userInfo.find("hidden") == notification.userInfo.end();
  }

  // The calls so far once there are at least `count`.
  std::vector<Call> waitForCalls(std::size_t count) {
    MutexLock lock(mutex_);
    changed_.wait_for(lock, std::chrono::seconds(5),
                      [&]() REQUIRES(mutex_) { return calls_.size() >= count; });
    return calls_;
  }

 private:
  void record(Call::Kind kind, UserNotificationCenter& center,
              const UserNotification& notification) {
    // Calling back into the center from here must work: no lock of it is held.
    bool inList = false;
    for (const UserNotification& delivered : center.deliveredNotifications()) {
      inList = inList || delivered.identifier == notification.identifier;
    }
    MutexLock lock(mutex_);
    calls_.push_back({kind, notification, inList});
    changed_.notify_all();
  }

  Mutex mutex_;
  ConditionVariable changed_;
  std::vector<Call> calls_ GUARDED_BY(mutex_);
};

// The log lines written while it lives, with their levels.
class LogLines {
 public:
  LogLines() : previousLevel_(TillLogManager::sharedManager().level()) {
    TillLogManager::sharedManager().setLevel(3);
    // The lines are shared with the sink: a queue of a center may still be
    // logging while this goes.
    sink_ = TillLogManager::sharedManager().addSink(
        [lines = lines_](int level, const std::string& line) {
          MutexLock lock(lines->mutex);
          lines->lines.emplace_back(level, line);
        });
  }
  ~LogLines() {
    sink_.reset();
    TillLogManager::sharedManager().setLevel(previousLevel_);
  }
  LogLines(const LogLines&) = delete;
  LogLines& operator=(const LogLines&) = delete;

  [[nodiscard]] bool has(int level, const std::string& line) const {
    return any(
        [&](int lineLevel, const std::string& text) { return lineLevel == level && text == line; });
  }
  [[nodiscard]] bool hasContaining(int level, const std::string& fragment) const {
    return any([&](int lineLevel, const std::string& text) {
      return lineLevel == level && text.find(fragment) != std::string::npos;
    });
  }

 private:
  struct Lines {
    Mutex mutex;
    std::vector<std::pair<int, std::string>> lines GUARDED_BY(mutex);
  };

  [[nodiscard]] bool any(const std::function<bool(int, const std::string&)>& matches) const {
    MutexLock lock(lines_->mutex);
    for (const auto& [level, text] : lines_->lines) {
      if (matches(level, text)) return true;
    }
    return false;
  }

  int previousLevel_;
  std::shared_ptr<Lines> lines_ = std::make_shared<Lines>();
  std::shared_ptr<void> sink_;
};

}  // namespace larder::testing
