#include "running-apps/VendQuitAppDialogOperation.h"

#include <algorithm>
#include <filesystem>

#include "store-runtime/dialogs/LedgerLocalizedString.h"

namespace larder {

namespace {

std::string nameOf(const RunningApplication& application) {
  if (application.localizedName() && !application.localizedName()->empty()) {
    return *application.localizedName();
  }
  if (!application.bundleURL()) return {};
  std::string path = *application.bundleURL();
  while (path.size() > 1 && path.ends_with('/')) path.pop_back();
  return std::filesystem::path(path).stem().string();
}

bool isClosedByAnOSUpdate(const RunningApplication& application,
                          const std::optional<std::vector<SysupQuaymartUpdate>>& osUpdates) {
  if (!osUpdates || !application.bundleIdentifier()) return false;
  const std::string& identifier = *application.bundleIdentifier();
  return std::any_of(osUpdates->begin(), osUpdates->end(), [&](const SysupQuaymartUpdate& update) {
    const std::vector<std::string>& toClose = update.applicationIdentifiersToClose();
    return std::find(toClose.begin(), toClose.end(), identifier) != toClose.end();
  });
}

struct QuitTexts {
  std::string title;
  std::string message;
  std::string skip;
};

QuitTexts textsForOneApp(const RunningApplication& application,
                         const std::optional<std::vector<SysupQuaymartUpdate>>& osUpdates,
                         const VendStoreClient& storeClient) {
  const std::string name = nameOf(application);
  auto text = [&](std::string_view key) {
    return LedgerLocalizedStringWithArguments(key, &storeClient, {name});
  };
  QuitTexts texts{text("INSTALL_QUIT_APP_TITLE_FORMAT"), text("INSTALL_QUIT_APP_MESSAGE_FORMAT"),
                  text("INSTALL_QUIT_APP_SKIP_BUTTON_FORMAT")};
  // Skipping it holds back an OS update as well, and the button says so.
  if (isClosedByAnOSUpdate(application, osUpdates)) {
    texts.skip = LedgerLocalizedString("INSTALL_QUIT_APP_SKIP_OS_UPDATES", &storeClient);
  }
  return texts;
}

QuitTexts textsForApps(const std::vector<std::shared_ptr<RunningApplication>>& apps,
                       const VendStoreClient& storeClient) {
  // The agent lays the names out as list items.
  std::string list;
  for (const auto& application : apps) list += "<li>" + nameOf(*application);
  return {LedgerLocalizedString("INSTALL_QUIT_APP_MULTIPLE_TITLE", &storeClient),
          LedgerLocalizedStringWithArguments("INSTALL_QUIT_APP_MULTIPLE_MESSAGE_FORMAT",
                                             &storeClient, {list}),
          LedgerLocalizedString("INSTALL_QUIT_APP_SKIPALL_BUTTON", &storeClient)};
}

}  // namespace

VendQuitAppDialogOperation::VendQuitAppDialogOperation(VendDialog dialog,
                                                       VendStoreClient storeClient)
    : VendDialogOperation(std::move(dialog), std::move(storeClient)) {}

std::shared_ptr<VendQuitAppDialogOperation> VendQuitAppDialogOperation::operationWithAppsToQuit(
    const std::vector<std::shared_ptr<RunningApplication>>& apps, bool allowUserToSkip,
    const std::optional<std::vector<SysupQuaymartUpdate>>& osUpdates, VendStoreClient storeClient) {
  const QuitTexts texts = apps.size() == 1 ? textsForOneApp(*apps.front(), osUpdates, storeClient)
                                           : textsForApps(apps, storeClient);
  PlistDictionary fields{
      {"message", texts.title},
      {"explanation", texts.message},
      {"okButtonString", LedgerLocalizedString("INSTALL_QUIT_APP_BUTTON", &storeClient)},
      {"cancelButtonString", LedgerLocalizedString("INSTALL_QUIT_APP_CANCEL_BUTTON", &storeClient)},
  };
  if (allowUserToSkip) fields["otherButtonString"] = texts.skip;
  return std::make_shared<VendQuitAppDialogOperation>(VendDialog::dialogWithDictionary(fields),
                                                      std::move(storeClient));
}

bool VendQuitAppDialogOperation::didForceFinish() const {
  MutexLock lock(mutex_);
  return didForceFinish_;
}

void VendQuitAppDialogOperation::setDidForceFinish(bool didForceFinish) {
  MutexLock lock(mutex_);
  didForceFinish_ = didForceFinish;
}

void VendQuitAppDialogOperation::forceFinish() {
  setDidForceFinish(true);
  dismissWithExitCode(VendDialog::kNoButtonExitCode);
}

}  // namespace larder
