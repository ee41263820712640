// A run loop served by a thread of its own, standing in for the main one.
#pragma once

#include <thread>

#include "platform/dispatch/RunLoop.h"

namespace larder::testing {

class RunLoopThread {
 public:
  RunLoopThread() : thread_([this] { loop_.run(); }) {}
  ~RunLoopThread() {
    loop_.stop();
    thread_.join();
  }
  RunLoopThread(const RunLoopThread&) = delete;
  RunLoopThread& operator=(const RunLoopThread&) = delete;
  RunLoop& loop() { return loop_; }
  [[nodiscard]] std::thread::id id() const { return thread_.get_id(); }

 private:
  RunLoop loop_;
  std::thread thread_;
};

}  // namespace larder::testing
