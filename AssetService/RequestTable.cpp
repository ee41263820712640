#include "AssetService/RequestTable.h"

#include <array>
#include <sstream>

#include "AssetService/AssetServiceInterface.h"
#include "AssetService/DBusValueCodec.h"
#include "AssetService/ServiceError.h"
#include "platform/log/TillLogManager.h"
#include "software-map/SoftwareMap.h"
#include "update-queue/UpdateQueue.h"

namespace larder {

namespace {

using Arguments = PlistArray;
constexpr auto kEmpty = WithoutTarget::kEmptyReply;
constexpr auto kErrorReply = WithoutTarget::kErrorReply;
constexpr auto kNothing = WithoutTarget::kNothing;

void answer(const ReplyHandler& reply, PlistArray outArguments) {
  if (reply) reply(std::move(outArguments));
}

const std::string& text(const Arguments& arguments, std::size_t index) {
  static const std::string kEmptyText;
  const std::string* value = arguments.at(index).string();
  return value ? *value : kEmptyText;
}

// Requests that carry a client type of their own set up the connection's
// store client before anything else; their targets come with later parts
// of the service.
template <std::size_t TypeIndex>
void setStoreClientFromType(AssetServiceInterface& interface, const Arguments& arguments,
                            const ReplyHandler&) {
  interface.setStoreClientFromTypeIfNeeded(arguments.at(TypeIndex).int64Value());
}

// clang-format off
constexpr std::array kRequests = std::to_array<RequestDescriptor>({
  // Connection control.
  {"setStoreClient:", "SetStoreClient", "a{sv}", "", "storeClient", "", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     i.setStoreClient(VendStoreClient::fromDictionary(
         a.at(0).dictionary() ? *a.at(0).dictionary() : PlistDictionary{}));
   }},
  {"startService", "StartService", "", "", "", "", false,
   [](AssetServiceInterface& i, const Arguments&, const ReplyHandler&) { i.startService(); }},

  // Installed software.
  {"productForBundleIdentifier:replyBlock:", "ProductForBundleIdentifier", "s", "a{sv}",
   "bundleIdentifier", "product", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.productForBundleIdentifier(text(a, 0))});
   }},
  {"productForItemIdentifier:replyBlock:", "ProductForItemIdentifier", "t", "a{sv}",
   "itemIdentifier", "product", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.productForItemIdentifier(a.at(0).uint64Value())});
   }},
  {"allProductsWithReplyBlock:", "AllProducts", "", "aa{sv}", "", "products", false,
   [](AssetServiceInterface& i, const Arguments&, const ReplyHandler& r) {
     answer(r, {i.allProducts()});
   }},
  {"createSoftwareProductForAppAtPath:replyBlock:", "CreateSoftwareProductForAppAtPath", "s",
   "a{sv}", "path", "product", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.createSoftwareProductForAppAtPath(text(a, 0))});
   }},
  {"productPathToUpgradeForBundleIdentifier:versionNumberString:replyBlock:",
   "ProductPathToUpgradeForBundleIdentifierVersionNumberString", "ss", "s",
   "bundleIdentifier,versionNumberString", "path", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.softwareMap().productPathToUpgradeForBundleIdentifier(text(a, 0), text(a, 1)).value_or("")});
   }},
  {"bundleInfoFromBundleAtPath:replyBlock:", "BundleInfoFromBundleAtPath", "s", "a{sv}", "path",
   "info", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.bundleInfoFromBundleAtPath(text(a, 0))});
   }},
  {"iconForApplicationWithBundeID:replyBlock:", "IconForApplicationWithBundeID", "s", "ay",
   "bundleIdentifier", "iconData", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.iconForApplicationWithBundeID(text(a, 0))});
   }},
  {"httpPostBodyWithInstalledApps:bundledApps:conditionally:replyBlock:",
   "HttpPostBodyWithInstalledAppsBundledAppsConditionally", "bbb", "aybb",
   "installedApps,bundledApps,conditionally", "body,compressed,hadBundledApps", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     bool compressed = false;
     bool hadBundledApps = false;
     auto body = i.softwareMap().updateRequestBodyData(&compressed, a.at(0).boolValue(), a.at(1).boolValue(),
                                                       a.at(2).boolValue(), &hadBundledApps, true);
     answer(r, {body.value_or(PlistData{}), compressed, hadBundledApps});
   }},
  {"productAtPath:wasUpdated:toBundleVersion:storeVersion:",
   "ProductAtPathWasUpdatedToBundleVersionStoreVersion", "sbsx", "",
   "path,wasUpdated,bundleVersion,storeVersion", "", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     i.softwareMap().productAtPathWasUpdatedToBundleVersionStoreVersion(
         text(a, 0), a.at(1).boolValue(), text(a, 2), a.at(3).int64Value());
   }},
  {"productAtPath:willBeUpdatedToBundleVersion:storeVersion:",
   "ProductAtPathWillBeUpdatedToBundleVersionStoreVersion", "ssx", "",
   "path,bundleVersion,storeVersion", "", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     i.softwareMap().productAtPathWillBeUpdatedToBundleVersionStoreVersion(
         text(a, 0), text(a, 1), a.at(2).int64Value());
   }},
  {"addSoftwareMapObserver:reply:", "AddSoftwareMapObserver", "o", "s", "observer", "token", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.addSoftwareMapObserver(text(a, 0))});
   }},
  {"removeSoftwareMapObserver:", "RemoveSoftwareMapObserver", "s", "", "token", "", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     i.removeSoftwareMapObserver(text(a, 0));
   }},
  {"shouldAllowAutoPushForBundleID:bundleVersion:replyBlock:",
   "ShouldAllowAutoPushForBundleIDBundleVersion", "ss", "b", "bundleIdentifier,bundleVersion",
   "allow", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.softwareMap().shouldAllowAutoPushForBundleID(text(a, 0), text(a, 1))});
   }},
  {"lookupOrvaneIDForApp:replyBlock:", "LookupOrvaneIDForApp", "a{sv}", "s", "product",
   "orvaneID", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.lookupOrvaneIDForApp(a.at(0)).value_or("")});
   }},

  // Available updates and installs.
  {"availableUpdatesBadgeCountWithReplyBlock:", "AvailableUpdatesBadgeCount", "", "t", "",
   "badgeCount", false, nullptr, kEmpty},
  {"availableUpdatesWithReplyBlock:", "AvailableUpdates", "", "aa{sv}", "", "updates", false,
   [](AssetServiceInterface& i, const Arguments&, const ReplyHandler& r) {
     answer(r, {i.availableUpdates()});
   }},
  {"availableUpdateWithItemIdentifier:replyBlock:", "AvailableUpdateWithItemIdentifier", "t",
   "a{sv}", "itemIdentifier", "update", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.availableUpdateWithItemIdentifier(a.at(0).uint64Value())});
   }},
  {"incompatibleUpdatesWithReplyBlock:", "IncompatibleUpdates", "", "aa{sv}", "", "updates",
   false,
   [](AssetServiceInterface& i, const Arguments&, const ReplyHandler& r) {
     answer(r, {i.incompatibleUpdates()});
   }},
  {"addAvailableUpdatesObserver:", "AddAvailableUpdatesObserver", "o", "", "observer", "", false,
   nullptr, kNothing},
  {"removeAvailableUpdatesObserver:", "RemoveAvailableUpdatesObserver", "o", "", "observer", "",
   false, nullptr, kNothing},
  {"startAppUpdates:andOSUpdates:withDelegate:replyBlock:",
   "StartAppUpdatesAndOSUpdatesWithDelegate", "aa{sv}aa{sv}o", "ba{sv}",
   "appUpdates,osUpdates,delegate", "success,error", false, nullptr, kErrorReply},
  {"startAppInstallWithTags:fallbackPurchase:reply:", "StartAppInstallWithTagsFallbackPurchase",
   "asa{sv}", "bsa{sv}a{sv}", "tags,fallbackPurchase", "success,path,response,error", false,
   nullptr, kErrorReply},
  {"checkForUpdatesWithUserHasSeenUpdates:replyBlock:", "CheckForUpdatesWithUserHasSeenUpdates",
   "b", "baa{sv}a{sv}", "userHasSeenUpdates", "success,updates,error", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     i.checkForUpdatesWithUserHasSeenUpdates(a.at(0).boolValue(), r);
   }},
  {"willStartDownloadForUpdateWithIdentifier:", "WillStartDownloadForUpdateWithIdentifier", "t",
   "", "itemIdentifier", "", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     if (auto queue = i.updateQueue()) {
       queue->willStartDownloadForUpdateWithIdentifier(a.at(0).uint64Value());
     }
   }},
  {"didFinishDownloadForUpdateWithItemIdentifier:didInstall:",
   "DidFinishDownloadForUpdateWithItemIdentifierDidInstall", "tb", "",
   "itemIdentifier,didInstall", "", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     if (auto queue = i.updateQueue()) {
       queue->didFinishDownloadForUpdateWithItemIdentifier(a.at(0).uint64Value(),
                                                           a.at(1).boolValue());
     }
   }},
  {"updatesForTags:replyBlock:", "UpdatesForTags", "as", "aa{sv}", "tags", "updates", false,
   nullptr, kErrorReply},
  {"willInteractivelyPurchaseItemIdentifier:replyBlock:", "WillInteractivelyPurchaseItemIdentifier",
   "t", "b", "itemIdentifier", "proceed", false, nullptr, kEmpty},
  {"didInteractivelyPurchaseItemIdentifier:success:", "DidInteractivelyPurchaseItemIdentifierSuccess",
   "tb", "", "itemIdentifier,success", "", false, nullptr, kNothing},

  // OS updates.
  {"addOSUpdateProgressObserver:", "AddOSUpdateProgressObserver", "o", "", "observer", "", false,
   nullptr, kNothing},
  {"removeOSUpdateProgressObserver:", "RemoveOSUpdateProgressObserver", "o", "", "observer", "",
   false, nullptr, kNothing},
  {"cancelOSUpdates:", "CancelOSUpdates", "aa{sv}", "", "osUpdates", "", true, nullptr, kNothing},
  {"cancelOSUpdatesWithProductKeys:", "CancelOSUpdatesWithProductKeys", "as", "", "productKeys",
   "", true, nullptr, kNothing},
  {"osUpdateScanInProgressWithReplyBlock:", "OsUpdateScanInProgress", "", "b", "", "inProgress",
   true, nullptr, kEmpty},
  {"hideOSUpdatesWithProductKeys:withReplyBlock:", "HideOSUpdatesWithProductKeys", "as", "b",
   "productKeys", "success", false, nullptr, kErrorReply},
  {"unhideAllOSUpdatesWithReplyBlock:", "UnhideAllOSUpdates", "", "b", "", "success", false,
   nullptr, kErrorReply},
  {"startOSUpdateScanWithForceFullScan:reportProgressImmediately:launchedFromNotification:"
   "userHasSeenAllUpdates:checkForOtherUpdates:",
   "StartOSUpdateScanWithForceFullScanReportProgressImmediatelyLaunchedFromNotification"
   "UserHasSeenAllUpdatesCheckForOtherUpdates",
   "bbbbb", "",
   "forceFullScan,reportProgressImmediately,launchedFromNotification,userHasSeenAllUpdates,"
   "checkForOtherUpdates",
   "", true, nullptr, kNothing},
  {"addOSUpdateScanObserver:", "AddOSUpdateScanObserver", "o", "", "observer", "", true, nullptr,
   kNothing},
  {"removeOSUpdateScanObserver:", "RemoveOSUpdateScanObserver", "o", "", "observer", "", true,
   nullptr, kNothing},
  {"softwareUpdateDidFinishBackgroundScanWithInfo:", "SoftwareUpdateDidFinishBackgroundScanWithInfo",
   "a{sv}", "", "info", "", false, nullptr, kNothing},

  // Install later, automatic updates, major OS update.
  {"removeUpdateFromInstallLaterWithBundleID:", "RemoveUpdateFromInstallLaterWithBundleID", "s", "",
   "bundleIdentifier", "", false, nullptr, kNothing},
  {"shouldOfferDoItLaterForAvailableUpdatesWithReplyBlock:",
   "ShouldOfferDoItLaterForAvailableUpdates", "", "b", "", "shouldOffer", false, nullptr, kEmpty},
  {"installAvailableUpdatesLaterWithMode:", "InstallAvailableUpdatesLaterWithMode", "x", "", "mode",
   "", false, nullptr, kNothing},
  {"appUpdatesToInstallLaterWithReplyBlock:", "AppUpdatesToInstallLater", "", "av", "", "updates",
   false, nullptr, kEmpty},
  {"cancelUpdatesToBeInstalledLater", "CancelUpdatesToBeInstalledLater", "", "", "", "", false,
   nullptr, kNothing},
  {"nowIsLaterWithMode:countdownDeferred:", "NowIsLaterWithModeCountdownDeferred", "xb", "",
   "mode,countdownDeferred", "", false, nullptr, kNothing},
  {"laterDidNotOccurWithDueToACPower:", "LaterDidNotOccurWithDueToACPower", "b", "",
   "dueToACPower", "", false, nullptr, kNothing},
  {"installedUpdatesJournalWithReplyBlock:", "InstalledUpdatesJournal", "", "aa{sv}", "",
   "journal", false, nullptr, kEmpty},
  {"isAutoUpdateEnabledWithReplyBlock:", "IsAutoUpdateEnabled", "", "b", "", "enabled", false,
   nullptr, kEmpty},
  {"shouldPromptForAutoUpdateOptInWithReplyBlock:", "ShouldPromptForAutoUpdateOptIn", "", "b", "",
   "shouldPrompt", false, nullptr, kEmpty},
  {"promptUserToOptInForAutoUpdateWithShowNotification:",
   "PromptUserToOptInForAutoUpdateWithShowNotification", "b", "", "showNotification", "", false,
   nullptr, kNothing},
  {"updateAutoInfoWithToken:replyBlock:", "UpdateAutoInfoWithToken", "s", "a{sv}", "token", "info",
   false, nullptr, kEmpty},
  {"majorOSUpdateHasDownloadedToPath:replyBlock:", "MajorOSUpdateHasDownloadedToPath", "s", "b",
   "path", "downloaded", false, nullptr, kEmpty},
  {"managedOSInstallWakeUpReceived", "ManagedOSInstallWakeUpReceived", "", "", "", "", false,
   nullptr, kNothing},
  {"downloadSetupHeraldForTags:bundleIdentifier:", "DownloadSetupHeraldForTagsBundleIdentifier",
   "ass", "", "tags,bundleIdentifier", "", false, nullptr, kNothing},
  {"checkSHDownloadStatus:", "CheckSHDownloadStatus", "", "a{sv}", "", "status", false, nullptr,
   kEmpty},

  // Managed distribution.
  {"showInvite:organizationName:storeClientType:", "ShowInviteOrganizationNameStoreClientType",
   "ssx", "", "inviteURL,organizationName,storeClientType", "", false, setStoreClientFromType<2>},
  {"redownloadWithItemIdentifier:bundleIdentifier:storeClientType:replyBlock:",
   "RedownloadWithItemIdentifierBundleIdentifierStoreClientType", "xsx", "bxsa{sv}",
   "itemIdentifier,bundleIdentifier,storeClientType", "success,itemIdentifier,path,error", false,
   setStoreClientFromType<2>, kErrorReply},
  {"processMDMManifestURL:options:storeClientType:replyBlock:",
   "ProcessMDMManifestURLOptionsStoreClientType", "sa{sv}x", "bava{sv}",
   "manifestURL,options,storeClientType", "success,items,error", false,
   setStoreClientFromType<2>, kErrorReply},
  {"accountLessDownloadWithItemIdentifier:bundleIdentifier:externalVersionIdentifier:options:"
   "replyBlock:",
   "AccountLessDownloadWithItemIdentifierBundleIdentifierExternalVersionIdentifierOptions",
   "tsxa{sv}", "bxsa{sv}", "itemIdentifier,bundleIdentifier,externalVersionIdentifier,options",
   "success,itemIdentifier,path,error", false, nullptr, kErrorReply},
  {"accountLessDownloadHeartbeat", "AccountLessDownloadHeartbeat", "", "", "", "", false, nullptr,
   kNothing},

  // Books.
  {"countOfBooksWithInfo:replyBlock:", "CountOfBooksWithInfo", "a{sv}", "t", "info", "count", false,
   nullptr, kEmpty},
  {"sortedBooksWithInfo:replyBlock:", "SortedBooksWithInfo", "a{sv}", "aa{sv}", "info", "books",
   false, nullptr, kEmpty},
  {"bookAtIndexWithInfo:replyBlock:", "BookAtIndexWithInfo", "a{sv}", "a{sv}", "info", "book",
   false, nullptr, kEmpty},
  {"bookWithInfo:replyBlock:", "BookWithInfo", "a{sv}", "a{sv}", "info", "book", false, nullptr,
   kEmpty},
  {"hasSampleWithItemIdentifier:replyBlock:", "HasSampleWithItemIdentifier", "t", "ba{sv}",
   "itemIdentifier", "hasSample,metadata", false, nullptr, kEmpty},
  {"addLibraryObserver:", "AddLibraryObserver", "o", "", "observer", "", false, nullptr, kNothing},
  {"removeLibraryObserver:", "RemoveLibraryObserver", "o", "", "observer", "", false, nullptr,
   kNothing},
  {"pollForPurchasedBooksWithReplyBlock:", "PollForPurchasedBooks", "", "b", "", "polled", false,
   nullptr, kErrorReply},
  {"redownloadBooksWithItemIdentifiers:accountID:", "RedownloadBooksWithItemIdentifiersAccountID",
   "att", "", "itemIdentifiers,accountID", "", false, nullptr, kNothing},
  {"pollForPurchasedItems:", "PollForPurchasedItems", "b", "", "force", "", false, nullptr,
   kNothing},
  {"purchasedItemsWithReplyBlock:", "PurchasedItems", "", "aa{sv}", "", "items", false, nullptr,
   kEmpty},
});
// clang-format on

struct CallbackDescriptor {
  std::string_view interface;
  std::string_view member;
  std::string_view signature;
  std::string_view names;
};

constexpr std::array kCallbacks = std::to_array<CallbackDescriptor>({
    {"VendSoftwareMapObserver", "SoftwareProductUpdatedState", "a{sv}x", "product,state"},
    {"VendAvailableUpdatesObserver", "AvailableUpdatesDidChangedWithUpdatesOsUpdatesBadgeCount",
     "aa{sv}aa{sv}t", "updates,osUpdates,badgeCount"},
    {"VendOSUpdateScanObserver", "OsUpdateScanForTagsDidProgressWithPercentCompleteIsFinishedError",
     "asdba{sv}", "tags,percentComplete,isFinished,error"},
    {"VendOSUpdateProgressObserver", "OsUpdatesChangedProgress", "aa{sv}a{sv}",
     "osUpdates,progress"},
    {"VendUpdateDelegate", "AppUpdateFinishedPurchaseWithSuccessErrorResponse", "a{sv}ba{sv}a{sv}",
     "update,success,error,response"},
    {"VendBookLibraryObserver", "BookLibraryHasAddedChangedRemoved", "aa{sv}aa{sv}aa{sv}",
     "added,changed,removed"},
});

std::vector<std::string_view> splitNames(std::string_view names) {
  std::vector<std::string_view> parts;
  while (!names.empty()) {
    std::size_t comma = names.find(',');
    parts.push_back(names.substr(0, comma));
    if (comma == std::string_view::npos) break;
    names.remove_prefix(comma + 1);
  }
  return parts;
}

void writeArguments(std::ostringstream& xml, std::string_view signature, std::string_view names,
                    std::string_view direction) {
  std::vector<std::string> types = DBusValueCodec::splitSignature(signature);
  std::vector<std::string_view> argumentNames = splitNames(names);
  for (std::size_t i = 0; i < types.size(); ++i) {
    xml << "      <arg name=\"" << (i < argumentNames.size() ? argumentNames[i] : "arg")
        << "\" type=\"" << types[i] << "\"";
    if (!direction.empty()) xml << " direction=\"" << direction << "\"";
    xml << "/>\n";
  }
}

}  // namespace

std::span<const RequestDescriptor> RequestTable::requests() {
  return kRequests;
}

const RequestDescriptor* RequestTable::find(std::string_view member) {
  for (const RequestDescriptor& request : kRequests) {
    if (request.member == member) return &request;
  }
  return nullptr;
}

void RequestTable::perform(const RequestDescriptor& request, AssetServiceInterface& interface,
                           const PlistArray& arguments, const ReplyHandler& reply) {
  if (request.handler) {
    request.handler(interface, arguments, reply);
  } else {
    TILL_LOG(3, "%@: %@ has no target in this build", "AssetServiceInterface", request.selector);
    if (request.withoutTarget == WithoutTarget::kEmptyReply) answer(reply, {});
  }
  // Also after a handler that did the part of the request this build has.
  if (request.withoutTarget == WithoutTarget::kErrorReply && reply) {
    throw ServiceError::notAvailable(request.member);
  }
}

std::string RequestTable::introspectionXml() {
  std::ostringstream xml;
  xml << "<!DOCTYPE node PUBLIC \"-//freedesktop//DTD D-BUS Object Introspection 1.0//EN\"\n"
         " \"http://www.freedesktop.org/standards/dbus/1.0/introspect.dtd\">\n"
      << "<node name=\"" << kObjectPath << "\">\n"
      << "  <interface name=\"" << kInterfaceName << "\">\n";
  for (const RequestDescriptor& request : kRequests) {
    xml << "    <method name=\"" << request.member << "\">\n";
    writeArguments(xml, request.inSignature, request.inNames, "in");
    writeArguments(xml, request.outSignature, request.outNames, "out");
    xml << "    </method>\n";
  }
  xml << "  </interface>\n";
  for (const CallbackDescriptor& callback : kCallbacks) {
    xml << "  <interface name=\"" << kCallbackInterfacePrefix << callback.interface << "\">\n"
        << "    <method name=\"" << callback.member << "\">\n";
    writeArguments(xml, callback.signature, callback.names, "in");
    xml << "      <annotation name=\"org.freedesktop.DBus.Method.NoReply\" value=\"true\"/>\n"
        << "    </method>\n  </interface>\n";
  }
  xml << "</node>\n";
  return xml.str();
}

}  // namespace larder
