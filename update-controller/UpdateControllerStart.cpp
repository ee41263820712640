// How a user's wish becomes a run: starting chosen updates, installing by
// tags, installing everything available, cancelling OS updates, and the
// rights, power and disk checks in front of each user-started install.
#include <algorithm>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "running-apps/AuthorizationController.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/dialogs/VendDialog.h"
#include "store-runtime/host/FreeSpaceRequest.h"
#include "store-runtime/host/LedgerDockMessaging.h"
#include "store-runtime/host/LedgerPowerSource.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/services/VendTransactionService.h"
#include "store-runtime/services/VendUIService.h"
#include "update-controller/UpdateController.h"
#include "update-operation/UpdateListDescription.h"
#include "update-operation/UpdateOperation.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateController";
// How hard the free space request may try: everything it can, and waiting.
constexpr std::int64_t kFreeSpaceUrgency = 3;

SysupQuaymartUpdateController& framework() {
  return SysupQuaymartUpdateController::sharedUpdateController();
}

std::string joined(const std::vector<std::string>& parts, std::string_view separator) {
  std::string text;
  for (const std::string& part : parts) {
    if (!text.empty()) text += separator;
    text += part;
  }
  return text;
}

// Whatever the check's own code, the client sees a cancellation: the
// check's title and message stay, so it can still tell why.
VendError startRefusal(const VendError& checkError) {
  VendError refusal = VendError::make(VendError::kCancelledCode);
  refusal.userInfo = checkError.userInfo;
  refusal.description = checkError.description;
  return refusal;
}

}  // namespace

// --- The checks ---

Result<void> UpdateController::canInstallAppUpdates(const std::vector<LedgerUpdateRef>& apps,
                                                    const OSUpdateList& osUpdates,
                                                    bool requiresAuthorization) {
  if (requiresAuthorization &&
      !AuthorizationController::sharedInstance().authorizeForSoftwareInstall()) {
    TILL_LOG(1, "%@: Not authorized to proceed with app updates %@ and OS updates %@", kSpeaker,
             describeList(apps), describeList(osUpdates));
    return VendError::notAuthorized();
  }
  // App updates on their own face no power or disk test.
  if (osUpdates.empty()) return {};
  if (!hasAdequatePowerOrUserConfirmsWithCriticalUpdates(hasCriticalUpdates(osUpdates))) {
    return VendError::cancelledByUser();
  }
  if (!checkAndReclaimFreeDiskSpaceForUpdates(osUpdates)) return VendError::notEnoughDiskSpace();
  return {};
}

bool UpdateController::hasCriticalUpdates(const OSUpdateList& osUpdates) {
  return std::ranges::any_of(osUpdates,
                             [](const SysupQuaymartUpdate& update) { return update.isCritical(); });
}

bool UpdateController::hasAdequatePowerOrUserConfirmsWithCriticalUpdates(bool) {
  // Plain battery power without a warning is adequate power.
  if (LedgerPowerSource::batteryWarningLevel() == LedgerPowerSource::kNoWarning ||
      runningOnACPower()) {
    return true;
  }
  const VendDialog dialog = VendDialog::dialogWithDictionary(
      {{"message", LedgerLocalizedString("AC_POWER_MESSAGE", &storeClient_)},
       {"explanation", LedgerLocalizedString("AC_POWER_TITLE", &storeClient_)},
       {"okButtonString", LedgerLocalizedString("AC_POWER_CONTINUE_BUTTON", &storeClient_)},
       {"cancelButtonString", LedgerLocalizedString("AC_POWER_CANCEL_BUTTON", &storeClient_)}});
  // Plugging in while the dialog is up is the same as pressing continue.
  std::weak_ptr<VendServiceProxy> weakProxy = serviceProxy_;
  startObservingPowerSourceWithCallback([weakProxy, dialog] {
    if (!runningOnACPower()) return;
    if (auto proxy = weakProxy.lock())
      proxy->uiService()->dismissDialog(dialog, VendDialogButton::kOK);
  });
  std::int64_t exitCode = VendDialogButton::kCancel;
  serviceProxy_->uiServiceSynchronousBlock([&](VendUIService& ui, DispatchSemaphore& semaphore) {
    ui.displayDialog(dialog, nullptr, [&](std::int64_t code) {
      exitCode = code;
      semaphore.signal();
    });
  });
  stopObservingPowerSource();
  return exitCode == VendDialogButton::kOK;
}

bool UpdateController::checkAndReclaimFreeDiskSpaceForUpdates(const OSUpdateList& osUpdates) {
  if (PreferenceStore::booleanForKey(kDefaultsDoNotCheckDiskSpaceKey, kQuaymartDefaultsID)
          .value_or(false)) {
    TILL_LOG(1, "%@: Not checking disk space due to %@ preference for updates %@", kSpeaker,
             kDefaultsDoNotCheckDiskSpaceKey, describeList(osUpdates));
    return true;
  }
  const std::uint64_t bytes = framework().diskSpaceRequiredForUpdates(osUpdates);
  std::shared_ptr<FreeSpaceRequest> request = FreeSpaceRequest::requestFreeSpace(bytes);
  request->setUrgency(kFreeSpaceUrgency);
  // Shared with the handler, which the request may call after a final
  // status only if it broke its word; the wait ends at the first final one.
  struct Outcome {
    DispatchSemaphore done;
    std::atomic<bool> ended{false};
    std::atomic<bool> satisfied{false};
  };
  auto outcome = std::make_shared<Outcome>();
  request->begin([outcome](std::int64_t status, const OptionalError& error) {
    if (error) TILL_LOG(1, "Disk space recovery failed with error: %@", describeError(error));
    if (!FreeSpaceRequest::isFinalStatus(status) || outcome->ended.exchange(true)) return;
    outcome->satisfied.store(status == FreeSpaceRequest::kSatisfied);
    outcome->done.signal();
  });
  outcome->done.wait();
  return outcome->satisfied.load();
}

// --- Starting chosen updates ---

void UpdateController::startAppUpdates(const std::optional<std::vector<LedgerUpdateRef>>& apps,
                                       const std::optional<OSUpdateList>& osUpdates,
                                       std::shared_ptr<VendUpdateDelegate> delegate,
                                       StartCompletionHandler completion) {
  const std::vector<LedgerUpdateRef> appList = apps.value_or(std::vector<LedgerUpdateRef>{});
  const OSUpdateList osList = osUpdates.value_or(OSUpdateList{});
  if (Result<void> checked = canInstallAppUpdates(appList, osList, true); !checked) {
    refuseStart(appList, osList, delegate, completion, checked.error());
    return;
  }
  auto operation = makeOperation([&](UpdateOperationSettings& s) {
    s.userInitiated = true;
    s.updateDelegate = delegate;
    if (apps) s.appUpdatesToInstall = *apps;
    s.osUpdatesToInstall = osList;
  });
  // The run holds the delegate weakly; the handler keeps it until the end.
  operation->setCompletionHandler([delegate, completion = std::move(completion)](
                                      VendOperation&, bool success, const OptionalError& error) {
    if (completion) completion(success, error);
  });
  enqueue(operation);
}

void UpdateController::refuseStart(const std::vector<LedgerUpdateRef>& apps,
                                   const OSUpdateList& osUpdates,
                                   const std::shared_ptr<VendUpdateDelegate>& delegate,
                                   const StartCompletionHandler& completion,
                                   const VendError& checkError) const {
  TILL_LOG(1, "%@: Can not proceed with updates based on pre-install checks. apps = %@, OS = %@",
           kSpeaker, describeList(apps), describeList(osUpdates));
  const VendError refusal = startRefusal(checkError);
  if (delegate) {
    for (const LedgerUpdateRef& update : apps) {
      delegate->appUpdateFinishedPurchase(update, false, refusal, std::nullopt);
    }
  }
  if (!osUpdates.empty()) {
    osUpdatesChangedProgress(osUpdates, LedgerSoftwareUpdateStatus::initWithError(refusal));
  }
  if (completion) completion(false, refusal);
}

// --- Installing by tags ---

void UpdateController::startAppInstallWithTags(const std::vector<std::string>& tags,
                                               std::optional<TillPurchase> fallbackPurchase,
                                               TagInstallCompletionHandler completion) {
  TILL_LOG(2, "Starting app install with Sysup tags \"%@\"", joined(tags, ", "));
  std::weak_ptr<UpdateController> weakSelf = weak_from_this();
  auto afterMatch = [weakSelf, tags, fallbackPurchase,
                     completion = std::move(completion)](const OSUpdateList& found) {
    DispatchQueue::globalQueue().async([weakSelf, tags, fallbackPurchase, completion, found] {
      auto self = weakSelf.lock();
      if (!self) return;
      if (!found.empty()) {
        self->startAppInstallWithUpdates(found, fallbackPurchase, completion);
        return;
      }
      // Nothing known carries the tags: a full scan may find it.
      self->startOSUpdateScanForTags(
          tags, true, true, false, false,
          [weakSelf, tags, fallbackPurchase, completion](const OptionalError& error) {
            DispatchQueue::globalQueue().async([=] {
              auto controller = weakSelf.lock();
              if (!controller) return;
              if (error) {
                TILL_LOG(1, "Error scanning software update for tags %@ : %@",
                         PlistValue(PlistArray(tags.begin(), tags.end())), describeError(error));
                controller->startAppInstallWithUpdates({}, fallbackPurchase, completion);
                return;
              }
              framework().availableUpdatesMatchingPredicate(
                  predicateWithTags(tags), [=](const OSUpdateList& rescanned) {
                    DispatchQueue::globalQueue().async([=] {
                      if (auto again = weakSelf.lock()) {
                        again->startAppInstallWithUpdates(rescanned, fallbackPurchase, completion);
                      }
                    });
                  });
            });
          });
    });
  };
  framework().availableUpdatesMatchingPredicate(predicateWithTags(tags), std::move(afterMatch));
}

void UpdateController::startAppInstallWithUpdates(const OSUpdateList& updates,
                                                  std::optional<TillPurchase> fallbackPurchase,
                                                  TagInstallCompletionHandler completion) {
  if (updates.size() != 1) {
    if (fallbackPurchase) {
      TILL_LOG(1, "%@: Falling back to purchase since update count %ld != 1", kSpeaker,
               updates.size());
      startAppInstallWithPurchase(*fallbackPurchase, std::move(completion));
    } else if (completion) {
      completion(false, std::nullopt, std::nullopt, VendError::noUniqueTaggedUpdate());
    }
    return;
  }
  const SysupQuaymartUpdate& update = updates.front();
  if (Result<void> checked = canInstallAppUpdates({}, updates, true); !checked) {
    if (fallbackPurchase) {
      TILL_LOG(1, "%@: Falling back to purchase after update error %@", kSpeaker,
               checked.error().descriptionText());
      startAppInstallWithPurchase(*fallbackPurchase, std::move(completion));
    } else if (completion) {
      completion(false, std::nullopt, std::nullopt, checked.error());
    }
    return;
  }
  // A purchase carries no download metadata in this build, so there is no
  // thumbnail to hand on: the launcher keeps its placeholder icon.
  LedgerDockMessaging::sharedInstance().loadIconForIdentifier(update.productKey(), "",
                                                              storeClient_);
  // An install of the same update that is already running gives way.
  cancelOSUpdates(updates);
  // No apps is an empty list, not an absent one: an absent list would let
  // the run qualify every available app update, which nobody asked for.
  startAppUpdates(std::vector<LedgerUpdateRef>{}, updates, nullptr, nullptr);
  if (completion) completion(true, update.productKey(), std::nullopt, std::nullopt);
}

void UpdateController::startAppInstallWithPurchase(const TillPurchase& purchase,
                                                   TagInstallCompletionHandler completion) {
  serviceProxy_->transactionService()->performPurchases(
      {purchase}, {}, 0,
      [purchase, completion = std::move(completion), client = storeClient_](
          const VendTransactionService::PurchaseResponses& responses, bool success,
          const OptionalError& error) {
        if (success) {
          LedgerDockMessaging::sharedInstance().loadIconForProductID(purchase.itemIdentifier(), "",
                                                                     client);
        }
        std::optional<TillPurchaseResponse> response;
        for (const auto& [made, answer] : responses) {
          if (made == purchase) response = answer;
        }
        if (!completion) return;
        std::optional<std::string> identifier;
        if (success) identifier = std::to_string(purchase.itemIdentifier());
        completion(success, identifier, response, error);
      });
}

// --- Everything available ---

std::shared_ptr<UpdateOperation> UpdateController::installAllAvailableUpdates() {
  return enqueueUserStartedRun(false);
}

std::shared_ptr<UpdateOperation> UpdateController::installAvailableCriticalUpdates() {
  return enqueueUserStartedRun(true);
}

// No checks here: the run makes its own decisions over what is available.
std::shared_ptr<UpdateOperation> UpdateController::enqueueUserStartedRun(bool criticalOnly) {
  auto operation = makeOperation([&](UpdateOperationSettings& s) {
    s.userInitiated = true;
    s.shouldInstallCriticalUpdatesOnly = criticalOnly;
  });
  enqueue(operation);
  return operation;
}

// --- Cancelling OS updates ---

void UpdateController::cancelOSUpdates(const OSUpdateList& osUpdates) {
  std::vector<std::string> keys;
  keys.reserve(osUpdates.size());
  for (const SysupQuaymartUpdate& update : osUpdates) keys.push_back(update.productKey());
  cancelOSUpdatesWithProductKeys(keys);
}

void UpdateController::cancelOSUpdatesWithProductKeys(const std::vector<std::string>& productKeys) {
  std::vector<SysupQuaymartUpdateController::CancelToken> tokens;
  {
    // Running installs add tokens meanwhile; the lookup sees a whole map.
    MutexLock lock(osUpdateCancelTokens_->mutex);
    for (const std::string& key : productKeys) {
      auto found = osUpdateCancelTokens_->tokens.find(key);
      if (found == osUpdateCancelTokens_->tokens.end()) {
        TILL_LOG(1, "%@ %@: No cancelToken for update %@", kSpeaker,
                 "cancelOSUpdatesWithProductKeys", key);
        continue;
      }
      // One token can serve several updates.
      if (std::ranges::find(tokens, found->second) == tokens.end()) tokens.push_back(found->second);
    }
  }
  for (const SysupQuaymartUpdateController::CancelToken& token : tokens) {
    TILL_LOG(2, "%@ cancelOperation with token %@", kSpeaker, token);
    framework().cancelOperation(token);
  }
}

}  // namespace larder
