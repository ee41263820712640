#pragma once

#include <memory>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/internal/DispatchQueueCore.h"

namespace larder {

// Every item is exclusive: one at a time, in submission order, on one worker thread.
class SerialDispatchQueue final : public DispatchQueue {
 public:
  SerialDispatchQueue(std::string label, Limits limits);
  ~SerialDispatchQueue() override;

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
};

}  // namespace larder
