#pragma once

namespace larder {

class DispatchQueueCore;

// Marks the calling thread as running a task of one queue for as long as the frame lives.
// Frames nest when a task of one queue enters another synchronously, so each thread keeps a
// stack of them, linked through the frames themselves on the thread's own call stack: pushing
// and popping cost two thread-local stores and never allocate.
class CurrentQueueFrame {
 public:
  explicit CurrentQueueFrame(const DispatchQueueCore* queue) noexcept
      : queue_(queue), outer_(innermost_) {
    innermost_ = this;
  }
  ~CurrentQueueFrame() { innermost_ = outer_; }

  CurrentQueueFrame(const CurrentQueueFrame&) = delete;
  CurrentQueueFrame& operator=(const CurrentQueueFrame&) = delete;

  // True when the calling thread is inside a task of `queue`, at any depth of nesting.
  [[nodiscard]] static bool isActive(const DispatchQueueCore* queue) noexcept;

 private:
  const DispatchQueueCore* queue_;
  const CurrentQueueFrame* outer_;
  static inline thread_local const CurrentQueueFrame* innermost_ = nullptr;
};

}  // namespace larder
