#include "platform/dispatch/internal/SerialDispatchQueue.h"

#include <stdexcept>
#include <utility>

#include "platform/dispatch/internal/CurrentQueueFrame.h"

namespace larder {

namespace {

void requireWork(const std::function<void()>& work) {
  if (!work) {
    throw std::invalid_argument("dispatch queue: empty work item");
  }
}

}  // namespace

SerialDispatchQueue::SerialDispatchQueue(std::string label, Limits limits)
    : core_(DispatchQueueCore::create({.label = std::move(label),
                                       .maxWorkers = 1,
                                       .idleTimeout = limits.idleTimeout,
                                       .withReaderGate = false})) {}

SerialDispatchQueue::~SerialDispatchQueue() {
  core_->abandon();
}

void SerialDispatchQueue::async(std::function<void()> work) {
  requireWork(work);
  core_->submit(std::move(work), DispatchQueueCore::Admission::Exclusive);
}

void SerialDispatchQueue::sync(const std::function<void()>& work) {
  requireWork(work);
  core_->checkNotEnteredFromOwnTask();
  core_->runSync(work, DispatchQueueCore::Admission::Exclusive);
}

void SerialDispatchQueue::barrierAsync(std::function<void()> work) {
  async(std::move(work));
}

void SerialDispatchQueue::barrierSync(const std::function<void()>& work) {
  sync(work);
}

const std::string& SerialDispatchQueue::label() const {
  return core_->label();
}

DispatchQueue::Kind SerialDispatchQueue::kind() const {
  return Kind::Serial;
}

bool SerialDispatchQueue::isCurrent() const {
  return CurrentQueueFrame::isActive(core_.get());
}

std::size_t SerialDispatchQueue::workerThreadCount() const {
  return core_->workerCount();
}

}  // namespace larder
