// The service's request table and the per-connection object its requests
// run against.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cctype>
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

// The D-Bus member of a keyword selector: the keywords without a final
// reply keyword, and without a reply suffix on the last of them,
// capitalised and run together.
std::string memberNameForSelector(std::string_view selector) {
  std::vector<std::string> keywords;
  for (std::size_t at = 0; at < selector.size();) {
    const std::size_t end = std::min(selector.find(':', at), selector.size());
    keywords.emplace_back(selector.substr(at, end - at));
    at = end + 1;
  }
  if (keywords.size() > 1) {
    const std::string& last = keywords.back();
    if (last == "replyBlock" || last == "withReplyBlock" || last == "reply") keywords.pop_back();
  }
  std::string& last = keywords.back();
  for (std::string_view suffix : {"WithReplyBlock", "ReplyBlock"}) {
    if (last.size() > suffix.size() && last.ends_with(suffix)) {
      last.resize(last.size() - suffix.size());
      break;
    }
  }
  std::string member;
  for (std::string keyword : keywords) {
    keyword[0] = static_cast<char>(std::toupper(static_cast<unsigned char>(keyword[0])));
    member += keyword;
  }
  return member;
}

// Whether the selector's last argument is the reply block.
bool selectorTakesReply(std::string_view selector) {
  for (std::string_view ending : {":replyBlock:", ":withReplyBlock:", ":reply:", "ReplyBlock:"}) {
    if (selector.ends_with(ending)) return true;
  }
  return false;
}

// A D-Bus signature checker written from the D-Bus rules, independent of
// the codec's own splitting.
class SignatureChecker {
 public:
  static bool valid(std::string_view signature, std::size_t* completeTypes) {
    if (signature.size() > 255) return false;
    SignatureChecker checker(signature);
    std::size_t count = 0;
    while (checker.position_ < signature.size()) {
      if (!checker.completeType(0, 0)) return false;
      ++count;
    }
    if (completeTypes) *completeTypes = count;
    return true;
  }

 private:
  explicit SignatureChecker(std::string_view signature) : signature_(signature) {}

  static bool isBasic(char c) {
    return std::string_view("ybnqiuxtdsogh").find(c) != std::string_view::npos;
  }

  bool completeType(int arrays, int structs) {
    if (position_ >= signature_.size()) return false;
    char c = signature_[position_++];
    if (isBasic(c) || c == 'v') return true;
    if (c == 'a') {
      if (arrays + 1 > 32) return false;
      if (position_ < signature_.size() && signature_[position_] == '{') {
        ++position_;
        if (position_ >= signature_.size() || !isBasic(signature_[position_++])) return false;
        if (!completeType(arrays + 1, structs + 1)) return false;
        return position_ < signature_.size() && signature_[position_++] == '}';
      }
      return completeType(arrays + 1, structs);
    }
    if (c == '(') {
      if (structs + 1 > 32) return false;
      std::size_t fields = 0;
      while (position_ < signature_.size() && signature_[position_] != ')') {
        if (!completeType(arrays, structs + 1)) return false;
        ++fields;
      }
      if (position_ >= signature_.size() || fields == 0) return false;
      ++position_;
      return true;
    }
    return false;
  }

  std::string_view signature_;
  std::size_t position_ = 0;
};

std::size_t nameCount(std::string_view names) {
  if (names.empty()) return 0;
  return static_cast<std::size_t>(std::count(names.begin(), names.end(), ',')) + 1;
}

bool isValidMemberName(std::string_view name) {
  if (name.empty() || name.size() > 255 || std::isdigit(static_cast<unsigned char>(name[0]))) {
    return false;
  }
  return std::all_of(name.begin(), name.end(), [](char c) {
    return std::isalnum(static_cast<unsigned char>(c)) || c == '_';
  });
}

TEST(RequestTable, NamingRuleOfTheChecker) {
  // The rule as stated, on the examples that define it.
  for (const auto& [selector, member] :
       {std::pair{"productForBundleIdentifier:replyBlock:", "ProductForBundleIdentifier"},
        {"allProductsWithReplyBlock:", "AllProducts"},
        {"addSoftwareMapObserver:reply:", "AddSoftwareMapObserver"},
        {"hideOSUpdatesWithProductKeys:withReplyBlock:", "HideOSUpdatesWithProductKeys"},
        {"setStoreClient:", "SetStoreClient"},
        {"checkSHDownloadStatus:", "CheckSHDownloadStatus"},
        {"startService", "StartService"},
        {"nowIsLaterWithMode:countdownDeferred:", "NowIsLaterWithModeCountdownDeferred"}}) {
    EXPECT_EQ(memberNameForSelector(selector), member);
  }
}

TEST(RequestTable, EveryMemberFollowsFromItsSelector) {
  std::set<std::string_view> members;
  std::set<std::string_view> selectors;
  ASSERT_GT(RequestTable::requests().size(), 50U);
  for (const RequestDescriptor& request : RequestTable::requests()) {
    EXPECT_EQ(request.member, memberNameForSelector(request.selector)) << request.selector;
    EXPECT_TRUE(isValidMemberName(request.member)) << request.member;
    EXPECT_TRUE(members.insert(request.member).second) << "member twice: " << request.member;
    EXPECT_TRUE(selectors.insert(request.selector).second)
        << "selector twice: " << request.selector;
    EXPECT_EQ(RequestTable::find(request.member), &request) << request.member;
  }
  EXPECT_EQ(RequestTable::find("NoSuchMember"), nullptr);
  EXPECT_EQ(RequestTable::find(""), nullptr);
  EXPECT_EQ(RequestTable::find("productForBundleIdentifier:replyBlock:"), nullptr)
      << "lookups are by member, not selector";
}

TEST(RequestTable, SignaturesAreValidAndMatchTheirNamesAndSelectors) {
  for (const RequestDescriptor& request : RequestTable::requests()) {
    for (const auto& [signature, names, direction] :
         {std::tuple{request.inSignature, request.inNames, "in"},
          std::tuple{request.outSignature, request.outNames, "out"}}) {
      std::size_t types = 0;
      EXPECT_TRUE(SignatureChecker::valid(signature, &types))
          << request.selector << " " << direction << ": \"" << signature << '"';
      std::vector<std::string> split;
      EXPECT_NO_THROW(split = DBusValueCodec::splitSignature(signature)) << request.selector;
      EXPECT_EQ(split.size(), types) << request.selector << " " << direction;
      EXPECT_EQ(nameCount(names), split.size())
          << request.selector << " " << direction << " names \"" << names << '"';
      std::string joined;
      for (const std::string& type : split) joined += type;
      EXPECT_EQ(joined, signature) << request.selector;
    }
    // Every argument of the selector is an in argument, except the reply.
    std::size_t selectorArguments =
        static_cast<std::size_t>(std::count(request.selector.begin(), request.selector.end(), ':'));
    bool reply = selectorTakesReply(request.selector) || !request.outSignature.empty();
    if (reply) {
      EXPECT_GE(selectorArguments, 1U) << request.selector << " answers without a reply block";
      --selectorArguments;
    }
    EXPECT_EQ(DBusValueCodec::splitSignature(request.inSignature).size(), selectorArguments)
        << request.selector;
    if (request.withoutTarget == WithoutTarget::kEmptyReply) {
      EXPECT_FALSE(request.outSignature.empty()) << request.selector << " has no reply to empty";
    }
  }
}

TEST(RequestTable, SignatureCheckerRefusesMalformedSignatures) {
  std::size_t count = 0;
  EXPECT_TRUE(SignatureChecker::valid("", &count));
  EXPECT_EQ(count, 0U);
  EXPECT_TRUE(SignatureChecker::valid("sa{sv}x(ias)", &count));
  EXPECT_EQ(count, 4U);
  for (const char* bad :
       {"a", "a{", "{sv}", "a{vs}", "a{sv", "()", "(s", "s)", "z", "a{s}", "a{svv}"}) {
    EXPECT_FALSE(SignatureChecker::valid(bad, nullptr)) << bad;
  }
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
    "ShowInviteOrganizationNameStoreClientType";
constexpr std::string_view kEmptyReplyRequests =
    "AvailableUpdatesBadgeCount WillInteractivelyPurchaseItemIdentifier OsUpdateScanInProgress "
    "ShouldOfferDoItLaterForAvailableUpdates AppUpdatesToInstallLater InstalledUpdatesJournal "
    "IsAutoUpdateEnabled ShouldPromptForAutoUpdateOptIn UpdateAutoInfoWithToken "
    "MajorOSUpdateHasDownloadedToPath CheckSHDownloadStatus CountOfBooksWithInfo "
    "SortedBooksWithInfo BookAtIndexWithInfo BookWithInfo HasSampleWithItemIdentifier "
    "PurchasedItems";
// Some of these have a handler for the part this build has (the client type).
constexpr std::string_view kRefusedRequests =
    "StartAppUpdatesAndOSUpdatesWithDelegate StartAppInstallWithTagsFallbackPurchase "
    "UpdatesForTags HideOSUpdatesWithProductKeys UnhideAllOSUpdates "
    "RedownloadWithItemIdentifierBundleIdentifierStoreClientType "
    "ProcessMDMManifestURLOptionsStoreClientType "
    "AccountLessDownloadWithItemIdentifierBundleIdentifierExternalVersionIdentifierOptions "
    "PollForPurchasedBooks";
constexpr std::string_view kSilentRequests =
    "AddAvailableUpdatesObserver RemoveAvailableUpdatesObserver "
    "DidInteractivelyPurchaseItemIdentifierSuccess AddOSUpdateProgressObserver "
    "RemoveOSUpdateProgressObserver CancelOSUpdates CancelOSUpdatesWithProductKeys "
    "StartOSUpdateScanWithForceFullScanReportProgressImmediatelyLaunchedFromNotification"
    "UserHasSeenAllUpdatesCheckForOtherUpdates "
    "AddOSUpdateScanObserver RemoveOSUpdateScanObserver "
    "SoftwareUpdateDidFinishBackgroundScanWithInfo RemoveUpdateFromInstallLaterWithBundleID "
    "InstallAvailableUpdatesLaterWithMode CancelUpdatesToBeInstalledLater "
    "NowIsLaterWithModeCountdownDeferred LaterDidNotOccurWithDueToACPower "
    "PromptUserToOptInForAutoUpdateWithShowNotification ManagedOSInstallWakeUpReceived "
    "DownloadSetupHeraldForTagsBundleIdentifier AccountLessDownloadHeartbeat "
    "AddLibraryObserver RemoveLibraryObserver RedownloadBooksWithItemIdentifiersAccountID "
    "PollForPurchasedItems";

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

struct CommittedMethod {
  std::string inTypes, outTypes, inNames, outNames;
};

// The methods of the service interface as the committed file declares
// them: argument types run together, argument names comma separated.
std::map<std::string, CommittedMethod> committedServiceMethods(const std::string& xml) {
  std::map<std::string, CommittedMethod> methods;
  std::stringstream lines(xml);
  bool inService = false;
  CommittedMethod* method = nullptr;
  for (std::string line; std::getline(lines, line);) {
    if (line.find("<interface ") != std::string::npos) {
      inService = attributeOf(line, "name") == ServiceRequests::kInterfaceName;
    } else if (inService && line.find("<method ") != std::string::npos) {
      const std::string name = attributeOf(line, "name");
      EXPECT_FALSE(methods.contains(name)) << name << " declared twice";
      method = &methods[name];
    } else if (inService && method && line.find("<arg ") != std::string::npos) {
      const bool in = attributeOf(line, "direction") == "in";
      std::string& names = in ? method->inNames : method->outNames;
      names += (names.empty() ? "" : ",") + attributeOf(line, "name");
      (in ? method->inTypes : method->outTypes) += attributeOf(line, "type");
    }
  }
  return methods;
}

TEST(RequestTable, IntrospectionMatchesTheCommittedInterfaceFile) {
  const std::string committed = committedInterfaceFile();
  EXPECT_EQ(ServiceRequests::introspectionXml(), committed)
      << "regenerate data/dbus from the table";

  // The committed file is the contract clients build against: it declares
  // the listed requests, and the table serves each as declared.
  const std::map<std::string, CommittedMethod> methods = committedServiceMethods(committed);
  std::set<std::string_view> declared;
  for (const auto& [name, method] : methods) declared.insert(name);
  EXPECT_EQ(declared, allRequestNames());
  std::set<std::string_view> served;
  for (const RequestDescriptor& request : RequestTable::requests()) {
    served.insert(request.member);
    auto method = methods.find(std::string(request.member));
    if (method == methods.end()) continue;
    EXPECT_EQ(request.inSignature, method->second.inTypes) << request.member;
    EXPECT_EQ(request.outSignature, method->second.outTypes) << request.member;
    EXPECT_EQ(request.inNames, method->second.inNames) << request.member;
    EXPECT_EQ(request.outNames, method->second.outNames) << request.member;
  }
  EXPECT_EQ(served, declared);
  EXPECT_NE(committed.find("<interface name=\"com.orvane.larderd.VendSoftwareMapObserver\">\n"
                           "    <method name=\"SoftwareProductUpdatedState\">\n"
                           "      <arg name=\"product\" type=\"a{sv}\" direction=\"in\"/>\n"
                           "      <arg name=\"state\" type=\"x\" direction=\"in\"/>\n"
                           "      <annotation name=\"org.freedesktop.DBus.Method.NoReply\" "
                           "value=\"true\"/>\n"),
            std::string::npos);
}

// MARK: the connection object

class FakeRemoteObjects final : public RemoteObjectFactory {
 public:
  std::shared_ptr<VendSoftwareMapObserver> softwareMapObserver(
      const std::string& peer, const std::string& objectPath) override {
    requests.emplace_back(peer, objectPath);
    return observer;
  }
  std::vector<std::pair<std::string, std::string>> requests;
  std::shared_ptr<RecordingObserver> observer = std::make_shared<RecordingObserver>();
};

class AssetServiceInterfaceTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    if (HasFatalFailure()) return;
    remote_ = std::make_shared<FakeRemoteObjects>();
  }
  void TearDown() override {
    interface_.reset();
    map_.reset();
    ServiceTest::TearDown();
  }
  AssetServiceInterface& connect(bool discover = false) {
    map_.emplace(options(storePath(), discover));
    map_->waitUntilIdle();
    interface_ = std::make_unique<AssetServiceInterface>(":1.42", *map_, remote_);
    return *interface_;
  }

  std::shared_ptr<FakeRemoteObjects> remote_;
  std::optional<SoftwareMap> map_;
  std::unique_ptr<AssetServiceInterface> interface_;
};

// A request that names a client type only fills an empty slot; setting
// the client replaces whatever is there.
TEST_F(AssetServiceInterfaceTest, RequestsNamingAClientTypeOnlyFillAnEmptySlot) {
  AssetServiceInterface& connection = connect();
  EXPECT_EQ(connection.storeClient(), std::nullopt);
  RequestTable::perform(
      *RequestTable::find("RedownloadWithItemIdentifierBundleIdentifierStoreClientType"),
      connection, {12, "com.example.x", 1}, {});
  ASSERT_TRUE(connection.storeClient());
  EXPECT_EQ(*connection.storeClient(),
            VendStoreClient::initWithStoreClientType(VendStoreClient::kBookApplication));
  EXPECT_EQ(connection.storeClient()->identifier(), "com.orvane.books");
  RequestTable::perform(*RequestTable::find("ShowInviteOrganizationNameStoreClientType"),
                        connection, {"https://invite", "Org", 0}, {});
  EXPECT_EQ(connection.storeClient()->clientType(), VendStoreClient::kBookApplication);

  RequestTable::perform(*RequestTable::find("SetStoreClient"), connection,
                        {PlistDictionary{{"identifier", "com.example.client"}, {"clientType", 4}}},
                        {});
  EXPECT_EQ(connection.storeClient()->identifier(), "com.example.client");
  EXPECT_EQ(connection.storeClient()->clientType(), 4);
  connection.setStoreClientFromTypeIfNeeded(VendStoreClient::kBookApplication);
  EXPECT_EQ(connection.storeClient()->clientType(), 4);

  AssetServiceInterface other(":1.43", *map_, remote_);
  other.setStoreClientFromTypeIfNeeded(VendStoreClient::kStoreApplication);
  EXPECT_EQ(other.storeClient()->identifier(), "com.orvane.quaymart");
}

TEST_F(AssetServiceInterfaceTest, ObserverAtTheRootPathIsNoObserver) {
  AssetServiceInterface& connection = connect();
  LogCapture log;
  std::string rootToken = connection.addSoftwareMapObserver("/");
  std::string emptyToken = connection.addSoftwareMapObserver("");
  EXPECT_FALSE(rootToken.empty());
  EXPECT_NE(rootToken, emptyToken);
  EXPECT_TRUE(remote_->requests.empty()) << "a handle was made for no object";
  connection.removeSoftwareMapObserver(rootToken);
  EXPECT_EQ(
      log.countExactly("SoftwareMap: Could not find SoftwareMap observer to remove for token: " +
                       rootToken),
      1U)
      << log.dump();

  std::string realToken = connection.addSoftwareMapObserver("/com/example/Observer");
  ASSERT_EQ(remote_->requests.size(), 1U);
  EXPECT_EQ(remote_->requests[0],
            (std::pair<std::string, std::string>{":1.42", "/com/example/Observer"}));
  auto product = std::make_shared<LedgerSoftwareProduct>(
      LedgerSoftwareProductFields{.bundlePath = "/Applications/Seen.app"});
  map_->notifyObserversAboutProduct(product, kSoftwareProductAdded);
  ASSERT_EQ(remote_->observer->calls().size(), 1U);
  EXPECT_EQ(remote_->observer->calls()[0].product, product);
  connection.removeSoftwareMapObserver(realToken);
  EXPECT_EQ(log.countExactly("SoftwareMap: Removed SoftwareMap observer for token: " + realToken),
            1U);
}

TEST_F(AssetServiceInterfaceTest, InstalledSoftwareRequestsAnswerInWireForm) {
  std::string app =
      makeStoreBundle(rootApplications(), "Wire", "com.example.wire", "5.1", 71, 7100);
  AssetServiceInterface& connection = connect(true);
  std::vector<PlistArray> replies;
  ReplyHandler collect = [&](PlistArray out) { replies.push_back(std::move(out)); };

  RequestTable::perform(*RequestTable::find("ProductForBundleIdentifier"), connection,
                        {"com.example.wire"}, collect);
  RequestTable::perform(*RequestTable::find("ProductForItemIdentifier"), connection,
                        {std::int64_t{71}}, collect);
  RequestTable::perform(*RequestTable::find("ProductForBundleIdentifier"), connection,
                        {"com.example.none"}, collect);
  RequestTable::perform(*RequestTable::find("AllProducts"), connection, {}, collect);
  ASSERT_EQ(replies.size(), 4U);
  PlistDictionary expected = map_->productForBundleIdentifier("com.example.wire")->toDictionary();
  EXPECT_EQ(replies[0], PlistArray{expected});
  EXPECT_EQ(replies[1], PlistArray{expected});
  EXPECT_EQ(PlistValue(expected)["bundlePath"], PlistValue(app));
  EXPECT_EQ(replies[2], PlistArray{PlistDictionary{}}) << "nothing found answers an empty record";
  EXPECT_EQ(replies[3], PlistArray{PlistArray{expected}});
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
  AssetServiceInterface& connection = connect();
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

TEST_F(AssetServiceInterfaceTest, AnUpdateCheckWithoutStoreClientIsRefusedAtOnce) {
  AssetServiceInterface& connection = connect();
  const RequestDescriptor& check = *RequestTable::find("CheckForUpdatesWithUserHasSeenUpdates");
  bool replied = false;
  EXPECT_EQ(refusal(check, connection, {false}, [&](PlistArray) { replied = true; }),
            ServiceError::kNoStoreClient);
  EXPECT_FALSE(replied);
  EXPECT_EQ(refusal(check, connection, {false}, {}), "") << "nobody waits for an answer";
}

}  // namespace
}  // namespace larder::testing
