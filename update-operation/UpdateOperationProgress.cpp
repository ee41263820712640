// What a user-started run shows of an OS update that brings an application:
// the application appears as being downloaded, with a placeholder in the
// launcher bar and a published progress item that a file manager can cancel.
#include "platform/log/TillLogManager.h"
#include "platform/system/FileIO.h"
#include "running-apps/RunningApplication.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/host/LedgerDockMessaging.h"
#include "store-runtime/host/LedgerFileProgress.h"
#include "store-runtime/host/LedgerRootHelper.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "update-operation/UpdateOperation.h"
#include "update-operation/UpdateOperationController.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateOperation";
constexpr std::string_view kBundleTagPrefix = "SYSUPBUNDLE:";
constexpr std::string_view kInstallerPrefix = "com.orvane.SetupHerald";

std::optional<std::string> bundleIdentifierOf(const SysupQuaymartUpdate& update) {
  for (const std::string& tag : update.tags()) {
    if (tag.starts_with(kBundleTagPrefix)) return tag.substr(kBundleTagPrefix.size());
  }
  return std::nullopt;
}

}  // namespace

void UpdateOperation::publishStatus(const LedgerSoftwareUpdateStatus& status,
                                    const std::vector<SysupQuaymartUpdate>& updates) {
  if (!settings().userInitiated) return;
  for (const SysupQuaymartUpdate& update : updates) {
    std::optional<std::string> identifier = bundleIdentifierOf(update);
    if (!identifier) continue;
    LedgerDockMessaging::sharedInstance().sendMessageForUpdate(update.toDictionary(),
                                                               status.toDictionary());
    if (status.hasEnded()) {
      endProgressItem(*identifier, update, status);
      continue;
    }
    std::shared_ptr<LedgerFileProgress> item = progressItemFor(*identifier, update, updates);
    item->setPausable(false);
    item->setCancellable(status.canCancel());
    item->setCompletedUnitCount(static_cast<std::int64_t>(status.percentComplete()));
    // Published once its first state is set, so that nothing sees it
    // pausable or at zero for a moment.
    item->publish();
  }
}

void UpdateOperation::endProgressItem(const std::string& identifier,
                                      const SysupQuaymartUpdate& update,
                                      const LedgerSoftwareUpdateStatus& status) {
  std::shared_ptr<LedgerFileProgress> item;
  {
    MutexLock lock(settingsMutex_);
    auto found = progressItems_.find(identifier);
    if (found == progressItems_.end()) return;
    item = std::move(found->second);
    progressItems_.erase(found);
  }
  if (status.state() == LedgerSoftwareUpdateStatus::kStateFinished &&
      identifier.starts_with(kInstallerPrefix)) {
    launchInstalledApplication(identifier);
  }
  LedgerRootHelper::sharedInstance().proxy().removePlaceholderWithName(update.title().value_or(""));
  item->unpublish();
}

std::shared_ptr<LedgerFileProgress> UpdateOperation::progressItemFor(
    const std::string& identifier, const SysupQuaymartUpdate& update,
    const std::vector<SysupQuaymartUpdate>& updates) {
  {
    MutexLock lock(settingsMutex_);
    if (auto found = progressItems_.find(identifier); found != progressItems_.end()) {
      return found->second;
    }
  }
  const std::string title = update.title().value_or("");
  Result<std::vector<std::uint8_t>> icon = FileIO::read(
      LedgerIconLocationForIdentifier(storeClient().identifier(), update.productKey()));
  LedgerRootHelper::sharedInstance().proxy().createPlaceholderWithName(title, 0,
                                                                       icon ? *icon : PlistData{});
  std::weak_ptr<UpdateOperationController> controller = updateController_;
  auto item = LedgerFileProgress::make(
      {.fileURL = "/Applications/" + title + ".appdownload", .operation = "downloading"},
      [controller, updates, productKey = update.productKey()] {
        TILL_LOG(1, "%@: Filewalker cancelled install of product %@", kSpeaker, productKey);
        if (auto owner = controller.lock()) owner->cancelOSUpdates(updates);
      });
  {
    MutexLock lock(settingsMutex_);
    progressItems_.emplace(identifier, item);
  }
  return item;
}

void UpdateOperation::launchInstalledApplication(const std::string& identifier) const {
  std::shared_ptr<UpdateOperationController> controller = updateController();
  LedgerSoftwareProductRef product =
      controller ? controller->softwareMap().productForBundleIdentifier(identifier) : nullptr;
  if (!product) {
    TILL_LOG(1, "%@: No application %@ to launch after its install", kSpeaker, identifier);
    return;
  }
  // The platform's launch options have no counterpart here: the installer
  // starts as any application does.
  if (Result<pid_t> launched = RunningApplication::launchBundle(product->bundlePath()); !launched) {
    TILL_LOG(1, "%@: Failed to launch %@ - %@", kSpeaker, product->bundlePath(),
             launched.errorDescription());
  }
}

}  // namespace larder
