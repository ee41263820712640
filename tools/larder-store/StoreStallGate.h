#pragma once

#include <chrono>

#include "platform/system/Mutex.h"

namespace larder {

// Where stalled requests wait: closed until the server stops, open for
// good after that, so that a stall never holds up the shutdown.
class StoreStallGate {
 public:
  // Returns once the gate is open.
  void wait();
  // Returns once the gate is open or `delay` has passed; true when open.
  bool waitFor(std::chrono::milliseconds delay);
  void open();

 private:
  Mutex mutex_;
  ConditionVariable opened_;
  bool open_ GUARDED_BY(mutex_) = false;
};

}  // namespace larder
