#include "platform/dispatch/internal/DispatchQueueCore.h"

#include <pthread.h>

#include <cstdio>
#include <cstdlib>
#include <exception>
#include <optional>
#include <system_error>
#include <thread>
#include <utility>

#include "platform/dispatch/internal/CurrentQueueFrame.h"
#include "platform/dispatch/internal/ReaderGate.h"
#include "platform/log/TillLogManager.h"

namespace larder {

namespace {

void writeErrorLine(const std::string& line) {
  TILL_LOG(0, "%@", line);
}

// The moment `timeout` from now, or nothing when that lies beyond what the clock can represent
// (an idle timeout of milliseconds::max() means "never").
std::optional<std::chrono::steady_clock::time_point> deadlineAfter(
    std::chrono::milliseconds timeout) {
  using Clock = std::chrono::steady_clock;
  const Clock::time_point now = Clock::now();
  const auto room =
      std::chrono::duration_cast<std::chrono::milliseconds>(Clock::time_point::max() - now);
  if (timeout >= room) {
    return std::nullopt;
  }
  return now + timeout;
}

}  // namespace

struct DispatchQueueCore::SyncTurn {
  ConditionVariable came;
  bool admitted = false;
};

// Gives the queue back when a synchronous block ends, whether it returned or threw.
class DispatchQueueCore::ReleaseOnExit {
 public:
  ReleaseOnExit(DispatchQueueCore& core, Admission admission)
      : core_(core), admission_(admission) {}
  ~ReleaseOnExit() { core_.finishSync(admission_); }
  ReleaseOnExit(const ReleaseOnExit&) = delete;
  ReleaseOnExit& operator=(const ReleaseOnExit&) = delete;

 private:
  DispatchQueueCore& core_;
  Admission admission_;
};

std::shared_ptr<DispatchQueueCore> DispatchQueueCore::create(Settings settings) {
  return std::make_shared<DispatchQueueCore>(CreationKey{}, std::move(settings));
}

DispatchQueueCore::DispatchQueueCore(CreationKey, Settings settings)
    : label_(std::move(settings.label)),
      maxWorkers_(settings.maxWorkers == 0 ? 1 : settings.maxWorkers),
      idleTimeout_(settings.idleTimeout),
      readerGate_(settings.withReaderGate ? std::make_unique<ReaderGate>() : nullptr) {}

DispatchQueueCore::~DispatchQueueCore() = default;

void DispatchQueueCore::submit(std::function<void()> work, Admission admission) {
  MutexLock lock(mutex_);
  enqueueLocked(WorkItem{std::move(work), nullptr, admission});
  admitLocked();
}

void DispatchQueueCore::runSync(const std::function<void()>& work, Admission admission) {
  waitForTurn(admission);
  const ReleaseOnExit release(*this, admission);
  const CurrentQueueFrame frame(this);
  work();
}

void DispatchQueueCore::waitForTurn(Admission admission) {
  SyncTurn turn;
  MutexLock lock(mutex_);
  enqueueLocked(WorkItem{{}, &turn, admission});
  admitLocked();
  turn.came.wait(lock, [&turn] { return turn.admitted; });
}

void DispatchQueueCore::finishSync(Admission admission) {
  MutexLock lock(mutex_);
  finishLocked(admission, /*wasAsync=*/false);
  admitLocked();
}

void DispatchQueueCore::readerLeftWhileBarrierPending() {
  MutexLock lock(mutex_);
  admitLocked();
}

void DispatchQueueCore::abandon() {
  MutexLock lock(mutex_);
  abandoned_ = true;
  workReady_.notify_all();
}

std::size_t DispatchQueueCore::workerCount() const {
  MutexLock lock(mutex_);
  return workers_;
}

void DispatchQueueCore::checkNotEnteredFromOwnTask() const {
#ifndef NDEBUG
  if (CurrentQueueFrame::isActive(this)) {
    writeErrorLine("larder: fatal: synchronous call into dispatch queue '" + label_ +
                   "' from a task already running on it would deadlock");
    std::abort();
  }
#endif
}

void DispatchQueueCore::enqueueLocked(WorkItem item) {
  if (item.admission == Admission::Exclusive && ++exclusiveOutstanding_ == 1 && readerGate_) {
    // Raised before admitLocked reads the slots: see ReaderGate.
    readerGate_->setBarrierPending(true);
  }
  if (item.admission == Admission::Shared && item.turn != nullptr) {
    ++sharedTurnsPending_;
  }
  pending_.push_back(std::move(item));
}

// Starts, in order, every pending item whose turn has come. A shared asynchronous item held back
// only by the worker limit does not hold back shared synchronous items behind it, since those
// run on their callers' threads; nothing passes an exclusive item.
void DispatchQueueCore::admitLocked() {
  std::size_t newlyReady = 0;
  for (auto item = pending_.begin(); item != pending_.end();) {
    if (item->admission == Admission::Exclusive) {
      if (item == pending_.begin() && exclusiveMayStartLocked()) {
        newlyReady += item->turn == nullptr ? 1 : 0;
        startLocked(std::move(*item));
        pending_.pop_front();
      }
      break;
    }
    if (exclusiveRunning_) {
      break;
    }
    if (item->turn == nullptr && asyncAdmitted_ >= maxWorkers_) {
      if (sharedTurnsPending_ == 0) {
        break;  // only asynchronous items wait here, and all of them for a worker
      }
      ++item;
      continue;
    }
    newlyReady += item->turn == nullptr ? 1 : 0;
    startLocked(std::move(*item));
    item = pending_.erase(item);
  }
  ensureWorkersLocked(newlyReady);
}

bool DispatchQueueCore::exclusiveMayStartLocked() const {
  return !exclusiveRunning_ && sharedRunning_ == 0 && (!readerGate_ || readerGate_->drained());
}

void DispatchQueueCore::startLocked(WorkItem item) {
  if (item.admission == Admission::Exclusive) {
    exclusiveRunning_ = true;
  } else {
    ++sharedRunning_;
  }
  if (item.turn != nullptr) {
    if (item.admission == Admission::Shared) {
      --sharedTurnsPending_;
    }
    // Notified under the lock: the waiter owns the turn and may leave as soon as it sees it.
    item.turn->admitted = true;
    item.turn->came.notify_one();
    return;
  }
  ++asyncAdmitted_;
  ready_.push_back(std::move(item));
}

void DispatchQueueCore::finishLocked(Admission admission, bool wasAsync) {
  if (admission == Admission::Exclusive) {
    exclusiveRunning_ = false;
    if (--exclusiveOutstanding_ == 0 && readerGate_) {
      readerGate_->setBarrierPending(false);
    }
  } else {
    --sharedRunning_;
  }
  if (wasAsync) {
    --asyncAdmitted_;
  }
}

void DispatchQueueCore::ensureWorkersLocked(std::size_t newlyReady) {
  while (workers_ - busyWorkers_ < ready_.size() && workers_ < maxWorkers_) {
    try {
      spawnWorkerLocked();
    } catch (const std::system_error& error) {
      // The items stay ready; the next admission, or a worker finishing, tries again.
      writeErrorLine("larder: dispatch queue '" + label_ +
                     "': could not start a worker thread: " + error.what());
      break;
    }
  }
  for (std::size_t i = 0; i < newlyReady; ++i) {
    workReady_.notify_one();
  }
}

void DispatchQueueCore::spawnWorkerLocked() {
  std::thread([self = shared_from_this()] { self->workerLoop(); }).detach();
  ++workers_;
}

void DispatchQueueCore::workerLoop() {
  nameWorkerThread();
  MutexLock lock(mutex_);
  while (waitForReadyWorkLocked(lock)) {
    WorkItem item = std::move(ready_.front());
    ready_.pop_front();
    ++busyWorkers_;
    lock.unlock();
    runAsyncItem(item.work);
    // The item's captures may hold the queue's last handle, whose release locks the mutex.
    item.work = nullptr;
    lock.lock();
    --busyWorkers_;
    finishLocked(item.admission, /*wasAsync=*/true);
    admitLocked();
  }
  --workers_;
}

bool DispatchQueueCore::waitForReadyWorkLocked(MutexLock& lock) {
  const auto idleDeadline = deadlineAfter(idleTimeout_);
  while (ready_.empty()) {
    if (abandoned_) {
      return false;
    }
    if (!idleDeadline) {
      workReady_.wait(lock);
    } else if (workReady_.wait_until(lock, *idleDeadline) == std::cv_status::timeout) {
      return !ready_.empty();
    }
  }
  return true;
}

void DispatchQueueCore::runAsyncItem(const std::function<void()>& work) noexcept {
  const CurrentQueueFrame frame(this);
  try {
    work();
  } catch (const std::exception& error) {
    writeErrorLine("larder: dispatch queue '" + label_ +
                   "': asynchronous work item threw: " + error.what());
  } catch (...) {
    writeErrorLine("larder: dispatch queue '" + label_ +
                   "': asynchronous work item threw a non-standard exception");
  }
}

void DispatchQueueCore::nameWorkerThread() const noexcept {
  // Linux limits thread names to 15 bytes.
  const std::string name = label_.substr(0, 15);
  pthread_setname_np(pthread_self(), name.c_str());
}

}  // namespace larder
