#pragma once

#include <cstdint>
#include <vector>

#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"

namespace larder {

// Told when the app or OS updates on offer, or the badge, may have changed.
// Observers in clients are handles on a client's object: two handles on one
// object are the same observer.
class VendAvailableUpdatesObserver {
 public:
  virtual ~VendAvailableUpdatesObserver() = default;
  virtual void availableUpdatesDidChangedWithUpdates(
      const std::vector<LedgerUpdateRef>& updates,
      const std::vector<SysupQuaymartUpdate>& osUpdates, std::uint64_t badgeCount) = 0;
  [[nodiscard]] virtual bool isSameObserverAs(const VendAvailableUpdatesObserver& other) const {
    return this == &other;
  }
};

}  // namespace larder
