#include "update-operation/UpdateOperation.h"

#include <utility>

#include "platform/log/TillLogManager.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateOperation";

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

}  // namespace

UpdateOperation::UpdateOperation(VendStoreClient storeClient)
    : VendOperation(std::move(storeClient)) {}

UpdateOperationSettings UpdateOperation::settings() const {
  MutexLock lock(settingsMutex_);
  return settings_;
}

void UpdateOperation::setSettings(UpdateOperationSettings settings) {
  MutexLock lock(settingsMutex_);
  settings_ = std::move(settings);
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

void UpdateOperation::run() {
  // The run from the store check to the closing notification is not part of
  // this build: the operation ends as soon as it starts, having done nothing.
  TILL_LOG(2, "%@: %@ ends without a run: this build only configures runs", kSpeaker,
           description());
}

}  // namespace larder
