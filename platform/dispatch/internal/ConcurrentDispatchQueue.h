#pragma once

#include <memory>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/internal/DispatchQueueCore.h"

namespace larder {

class ReaderGate;

// Shared items overlap; barriers run alone. Synchronous readers enter through a ReaderGate and
// touch the queue's ordered state only while a barrier is pending.
class ConcurrentDispatchQueue final : public DispatchQueue {
 public:
  ConcurrentDispatchQueue(std::string label, Limits limits);
  ~ConcurrentDispatchQueue() override;

  void async(std::function<void()> work) override;
  void sync(const std::function<void()>& work) override;
  void barrierAsync(std::function<void()> work) override;
  void barrierSync(const std::function<void()>& work) override;

  [[nodiscard]] const std::string& label() const override;
  [[nodiscard]] Kind kind() const override;
  [[nodiscard]] bool isCurrent() const override;
  [[nodiscard]] std::size_t workerThreadCount() const override;

 private:
  std::shared_ptr<DispatchQueueCore> core_;
  ReaderGate& readerGate_;
};

}  // namespace larder
