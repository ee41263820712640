#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/value/PlistValue.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"

namespace larder {

// One change of the updates on offer, as every available-updates observer is
// told it: the app updates, the OS updates and the badge count. Observers in
// clients need the lists in their wire form; it is made once per change, by
// the first observer that asks, however many observers there are.
class AvailableUpdatesChange {
 public:
  AvailableUpdatesChange(std::vector<LedgerUpdateRef> updates,
                         std::vector<SysupQuaymartUpdate> osUpdates, std::uint64_t badgeCount);

  [[nodiscard]] const std::vector<LedgerUpdateRef>& updates() const { return updates_; }
  [[nodiscard]] const std::vector<SysupQuaymartUpdate>& osUpdates() const { return osUpdates_; }
  [[nodiscard]] std::uint64_t badgeCount() const { return badgeCount_; }

  // Safe from several observers at once.
  [[nodiscard]] const PlistValue& wireUpdates() const;
  [[nodiscard]] const PlistValue& wireOSUpdates() const;
  [[nodiscard]] const PlistValue& wireBadgeCount() const { return wireBadgeCount_; }

 private:
  std::vector<LedgerUpdateRef> updates_;
  std::vector<SysupQuaymartUpdate> osUpdates_;
  std::uint64_t badgeCount_;
  PlistValue wireBadgeCount_;
  mutable std::once_flag wireOnce_;
  mutable PlistValue wireUpdates_;
  mutable PlistValue wireOSUpdates_;
};

}  // namespace larder
