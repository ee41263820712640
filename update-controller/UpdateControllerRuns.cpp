// What the controller tells the runs it makes: whether updates are under
// way, which app updates the user put off, and where installs are recorded.
#include <algorithm>
#include <chrono>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/services/VendDownloadService.h"
#include "update-controller/UpdateController.h"

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

bool UpdateController::confirmRestartWithUpdatesWillDownload(bool willDownload) {
  // The restart confirmation belongs to the restart path, which this build
  // does not have; without it the restart counts as declined, so that the
  // updates wait for the next logout instead of a restart nobody agreed to.
  TILL_LOG(1, "%@: No restart confirmation in this build (download %d); restart declined", kSpeaker,
           willDownload);
  return false;
}

void UpdateController::appendInstalledUpdatesToJournal(const std::vector<LedgerUpdateRef>& apps,
                                                       const OSUpdateList& osUpdates) {
  for (const LedgerUpdateRef& update : apps) {
    TILL_LOG(1, "%@: Installed update %@ (no update journal to append it to)", kSpeaker, update);
  }
  for (const SysupQuaymartUpdate& update : osUpdates) {
    TILL_LOG(1, "%@: Installed OS update %@ (no update journal to append it to)", kSpeaker, update);
  }
}

}  // namespace larder
