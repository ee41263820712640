#pragma once

#include <functional>

#include "platform/system/Mutex.h"

namespace larder {

// Spreads the progress reports of a simulated scan, download or install
// over the time it is meant to take, and lets another thread cancel it. The
// waits are on a condition variable so that a cancellation ends even a long
// simulated install at once.
class SysupOperationPacer {
 public:
  // Reports handed out per run, 0 and 100 included.
  static constexpr int kSteps = 4;

  // Calls `report` with 0, then with a larger percent after each equal share of
  // `seconds` (all at once when 0), up to 100. False when cancelled first.
  bool run(double seconds, const std::function<void(double percent)>& report);
  void cancel();
  [[nodiscard]] bool isCancelled();

 private:
  Mutex mutex_;
  ConditionVariable condition_;
  bool cancelled_ GUARDED_BY(mutex_) = false;
};

}  // namespace larder
