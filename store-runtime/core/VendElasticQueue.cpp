#include "store-runtime/core/VendElasticQueue.h"

#include <deque>
#include <exception>
#include <thread>

#include "platform/log/TillLogManager.h"
#include "platform/system/Mutex.h"

namespace larder {

struct VendElasticQueue::State {
  std::string name;
  std::chrono::milliseconds idleTimeout;
  mutable Mutex mutex;
  ConditionVariable workAvailable;
  mutable ConditionVariable allFinished;
  std::deque<std::function<void()>> pending GUARDED_BY(mutex);
  std::size_t running GUARDED_BY(mutex) = 0;
  std::size_t idleThreads GUARDED_BY(mutex) = 0;
  std::size_t threads GUARDED_BY(mutex) = 0;

  // Waits for a task; false when none came within the idle timeout.
  bool takeNext(MutexLock& lock, std::function<void()>& next) REQUIRES(mutex) {
    ++idleThreads;
    const bool woken = workAvailable.wait_for(lock, idleTimeout,
                                              [&]() REQUIRES(mutex) { return !pending.empty(); });
    --idleThreads;
    if (!woken) return false;
    next = std::move(pending.front());
    pending.pop_front();
    ++running;
    return true;
  }

  void work() {
    MutexLock lock(mutex);
    std::function<void()> task;
    while (takeNext(lock, task)) {
      mutex.unlock();
      try {
        task();
      } catch (const std::exception& exception) {
        TILL_LOG(1, "%@: A task of %@ failed: %@", "VendElasticQueue", name, exception.what());
      } catch (...) {
        TILL_LOG(1, "%@: A task of %@ failed", "VendElasticQueue", name);
      }
      task = nullptr;
      mutex.lock();
      --running;
      if (pending.empty() && running == 0) allFinished.notify_all();
    }
    --threads;
  }
};

VendElasticQueue::VendElasticQueue(std::string name, std::chrono::milliseconds idleTimeout)
    : state_(std::make_shared<State>()) {
  state_->name = std::move(name);
  state_->idleTimeout = idleTimeout;
}

VendElasticQueue::~VendElasticQueue() = default;

void VendElasticQueue::async(std::function<void()> task) {
  if (!task) return;
  MutexLock lock(state_->mutex);
  state_->pending.push_back(std::move(task));
  // Every queued task needs a thread of its own, or one waiting for
  // another could starve it.
  if (state_->idleThreads >= state_->pending.size()) {
    state_->workAvailable.notify_one();
    return;
  }
  ++state_->threads;
  std::thread([state = state_] { state->work(); }).detach();
}

const std::string& VendElasticQueue::name() const {
  return state_->name;
}

std::size_t VendElasticQueue::taskCount() const {
  MutexLock lock(state_->mutex);
  return state_->pending.size() + state_->running;
}

std::size_t VendElasticQueue::threadCount() const {
  MutexLock lock(state_->mutex);
  return state_->threads;
}

void VendElasticQueue::waitUntilIdle() const {
  MutexLock lock(state_->mutex);
  state_->allFinished.wait(lock, [&]() REQUIRES(state_->mutex) {
    return state_->pending.empty() && state_->running == 0;
  });
}

}  // namespace larder
