// What a run does around the restart that installs OS updates: it clears
// the machine before a Do It Later restart, shows the restart countdown,
// asks the framework for the install after logout, reports what a Do It
// Later left undone, and starts again what it quit for nothing. All of it
// runs under the lock of all runs.
#include <algorithm>

#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/host/LedgerLoginService.h"
#include "store-runtime/host/LedgerQuaymartLauncher.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/services/VendDialogOperation.h"
#include "update-operation/UpdateListDescription.h"
#include "update-operation/UpdateOperation.h"
#include "update-queue/UpdateQueue.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateOperation";
constexpr std::string_view kShowUpdatesURL = "quaymart://showUpdatesPage?source=notification";

// Results of the restart countdown.
constexpr std::int64_t kCountdownRestart = 1;
constexpr std::int64_t kCountdownRestartNow = 2;
constexpr std::int64_t kCountdownTonight = 3;
constexpr std::int64_t kCountdownInAnHour = 4;
constexpr std::int64_t kCountdownTomorrow = 5;

// The final snapshot of the running applications, so that the login after
// the restart brings them back.
constexpr std::int32_t kTakeSnapshot = 1;
constexpr std::int32_t kDisposeSnapshot = 0;

}  // namespace

bool UpdateOperation::shouldRestartAfterShowingRestartCountdown() {
  std::shared_ptr<UpdateOperationController> controller = updateController();
  if (!controller) return false;
  const std::int64_t result =
      controller->notificationCatalogue().showRestartCountdownNotification();
  auto installLater = [&](std::int64_t mode, const char* line) {
    TILL_LOG(1, line, kSpeaker);
    controller->installAvailableUpdatesLaterWithMode(mode);
    return false;
  };
  switch (result) {
    case kCountdownRestart:
    case kCountdownRestartNow:
      TILL_LOG(1, "%@: Proceeding with restart-required updates after showing countdown", kSpeaker);
      return true;
    case kCountdownTonight:
      return installLater(
          1, "%@: User cancelled restart during the countdown and opted to install tonight");
    case kCountdownInAnHour:
      return installLater(
          2, "%@: User cancelled restart during the countdown and opted to install in an hour");
    case kCountdownTomorrow:
      return installLater(
          3, "%@: User cancelled restart during the countdown and opted to be reminded tomorrow");
    default:
      TILL_LOG(1,
               "%@: Unexpected result from TwilightAgent restart countdown (%i), cancelling "
               "restart",
               kSpeaker, result);
      return false;
  }
}

bool UpdateOperation::prepareSystemForDoItLater() {
  const UpdateOperationSettings s = settings();
  const std::vector<SysupQuaymartUpdate> later =
      s.osUpdatesToInstallLater.value_or(std::vector<SysupQuaymartUpdate>{});
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  // Nothing to prepare when no restart follows.
  if (later.empty() || sysup.actionRequiredForUpdates(later) == 0) return true;
  if (sysup.isDownloadRequiredForPostLogoutUpdates(later) && !downloadLaterUpdatesNow(later)) {
    return false;
  }
  if (s.doItLaterMode == 2) {
    // In an hour nothing is quit here: the user is at the machine.
    if (!UpdatePolicy::otherUsersAreLoggedIn()) return true;
    TILL_LOG(1, "%@: Aborting Do It Later because other users are logged in", kSpeaker);
    return false;
  }
  if (s.restartCountdownWasDeferred && !LedgerIsMainDisplayAsleep() &&
      !shouldRestartAfterShowingRestartCountdown()) {
    return false;
  }
  if (UpdatePolicy::otherUsersAreLoggedIn()) {
    TILL_LOG(1,
             "%@: Skipping pre-emptive aggressive quit of all running applications because other "
             "users are logged in",
             kSpeaker);
    return false;
  }
  takeFinalSnapshot();
  return quitAllApplicationsForRestart(later);
}

// The OS updates put off are downloaded before the machine is cleared for
// them; a failed download ends the Do It Later with abort code 106.
bool UpdateOperation::downloadLaterUpdatesNow(const std::vector<SysupQuaymartUpdate>& later) {
  TILL_LOG(1,
           "%@: OS Updates to be installed later are not downloaded, downloading now before "
           "preparing system for Do It Later (Updates: %@)",
           kSpeaker, describeList(later));
  DispatchSemaphore downloaded;
  OptionalError failure;
  downloadUpdatesForPostLogoutInstall(later, [&](const OptionalError& error) {
    failure = error;
    downloaded.signal();
  });
  downloaded.wait();
  if (!failure) return true;
  for (const SysupQuaymartUpdate& update : later) {
    auditOSUpdate(update, false,
                  UpdateAbort{.code = kAbortDownloadBeforeLater, .reason = failure->description});
  }
  return false;
}

void UpdateOperation::takeFinalSnapshot() {
  if (const std::int32_t status = LedgerLoginService::setFinalTALSnapshot(kTakeSnapshot);
      status != 0) {
    TILL_LOG(1, "%@: TAL snapshot failed with error %i", kSpeaker, status);
    return;
  }
  TILL_LOG(1, "%@: TAL snapshot was successful ahead of quitting apps", kSpeaker);
  changeRunState([](UpdateOperationRunState& state) { state.didSnapshotTAL = true; });
}

// Every application but the white-listed processes is asked to quit, with
// no prompt: the user chose the moment. Applications that stay block the
// restart updates of this run, unless the user allowed updates over
// applications that cannot be quit.
bool UpdateOperation::quitAllApplicationsForRestart(const std::vector<SysupQuaymartUpdate>& later) {
  TILL_LOG(1,
           "%@: Performing pre-emptive, aggressive quit of all running applications ahead of Do "
           "It Later updates that will require a restart (%@)",
           kSpeaker, describeList(later));
  std::shared_ptr<AppHelper> helper =
      AppHelper::initWithAllRunningApplicationsIgnoringWhitelistedApps(true, storeClient());
  helper->setTiming(settings().appHelperTiming);
  if (helper->ensureAppsAreNotRunningWithPromptToConfirm(false)) return true;
  const std::vector<std::shared_ptr<RunningApplication>> blockers =
      helper->immortalRunningApplications();
  if (PreferenceStore::booleanForKey(kDefaultsAutoUpdateImmortalAppsKey, kDaemonDefaultsID)
          .value_or(false)) {
    TILL_LOG(1,
             "%@: Pre-emptive quit of %@ failed, but the %@ preference is set. Continuing with "
             "pre-emptive quit of all apps.",
             kSpeaker, describeList(blockers), kDefaultsAutoUpdateImmortalAppsKey);
    return true;
  }
  TILL_LOG(1, "%@: Pre-emptive quit of all applications failed. Restart is blocked by %@", kSpeaker,
           describeList(blockers));
  changeRunState([&](UpdateOperationRunState& state) {
    state.restartIsBlockedByRunningApplications = blockers;
    state.relaunchAppHelpers.push_back(helper);
  });
  auditUpdatesBlockedByApplications(later, blockers);
  return false;
}

void UpdateOperation::auditUpdatesBlockedByApplications(
    const std::vector<SysupQuaymartUpdate>& later,
    const std::vector<std::shared_ptr<RunningApplication>>& blockers) {
  if (blockers.empty()) return;
  const RunningApplication& first = *blockers.front();
  const std::string bundleIdentifier = first.bundleIdentifier().value_or("");
  UpdateAbort abort{.code = kAbortDidNotTerminate,
                    .reason = "app " + bundleIdentifier + " did not terminate",
                    .bundleID = bundleIdentifier};
  if (first.localizedName()) abort.appNames = std::vector<std::string>{*first.localizedName()};
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  for (const SysupQuaymartUpdate& update : later) {
    if (sysup.actionRequiredForUpdates({update}) != 0) auditOSUpdate(update, false, abort);
  }
}

void UpdateOperation::restartToInstallUpdates() {
  const std::vector<SysupQuaymartUpdate> restartUpdates = runState().osUpdatesToInstallOnRestart;
  TILL_LOG(1, "%@: Proceeding with OS updates requiring restart - %@", kSpeaker,
           describeList(restartUpdates));
  for (const SysupQuaymartUpdate& update : restartUpdates) {
    messageTraceOSUpdate(update, "pass", nullptr, std::nullopt);
  }
  changeSettings([&](UpdateOperationSettings& s) {
    if (!s.osUpdatesToInstallLater) return;
    std::erase_if(*s.osUpdatesToInstallLater, [&](const SysupQuaymartUpdate& update) {
      return std::ranges::any_of(restartUpdates, [&](const SysupQuaymartUpdate& restart) {
        return restart.productKey() == update.productKey();
      });
    });
  });
  const bool restartNow = shouldRestartAfterShowingRestartCountdown();
  std::shared_ptr<UpdateOperationController> controller = updateController();
  if (controller && restartNow) {
    controller->appendInstalledUpdatesToJournal({}, restartUpdates);
    controller->notificationCatalogue().removeUpdatesAvailableNotifications();
    controller->clearAvailableUpdatesBadgeCount();
  }
  if (controller) controller->didRequestPostLogoutInstallOfUpdates();
  TILL_LOG(3, "%@: will call installUpdatesAfterNextLogout", kSpeaker);
  if (SysupQuaymartUpdateController::sharedUpdateController().installUpdatesAfterNextLogout(
          restartUpdates, restartNow, settings().nowIsLater)) {
    return;
  }
  TILL_LOG(1, "%@: installUpdatesAfterNextLogout returned NO", kSpeaker);
  showUpdatesChangedDialog();
}

// The framework refused because the updates changed since they were
// chosen: the user may look at the new ones.
void UpdateOperation::showUpdatesChangedDialog() {
  auto text = [&](std::string_view key) { return LedgerLocalizedString(key, &storeClient()); };
  auto dialog = std::make_shared<VendDialogOperation>(
      VendDialog::dialogWithDictionary(
          {{"cancelButtonString", text("CANCEL")},
           {"okButtonString", text("UPDATEFAILED_DIALOG_AVAILABLE_UPDATES_SHOW_DETAILS_BUTTON")},
           {"message", text("UPDATEFAILED_DIALOG_AVAILABLE_UPDATES_CHANGED_TITLE")},
           {"explanation", text("UPDATEFAILED_DIALOG_AVAILABLE_UPDATES_CHANGED_BODY")}}),
      storeClient());
  dialog->setPerformDefaultActions(false);
  OptionalError error;
  if (!runSubOperation(*dialog, &error) || error) {
    TILL_LOG(1, "%@: Updates changed dialog failed: %@", kSpeaker, describeError(error));
    return;
  }
  if (const std::optional<VendDialogButton> selected = dialog->selectedButton();
      !selected || selected->role != VendDialogButton::kOK) {
    return;
  }
  TILL_LOG(3, "%@: open URL %@", kSpeaker, kShowUpdatesURL);
  if (!LedgerQuaymartLauncher::sharedInstance().launchQuaymartWithURL(kShowUpdatesURL)) {
    TILL_LOG(1, "%@: failed to open URL %@", kSpeaker, kShowUpdatesURL);
  }
}

// The end of a Do It Later run that did not restart: what was put off and
// is still not installed is a failure the user hears of, unless it only
// waits for its time (abort codes 500 to 599). The later lists are emptied
// either way.
void UpdateOperation::showDoItLaterFailureAlert() {
  std::shared_ptr<UpdateOperationController> controller = updateController();
  if (!controller) return;
  const std::shared_ptr<const UpdateQueue::UpdateList> available =
      controller->updateQueue()->availableUpdates();
  const bool appLeftUndone = std::ranges::any_of(*available, [&](const LedgerUpdateRef& update) {
    const std::int64_t code = update->autoUpdateAbortCode();
    return update->bundleID() &&
           controller->appUpdatesToInstallLaterIncludesBundleID(*update->bundleID()) &&
           (code < 500 || code > 599);
  });
  const bool osLeftUndone =
      !SysupQuaymartUpdateController::sharedUpdateController().updatesToBeInstalledLater().empty();
  controller->cancelUpdatesToBeInstalledLater();
  if (appLeftUndone || osLeftUndone) {
    controller->notificationCatalogue().postDoItLaterFailedNotificationWithAuditInfo(auditInfo());
  }
}

void UpdateOperation::relaunchTerminatedApplications() {
  for (const std::shared_ptr<AppHelper>& helper : runState().relaunchAppHelpers) {
    if (helper->needsRelaunch()) helper->relaunchTerminatedApps();
  }
  if (!runState().didSnapshotTAL) return;
  if (const std::int32_t status = LedgerLoginService::setFinalTALSnapshot(kDisposeSnapshot);
      status == 0) {
    TILL_LOG(1, "%@: TAL snapshot disposed of successfully after re-launching apps", kSpeaker);
  } else {
    TILL_LOG(1, "%@: TAL snapshot disposal failed with error %i", kSpeaker, status);
  }
  changeRunState([](UpdateOperationRunState& state) { state.didSnapshotTAL = false; });
}

}  // namespace larder
