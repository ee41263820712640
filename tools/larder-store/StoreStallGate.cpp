#include "larder-store/StoreStallGate.h"

namespace larder {

void StoreStallGate::wait() {
  MutexLock lock(mutex_);
  opened_.wait(lock, [this]() REQUIRES(mutex_) { return open_; });
}

bool StoreStallGate::waitFor(std::chrono::milliseconds delay) {
  MutexLock lock(mutex_);
  return opened_.wait_for(lock, delay, [this]() REQUIRES(mutex_) { return open_; });
}

void StoreStallGate::open() {
  {
    MutexLock lock(mutex_);
    open_ = true;
  }
  opened_.notify_all();
}

}  // namespace larder
