// The cloud library client session against the reference store on
// loopback, in process: sign-in, login, revisions published while the
// store runs, differences with deleted ids, token pairs, media kinds,
// pre-orders, a store that stalls; and `larderctl dmap-dump`.
#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <mutex>
#include <nlohmann/json.hpp>
#include <optional>
#include <thread>

#include "dmap/DAAPBuffer.h"
#include "dmap/DAAPClient.h"
#include "dmap/DAAPCode.h"
#include "dmap/DAAPContainerScope.h"
#include "dmap/DAAPItem.h"
#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/RunLoop.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/accounts/VendAccountStore.h"
#include "store-runtime/http/VendRequestSigner.h"
#include "store-runtime/http/VendURLBag.h"
#include "tests/integration/InProcessRuntime.h"
#include "tests/integration/LarderctlProcess.h"

namespace larder::testing {
namespace {

using namespace std::chrono_literals;

constexpr std::uint64_t kAccountID = 8101;
constexpr char kAccountName[] = "listener@example.org";
constexpr char kPassword[] = "open sesame";

class RecordingOwner : public LedgerDAAPClientDelegate {
 public:
  struct Update {
    std::optional<DAAPArray> items;
    std::optional<std::int64_t> latestVersion;
    std::optional<DAAPArray> deleted;
  };

  std::optional<std::vector<PlistDictionary>> daapClientTokenPairsForLocalDatabaseWithClient(
      DAAPClient&) override {
    std::lock_guard lock(mutex_);
    return tokenPairs_;
  }
  void daapClientUpdatedItemsWithLatestVersionDeletedItems(
      DAAPClient&, const std::optional<DAAPArray>& items, std::optional<std::int64_t> latest,
      const std::optional<DAAPArray>& deleted) override {
    std::lock_guard lock(mutex_);
    updates_.push_back({items, latest, deleted});
  }
  void daapClientHandledEventEventInfoWithSuccessError(DAAPClient&, std::int64_t event,
                                                       const DAAPDictionary&, bool success,
                                                       const OptionalError&) override {
    std::lock_guard lock(mutex_);
    events_.emplace_back(event, success);
  }

  void setTokenPairs(std::vector<PlistDictionary> pairs) {
    std::lock_guard lock(mutex_);
    tokenPairs_ = std::move(pairs);
  }
  std::vector<Update> updates() const {
    std::lock_guard lock(mutex_);
    return updates_;
  }
  std::vector<std::pair<std::int64_t, bool>> events() const {
    std::lock_guard lock(mutex_);
    return events_;
  }

 private:
  mutable std::mutex mutex_;
  std::optional<std::vector<PlistDictionary>> tokenPairs_;
  std::vector<Update> updates_;
  std::vector<std::pair<std::int64_t, bool>> events_;
};

std::vector<std::uint64_t> itemIDs(const std::optional<DAAPArray>& items) {
  std::vector<std::uint64_t> identifiers;
  if (items) {
    for (const DAAPValue& value : *items) identifiers.push_back(value.item()->itemID());
  }
  return identifiers;
}

std::vector<std::int64_t> numbers(const std::optional<DAAPArray>& values) {
  std::vector<std::int64_t> result;
  if (values) {
    for (const DAAPValue& value : *values) result.push_back(value.int64Value());
  }
  return result;
}

const DAAPItem* findItem(const std::optional<DAAPArray>& items, std::uint64_t identifier) {
  if (!items) return nullptr;
  for (const DAAPValue& value : *items) {
    if (value.item()->itemID() == identifier) return value.item().get();
  }
  return nullptr;
}

PlistDictionary libraryItem(std::uint64_t identifier, const std::string& name,
                            PlistDictionary extra = {}) {
  PlistDictionary item{{"id", identifier}, {"name", name}};
  for (auto& [key, value] : extra) item[key] = std::move(value);
  return item;
}

PlistDictionary revision(std::int64_t number, PlistArray items, PlistArray deleted = {}) {
  return {{"revision", number}, {"items", std::move(items)}, {"deleted", std::move(deleted)}};
}

class CloudLibraryTest : public InProcessRuntimeTest {
 protected:
  void SetUp() override {
    catalogue_.addAccount(
        {.accountID = kAccountID, .orvaneID = kAccountName, .password = kPassword});
  }

  void TearDown() override {
    for (const auto& client : clients_) client->stopUpdating();
    // A stopped store lets its stalled requests go, so queued polls end fast.
    if (store_) store_->stop();
    DAAPClient::pollingQueue()->sync([] {});
    clients_.clear();
    InProcessRuntimeTest::TearDown();
  }

  void writeLibrary(const PlistArray& revisions, const PlistDictionary& bag = {}) {
    catalogue_.writeFile("library.plist", PropertyListSerialization::writeXml(PlistDictionary{
                                              {"bag", bag}, {"revisions", revisions}}));
  }

  void signIn() {
    VendServiceProxy proxy(VendStoreClient::initWithStoreClientType(1), runtime_);
    ASSERT_TRUE(signInThrough(proxy, kAccountName, kPassword));
  }

  std::shared_ptr<DAAPClient> makeClient() {
    auto client = DAAPClient::initWithServiceName(
        "QzPurchaseDaap", VendStoreClient::initWithStoreClientType(1), owner_, runLoop_);
    clients_.push_back(client);
    return client;
  }

  struct Poll {
    bool success = false;
    std::optional<DAAPArray> items;
    std::optional<DAAPArray> deleted;
  };
  static Poll pollAndWait(DAAPClient& client, bool forced) {
    Poll poll;
    DispatchSemaphore done;
    client.pollForUpdatesWithForcedUpdate(forced,
                                          [&](bool success, const std::optional<DAAPArray>& items,
                                              const std::optional<DAAPArray>& deleted) {
                                            poll = {success, items, deleted};
                                            done.signal();
                                          });
    EXPECT_TRUE(done.waitFor(60s));
    return poll;
  }

  RunLoop runLoop_;
  std::thread runLoopThread_{[this] { runLoop_.run(); }};
  std::shared_ptr<RecordingOwner> owner_ = std::make_shared<RecordingOwner>();
  std::vector<std::shared_ptr<DAAPClient>> clients_;

 public:
  ~CloudLibraryTest() override {
    runLoop_.stop();
    runLoopThread_.join();
  }
};

TEST_F(CloudLibraryTest, NewRevisionBringsChangesAndDeletedIdsAndAnUnchangedOneNoItemsRequest) {
  PlistArray revisions{
      revision(1, {libraryItem(1001, "Atlas"), libraryItem(1002, "Bestiary"),
                   libraryItem(1003, "Cookbook")}),
      revision(2, {libraryItem(1002, "Bestiary, second edition"), libraryItem(1004, "Dictionary")},
               {1003})};
  writeLibrary(revisions);
  startStore();
  signIn();
  auto client = makeClient();
  client->startUpdatingWithLocalVersion(1);
  ASSERT_TRUE(eventually([&] { return owner_->updates().size() == 1; }, 30s));
  DAAPClient::pollingQueue()->sync([] {});

  const auto update = owner_->updates()[0];
  EXPECT_EQ(itemIDs(update.items), (std::vector<std::uint64_t>{1002, 1004}));
  EXPECT_EQ(update.latestVersion, 2);
  EXPECT_EQ(numbers(update.deleted), (std::vector<std::int64_t>{1003}));
  const DAAPItem* changed = findItem(update.items, 1002);
  ASSERT_TRUE(changed);
  EXPECT_EQ(changed->name(), "Bestiary, second edition");
  EXPECT_EQ(changed->objectForKey("com.orvane.sonorel.cloud-purchased-token"), DAAPValue(2));
  EXPECT_EQ(client->localVersion(), 2);
  EXPECT_EQ(client->state(), DAAPClient::State::InStep);
  EXPECT_EQ(requests("daap-login"), 1U);
  EXPECT_EQ(requests("daap-update"), 1U);
  EXPECT_EQ(requests("daap-items"), 1U);
  for (const auto& [event, success] : owner_->events()) EXPECT_TRUE(success) << event;

  // Nothing new: a login and a revision request, no items request.
  const Poll unchanged = pollAndWait(*client, false);
  EXPECT_TRUE(unchanged.success);
  EXPECT_FALSE(unchanged.items);
  EXPECT_EQ(requests("daap-login"), 2U);
  EXPECT_EQ(requests("daap-update"), 2U);
  EXPECT_EQ(requests("daap-items"), 1U);

  // A revision published while the store runs.
  revisions.push_back(revision(3, {libraryItem(1005, "Encyclopedia")}, {1001}));
  writeLibrary(revisions);
  const Poll changedAgain = pollAndWait(*client, false);
  EXPECT_TRUE(changedAgain.success);
  EXPECT_EQ(itemIDs(changedAgain.items), (std::vector<std::uint64_t>{1005}));
  EXPECT_EQ(numbers(changedAgain.deleted), (std::vector<std::int64_t>{1001}));
  EXPECT_EQ(client->localVersion(), 3);
  EXPECT_EQ(requests("daap-items"), 2U);
}

TEST_F(CloudLibraryTest, FirstFetchLeavesOutWhatTheClientHoldsAndKindsItDidNotAskFor) {
  const PlistDate release{2000000000};
  writeLibrary({revision(
      1, {libraryItem(2001, "Held", {{"media-kind", 2}}),
          libraryItem(2002, "Stale token", {{"media-kind", 2}}),
          libraryItem(2003, "A film", {{"media-kind", 4}}), libraryItem(2004, "Kindless"),
          libraryItem(2005, "Coming soon",
                      {{"media-kind", 2}, {"pre-order", true}, {"release-date", release}})})});
  startStore();
  signIn();
  owner_->setTokenPairs({*DAAPClient::tokenPairWithCloudID(2001, 1),
                         *DAAPClient::tokenPairWithCloudID(2002, 99),
                         *DAAPClient::tokenPairWithCloudID(2999, 1)});
  auto client = makeClient();
  client->setMediaKinds({2});
  // Not started, so the client holds no revision: a forced poll asks from 0.
  const Poll poll = pollAndWait(*client, true);
  ASSERT_TRUE(poll.success);
  EXPECT_EQ(itemIDs(poll.items), (std::vector<std::uint64_t>{2002, 2004, 2005}));
  EXPECT_EQ(numbers(poll.deleted), (std::vector<std::int64_t>{2999}));
  const DAAPItem* preorder = findItem(poll.items, 2005);
  ASSERT_TRUE(preorder);
  EXPECT_EQ(preorder->objectForKey("com.orvane.sonorel.store.expected-release-date"),
            DAAPValue(PlistDate{2000000000}));
}

TEST_F(CloudLibraryTest, StoreThatNeverAnswersTimesOutAndTheNextTickPollsAgain) {
  writeLibrary({revision(4, {libraryItem(3001, "Never seen")})},
               {{"update-polling-frequency-secs", 1}});
  // Short enough for three polls in the wait below, long enough for the
  // bag and the sign-in on a loaded machine.
  startStore({"daap-update=stall"}, 3);
  signIn();
  auto client = makeClient();
  client->startUpdatingWithLocalVersion(1);
  // Each poll logs in, then waits for a revision that never comes until
  // the request gives up; the timer's next tick starts the next poll.
  ASSERT_TRUE(eventually([&] { return requests("daap-update") >= 3; }, 60s));
  EXPECT_GE(requests("daap-login"), 3U);
  EXPECT_EQ(requests("daap-items"), 0U);
  std::size_t failedRevisions = 0;
  for (const auto& [event, success] : owner_->events()) {
    if (event == DAAPClient::kEventGetLatestVersion) {
      EXPECT_FALSE(success);
      ++failedRevisions;
    }
  }
  EXPECT_GE(failedRevisions, 2U);
}

TEST_F(CloudLibraryTest, FaultsAndRefusals) {
  writeLibrary({revision(1, {libraryItem(4001, "Only")})});
  startStore({"daap-items=500"});
  // The bag names the service below the host the client used.
  const PlistValue service = runtime_->urlBag().valueForKey(0, "purchase-daap");
  ASSERT_TRUE(service.dictionary());
  EXPECT_EQ(*service["base-url"].string(), store_->baseURL() + "/daap");

  // Unsigned: refused before anything else.
  VendURLRequest unsigned_(store_->baseURL() + "/daap/login");
  unsigned_.setMethod("POST");
  auto answer = VendHTTPTransfer::perform(unsigned_);
  EXPECT_EQ(answer.response.statusCode, 401);
  EXPECT_EQ(requests("daap-login"), 1U);

  signIn();
  auto client = makeClient();
  const Poll poll = pollAndWait(*client, true);
  EXPECT_TRUE(poll.success);  // the poll ran through; the items request failed
  EXPECT_FALSE(poll.items);
  EXPECT_EQ(requests("daap-items"), 1U);
  EXPECT_EQ(client->localVersion(), std::nullopt);
  ASSERT_FALSE(owner_->events().empty());
  EXPECT_EQ(owner_->events().back(), std::make_pair(std::int64_t{4}, false));

  // A session the store never gave is refused, and the answer is signed.
  const auto account = runtime_->accountStore().primaryAccount();
  ASSERT_TRUE(account);
  VendURLRequest update(store_->baseURL() + "/daap/update");
  update.setMethod("POST");
  update.setValue("application/x-www-form-urlencoded", "Content-Type");
  update.setBody(PlistData{'s', 'e', 's', 's', 'i', 'o', 'n', '-', 'i', 'd', '=', '9', '9', '9'});
  VendRequestSigner(account->signingKey).sign(update, account->accountID);
  answer = VendHTTPTransfer::perform(update);
  EXPECT_EQ(answer.response.statusCode, 403);
  EXPECT_TRUE(VendRequestSigner(account->signingKey).verifiedBody(answer.response, answer.body));
}

TEST_F(CloudLibraryTest, StoreWithoutLibraryHasNoServiceInItsBag) {
  startStore();
  EXPECT_TRUE(runtime_->urlBag().load(0).success);
  EXPECT_TRUE(runtime_->urlBag().valueForKey(0, "purchase-daap").isNull());
  signIn();
  auto client = makeClient();
  const Poll poll = pollAndWait(*client, false);
  EXPECT_FALSE(poll.success);  // no URL, so no session
  EXPECT_EQ(requests("daap-login"), 0U);
}

// A document as a store would send it, written with the client library's
// own writer.
PlistData sampleDocument() {
  DAAPBuffer buffer;
  {
    DAAPContainerScope document(buffer, "mupd"_dmap);
    buffer.appendUInt32(200, "mstt"_dmap);
    buffer.appendUInt32(12, "musr"_dmap);
    DAAPContainerScope listing(buffer, "mlcl"_dmap);
    DAAPContainerScope item(buffer, "mlit"_dmap);
    buffer.appendUInt64(5001, "miid"_dmap);
    buffer.appendUTF8String(std::string_view("Grammar"), "minm"_dmap);
    buffer.appendUInt32(1700000000, "asdp"_dmap);
    buffer.appendUInt32(2, "aeMk"_dmap);
  }
  return buffer.takeData();
}

class DmapDumpTest : public ::testing::Test {
 protected:
  LarderctlRun larderctl(const std::vector<std::string>& arguments) {
    return runLarderctl(platform_.directory() + "/dump", arguments, {{"HOME", platform_.home()}});
  }
  std::string writeDocument(const std::string& name, const PlistData& bytes) {
    const std::string path = platform_.directory() + "/" + name;
    EXPECT_TRUE(FileIO::writeAtomically(path, bytes));
    return path;
  }

  TemporaryPlatform platform_;
};

TEST_F(DmapDumpTest, PrintsTheDecodedDocumentAsJson) {
  const std::string path = writeDocument("update.dmap", sampleDocument());
  const LarderctlRun run = larderctl({"dmap-dump", path});
  ASSERT_EQ(run.status, 0) << run.errors;
  EXPECT_NE(run.output.find("\n  \"dmap.serverrevision\": 12"), std::string::npos)
      << "indented for people: " << run.output;
  const auto json = nlohmann::json::parse(run.output);
  EXPECT_EQ(json["dmap.status"], 200);
  EXPECT_EQ(json["dmap.serverrevision"], 12);
  ASSERT_EQ(json["dmap.listing"].size(), 1U);
  const auto& item = json["dmap.listing"][0];
  EXPECT_EQ(item["dmap.itemid"], 5001);
  EXPECT_EQ(item["name"], "Grammar");
  EXPECT_EQ(item["com.orvane.sonorel.extended-media-kind"], 2);
  EXPECT_EQ(item["daap.songdatepurchased"], "2023-11-14T22:13:20Z");

  const LarderctlRun line = larderctl({"--json", "dmap-dump", path});
  ASSERT_EQ(line.status, 0) << line.errors;
  EXPECT_EQ(line.output.find('\n'), line.output.size() - 1) << "one line: " << line.output;
  const auto compact = nlohmann::json::parse(line.output);
  EXPECT_EQ(compact["dmap.listing"][0]["daap.songdatepurchased"], 1700000000);
}

TEST_F(DmapDumpTest, RefusesWhatItCannotReadOrDecode) {
  PlistData truncated = sampleDocument();
  truncated.resize(truncated.size() - 3);
  for (const auto& [path, error] :
       {std::pair{platform_.directory() + "/absent.dmap", "cannot read"},
        std::pair{writeDocument("cut.dmap", truncated), "is not a DMAP document"}}) {
    SCOPED_TRACE(error);
    const LarderctlRun run = larderctl({"dmap-dump", path});
    EXPECT_EQ(run.status, 1);
    EXPECT_NE(run.errors.find(error), std::string::npos) << run.errors;
    EXPECT_TRUE(run.output.empty());
  }
}

}  // namespace
}  // namespace larder::testing
