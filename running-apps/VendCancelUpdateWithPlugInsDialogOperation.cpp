#include "running-apps/VendCancelUpdateWithPlugInsDialogOperation.h"

#include "platform/log/TillLogManager.h"
#include "running-apps/PlugInHost.h"
#include "running-apps/RunningApplication.h"
#include "store-runtime/dialogs/LedgerLocalizedString.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "VendCancelUpdateWithPlugInsDialogOperation";

// The application to update: every entry names a plug-in of the same
// bundle, so the first says which.
std::string nameOfContainingApp(const PlistDictionary& plugInInfo) {
  const PlistValue info(plugInInfo);
  if (const std::string* path = info[PlugInHost::kContainingPathKey].string()) {
    return RunningApplication::displayNameOfBundle(*path);
  }
  TILL_LOG(1, "%@: No containing path in %@", kSpeaker, info);
  const std::string* identifier = info[PlugInHost::kContainingIdentifierKey].string();
  return identifier ? *identifier : std::string();
}

}  // namespace

std::shared_ptr<VendDialogOperation>
VendCancelUpdateWithPlugInsDialogOperation::operationWithDictionary(const PlugInHostApps& hosts,
                                                                    VendStoreClient storeClient) {
  if (hosts.empty()) return nullptr;
  const std::string appName = nameOfContainingApp(hosts.begin()->second);
  std::string body;
  if (hosts.size() == 1) {
    body = LedgerLocalizedStringWithArguments("CANNOT_UPDATE_BODY", &storeClient,
                                              {appName, hosts.begin()->first});
  } else {
    std::string list = "<br><br><ul>";
    for (const auto& [hostName, info] : hosts) list += "<li>" + hostName + "</li>";
    list += "</ul>";
    body =
        LedgerLocalizedStringWithArguments("CANNOT_UPDATE_BODY_MULTIPLE", &storeClient, {appName}) +
        " " + list;
  }
  const PlistDictionary fields{
      {"message",
       LedgerLocalizedStringWithArguments("CANNOT_UPDATE_TITLE", &storeClient, {appName})},
      {"explanation", body},
      {"okButtonString", LedgerLocalizedString("CANNOT_UPDATE_DEFAULT_BUTTON", &storeClient)},
  };
  TILL_LOG(2, "%@: %@ cannot be updated while %@ host application(s) use its plug-ins", kSpeaker,
           appName, hosts.size());
  return std::make_shared<VendCancelUpdateWithPlugInsDialogOperation>(
      VendDialog::dialogWithDictionary(fields), std::move(storeClient));
}

}  // namespace larder
