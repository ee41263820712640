#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <string>

#include "store-runtime/core/VendElasticQueue.h"

namespace larder {

class VendOperation;

// Runs operations on threads of its own, never on the caller's. An
// operation may block for as long as its work takes, and may wait for
// another operation that it added to the same queue: a queued operation
// never waits for a running one to finish, because a new thread starts
// whenever none is idle (`VendElasticQueue`). Idle threads leave after a
// while.
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
  [[nodiscard]] std::size_t operationCount() const { return threads_.taskCount(); }
  // Threads alive right now (for diagnostics and tests).
  [[nodiscard]] std::size_t threadCount() const { return threads_.threadCount(); }
  // Returns when no operation is queued or running.
  void waitUntilAllOperationsAreFinished() { threads_.waitUntilIdle(); }

 private:
  VendElasticQueue threads_;
};

}  // namespace larder
