// The registry, the badge and its observers, the questions about the
// machine and the periodic entry of the update controller.
#include "update-controller/UpdateController.h"

#include "notifications/catalogue/UpdateNotificationCatalogue.h"

#include <algorithm>

#include "platform/log/TillLogManager.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/core/StoreClientRegistry.h"
#include "store-runtime/host/LedgerDistributedNotificationCenter.h"
#include "store-runtime/host/LedgerSessionList.h"
#include "store-runtime/host/LedgerSystemSettings.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/services/VendOperationQueue.h"
#include "update-operation/UpdateOperation.h"
#include "update-queue/journal/UpdateJournal.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateController";
constexpr std::string_view kBadgeNotificationName = "com.orvane.quaymart";
constexpr std::string_view kBadgeNotificationObject = "updateDockTile";

StoreClientRegistry<UpdateController>& registry() {
  static StoreClientRegistry<UpdateController> controllers;
  return controllers;
}

const PlistValue& valueOf(const PlistDictionary& info, std::string_view key) {
  auto found = info.find(key);
  return found == info.end() ? PlistValue::null() : found->second;
}

std::optional<std::string> stringOf(const PlistDictionary& info, std::string_view key) {
  const std::string* text = valueOf(info, key).string();
  return text ? std::optional<std::string>(*text) : std::nullopt;
}

bool contains(const std::vector<std::string>& keys, const std::string& key) {
  return std::ranges::find(keys, key) != keys.end();
}

}  // namespace

// --- The registry ---

std::shared_ptr<UpdateController> UpdateController::updateControllerForStoreClient(
    const VendStoreClient* storeClient) {
  if (!storeClient || storeClient->identifier().empty()) {
    TILL_LOG(1,
             "%@: updateControllerForStoreClient: called with nil storeClient.identifier, no "
             "UpdateController will be available for this client",
             kSpeaker);
    return nullptr;
  }
  return registry().objectForStoreClient(storeClient, [](const VendStoreClient& client) {
    return make(client, SoftwareMap::sharedInstance());
  });
}

std::shared_ptr<UpdateQueue> UpdateController::updateQueueForStoreClient(
    const VendStoreClient* storeClient) {
  auto controller = updateControllerForStoreClient(storeClient);
  return controller ? controller->updateQueue() : nullptr;
}

void UpdateController::finishPendingWritesOfAllControllers() {
  registry().forEach([](UpdateController& controller) {
    if (controller.updateQueue_) controller.updateQueue_->finishPendingWrites();
  });
}

std::shared_ptr<UpdateController> UpdateController::make(
    VendStoreClient storeClient, SoftwareMap& softwareMap,
    std::shared_ptr<UserNotificationCenter> notificationCenter) {
  auto controller =
      std::make_shared<UpdateController>(std::move(storeClient), std::move(notificationCenter));
  controller->initWithStoreClient(softwareMap);
  return controller;
}

UpdateController::UpdateController(VendStoreClient storeClient,
                                   std::shared_ptr<UserNotificationCenter> notificationCenter)
    : storeClient_(std::move(storeClient)),
      notificationCatalogue_(std::make_unique<UpdateNotificationCatalogue>(
          storeClient_, notificationContext_, std::move(notificationCenter))) {}

UpdateController::~UpdateController() {
  if (availableOSUpdatesObservation_ != 0) {
    SysupQuaymartUpdateController::sharedUpdateController().removeAvailableUpdatesObserver(
        availableOSUpdatesObservation_);
  }
}

// Right after construction (under the registry's lock, for the registry's
// controllers), so that the queue and the framework can be given a weak
// reference to this controller. It must not ask the registry.
void UpdateController::initWithStoreClient(SoftwareMap& softwareMap) {
  std::weak_ptr<UpdateController> weakSelf = weak_from_this();
  softwareMap_ = &softwareMap;
  updateQueue_ = std::make_shared<UpdateQueue>(storeClient_, weakSelf, softwareMap);
  serviceProxy_ = std::make_shared<VendServiceProxy>(storeClient_);
  majorOSInstallQueue_ =
      DispatchQueue::create("UpdateController Install Queue", DispatchQueue::Kind::Serial);
  availableOSUpdatesObservation_ =
      SysupQuaymartUpdateController::sharedUpdateController().addAvailableUpdatesObserver(
          [weakSelf](const OSUpdateList&) {
            if (auto self = weakSelf.lock()) self->availableUpdatesDidChangeInternal();
          });
}

void UpdateController::startObservingPowerSourceWithCallback(std::function<void()> callback) {
  MutexLock lock(powerLock_);
  if (powerRunLoopSource_) return;
  powerRunLoopSource_ = LedgerPowerSource::observeLimitedPowerChanges(std::move(callback));
}

void UpdateController::stopObservingPowerSource() {
  std::unique_ptr<LedgerPowerSource::Observation> source;
  {
    MutexLock lock(powerLock_);
    source = std::move(powerRunLoopSource_);
  }
}

bool UpdateController::isObservingPowerSource() const {
  MutexLock lock(powerLock_);
  return powerRunLoopSource_ != nullptr;
}

// --- Badge and observers ---

void UpdateController::addAvailableUpdatesObserver(
    std::shared_ptr<VendAvailableUpdatesObserver> observer) {
  availableUpdateObservers_.add(std::move(observer));
}

void UpdateController::removeAvailableUpdatesObserver(
    const std::shared_ptr<VendAvailableUpdatesObserver>& observer) {
  availableUpdateObservers_.remove(observer);
}

std::vector<LedgerUpdateRef> UpdateController::availableAppUpdates() const {
  auto updates = updateQueue_->availableUpdates();
  return updates ? *updates : std::vector<LedgerUpdateRef>{};
}

std::uint64_t UpdateController::availableUpdatesBadgeCount() const {
  std::vector<LedgerUpdateRef> appUpdates = availableAppUpdates();
  std::uint64_t count = appUpdates.size();
  if (isAutoUpdatedEnabled()) {
    // An unseen update that automatic updates will install by itself is not
    // the user's business yet.
    count = std::ranges::count_if(appUpdates, [](const LedgerUpdateRef& update) {
      return update->didFailToAutoInstall() || update->hasBeenSeenByUser();
    });
  }
  if (storeClient_.clientType() != 0) return count;

  OSUpdateList osUpdates =
      SysupQuaymartUpdateController::sharedUpdateController().availableUpdates();
  if (isAutoUpdatedOfRestartRequiredUpdatesEnabled() && !lastDoItLaterLogoutFailed()) {
    std::vector<std::string> seen = osUpdateProductKeysSeenByUser();
    OSUpdateList quiet = availableOSUpdatesEligibleForAutoInstallOfRestartRequiredUpdates();
    std::erase_if(quiet, [&](const SysupQuaymartUpdate& update) {
      return contains(seen, update.productKey());
    });
    std::erase_if(osUpdates, [&](const SysupQuaymartUpdate& update) {
      return std::ranges::any_of(quiet, [&](const SysupQuaymartUpdate& eligible) {
        return eligible.productKey() == update.productKey();
      });
    });
  }
  // All OS updates together count as one.
  return count + (osUpdates.empty() ? 0 : 1);
}

void UpdateController::availableUpdatesDidChange() {
  availableUpdatesDidChangeInternal();
}

void UpdateController::availableUpdatesDidChangeInternal() {
  bool badgeDisabled =
      PreferenceStore::booleanForKey(kDefaultsDisableQuaymartBadgeKey, kQuaymartDefaultsID)
          .value_or(false);
  std::uint64_t count = badgeDisabled ? 0 : availableUpdatesBadgeCount();
  (void)PreferenceStore::setValue(kDefaultsQuaymartBadgeCountKey, count, kQuaymartDefaultsID);
  if (!disableDockBadgeUpdates_.load()) {
    bool changed = false;
    {
      MutexLock lock(badgeLock_);
      if (lastDockBadgeCount_ != count) {
        lastDockBadgeCount_ = count;
        changed = true;
      }
    }
    if (changed) sendBadgeMessage(count);
  }
  // The real count, whatever the switch says: only a switched-off badge
  // needs it counted a second time.
  const std::uint64_t realCount = badgeDisabled ? availableUpdatesBadgeCount() : count;
  if (realCount == 0) {
    TILL_LOG(2,
             "%@: _availableUpdatesDidChange removing all updates available notifications "
             "because the badge count is 0",
             kSpeaker);
    notificationCatalogue_->removeUpdatesAvailableNotifications();
  }
  auto change = std::make_shared<const AvailableUpdatesChange>(
      availableAppUpdates(),
      SysupQuaymartUpdateController::sharedUpdateController().availableUpdates(), count);
  availableUpdateObservers_.forEach([&](VendAvailableUpdatesObserver& observer) {
    observer.availableUpdatesDidChangedWithUpdates(change);
  });
}

void UpdateController::sendBadgeMessage(std::uint64_t count) const {
  LedgerDistributedNotificationCenter::defaultCenter().postNotificationName(
      kBadgeNotificationName, kBadgeNotificationObject, {{"badgeCount", count}});
}

void UpdateController::disableDockBadgeUpdates() {
  disableDockBadgeUpdates_.store(true);
}

void UpdateController::enableDockBadgeUpdates() {
  disableDockBadgeUpdates_.store(false);
  availableUpdatesDidChangeInternal();
}

void UpdateController::clearAvailableUpdatesBadgeCount() {
  (void)PreferenceStore::setValue(kDefaultsQuaymartBadgeCountKey, std::uint64_t{0},
                                  kQuaymartDefaultsID);
  sendBadgeMessage(0);
}

std::optional<std::uint64_t> UpdateController::lastDockBadgeCount() const {
  MutexLock lock(badgeLock_);
  return lastDockBadgeCount_;
}

// --- Tags ---

UpdateController::OSUpdatePredicate UpdateController::predicateWithTags(
    std::vector<std::string> tags) {
  return [tags = std::move(tags)](const SysupQuaymartUpdate& update) {
    return std::ranges::all_of(
        tags, [&](const std::string& tag) { return contains(update.tags(), tag); });
  };
}

void UpdateController::updatesForTags(const std::vector<std::string>& tags,
                                      std::function<void(const OSUpdateList&)> handler) const {
  SysupQuaymartUpdateController::sharedUpdateController().availableUpdatesMatchingPredicate(
      predicateWithTags(tags), std::move(handler));
}

// --- The periodic entry ---

std::shared_ptr<UpdateOperation> UpdateController::softwareUpdateDidFinishBackgroundScanWithInfo(
    const PlistDictionary& info) {
  TILL_LOG(2, "%@: softwareUpdateDidFinishBackgroundScanWithMessage:%@", kSpeaker,
           PlistValue(info));
  if (info.contains("majorOSUpdateAvailableAtPath")) {
    if (LedgerSystemSettings::areMajorOSUpdatesManaged()) {
      TILL_LOG(1,
               "%@: Ignoring notice of new major OS update availability because this machine "
               "is Gantry enrolled",
               kSpeaker);
      return nullptr;
    }
    TILL_LOG(1, "%@: Received notice of new major OS update availability", kSpeaker);
    majorOSInstallQueue_->async(
        [weakSelf = weak_from_this(), path = stringOf(info, "majorOSUpdateAvailableAtPath")] {
          if (auto self = weakSelf.lock()) self->majorOSUpdateAvailableWithInfoBundlePath(path);
        });
    return nullptr;
  }
  (void)PreferenceStore::setValue(kDefaultsLastAutoUpdateInvocationKey, PlistDate::now(),
                                  kDaemonDefaultsID, PreferenceScope::User);
  recordSilentInstalls(info);

  auto operation = makeOperation();
  configureTimedTasks(info, *operation);
  if (valueOf(info, "updateNotificationsOnly").boolValue()) {
    TILL_LOG(2, "%@: updateNotificationsOnly=true, setting updateNotificationsOnly=YES on %@",
             kSpeaker, operation->description());
    operation->changeSettings(
        [](UpdateOperationSettings& s) { s.shouldUpdateNotificationsOnly = true; });
  } else {
    // Every report advances the major OS update: there is no timer of its own.
    majorOSInstallQueue_->async([weakSelf = weak_from_this()] {
      if (auto self = weakSelf.lock()) self->checkMajorOSUpdateStatus();
    });
  }
  applyPostLogoutResults(info, *operation);
  enqueue(operation);
  return operation;
}

void UpdateController::recordSilentInstalls(const PlistDictionary& info) {
  std::int64_t count = valueOf(info, "autoInstalledUpdatesCount").int64Value();
  if (count < 1) return;
  bool adminInstall = false;
  if (const PlistDictionary* entries = valueOf(info, "autoInstallJournalEntries").dictionary()) {
    static constexpr std::pair<std::string_view, std::string_view> kJournalKeys[] = {
        {"JournalEntryTitle", "title"},
        {"JournalEntryProductVersion", "version"},
        {"JournalEntryLongDescription", "release-notes"},
        {"JournalEntryDescription", "productKey"}};
    std::vector<PlistDictionary> journal;
    bool postLogout = false;
    for (const auto& [unused, value] : *entries) {
      const PlistDictionary* entry = value.dictionary();
      if (!entry) continue;
      PlistDictionary record{{"__isSoftwareUpdate", true}, {"installDate", PlistDate::now()}};
      for (const auto& [from, to] : kJournalKeys) {
        if (entry->contains(from)) record[std::string(to)] = valueOf(*entry, from);
      }
      if (valueOf(*entry, "JournalEntryWasPostLogoutInstall").boolValue()) {
        record["__postLogoutInstallPending"] = true;
        postLogout = true;
      }
      adminInstall = adminInstall || valueOf(*entry, "JournalEntryWasAdminAutoInstall").boolValue();
      journal.push_back(std::move(record));
    }
    appendCriticalUpdatesToJournal(journal);
    if (adminInstall) notificationCatalogue_->postAdminInstallNotification(count, postLogout);
  }
  if (!adminInstall) {
    notificationCatalogue_->postSilentInstallNotification(
        count, stringOf(info, "autoInstalledUpdatesTitle"),
        stringOf(info, "autoInstalledUpdatesText"),
        stringOf(info, "autoInstalledUpdatesURLString"));
  }
}

void UpdateController::configureTimedTasks(const PlistDictionary& info,
                                           UpdateOperation& operation) const {
  UpdateOperationSettings s;
  s.shouldCheckForAndStageAppUpdates = isTimeToStageAppUpdates();
  s.shouldPostAvailableUpdatesNotification = isTimeToPostUpdatesAvailableNotification();
  s.shouldStartAutoInstallOfUpdates = isTimeToAutoUpdate();
  s.criticalOSUpdateCount = valueOf(info, "criticalUpdatesCount").int64Value();
  s.criticalOSUpdatesRequireRestart = valueOf(info, "criticalUpdatesRequireRestart").boolValue();
  s.criticalOSUpdatesShouldBeInstalledImmediately =
      valueOf(info, "installCriticalUpdates").boolValue();
  s.criticalOSUpdatesHaveDelayedAutoInstall =
      valueOf(info, "allowCriticalUpdatesDelay").boolValue();
  // Critical updates are announced daily, not weekly: their test replaces
  // the other one.
  if (s.criticalOSUpdateCount > 0) {
    s.shouldPostAvailableUpdatesNotification = isTimeToPostCriticalUpdateNotification();
  }
  s.criticalOSUpdateNotificationTitle = stringOf(info, "criticalUpdatesTitle");
  s.criticalOSUpdateNotificationText = stringOf(info, "criticalUpdatesText");

  if (const PlistArray* later = valueOf(info, "osUpdatesToPerformLater").array();
      later && !later->empty()) {
    OSUpdateList available =
        SysupQuaymartUpdateController::sharedUpdateController().availableUpdates();
    OSUpdateList toInstallLater;
    for (const PlistValue& key : *later) {
      if (!key.string()) continue;
      auto found = std::ranges::find(available, *key.string(), &SysupQuaymartUpdate::productKey);
      if (found != available.end()) toInstallLater.push_back(*found);
    }
    TILL_LOG(2, "%@: Received OS updates to install later - %@", kSpeaker, PlistValue(*later));
    if (!toInstallLater.empty()) s.osUpdatesToInstallLater = std::move(toInstallLater);
  }
  operation.setSettings(std::move(s));
}

void UpdateController::applyPostLogoutResults(const PlistDictionary& info,
                                              UpdateOperation& operation) const {
  std::vector<std::string> confirmedKeys;
  if (const PlistDictionary* results = valueOf(info, "postLogoutUpdatesInstalled").dictionary()) {
    bool fakeFailure =
        PreferenceStore::booleanForKey(kDefaultsFakePostLogoutUpdateFailureKey, kDaemonDefaultsID)
            .value_or(false);
    std::vector<PlistDictionary> installed;
    std::vector<PlistDictionary> installedLater;
    std::vector<PlistDictionary> failed;
    for (const auto& [productKey, value] : *results) {
      const PlistDictionary* result = value.dictionary();
      PlistDictionary entry = result ? *result : PlistDictionary{};
      std::optional<std::string> state = stringOf(entry, "State");
      if (state == "Installed" && !fakeFailure) {
        installed.push_back(entry);
        confirmedKeys.push_back(productKey);
        if (valueOf(entry, "InstalledLater").boolValue()) installedLater.push_back(entry);
      } else if (state == "Error" || fakeFailure) {
        failed.push_back(entry);
      }
    }
    auto asValue = [](const std::vector<PlistDictionary>& list) {
      return PlistValue(PlistArray(list.begin(), list.end()));
    };
    if (!installedLater.empty()) {
      TILL_LOG(2,
               "%@: SoftwareUpdate reported the following updates were installed later after "
               "logout %@",
               kSpeaker, asValue(installedLater));
    }
    if (!failed.empty()) {
      TILL_LOG(1,
               "%@: SoftwareUpdate reported that the following updates failed to install post "
               "logout - %@",
               kSpeaker, asValue(failed));
    }
    if (!installed.empty()) {
      TILL_LOG(2,
               "%@: SoftwareUpdate reported the following updates were installed (later or "
               "otherwise) after logout %@",
               kSpeaker, asValue(installed));
    }
    operation.changeSettings([&](UpdateOperationSettings& s) {
      s.postLogoutInstalledLaterUpdates = std::move(installedLater);
      s.postLogoutFailedUpdates = std::move(failed);
      s.postLogoutInstalledUpdates = std::move(installed);
    });
  }
  confirmPendingUpdatesInJournal(confirmedKeys);
}

std::shared_ptr<UpdateOperation> UpdateController::makeOperation(
    const std::function<void(UpdateOperationSettings&)>& configure) {
  auto operation = std::make_shared<UpdateOperation>(
      storeClient_, std::weak_ptr<UpdateOperationController>(weak_from_this()));
  // Every run's installs can be cancelled through the controller, whoever
  // started the run.
  operation->changeSettings(
      [&](UpdateOperationSettings& s) { s.osUpdateCancelTokens = osUpdateCancelTokens_; });
  if (configure) operation->changeSettings(configure);
  return operation;
}

void UpdateController::enqueue(const std::shared_ptr<UpdateOperation>& operation) const {
  TILL_LOG(2, "%@: Enqueuing UpdateOperation %@", kSpeaker, operation->description());
  VendOperationQueue::mainQueue().addOperation(operation);
}

// --- The installed-updates journal ---

void UpdateController::appendCriticalUpdatesToJournal(
    const std::vector<PlistDictionary>& entries) const {
  UpdateJournal::sharedJournal().appendCriticalUpdates(entries);
}

void UpdateController::confirmPendingUpdatesInJournal(
    const std::vector<std::string>& productKeys) const {
  UpdateJournal::sharedJournal().confirmPendingUpdates(productKeys);
}

std::vector<PlistDictionary> UpdateController::installedUpdatesJournal() const {
  return UpdateJournal::sharedJournal().installedUpdatesJournal();
}

}  // namespace larder
