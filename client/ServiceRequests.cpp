#include "client/ServiceRequests.h"

#include <array>
#include <sstream>
#include <vector>

#include "client/DBusValueCodec.h"

namespace larder {

namespace {

constexpr std::array kRequests = std::to_array<RequestSignature>({
    // Connection control.
    {"setStoreClient:", "SetStoreClient", "a{sv}", "", "storeClient", ""},
    {"startService", "StartService", "", "", "", ""},

    // Installed software.
    {"productForBundleIdentifier:replyBlock:", "ProductForBundleIdentifier", "s", "a{sv}",
     "bundleIdentifier", "product"},
    {"productForItemIdentifier:replyBlock:", "ProductForItemIdentifier", "t", "a{sv}",
     "itemIdentifier", "product"},
    {"allProductsWithReplyBlock:", "AllProducts", "", "aa{sv}", "", "products"},
    {"createSoftwareProductForAppAtPath:replyBlock:", "CreateSoftwareProductForAppAtPath", "s",
     "a{sv}", "path", "product"},
    {"productPathToUpgradeForBundleIdentifier:versionNumberString:replyBlock:",
     "ProductPathToUpgradeForBundleIdentifierVersionNumberString", "ss", "s",
     "bundleIdentifier,versionNumberString", "path"},
    {"bundleInfoFromBundleAtPath:replyBlock:", "BundleInfoFromBundleAtPath", "s", "a{sv}", "path",
     "info"},
    {"iconForApplicationWithBundeID:replyBlock:", "IconForApplicationWithBundeID", "s", "ay",
     "bundleIdentifier", "iconData"},
    {"httpPostBodyWithInstalledApps:bundledApps:conditionally:replyBlock:",
     "HttpPostBodyWithInstalledAppsBundledAppsConditionally", "bbb", "aybb",
     "installedApps,bundledApps,conditionally", "body,compressed,hadBundledApps"},
    {"productAtPath:wasUpdated:toBundleVersion:storeVersion:",
     "ProductAtPathWasUpdatedToBundleVersionStoreVersion", "sbsx", "",
     "path,wasUpdated,bundleVersion,storeVersion", ""},
    {"productAtPath:willBeUpdatedToBundleVersion:storeVersion:",
     "ProductAtPathWillBeUpdatedToBundleVersionStoreVersion", "ssx", "",
     "path,bundleVersion,storeVersion", ""},
    {"addSoftwareMapObserver:reply:", "AddSoftwareMapObserver", "o", "s", "observer", "token"},
    {"removeSoftwareMapObserver:", "RemoveSoftwareMapObserver", "s", "", "token", ""},
    {"shouldAllowAutoPushForBundleID:bundleVersion:replyBlock:",
     "ShouldAllowAutoPushForBundleIDBundleVersion", "ss", "b", "bundleIdentifier,bundleVersion",
     "allow"},
    {"lookupOrvaneIDForApp:replyBlock:", "LookupOrvaneIDForApp", "a{sv}", "s", "product",
     "orvaneID"},

    // Available updates and installs.
    {"availableUpdatesBadgeCountWithReplyBlock:", "AvailableUpdatesBadgeCount", "", "t", "",
     "badgeCount"},
    {"availableUpdatesWithReplyBlock:", "AvailableUpdates", "", "aa{sv}", "", "updates"},
    {"availableUpdateWithItemIdentifier:replyBlock:", "AvailableUpdateWithItemIdentifier", "t",
     "a{sv}", "itemIdentifier", "update"},
    {"incompatibleUpdatesWithReplyBlock:", "IncompatibleUpdates", "", "aa{sv}", "", "updates"},
    {"addAvailableUpdatesObserver:", "AddAvailableUpdatesObserver", "o", "", "observer", ""},
    {"removeAvailableUpdatesObserver:", "RemoveAvailableUpdatesObserver", "o", "", "observer", ""},
    {"startAppUpdates:andOSUpdates:withDelegate:replyBlock:",
     "StartAppUpdatesAndOSUpdatesWithDelegate", "aa{sv}aa{sv}o", "ba{sv}",
     "appUpdates,osUpdates,delegate", "success,error"},
    {"startAppInstallWithTags:fallbackPurchase:reply:", "StartAppInstallWithTagsFallbackPurchase",
     "asa{sv}", "bsa{sv}a{sv}", "tags,fallbackPurchase", "success,path,response,error"},
    {"checkForUpdatesWithUserHasSeenUpdates:replyBlock:", "CheckForUpdatesWithUserHasSeenUpdates",
     "b", "baa{sv}a{sv}", "userHasSeenUpdates", "success,updates,error"},
    {"willStartDownloadForUpdateWithIdentifier:", "WillStartDownloadForUpdateWithIdentifier", "t",
     "", "itemIdentifier", ""},
    {"didFinishDownloadForUpdateWithItemIdentifier:didInstall:",
     "DidFinishDownloadForUpdateWithItemIdentifierDidInstall", "tb", "",
     "itemIdentifier,didInstall", ""},
    {"updatesForTags:replyBlock:", "UpdatesForTags", "as", "aa{sv}", "tags", "updates"},
    {"willInteractivelyPurchaseItemIdentifier:replyBlock:",
     "WillInteractivelyPurchaseItemIdentifier", "t", "b", "itemIdentifier", "proceed"},
    {"didInteractivelyPurchaseItemIdentifier:success:",
     "DidInteractivelyPurchaseItemIdentifierSuccess", "tb", "", "itemIdentifier,success", ""},

    // OS updates.
    {"addOSUpdateProgressObserver:", "AddOSUpdateProgressObserver", "o", "", "observer", ""},
    {"removeOSUpdateProgressObserver:", "RemoveOSUpdateProgressObserver", "o", "", "observer", ""},
    {"cancelOSUpdates:", "CancelOSUpdates", "aa{sv}", "", "osUpdates", ""},
    {"cancelOSUpdatesWithProductKeys:", "CancelOSUpdatesWithProductKeys", "as", "", "productKeys",
     ""},
    {"osUpdateScanInProgressWithReplyBlock:", "OsUpdateScanInProgress", "", "b", "", "inProgress"},
    {"hideOSUpdatesWithProductKeys:withReplyBlock:", "HideOSUpdatesWithProductKeys", "as", "b",
     "productKeys", "success"},
    {"unhideAllOSUpdatesWithReplyBlock:", "UnhideAllOSUpdates", "", "b", "", "success"},
    {"startOSUpdateScanWithForceFullScan:reportProgressImmediately:launchedFromNotification:"
     "userHasSeenAllUpdates:checkForOtherUpdates:",
     "StartOSUpdateScanWithForceFullScanReportProgressImmediatelyLaunchedFromNotificationUserHasSee"
     "nAllUpdatesCheckForOtherUpdates",
     "bbbbb", "",
     "forceFullScan,reportProgressImmediately,launchedFromNotification,userHasSeenAllUpdates,"
     "checkForOtherUpdates",
     ""},
    {"addOSUpdateScanObserver:", "AddOSUpdateScanObserver", "o", "", "observer", ""},
    {"removeOSUpdateScanObserver:", "RemoveOSUpdateScanObserver", "o", "", "observer", ""},
    {"softwareUpdateDidFinishBackgroundScanWithInfo:",
     "SoftwareUpdateDidFinishBackgroundScanWithInfo", "a{sv}", "", "info", ""},

    // Install later, automatic updates, major OS update.
    {"removeUpdateFromInstallLaterWithBundleID:", "RemoveUpdateFromInstallLaterWithBundleID", "s",
     "", "bundleIdentifier", ""},
    {"shouldOfferDoItLaterForAvailableUpdatesWithReplyBlock:",
     "ShouldOfferDoItLaterForAvailableUpdates", "", "b", "", "shouldOffer"},
    {"installAvailableUpdatesLaterWithMode:", "InstallAvailableUpdatesLaterWithMode", "x", "",
     "mode", ""},
    {"appUpdatesToInstallLaterWithReplyBlock:", "AppUpdatesToInstallLater", "", "av", "",
     "updates"},
    {"cancelUpdatesToBeInstalledLater", "CancelUpdatesToBeInstalledLater", "", "", "", ""},
    {"nowIsLaterWithMode:countdownDeferred:", "NowIsLaterWithModeCountdownDeferred", "xb", "",
     "mode,countdownDeferred", ""},
    {"laterDidNotOccurWithDueToACPower:", "LaterDidNotOccurWithDueToACPower", "b", "",
     "dueToACPower", ""},
    {"installedUpdatesJournalWithReplyBlock:", "InstalledUpdatesJournal", "", "aa{sv}", "",
     "journal"},
    {"isAutoUpdateEnabledWithReplyBlock:", "IsAutoUpdateEnabled", "", "b", "", "enabled"},
    {"shouldPromptForAutoUpdateOptInWithReplyBlock:", "ShouldPromptForAutoUpdateOptIn", "", "b", "",
     "shouldPrompt"},
    {"promptUserToOptInForAutoUpdateWithShowNotification:",
     "PromptUserToOptInForAutoUpdateWithShowNotification", "b", "", "showNotification", ""},
    {"updateAutoInfoWithToken:replyBlock:", "UpdateAutoInfoWithToken", "s", "a{sv}", "token",
     "info"},
    {"majorOSUpdateHasDownloadedToPath:replyBlock:", "MajorOSUpdateHasDownloadedToPath", "s", "b",
     "path", "downloaded"},
    {"managedOSInstallWakeUpReceived", "ManagedOSInstallWakeUpReceived", "", "", "", ""},
    {"downloadSetupHeraldForTags:bundleIdentifier:", "DownloadSetupHeraldForTagsBundleIdentifier",
     "ass", "", "tags,bundleIdentifier", ""},
    {"checkSHDownloadStatus:", "CheckSHDownloadStatus", "", "a{sv}", "", "status"},

    // Managed distribution.
    {"showInvite:organizationName:storeClientType:", "ShowInviteOrganizationNameStoreClientType",
     "ssx", "", "inviteURL,organizationName,storeClientType", ""},
    {"redownloadWithItemIdentifier:bundleIdentifier:storeClientType:replyBlock:",
     "RedownloadWithItemIdentifierBundleIdentifierStoreClientType", "xsx", "bxsa{sv}",
     "itemIdentifier,bundleIdentifier,storeClientType", "success,itemIdentifier,path,error"},
    {"processMDMManifestURL:options:storeClientType:replyBlock:",
     "ProcessMDMManifestURLOptionsStoreClientType", "sa{sv}x", "bava{sv}",
     "manifestURL,options,storeClientType", "success,items,error"},
    {"accountLessDownloadWithItemIdentifier:bundleIdentifier:externalVersionIdentifier:options:"
     "replyBlock:",
     "AccountLessDownloadWithItemIdentifierBundleIdentifierExternalVersionIdentifierOptions",
     "tsxa{sv}", "bxsa{sv}", "itemIdentifier,bundleIdentifier,externalVersionIdentifier,options",
     "success,itemIdentifier,path,error"},
    {"accountLessDownloadHeartbeat", "AccountLessDownloadHeartbeat", "", "", "", ""},

    // Books.
    {"countOfBooksWithInfo:replyBlock:", "CountOfBooksWithInfo", "a{sv}", "t", "info", "count"},
    {"sortedBooksWithInfo:replyBlock:", "SortedBooksWithInfo", "a{sv}", "aa{sv}", "info", "books"},
    {"bookAtIndexWithInfo:replyBlock:", "BookAtIndexWithInfo", "a{sv}", "a{sv}", "info", "book"},
    {"bookWithInfo:replyBlock:", "BookWithInfo", "a{sv}", "a{sv}", "info", "book"},
    {"hasSampleWithItemIdentifier:replyBlock:", "HasSampleWithItemIdentifier", "t", "ba{sv}",
     "itemIdentifier", "hasSample,metadata"},
    {"addLibraryObserver:", "AddLibraryObserver", "o", "", "observer", ""},
    {"removeLibraryObserver:", "RemoveLibraryObserver", "o", "", "observer", ""},
    {"pollForPurchasedBooksWithReplyBlock:", "PollForPurchasedBooks", "", "b", "", "polled"},
    {"redownloadBooksWithItemIdentifiers:accountID:", "RedownloadBooksWithItemIdentifiersAccountID",
     "att", "", "itemIdentifiers,accountID", ""},
    {"pollForPurchasedItems:", "PollForPurchasedItems", "b", "", "force", ""},
    {"purchasedItemsWithReplyBlock:", "PurchasedItems", "", "aa{sv}", "", "items"},

});

constexpr std::array kCallbacks = std::to_array<CallbackSignature>({
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

std::span<const RequestSignature> ServiceRequests::all() {
  return kRequests;
}

const RequestSignature* ServiceRequests::find(std::string_view member) {
  for (const RequestSignature& request : kRequests) {
    if (request.member == member) return &request;
  }
  return nullptr;
}

std::span<const CallbackSignature> ServiceRequests::callbacks() {
  return kCallbacks;
}

std::string ServiceRequests::introspectionXml() {
  std::ostringstream xml;
  xml << "<!DOCTYPE node PUBLIC \"-//freedesktop//DTD D-BUS Object Introspection 1.0//EN\"\n"
         " \"http://www.freedesktop.org/standards/dbus/1.0/introspect.dtd\">\n"
      << "<node name=\"" << kObjectPath << "\">\n"
      << "  <interface name=\"" << kInterfaceName << "\">\n";
  for (const RequestSignature& request : kRequests) {
    xml << "    <method name=\"" << request.member << "\">\n";
    writeArguments(xml, request.inSignature, request.inNames, "in");
    writeArguments(xml, request.outSignature, request.outNames, "out");
    xml << "    </method>\n";
  }
  xml << "  </interface>\n";
  for (const CallbackSignature& callback : kCallbacks) {
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
