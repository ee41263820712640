#pragma once

namespace larder {

// Told when the list of available updates may have changed. Called on the
// process's global queue, never inside the update queue, so it may call
// back into the queue.
class UpdateQueueDelegate {
 public:
  virtual ~UpdateQueueDelegate() = default;
  virtual void availableUpdatesDidChange() = 0;
};

}  // namespace larder
