#pragma once

#include "notifications/catalogue/UpdateNotificationContext.h"

namespace larder {

class UpdateController;

// The update controller as its notification catalogue asks it: the
// switches of automatic updates, the Do It Later offer and the audit
// cache. A member of the controller, so it lives exactly as long.
class UpdateControllerNotificationContext final : public UpdateNotificationContext {
 public:
  explicit UpdateControllerNotificationContext(UpdateController& controller)
      : controller_(controller) {}

  [[nodiscard]] bool isAutoUpdatedEnabled() const override;
  [[nodiscard]] bool isAutoUpdatedOfRestartRequiredUpdatesEnabled() const override;
  [[nodiscard]] bool shouldOfferDoItLaterForAppUpdates(
      const std::vector<LedgerUpdateRef>& appUpdates,
      const std::vector<SysupQuaymartUpdate>& osUpdates) const override;
  [[nodiscard]] bool shouldOfferDoItLaterForAvailableUpdates() const override;
  std::optional<std::string> cacheUpdateAuditInfo(const PlistDictionary& auditInfo) override;
  void resetUpdatesAvailableNotificationTimestamp() override;

 private:
  UpdateController& controller_;
};

}  // namespace larder
