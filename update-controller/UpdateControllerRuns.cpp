// What the controller tells the runs it makes: whether updates are under
// way, whether the user agrees to a restart, and where installs are recorded.
#include <algorithm>
#include <chrono>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"
#include "store-runtime/dialogs/VendDialog.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/services/VendDownloadService.h"
#include "store-runtime/services/VendUIService.h"
#include "update-controller/UpdateController.h"
#include "update-queue/journal/UpdateJournal.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateController";
constexpr double kPostLogoutRequestSeconds = 3600;

double secondsSinceEpoch() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

}  // namespace

bool UpdateController::updatesAreInProgress() const {
  std::vector<TillDownloadRef> downloads;
  serviceProxy_->downloadServiceSynchronousBlock(
      [&](VendDownloadService& service, DispatchSemaphore& semaphore) {
        service.downloadsWithTypeMask(TillDownload::kInstall,
                                      [&](std::vector<TillDownloadRef> current) {
                                        downloads = std::move(current);
                                        semaphore.signal();
                                      });
      });
  for (const TillDownloadRef& download : downloads) {
    const TillDownloadFields fields = download->snapshot();
    if (fields.status.isPaused || fields.status.isFailed) continue;
    if ((fields.downloadType & TillDownload::kInstall) == 0) continue;
    // A new app that is downloading replaces nothing, so it does not count.
    if (softwareMap_->productPathToUpgradeForBundleIdentifier(fields.metadata.bundleIdentifier(),
                                                              fields.metadata.bundleVersion())) {
      return true;
    }
  }
  if (!osUpdatesInProgress().empty()) return true;
  if (LedgerTwilightAgent::isRestartCountdownShown()) return true;
  return hasRecentlyRequestedPostLogoutInstall();
}

void UpdateController::didRequestPostLogoutInstallOfUpdates() {
  lastLogoutRequestedDate_.store(secondsSinceEpoch());
}

bool UpdateController::hasRecentlyRequestedPostLogoutInstall() const {
  const double requested = lastLogoutRequestedDate_.load();
  return requested > 0 && secondsSinceEpoch() - requested < kPostLogoutRequestSeconds;
}

// The dialog's texts say whether the updates still have to download before
// the restart. Blocks until the user answers; with no dialog agent the
// answer is "not now".
bool UpdateController::confirmRestartWithUpdatesWillDownload(bool willDownload) {
  auto text = [&](std::string key) {
    if (willDownload) key += "_DOWNLOAD";
    return LedgerLocalizedString(key, &storeClient_);
  };
  const VendDialog dialog = VendDialog::dialogWithDictionary(
      {{"message", text("CONFIRM_RESTART_TITLE")},
       {"explanation", text("CONFIRM_RESTART_MESSAGE")},
       {"okButtonString", text("CONFIRM_RESTART_RESTART_BUTTON")},
       {"cancelButtonString", text("CONFIRM_RESTART_NOT_NOW_BUTTON")}});
  auto answered = std::make_shared<DispatchSemaphore>();
  auto exitCode = std::make_shared<std::atomic<std::int64_t>>(VendDialogButton::kCancel);
  serviceProxy_->uiService()->displayDialog(dialog, nullptr,
                                            [answered, exitCode](std::int64_t code) {
                                              exitCode->store(code);
                                              answered->signal();
                                            });
  answered->wait();
  return exitCode->load() == VendDialogButton::kOK;
}

void UpdateController::appendInstalledUpdatesToJournal(const std::vector<LedgerUpdateRef>& apps,
                                                       const OSUpdateList& osUpdates) {
  UpdateJournal::sharedJournal().appendInstalledUpdates(apps, osUpdates);
}

}  // namespace larder
