#include "store-runtime/services/VendOperationQueue.h"

#include "store-runtime/services/VendOperation.h"

namespace larder {

VendOperationQueue::VendOperationQueue(std::string name, std::chrono::milliseconds idleTimeout)
    : threads_(std::move(name), idleTimeout) {}

VendOperationQueue::~VendOperationQueue() {
  threads_.waitUntilIdle();
}

VendOperationQueue& VendOperationQueue::mainQueue() {
  static VendOperationQueue queue("com.orvane.larderd.VendOperationQueue.main");
  return queue;
}

void VendOperationQueue::addOperation(std::shared_ptr<VendOperation> operation) {
  if (!operation) return;
  threads_.async([operation = std::move(operation)] { operation->start(); });
}

}  // namespace larder
