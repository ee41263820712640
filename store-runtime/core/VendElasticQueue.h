#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <string>

namespace larder {

// Runs tasks on threads of its own, never on the caller's, and never lets
// a queued task wait for a running one: a new thread starts whenever none
// is idle. A task may therefore block for as long as its work takes, and
// may wait for another task that it queued here, without a bound on
// either; idle threads leave after `idleTimeout`. A bounded pool cannot
// promise that, because a task that waits for work queued behind it
// deadlocks once every worker waits.
//
// Dropping the queue does not wait: tasks already queued still run, on
// threads that hold the queue's state until they leave.
class VendElasticQueue {
 public:
  explicit VendElasticQueue(std::string name,
                            std::chrono::milliseconds idleTimeout = std::chrono::seconds(10));
  ~VendElasticQueue();
  VendElasticQueue(const VendElasticQueue&) = delete;
  VendElasticQueue& operator=(const VendElasticQueue&) = delete;

  // An exception that leaves a task is logged; the thread goes on.
  void async(std::function<void()> task);

  [[nodiscard]] const std::string& name() const;
  // Tasks queued or running.
  [[nodiscard]] std::size_t taskCount() const;
  // Threads alive right now (for diagnostics and tests).
  [[nodiscard]] std::size_t threadCount() const;
  // Returns when no task is queued or running.
  void waitUntilIdle() const;

 private:
  struct State;
  std::shared_ptr<State> state_;
};

}  // namespace larder
