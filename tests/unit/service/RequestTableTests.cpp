// The service's request table and the per-connection object its requests
// run against.
#include <gtest/gtest.h>

#include <array>
#include <fstream>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "AssetService/AssetServiceInterface.h"
#include "AssetService/RequestTable.h"
#include "ServiceTestSupport.h"
#include "client/DBusValueCodec.h"
#include "client/ServiceError.h"

#ifndef LARDER_SOURCE_DIR
#error "the service tests read committed files of the source tree: define LARDER_SOURCE_DIR"
#endif

namespace larder::testing {
namespace {

TEST(RequestTable, MembersAreUniqueFoundByNameAndTheirArgumentsNamed) {
  std::set<std::string_view> members;
  for (const RequestDescriptor& request : RequestTable::requests()) {
    EXPECT_TRUE(members.insert(request.member).second) << "member twice: " << request.member;
    EXPECT_EQ(RequestTable::find(request.member), &request) << request.member;
    for (const auto& [signature, names] : {std::pair{request.inSignature, request.inNames},
                                           std::pair{request.outSignature, request.outNames}}) {
      std::vector<std::string> split;
      EXPECT_NO_THROW(split = DBusValueCodec::splitSignature(signature)) << request.member;
      const auto commas = static_cast<std::size_t>(std::count(names.begin(), names.end(), ','));
      EXPECT_EQ(names.empty() ? 0 : commas + 1, split.size()) << request.member << " " << names;
    }
    if (request.withoutTarget == WithoutTarget::kEmptyReply) {
      EXPECT_FALSE(request.outSignature.empty()) << request.member << " has no reply to empty";
    }
  }
  EXPECT_EQ(RequestTable::find("NoSuchMember"), nullptr);
  EXPECT_EQ(RequestTable::find("productForBundleIdentifier:replyBlock:"), nullptr)
      << "lookups are by member, not selector";
}

// The words of `text`, split at spaces.
std::vector<std::string_view> words(std::string_view text) {
  std::vector<std::string_view> result;
  for (std::size_t at = 0; at < text.size();) {
    std::size_t end = std::min(text.find(' ', at), text.size());
    if (end > at) result.push_back(text.substr(at, end - at));
    at = end + 1;
  }
  return result;
}

// The service's requests by what they do when this build has no target for
// them, written out here rather than taken from the table under test.
constexpr std::string_view kHandledRequests =
    "SetStoreClient StartService ProductForBundleIdentifier ProductForItemIdentifier "
    "AllProducts CreateSoftwareProductForAppAtPath "
    "ProductPathToUpgradeForBundleIdentifierVersionNumberString BundleInfoFromBundleAtPath "
    "IconForApplicationWithBundeID HttpPostBodyWithInstalledAppsBundledAppsConditionally "
    "ProductAtPathWasUpdatedToBundleVersionStoreVersion "
    "ProductAtPathWillBeUpdatedToBundleVersionStoreVersion AddSoftwareMapObserver "
    "RemoveSoftwareMapObserver ShouldAllowAutoPushForBundleIDBundleVersion "
    "LookupOrvaneIDForApp AvailableUpdates AvailableUpdateWithItemIdentifier "
    "IncompatibleUpdates CheckForUpdatesWithUserHasSeenUpdates "
    "WillStartDownloadForUpdateWithIdentifier "
    "DidFinishDownloadForUpdateWithItemIdentifierDidInstall "
    "ShowInviteOrganizationNameStoreClientType AvailableUpdatesBadgeCount "
    "OsUpdateScanInProgress ShouldOfferDoItLaterForAvailableUpdates IsAutoUpdateEnabled "
    "ShouldPromptForAutoUpdateOptIn UpdatesForTags HideOSUpdatesWithProductKeys "
    "UnhideAllOSUpdates AddAvailableUpdatesObserver RemoveAvailableUpdatesObserver "
    "AddOSUpdateProgressObserver RemoveOSUpdateProgressObserver "
    "StartOSUpdateScanWithForceFullScanReportProgressImmediatelyLaunchedFromNotificationU"
    "serHasSeenAllUpdatesCheckForOtherUpdates "
    "AddOSUpdateScanObserver RemoveOSUpdateScanObserver "
    "SoftwareUpdateDidFinishBackgroundScanWithInfo "
    "PromptUserToOptInForAutoUpdateWithShowNotification "
    "StartAppUpdatesAndOSUpdatesWithDelegate StartAppInstallWithTagsFallbackPurchase "
    "CancelOSUpdates CancelOSUpdatesWithProductKeys AppUpdatesToInstallLater "
    "RemoveUpdateFromInstallLaterWithBundleID InstallAvailableUpdatesLaterWithMode "
    "CancelUpdatesToBeInstalledLater NowIsLaterWithModeCountdownDeferred "
    "LaterDidNotOccurWithDueToACPower InstalledUpdatesJournal UpdateAutoInfoWithToken "
    "WillInteractivelyPurchaseItemIdentifier DidInteractivelyPurchaseItemIdentifierSuccess "
    "MajorOSUpdateHasDownloadedToPath ManagedOSInstallWakeUpReceived "
    "DownloadSetupHeraldForTagsBundleIdentifier CheckSHDownloadStatus "
    "AccountLessDownloadHeartbeat";
constexpr std::string_view kEmptyReplyRequests =
    "CountOfBooksWithInfo SortedBooksWithInfo BookAtIndexWithInfo "
    "BookWithInfo HasSampleWithItemIdentifier PurchasedItems";
// Some of these have a handler for the part this build has (the client type).
constexpr std::string_view kRefusedRequests =
    "RedownloadWithItemIdentifierBundleIdentifierStoreClientType "
    "ProcessMDMManifestURLOptionsStoreClientType "
    "AccountLessDownloadWithItemIdentifierBundleIdentifierExternalVersionIdentifierOptions "
    "PollForPurchasedBooks";
constexpr std::string_view kSilentRequests =
    "AddLibraryObserver RemoveLibraryObserver "
    "RedownloadBooksWithItemIdentifiersAccountID PollForPurchasedItems";

std::set<std::string_view> allRequestNames() {
  std::set<std::string_view> names;
  for (std::string_view list :
       {kHandledRequests, kEmptyReplyRequests, kRefusedRequests, kSilentRequests}) {
    for (std::string_view name : words(list))
      EXPECT_TRUE(names.insert(name).second) << name << " listed twice";
  }
  return names;
}

std::string committedInterfaceFile() {
  const std::string path =
      std::string(LARDER_SOURCE_DIR) + "/data/dbus/com.orvane.larderd.AssetService.xml";
  std::ifstream file(path);
  EXPECT_TRUE(file) << path << " is missing";
  std::stringstream text;
  text << file.rdbuf();
  return text.str();
}

// The value of `attribute` in the XML element that starts on `line`.
std::string attributeOf(const std::string& line, const std::string& attribute) {
  std::size_t at = line.find(' ' + attribute + "=\"");
  if (at == std::string::npos) return "";
  at += attribute.size() + 3;
  return line.substr(at, line.find('"', at) - at);
}

// A method as "in types (in names) -> out types (out names)".
std::string methodText(std::string_view inTypes, std::string_view inNames,
                       std::string_view outTypes, std::string_view outNames) {
  return std::string(inTypes) + " (" + std::string(inNames) + ") -> " + std::string(outTypes) +
         " (" + std::string(outNames) + ")";
}

// The methods of the service interface as the committed file declares them.
std::map<std::string, std::string> committedServiceMethods(const std::string& xml) {
  std::map<std::string, std::array<std::string, 4>> methods;  // types and names, in and out
  std::stringstream lines(xml);
  bool inService = false;
  std::array<std::string, 4>* method = nullptr;
  for (std::string line; std::getline(lines, line);) {
    if (line.find("<interface ") != std::string::npos) {
      inService = attributeOf(line, "name") == ServiceRequests::kInterfaceName;
    } else if (inService && line.find("<method ") != std::string::npos) {
      const std::string name = attributeOf(line, "name");
      EXPECT_FALSE(methods.contains(name)) << name << " declared twice";
      method = &methods[name];
    } else if (inService && method && line.find("<arg ") != std::string::npos) {
      const std::size_t out = attributeOf(line, "direction") == "in" ? 0 : 2;
      (*method)[out] += attributeOf(line, "type");
      std::string& names = (*method)[out + 1];
      names += (names.empty() ? "" : ",") + attributeOf(line, "name");
    }
  }
  std::map<std::string, std::string> texts;
  for (const auto& [name, m] : methods) texts[name] = methodText(m[0], m[1], m[2], m[3]);
  return texts;
}

TEST(RequestTable, IntrospectionMatchesTheCommittedInterfaceFile) {
  const std::string committed = committedInterfaceFile();
  EXPECT_EQ(ServiceRequests::introspectionXml(), committed)
      << "regenerate data/dbus from the table";

  // The committed file is the contract clients build against: it declares
  // the listed requests, and the table serves each as declared.
  const std::map<std::string, std::string> declared = committedServiceMethods(committed);
  std::set<std::string_view> names;
  for (const auto& [name, method] : declared) names.insert(name);
  EXPECT_EQ(names, allRequestNames());
  std::map<std::string, std::string> served;
  for (const RequestDescriptor& request : RequestTable::requests()) {
    served[std::string(request.member)] =
        methodText(request.inSignature, request.inNames, request.outSignature, request.outNames);
  }
  // As text, so that a failure shows the methods that differ.
  const auto text = [](const std::map<std::string, std::string>& methods) {
    std::string lines;
    for (const auto& [name, method] : methods) lines += name + ": " + method + "\n";
    return lines;
  };
  EXPECT_EQ(text(served), text(declared));
  EXPECT_NE(committed.find("<interface name=\"com.orvane.larderd.VendSoftwareMapObserver\">\n"
                           "    <method name=\"SoftwareProductUpdatedState\">\n"
                           "      <arg name=\"product\" type=\"a{sv}\" direction=\"in\"/>\n"
                           "      <arg name=\"state\" type=\"x\" direction=\"in\"/>\n"
                           "      <annotation name=\"org.freedesktop.DBus.Method.NoReply\" "
                           "value=\"true\"/>\n"),
            std::string::npos);
}

// MARK: the connection object

class NoRemoteObjects final : public RemoteObjectFactory {
 public:
  std::shared_ptr<VendSoftwareMapObserver> softwareMapObserver(const std::string&,
                                                               const std::string&) override {
    return nullptr;
  }
  std::shared_ptr<VendAvailableUpdatesObserver> availableUpdatesObserver(
      const std::string&, const std::string&) override {
    return nullptr;
  }
  std::shared_ptr<VendOSUpdateScanObserver> osUpdateScanObserver(const std::string&,
                                                                 const std::string&) override {
    return nullptr;
  }
  std::shared_ptr<VendOSUpdateProgressObserver> osUpdateProgressObserver(
      const std::string&, const std::string&) override {
    return nullptr;
  }
  std::shared_ptr<VendUpdateDelegate> updateDelegate(const std::string&,
                                                     const std::string&) override {
    return nullptr;
  }
};

class AssetServiceInterfaceTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    map_.emplace(options(storePath(), false));
    map_->waitUntilIdle();
  }
  AssetServiceInterface connection(const std::string& peer = ":1.42") {
    return AssetServiceInterface(peer, *map_, std::make_shared<NoRemoteObjects>());
  }
  std::optional<SoftwareMap> map_;
};

// A request that names a client type only fills an empty slot; setting
// the client replaces whatever is there.
TEST_F(AssetServiceInterfaceTest, RequestsNamingAClientTypeOnlyFillAnEmptySlot) {
  AssetServiceInterface first = connection();
  auto perform = [&](std::string_view member, const PlistArray& arguments) {
    RequestTable::perform(*RequestTable::find(member), first, arguments, {});
    return first.storeClient();
  };
  EXPECT_EQ(first.storeClient(), std::nullopt);
  EXPECT_EQ(perform("RedownloadWithItemIdentifierBundleIdentifierStoreClientType",
                    {12, "com.example.x", 1}),
            VendStoreClient::initWithStoreClientType(VendStoreClient::kBookApplication));
  EXPECT_EQ(perform("ShowInviteOrganizationNameStoreClientType", {"https://invite", "Org", 0}),
            VendStoreClient::initWithStoreClientType(VendStoreClient::kBookApplication));
  const auto set = perform(
      "SetStoreClient", {PlistDictionary{{"identifier", "com.example.client"}, {"clientType", 4}}});
  EXPECT_EQ(set->identifier(), "com.example.client");
  EXPECT_EQ(set->clientType(), 4);
  first.setStoreClientFromTypeIfNeeded(VendStoreClient::kBookApplication);
  EXPECT_EQ(first.storeClient()->clientType(), 4);

  AssetServiceInterface other = connection(":1.43");
  other.setStoreClientFromTypeIfNeeded(VendStoreClient::kStoreApplication);
  EXPECT_EQ(other.storeClient()->identifier(), "com.orvane.quaymart");
}

// The name of the error that performing `request` answers with, or "".
std::string refusal(const RequestDescriptor& request, AssetServiceInterface& connection,
                    const PlistArray& arguments, const ReplyHandler& reply) {
  try {
    RequestTable::perform(request, connection, arguments, reply);
  } catch (const ServiceError& error) {
    return error.getName();
  }
  return "";
}

TEST_F(AssetServiceInterfaceTest, RequestsWithoutTargetAnswerEmptyRefuseOrStaySilent) {
  AssetServiceInterface connection = this->connection();
  std::set<std::string_view> unlisted;
  for (const RequestDescriptor& request : RequestTable::requests()) unlisted.insert(request.member);
  for (const auto& [list, outcome] :
       {std::pair{kEmptyReplyRequests, "empty"}, std::pair{kRefusedRequests, "refused"},
        std::pair{kSilentRequests, "silent"}}) {
    for (std::string_view member : words(list)) {
      SCOPED_TRACE(std::string(member) + " should be " + outcome);
      const RequestDescriptor* request = RequestTable::find(member);
      ASSERT_NE(request, nullptr);
      unlisted.erase(member);
      PlistArray arguments(DBusValueCodec::splitSignature(request->inSignature).size());
      std::vector<PlistArray> replies;
      const std::string error = refusal(*request, connection, arguments,
                                        [&](PlistArray out) { replies.push_back(std::move(out)); });
      // The reply that belonged to the target is an error, never silence.
      EXPECT_EQ(error, outcome == std::string_view("refused") ? ServiceError::kNotAvailable : "");
      EXPECT_EQ(replies, outcome == std::string_view("empty") ? std::vector<PlistArray>(1)
                                                              : std::vector<PlistArray>{});
      // Requests sent without wanting a reply have no handler to call.
      EXPECT_NO_THROW(RequestTable::perform(*request, connection, arguments, {}));
    }
  }
  for (std::string_view member : words(kHandledRequests)) unlisted.erase(member);
  EXPECT_TRUE(unlisted.empty()) << "requests nobody listed, e.g. " << *unlisted.begin();
}

}  // namespace
}  // namespace larder::testing
