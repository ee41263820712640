#pragma once

#include <chrono>
#include <optional>

#include "platform/system/Mutex.h"

namespace larder {

// Counting semaphore used where a result is needed in line: the caller
// waits for a completion handler to signal.
class DispatchSemaphore {
 public:
  explicit DispatchSemaphore(long initial = 0) : count_(initial) {}

  void signal();
  // Waits without limit.
  void wait();
  // Returns false when the timeout passed without a signal.
  bool waitFor(std::chrono::steady_clock::duration timeout);

 private:
  Mutex mutex_;
  ConditionVariable condition_;
  long count_ GUARDED_BY(mutex_);
};

}  // namespace larder
