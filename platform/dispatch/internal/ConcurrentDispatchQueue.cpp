#include "platform/dispatch/internal/ConcurrentDispatchQueue.h"

#include <stdexcept>
#include <utility>

#include "platform/dispatch/internal/CurrentQueueFrame.h"
#include "platform/dispatch/internal/ReaderGate.h"

namespace larder {

namespace {

using Admission = DispatchQueueCore::Admission;

void requireWork(const std::function<void()>& work) {
  if (!work) {
    throw std::invalid_argument("dispatch queue: empty work item");
  }
}

// Lets a reader that came in through the gate out again, whether its block returned or threw.
class GateExit {
 public:
  GateExit(DispatchQueueCore& core, ReaderGate& gate, std::size_t slot) noexcept
      : core_(core), gate_(gate), slot_(slot) {}
  ~GateExit() {
    if (gate_.leave(slot_)) {
      core_.readerLeftWhileBarrierPending();
    }
  }
  GateExit(const GateExit&) = delete;
  GateExit& operator=(const GateExit&) = delete;

 private:
  DispatchQueueCore& core_;
  ReaderGate& gate_;
  std::size_t slot_;
};

}  // namespace

ConcurrentDispatchQueue::ConcurrentDispatchQueue(std::string label, Limits limits)
    : core_(DispatchQueueCore::create({.label = std::move(label),
                                       .maxWorkers = limits.concurrentWorkers,
                                       .idleTimeout = limits.idleTimeout,
                                       .withReaderGate = true})),
      readerGate_(core_->readerGate()) {}

ConcurrentDispatchQueue::~ConcurrentDispatchQueue() {
  core_->abandon();
}

void ConcurrentDispatchQueue::async(std::function<void()> work) {
  requireWork(work);
  core_->submit(std::move(work), Admission::Shared);
}

void ConcurrentDispatchQueue::sync(const std::function<void()>& work) {
  requireWork(work);
  core_->checkNotEnteredFromOwnTask();
  const std::size_t slot = ReaderGate::slotOfThisThread();
  if (!readerGate_.tryEnter(slot)) {
    core_->runSync(work, Admission::Shared);
    return;
  }
  const GateExit exit(*core_, readerGate_, slot);
  const CurrentQueueFrame frame(core_.get());
  work();
}

void ConcurrentDispatchQueue::barrierAsync(std::function<void()> work) {
  requireWork(work);
  core_->submit(std::move(work), Admission::Exclusive);
}

void ConcurrentDispatchQueue::barrierSync(const std::function<void()>& work) {
  requireWork(work);
  core_->checkNotEnteredFromOwnTask();
  core_->runSync(work, Admission::Exclusive);
}

const std::string& ConcurrentDispatchQueue::label() const {
  return core_->label();
}

DispatchQueue::Kind ConcurrentDispatchQueue::kind() const {
  return Kind::Concurrent;
}

bool ConcurrentDispatchQueue::isCurrent() const {
  return CurrentQueueFrame::isActive(core_.get());
}

std::size_t ConcurrentDispatchQueue::workerThreadCount() const {
  return core_->workerCount();
}

}  // namespace larder
