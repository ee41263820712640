#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/error/VendError.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "running-apps/AppHelper.h"
#include "store-runtime/records/LedgerSoftwareUpdateStatus.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/records/TillPurchase.h"
#include "store-runtime/services/VendOperation.h"
#include "update-operation/UpdateOperationController.h"
#include "update-operation/VendUpdateDelegate.h"

namespace larder {

class DispatchQueue;
class LedgerFileProgress;
class UpdateQueue;
class UpdateRunRecord;
struct VendPurchaseRecord;

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
  std::weak_ptr<VendUpdateDelegate> updateDelegate;
  // How the run's take-downs of applications pause and wait.
  AppHelper::Timing appHelperTiming;
  // A run of its own unless the maker shares the controller's.
  std::shared_ptr<OSUpdateCancelTokens> osUpdateCancelTokens =
      std::make_shared<OSUpdateCancelTokens>();
};

// What a run finds out and decides on its way; read by the steps that come
// after, and by tests.
struct UpdateOperationRunState {
  std::uint32_t powerAssertion = 0;
  bool startedInDimWake = false;
  bool shouldRestartToInstallUpdates = false;
  bool userDidDeclineRestart = false;
  bool didSnapshotTAL = false;
  std::vector<std::shared_ptr<RunningApplication>> restartIsBlockedByRunningApplications;
  std::vector<SysupQuaymartUpdate> osUpdatesToInstallOnRestart;
  std::vector<std::shared_ptr<AppHelper>> relaunchAppHelpers;
  std::vector<LedgerUpdateRef> autoInstalledAppUpdates;
};

// Why an update was held back: the code, its reason in words, and who was in
// the way. Code 0 means nothing objected.
struct UpdateAbort {
  std::int64_t code = 0;
  std::optional<std::string> reason;
  std::optional<std::string> appName;
  std::optional<std::string> bundleID;
  std::optional<std::vector<std::string>> appNames;
};

// One run of the update machinery for one store client: it checks the
// store, qualifies app and OS updates, buys the app updates, stages and
// installs them, installs the OS updates, and ends with the notification
// that the situation calls for. It is made by the update controller and runs
// on the main operation queue, whose thread it blocks for the whole of its
// downloads and installs.
//
// One lock, shared by the runs of all store clients, serialises their
// qualification, their timestamps and their finish; it is never held during
// purchase, download and install, so that a second client's run qualifies
// while the first one downloads.
class UpdateOperation : public VendOperation {
 public:
  // Abort codes of app and OS updates.
  enum AbortCode : std::int64_t {
    kAbortNone = 0,
    kAbortAutoUpdateDisabled = 1,
    kAbortAppRunning = 3,
    kAbortNoBundleID = 4,
    kAbortPreflight = 5,
    kAbortPurchaseFailed = 6,
    kAbortPreflightBeforeStaging = 7,
    kAbortImmortal = 100,
    kAbortForemost = 101,
    kAbortDidNotTerminate = 103,
    kAbortOtherUsers = 104,
    kAbortPlugInsInUse = 105,
    kAbortDownloadBeforeLater = 106,
    kAbortNotRecommended = 200,
    kAbortFirmwareWarning = 201,
    kAbortLicenseAgreement = 202,
    kAbortTooRecent = 501,
    kAbortTooSoon = 502,
  };

  UpdateOperation(VendStoreClient storeClient,
                  std::weak_ptr<UpdateOperationController> updateController);

  [[nodiscard]] UpdateOperationSettings settings() const;
  void setSettings(UpdateOperationSettings settings);
  // Changes the settings in place, under the operation's lock.
  template <typename Change>
  void changeSettings(Change&& change) {
    MutexLock lock(settingsMutex_);
    change(settings_);
  }
  [[nodiscard]] UpdateOperationRunState runState() const;
  // The audit of the run so far: "runDate", "appUpdates", "osUpdates".
  [[nodiscard]] PlistDictionary auditInfo() const;

  // "<UpdateOperation: client=... flags=[...] criticalOSUpdateCount=...>":
  // the flags that are set, by name, and the lists by their keys, so that a
  // log line shows what a run was asked to do.
  [[nodiscard]] std::string description() const;

  // The lock of all runs of the process.
  static Mutex& synchronizationLock();

  // "<caches of the service>/UpdateOperationAudit.plist": the audit of the
  // last background run.
  static std::string auditFilePath();

  // What the decisions read from the preferences and the machine, taken
  // once for a pass over many updates; within such a pass the answers
  // could only change by a moment's difference.
  struct DecisionInputs {
    std::optional<std::int64_t> alwaysAbortCode;
    bool autoUpdateEnabled = false;
    double minimumReleaseInterval = 0;
    bool updateImmortalApps = false;
    bool updateForegroundApps = false;
    AppHelper::Survey survey;
    // The queue's updates by bundle identifier, the last of each in list
    // order, when the pass has the list in hand; otherwise the queue is
    // asked.
    std::optional<std::map<std::string, LedgerUpdateRef, std::less<>>> updatesByBundleID;
    static DecisionInputs read();
  };

  // --- Qualification; under the lock of all runs ---
  std::vector<LedgerUpdateRef> appUpdatesToStageOrInstallNow();
  // True with code 0 when the app update may be installed now; the
  // download, when given, is preflighted as well.
  bool shouldAutoInstallAppUpdate(const std::optional<std::string>& bundleIdentifier,
                                  const TillDownloadRef& download, UpdateAbort* abort);
  bool shouldAutoInstallAppUpdate(const std::optional<std::string>& bundleIdentifier,
                                  const TillDownloadRef& download, UpdateAbort* abort,
                                  const DecisionInputs& inputs);
  std::vector<SysupQuaymartUpdate> osUpdatesToInstallNow();
  bool shouldInstallOSUpdate(const SysupQuaymartUpdate& update, UpdateAbort* abort);
  bool shouldInstallOSUpdate(const SysupQuaymartUpdate& update, UpdateAbort* abort,
                             const DecisionInputs& inputs);

 protected:
  void run() override;

 private:
  using DownloadReply = std::function<void(std::int64_t result, const OptionalError& error)>;

  std::shared_ptr<UpdateOperationController> updateController() const;
  void runSequence();
  void runUpdates(UpdateOperationController& controller, UpdateRunRecord& record);
  void finishRun(UpdateOperationController& controller);
  void answerListedUpdatesWithError(const VendError& error);
  void createPowerAssertion();
  void releasePowerAssertion();
  [[nodiscard]] bool shouldCheckUpdateQueue() const;
  void checkUpdateQueue(UpdateQueue& queue);
  void resetTimestamps();
  void considerRestartRequiredAutoInstall(UpdateOperationController& controller);
  // --- Restart and Do It Later ---
  bool prepareSystemForDoItLater();
  bool downloadLaterUpdatesNow(const std::vector<SysupQuaymartUpdate>& later);
  void takeFinalSnapshot();
  bool quitAllApplicationsForRestart(const std::vector<SysupQuaymartUpdate>& later);
  void auditUpdatesBlockedByApplications(
      const std::vector<SysupQuaymartUpdate>& later,
      const std::vector<std::shared_ptr<RunningApplication>>& blockers);
  // Shows the countdown and acts on the user's choice; true to restart.
  bool shouldRestartAfterShowingRestartCountdown();
  void restartToInstallUpdates();
  void showUpdatesChangedDialog();
  void showDoItLaterFailureAlert();
  void relaunchTerminatedApplications();
  void writeAuditInfoToDisk() const;

  // --- The closing notification ---
  void validateAndPostAvailableUpdatesNotification();
  bool postAvailableUpdatesNotification(UpdateOperationController& controller);
  bool updatesAreInProgressOrQueuedForLater();
  void reportOSUpdatesChangedProgress(const std::vector<SysupQuaymartUpdate>& updates,
                                      const LedgerSoftwareUpdateStatus& status);

  // --- Qualification helpers ---
  // "A, B": the display names of the applications that use busy plug-ins.
  static std::string joinedHostNames(const PlugInHostApps& hosts);
  [[nodiscard]] bool shouldDownloadAppUpdateAssets() const;
  bool runningAppBlocksInstall(const std::string& bundleIdentifier, UpdateAbort* abort,
                               const AppHelper::Survey& survey);
  bool preflightAllows(const TillDownloadRef& download, UpdateAbort* abort);
  // The download layer's answer on the download's preflight package: whether
  // the item may be installed, and what objected.
  std::pair<bool, PlistValue> checkPreflight(const TillDownloadMetadata& metadata,
                                             const PlistValue& systemVersion);
  bool appToCloseBlocksInstall(const std::string& bundleIdentifier, UpdateAbort* abort,
                               const DecisionInputs& inputs);
  [[nodiscard]] bool isInstallLaterUpdate(const SysupQuaymartUpdate& update) const;

  // --- What only the user can answer ---
  void performUserInteractionRequiredForAppUpdates(std::vector<LedgerUpdateRef>& appUpdates,
                                                   std::vector<SysupQuaymartUpdate>& osUpdates);
  std::shared_ptr<AppHelper> appHelperFor(std::vector<std::string> bundleIdentifiers) const;
  void skipUpdatesOfSkippedApps(const AppHelper& helper, std::vector<LedgerUpdateRef>& appUpdates,
                                std::vector<SysupQuaymartUpdate>& osUpdates);
  void confirmOSUpdateTexts(std::vector<SysupQuaymartUpdate>& osUpdates);

  // --- Purchase ---
  std::vector<TillDownloadRef> purchaseAppUpdates(std::vector<LedgerUpdateRef>& appUpdates);
  void loadOrvaneIDForPurchase(TillPurchase& purchase, const VendPurchaseRecord& record);
  void tellDelegate(const LedgerUpdateRef& update, bool success, const OptionalError& error,
                    const std::optional<TillPurchaseResponse>& response);

  // --- App downloads and installs ---
  void downloadAndInstallUpdates(const std::vector<TillDownloadRef>& downloads,
                                 const std::vector<SysupQuaymartUpdate>& osUpdates);
  void lockApplicationsOfOSUpdates(const std::vector<SysupQuaymartUpdate>& osUpdates, bool lock);
  void downloadAndInstallAppUpdateDownloads(const std::vector<TillDownloadRef>& downloads);
  bool preflightBeforeStagingAllows(const TillDownloadRef& download,
                                    const PlistValue& systemVersion);
  void installStagedDownload(const TillDownloadRef& download);
  bool quitAppInTheWay(const std::string& bundleIdentifier, const TillDownloadRef& download,
                       UpdateAbort* abort, const AppHelper::Survey& survey);
  void performDownload(const TillDownloadRef& download, DownloadReply reply);

  // --- OS updates ---
  void downloadAndInstallOSUpdates(std::vector<SysupQuaymartUpdate> updates,
                                   std::function<void(const OptionalError&)> completion);
  std::vector<std::string> quitAppsToCloseForOSUpdates(std::vector<SysupQuaymartUpdate>& updates);
  void finishOSUpdateInstall(const std::vector<SysupQuaymartUpdate>& updates,
                             const OptionalError& error,
                             const std::vector<std::string>& relaunchIdentifiers);
  void downloadUpdatesForPostLogoutInstall(std::vector<SysupQuaymartUpdate> updates,
                                           std::function<void(const OptionalError&)> completion);
  void dropFromRestart(const std::vector<SysupQuaymartUpdate>& updates);
  // --- Progress of OS updates that bring an application ---
  void publishStatus(const LedgerSoftwareUpdateStatus& status,
                     const std::vector<SysupQuaymartUpdate>& updates);
  void endProgressItem(const std::string& identifier, const SysupQuaymartUpdate& update,
                       const LedgerSoftwareUpdateStatus& status);
  std::shared_ptr<LedgerFileProgress> progressItemFor(
      const std::string& identifier, const SysupQuaymartUpdate& update,
      const std::vector<SysupQuaymartUpdate>& updates);
  void launchInstalledApplication(const std::string& identifier) const;

  void rememberCancelToken(const std::optional<std::string>& token,
                           const std::vector<SysupQuaymartUpdate>& updates,
                           std::string_view startName);

  // --- Audit and traces ---
  void auditAppUpdate(std::uint64_t itemIdentifier, bool shouldInstall, const UpdateAbort& abort);
  void auditOSUpdate(const SysupQuaymartUpdate& update, bool shouldInstall,
                     const UpdateAbort& abort);
  void logAppAutoUpdateAbort(const UpdateAbort& abort, const std::string& bundleIdentifier,
                             std::uint64_t itemIdentifier) const;
  void messageTraceAppAutoUpdate(bool success, std::int64_t abortCode, const OptionalError& error,
                                 const std::string& bundleIdentifier,
                                 std::uint64_t itemIdentifier) const;
  void messageTraceOSUpdate(const SysupQuaymartUpdate& update, std::string_view result,
                            const UpdateAbort* abort, const OptionalError& error) const;

  template <typename Change>
  void changeRunState(Change&& change) {
    MutexLock lock(settingsMutex_);
    change(runState_);
  }

  std::weak_ptr<UpdateOperationController> updateController_;
  mutable Mutex settingsMutex_;
  UpdateOperationSettings settings_ GUARDED_BY(settingsMutex_);
  UpdateOperationRunState runState_ GUARDED_BY(settingsMutex_);
  PlistDictionary auditInfo_ GUARDED_BY(settingsMutex_);
  // By the bundle identifier the OS update brings.
  std::map<std::string, std::shared_ptr<LedgerFileProgress>> progressItems_
      GUARDED_BY(settingsMutex_);
};

}  // namespace larder
