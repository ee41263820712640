// Carrying out what qualification chose: what only the user can answer,
// one bulk purchase of the app updates, their downloads in two stages
// (staged in the background, installed when the app may be replaced), and
// the OS updates through the system update framework.
#include <algorithm>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "platform/system/ApplicationRegistry.h"
#include "running-apps/AuthorizationController.h"
#include "running-apps/VendCancelUpdateWithPlugInsDialogOperation.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/host/LedgerRootHelper.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/records/VendPurchaseRecord.h"
#include "store-runtime/services/VendDownloadService.h"
#include "store-runtime/services/VendOperationQueue.h"
#include "store-runtime/services/VendOrvaneIDLookupOperation.h"
#include "store-runtime/services/VendServiceProxy.h"
#include "store-runtime/services/VendTransactionService.h"
#include "store-runtime/services/VendUIService.h"
#include "update-operation/UpdateListDescription.h"
#include "update-operation/UpdateOperation.h"
#include "update-queue/UpdateQueue.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateOperation";
// Installs of staged updates that wait for their decision and their
// install at the same time; each may wait for an application to quit.
constexpr std::size_t kConcurrentInstalls = 4;

// Counts the downloads of a run that have not ended, and wakes the run
// when the last one has.
class PendingDownloads {
 public:
  void enter() {
    MutexLock lock(mutex_);
    ++count_;
  }
  void leave() {
    MutexLock lock(mutex_);
    if (--count_ == 0) ended_.notify_all();
  }
  void wait() {
    MutexLock lock(mutex_);
    ended_.wait(lock, [this]() REQUIRES(mutex_) { return count_ == 0; });
  }

 private:
  Mutex mutex_;
  ConditionVariable ended_;
  std::size_t count_ GUARDED_BY(mutex_) = 0;
};

bool isSet(const std::vector<std::string>& list, std::string_view value) {
  return std::ranges::find(list, value) != list.end();
}

// The version the OS updates will bring, for the preflights of app updates:
// "SystemVersion" of the first recommended update that names one.
PlistValue systemVersionForPreflights(const std::vector<SysupQuaymartUpdate>& available) {
  for (const SysupQuaymartUpdate& update : available) {
    if (!update.isRecommended()) continue;
    auto found = update.downloadMetadataDictionary().find("SystemVersion");
    if (found == update.downloadMetadataDictionary().end()) continue;
    TILL_LOG(2,
             "%@: Using OS Update version info from %@ with evaluating app update preflights (%@)",
             kSpeaker, update, found->second);
    return found->second;
  }
  return PlistValue();
}

std::string describePurchaseResponses(const VendTransactionService::PurchaseResponses& responses) {
  std::string text = "{";
  for (const auto& [purchase, response] : responses) {
    if (text.size() > 1) text += ", ";
    text += std::to_string(purchase.itemIdentifier()) + " = " + response.description();
  }
  return text + "}";
}

}  // namespace

// --- What only the user can answer ---

void UpdateOperation::performUserInteractionRequiredForAppUpdates(
    std::vector<LedgerUpdateRef>& appUpdates, std::vector<SysupQuaymartUpdate>& osUpdates) {
  const UpdateOperationSettings s = settings();
  if (!s.userInitiated) return;
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  std::vector<std::string> identifiers;
  for (const LedgerUpdateRef& update : appUpdates) {
    if (update->bundleID()) identifiers.push_back(*update->bundleID());
  }
  if (sysup.actionRequiredForUpdates(osUpdates) == 0) {
    for (const SysupQuaymartUpdate& update : osUpdates) {
      for (const std::string& identifier : update.applicationIdentifiersToClose()) {
        identifiers.push_back(identifier);
      }
    }
  }
  auto cancelEverything = [&] {
    const VendError cancelled = VendError::cancelledByUser();
    for (const LedgerUpdateRef& update : appUpdates) tellDelegate(update, false, cancelled, {});
    if (s.osUpdatesToInstall && !s.osUpdatesToInstall->empty()) {
      reportOSUpdatesChangedProgress(*s.osUpdatesToInstall,
                                     LedgerSoftwareUpdateStatus::initWithError(cancelled));
    }
    appUpdates.clear();
    osUpdates.clear();
  };
  for (const std::string& identifier : identifiers) {
    std::optional<PlugInHostApps> hosts;
    if (AppHelper::isAppRunningWithBundleID(identifier, nullptr, &hosts) && hosts &&
        !hosts->empty()) {
      TILL_LOG(1, "%@: Cancelling the update: plug-ins of %@ are in use by %@", kSpeaker,
               identifier, PlistValue(PlistDictionary(hosts->begin(), hosts->end())));
      cancelEverything();
      // The user learns which applications hold the plug-ins; nobody waits
      // for the answer, which changes nothing.
      if (std::shared_ptr<VendDialogOperation> dialog =
              VendCancelUpdateWithPlugInsDialogOperation::operationWithDictionary(*hosts,
                                                                                  storeClient())) {
        VendOperationQueue::mainQueue().addOperation(dialog);
      }
      return;
    }
  }
  if (!identifiers.empty()) {
    std::shared_ptr<AppHelper> helper = appHelperFor(identifiers);
    helper->setAllowUserToSkipApps(identifiers.size() > 1);
    helper->setOsUpdates(osUpdates);
    if (!helper->ensureAppsAreNotRunningWithPromptToConfirm(true)) {
      cancelEverything();
      return;
    }
    skipUpdatesOfSkippedApps(*helper, appUpdates, osUpdates);
    changeRunState(
        [&](UpdateOperationRunState& state) { state.relaunchAppHelpers.push_back(helper); });
  }
  confirmOSUpdateTexts(osUpdates);
  if (sysup.actionRequiredForUpdates(osUpdates) == 0) return;
  const bool appDownloadRequired = std::ranges::any_of(
      appUpdates, [](const LedgerUpdateRef& update) { return !update->isStaged(); });
  const bool osDownloadRequired = sysup.isDownloadRequiredForPostLogoutUpdates(osUpdates);
  if (!appDownloadRequired && !osDownloadRequired) return;
  TILL_LOG(
      2,
      "%@: Prompting user to confirm download and restart because osUpdateDownloadRequired=%i, "
      "appUpdateDownloadRequired=%i",
      kSpeaker, osDownloadRequired, appDownloadRequired);
  std::shared_ptr<UpdateOperationController> controller = updateController();
  const bool agreed = controller && controller->confirmRestartWithUpdatesWillDownload(true);
  changeRunState([&](UpdateOperationRunState& state) { state.userDidDeclineRestart = !agreed; });
}

std::shared_ptr<AppHelper> UpdateOperation::appHelperFor(
    std::vector<std::string> bundleIdentifiers) const {
  std::shared_ptr<AppHelper> helper =
      AppHelper::initWithBundleIdentifiers(std::move(bundleIdentifiers), storeClient());
  helper->setTiming(settings().appHelperTiming);
  return helper;
}

void UpdateOperation::skipUpdatesOfSkippedApps(const AppHelper& helper,
                                               std::vector<LedgerUpdateRef>& appUpdates,
                                               std::vector<SysupQuaymartUpdate>& osUpdates) {
  const std::vector<std::string> skipped = helper.skippedAppBundleIdentifiers();
  if (skipped.empty()) return;
  const VendError cancelled = VendError::cancelledByUser();
  std::erase_if(appUpdates, [&](const LedgerUpdateRef& update) {
    if (!update->bundleID() || !isSet(skipped, *update->bundleID())) return false;
    TILL_LOG(2,
             "%@: Skipping app update for %@ because the user chose to skip it instead of quitting "
             "the app",
             kSpeaker, update);
    tellDelegate(update, false, cancelled, {});
    return true;
  });
  std::erase_if(osUpdates, [&](const SysupQuaymartUpdate& update) {
    for (const std::string& identifier : update.applicationIdentifiersToClose()) {
      if (!isSet(skipped, identifier)) continue;
      TILL_LOG(2,
               "%@: Skipping OS update for %@ because the user chose to skip it instead of "
               "quitting %@",
               kSpeaker, update, identifier);
      reportOSUpdatesChangedProgress({update},
                                     LedgerSoftwareUpdateStatus::initWithError(cancelled));
      return true;
    }
    return false;
  });
}

void UpdateOperation::confirmOSUpdateTexts(std::vector<SysupQuaymartUpdate>& osUpdates) {
  auto accepted = [this](auto display) {
    bool agreed = false;
    serviceProxy()->uiServiceSynchronousBlock(
        [&](VendUIService& service, DispatchSemaphore& semaphore) {
          display(service, [&](bool answer) {
            agreed = answer;
            semaphore.signal();
          });
        });
    return agreed;
  };
  std::erase_if(osUpdates, [&](const SysupQuaymartUpdate& update) {
    const std::string title = update.title().value_or(update.productKey());
    bool keep = true;
    if (update.firmwareWarning() && !update.productKey().empty()) {
      keep = accepted([&](VendUIService& service, std::function<void(bool)> reply) {
        service.displayFirmwareWarningWithTitle(title, *update.firmwareWarning(), std::move(reply));
      });
    }
    if (keep && update.licenseAgreement() && !update.productKey().empty()) {
      const std::string agreementTitle =
          LedgerLocalizedString("SOFTWARE_LICENSE_AGREEMENT_TITLE", &storeClient());
      keep = accepted([&](VendUIService& service, std::function<void(bool)> reply) {
        service.displayLicenseAgreementWithTitle(agreementTitle, *update.licenseAgreement(),
                                                 std::move(reply));
      });
    }
    if (!keep) {
      reportOSUpdatesChangedProgress(
          {update}, LedgerSoftwareUpdateStatus::initWithError(VendError::cancelledByUser()));
    }
    return !keep;
  });
}

// --- The bulk purchase ---

std::vector<TillDownloadRef> UpdateOperation::purchaseAppUpdates(
    std::vector<LedgerUpdateRef>& appUpdates) {
  TILL_LOG(2, "%@: App updates to be installed/staged is %@", kSpeaker, describeList(appUpdates));
  const bool userInitiated = settings().userInitiated;
  std::shared_ptr<UpdateOperationController> controller = updateController();
  if (!controller) return {};
  std::vector<TillPurchase> purchases;
  VendTransactionService::LegacyApps legacyApps;
  for (const LedgerUpdateRef& update : appUpdates) {
    LedgerSoftwareProductRef product =
        controller->softwareMap().productForItemIdentifier(update->itemIdentifierValue());
    const std::string bundlePath = product ? product->bundlePath() : std::string();
    const std::optional<VendPurchaseRecord> record =
        product ? VendPurchaseRecord::purchaseRecordFromBundleAtPath(bundlePath) : std::nullopt;
    TillPurchase purchase =
        TillPurchase::purchaseWithBuyParameters(update->actionParams().value_or(""));
    purchase.setItemIdentifier(update->itemIdentifierValue());
    purchase.setPurchaseType(userInitiated ? TillPurchase::kPurchaseTypeUserInitiated
                                           : TillPurchase::kPurchaseTypeBackground);
    purchase.setIsUpdate(true);
    if (record) loadOrvaneIDForPurchase(purchase, *record);
    const bool isLegacy = product && !record && product->snapshot().isLegacyApp;
    if (isLegacy && userInitiated) {
      TILL_LOG(2, "%@: Will attempt legacy conversion for app %@", kSpeaker, product);
      legacyApps.push_back(product);
    } else if (isLegacy) {
      TILL_LOG(2, "%@: Skipped purchase of %@ because it requires legacy conversion", kSpeaker,
               update);
      continue;
    }
    if (!userInitiated && purchase.accountIdentifier() == 0 && !purchase.orvaneID()) {
      TILL_LOG(2,
               "%@: Skipped purchase of %@ because it is not user initiated and requires "
               "authentication",
               kSpeaker, update);
      continue;
    }
    purchases.push_back(std::move(purchase));
  }

  VendTransactionService::PurchaseResponses responses;
  bool success = false;
  OptionalError error;
  serviceProxy()->transactionServiceSynchronousBlock([&](VendTransactionService& service,
                                                         DispatchSemaphore& semaphore) {
    service.performPurchases(purchases, legacyApps, VendTransactionService::kLeaveDownloadsToCaller,
                             [&](const VendTransactionService::PurchaseResponses& replied,
                                 bool replySuccess, const OptionalError& replyError) {
                               responses = replied;
                               success = replySuccess;
                               error = replyError;
                               semaphore.signal();
                             });
  });
  TILL_LOG(2, "%@: Transaction service completed making bulk purchases, purchaseResponses = %@",
           kSpeaker, describePurchaseResponses(responses));
  const std::shared_ptr<UpdateQueue>& queue = controller->updateQueue();
  std::vector<TillDownloadRef> downloads;
  if (success) {
    for (const auto& [purchase, response] : responses) {
      tellDelegate(queue->availableUpdateWithItemIdentifier(purchase.itemIdentifier()), true, {},
                   response);
      downloads.insert(downloads.end(), response.downloads().begin(), response.downloads().end());
    }
    return downloads;
  }
  for (const TillPurchase& purchase : purchases) {
    LedgerUpdateRef update = queue->availableUpdateWithItemIdentifier(purchase.itemIdentifier());
    tellDelegate(update, false, error, {});
    if (error && error->isCancellation()) continue;
    queue->setAutoUpdateAbortCode(kAbortPurchaseFailed, purchase.itemIdentifier());
    UpdateAbort abort{kAbortPurchaseFailed, error ? error->description : std::string()};
    if (update) abort.appName = update->title();
    auditAppUpdate(purchase.itemIdentifier(), false, abort);
  }
  return {};
}

void UpdateOperation::loadOrvaneIDForPurchase(TillPurchase& purchase,
                                              const VendPurchaseRecord& record) {
  std::shared_ptr<VendOrvaneIDLookupOperation> lookup =
      VendOrvaneIDLookupOperation::orvaneIDLookupOperationForPurchaseRecord(record, storeClient());
  VendOperation parent(storeClient());
  OptionalError error;
  const bool succeeded = parent.runSubOperation(*lookup, &error);
  lookup->setDelegate(nullptr);
  if (succeeded && !error) {
    TILL_LOG(3, "%@: We know Orvane ID (case 3)", kSpeaker);
    if (std::optional<std::string> name = lookup->orvaneID()) purchase.setOrvaneID(std::move(name));
  } else {
    TILL_LOG(1, "%@: App may be from wrong environment! Lookup failed with error - %@", kSpeaker,
             describeError(error));
  }
}

void UpdateOperation::tellDelegate(const LedgerUpdateRef& update, bool success,
                                   const OptionalError& error,
                                   const std::optional<TillPurchaseResponse>& response) {
  std::shared_ptr<VendUpdateDelegate> delegate = settings().updateDelegate.lock();
  if (delegate && update) delegate->appUpdateFinishedPurchase(update, success, error, response);
}

// --- Downloads and installs ---

void UpdateOperation::downloadAndInstallUpdates(const std::vector<TillDownloadRef>& downloads,
                                                const std::vector<SysupQuaymartUpdate>& osUpdates) {
  lockApplicationsOfOSUpdates(osUpdates, true);
  downloadAndInstallAppUpdateDownloads(downloads);
  DispatchSemaphore osUpdatesEnded;
  downloadAndInstallOSUpdates(osUpdates, [&](const OptionalError&) { osUpdatesEnded.signal(); });
  osUpdatesEnded.wait();
  lockApplicationsOfOSUpdates(osUpdates, false);
}

void UpdateOperation::lockApplicationsOfOSUpdates(const std::vector<SysupQuaymartUpdate>& osUpdates,
                                                  bool lock) {
  std::shared_ptr<VendDownloadService> service = serviceProxy()->downloadService();
  for (const SysupQuaymartUpdate& update : osUpdates) {
    for (const std::string& identifier : update.applicationIdentifiersToClose()) {
      if (lock) {
        service->lockApplicationsForBundleID(identifier);
      } else {
        service->unlockApplicationsWithBundleIdentifier(identifier);
      }
      if (std::optional<std::string> path =
              ApplicationRegistry::pathForBundleIdentifier(identifier)) {
        LedgerRootHelper::sharedInstance().proxy().updateLockedFilePaths({*path}, lock);
      }
    }
  }
}

void UpdateOperation::downloadAndInstallAppUpdateDownloads(
    const std::vector<TillDownloadRef>& downloads) {
  if (downloads.empty()) {
    TILL_LOG(2, "%@: There are no app updates that can be downloaded and/or installed at this time",
             kSpeaker);
    return;
  }
  const bool userInitiated = settings().userInitiated;
  const PlistValue systemVersion = systemVersionForPreflights(
      SysupQuaymartUpdateController::sharedUpdateController().availableUpdates());
  // A queue of the run's own: an install may wait for a preflight answer
  // or for an application to quit, and must not take a thread from a pool
  // that those answers need.
  std::shared_ptr<DispatchQueue> installQueue =
      DispatchQueue::create("UpdateOperation Install Queue", DispatchQueue::Kind::Concurrent,
                            DispatchQueue::Limits{.concurrentWorkers = kConcurrentInstalls});
  PendingDownloads pending;
  for (const TillDownloadRef& download : downloads) {
    if (!shouldDownloadAppUpdateAssets()) {
      TILL_LOG(3,
               "%@: Setting skipAssetDownloadIfNotAlreadyOnDisk=YES because it's not time to stage "
               "updates for download %@",
               kSpeaker, download);
      download->setSkipAssetDownloadIfNotAlreadyOnDisk(true);
    }
    if (!userInitiated) download->setDownloadType(TillDownload::kStageOnly);
    if (!preflightBeforeStagingAllows(download, systemVersion)) continue;
    pending.enter();
    performDownload(download, [this, download, installQueue, &pending](std::int64_t result,
                                                                       const OptionalError&) {
      if (result == 1 && (download->downloadType() & TillDownload::kStageOnly) != 0) {
        installQueue->async([this, download, &pending] {
          installStagedDownload(download);
          pending.leave();
        });
        return;
      }
      pending.leave();
    });
  }
  pending.wait();
}

bool UpdateOperation::preflightBeforeStagingAllows(const TillDownloadRef& download,
                                                   const PlistValue& systemVersion) {
  const TillDownloadMetadata metadata = download->metadata();
  if (!metadata.preflightPackageURL()) {
    TILL_LOG(2,
             "%@: Skipping pre-flight check for %llu (%@) because no preflight package was "
             "specified",
             kSpeaker, metadata.itemIdentifier(), metadata.bundleIdentifier());
    return true;
  }
  const auto [allowed, object] = checkPreflight(metadata, systemVersion);
  if (allowed) return true;
  const UpdateAbort abort{kAbortPreflightBeforeStaging, "not downloaded due to preflight failed"};
  logAppAutoUpdateAbort(abort, metadata.bundleIdentifier(), metadata.itemIdentifier());
  if (std::shared_ptr<UpdateOperationController> controller = updateController()) {
    controller->updateQueue()->setAutoUpdateAbortCode(kAbortPreflightBeforeStaging,
                                                      metadata.itemIdentifier());
  }
  TILL_LOG(1, "%@: Update %llu (%@) will not be staged because the preflight failed", kSpeaker,
           metadata.itemIdentifier(), metadata.bundleIdentifier());
  // The audit keeps the code of the preflight's own error.
  const PlistValue& code = object["code"];
  auditAppUpdate(metadata.itemIdentifier(), false,
                 UpdateAbort{code.isInteger() ? code.int64Value() : 0});
  return false;
}

void UpdateOperation::installStagedDownload(const TillDownloadRef& download) {
  const TillDownloadMetadata metadata = download->metadata();
  const std::string& bundleIdentifier = metadata.bundleIdentifier();
  UpdateAbort abort;
  bool shouldInstall = true;
  if (!settings().userInitiated) {
    // One look at the machine serves the decision and the quit after it.
    const DecisionInputs inputs = DecisionInputs::read();
    shouldInstall = shouldAutoInstallAppUpdate(
        bundleIdentifier.empty() ? std::nullopt : std::optional(bundleIdentifier), download, &abort,
        inputs);
    if (shouldInstall) {
      shouldInstall = quitAppInTheWay(bundleIdentifier, download, &abort, inputs.survey);
    }
  }
  std::shared_ptr<UpdateOperationController> controller = updateController();
  if (!shouldInstall) {
    logAppAutoUpdateAbort(abort, bundleIdentifier, metadata.itemIdentifier());
    if (controller) {
      controller->updateQueue()->setAutoUpdateAbortCode(abort.code, metadata.itemIdentifier());
    }
    auditAppUpdate(metadata.itemIdentifier(), false, abort);
    return;
  }
  const LedgerUpdateRef update =
      controller
          ? controller->updateQueue()->availableUpdateWithItemIdentifier(metadata.itemIdentifier())
          : nullptr;
  download->setDownloadType(TillDownload::kInstall);
  DispatchSemaphore installed;
  performDownload(download, [&](std::int64_t result, const OptionalError& error) {
    // What a background run replaced, for the notification at its end.
    if (result == 1 && update && !settings().userInitiated) {
      changeRunState(
          [&](UpdateOperationRunState& state) { state.autoInstalledAppUpdates.push_back(update); });
    }
    if (std::optional<std::string> url = download->relaunchAppWithBundleURL()) {
      AppHelper::relaunchAppWithBundleURL(url);
    }
    messageTraceAppAutoUpdate(result == 1, kAbortNone, error, bundleIdentifier,
                              metadata.itemIdentifier());
    auditAppUpdate(metadata.itemIdentifier(), true, UpdateAbort{});
    installed.signal();
  });
  installed.wait();
}

bool UpdateOperation::quitAppInTheWay(const std::string& bundleIdentifier,
                                      const TillDownloadRef& download, UpdateAbort* abort,
                                      const AppHelper::Survey& survey) {
  std::optional<std::string> appName;
  std::optional<PlugInHostApps> hosts;
  if (!AppHelper::isAppRunningWithBundleID(bundleIdentifier, &appName, &hosts, survey)) {
    return true;
  }
  abort->appName = appName;
  if (hosts && !hosts->empty()) {
    abort->code = kAbortPlugInsInUse;
    abort->reason = bundleIdentifier + " containing plugIns used by " + joinedHostNames(*hosts);
    return false;
  }
  std::shared_ptr<AppHelper> helper = appHelperFor({bundleIdentifier});
  if (helper->ensureAppsAreNotRunningWithPromptToConfirm(false)) {
    const std::vector<std::string> urls = helper->terminatedAppBundleURLs();
    if (!urls.empty()) download->setRelaunchAppWithBundleURL(urls.back());
    return true;
  }
  abort->code = kAbortDidNotTerminate;
  abort->reason = "running app did not terminate";
  return false;
}

// A download that installs tells the software map before and after the
// replacement, so that the bundle's removal and return are not taken for an
// uninstall and a new install; and the update queue learns what was staged
// and what was installed.
void UpdateOperation::performDownload(
    const TillDownloadRef& download,
    std::function<void(std::int64_t, const OptionalError&)> reply) {
  std::shared_ptr<UpdateOperationController> controller = updateController();
  const TillDownloadMetadata metadata = download->metadata();
  const bool installs = (download->downloadType() & TillDownload::kInstall) != 0;
  std::optional<std::string> replacedPath;
  if (controller && installs) {
    replacedPath = controller->softwareMap().productPathToUpgradeForBundleIdentifier(
        metadata.bundleIdentifier(), metadata.bundleVersion());
    if (replacedPath) {
      controller->softwareMap().productAtPathWillBeUpdatedToBundleVersionStoreVersion(
          *replacedPath, metadata.bundleVersion(), 0);
    }
  }
  if (controller)
    controller->updateQueue()->willStartDownloadForUpdateWithIdentifier(metadata.itemIdentifier());
  serviceProxy()->downloadService()->performDownload(
      download, 0,
      [controller, download, metadata, installs, replacedPath,
       userInitiated = settings().userInitiated,
       reply = std::move(reply)](std::int64_t result, OptionalError error) {
        if (controller) {
          if (replacedPath) {
            controller->softwareMap().productAtPathWasUpdatedToBundleVersionStoreVersion(
                *replacedPath, result == 1, metadata.bundleVersion(), 0);
          }
          UpdateQueue& queue = *controller->updateQueue();
          if (result == 1 && !installs)
            queue.didStageUpdateForItemIdentifier(metadata.itemIdentifier());
          queue.didFinishDownloadForUpdateWithItemIdentifier(metadata.itemIdentifier(),
                                                             result == 1 && installs);
          if (result != 1 && !userInitiated) {
            queue.setDidFailToAutoInstall(metadata.itemIdentifier());
          }
        }
        if (error)
          TILL_LOG(1, "%@: Download of %@ failed: %@", kSpeaker, download, describeError(error));
        reply(result, error);
      });
}

// --- OS updates ---

void UpdateOperation::downloadAndInstallOSUpdates(
    std::vector<SysupQuaymartUpdate> updates,
    std::function<void(const OptionalError&)> completion) {
  if (updates.empty()) {
    TILL_LOG(2, "%@: There are no OS Updates that can be downloaded and/or installed at this time",
             kSpeaker);
    DispatchQueue::globalQueue().async([completion] { completion(std::nullopt); });
    return;
  }
  const bool userInitiated = settings().userInitiated;
  TILL_LOG(2, "%@: Attempting to install %@ OS updates %@", kSpeaker,
           userInitiated ? "foreground" : "background", describeList(updates));
  if (!AuthorizationController::sharedInstance().authorizeForSoftwareInstall()) {
    TILL_LOG(1, "%@: Not authorized to proceed with OS updates %@", kSpeaker,
             describeList(updates));
    VendError error =
        VendError::make(4, "Authorization failed", "Not authorized to proceed with updates.");
    DispatchQueue::globalQueue().async([completion, error] { completion(error); });
    return;
  }
  for (const SysupQuaymartUpdate& update : updates) {
    TILL_LOG(3, "%@: Pre-heated cache of release notes for %@ - %@", kSpeaker, update,
             update.longDescription());
  }
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  if (sysup.actionRequiredForUpdates(updates) != 0) {
    changeRunState([&](UpdateOperationRunState& state) {
      state.shouldRestartToInstallUpdates = true;
      state.osUpdatesToInstallOnRestart = updates;
    });
    if (sysup.isDownloadRequiredForPostLogoutUpdates(updates)) {
      downloadUpdatesForPostLogoutInstall(std::move(updates), std::move(completion));
    } else {
      DispatchQueue::globalQueue().async([completion] { completion(std::nullopt); });
    }
    return;
  }
  std::vector<std::string> relaunchIdentifiers = quitAppsToCloseForOSUpdates(updates);
  if (updates.empty()) {
    // Every update waited for an application that would not quit; the
    // framework starts nothing for an empty list and would never finish.
    for (const std::string& identifier : relaunchIdentifiers) {
      AppHelper::relaunchAppWithBundleID(identifier);
    }
    DispatchQueue::globalQueue().async([completion] { completion(std::nullopt); });
    return;
  }
  std::shared_ptr<UpdateOperationController> controller = updateController();
  auto notifyQueue =
      DispatchQueue::create("UpdateOperation OS Update Notify Queue", DispatchQueue::Kind::Serial);
  std::optional<std::string> token = sysup.startInstallingUpdates(
      updates, notifyQueue, userInitiated,
      [this, updates](const PlistDictionary& statusInfo, bool canCancel, double percent) {
        LedgerSoftwareUpdateStatus status =
            LedgerSoftwareUpdateStatus::initWithProgress(percent, statusInfo, canCancel);
        reportOSUpdatesChangedProgress(updates, status);
        publishStatus(status, updates);
        TILL_LOG(2, "%@: OS Updates install progress: %@", kSpeaker, status);
      },
      [this, updates, controller, relaunchIdentifiers, completion](const OptionalError& error) {
        finishOSUpdateInstall(updates, error, relaunchIdentifiers);
        DispatchQueue::globalQueue().async([completion, error] { completion(error); });
      });
  rememberCancelToken(token, updates, "startInstallingUpdates");
  if (controller) controller->didStartOSUpdates(updates);
}

std::vector<std::string> UpdateOperation::quitAppsToCloseForOSUpdates(
    std::vector<SysupQuaymartUpdate>& updates) {
  std::vector<std::string> relaunchIdentifiers;
  std::erase_if(updates, [&](const SysupQuaymartUpdate& update) {
    for (const std::string& identifier : update.applicationIdentifiersToClose()) {
      std::optional<std::string> appName;
      std::optional<PlugInHostApps> hosts;
      if (!AppHelper::isAppRunningWithBundleID(identifier, &appName, &hosts)) continue;
      std::shared_ptr<AppHelper> helper = appHelperFor({identifier});
      const bool hasHosts = hosts && !hosts->empty();
      if (!hasHosts && helper->ensureAppsAreNotRunningWithPromptToConfirm(false)) {
        if (appName) relaunchIdentifiers.push_back(identifier);
        continue;
      }
      if (hasHosts) {
        TILL_LOG(1,
                 "%@: Skipping install-later OS update %@ because %@ containing plugIns used by %@",
                 kSpeaker, update, identifier, joinedHostNames(*hosts));
      } else {
        TILL_LOG(1, "%@: Skipping install-later OS update %@ because the %@ failed to quit",
                 kSpeaker, update, identifier);
      }
      UpdateAbort abort{kAbortDidNotTerminate, "app " + identifier + " did not terminate",
                        std::nullopt, identifier,
                        appName ? std::optional(std::vector<std::string>{*appName}) : std::nullopt};
      auditOSUpdate(update, false, abort);
      messageTraceOSUpdate(update, "fail", &abort, std::nullopt);
      return true;
    }
    return false;
  });
  return relaunchIdentifiers;
}

void UpdateOperation::finishOSUpdateInstall(const std::vector<SysupQuaymartUpdate>& updates,
                                            const OptionalError& error,
                                            const std::vector<std::string>& relaunchIdentifiers) {
  LedgerSoftwareUpdateStatus status =
      error ? LedgerSoftwareUpdateStatus::initWithError(*error)
            : LedgerSoftwareUpdateStatus::initWithProgress(100.0, std::nullopt, false);
  if (error) {
    TILL_LOG(1, "%@: Failed to install OS Updates %@ with error %@", kSpeaker,
             describeList(updates), describeError(error));
  } else {
    TILL_LOG(2, "%@: Finished installing OS Updates %@", kSpeaker, describeList(updates));
  }
  reportOSUpdatesChangedProgress(updates, status);
  publishStatus(status, updates);
  std::shared_ptr<UpdateOperationController> controller = updateController();
  if (controller) {
    controller->didFinishOSUpdates(updates);
    if (!error) controller->appendInstalledUpdatesToJournal({}, updates);
  }
  for (const std::string& identifier : relaunchIdentifiers) {
    AppHelper::relaunchAppWithBundleID(identifier);
  }
  for (const SysupQuaymartUpdate& update : updates) {
    messageTraceOSUpdate(update, error ? "fail" : "pass", nullptr, error);
  }
  changeSettings([&](UpdateOperationSettings& s) {
    if (!s.osUpdatesToInstallLater) return;
    std::erase_if(*s.osUpdatesToInstallLater, [&](const SysupQuaymartUpdate& later) {
      return std::ranges::any_of(updates, [&](const SysupQuaymartUpdate& installed) {
        return installed.productKey() == later.productKey();
      });
    });
  });
}

void UpdateOperation::downloadUpdatesForPostLogoutInstall(
    std::vector<SysupQuaymartUpdate> updates,
    std::function<void(const OptionalError&)> completion) {
  TILL_LOG(2, "%@: Starting OS Update download for %@", kSpeaker, describeList(updates));
  auto notifyQueue = DispatchQueue::create("UpdateOperation OS Update Download Notify Queue",
                                           DispatchQueue::Kind::Serial);
  std::optional<std::string> token =
      SysupQuaymartUpdateController::sharedUpdateController().startDownloadingPostLogoutUpdates(
          updates, notifyQueue,
          [this, updates](const PlistDictionary& statusInfo, bool, double percent) {
            LedgerSoftwareUpdateStatus status =
                LedgerSoftwareUpdateStatus::initWithProgress(percent, statusInfo, true);
            reportOSUpdatesChangedProgress(updates, status);
            TILL_LOG(2, "%@: OS Updates download (for post-logout) progress: %@", kSpeaker, status);
          },
          [this, updates, completion](const OptionalError& error) {
            LedgerSoftwareUpdateStatus status =
                error ? LedgerSoftwareUpdateStatus::initWithError(*error)
                      : LedgerSoftwareUpdateStatus::initWithProgress(100.0, std::nullopt, true);
            if (error) {
              TILL_LOG(1, "%@: OS Updates download (for post-logout) failed with error %@",
                       kSpeaker, describeError(error));
              dropFromRestart(updates);
            } else {
              TILL_LOG(2, "%@: OS Updates download (for post-logout) finished", kSpeaker);
            }
            reportOSUpdatesChangedProgress(updates, status);
            completion(error);
          });
  rememberCancelToken(token, updates, "startDownloadingPostLogoutUpdates");
}

void UpdateOperation::dropFromRestart(const std::vector<SysupQuaymartUpdate>& updates) {
  changeRunState([&](UpdateOperationRunState& state) {
    if (!state.shouldRestartToInstallUpdates) return;
    std::erase_if(state.osUpdatesToInstallOnRestart, [&](const SysupQuaymartUpdate& waiting) {
      return std::ranges::any_of(updates, [&](const SysupQuaymartUpdate& failed) {
        return failed.productKey() == waiting.productKey();
      });
    });
    state.shouldRestartToInstallUpdates = !state.osUpdatesToInstallOnRestart.empty();
  });
}

void UpdateOperation::rememberCancelToken(const std::optional<std::string>& token,
                                          const std::vector<SysupQuaymartUpdate>& updates,
                                          std::string_view startName) {
  if (!token) {
    TILL_LOG(2, "%@: no token from %@ %@", kSpeaker, startName, describeList(updates));
    return;
  }
  std::shared_ptr<OSUpdateCancelTokens> tokens = settings().osUpdateCancelTokens;
  MutexLock lock(tokens->mutex);
  for (const SysupQuaymartUpdate& update : updates) tokens->tokens[update.productKey()] = *token;
  TILL_LOG(3, "%@: %@ added token from %@ %@ %@", kSpeaker, description(), startName, *token,
           describeList(updates));
}

void UpdateOperation::reportOSUpdatesChangedProgress(
    const std::vector<SysupQuaymartUpdate>& updates, const LedgerSoftwareUpdateStatus& status) {
  if (std::shared_ptr<UpdateOperationController> controller = updateController()) {
    controller->osUpdatesChangedProgress(updates, status);
  }
}

}  // namespace larder
