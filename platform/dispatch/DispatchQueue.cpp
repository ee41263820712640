#include "platform/dispatch/DispatchQueue.h"

#include <utility>

#include "platform/dispatch/internal/ConcurrentDispatchQueue.h"
#include "platform/dispatch/internal/SerialDispatchQueue.h"

namespace larder {

std::shared_ptr<DispatchQueue> DispatchQueue::create(std::string label, Kind kind) {
  return create(std::move(label), kind, Limits{});
}

std::shared_ptr<DispatchQueue> DispatchQueue::create(std::string label, Kind kind, Limits limits) {
  if (kind == Kind::Serial) {
    return std::make_shared<SerialDispatchQueue>(std::move(label), limits);
  }
  return std::make_shared<ConcurrentDispatchQueue>(std::move(label), limits);
}

DispatchQueue& DispatchQueue::globalQueue() {
  // Handlers that run here may block on a store request or another
  // queue's barrier, so the queue allows many at once; idle workers leave.
  static const std::shared_ptr<DispatchQueue> queue = create(
      "com.orvane.larderd.global-default", Kind::Concurrent, Limits{.concurrentWorkers = 64});
  return *queue;
}

}  // namespace larder
