#pragma once

#include <chrono>
#include <cstddef>
#include <deque>
#include <functional>
#include <memory>
#include <string>

#include "platform/system/Mutex.h"

namespace larder {

class ReaderGate;

// The state behind one queue: it admits work in order and runs asynchronous items on worker
// threads it starts on demand and lets go after an idle period.
//
// Workers own the core through shared_ptr, so when the queue's last handle goes away the items
// still queued run to completion; the handle only marks the core abandoned, which lets idle
// workers leave at once instead of waiting out their idle timeout. Nothing ever waits for a
// worker to exit, so dropping the last handle from inside one of the queue's own tasks is safe.
class DispatchQueueCore : public std::enable_shared_from_this<DispatchQueueCore> {
 public:
  // Shared items may overlap each other. An exclusive item starts once everything queued before
  // it has finished, runs alone, and holds back everything queued after it.
  enum class Admission { Shared, Exclusive };

  struct Settings {
    std::string label;
    std::size_t maxWorkers = 1;
    std::chrono::milliseconds idleTimeout{5000};
    // Concurrent queues let synchronous readers bypass the ordered path through a ReaderGate.
    bool withReaderGate = false;
  };

 private:
  struct CreationKey {
    explicit CreationKey() = default;
  };

 public:
  static std::shared_ptr<DispatchQueueCore> create(Settings settings);
  DispatchQueueCore(CreationKey, Settings settings);
  ~DispatchQueueCore();

  DispatchQueueCore(const DispatchQueueCore&) = delete;
  DispatchQueueCore& operator=(const DispatchQueueCore&) = delete;

  void submit(std::function<void()> work, Admission admission);
  // Waits for the item's turn, runs `work` on the calling thread, then releases the queue, also
  // when `work` throws.
  void runSync(const std::function<void()>& work, Admission admission);

  // A reader that came in through the gate left while a barrier was pending: the barrier may
  // have been waiting for it.
  void readerLeftWhileBarrierPending();

  // No handle refers to the queue any more: no new work can arrive.
  void abandon();

  // Only for a core created withReaderGate.
  [[nodiscard]] ReaderGate& readerGate() const noexcept { return *readerGate_; }
  [[nodiscard]] const std::string& label() const noexcept { return label_; }
  [[nodiscard]] std::size_t workerCount() const;

  // Entering a queue synchronously from its own task can never make progress. Debug builds stop
  // the process with a message naming the queue; release builds skip the check.
  void checkNotEnteredFromOwnTask() const;

 private:
  struct SyncTurn;
  struct WorkItem {
    std::function<void()> work;  // asynchronous items
    SyncTurn* turn = nullptr;    // synchronous items: the caller waits on it
    Admission admission = Admission::Shared;
  };
  class ReleaseOnExit;

  void waitForTurn(Admission admission);
  void finishSync(Admission admission);

  void enqueueLocked(WorkItem item) REQUIRES(mutex_);
  void admitLocked() REQUIRES(mutex_);
  [[nodiscard]] bool exclusiveMayStartLocked() const REQUIRES(mutex_);
  void startLocked(WorkItem item) REQUIRES(mutex_);
  void finishLocked(Admission admission, bool wasAsync) REQUIRES(mutex_);

  void ensureWorkersLocked(std::size_t newlyReady) REQUIRES(mutex_);
  void spawnWorkerLocked() REQUIRES(mutex_);
  void workerLoop() EXCLUDES(mutex_);
  [[nodiscard]] bool waitForReadyWorkLocked(MutexLock& lock) REQUIRES(mutex_);
  void runAsyncItem(const std::function<void()>& work) noexcept;
  void nameWorkerThread() const noexcept;

  const std::string label_;
  const std::size_t maxWorkers_;
  const std::chrono::milliseconds idleTimeout_;
  const std::unique_ptr<ReaderGate> readerGate_;

  mutable Mutex mutex_;
  ConditionVariable workReady_;
  std::deque<WorkItem> pending_ GUARDED_BY(mutex_);  // not yet admitted, in submission order
  std::deque<WorkItem> ready_
      GUARDED_BY(mutex_);  // admitted asynchronous items waiting for a worker
  std::size_t sharedTurnsPending_ GUARDED_BY(mutex_) = 0;  // synchronous shared items in pending_
  std::size_t sharedRunning_ GUARDED_BY(mutex_) = 0;
  bool exclusiveRunning_ GUARDED_BY(mutex_) = false;
  std::size_t exclusiveOutstanding_ GUARDED_BY(mutex_) = 0;  // queued or running
  std::size_t asyncAdmitted_ GUARDED_BY(mutex_) = 0;         // in ready_ or running on a worker
  std::size_t workers_ GUARDED_BY(mutex_) = 0;
  std::size_t busyWorkers_ GUARDED_BY(mutex_) = 0;
  bool abandoned_ GUARDED_BY(mutex_) = false;
};

}  // namespace larder
