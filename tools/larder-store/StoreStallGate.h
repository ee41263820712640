#pragma once

#include <condition_variable>
#include <mutex>

namespace larder {

// Where stalled requests wait: closed until the server stops, open for
// good after that, so that a stall never holds up the shutdown.
class StoreStallGate {
 public:
  // Returns once the gate is open.
  void wait();
  void open();

 private:
  std::mutex mutex_;
  std::condition_variable opened_;
  bool open_ = false;
};

}  // namespace larder
