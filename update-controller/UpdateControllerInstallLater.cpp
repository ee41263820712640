// Do It Later: the user puts the available updates off to tonight, to an
// hour from now, or to tomorrow. The OS updates go to the system update
// framework's later list, the app updates to a preference of the service,
// and the deferred-install agent is armed; when its moment comes it asks
// for the run that installs them.
#include <algorithm>
#include <atomic>
#include <chrono>

#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "running-apps/AuthorizationController.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/services/VendOperationQueue.h"
#include "store-runtime/services/VendUIService.h"
#include "update-controller/UpdateController.h"
#include "update-operation/UpdateListDescription.h"
#include "update-operation/UpdateOperation.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateController";
constexpr double kSecondsPerDay = 86400;

}  // namespace

void UpdateController::installAvailableUpdatesLaterWithMode(std::int64_t mode) {
  installAvailableUpdatesLaterWithMode(mode, true);
}

// Tomorrow only moves the updates-available notification's timestamp back so
// that it comes due in 24 hours, whatever its interval (less the slack the
// time test allows).
void UpdateController::installAvailableUpdatesLaterWithMode(std::int64_t mode, bool userInitiated) {
  if (mode == kLaterRemindTomorrow) {
    const auto due =
        Clock::now() + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(
                           kSecondsPerDay - availableUpdatesNotificationMinimumInterval()));
    const PlistDate date = plistDateOf(due);
    (void)PreferenceStore::setValue(kDefaultsDidPostUpdatesAvailableNotificationDateKey, date,
                                    kDaemonDefaultsID);
    TILL_LOG(1, "%@: Setting last notification timestamp to %@ to force a notification in 24 hours",
             kSpeaker, PlistValue(date));
    return;
  }
  // Asked for so that the installs later have it; the lists are filled
  // whatever the answer, as the install at the later moment asks again.
  (void)AuthorizationController::sharedInstance().authorizeForSoftwareInstall();
  const OSUpdateList osUpdates = osUpdatesToInstallLater();
  const std::shared_ptr<const UpdateQueue::UpdateList> apps = updateQueue_->availableUpdates();
  TILL_LOG(1, "%@: Adding OS updates to Do It Later array - %@", kSpeaker, describeList(osUpdates));
  SysupQuaymartUpdateController::sharedUpdateController().installUpdatesLater(osUpdates);
  TILL_LOG(1, "%@: Adding App updates to Do It Later manifest - %@", kSpeaker, describeList(*apps));
  addAppUpdatesToInstallLater(*apps);
  if (osUpdates.empty() && apps->empty()) return;
  LedgerTwilightAgent::armObserverWithMode(mode);
  if (otherUsersAreLoggedIn()) {
    if (userInitiated) notificationCatalogue_->postOtherUsersLoggedInLaterHelperNotification();
    return;
  }
  if (userInitiated && !runningOnACPower()) {
    notificationCatalogue_->postPowerLaterHelperNotification();
  }
}

// The available OS updates that may wait for later: recommended, either
// needing no restart or opted in for Do It Later, and with any firmware
// warning and licence accepted by the user, one dialog after the other.
UpdateController::OSUpdateList UpdateController::osUpdatesToInstallLater() {
  OSUpdateList later;
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  for (const SysupQuaymartUpdate& update : sysup.availableUpdates()) {
    if (!update.isRecommended()) {
      TILL_LOG(1,
               "%@: installAvailableUpdatesLater skipping OS Update %@ because it is not "
               "recommended",
               kSpeaker, update);
      continue;
    }
    if (sysup.actionRequiredForUpdates({update}) != 0 && !update.allowedToUseInstallLater()) {
      TILL_LOG(1,
               "%@: installAvailableUpdatesLater skipping OS Update %@ because it requires a "
               "restart and is not opted-in for Do It Later",
               kSpeaker, update);
      continue;
    }
    // The firmware warning first, then the licence: one declined text
    // leaves the update out.
    const char* declined =
        update.firmwareWarning() && !userAcceptsAgreement(update, true)     ? "firmware warning"
        : update.licenseAgreement() && !userAcceptsAgreement(update, false) ? "license agreement"
                                                                            : nullptr;
    if (declined) {
      TILL_LOG(1,
               "%@: installAvailableUpdatesLater skipping OS Update %@ because the %@ was declined",
               kSpeaker, update, declined);
      continue;
    }
    later.push_back(update);
  }
  return later;
}

// Shows the update's firmware warning or licence through the dialog agents
// and waits for the answer, which the agents' call time-out bounds.
bool UpdateController::userAcceptsAgreement(const SysupQuaymartUpdate& update, bool firmware) {
  auto answered = std::make_shared<DispatchSemaphore>();
  auto agreed = std::make_shared<std::atomic<bool>>(false);
  auto reply = [answered, agreed](bool accepted) {
    agreed->store(accepted);
    answered->signal();
  };
  const std::shared_ptr<VendUIService> ui = serviceProxy_->uiService();
  if (firmware) {
    ui->displayFirmwareWarningWithTitle(update.title().value_or(""), *update.firmwareWarning(),
                                        reply);
  } else {
    ui->displayLicenseAgreementWithTitle(
        LedgerLocalizedString("SOFTWARE_LICENSE_AGREEMENT_TITLE", &storeClient_),
        *update.licenseAgreement(), reply);
  }
  answered->wait();
  return agreed->load();
}

std::vector<std::string> UpdateController::appUpdatesToInstallLater() const {
  std::vector<std::string> identifiers;
  const PlistValue value = PreferenceStore::valueForKey(kDefaultsAppUpdatesToInstallLaterKey,
                                                        kDaemonDefaultsID, PreferenceScope::User);
  if (const PlistArray* array = value.array()) {
    for (const PlistValue& element : *array) {
      if (const std::string* identifier = element.string()) identifiers.push_back(*identifier);
    }
  }
  return identifiers;
}

bool UpdateController::appUpdatesToInstallLaterIncludesBundleID(
    std::string_view bundleIdentifier) const {
  const std::vector<std::string> later = appUpdatesToInstallLater();
  return std::ranges::find(later, bundleIdentifier) != later.end();
}

bool UpdateController::hasUpdatesToBeInstalledLater() const {
  return !appUpdatesToInstallLater().empty() ||
         !SysupQuaymartUpdateController::sharedUpdateController()
              .updatesToBeInstalledLater()
              .empty();
}

void UpdateController::writeAppUpdatesToInstallLater(
    const std::vector<std::string>& bundleIdentifiers) const {
  PlistArray stored(bundleIdentifiers.begin(), bundleIdentifiers.end());
  (void)PreferenceStore::setValue(kDefaultsAppUpdatesToInstallLaterKey, std::move(stored),
                                  kDaemonDefaultsID, PreferenceScope::User);
}

// A new request replaces the list: what the user put off before is in the
// queue's available updates again if it still waits.
void UpdateController::addAppUpdatesToInstallLater(const std::vector<LedgerUpdateRef>& updates) {
  std::vector<std::string> identifiers;
  for (const LedgerUpdateRef& update : updates) {
    if (update->bundleID()) identifiers.push_back(*update->bundleID());
  }
  MutexLock lock(installLaterLock_);
  writeAppUpdatesToInstallLater(identifiers);
}

void UpdateController::removeUpdateFromInstallLaterWithBundleID(std::string_view bundleIdentifier) {
  MutexLock lock(installLaterLock_);
  std::vector<std::string> identifiers = appUpdatesToInstallLater();
  if (std::erase(identifiers, bundleIdentifier) > 0) writeAppUpdatesToInstallLater(identifiers);
}

// Asks for the authorization first, as every change of the later lists
// does, but goes on without it: a cancel must never leave updates armed.
void UpdateController::cancelUpdatesToBeInstalledLater() {
  (void)AuthorizationController::sharedInstance().authorizeForSoftwareInstall();
  SysupQuaymartUpdateController::sharedUpdateController().removeAllUpdatesFromInstallLater();
  {
    MutexLock lock(installLaterLock_);
    writeAppUpdatesToInstallLater({});
  }
  LedgerTwilightAgent::disarmObserver();
}

// The app updates are not handed over: the run reads the stored list.
std::shared_ptr<UpdateOperation> UpdateController::nowIsLaterWithMode(std::int64_t mode,
                                                                      bool countdownDeferred) {
  auto operation = makeOperation([&](UpdateOperationSettings& s) {
    s.doItLaterMode = mode;
    s.restartCountdownWasDeferred = countdownDeferred;
    s.nowIsLater = true;
    s.osUpdatesToInstallLater =
        SysupQuaymartUpdateController::sharedUpdateController().updatesToBeInstalledLater();
  });
  enqueue(operation);
  return operation;
}

void UpdateController::laterDidNotOccurWithDueToACPower(bool dueToACPower) {
  const PlistDictionary missed{{"missedLaterWindow", true},
                               {"dueToNotBeingOnACPower", dueToACPower}};
  notificationCatalogue_->postDoItLaterFailedNotificationWithAuditInfo(missed);
}

}  // namespace larder
