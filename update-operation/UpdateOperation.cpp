// The run from start to end: the power assertion, the store check, the
// locked phases around purchase and install, the closing notification and
// the run record.
#include "update-operation/UpdateOperation.h"

#include <algorithm>
#include <cstdio>
#include <exception>
#include <utility>

#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/host/LedgerPowerAssertion.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/PreferenceStore.h"
#include "update-operation/UpdateListDescription.h"
#include "update-operation/UpdateRunRecord.h"
#include "update-queue/UpdateQueue.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateOperation";
constexpr std::string_view kPowerAssertionName = "com.orvane.pantryd.UpdateStaging";
constexpr std::string_view kRunTraceDomain = "com.orvane.Quaymart.autoupdate.operation_run";

void appendFlag(std::string& text, bool isSet, std::string_view name) {
  if (!isSet) return;
  if (text.back() != '[') text += ' ';
  text += name;
}

template <typename List, typename Key>
void appendList(std::string& text, std::string_view name, const std::optional<List>& list,
                Key&& keyOf) {
  if (!list) return;
  text += ' ';
  text += name;
  text += "=(";
  for (std::size_t index = 0; index < list->size(); ++index) {
    if (index > 0) text += ", ";
    text += keyOf((*list)[index]);
  }
  text += ')';
}

// Releases the run's power assertion on every way out of `run`.
class PowerAssertionRelease {
 public:
  explicit PowerAssertionRelease(std::function<void()> release) : release_(std::move(release)) {}
  ~PowerAssertionRelease() { release_(); }
  PowerAssertionRelease(const PowerAssertionRelease&) = delete;
  PowerAssertionRelease& operator=(const PowerAssertionRelease&) = delete;

 private:
  std::function<void()> release_;
};

}  // namespace

UpdateOperation::UpdateOperation(VendStoreClient storeClient,
                                 std::weak_ptr<UpdateOperationController> updateController)
    : VendOperation(std::move(storeClient)), updateController_(std::move(updateController)) {}

UpdateOperationSettings UpdateOperation::settings() const {
  MutexLock lock(settingsMutex_);
  return settings_;
}

void UpdateOperation::setSettings(UpdateOperationSettings settings) {
  MutexLock lock(settingsMutex_);
  settings_ = std::move(settings);
}

UpdateOperationRunState UpdateOperation::runState() const {
  MutexLock lock(settingsMutex_);
  return runState_;
}

PlistDictionary UpdateOperation::auditInfo() const {
  MutexLock lock(settingsMutex_);
  return auditInfo_;
}

Mutex& UpdateOperation::synchronizationLock() {
  static Mutex lock;
  return lock;
}

std::shared_ptr<UpdateOperationController> UpdateOperation::updateController() const {
  return updateController_.lock();
}

std::string UpdateOperation::description() const {
  UpdateOperationSettings s = settings();
  std::string text = "<UpdateOperation: client=" + storeClient().identifier() + " flags=[";
  appendFlag(text, s.userInitiated, "userInitiated");
  appendFlag(text, s.nowIsLater, "nowIsLater");
  appendFlag(text, s.restartCountdownWasDeferred, "restartCountdownWasDeferred");
  appendFlag(text, s.shouldUpdateNotificationsOnly, "shouldUpdateNotificationsOnly");
  appendFlag(text, s.shouldCheckForAndStageAppUpdates, "shouldCheckForAndStageAppUpdates");
  appendFlag(text, s.shouldStartAutoInstallOfUpdates, "shouldStartAutoInstallOfUpdates");
  appendFlag(text, s.shouldPostAvailableUpdatesNotification,
             "shouldPostAvailableUpdatesNotification");
  appendFlag(text, s.shouldInstallCriticalUpdatesOnly, "shouldInstallCriticalUpdatesOnly");
  appendFlag(text, s.criticalOSUpdatesHaveDelayedAutoInstall,
             "criticalOSUpdatesHaveDelayedAutoInstall");
  appendFlag(text, s.criticalOSUpdatesShouldBeInstalledImmediately,
             "criticalOSUpdatesShouldBeInstalledImmediately");
  appendFlag(text, s.criticalOSUpdatesRequireRestart, "criticalOSUpdatesRequireRestart");
  text += "] criticalOSUpdateCount=" + std::to_string(s.criticalOSUpdateCount);
  if (s.doItLaterMode != 0) text += " doItLaterMode=" + std::to_string(s.doItLaterMode);
  auto productKey = [](const SysupQuaymartUpdate& update) { return update.productKey(); };
  appendList(text, "appUpdatesToInstall", s.appUpdatesToInstall, [](const LedgerUpdateRef& update) {
    return std::to_string(update->itemIdentifierValue());
  });
  appendList(text, "osUpdatesToInstall", s.osUpdatesToInstall, productKey);
  appendList(text, "osUpdatesToInstallLater", s.osUpdatesToInstallLater, productKey);
  auto count = [](std::string_view name, std::size_t size) {
    return size == 0 ? std::string() : " " + std::string(name) + "=" + std::to_string(size);
  };
  text += count("postLogoutInstalledLaterUpdates", s.postLogoutInstalledLaterUpdates.size());
  text += count("postLogoutFailedUpdates", s.postLogoutFailedUpdates.size());
  text += count("postLogoutInstalledUpdates", s.postLogoutInstalledUpdates.size());
  return text + ">";
}

// --- The entry ---

void UpdateOperation::run() {
  if (LedgerTwilightAgent::isRestartCountdownShown()) {
    TILL_LOG(1, "%@: TwilightAgent already displaying restart countdown. Aborting.", kSpeaker);
    answerListedUpdatesWithError(VendError::cancelledByUser());
    return;
  }
  // The preferences are read from their files at each use, so there is
  // nothing to synchronise before the run reads them.
  createPowerAssertion();
  PowerAssertionRelease release([this] { releasePowerAssertion(); });
  try {
    runSequence();
  } catch (const std::exception& exception) {
    TILL_LOG(1, "%@: Exception during operation - %@", kSpeaker, exception.what());
  }
}

void UpdateOperation::answerListedUpdatesWithError(const VendError& error) {
  UpdateOperationSettings s = settings();
  if (s.appUpdatesToInstall) {
    for (const LedgerUpdateRef& update : *s.appUpdatesToInstall) {
      tellDelegate(update, false, error, std::nullopt);
    }
  }
  if (s.osUpdatesToInstall && !s.osUpdatesToInstall->empty()) {
    reportOSUpdatesChangedProgress(*s.osUpdatesToInstall,
                                   LedgerSoftwareUpdateStatus::initWithError(error));
  }
}

void UpdateOperation::createPowerAssertion() {
  changeRunState([](UpdateOperationRunState& state) { state.powerAssertion = 0; });
  const std::string_view type = settings().nowIsLater ? "MaintenanceWake" : "BackgroundTask";
  Result<std::uint32_t> assertion = LedgerPowerAssertion::create(type, kPowerAssertionName);
  if (assertion) {
    changeRunState([&](UpdateOperationRunState& state) { state.powerAssertion = *assertion; });
    TILL_LOG(2, "%@: Asserted %@ power assertion (returned %d)", kSpeaker, type, 0);
  } else {
    TILL_LOG(1, "%@: PowerAssertionCreateWithDescription for %@ returned error:%d", kSpeaker, type,
             assertion.error().code);
  }
}

void UpdateOperation::releasePowerAssertion() {
  const std::uint32_t identifier = runState().powerAssertion;
  if (identifier == 0) return;
  const std::int64_t result = LedgerPowerAssertion::release(identifier);
  if (result == 0) {
    TILL_LOG(2, "%@: Released BackgroundTask power assertion (returned %d)", kSpeaker, result);
  } else {
    TILL_LOG(1, "PowerAssertionRelease returned error:%d", result);
  }
}

// --- The sequence ---

void UpdateOperation::runSequence() {
  const auto startDate = UpdatePolicy::Clock::now();
  {
    MutexLock lock(settingsMutex_);
    auditInfo_["runDate"] = UpdatePolicy::plistDateOf(startDate);
  }
  const UpdateOperationSettings s = settings();
  UpdateRunRecord record(s.userInitiated, s.nowIsLater, s.shouldStartAutoInstallOfUpdates,
                         s.shouldCheckForAndStageAppUpdates);
  if (isCancelled()) {
    TILL_LOG(2, "%@: Aborting cancelled operation", kSpeaker);
    return;
  }
  changeRunState(
      [](UpdateOperationRunState& state) { state.startedInDimWake = LedgerIsDimWake(); });
  const std::int64_t thermalCountAtStart = LedgerDimWakeThermalEmergencyCount();
  std::shared_ptr<UpdateOperationController> controller = updateController();
  if (!controller) {
    TILL_LOG(1, "%@: %@ has no update controller; nothing to do", kSpeaker, description());
    return;
  }
  if (s.shouldUpdateNotificationsOnly) {
    TILL_LOG(2,
             "%@: Did not check for updates, stage or auto-update due to "
             "self.shouldUpdateNotificationsOnly=%i on %@",
             kSpeaker, true, storeClient().identifier());
    if (UpdatePolicy::lastDoItLaterLogoutFailed()) {
      TILL_LOG(1, "%@: Resetting LastDoItLaterLogoutFailed flag to NO due to reboot or login",
               kSpeaker);
      UpdatePolicy::setLastDoItLaterLogoutFailed(false);
    }
  } else {
    runUpdates(*controller, record);
  }
  finishRun(*controller);
  setSuccess(true);
  setError(std::nullopt);
  if (!s.userInitiated && !s.shouldUpdateNotificationsOnly) writeAuditInfoToDisk();
  UpdateOperationRunState state = runState();
  record.finish(state.shouldRestartToInstallUpdates && !state.userDidDeclineRestart,
                state.osUpdatesToInstallOnRestart, startDate, isCancelled(),
                LedgerDimWakeThermalEmergencyCount() - thermalCountAtStart);
  TILL_LOG(1, "%@: Message tracing %@ - %@", kSpeaker, kRunTraceDomain,
           PlistValue(record.dictionary()));
}

void UpdateOperation::runUpdates(UpdateOperationController& controller, UpdateRunRecord& record) {
  const std::shared_ptr<UpdateQueue>& queue = controller.updateQueue();
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  controller.disableDockBadgeUpdates();
  checkUpdateQueue(*queue);
  queue->setDisableQueueChecks(true);
  record.setAvailable(*queue->availableUpdates(), sysup.availableUpdates());

  const UpdateOperationSettings s = settings();
  bool prepared = true;
  if (s.nowIsLater) {
    MutexLock lock(synchronizationLock());
    prepared = prepareSystemForDoItLater();
    if (!prepared) {
      TILL_LOG(1,
               "%@: Setting LastDoItLaterLogoutFailed flag to YES due to prepareSystemForDoItLater "
               "returning NO",
               kSpeaker);
      UpdatePolicy::setLastDoItLaterLogoutFailed(true);
    }
  }
  if (prepared) {
    std::vector<SysupQuaymartUpdate> osUpdates;
    std::vector<LedgerUpdateRef> appUpdates;
    {
      MutexLock lock(synchronizationLock());
      osUpdates = osUpdatesToInstallNow();
      appUpdates = appUpdatesToStageOrInstallNow();
      TILL_LOG(2, "%@: osUpdatedToInstallNow returned qualified updates: %@", kSpeaker,
               describeList(osUpdates));
      TILL_LOG(2, "%@: appUpdatesToStageOrInstallNow returned qualified updates: %@", kSpeaker,
               describeList(appUpdates));
      performUserInteractionRequiredForAppUpdates(appUpdates, osUpdates);
      record.setToInstall(appUpdates, osUpdates, controller.appUpdatesToInstallLater(),
                          sysup.updatesToBeInstalledLater());
    }
    TILL_LOG(2, "%@: Starting app update purchases for %@", kSpeaker, describeList(appUpdates));
    std::vector<TillDownloadRef> downloads = purchaseAppUpdates(appUpdates);
    if (sysup.actionRequiredForUpdates(osUpdates) == 0 &&
        (!downloads.empty() || !osUpdates.empty()) && s.userInitiated &&
        UpdatePolicy::shouldPromptForAutoUpdateOptIn()) {
      controller.promptUserToOptInForAutoUpdateWithShowNotification(true);
    }
    TILL_LOG(2, "%@: Starting app update downloads for %@", kSpeaker, describeList(downloads));
    downloadAndInstallUpdates(downloads, osUpdates);
    MutexLock lock(synchronizationLock());
    resetTimestamps();
  }
  controller.enableDockBadgeUpdates();
  queue->setDisableQueueChecks(false);
}

void UpdateOperation::finishRun(UpdateOperationController& controller) {
  MutexLock lock(synchronizationLock());
  const UpdateOperationSettings s = settings();
  UpdateOperationRunState state = runState();
  if (state.shouldRestartToInstallUpdates && !state.userDidDeclineRestart) {
    restartToInstallUpdates();
    return;
  }
  if (isCancelled()) return;
  if (s.nowIsLater) {
    showDoItLaterFailureAlert();
  } else {
    if (!s.userInitiated) considerRestartRequiredAutoInstall(controller);
    validateAndPostAvailableUpdatesNotification();
  }
  relaunchTerminatedApplications();
  state = runState();
  if (state.shouldRestartToInstallUpdates && state.userDidDeclineRestart &&
      !state.osUpdatesToInstallOnRestart.empty()) {
    TILL_LOG(2, "%@: User declined restart, setting updates to be installed after next logout - %@",
             kSpeaker, describeList(state.osUpdatesToInstallOnRestart));
    (void)SysupQuaymartUpdateController::sharedUpdateController().installUpdatesAfterNextLogout(
        state.osUpdatesToInstallOnRestart, false, false);
  }
}

void UpdateOperation::considerRestartRequiredAutoInstall(UpdateOperationController& controller) {
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  const std::vector<SysupQuaymartUpdate> eligible =
      controller.availableOSUpdatesEligibleForAutoInstallOfRestartRequiredUpdates();
  const bool enabled = UpdatePolicy::isAutoUpdatedOfRestartRequiredUpdatesEnabled();
  const bool logoutFailed = UpdatePolicy::lastDoItLaterLogoutFailed();
  if (!eligible.empty() && enabled && !logoutFailed) {
    TILL_LOG(1,
             "%@: Automatically setting all available updates tonight because Auto Update of "
             "Restart Required Updates is enabled and there are restart required OS updates "
             "available that qualify for Do It Later - %@",
             kSpeaker, describeList(eligible));
    sysup.installUpdatesLater(eligible);
    LedgerTwilightAgent::armObserverWithMode(1);
  } else if (logoutFailed && enabled) {
    TILL_LOG(1,
             "%@: Auto Update of Restart Required Updates is enabled, but the last Do it Later "
             "logout failed. Automatic install will not be attempted.",
             kSpeaker);
  } else if (eligible.empty() && enabled) {
    TILL_LOG(1,
             "%@: Auto Update of Restart Required Updates is enabled, but none of the available "
             "OS updates are eligible to be installed automatically (%@)",
             kSpeaker, describeList(sysup.availableUpdates()));
  }
}

// --- The store check ---

bool UpdateOperation::shouldCheckUpdateQueue() const {
  const UpdateOperationSettings s = settings();
  return (s.shouldCheckForAndStageAppUpdates || s.shouldStartAutoInstallOfUpdates) &&
         !s.userInitiated;
}

void UpdateOperation::checkUpdateQueue(UpdateQueue& queue) {
  if (!shouldCheckUpdateQueue()) {
    TILL_LOG(2,
             "%@: cheCKUpdateQueue skipping app update queue check (userInitiated=%i) - cached "
             "queue has updates: %@",
             kSpeaker, settings().userInitiated, describeList(*queue.availableUpdates()));
    return;
  }
  DispatchSemaphore checked;
  queue.checkForUpdatesWithCompletionHandler(
      [&checked](bool success, const UpdateQueue::UpdateList& available,
                 const std::optional<UpdateQueue::UpdateList>& incompatible,
                 const OptionalError& error) {
        if (success) {
          TILL_LOG(2,
                   "%@: App Update queue check succeeded and returned available updates %@ "
                   "incompatibleUpdates %@",
                   kSpeaker, describeList(available),
                   incompatible ? describeList(*incompatible) : "(null)");
        } else {
          TILL_LOG(1, "%@: App Update queue check failed with error %@", kSpeaker,
                   describeError(error));
        }
        checked.signal();
      });
  checked.wait();
}

void UpdateOperation::resetTimestamps() {
  const UpdateOperationSettings s = settings();
  const PlistDate now = UpdatePolicy::plistDateOf(UpdatePolicy::Clock::now());
  if (s.shouldCheckForAndStageAppUpdates) {
    TILL_LOG(2, "%@: Setting AppUpdatesStagedTimestamp timestamp to now", kSpeaker);
    (void)PreferenceStore::setValue(kDefaultsDidStageAppUpdatesDateKey, now, kDaemonDefaultsID);
  }
  if (s.shouldStartAutoInstallOfUpdates) {
    TILL_LOG(2, "%@: Setting AutoUpdateStartedTimestamp timestamp to now", kSpeaker);
    (void)PreferenceStore::setValue(kDefaultsDidStartAutoUpdateDateKey, now, kDaemonDefaultsID);
  }
}

// --- The audit file ---

std::string UpdateOperation::auditFilePath() {
  return VendFileManager::cacheDirectoryPathWithName(kDaemonDefaultsID) +
         "/UpdateOperationAudit.plist";
}

void UpdateOperation::writeAuditInfoToDisk() const {
  const std::string path = auditFilePath();
  const PlistValue audit(auditInfo());
  TILL_LOG(2, "%@: Writing audit info to disk at %@ - %@", kSpeaker, path, audit);
  if (Result<void> written =
          FileIO::writeAtomically(path, PropertyListSerialization::writeXml(audit));
      !written) {
    TILL_LOG(1, "%@: Failed to write update operation audit to disk at %@", kSpeaker, path);
  }
}

}  // namespace larder
