#include "AssetService/RequestTable.h"

#include <algorithm>
#include <array>
#include <stdexcept>
#include <vector>

#include "AssetService/AssetServiceInterface.h"
#include "client/ServiceError.h"
#include "platform/log/TillLogManager.h"
#include "software-map/SoftwareMap.h"
#include "update-controller/UpdateController.h"
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

// One value moved into the answer: a braced list would copy it, and a
// journal of 10,000 entries is a deep copy of 2.6 MB.
void answerWith(const ReplyHandler& reply, PlistValue value) {
  PlistArray outArguments;
  outArguments.push_back(std::move(value));
  answer(reply, std::move(outArguments));
}

const std::string& text(const Arguments& arguments, std::size_t index) {
  static const std::string kEmptyText;
  const std::string* value = arguments.at(index).string();
  return value ? *value : kEmptyText;
}

PlistArray wireForms(const std::vector<SysupQuaymartUpdate>& updates) {
  PlistArray wire;
  wire.reserve(updates.size());
  for (const SysupQuaymartUpdate& update : updates) wire.emplace_back(update.toDictionary());
  return wire;
}

PlistArray stringArray(const std::vector<std::string>& strings) {
  return {strings.begin(), strings.end()};
}

PlistArray journalEntries(std::vector<PlistDictionary> entries) {
  return {std::make_move_iterator(entries.begin()), std::make_move_iterator(entries.end())};
}

// A token names a file of the audit cache folder: one that could lead out
// of it is no token the service gave, and answers as an unknown one does.
PlistDictionary auditInfoForToken(const UpdateController& controller, const std::string& token) {
  if (token.empty() || token.find('/') != std::string::npos) return {};
  return controller.cachedUpdateAuditInfoWithKey(token).value_or(PlistDictionary{});
}

std::vector<std::string> texts(const Arguments& arguments, std::size_t index) {
  std::vector<std::string> values;
  if (const PlistArray* array = arguments.at(index).array()) {
    for (const PlistValue& value : *array) {
      if (value.string()) values.push_back(*value.string());
    }
  }
  return values;
}

// The queue's own record of each update the client sent, where it has one:
// the run then works from what the store said, not from the client's copy.
std::vector<LedgerUpdateRef> appUpdates(const AssetServiceInterface& interface,
                                        const Arguments& arguments, std::size_t index) {
  std::vector<LedgerUpdateRef> updates;
  const std::shared_ptr<UpdateQueue> queue = interface.updateQueue();
  if (const PlistArray* array = arguments.at(index).array()) {
    for (const PlistValue& value : *array) {
      if (!value.dictionary()) continue;
      LedgerUpdateRef update = LedgerUpdate::fromDictionary(*value.dictionary());
      if (!update) continue;
      if (queue) {
        if (LedgerUpdateRef queued =
                queue->availableUpdateWithItemIdentifier(update->itemIdentifierValue())) {
          update = std::move(queued);
        }
      }
      updates.push_back(std::move(update));
    }
  }
  return updates;
}

std::vector<SysupQuaymartUpdate> osUpdates(const Arguments& arguments, std::size_t index) {
  std::vector<SysupQuaymartUpdate> updates;
  if (const PlistArray* array = arguments.at(index).array()) {
    for (const PlistValue& value : *array) {
      if (!value.dictionary()) continue;
      if (auto update = SysupQuaymartUpdate::fromDictionary(*value.dictionary())) {
        updates.push_back(std::move(*update));
      }
    }
  }
  return updates;
}

PlistDictionary wireForm(const OptionalError& error) {
  return error ? error->toDictionary() : PlistDictionary{};
}

// Runs `work` with the update controller of the connection's client. Without
// a client there is none: a caller that waits for a reply hears why.
template <typename Work>
void withController(AssetServiceInterface& interface, std::string_view member,
                    const ReplyHandler& reply, Work&& work) {
  std::shared_ptr<UpdateController> controller = interface.updateController();
  if (!controller) {
    if (reply) throw ServiceError::noStoreClient(member);
    return;
  }
  work(*controller);
}

// The checks in front of the start may hold the connection's queue for as
// long as the user takes over a dialog. The reply keeps the client's
// delegate alive until the run has ended and told it everything.
void startAppUpdates(AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
  withController(i, "StartAppUpdatesAndOSUpdatesWithDelegate", r, [&](UpdateController& c) {
    std::shared_ptr<VendUpdateDelegate> delegate = i.updateDelegate(text(a, 2));
    c.startAppUpdates(appUpdates(i, a, 0), osUpdates(a, 1), delegate,
                      [r, delegate](bool success, const OptionalError& error) {
                        answer(r, {success, wireForm(error)});
                      });
  });
}

// An empty purchase dictionary is no fallback.
void startAppInstallWithTags(AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
  withController(i, "StartAppInstallWithTagsFallbackPurchase", r, [&](UpdateController& c) {
    std::optional<TillPurchase> fallback;
    if (const PlistDictionary* fields = a.at(1).dictionary(); fields && !fields->empty()) {
      fallback = TillPurchase::fromDictionary(*fields);
    }
    c.startAppInstallWithTags(
        texts(a, 0), std::move(fallback),
        [r](bool success, const std::optional<std::string>& identifier,
            const std::optional<TillPurchaseResponse>& response, const OptionalError& error) {
          answer(r, {success, identifier.value_or(""),
                     response ? response->toDictionary() : PlistDictionary{}, wireForm(error)});
        });
  });
}

// A request answered by the controller with one value.
#define CONTROLLER_REPLY(member, expression)                                                  \
  [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {                   \
    (void)a;                                                                                  \
    withController(i, member, r,                                                              \
                   [&]([[maybe_unused]] UpdateController& c) { answerWith(r, expression); }); \
  }
// A request the controller carries out without a reply.
#define CONTROLLER_CALL(member, statement)                                  \
  [](AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) { \
    (void)a;                                                                \
    withController(i, member, r, [&](UpdateController& c) { statement; });  \
  }

// The wire has no absent values: tags that are not an array and an empty
// bundle identifier stand for the missing parameters.
void downloadSetupHerald(AssetServiceInterface& i, const Arguments& a, const ReplyHandler& r) {
  withController(i, "DownloadSetupHeraldForTagsBundleIdentifier", r, [&](UpdateController& c) {
    std::optional<std::vector<std::string>> tags;
    if (a.at(0).array()) tags = texts(a, 0);
    std::optional<std::string> bundleIdentifier;
    if (!text(a, 1).empty()) bundleIdentifier = text(a, 1);
    c.downloadSetupHeraldForTags(tags, bundleIdentifier);
  });
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
  {"AvailableUpdatesBadgeCount", false,
   [](AssetServiceInterface& i, const Arguments&, const ReplyHandler& r) {
     // A book client's badge counts book updates, which come with the book library.
     if (i.isBookClient()) {
       if (r) throw ServiceError::notAvailable("AvailableUpdatesBadgeCount");
       return;
     }
     withController(i, "AvailableUpdatesBadgeCount", r,
                    [&](UpdateController& c) { answer(r, {c.availableUpdatesBadgeCount()}); });
   }},
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
   CONTROLLER_CALL("AddAvailableUpdatesObserver", c.addAvailableUpdatesObserver(i.availableUpdatesObserver(text(a, 0))))},
  {"RemoveAvailableUpdatesObserver", false,
   CONTROLLER_CALL("RemoveAvailableUpdatesObserver", c.removeAvailableUpdatesObserver(i.availableUpdatesObserver(text(a, 0))))},
  {"StartAppUpdatesAndOSUpdatesWithDelegate", false, startAppUpdates},
  {"StartAppInstallWithTagsFallbackPurchase", false, startAppInstallWithTags},
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
   CONTROLLER_CALL("UpdatesForTags", c.updatesForTags(texts(a, 0), [r](const std::vector<SysupQuaymartUpdate>& updates) { answer(r, {wireForms(updates)}); }))},
  {"WillInteractivelyPurchaseItemIdentifier", false,
   CONTROLLER_REPLY("WillInteractivelyPurchaseItemIdentifier", c.willInteractivelyPurchaseItemIdentifier(a.at(0).uint64Value()))},
  {"DidInteractivelyPurchaseItemIdentifierSuccess", false,
   CONTROLLER_CALL("DidInteractivelyPurchaseItemIdentifierSuccess", c.didInteractivelyPurchaseItemIdentifier(a.at(0).uint64Value(), a.at(1).boolValue()))},

  // OS updates.
  {"AddOSUpdateProgressObserver", false,
   CONTROLLER_CALL("AddOSUpdateProgressObserver", c.addOSUpdateProgressObserver(i.osUpdateProgressObserver(text(a, 0))))},
  {"RemoveOSUpdateProgressObserver", false,
   CONTROLLER_CALL("RemoveOSUpdateProgressObserver", c.removeOSUpdateProgressObserver(i.osUpdateProgressObserver(text(a, 0))))},
  {"CancelOSUpdates", true,
   CONTROLLER_CALL("CancelOSUpdates", c.cancelOSUpdates(osUpdates(a, 0)))},
  {"CancelOSUpdatesWithProductKeys", true,
   CONTROLLER_CALL("CancelOSUpdatesWithProductKeys", c.cancelOSUpdatesWithProductKeys(texts(a, 0)))},
  {"OsUpdateScanInProgress", true,
   CONTROLLER_REPLY("OsUpdateScanInProgress", c.osUpdateScanInProgress())},
  {"HideOSUpdatesWithProductKeys", false,
   CONTROLLER_CALL("HideOSUpdatesWithProductKeys", c.hideOSUpdatesWithProductKeys(texts(a, 0), [r](bool success) { answer(r, {success}); }))},
  {"UnhideAllOSUpdates", false,
   CONTROLLER_CALL("UnhideAllOSUpdates", c.unhideAllOSUpdates([r](bool success) { answer(r, {success}); }))},
  {"StartOSUpdateScanWithForceFullScanReportProgressImmediatelyLaunchedFromNotificationUserHasSeenAllUpdatesCheckForOtherUpdates", true,
   CONTROLLER_CALL("StartOSUpdateScan", c.startOSUpdateScanWithForceFullScan(a.at(0).boolValue(), a.at(1).boolValue(), a.at(2).boolValue(), a.at(3).boolValue(), a.at(4).boolValue()))},
  {"AddOSUpdateScanObserver", true,
   CONTROLLER_CALL("AddOSUpdateScanObserver", c.addOSUpdateScanObserver(i.osUpdateScanObserver(text(a, 0))))},
  {"RemoveOSUpdateScanObserver", true,
   CONTROLLER_CALL("RemoveOSUpdateScanObserver", c.removeOSUpdateScanObserver(i.osUpdateScanObserver(text(a, 0))))},
  {"SoftwareUpdateDidFinishBackgroundScanWithInfo", false,
   CONTROLLER_CALL("SoftwareUpdateDidFinishBackgroundScanWithInfo", c.softwareUpdateDidFinishBackgroundScanWithInfo(a.at(0).dictionary() ? *a.at(0).dictionary() : PlistDictionary{}))},

  // Install later, automatic updates, major OS update.
  {"RemoveUpdateFromInstallLaterWithBundleID", false,
   CONTROLLER_CALL("RemoveUpdateFromInstallLaterWithBundleID", c.removeUpdateFromInstallLaterWithBundleID(text(a, 0)))},
  {"ShouldOfferDoItLaterForAvailableUpdates", false,
   CONTROLLER_REPLY("ShouldOfferDoItLaterForAvailableUpdates", c.shouldOfferDoItLaterForAvailableUpdates())},
  {"InstallAvailableUpdatesLaterWithMode", false,
   CONTROLLER_CALL("InstallAvailableUpdatesLaterWithMode", c.installAvailableUpdatesLaterWithMode(a.at(0).int64Value()))},
  {"AppUpdatesToInstallLater", false,
   CONTROLLER_REPLY("AppUpdatesToInstallLater", stringArray(c.appUpdatesToInstallLater()))},
  {"CancelUpdatesToBeInstalledLater", false,
   CONTROLLER_CALL("CancelUpdatesToBeInstalledLater", c.cancelUpdatesToBeInstalledLater())},
  {"NowIsLaterWithModeCountdownDeferred", false,
   CONTROLLER_CALL("NowIsLaterWithModeCountdownDeferred", c.nowIsLaterWithMode(a.at(0).int64Value(), a.at(1).boolValue()))},
  {"LaterDidNotOccurWithDueToACPower", false,
   CONTROLLER_CALL("LaterDidNotOccurWithDueToACPower", c.laterDidNotOccurWithDueToACPower(a.at(0).boolValue()))},
  {"InstalledUpdatesJournal", false,
   CONTROLLER_REPLY("InstalledUpdatesJournal", journalEntries(c.installedUpdatesJournal()))},
  {"IsAutoUpdateEnabled", false,
   CONTROLLER_REPLY("IsAutoUpdateEnabled", UpdateController::isAutoUpdatedEnabled())},
  {"ShouldPromptForAutoUpdateOptIn", false,
   CONTROLLER_REPLY("ShouldPromptForAutoUpdateOptIn", UpdateController::shouldPromptForAutoUpdateOptIn())},
  {"PromptUserToOptInForAutoUpdateWithShowNotification", false,
   CONTROLLER_CALL("PromptUserToOptInForAutoUpdateWithShowNotification", c.promptUserToOptInForAutoUpdateWithShowNotification(a.at(0).boolValue()))},
  {"UpdateAutoInfoWithToken", false,
   CONTROLLER_REPLY("UpdateAutoInfoWithToken", auditInfoForToken(c, text(a, 0)))},
  {"MajorOSUpdateHasDownloadedToPath", false,
   CONTROLLER_REPLY("MajorOSUpdateHasDownloadedToPath", c.majorOSUpdateHasDownloadedToPath(text(a, 0)))},
  {"ManagedOSInstallWakeUpReceived", false,
   CONTROLLER_CALL("ManagedOSInstallWakeUpReceived", c.managedOSInstallWakeUpReceived())},
  {"DownloadSetupHeraldForTagsBundleIdentifier", false, downloadSetupHerald},
  {"CheckSHDownloadStatus", false,
   CONTROLLER_REPLY("CheckSHDownloadStatus", c.statusForSetupHeraldDownload())},

  // Managed distribution.
  {"ShowInviteOrganizationNameStoreClientType", false, setStoreClientFromType<2>},
  {"RedownloadWithItemIdentifierBundleIdentifierStoreClientType", false,
   setStoreClientFromType<2>, kErrorReply},
  {"ProcessMDMManifestURLOptionsStoreClientType", false,
   setStoreClientFromType<2>, kErrorReply},
  {"AccountLessDownloadWithItemIdentifierBundleIdentifierExternalVersionIdentifierOptions", false, nullptr, kErrorReply},
  {"AccountLessDownloadHeartbeat", false,
   CONTROLLER_CALL("AccountLessDownloadHeartbeat", c.daemonDownloadHeartbeat())},

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

#undef CONTROLLER_REPLY
#undef CONTROLLER_CALL

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
