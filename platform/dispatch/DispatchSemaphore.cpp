#include "platform/dispatch/DispatchSemaphore.h"

namespace larder {

void DispatchSemaphore::signal() {
  // Notified under the lock: a waiter typically owns the semaphore on its stack and may destroy
  // it as soon as it sees the count, which must not happen while notify_one still touches it.
  MutexLock lock(mutex_);
  ++count_;
  condition_.notify_one();
}

void DispatchSemaphore::wait() {
  MutexLock lock(mutex_);
  condition_.wait(lock, [this]() REQUIRES(mutex_) { return count_ > 0; });
  --count_;
}

bool DispatchSemaphore::waitFor(std::chrono::steady_clock::duration timeout) {
  using Clock = std::chrono::steady_clock;
  const auto signalled = [this]() REQUIRES(mutex_) { return count_ > 0; };
  const Clock::time_point now = Clock::now();
  MutexLock lock(mutex_);
  // Callers pass duration::max() for "no limit"; adding it to the clock would overflow.
  if (timeout >= Clock::time_point::max() - now) {
    condition_.wait(lock, signalled);
  } else if (!condition_.wait_until(lock, now + timeout, signalled)) {
    return false;
  }
  --count_;
  return true;
}

}  // namespace larder
