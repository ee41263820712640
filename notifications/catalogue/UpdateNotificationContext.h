#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/value/PlistValue.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"

namespace larder {

// What the catalogue asks of the update controller it posts for: the
// switches of automatic updates, whether Do It Later can be offered, and
// the cache of audits that a notification carries a key to.
class UpdateNotificationContext {
 public:
  virtual ~UpdateNotificationContext() = default;

  [[nodiscard]] virtual bool isAutoUpdatedEnabled() const = 0;
  [[nodiscard]] virtual bool isAutoUpdatedOfRestartRequiredUpdatesEnabled() const = 0;
  [[nodiscard]] virtual bool shouldOfferDoItLaterForAppUpdates(
      const std::vector<LedgerUpdateRef>& appUpdates,
      const std::vector<SysupQuaymartUpdate>& osUpdates) const = 0;
  // Do It Later for the updates available now.
  [[nodiscard]] virtual bool shouldOfferDoItLaterForAvailableUpdates() const = 0;
  // The key of the stored audit, or nothing when it could not be stored.
  virtual std::optional<std::string> cacheUpdateAuditInfo(const PlistDictionary& auditInfo) = 0;
  // The updates available notification just went out.
  virtual void resetUpdatesAvailableNotificationTimestamp() = 0;
};

}  // namespace larder
