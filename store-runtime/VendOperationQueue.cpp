#include "store-runtime/VendOperationQueue.h"

#include <algorithm>

#include "store-runtime/VendOperation.h"

namespace larder {

VendOperationQueue::VendOperationQueue(std::string name, std::chrono::milliseconds idleTimeout)
    : name_(std::move(name)), idleTimeout_(idleTimeout) {}

VendOperationQueue::~VendOperationQueue() {
  std::vector<std::thread> threads;
  {
    std::unique_lock lock(mutex_);
    allFinished_.wait(lock, [&] { return pending_.empty() && running_ == 0; });
    stopping_ = true;
    threads.swap(threads_);
  }
  workAvailable_.notify_all();
  for (std::thread& thread : threads) thread.join();
}

VendOperationQueue& VendOperationQueue::mainQueue() {
  static VendOperationQueue queue("com.orvane.larderd.VendOperationQueue.main");
  return queue;
}

void VendOperationQueue::addOperation(std::shared_ptr<VendOperation> operation) {
  if (!operation) return;
  std::lock_guard lock(mutex_);
  reapFinishedThreads();
  pending_.push_back(std::move(operation));
  // Spare idle threads may be few; every queued operation needs a thread
  // of its own, or one waiting for another could starve it.
  if (idleThreads_ >= pending_.size()) {
    workAvailable_.notify_one();
  } else {
    threads_.emplace_back([this] { work(); });
  }
}

bool VendOperationQueue::takeNext(std::unique_lock<std::mutex>& lock,
                                  std::shared_ptr<VendOperation>& next) {
  ++idleThreads_;
  const bool woken =
      workAvailable_.wait_for(lock, idleTimeout_, [&] { return stopping_ || !pending_.empty(); });
  --idleThreads_;
  if (!woken || pending_.empty()) return false;
  next = std::move(pending_.front());
  pending_.pop_front();
  ++running_;
  return true;
}

void VendOperationQueue::work() {
  std::unique_lock lock(mutex_);
  std::shared_ptr<VendOperation> operation;
  while (takeNext(lock, operation)) {
    lock.unlock();
    operation->start();
    operation.reset();
    lock.lock();
    --running_;
    if (pending_.empty() && running_ == 0) allFinished_.notify_all();
  }
  if (!stopping_) finishedThreads_.push_back(std::this_thread::get_id());
}

void VendOperationQueue::reapFinishedThreads() {
  for (std::thread::id id : finishedThreads_) {
    auto found = std::find_if(threads_.begin(), threads_.end(),
                              [&](const std::thread& thread) { return thread.get_id() == id; });
    if (found == threads_.end()) continue;
    // The thread has left its loop and only returns from `work` now.
    found->join();
    threads_.erase(found);
  }
  finishedThreads_.clear();
}

std::size_t VendOperationQueue::operationCount() const {
  std::lock_guard lock(mutex_);
  return pending_.size() + running_;
}

std::size_t VendOperationQueue::threadCount() const {
  std::lock_guard lock(mutex_);
  return threads_.size() - finishedThreads_.size();
}

void VendOperationQueue::waitUntilAllOperationsAreFinished() {
  std::unique_lock lock(mutex_);
  allFinished_.wait(lock, [&] { return pending_.empty() && running_ == 0; });
}

}  // namespace larder
