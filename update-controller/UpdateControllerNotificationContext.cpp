#include "update-controller/UpdateControllerNotificationContext.h"

#include "update-controller/UpdateController.h"

namespace larder {

bool UpdateControllerNotificationContext::isAutoUpdatedEnabled() const {
  return UpdatePolicy::isAutoUpdatedEnabled();
}

bool UpdateControllerNotificationContext::isAutoUpdatedOfRestartRequiredUpdatesEnabled() const {
  return UpdatePolicy::isAutoUpdatedOfRestartRequiredUpdatesEnabled();
}

bool UpdateControllerNotificationContext::shouldOfferDoItLaterForAppUpdates(
    const std::vector<LedgerUpdateRef>& appUpdates,
    const std::vector<SysupQuaymartUpdate>& osUpdates) const {
  return UpdatePolicy::shouldOfferDoItLaterForAppUpdates(appUpdates, osUpdates);
}

bool UpdateControllerNotificationContext::shouldOfferDoItLaterForAvailableUpdates() const {
  return controller_.shouldOfferDoItLaterForAvailableUpdates();
}

std::optional<std::string> UpdateControllerNotificationContext::cacheUpdateAuditInfo(
    const PlistDictionary& auditInfo) {
  return controller_.cacheUpdateAuditInfo(auditInfo);
}

void UpdateControllerNotificationContext::resetUpdatesAvailableNotificationTimestamp() {
  UpdatePolicy::resetUpdatesAvailableNotificationTimestamp();
}

}  // namespace larder
