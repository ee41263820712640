#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <optional>

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
  std::mutex mutex_;
  std::condition_variable condition_;
  long count_;
};

}  // namespace larder
