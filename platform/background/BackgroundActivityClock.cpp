#include "platform/background/BackgroundActivityClock.h"

#include <time.h>

#include <optional>
#include <thread>

#include "platform/system/Mutex.h"

namespace larder {

namespace {

using Duration = BackgroundActivityClock::Duration;
using TimePoint = BackgroundActivityClock::TimePoint;

// The monotonic clock stops while the machine is suspended; waits in it are therefore cut
// into pieces no longer than this, after each of which boot time is read again.
constexpr std::chrono::seconds kLongestSleep{60};

TimePoint bootTime() {
  timespec now{};
  ::clock_gettime(CLOCK_BOOTTIME, &now);
  return TimePoint(std::chrono::seconds(now.tv_sec) + std::chrono::nanoseconds(now.tv_nsec));
}

// Its thread starts with the first request and ends with the clock.
class SystemClock final : public BackgroundActivityClock {
 public:
  SystemClock() = default;
  SystemClock(const SystemClock&) = delete;
  SystemClock& operator=(const SystemClock&) = delete;

  ~SystemClock() override {
    {
      MutexLock lock(mutex_);
      stopping_ = true;
    }
    changed_.notify_all();
    if (thread_.joinable()) thread_.join();
  }

  [[nodiscard]] TimePoint now() const override { return bootTime(); }

  void scheduleWakeUp(TimePoint time, std::function<void()> wake) override {
    {
      MutexLock lock(mutex_);
      request_ = Request{time, std::move(wake)};
      if (!thread_.joinable()) thread_ = std::thread([this] { run(); });
    }
    changed_.notify_all();
  }

  void cancelWakeUp() override {
    MutexLock lock(mutex_);
    request_.reset();
    if (std::this_thread::get_id() == thread_.get_id()) return;
    changed_.wait(lock, [this]() REQUIRES(mutex_) { return !firing_; });
  }

 private:
  struct Request {
    TimePoint time;
    std::function<void()> wake;
  };

  void run() {
    MutexLock lock(mutex_);
    while (!stopping_) {
      if (!request_) {
        changed_.wait(lock);
        continue;
      }
      const Duration remaining = request_->time - bootTime();
      if (remaining > Duration::zero()) {
        changed_.wait_for(lock, std::min<Duration>(remaining, kLongestSleep));
        continue;
      }
      std::function<void()> wake = std::move(request_->wake);
      request_.reset();
      firing_ = true;
      lock.unlock();
      wake();
      lock.lock();
      firing_ = false;
      changed_.notify_all();
    }
  }

  Mutex mutex_;
  ConditionVariable changed_;
  std::optional<Request> request_ GUARDED_BY(mutex_);
  bool firing_ GUARDED_BY(mutex_) = false;
  bool stopping_ GUARDED_BY(mutex_) = false;
  // Started under the lock; joined by the destructor, when no other
  // thread uses the clock any more.
  std::thread thread_;
};

}  // namespace

std::shared_ptr<BackgroundActivityClock> BackgroundActivityClock::system() {
  return std::make_shared<SystemClock>();
}

}  // namespace larder
