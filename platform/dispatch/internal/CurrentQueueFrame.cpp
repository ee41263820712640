#include "platform/dispatch/internal/CurrentQueueFrame.h"

namespace larder {

bool CurrentQueueFrame::isActive(const DispatchQueueCore* queue) noexcept {
  for (const CurrentQueueFrame* frame = innermost_; frame != nullptr; frame = frame->outer_) {
    if (frame->queue_ == queue) {
      return true;
    }
  }
  return false;
}

}  // namespace larder
