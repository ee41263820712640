#pragma once

#include <memory>
#include <string>
#include <utility>

#include "platform/dispatch/DispatchQueue.h"

namespace larder {

// Ends the process: `label`'s confined state was touched from outside the
// queue. Out of line so that the template below stays small.
[[noreturn]] void queueConfinementViolated(const std::string& label);

// State that lives on one dispatch queue instead of behind a mutex: it is
// read and changed only by tasks of that queue (on a concurrent queue,
// changed only in barriers). The type says so where a comment used to, and
// in debug builds every access checks that the caller runs on the queue.
template <typename T>
class QueueConfined {
 public:
  template <typename... Arguments>
  explicit QueueConfined(std::shared_ptr<DispatchQueue> queue, Arguments&&... arguments)
      : queue_(std::move(queue)), value_(std::forward<Arguments>(arguments)...) {}

  T& operator*() {
    checkOnQueue();
    return value_;
  }
  const T& operator*() const {
    checkOnQueue();
    return value_;
  }
  T* operator->() { return &**this; }
  const T* operator->() const { return &**this; }

 private:
  void checkOnQueue() const {
#ifndef NDEBUG
    if (!queue_->isCurrent()) queueConfinementViolated(queue_->label());
#endif
  }

  std::shared_ptr<DispatchQueue> queue_;
  T value_;
};

}  // namespace larder
