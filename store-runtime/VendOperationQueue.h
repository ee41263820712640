#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace larder {

class VendOperation;

// Runs operations on threads of its own, never on the caller's. An
// operation may block for as long as its work takes, and may wait for
// another operation that it added to the same queue: a queued operation
// never waits for a running one to finish, because a new thread starts
// whenever none is idle. Idle threads leave after a while.
class VendOperationQueue {
 public:
  explicit VendOperationQueue(std::string name,
                              std::chrono::milliseconds idleTimeout = std::chrono::seconds(10));
  ~VendOperationQueue();  // waits for the operations it runs
  VendOperationQueue(const VendOperationQueue&) = delete;
  VendOperationQueue& operator=(const VendOperationQueue&) = delete;

  // The one shared queue of the process.
  static VendOperationQueue& mainQueue();

  void addOperation(std::shared_ptr<VendOperation> operation);

  // Operations queued or running.
  [[nodiscard]] std::size_t operationCount() const;
  // Threads alive right now (for diagnostics and tests).
  [[nodiscard]] std::size_t threadCount() const;
  // Returns when no operation is queued or running.
  void waitUntilAllOperationsAreFinished();

 private:
  void work();
  bool takeNext(std::unique_lock<std::mutex>& lock, std::shared_ptr<VendOperation>& next);
  void reapFinishedThreads();

  std::string name_;
  std::chrono::milliseconds idleTimeout_;
  mutable std::mutex mutex_;
  std::condition_variable workAvailable_;
  std::condition_variable allFinished_;
  std::deque<std::shared_ptr<VendOperation>> pending_;
  std::size_t running_ = 0;
  std::size_t idleThreads_ = 0;
  std::vector<std::thread> threads_;
  std::vector<std::thread::id> finishedThreads_;
  bool stopping_ = false;
};

}  // namespace larder
