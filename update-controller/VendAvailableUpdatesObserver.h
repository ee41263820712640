#pragma once

#include <memory>

#include "update-controller/AvailableUpdatesChange.h"

namespace larder {

// Told when the app or OS updates on offer, or the badge, may have changed.
// Observers in clients are handles on a client's object: two handles on one
// object are the same observer.
class VendAvailableUpdatesObserver {
 public:
  virtual ~VendAvailableUpdatesObserver() = default;
  // The updates, the OS updates and the badge count of one change; shared,
  // so that an observer may keep it until it has passed it on.
  virtual void availableUpdatesDidChangedWithUpdates(
      const std::shared_ptr<const AvailableUpdatesChange>& change) = 0;
  [[nodiscard]] virtual bool isSameObserverAs(const VendAvailableUpdatesObserver& other) const {
    return this == &other;
  }
};

}  // namespace larder
