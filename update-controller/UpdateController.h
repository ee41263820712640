#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/error/Result.h"
#include "platform/error/VendError.h"
#include "platform/system/Bundle.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/host/LedgerMajorOSInstallService.h"
#include "store-runtime/host/LedgerPowerSource.h"
#include "store-runtime/records/LedgerSoftwareUpdateStatus.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"
#include "store-runtime/records/TillPurchase.h"
#include "store-runtime/records/TillPurchaseResponse.h"
#include "store-runtime/services/VendServiceProxy.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"
#include "update-controller/ObserverArray.h"
#include "update-controller/UpdateControllerNotificationContext.h"
#include "update-controller/VendAvailableUpdatesObserver.h"
#include "update-controller/VendOSUpdateProgressObserver.h"
#include "update-controller/VendOSUpdateScanObserver.h"
#include "update-operation/UpdateOperationController.h"
#include "update-operation/VendUpdateDelegate.h"
#include "update-queue/UpdateQueue.h"
#include "update-queue/UpdateQueueDelegate.h"

namespace larder {

class SoftwareMap;
class UpdateNotificationCatalogue;
class UpdateOperation;
struct UpdateOperationSettings;
class UserNotificationCenter;
struct UserNotification;

// The policy centre for the updates of one store client: when the update
// machinery runs and with which tasks, what the badge counts, who hears of
// changes, OS update scans and hiding, and the time tests and switches of
// automatic updates. One per store client identifier, made on first use and
// kept until the process ends.
//
// The time tests and switches keep nothing in memory: each answer is read
// from the preferences at the moment of the question.
class UpdateController final : public UpdateQueueDelegate,
                               public UpdateOperationController,
                               public std::enable_shared_from_this<UpdateController> {
 public:
  using OSUpdateList = std::vector<SysupQuaymartUpdate>;
  using OSUpdatePredicate = SysupQuaymartUpdateController::Predicate;
  using ScanCompletionHandler = std::function<void(const OptionalError& error)>;
  using SuccessHandler = std::function<void(bool success)>;
  using StartCompletionHandler = std::function<void(bool success, const OptionalError& error)>;
  // Success, the identifier of what is being installed (the product key of
  // an OS update, or the decimal item identifier of a purchase), the
  // purchase's response, and the error.
  using TagInstallCompletionHandler = std::function<void(
      bool success, const std::optional<std::string>& identifier,
      const std::optional<TillPurchaseResponse>& response, const OptionalError& error)>;

  // A scan shows up as in progress after this long even when it was started
  // quietly.
  static constexpr double kQuietScanSeconds = 2.5;

  // --- The registry ---

  // The controller of the client, made on first use; nothing for a client
  // without identifier.
  static std::shared_ptr<UpdateController> updateControllerForStoreClient(
      const VendStoreClient* storeClient);
  static std::shared_ptr<UpdateQueue> updateQueueForStoreClient(const VendStoreClient* storeClient);
  // Waits until the changes under way on the update queues of every
  // controller, and the writes they make, have ended.
  static void finishPendingWritesOfAllControllers();

  // A controller outside the registry, over `softwareMap`, which must
  // outlive it: the registry makes its own with the shared map; tests make
  // theirs with a map of their own.
  // A null center means the service's own.
  static std::shared_ptr<UpdateController> make(
      VendStoreClient storeClient, SoftwareMap& softwareMap,
      std::shared_ptr<UserNotificationCenter> notificationCenter = nullptr);
  // Use make; public for make_shared only.
  explicit UpdateController(VendStoreClient storeClient,
                            std::shared_ptr<UserNotificationCenter> notificationCenter = nullptr);
  ~UpdateController() override;
  UpdateController(const UpdateController&) = delete;
  UpdateController& operator=(const UpdateController&) = delete;

  [[nodiscard]] const VendStoreClient& storeClient() const { return storeClient_; }
  [[nodiscard]] const std::shared_ptr<UpdateQueue>& updateQueue() const override {
    return updateQueue_;
  }
  [[nodiscard]] SoftwareMap& softwareMap() const override { return *softwareMap_; }
  [[nodiscard]] const std::shared_ptr<VendServiceProxy>& serviceProxy() const {
    return serviceProxy_;
  }

  // --- Badge and observers ---

  void addAvailableUpdatesObserver(std::shared_ptr<VendAvailableUpdatesObserver> observer);
  void removeAvailableUpdatesObserver(
      const std::shared_ptr<VendAvailableUpdatesObserver>& observer);
  // App updates the user is to hear of, plus one for all OS updates together.
  [[nodiscard]] std::uint64_t availableUpdatesBadgeCount() const override;
  void availableUpdatesDidChange() override;
  void disableDockBadgeUpdates() override;
  void enableDockBadgeUpdates() override;
  void clearAvailableUpdatesBadgeCount() override;
  // The badge count last sent, if any.
  [[nodiscard]] std::optional<std::uint64_t> lastDockBadgeCount() const;

  // --- The periodic entry ---

  // The software update agent's report of a background scan: makes and
  // enqueues the run that the time tests call for. Returns the operation
  // enqueued, if any, for the caller's log and for tests.
  std::shared_ptr<UpdateOperation> softwareUpdateDidFinishBackgroundScanWithInfo(
      const PlistDictionary& info);

  void updatesForTags(const std::vector<std::string>& tags,
                      std::function<void(const OSUpdateList&)> handler) const;
  // An update matches when it carries every tag.
  static OSUpdatePredicate predicateWithTags(std::vector<std::string> tags);

  // Calls `callback` on the main run loop when the machine moves between
  // mains and limited power, until stopped. Nothing when already observing.
  void startObservingPowerSourceWithCallback(std::function<void()> callback);
  void stopObservingPowerSource();
  [[nodiscard]] bool isObservingPowerSource() const;

  // --- Starting updates ---

  // The user's own start of chosen updates. The rights, power and disk
  // checks come first and block the calling thread for as long as their
  // prompts and the free space request take; on success one user-started
  // run is enqueued, whose end reaches the handler. On failure every app
  // update hears of it through the delegate, the OS updates through the
  // progress observers, and the handler gets a cancellation that keeps the
  // check's title and message. The delegate is kept until the run has
  // ended. Absent app updates leave the choice to the run's qualification;
  // absent OS updates are none.
  void startAppUpdates(const std::optional<std::vector<LedgerUpdateRef>>& apps,
                       const std::optional<OSUpdateList>& osUpdates,
                       std::shared_ptr<VendUpdateDelegate> delegate,
                       StartCompletionHandler completion);
  // Installs the OS update that carries all the tags, scanning for it when
  // none is known; without exactly one, the fallback purchase is made. The
  // handler is called once, on the global queue, and does not wait for
  // the install.
  void startAppInstallWithTags(const std::vector<std::string>& tags,
                               std::optional<TillPurchase> fallbackPurchase,
                               TagInstallCompletionHandler completion);
  // The two halves of the above: the matches found, and the purchase.
  void startAppInstallWithUpdates(const OSUpdateList& updates,
                                  std::optional<TillPurchase> fallbackPurchase,
                                  TagInstallCompletionHandler completion);
  void startAppInstallWithPurchase(const TillPurchase& purchase,
                                   TagInstallCompletionHandler completion);
  // For notification activation: a user-started run over everything
  // available (or only the critical OS updates), which makes its own
  // decisions; no checks here. The run enqueued is returned.
  std::shared_ptr<UpdateOperation> installAllAvailableUpdates();
  std::shared_ptr<UpdateOperation> installAvailableCriticalUpdates();
  void cancelOSUpdates(const OSUpdateList& osUpdates) override;
  // A key without a token is logged and passed over; a token that serves
  // several keys is cancelled once.
  void cancelOSUpdatesWithProductKeys(const std::vector<std::string>& productKeys);

  // The checks in front of a user-started install: rights (when
  // `requiresAuthorization`), then power, then disk. App updates alone face
  // only the rights.
  Result<void> canInstallAppUpdates(const std::vector<LedgerUpdateRef>& apps,
                                    const OSUpdateList& osUpdates, bool requiresAuthorization);
  [[nodiscard]] static bool hasCriticalUpdates(const OSUpdateList& osUpdates);
  // True on mains power or without a battery warning; otherwise asks the
  // user, and plugging in while asked counts as "continue". Blocks on the
  // dialog. The argument does not change the decision.
  bool hasAdequatePowerOrUserConfirmsWithCriticalUpdates(bool hasCriticalUpdates);
  // Asks the platform to make room for the updates and waits for its final
  // answer; the free space request bounds the wait.
  bool checkAndReclaimFreeDiskSpaceForUpdates(const OSUpdateList& osUpdates);

  // --- OS update scans and hiding ---

  void startOSUpdateScanWithForceFullScan(bool forceFullScan, bool reportProgressImmediately,
                                          bool launchedFromNotification, bool userHasSeenAllUpdates,
                                          bool checkForOtherUpdates);
  // One scan at a time: a caller that meets a running scan starts nothing,
  // and its handler is called when that scan finishes, with its error.
  void startOSUpdateScanForTags(std::optional<std::vector<std::string>> tags, bool forceFullScan,
                                bool reportProgressImmediately, bool launchedFromNotification,
                                bool userHasSeenAllUpdates, ScanCompletionHandler completion);
  [[nodiscard]] bool osUpdateScanShouldReportProgress() const;
  [[nodiscard]] bool osUpdateScanInProgress() const;
  void addOSUpdateScanObserver(std::shared_ptr<VendOSUpdateScanObserver> observer);
  void removeOSUpdateScanObserver(const std::shared_ptr<VendOSUpdateScanObserver>& observer);
  void addOSUpdateProgressObserver(std::shared_ptr<VendOSUpdateProgressObserver> observer);
  void removeOSUpdateProgressObserver(
      const std::shared_ptr<VendOSUpdateProgressObserver>& observer);
  void enumerateOSUpdateProgressObserversWithBlock(
      const std::function<void(VendOSUpdateProgressObserver&)>& block) const;
  void osUpdatesChangedProgress(const OSUpdateList& osUpdates,
                                const LedgerSoftwareUpdateStatus& progress) const override;
  void didStartOSUpdates(const OSUpdateList& osUpdates) override;
  void didFinishOSUpdates(const OSUpdateList& osUpdates) override;
  [[nodiscard]] OSUpdateList osUpdatesInProgress() const;
  void hideOSUpdatesWithProductKeys(const std::vector<std::string>& productKeys,
                                    SuccessHandler completion);
  void unhideAllOSUpdates(SuccessHandler completion);
  void setUserHasSeenAllAvailableOSUpdates();
  [[nodiscard]] std::vector<std::string> osUpdateProductKeysSeenByUser() const;

  // --- Timing policy ---

  [[nodiscard]] std::optional<Clock::time_point> dateForTimestampKey(std::string_view key) const;
  [[nodiscard]] bool timestampWithKeyHasExceededCheckInterval(std::string_view key,
                                                              double seconds) const;
  [[nodiscard]] bool isTimeToPostCriticalUpdateNotification() const;
  [[nodiscard]] bool isTimeToPostUpdatesAvailableNotification() const;
  [[nodiscard]] bool isTimeToStageAppUpdates() const;
  [[nodiscard]] bool isTimeToAutoUpdate() const;
  void promptUserToOptInForAutoUpdateWithShowNotification(bool showNotification) override;
  void promptUserToOptInForAutoUpdateOfRestartRequiredUpdatesWithShowNotification(
      bool showNotification) override;
  [[nodiscard]] OSUpdateList availableOSUpdatesEligibleForAutoInstallOfRestartRequiredUpdates()
      const override;

  // --- What runs ask ---

  [[nodiscard]] bool updatesAreInProgress() const override;
  void didRequestPostLogoutInstallOfUpdates() override;
  [[nodiscard]] bool hasRecentlyRequestedPostLogoutInstall() const;
  [[nodiscard]] bool updateFailureNotificationIsDisplayed() const override;
  [[nodiscard]] UpdateNotificationCatalogue& notificationCatalogue() const override;
  [[nodiscard]] bool shouldOfferDoItLaterForAvailableUpdates() const;
  bool confirmRestartWithUpdatesWillDownload(bool willDownload) override;
  void appendInstalledUpdatesToJournal(const std::vector<LedgerUpdateRef>& appUpdates,
                                       const OSUpdateList& osUpdates) override;
  [[nodiscard]] const std::shared_ptr<OSUpdateCancelTokens>& osUpdateCancelTokens() const override {
    return osUpdateCancelTokens_;
  }

  // --- Do It Later ---

  // Modes of Do It Later.
  static constexpr std::int64_t kLaterTonight = 1;
  static constexpr std::int64_t kLaterInAnHour = 2;
  static constexpr std::int64_t kLaterRemindTomorrow = 3;

  // The user's wish to have the available updates installed later: tonight
  // or in an hour fills the later lists and arms the deferred-install agent;
  // tomorrow only makes the updates-available notification come due then.
  void installAvailableUpdatesLaterWithMode(std::int64_t mode) override;
  void installAvailableUpdatesLaterWithMode(std::int64_t mode, bool userInitiated);
  [[nodiscard]] std::vector<std::string> appUpdatesToInstallLater() const override;
  [[nodiscard]] bool appUpdatesToInstallLaterIncludesBundleID(
      std::string_view bundleIdentifier) const override;
  void removeUpdateFromInstallLaterWithBundleID(std::string_view bundleIdentifier);
  [[nodiscard]] bool hasUpdatesToBeInstalledLater() const;
  void cancelUpdatesToBeInstalledLater() override;
  // The deferred-install agent's moment has come: a run installs what was
  // put off. Returns the run enqueued, for tests.
  std::shared_ptr<UpdateOperation> nowIsLaterWithMode(std::int64_t mode, bool countdownDeferred);
  // The moment passed unused; the user hears why, the lists stay.
  void laterDidNotOccurWithDueToACPower(bool dueToACPower);

  // --- The installed-updates journal ---

  // What was installed in the last 30 days, oldest first, without the OS
  // updates that wait for a logout.
  [[nodiscard]] std::vector<PlistDictionary> installedUpdatesJournal() const;

  // --- Audits that notifications carry the key of ---

  // Stores the audit as an XML property list in a file of its own; the
  // key, or nothing when it could not be written.
  std::optional<std::string> cacheUpdateAuditInfo(const PlistDictionary& auditInfo) const;
  [[nodiscard]] std::optional<PlistDictionary> cachedUpdateAuditInfoWithKey(
      std::string_view key) const;
  [[nodiscard]] static std::string auditInfoCachePath(std::string_view key);

  // --- What notification activations ask ---

  // Opens the store application on the details of a failed install: the
  // audit the notification kept the key of. An empty key still opens the
  // page, which then finds nothing.
  void launchQuaymartAndShowUpdateFailureWithAuditInfoCacheKey(std::string_view key) const;

  // --- Major OS update ---

  // The state of a major OS update is one dictionary (preference
  // "MajorOSUpdate", scope system), written only through the install
  // service. Everything that changes it runs on the install queue, serially.
  using MajorOSInstallCancelToken = SysupQuaymartUpdateController::CancelToken;
  // The longest the install queue waits for the framework to match tags.
  static constexpr std::chrono::seconds kMajorOSTagLookupTimeout{600};
  // The pause after a managed install of the installer, for it to be found
  // among the installed applications.
  static constexpr std::chrono::seconds kSetupHeraldDiscoveryPause{10};

  // The announcement of a notification bundle: a new state with a random
  // evaluation date (or an evaluation at once for a delay of 0 or less).
  void majorOSUpdateAvailableWithInfoBundlePath(const std::optional<std::string>& path);
  // The evaluation at a background scan report; call on the install queue.
  void checkMajorOSUpdateStatus();
  void startMajorOSUpdateBackgroundDownload(const SysupQuaymartUpdate& update,
                                            const std::string& bundleIdentifier);
  // The user's answer to a major OS update notification; caller's thread.
  void didActivateMajorOSUpdateNotification(const UserNotification& notification);
  void didDismissMajorOSUpdateNotification(const UserNotification& notification);
  void majorOSUpdateWillBeDownloadedByDaemonWithItemIdentifier(std::uint64_t itemIdentifier,
                                                               const PlistValue& versionIdentifier);
  // True when the caller is not to launch the installer it downloaded.
  // Blocks on the install queue: never call it from there.
  bool majorOSUpdateHasDownloadedToPath(const std::string& path);
  void daemonDownloadHeartbeat();
  // The managed path: fetch the installer with these tags and hand it to
  // the install service.
  void downloadSetupHeraldForTags(const std::optional<std::vector<std::string>>& tags,
                                  const std::optional<std::string>& bundleIdentifier);
  // The managed install's "bundleIdentifier", "progress", "state" and
  // "error". Blocks on the install queue: never call it from there.
  PlistDictionary statusForSetupHeraldDownload();
  void startAdminInstallAtPath(const std::string& path);
  void managedOSInstallWakeUpReceived();
  void proceedWithMDMMajorOSInstall();
  // The connection to the install service, made when there is none.
  std::shared_ptr<MajorOSInstallDaemonInterface> installDaemonConnection();
  bool willInteractivelyPurchaseItemIdentifier(std::uint64_t itemIdentifier);
  void didInteractivelyPurchaseItemIdentifier(std::uint64_t itemIdentifier, bool success);
  [[nodiscard]] std::optional<MajorOSInstallCancelToken> majorOSInstallCancelToken() const;
  void setMajorOSInstallCancelToken(std::optional<MajorOSInstallCancelToken> token);
  [[nodiscard]] const std::shared_ptr<DispatchQueue>& majorOSInstallQueue() const {
    return majorOSInstallQueue_;
  }
  // For tests: shorter waits than kMajorOSTagLookupTimeout and
  // kSetupHeraldDiscoveryPause, and a disk whose free space they choose.
  // The service never calls these.
  void setMajorOSUpdateWaitsForTesting(std::chrono::milliseconds tagLookupTimeout,
                                       std::chrono::milliseconds discoveryPause);
  void setAvailableDiskSpaceForTesting(std::function<std::uint64_t()> availableDiskSpace);

 private:
  void initWithStoreClient(SoftwareMap& softwareMap);
  void availableUpdatesDidChangeInternal();
  void sendBadgeMessage(std::uint64_t count) const;
  // A run of this controller's client with the settings `configure` makes.
  std::shared_ptr<UpdateOperation> makeOperation(
      const std::function<void(UpdateOperationSettings&)>& configure = {});
  void enqueue(const std::shared_ptr<UpdateOperation>& operation) const;
  void refuseStart(const std::vector<LedgerUpdateRef>& apps, const OSUpdateList& osUpdates,
                   const std::shared_ptr<VendUpdateDelegate>& delegate,
                   const StartCompletionHandler& completion, const VendError& checkError) const;
  std::shared_ptr<UpdateOperation> enqueueUserStartedRun(bool criticalOnly);
  [[nodiscard]] std::vector<LedgerUpdateRef> availableAppUpdates() const;
  void sendOSUpdateScanForTags(const std::vector<std::string>& tags, bool finished,
                               float percentComplete, const OptionalError& error) const;
  void osUpdateScanDidFinish(const OptionalError& error, bool userHasSeenAllUpdates);

  // Steps of the background scan report.
  void recordSilentInstalls(const PlistDictionary& info);
  void applyPostLogoutResults(const PlistDictionary& info, UpdateOperation& operation) const;
  void configureTimedTasks(const PlistDictionary& info, UpdateOperation& operation) const;

  // Do It Later steps.
  [[nodiscard]] OSUpdateList osUpdatesToInstallLater();
  bool userAcceptsAgreement(const SysupQuaymartUpdate& update, bool firmware);
  void addAppUpdatesToInstallLater(const std::vector<LedgerUpdateRef>& updates);
  void writeAppUpdatesToInstallLater(const std::vector<std::string>& bundleIdentifiers) const
      REQUIRES(installLaterLock_);

  // The installed-updates journal: the background scan report's entries,
  // and its word on the OS updates installed after a logout.
  void appendCriticalUpdatesToJournal(const std::vector<PlistDictionary>& entries) const;
  void confirmPendingUpdatesInJournal(const std::vector<std::string>& productKeys) const;

  VendStoreClient storeClient_;
  SoftwareMap* softwareMap_ = nullptr;
  std::shared_ptr<UpdateQueue> updateQueue_;
  // Seconds since the epoch of the last request to install after logout; 0
  // when there was none.
  std::atomic<double> lastLogoutRequestedDate_{0};
  std::shared_ptr<OSUpdateCancelTokens> osUpdateCancelTokens_ =
      std::make_shared<OSUpdateCancelTokens>();
  UpdateControllerNotificationContext notificationContext_{*this};
  std::unique_ptr<UpdateNotificationCatalogue> notificationCatalogue_;

  // Serialises the read, change and write of the stored later list, which
  // the client's requests and the runs change from different threads.
  mutable Mutex installLaterLock_;

  mutable Mutex osUpdateScanLock_;
  std::atomic<bool> osUpdateScanInProgress_{false};
  std::atomic<bool> osUpdateReportProgressImmediately_{false};
  // Seconds since the epoch of the running scan's start; 0 when idle.
  std::atomic<double> osUpdateScanStartDate_{0};
  std::optional<std::vector<std::string>> osUpdateScanTags_ GUARDED_BY(osUpdateScanLock_);
  std::vector<ScanCompletionHandler> osUpdateScanWaiters_ GUARDED_BY(osUpdateScanLock_);
  ObserverArray<VendOSUpdateScanObserver> osUpdateScanObservers_;

  mutable Mutex osUpdatesInProgressLock_;
  OSUpdateList osUpdatesInProgress_ GUARDED_BY(osUpdatesInProgressLock_);
  ObserverArray<VendOSUpdateProgressObserver> osUpdateProgressObservers_;

  ObserverArray<VendAvailableUpdatesObserver> availableUpdateObservers_;
  std::atomic<bool> disableDockBadgeUpdates_{false};
  mutable Mutex badgeLock_;
  std::optional<std::uint64_t> lastDockBadgeCount_ GUARDED_BY(badgeLock_);

  mutable Mutex powerLock_;
  std::unique_ptr<LedgerPowerSource::Observation> powerRunLoopSource_ GUARDED_BY(powerLock_);

  std::shared_ptr<VendServiceProxy> serviceProxy_;
  std::shared_ptr<DispatchQueue> majorOSInstallQueue_;
  SysupQuaymartUpdateController::ObserverToken availableOSUpdatesObservation_ = 0;

  // --- Major OS update ---
  [[nodiscard]] PlistDictionary readMajorOSUpdatePrefs() const;
  void writeMajorOSUpdatePrefs(const PlistDictionary& prefs);
  [[nodiscard]] std::optional<Bundle> majorOSUpdateBundle() const;
  [[nodiscard]] std::optional<PlistDictionary> majorOSUpdateBundleInfoDictionary() const;
  void postMajorOSUpdateAvailableNotificationOfType(std::string_view type);
  // The updates that carry all the tags, or nothing when the framework did
  // not answer in time. Blocks the install queue meanwhile.
  [[nodiscard]] std::optional<OSUpdateList> waitForUpdatesForTags(
      const std::vector<std::string>& tags) const;
  // One pass of the evaluation; false when it failed and is to be retried.
  bool evaluateMajorOSUpdateDownload(PlistDictionary& state, const PlistDictionary& info,
                                     std::optional<std::pair<std::string, std::string>>& trace);
  void finishMajorOSUpdateBackgroundDownload(const SysupQuaymartUpdate& update,
                                             const OptionalError& error);
  void startMDMSetupHeraldInstall(const std::vector<std::string>& tags,
                                  const std::string& bundleIdentifier);
  void finishMDMSetupHeraldInstall(const SysupQuaymartUpdate& update, const OptionalError& error,
                                   const std::string& bundleIdentifier);
  void openMajorOSUpdateStorePage(const PlistDictionary& info) const;
  void launchSetupHerald(const PlistDictionary& info) const;
  [[nodiscard]] std::uint64_t majorOSAvailableDiskSpace() const;

  mutable Mutex majorOSLock_;
  std::optional<MajorOSInstallCancelToken> majorOSInstallCancelToken_ GUARDED_BY(majorOSLock_);
  std::shared_ptr<LedgerMajorOSInstallService> installDaemonConnection_ GUARDED_BY(majorOSLock_);
  std::chrono::milliseconds majorOSTagLookupTimeout_ GUARDED_BY(majorOSLock_) =
      kMajorOSTagLookupTimeout;
  std::chrono::milliseconds setupHeraldDiscoveryPause_ GUARDED_BY(majorOSLock_) =
      kSetupHeraldDiscoveryPause;
  std::function<std::uint64_t()> availableDiskSpaceForTesting_ GUARDED_BY(majorOSLock_);
  // Set on the caller's thread, changed by handlers on the install queue.
  PlistDictionary lastMDMInstallProgress_ GUARDED_BY(majorOSLock_);
};

}  // namespace larder
