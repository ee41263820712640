#include "update-controller/AvailableUpdatesChange.h"

namespace larder {

AvailableUpdatesChange::AvailableUpdatesChange(std::vector<LedgerUpdateRef> updates,
                                               std::vector<SysupQuaymartUpdate> osUpdates,
                                               std::uint64_t badgeCount)
    : updates_(std::move(updates)),
      osUpdates_(std::move(osUpdates)),
      badgeCount_(badgeCount),
      wireBadgeCount_(badgeCount) {}

const PlistValue& AvailableUpdatesChange::wireUpdates() const {
  std::call_once(wireOnce_, [this] {
    PlistArray updates;
    updates.reserve(updates_.size());
    for (const LedgerUpdateRef& update : updates_) updates.emplace_back(update->toDictionary());
    PlistArray osUpdates;
    osUpdates.reserve(osUpdates_.size());
    for (const SysupQuaymartUpdate& update : osUpdates_)
      osUpdates.emplace_back(update.toDictionary());
    wireUpdates_ = std::move(updates);
    wireOSUpdates_ = std::move(osUpdates);
  });
  return wireUpdates_;
}

const PlistValue& AvailableUpdatesChange::wireOSUpdates() const {
  (void)wireUpdates();  // both are made together
  return wireOSUpdates_;
}

}  // namespace larder
