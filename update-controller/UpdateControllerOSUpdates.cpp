// OS update scans, their observers, install progress, hiding and the OS
// updates the user has seen.
#include <algorithm>

#include "platform/log/TillLogManager.h"
#include "running-apps/AuthorizationController.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/PreferenceStore.h"
#include "update-controller/UpdateController.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateController";

double secondsSinceEpoch() {
  using Seconds = std::chrono::duration<double>;
  return Seconds(std::chrono::system_clock::now().time_since_epoch()).count();
}

SysupQuaymartUpdateController& framework() {
  return SysupQuaymartUpdateController::sharedUpdateController();
}

}  // namespace

void UpdateController::startOSUpdateScanWithForceFullScan(bool forceFullScan,
                                                          bool reportProgressImmediately,
                                                          bool launchedFromNotification,
                                                          bool userHasSeenAllUpdates,
                                                          bool checkForOtherUpdates) {
  startOSUpdateScanForTags(std::nullopt, forceFullScan, reportProgressImmediately,
                           launchedFromNotification, userHasSeenAllUpdates, nullptr);
  if (!checkForOtherUpdates) return;
  // The check's outcome is not looked at: a failed check marks the cached
  // lists as seen all the same.
  updateQueue_->checkForUpdatesWithCompletionHandler(
      [queue = updateQueue_, userHasSeenAllUpdates](
          bool, const UpdateQueue::UpdateList& available,
          const std::optional<UpdateQueue::UpdateList>& incompatible, const OptionalError&) {
        if (userHasSeenAllUpdates) {
          queue->setUserHasSeenAllUpdates(available,
                                          incompatible.value_or(UpdateQueue::UpdateList{}));
        }
      });
}

void UpdateController::startOSUpdateScanForTags(std::optional<std::vector<std::string>> tags,
                                                bool forceFullScan, bool reportProgressImmediately,
                                                bool launchedFromNotification,
                                                bool userHasSeenAllUpdates,
                                                ScanCompletionHandler completion) {
  // Before the lock: a scan that was started quietly becomes visible.
  if (reportProgressImmediately) osUpdateReportProgressImmediately_.store(true);
  {
    MutexLock lock(osUpdateScanLock_);
    if (osUpdateScanInProgress_.load()) {
      if (completion) osUpdateScanWaiters_.push_back(std::move(completion));
      return;
    }
    TILL_LOG(2,
             "%@: Starting SoftwareUpdate scan with forceFullScan=%i launchedFromNotification=%i",
             kSpeaker, forceFullScan, launchedFromNotification);
    osUpdateScanInProgress_.store(true);
    osUpdateScanStartDate_.store(secondsSinceEpoch());
    osUpdateScanTags_ = tags;
    if (completion) osUpdateScanWaiters_.push_back(std::move(completion));
  }
  bool includingPrerelease =
      !PreferenceStore::booleanForKey(kDefaultsHidePreReleaseOSUpdatesKey, kQuaymartDefaultsID)
           .value_or(false);
  std::vector<std::string> scanTags = tags.value_or(std::vector<std::string>{});
  std::weak_ptr<UpdateController> weakSelf = weak_from_this();
  framework().startScanningForUpdatesIncludingPrerelease(
      includingPrerelease, !launchedFromNotification, forceFullScan, nullptr,
      [weakSelf, scanTags](double percent) {
        auto self = weakSelf.lock();
        if (!self || percent < 0) return;
        self->sendOSUpdateScanForTags(scanTags, false, static_cast<float>(percent), std::nullopt);
      },
      [weakSelf, userHasSeenAllUpdates](const OptionalError& error) {
        if (auto self = weakSelf.lock()) self->osUpdateScanDidFinish(error, userHasSeenAllUpdates);
      });
}

void UpdateController::osUpdateScanDidFinish(const OptionalError& error,
                                             bool userHasSeenAllUpdates) {
  TILL_LOG(2, "%@: OS Update scan completed (took %.2f seconds)", kSpeaker,
           secondsSinceEpoch() - osUpdateScanStartDate_.load());
  std::vector<std::string> tags;
  {
    MutexLock lock(osUpdateScanLock_);
    tags = osUpdateScanTags_.value_or(std::vector<std::string>{});
  }
  sendOSUpdateScanForTags(tags, true, 100.0F, error);
  if (userHasSeenAllUpdates) setUserHasSeenAllAvailableOSUpdates();
  std::vector<ScanCompletionHandler> waiters;
  {
    MutexLock lock(osUpdateScanLock_);
    osUpdateScanInProgress_.store(false);
    osUpdateReportProgressImmediately_.store(false);
    osUpdateScanStartDate_.store(0);
    osUpdateScanTags_.reset();
    waiters.swap(osUpdateScanWaiters_);
  }
  for (const ScanCompletionHandler& waiter : waiters) waiter(error);
}

bool UpdateController::osUpdateScanShouldReportProgress() const {
  if (osUpdateReportProgressImmediately_.load()) return true;
  double started = osUpdateScanStartDate_.load();
  return started > 0 && secondsSinceEpoch() - started > kQuietScanSeconds;
}

bool UpdateController::osUpdateScanInProgress() const {
  return osUpdateScanShouldReportProgress() && osUpdateScanInProgress_.load();
}

void UpdateController::sendOSUpdateScanForTags(const std::vector<std::string>& tags, bool finished,
                                               float percentComplete,
                                               const OptionalError& error) const {
  osUpdateScanObservers_.forEach([&](VendOSUpdateScanObserver& observer) {
    observer.osUpdateScanForTags(tags, percentComplete, finished, error);
  });
}

void UpdateController::addOSUpdateScanObserver(std::shared_ptr<VendOSUpdateScanObserver> observer) {
  osUpdateScanObservers_.add(std::move(observer));
}

void UpdateController::removeOSUpdateScanObserver(
    const std::shared_ptr<VendOSUpdateScanObserver>& observer) {
  osUpdateScanObservers_.remove(observer);
}

void UpdateController::addOSUpdateProgressObserver(
    std::shared_ptr<VendOSUpdateProgressObserver> observer) {
  osUpdateProgressObservers_.add(std::move(observer));
}

void UpdateController::removeOSUpdateProgressObserver(
    const std::shared_ptr<VendOSUpdateProgressObserver>& observer) {
  osUpdateProgressObservers_.remove(observer);
}

void UpdateController::enumerateOSUpdateProgressObserversWithBlock(
    const std::function<void(VendOSUpdateProgressObserver&)>& block) const {
  osUpdateProgressObservers_.forEach(block);
}

void UpdateController::osUpdatesChangedProgress(const OSUpdateList& osUpdates,
                                                const LedgerSoftwareUpdateStatus& progress) const {
  enumerateOSUpdateProgressObserversWithBlock([&](VendOSUpdateProgressObserver& observer) {
    observer.osUpdatesChangedProgress(osUpdates, progress);
  });
}

void UpdateController::didStartOSUpdates(const OSUpdateList& osUpdates) {
  MutexLock lock(osUpdatesInProgressLock_);
  osUpdatesInProgress_.insert(osUpdatesInProgress_.end(), osUpdates.begin(), osUpdates.end());
}

void UpdateController::didFinishOSUpdates(const OSUpdateList& osUpdates) {
  MutexLock lock(osUpdatesInProgressLock_);
  std::erase_if(osUpdatesInProgress_, [&](const SysupQuaymartUpdate& update) {
    return std::ranges::find(osUpdates, update) != osUpdates.end();
  });
  TILL_LOG(2, "%@: At conclusion of OS updates, the _osUpdatesInProgress has %i items", kSpeaker,
           osUpdatesInProgress_.size());
}

UpdateController::OSUpdateList UpdateController::osUpdatesInProgress() const {
  MutexLock lock(osUpdatesInProgressLock_);
  return osUpdatesInProgress_;
}

void UpdateController::hideOSUpdatesWithProductKeys(const std::vector<std::string>& productKeys,
                                                    SuccessHandler completion) {
  if (!AuthorizationController::sharedInstance().authorizeForSoftwareInstall()) {
    TILL_LOG(1, "%@: Failed to authorize to hide OS Updates: %@", kSpeaker,
             PlistValue(PlistArray(productKeys.begin(), productKeys.end())));
    if (completion) completion(false);
    return;
  }
  for (const SysupQuaymartUpdate& update : framework().availableUpdates()) {
    if (std::ranges::find(productKeys, update.productKey()) != productKeys.end()) {
      framework().ignoreUpdate(update);
    }
  }
  if (completion) completion(true);
}

void UpdateController::unhideAllOSUpdates(SuccessHandler completion) {
  bool authorized = AuthorizationController::sharedInstance().authorizeForSoftwareInstall();
  if (authorized) {
    framework().resetIgnoredUpdates();
  } else {
    TILL_LOG(1, "%@: Failed to authorize to unhide all OS Updates", kSpeaker);
  }
  if (completion) completion(authorized);
}

void UpdateController::setUserHasSeenAllAvailableOSUpdates() {
  PlistArray keys;
  for (const SysupQuaymartUpdate& update : framework().availableUpdates()) {
    if (!update.productKey().empty()) keys.emplace_back(update.productKey());
  }
  (void)PreferenceStore::setValue(kDefaultsOSUpdatesSeenByUserKey, std::move(keys),
                                  kQuaymartDefaultsID, PreferenceScope::User);
}

std::vector<std::string> UpdateController::osUpdateProductKeysSeenByUser() const {
  std::vector<std::string> keys;
  PlistValue stored = PreferenceStore::valueForKey(kDefaultsOSUpdatesSeenByUserKey,
                                                   kQuaymartDefaultsID, PreferenceScope::User);
  if (const PlistArray* array = stored.array()) {
    for (const PlistValue& key : *array) {
      if (key.string()) keys.push_back(*key.string());
    }
  }
  return keys;
}

}  // namespace larder
