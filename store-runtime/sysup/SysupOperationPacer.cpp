#include "store-runtime/sysup/SysupOperationPacer.h"

#include <algorithm>
#include <chrono>

namespace larder {

namespace {

// Longer simulated runs are a mistake in the state file, not a wish.
constexpr double kLongestRunSeconds = 24 * 3600;

}  // namespace

bool SysupOperationPacer::run(double seconds, const std::function<void(double percent)>& report) {
  const auto start = std::chrono::steady_clock::now();
  const std::chrono::duration<double> length(std::clamp(seconds, 0.0, kLongestRunSeconds));
  for (int step = 0; step <= kSteps; ++step) {
    const auto deadline = start + std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                                      length * step / kSteps);
    {
      MutexLock lock(mutex_);
      condition_.wait_until(lock, deadline, [this]() REQUIRES(mutex_) { return cancelled_; });
      if (cancelled_) return false;
    }
    if (report) report(100.0 * step / kSteps);
  }
  return !isCancelled();
}

void SysupOperationPacer::cancel() {
  MutexLock lock(mutex_);
  cancelled_ = true;
  condition_.notify_all();
}

bool SysupOperationPacer::isCancelled() {
  MutexLock lock(mutex_);
  return cancelled_;
}

}  // namespace larder
