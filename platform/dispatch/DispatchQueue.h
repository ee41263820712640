#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <string>

namespace larder {

// A work queue in the manner the service is built around:
//  - Serial: one work item at a time, in order.
//  - Concurrent: non-barrier items run in parallel with each other; a
//    barrier item waits for everything queued before it and runs alone;
//    items queued after a barrier wait for it.
// `sync` and `barrierSync` run the block on the calling thread once its
// turn has come, and return when it is done. Entering a queue synchronously
// from a task already running on it deadlocks, as it would anywhere else:
// callers must not do it (debug builds abort with a message instead).
// An exception thrown by a `sync` block reaches its caller once the queue is
// released; one thrown by an asynchronous item is logged and the
// queue goes on with its next item.
//
// Synchronous readers of a concurrent queue take a fast path that touches
// no shared cache line while no barrier is pending, so that lookups scale
// with the number of reader threads.
class DispatchQueue {
 public:
  enum class Kind { Serial, Concurrent };

  // Worker threads start when asynchronous work arrives and exit after `idleTimeout` without
  // any, so that hundreds of mostly idle queues cost no threads. A concurrent queue runs up to
  // `concurrentWorkers` asynchronous items at once; a serial queue always uses one worker.
  struct Limits {
    std::size_t concurrentWorkers = 4;
    std::chrono::milliseconds idleTimeout{5000};
  };

  // Dropping the last reference while items are still queued is fine: they still run.
  static std::shared_ptr<DispatchQueue> create(std::string label, Kind kind);
  static std::shared_ptr<DispatchQueue> create(std::string label, Kind kind, Limits limits);
  // The process's shared concurrent queue of default priority, for work
  // that must run outside whatever queue or lock its submitter holds:
  // completion handlers and delegate calls. Made on first use, never torn
  // down.
  static DispatchQueue& globalQueue();
  virtual ~DispatchQueue() = default;

  DispatchQueue(const DispatchQueue&) = delete;
  DispatchQueue& operator=(const DispatchQueue&) = delete;

  virtual void async(std::function<void()> work) = 0;
  virtual void sync(const std::function<void()>& work) = 0;
  virtual void barrierAsync(std::function<void()> work) = 0;
  virtual void barrierSync(const std::function<void()>& work) = 0;

  [[nodiscard]] virtual const std::string& label() const = 0;
  [[nodiscard]] virtual Kind kind() const = 0;

  // True when the calling thread is running a task of this queue.
  [[nodiscard]] virtual bool isCurrent() const = 0;

  // Worker threads alive right now for this queue (for diagnostics and tests).
  [[nodiscard]] virtual std::size_t workerThreadCount() const { return 0; }

 protected:
  DispatchQueue() = default;
};

}  // namespace larder
