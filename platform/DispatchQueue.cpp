#include "platform/DispatchQueue.h"

#include <utility>

#include "platform/ConcurrentDispatchQueue.h"
#include "platform/SerialDispatchQueue.h"

namespace larder {

std::shared_ptr<DispatchQueue> DispatchQueue::create(std::string label, Kind kind) {
  return create(std::move(label), kind, Limits{});
}

std::shared_ptr<DispatchQueue> DispatchQueue::create(std::string label, Kind kind,
                                                     Limits limits) {
  if (kind == Kind::Serial) {
    return std::make_shared<SerialDispatchQueue>(std::move(label), limits);
  }
  return std::make_shared<ConcurrentDispatchQueue>(std::move(label), limits);
}

}  // namespace larder
