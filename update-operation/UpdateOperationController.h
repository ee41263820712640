#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/system/Mutex.h"
#include "store-runtime/records/LedgerSoftwareUpdateStatus.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"
#include "update-operation/UpdatePolicy.h"

namespace larder {

class SoftwareMap;
class UpdateNotificationCatalogue;
class UpdateQueue;
class VendServiceProxy;

// Product key to the cancel token of the OS update install that serves it.
// The controller shares one with the runs the user started, so that a
// cancel finds the token of a running install; entries stay after the
// install has ended and a later install of the same key replaces them.
struct OSUpdateCancelTokens {
  Mutex mutex;
  std::map<std::string, SysupQuaymartUpdateController::CancelToken, std::less<>> tokens
      GUARDED_BY(mutex);
};

// The update controller as its runs see it. The controller sits above the
// runs it makes, so a run reaches it only through this interface; the
// answers that come from the preferences alone are the policy's.
class UpdateOperationController : public UpdatePolicy {
 public:
  using OSUpdateList = std::vector<SysupQuaymartUpdate>;

  virtual ~UpdateOperationController() = default;

  [[nodiscard]] virtual const std::shared_ptr<UpdateQueue>& updateQueue() const = 0;
  [[nodiscard]] virtual SoftwareMap& softwareMap() const = 0;

  virtual void disableDockBadgeUpdates() = 0;
  virtual void clearAvailableUpdatesBadgeCount() = 0;
  virtual void enableDockBadgeUpdates() = 0;
  [[nodiscard]] virtual std::uint64_t availableUpdatesBadgeCount() const = 0;

  // An installed app is being replaced, an OS update is installing, the
  // restart countdown is up, or a post-logout install was asked for lately.
  [[nodiscard]] virtual bool updatesAreInProgress() const = 0;
  // A restart or logout that installs updates was asked for just now; for
  // an hour after that, updates count as in progress.
  virtual void didRequestPostLogoutInstallOfUpdates() = 0;
  // Bundle identifiers of the app updates the user put off to later.
  [[nodiscard]] virtual std::vector<std::string> appUpdatesToInstallLater() const = 0;
  [[nodiscard]] virtual bool appUpdatesToInstallLaterIncludesBundleID(
      std::string_view bundleIdentifier) const = 0;
  // Empties both later lists and disarms the deferred-install agent.
  virtual void cancelUpdatesToBeInstalledLater() = 0;
  // The user's choice at the end of a restart countdown: 1 tonight, 2 in an
  // hour, 3 remind tomorrow.
  virtual void installAvailableUpdatesLaterWithMode(std::int64_t mode) = 0;
  [[nodiscard]] virtual bool updateFailureNotificationIsDisplayed() const = 0;
  // What the controller posts to the user, and takes away.
  [[nodiscard]] virtual UpdateNotificationCatalogue& notificationCatalogue() const = 0;
  // Blocks on the dialog; true when the user agreed.
  virtual bool confirmRestartWithUpdatesWillDownload(bool willDownload) = 0;
  virtual void promptUserToOptInForAutoUpdateWithShowNotification(bool showNotification) = 0;
  virtual void promptUserToOptInForAutoUpdateOfRestartRequiredUpdatesWithShowNotification(
      bool showNotification) = 0;
  [[nodiscard]] virtual OSUpdateList
  availableOSUpdatesEligibleForAutoInstallOfRestartRequiredUpdates() const = 0;

  virtual void osUpdatesChangedProgress(const OSUpdateList& osUpdates,
                                        const LedgerSoftwareUpdateStatus& progress) const = 0;
  virtual void didStartOSUpdates(const OSUpdateList& osUpdates) = 0;
  virtual void cancelOSUpdates(const OSUpdateList& osUpdates) = 0;
  virtual void didFinishOSUpdates(const OSUpdateList& osUpdates) = 0;
  virtual void appendInstalledUpdatesToJournal(const std::vector<LedgerUpdateRef>& appUpdates,
                                               const OSUpdateList& osUpdates) = 0;
  [[nodiscard]] virtual const std::shared_ptr<OSUpdateCancelTokens>& osUpdateCancelTokens()
      const = 0;
};

}  // namespace larder
