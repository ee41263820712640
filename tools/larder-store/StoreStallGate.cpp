#include "larder-store/StoreStallGate.h"

namespace larder {

void StoreStallGate::wait() {
  std::unique_lock lock(mutex_);
  opened_.wait(lock, [this] { return open_; });
}

bool StoreStallGate::waitFor(std::chrono::milliseconds delay) {
  std::unique_lock lock(mutex_);
  return opened_.wait_for(lock, delay, [this] { return open_; });
}

void StoreStallGate::open() {
  {
    std::lock_guard lock(mutex_);
    open_ = true;
  }
  opened_.notify_all();
}

}  // namespace larder
