#include "AssetService/RequestTable.h"

#include <algorithm>
#include <array>
#include <stdexcept>
#include <vector>

#include "AssetService/AssetServiceInterface.h"
#include "client/ServiceError.h"
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
constexpr std::array kHandling = std::to_array<RequestHandling>({
  // Connection control.
  {"SetStoreClient", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     i.setStoreClient(VendStoreClient::fromDictionary(
         a.at(0).dictionary() ? *a.at(0).dictionary() : PlistDictionary{}));
   }},
  {"StartService", false,
   [](AssetServiceInterface& i, const Arguments&, const ReplyHandler&) { i.startService(); }},

  // Installed software.
  {"ProductForBundleIdentifier", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.productForBundleIdentifier(text(a, 0))});
   }},
  {"ProductForItemIdentifier", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.productForItemIdentifier(a.at(0).uint64Value())});
   }},
  {"AllProducts", false,
   [](AssetServiceInterface& i, const Arguments&, const ReplyHandler& r) {
     answer(r, {i.allProducts()});
   }},
  {"CreateSoftwareProductForAppAtPath", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.createSoftwareProductForAppAtPath(text(a, 0))});
   }},
  {"ProductPathToUpgradeForBundleIdentifierVersionNumberString", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.softwareMap().productPathToUpgradeForBundleIdentifier(text(a, 0), text(a, 1)).value_or("")});
   }},
  {"BundleInfoFromBundleAtPath", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.bundleInfoFromBundleAtPath(text(a, 0))});
   }},
  {"IconForApplicationWithBundeID", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.iconForApplicationWithBundeID(text(a, 0))});
   }},
  {"HttpPostBodyWithInstalledAppsBundledAppsConditionally", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     bool compressed = false;
     bool hadBundledApps = false;
     auto body = i.softwareMap().updateRequestBodyData(&compressed, a.at(0).boolValue(), a.at(1).boolValue(),
                                                       a.at(2).boolValue(), &hadBundledApps, true);
     answer(r, {body.value_or(PlistData{}), compressed, hadBundledApps});
   }},
  {"ProductAtPathWasUpdatedToBundleVersionStoreVersion", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     i.softwareMap().productAtPathWasUpdatedToBundleVersionStoreVersion(
         text(a, 0), a.at(1).boolValue(), text(a, 2), a.at(3).int64Value());
   }},
  {"ProductAtPathWillBeUpdatedToBundleVersionStoreVersion", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     i.softwareMap().productAtPathWillBeUpdatedToBundleVersionStoreVersion(
         text(a, 0), text(a, 1), a.at(2).int64Value());
   }},
  {"AddSoftwareMapObserver", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.addSoftwareMapObserver(text(a, 0))});
   }},
  {"RemoveSoftwareMapObserver", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     i.removeSoftwareMapObserver(text(a, 0));
   }},
  {"ShouldAllowAutoPushForBundleIDBundleVersion", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.softwareMap().shouldAllowAutoPushForBundleID(text(a, 0), text(a, 1))});
   }},
  {"LookupOrvaneIDForApp", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.lookupOrvaneIDForApp(a.at(0)).value_or("")});
   }},

  // Available updates and installs.
  {"AvailableUpdatesBadgeCount", false, nullptr, kEmpty},
  {"AvailableUpdates", false,
   [](AssetServiceInterface& i, const Arguments&, const ReplyHandler& r) {
     answer(r, {i.availableUpdates()});
   }},
  {"AvailableUpdateWithItemIdentifier", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     answer(r, {i.availableUpdateWithItemIdentifier(a.at(0).uint64Value())});
   }},
  {"IncompatibleUpdates", false,
   [](AssetServiceInterface& i, const Arguments&, const ReplyHandler& r) {
     answer(r, {i.incompatibleUpdates()});
   }},
  {"AddAvailableUpdatesObserver", false,
   nullptr, kNothing},
  {"RemoveAvailableUpdatesObserver", false, nullptr, kNothing},
  {"StartAppUpdatesAndOSUpdatesWithDelegate", false, nullptr, kErrorReply},
  {"StartAppInstallWithTagsFallbackPurchase", false,
   nullptr, kErrorReply},
  {"CheckForUpdatesWithUserHasSeenUpdates", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
     i.checkForUpdatesWithUserHasSeenUpdates(a.at(0).boolValue(), r);
   }},
  {"WillStartDownloadForUpdateWithIdentifier", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     if (auto queue = i.updateQueue()) {
       queue->willStartDownloadForUpdateWithIdentifier(a.at(0).uint64Value());
     }
   }},
  {"DidFinishDownloadForUpdateWithItemIdentifierDidInstall", false,
   [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler&) {
     if (auto queue = i.updateQueue()) {
       queue->didFinishDownloadForUpdateWithItemIdentifier(a.at(0).uint64Value(),
                                                           a.at(1).boolValue());
     }
   }},
  {"UpdatesForTags", false,
   nullptr, kErrorReply},
  {"WillInteractivelyPurchaseItemIdentifier", false, nullptr, kEmpty},
  {"DidInteractivelyPurchaseItemIdentifierSuccess", false, nullptr, kNothing},

  // OS updates.
  {"AddOSUpdateProgressObserver", false,
   nullptr, kNothing},
  {"RemoveOSUpdateProgressObserver", false, nullptr, kNothing},
  {"CancelOSUpdates", true, nullptr, kNothing},
  {"CancelOSUpdatesWithProductKeys", true, nullptr, kNothing},
  {"OsUpdateScanInProgress", true, nullptr, kEmpty},
  {"HideOSUpdatesWithProductKeys", false, nullptr, kErrorReply},
  {"UnhideAllOSUpdates", false,
   nullptr, kErrorReply},
  {"StartOSUpdateScanWithForceFullScanReportProgressImmediatelyLaunchedFromNotificationUserHasSeenAllUpdatesCheckForOtherUpdates", true, nullptr, kNothing},
  {"AddOSUpdateScanObserver", true, nullptr,
   kNothing},
  {"RemoveOSUpdateScanObserver", true,
   nullptr, kNothing},
  {"SoftwareUpdateDidFinishBackgroundScanWithInfo", false, nullptr, kNothing},

  // Install later, automatic updates, major OS update.
  {"RemoveUpdateFromInstallLaterWithBundleID", false, nullptr, kNothing},
  {"ShouldOfferDoItLaterForAvailableUpdates", false, nullptr, kEmpty},
  {"InstallAvailableUpdatesLaterWithMode", false, nullptr, kNothing},
  {"AppUpdatesToInstallLater", false, nullptr, kEmpty},
  {"CancelUpdatesToBeInstalledLater", false,
   nullptr, kNothing},
  {"NowIsLaterWithModeCountdownDeferred", false, nullptr, kNothing},
  {"LaterDidNotOccurWithDueToACPower", false, nullptr, kNothing},
  {"InstalledUpdatesJournal", false, nullptr, kEmpty},
  {"IsAutoUpdateEnabled", false,
   nullptr, kEmpty},
  {"ShouldPromptForAutoUpdateOptIn", false, nullptr, kEmpty},
  {"PromptUserToOptInForAutoUpdateWithShowNotification", false,
   nullptr, kNothing},
  {"UpdateAutoInfoWithToken", false, nullptr, kEmpty},
  {"MajorOSUpdateHasDownloadedToPath", false, nullptr, kEmpty},
  {"ManagedOSInstallWakeUpReceived", false,
   nullptr, kNothing},
  {"DownloadSetupHeraldForTagsBundleIdentifier", false, nullptr, kNothing},
  {"CheckSHDownloadStatus", false, nullptr,
   kEmpty},

  // Managed distribution.
  {"ShowInviteOrganizationNameStoreClientType", false, setStoreClientFromType<2>},
  {"RedownloadWithItemIdentifierBundleIdentifierStoreClientType", false,
   setStoreClientFromType<2>, kErrorReply},
  {"ProcessMDMManifestURLOptionsStoreClientType", false,
   setStoreClientFromType<2>, kErrorReply},
  {"AccountLessDownloadWithItemIdentifierBundleIdentifierExternalVersionIdentifierOptions", false, nullptr, kErrorReply},
  {"AccountLessDownloadHeartbeat", false, nullptr,
   kNothing},

  // Books.
  {"CountOfBooksWithInfo", false,
   nullptr, kEmpty},
  {"SortedBooksWithInfo", false, nullptr, kEmpty},
  {"BookAtIndexWithInfo", false, nullptr, kEmpty},
  {"BookWithInfo", false, nullptr,
   kEmpty},
  {"HasSampleWithItemIdentifier", false, nullptr, kEmpty},
  {"AddLibraryObserver", false, nullptr, kNothing},
  {"RemoveLibraryObserver", false, nullptr,
   kNothing},
  {"PollForPurchasedBooks", false,
   nullptr, kErrorReply},
  {"RedownloadBooksWithItemIdentifiersAccountID", false, nullptr, kNothing},
  {"PollForPurchasedItems", false, nullptr,
   kNothing},
  {"PurchasedItems", false, nullptr,
   kEmpty},

});
// clang-format on

// Joins the two tables once; a request without handling, or handling of a
// request clients do not know, is a fault of this file, found at start.
std::vector<RequestDescriptor> joinRequests() {
  std::vector<RequestDescriptor> joined;
  for (const RequestSignature& signature : ServiceRequests::all()) {
    const auto* handling = std::ranges::find(kHandling, signature.member, &RequestHandling::member);
    if (handling == kHandling.end()) {
      throw std::logic_error("no handling for request " + std::string(signature.member));
    }
    joined.push_back({signature, handling->direct, handling->handler, handling->withoutTarget});
  }
  if (joined.size() != kHandling.size()) {
    throw std::logic_error("handling for a request clients do not know");
  }
  return joined;
}

}  // namespace

std::span<const RequestDescriptor> RequestTable::requests() {
  static const std::vector<RequestDescriptor> table = joinRequests();
  return table;
}

const RequestDescriptor* RequestTable::find(std::string_view member) {
  for (const RequestDescriptor& request : requests()) {
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

}  // namespace larder
