#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"
#include "store-runtime/services/VendOperation.h"

namespace larder {

// What one run of the update machinery is asked to do. Plain data, set by
// the makers of runs before the run starts.
struct UpdateOperationSettings {
  bool userInitiated = false;
  bool nowIsLater = false;
  bool restartCountdownWasDeferred = false;
  bool shouldUpdateNotificationsOnly = false;
  bool shouldCheckForAndStageAppUpdates = false;
  bool shouldStartAutoInstallOfUpdates = false;
  bool shouldPostAvailableUpdatesNotification = false;
  bool shouldInstallCriticalUpdatesOnly = false;
  bool criticalOSUpdatesHaveDelayedAutoInstall = false;
  bool criticalOSUpdatesShouldBeInstalledImmediately = false;
  bool criticalOSUpdatesRequireRestart = false;
  std::int64_t criticalOSUpdateCount = 0;
  std::optional<std::string> criticalOSUpdateNotificationTitle;
  std::optional<std::string> criticalOSUpdateNotificationText;
  // Absent: qualification decides.
  std::optional<std::vector<LedgerUpdateRef>> appUpdatesToInstall;
  std::optional<std::vector<SysupQuaymartUpdate>> osUpdatesToInstall;
  std::optional<std::vector<SysupQuaymartUpdate>> osUpdatesToInstallLater;
  std::int64_t doItLaterMode = 0;
  std::vector<PlistDictionary> postLogoutInstalledLaterUpdates;
  std::vector<PlistDictionary> postLogoutFailedUpdates;
  std::vector<PlistDictionary> postLogoutInstalledUpdates;
};

// One run of the update machinery for one store client, from the store
// check to the notification at its end. It is made and configured by the
// update controller and runs on the main operation queue.
class UpdateOperation : public VendOperation {
 public:
  explicit UpdateOperation(VendStoreClient storeClient);

  [[nodiscard]] UpdateOperationSettings settings() const;
  void setSettings(UpdateOperationSettings settings);
  // Changes the settings in place, under the operation's lock.
  template <typename Change>
  void changeSettings(Change&& change) {
    MutexLock lock(settingsMutex_);
    change(settings_);
  }

  // "<UpdateOperation: client=... flags=[...] criticalOSUpdateCount=...>":
  // the flags that are set, by name, and the lists by their keys, so that a
  // log line shows what a run was asked to do.
  [[nodiscard]] std::string description() const;

 protected:
  void run() override;

 private:
  mutable Mutex settingsMutex_;
  UpdateOperationSettings settings_ GUARDED_BY(settingsMutex_);
};

}  // namespace larder
