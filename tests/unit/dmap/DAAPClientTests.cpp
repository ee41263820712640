// The client session against a scripted service on 127.0.0.1, through the
// real runtime: signing, transport, verification, decoding, the poll's
// steps, the delegate's events, the timers and the states.
#include <gtest/gtest.h>
#include <httplib.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "DAAPTestSupport.h"
#include "dmap/DAAPClient.h"
#include "dmap/DAAPClientPreferences.h"
#include "dmap/DAAPItem.h"
#include "dmap/DAAPItemsRequest.h"
#include "dmap/DAAPMediaKindQuery.h"
#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/dispatch/RunLoop.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/accounts/VendAccountStore.h"
#include "store-runtime/http/VendRequestSigner.h"
#include "store-runtime/http/VendURLBag.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "tests/unit/RunLoopThread.h"
#include "tests/unit/ScopedEnvironment.h"
#include "tests/unit/TemporaryFolder.h"

// Scaffolding: a cloud library service whose every answer a test can
// script, a delegate that records what it is told, a run loop on a thread of
// its own, and a private runtime, root and preference folder.
namespace larder::dmaptest {

namespace fs = std::filesystem;

using ScopedEnvironment = larder::testing::ScopedEnvironment;

using RunLoopThread = larder::testing::RunLoopThread;

using TemporaryFolder = larder::testing::TemporaryFolder;

inline bool waitUntil(const std::function<bool()>& condition,
                      std::chrono::milliseconds limit = std::chrono::seconds(10)) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return true;
}

// The service side of a cloud library, on 127.0.0.1. It records every
// request with whether its signature was good, and answers each action
// ("login", "update", "databases", "items") with what the test scripted,
// signed with the account's key unless told otherwise.
class FakeCloudLibrary {
 public:
  enum class Signing { Signed, Unsigned, Forged };
  struct Answer {
    int status = 200;
    std::string contentType = std::string(DAAPClient::kDMAPContentType);
    PlistData body;
    Signing signing = Signing::Signed;
  };
  struct Received {
    std::string action;
    std::string method;
    std::string target;
    std::multimap<std::string, std::string, httplib::detail::ci> headers;
    PlistData body;
    bool signatureValid = false;

    [[nodiscard]] std::string header(const std::string& name) const {
      const auto found = headers.find(name);
      return found == headers.end() ? std::string() : found->second;
    }
    [[nodiscard]] std::string bodyText() const { return {body.begin(), body.end()}; }
  };
  using Responder = std::function<Answer(const Received&)>;

  explicit FakeCloudLibrary(PlistData signingKey) : key_(std::move(signingKey)) {
    server_.Get("/bag.plist", [this](const httplib::Request& request, httplib::Response& response) {
      {
        std::unique_lock lock(mutex_);
        ++bagRequests_;
        bagTypes_.push_back(request.get_param_value("type"));
        changed_.wait(lock, [&] { return held_ != "bag"; });
      }
      response.set_content(PropertyListSerialization::writeXml(bag()), "application/x-plist");
    });
    const auto handle = [this](const std::string& action) {
      return [this, action](const httplib::Request& request, httplib::Response& response) {
        answer(action, request, response);
      };
    };
    server_.Post("/daap/login", handle("login"));
    server_.Post("/daap/update", handle("update"));
    server_.Post("/daap/databases", handle("databases"));
    server_.Post(R"(/daap/databases/(\d+)/items)", handle("items"));
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
    while (!server_.is_running()) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    setRevision(1);
  }
  ~FakeCloudLibrary() {
    release();
    server_.stop();
    thread_.join();
  }
  FakeCloudLibrary(const FakeCloudLibrary&) = delete;
  FakeCloudLibrary& operator=(const FakeCloudLibrary&) = delete;

  [[nodiscard]] std::string origin() const { return "http://127.0.0.1:" + std::to_string(port_); }
  [[nodiscard]] std::string bagURL() const { return origin() + "/bag.plist"; }
  [[nodiscard]] std::string baseURL() const { return origin() + "/daap"; }

  // Entries of the bag's "purchase-daap" besides "base-url"; null removes
  // the whole dictionary from the bag.
  void setServiceSettings(std::optional<PlistDictionary> settings) {
    std::lock_guard lock(mutex_);
    settings_ = std::move(settings);
  }
  void setResponder(const std::string& action, Responder responder) {
    std::lock_guard lock(mutex_);
    responders_[action] = std::move(responder);
  }
  // The plain answers: a login with `sessionID`, `revision`, and the items
  // given (an empty listing and no deleted ids until set).
  void setRevision(std::uint32_t revision, std::uint32_t sessionID = 77) {
    setResponder("login", [sessionID](const Received&) {
      return Answer{.body =
                        document(container("mlog", {u32("mstt", 200), u32("mlid", sessionID)}))};
    });
    setResponder("update", [revision](const Received&) {
      return Answer{.body = document(container("mupd", {u32("mstt", 200), u32("musr", revision)}))};
    });
    setItems({}, {});
  }
  void setItems(std::vector<Tag> items, std::vector<std::uint64_t> deleted) {
    std::vector<Tag> deletedTags;
    for (const std::uint64_t identifier : deleted) deletedTags.push_back(u64("mild", identifier));
    const PlistData answer = document(container(
        "adbs", {u32("mstt", 200), u8("muty", 1), u32("mrco", items.size()),
                 container("mlcl", std::move(items)), container("mudl", std::move(deletedTags))}));
    setResponder("items", [answer](const Received&) { return Answer{.body = answer}; });
  }

  [[nodiscard]] int bagRequests() const {
    std::lock_guard lock(mutex_);
    return bagRequests_;
  }

  // The "type" of each bag request, "" for the default bag.
  [[nodiscard]] std::vector<std::string> bagTypes() const {
    std::lock_guard lock(mutex_);
    return bagTypes_;
  }

  // Answers of `action` ("bag" included) wait until `release`.
  void hold(const std::string& action) {
    {
      std::lock_guard lock(mutex_);
      held_ = action;
    }
    changed_.notify_all();
  }
  void release() {
    {
      std::lock_guard lock(mutex_);
      held_.reset();
    }
    changed_.notify_all();
  }

  [[nodiscard]] std::vector<Received> received(const std::string& action) const {
    std::lock_guard lock(mutex_);
    std::vector<Received> matching;
    for (const Received& request : received_) {
      if (request.action == action) matching.push_back(request);
    }
    return matching;
  }
  [[nodiscard]] std::size_t count(const std::string& action) const {
    return received(action).size();
  }
  [[nodiscard]] std::vector<std::string> actions() const {
    std::lock_guard lock(mutex_);
    std::vector<std::string> names;
    for (const Received& request : received_) names.push_back(request.action);
    return names;
  }
  bool waitForCount(const std::string& action, std::size_t count,
                    std::chrono::milliseconds limit = std::chrono::seconds(10)) const {
    return waitUntil([&] { return this->count(action) >= count; }, limit);
  }

  // A listing item with an id, a name and, when given, an extended media kind.
  static Tag item(std::uint64_t identifier, std::string_view name,
                  std::optional<std::uint32_t> mediaKind = std::nullopt) {
    std::vector<Tag> fields{u8("mikd", 2), u64("miid", identifier), text("minm", name)};
    if (mediaKind) fields.push_back(u32("aeMk", *mediaKind));
    return container("mlit", std::move(fields));
  }

 private:
  PlistDictionary bag() const {
    std::lock_guard lock(mutex_);
    PlistDictionary bag{{"ttl", 3600}};
    if (!settings_) return bag;
    PlistDictionary service{{"base-url", baseURL()}};
    for (const auto& [key, value] : *settings_) service[key] = value;
    bag["purchase-daap"] = service;
    return bag;
  }

  void answer(const std::string& action, const httplib::Request& request,
              httplib::Response& response) {
    Received received{action, request.method, request.target, {}, {}, false};
    for (const auto& [name, value] : request.headers) received.headers.emplace(name, value);
    received.body.assign(request.body.begin(), request.body.end());
    const VendRequestSigner signer(key_);
    received.signatureValid = VendRequestSigner::signaturesMatch(
        request.get_header_value(std::string(VendRequestSigner::kSignatureHeader)),
        signer.requestSignature(request.method, request.target, received.body));
    Responder responder;
    {
      std::unique_lock lock(mutex_);
      received_.push_back(received);
      changed_.wait(lock, [&] { return held_ != action; });
      responder = responders_[action];
    }
    const Answer answer = responder ? responder(received) : Answer{.status = 404};
    response.status = answer.status;
    response.set_content(reinterpret_cast<const char*>(answer.body.data()), answer.body.size(),
                         answer.contentType);
    if (answer.signing == Signing::Unsigned) return;
    const std::string signature =
        answer.signing == Signing::Forged
            ? std::string(64, '0')
            : signer.answerSignature(answer.status, std::span<const std::uint8_t>(answer.body));
    response.set_header(std::string(VendRequestSigner::kSignatureHeader), signature);
  }

  PlistData key_;
  httplib::Server server_;
  int port_ = 0;
  std::thread thread_;
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::optional<PlistDictionary> settings_ = PlistDictionary{};
  std::map<std::string, Responder> responders_;
  std::optional<std::string> held_;
  std::vector<Received> received_;
  int bagRequests_ = 0;
  std::vector<std::string> bagTypes_;
};

// Records what the client tells its owner; hands out the token pairs set.
class RecordingDelegate : public LedgerDAAPClientDelegate {
 public:
  struct Event {
    std::int64_t number = 0;
    DAAPDictionary info;
    bool success = false;
    OptionalError error;
  };
  struct Update {
    std::optional<DAAPArray> items;
    std::optional<std::int64_t> latestVersion;
    std::optional<DAAPArray> deleted;
  };

  std::optional<std::vector<PlistDictionary>> daapClientTokenPairsForLocalDatabaseWithClient(
      DAAPClient& /*client*/) override {
    std::lock_guard lock(mutex_);
    ++tokenPairRequests_;
    return tokenPairs_;
  }
  void daapClientUpdatedItemsWithLatestVersionDeletedItems(
      DAAPClient& /*client*/, const std::optional<DAAPArray>& updatedItems,
      std::optional<std::int64_t> latestVersion,
      const std::optional<DAAPArray>& deletedItems) override {
    std::lock_guard lock(mutex_);
    updates_.push_back({updatedItems, latestVersion, deletedItems});
  }
  void daapClientHandledEventEventInfoWithSuccessError(DAAPClient& /*client*/, std::int64_t event,
                                                       const DAAPDictionary& eventInfo,
                                                       bool success,
                                                       const OptionalError& error) override {
    std::lock_guard lock(mutex_);
    events_.push_back({event, eventInfo, success, error});
  }

  void setTokenPairs(std::optional<std::vector<PlistDictionary>> pairs) {
    std::lock_guard lock(mutex_);
    tokenPairs_ = std::move(pairs);
  }
  [[nodiscard]] std::vector<Event> events() const {
    std::lock_guard lock(mutex_);
    return events_;
  }
  [[nodiscard]] std::vector<Update> updates() const {
    std::lock_guard lock(mutex_);
    return updates_;
  }
  [[nodiscard]] int tokenPairRequests() const {
    std::lock_guard lock(mutex_);
    return tokenPairRequests_;
  }
  void clear() {
    std::lock_guard lock(mutex_);
    events_.clear();
    updates_.clear();
  }

 private:
  mutable std::mutex mutex_;
  std::optional<std::vector<PlistDictionary>> tokenPairs_;
  std::vector<Event> events_;
  std::vector<Update> updates_;
  int tokenPairRequests_ = 0;
};

// The outcome of one poll, waited for.
struct PollResult {
  bool success = false;
  std::optional<DAAPArray> items;
  std::optional<DAAPArray> deleted;
};

inline std::optional<PollResult> pollAndWait(
    DAAPClient& client, bool forced, std::chrono::milliseconds limit = std::chrono::seconds(20)) {
  struct Shared {
    std::mutex mutex;
    std::condition_variable done;
    std::optional<PollResult> result;
  };
  auto shared = std::make_shared<Shared>();
  client.pollForUpdatesWithForcedUpdate(
      forced, [shared](bool success, const std::optional<DAAPArray>& items,
                       const std::optional<DAAPArray>& deleted) {
        std::lock_guard lock(shared->mutex);
        shared->result = PollResult{success, items, deleted};
        shared->done.notify_all();
      });
  std::unique_lock lock(shared->mutex);
  shared->done.wait_for(lock, limit, [&] { return shared->result.has_value(); });
  return shared->result;
}

// A private root (with a machine id), preference folder, runtime and
// signed-in account, and a fake service; makes clients on a run loop of
// its own.
class DAAPClientFixture : public ::testing::Test {
 protected:
  static constexpr std::uint64_t kAccountID = 4242;
  static constexpr char kMachineID[] = "0123456789abcdef0123456789abcdef";
  static constexpr char kServiceName[] = "QzPurchaseDaap";

  DAAPClientFixture() : service_(signingKey()) {}

  static PlistData signingKey() { return bytesOf("the account's signing key"); }

  void SetUp() override {
    environment_.set("LARDER_ROOT", folder_.path() + "/root");
    environment_.set("XDG_CONFIG_HOME", folder_.path() + "/config");
    environment_.set("XDG_STATE_HOME", folder_.path() + "/state");
    ASSERT_TRUE(FileIO::writeAtomically(folder_.path() + "/root/etc/machine-id",
                                        std::string(kMachineID) + "\n"));
    startRuntime(10);
  }

  void TearDown() override {
    // Polls still queued would outlive the test: stop the timers, let
    // held answers go, and wait for the polling queue to drain.
    for (const auto& client : clients_) client->stopUpdating();
    service_.release();
    DAAPClient::pollingQueue()->sync([] {});
    clients_.clear();
    VendRuntime::setShared(nullptr);
  }

  void startRuntime(double requestTimeout) {
    VendRuntimeConfiguration configuration;
    configuration.bagURL = service_.bagURL();
    configuration.stateDirectory = folder_.path() + "/state/larder";
    configuration.downloadsDirectory = folder_.path() + "/downloads";
    configuration.connectTimeout = std::chrono::seconds(2);
    configuration.requestTimeout = requestTimeout;
    runtime_ = std::make_shared<VendRuntime>(configuration);
    VendRuntime::setShared(runtime_);
  }

  void signIn() {
    runtime_->accountStore().signIn({.accountID = kAccountID,
                                     .orvaneID = "reader",
                                     .signingKey = signingKey(),
                                     .storeFrontID = "1"});
  }

  static VendStoreClient storeClient() {
    return VendStoreClient("com.example.Books", VendStoreClient::kBookApplication, 3,
                           "com.example.Books",
                           PlistDictionary{{"Client-DAAP-Version", "3.13"},
                                           {"Client-Cloud-Purchase-Daap-Version", 2}});
  }

  std::shared_ptr<DAAPClient> makeClient(
      const std::shared_ptr<RecordingDelegate>& delegate = nullptr,
      const VendStoreClient& storeClient = DAAPClientFixture::storeClient()) {
    auto owner = delegate ? delegate : delegate_;
    auto client =
        DAAPClient::initWithServiceName(kServiceName, storeClient, owner, runLoop_.loop());
    clients_.push_back(client);
    return client;
  }

  void writePreferences(const PlistDictionary& preferences) {
    ASSERT_TRUE(FileIO::writeAtomically(folder_.path() + "/config/larder/com.orvane.larderd.plist",
                                        PropertyListSerialization::writeXml(preferences)));
  }

  TemporaryFolder folder_;
  ScopedEnvironment environment_;
  FakeCloudLibrary service_;
  RunLoopThread runLoop_;
  std::shared_ptr<VendRuntime> runtime_;
  std::shared_ptr<RecordingDelegate> delegate_ = std::make_shared<RecordingDelegate>();
  std::vector<std::shared_ptr<DAAPClient>> clients_;
};

}  // namespace larder::dmaptest

namespace larder::dmaptest {
namespace {

using namespace std::chrono_literals;
using Answer = FakeCloudLibrary::Answer;
using Received = FakeCloudLibrary::Received;
using State = DAAPClient::State;

std::vector<std::uint64_t> itemIDs(const std::optional<DAAPArray>& items) {
  std::vector<std::uint64_t> identifiers;
  if (!items) return identifiers;
  for (const DAAPValue& value : *items) identifiers.push_back(value.item()->itemID());
  return identifiers;
}

std::vector<std::int64_t> numbers(const std::optional<DAAPArray>& values) {
  std::vector<std::int64_t> result;
  if (!values) return result;
  for (const DAAPValue& value : *values) result.push_back(value.int64Value());
  return result;
}

std::vector<std::int64_t> eventNumbers(const std::vector<RecordingDelegate::Event>& events) {
  std::vector<std::int64_t> result;
  for (const auto& event : events) result.push_back(event.number);
  return result;
}

std::vector<std::string> keysOf(const DAAPDictionary& dictionary) {
  std::vector<std::string> keys;
  for (const auto& [key, value] : dictionary) keys.push_back(key.str());
  return keys;
}

class DAAPClientTest : public DAAPClientFixture {
 protected:
  // Starts a client and waits for the poll that the bag's arrival starts.
  std::shared_ptr<DAAPClient> startedClient(std::optional<std::int64_t> localVersion,
                                            std::size_t updatesBefore = 0) {
    auto client = makeClient();
    client->startUpdatingWithLocalVersion(localVersion);
    EXPECT_TRUE(service_.waitForCount("update", updatesBefore + 1));
    EXPECT_TRUE(waitUntil([&] { return client->pollingTimer() && client->forcedRefreshTimer(); }));
    DAAPClient::pollingQueue()->sync([] {});  // the poll has finished
    return client;
  }
};

TEST_F(DAAPClientTest, FirstPollFetchesEverythingAndComesInStep) {
  signIn();
  service_.setRevision(3);
  service_.setItems({FakeCloudLibrary::item(1001, "First"), FakeCloudLibrary::item(1002, "Second")},
                    {9, 10});
  auto client = makeClient();
  EXPECT_EQ(client->state(), State::Stopped);
  client->startUpdatingWithLocalVersion(std::nullopt);  // nothing held: revision 0
  ASSERT_TRUE(waitUntil([&] { return delegate_->updates().size() == 1; }));
  DAAPClient::pollingQueue()->sync([] {});

  const auto update = delegate_->updates().at(0);
  EXPECT_EQ(itemIDs(update.items), (std::vector<std::uint64_t>{1001, 1002}));
  EXPECT_EQ(update.latestVersion, 3);
  EXPECT_EQ(numbers(update.deleted), (std::vector<std::int64_t>{9, 10}));
  EXPECT_EQ(service_.actions(), (std::vector<std::string>{"login", "update", "items"}));
  EXPECT_EQ(client->sessionID(), 77);
  EXPECT_EQ(client->latestVersion(), 3);
  EXPECT_EQ(client->localVersion(), 3);
  EXPECT_EQ(client->state(), State::InStep);
  EXPECT_EQ(delegate_->tokenPairRequests(), 1);
}

TEST_F(DAAPClientTest, EveryStepIsSignedWithTheClientsHeadersAndToldWithItsInfo) {
  signIn();
  service_.setRevision(3);
  service_.setItems({FakeCloudLibrary::item(1001, "First")}, {});
  auto client = startedClient(1);
  ASSERT_EQ(service_.actions(), (std::vector<std::string>{"login", "update", "items"}));
  for (const std::string action : {"login", "update", "items"}) {
    const Received request = service_.received(action).at(0);
    SCOPED_TRACE(action);
    EXPECT_EQ(request.method, "POST");
    EXPECT_TRUE(request.signatureValid);
    EXPECT_EQ(request.header("X-Larder-Account-ID"), std::to_string(kAccountID));
    EXPECT_EQ(request.header("Client-DAAP-Version"), "3.13");
    EXPECT_EQ(request.header("Client-Cloud-Purchase-Daap-Version"), "2");
    EXPECT_EQ(request.header("Client-Cloud-DAAP-Request-Reason"), "1");
    EXPECT_EQ(request.header("X-Guid"), kMachineID);
  }
  EXPECT_EQ(service_.received("login").at(0).target, "/daap/login");
  EXPECT_TRUE(service_.received("login").at(0).body.empty());
  EXPECT_EQ(service_.received("update").at(0).target, "/daap/update");
  EXPECT_EQ(service_.received("items").at(0).target, "/daap/databases/1/items?includePreorders=1");

  const auto events = delegate_->events();
  ASSERT_EQ(eventNumbers(events), (std::vector<std::int64_t>{1, 2, 4}));
  for (const auto& event : events) {
    EXPECT_TRUE(event.success);
    EXPECT_FALSE(event.error);
    EXPECT_EQ(lookup(event.info, "reason"), DAAPValue(1));
  }
  EXPECT_EQ(keysOf(events[0].info), (std::vector<std::string>{"reason", "sessionID"}));
  EXPECT_EQ(lookup(events[0].info, "sessionID"), DAAPValue(77));
  EXPECT_EQ(keysOf(events[1].info), (std::vector<std::string>{"reason", "response"}));
  EXPECT_EQ(lookup(events[1].info, "response")["dmap.serverrevision"], DAAPValue(3));
  EXPECT_EQ(keysOf(events[2].info),
            (std::vector<std::string>{"latestVersion", "localVersion", "reason", "response"}));
  EXPECT_EQ(lookup(events[2].info, "localVersion"), DAAPValue(1));
  EXPECT_EQ(lookup(events[2].info, "latestVersion"), DAAPValue(3));
  EXPECT_EQ(lookup(events[2].info, "response")["dmap.listing"].array()->size(), 1U);
}

TEST_F(DAAPClientTest, UnchangedRevisionSendsNoItemsRequestUnlessForced) {
  signIn();
  service_.setRevision(5);
  LogCapture log;
  auto client = startedClient(5);
  const auto poll = pollAndWait(*client, false);
  ASSERT_TRUE(poll);
  EXPECT_TRUE(poll->success);
  EXPECT_FALSE(poll->items);
  EXPECT_FALSE(poll->deleted);
  EXPECT_EQ(service_.count("login"), 2U);
  EXPECT_EQ(service_.count("update"), 2U);
  EXPECT_EQ(service_.count("items"), 0U);
  EXPECT_TRUE(delegate_->updates().empty());
  EXPECT_EQ(client->state(), State::InStep);
  EXPECT_EQ(log.countExactly("DAAPClient: pollForUpdate did not load items because "
                             "localVersion=latestVersion (5=5), forcedUpdate=0",
                             1),
            2U);

  const auto forced = pollAndWait(*client, true);
  ASSERT_TRUE(forced && forced->success);
  ASSERT_EQ(service_.count("items"), 1U);
  const auto body = DAAPItemsRequest::parse(service_.received("items").at(0).body);
  ASSERT_TRUE(body);
  EXPECT_EQ(body->latestVersion, 5U);
  EXPECT_EQ(body->localVersion, 5U);
  EXPECT_EQ(service_.received("items").at(0).target, "/daap/databases/5/items?includePreorders=1");
}

TEST_F(DAAPClientTest, ItemsRequestIsTheExactBody) {
  signIn();
  service_.setRevision(8);
  delegate_->setTokenPairs(DAAPClient::TokenPairs{*DAAPClient::tokenPairWithCloudID(1001, 7),
                                                  *DAAPClient::tokenPairWithCloudID(1002, 8)});
  auto client = makeClient();
  client->setMediaKinds({2, 64});
  const auto before = static_cast<std::uint32_t>(std::time(nullptr));
  client->startUpdatingWithLocalVersion(6);
  ASSERT_TRUE(service_.waitForCount("items", 1));
  const auto after = static_cast<std::uint32_t>(std::time(nullptr));

  const std::string query = *DAAPMediaKindQuery::text(std::vector<std::int64_t>{2, 64});
  const Received items = service_.received("items").at(0);
  const auto parsed = DAAPItemsRequest::parse(items.body);
  ASSERT_TRUE(parsed && parsed->utcTime);
  EXPECT_GE(*parsed->utcTime, before);
  EXPECT_LE(*parsed->utcTime, after);
  // Built tag by tag by the test; only the clock is taken from the request.
  std::vector<Tag> pairs{container("aeti", {u32("aeto", 7), u64("mild", 1001)}),
                         container("aeti", {u32("aeto", 8), u64("mild", 1002)})};
  const PlistData expected = document(container(
      "adsr", {u32("mstc", *parsed->utcTime), u32("mlid", 77), u8("mikd", 2), u32("musr", 8),
               u32("mder", 6), text("mque", query), container("aetl", std::move(pairs))}));
  EXPECT_EQ(items.body, expected);
  EXPECT_EQ(items.header("Content-Type"), "application/x-dmap-tagged");
  // The revision request names the session, the owner's revision and the kinds.
  EXPECT_EQ(service_.received("update").at(0).bodyText(),
            "session-id=77&revision-number=6&query=" + query);
  EXPECT_EQ(service_.received("update").at(0).header("Content-Type"),
            "application/x-www-form-urlencoded");
}

TEST_F(DAAPClientTest, DatabasesListingIsAskedForWithBothRevisions) {
  signIn();
  service_.setResponder("databases", [](const Received&) {
    return Answer{
        .body = document(container(
            "avdb",
            {u32("mstt", 200), u32("mrco", 1),
             container("mlcl", {container("mlit", {u64("miid", 1), text("minm", "Library")})})}))};
  });
  auto client = startedClient(3);
  delegate_->clear();
  const auto databases = client->getDatabasesWithLocalVersion(3, 4, 1);
  ASSERT_TRUE(databases);
  ASSERT_EQ(databases->size(), 1U);
  EXPECT_EQ((*databases)[0].item()->name(), "Library");
  const Received request = service_.received("databases").at(0);
  EXPECT_EQ(request.bodyText(), "session-id=77&revision-number=4&delta=3");
  EXPECT_EQ(request.target, "/daap/databases");
  ASSERT_EQ(eventNumbers(delegate_->events()), (std::vector<std::int64_t>{3}));
  EXPECT_TRUE(delegate_->events()[0].success);
}

TEST_F(DAAPClientTest, ItemsOfOtherMediaKindsNeverReachTheOwner) {
  signIn();
  service_.setRevision(2);
  service_.setItems(
      {FakeCloudLibrary::item(1, "Kind four", 4), FakeCloudLibrary::item(2, "Kind two", 2),
       FakeCloudLibrary::item(3, "No kind"), FakeCloudLibrary::item(4, "Kind 64", 64)},
      {});
  LogCapture log;
  auto client = makeClient();
  client->setMediaKinds({2, 64, 1});
  client->startUpdatingWithLocalVersion(1);
  ASSERT_TRUE(waitUntil([&] { return delegate_->updates().size() == 1; }));
  EXPECT_EQ(itemIDs(delegate_->updates()[0].items), (std::vector<std::uint64_t>{2, 3, 4}));
  EXPECT_EQ(log.countContaining("from DAAP as it's media kind (4) is not of the requested "
                                "type(s) (2, 64, 1)"),
            1U);
  // The poll's handler gets the filtered items as well.
  const auto poll = pollAndWait(*client, true);
  ASSERT_TRUE(poll);
  EXPECT_EQ(itemIDs(poll->items), (std::vector<std::uint64_t>{2, 3, 4}));
}

TEST_F(DAAPClientTest, ContentTypeWithAParameterIsNotDecoded) {
  signIn();
  service_.setResponder("update", [](const Received&) {
    return Answer{.contentType = "application/x-dmap-tagged; charset=binary",
                  .body = document(container("mupd", {u32("mstt", 200), u32("musr", 9)}))};
  });
  auto client = startedClient(1);
  EXPECT_EQ(service_.count("items"), 0U);
  EXPECT_FALSE(client->latestVersion());
  const auto events = delegate_->events();
  ASSERT_EQ(eventNumbers(events), (std::vector<std::int64_t>{1, 2}));
  EXPECT_FALSE(events[1].success);
  EXPECT_EQ(client->state(), State::Session);
}

TEST_F(DAAPClientTest, AnswersThatFailVerificationAreStillUsed) {
  signIn();
  service_.setResponder("update", [](const Received&) {
    return Answer{.body = document(container("mupd", {u32("mstt", 200), u32("musr", 4)})),
                  .signing = FakeCloudLibrary::Signing::Unsigned};
  });
  const PlistData items = document(container(
      "adbs", {u32("mstt", 200), container("mlcl", {FakeCloudLibrary::item(5, "Five")})}));
  service_.setResponder("items", [items](const Received&) {
    return Answer{.body = items, .signing = FakeCloudLibrary::Signing::Forged};
  });
  LogCapture log;
  auto client = startedClient(1);
  ASSERT_EQ(delegate_->updates().size(), 1U);
  EXPECT_EQ(itemIDs(delegate_->updates()[0].items), (std::vector<std::uint64_t>{5}));
  EXPECT_EQ(client->localVersion(), 4);
  EXPECT_EQ(log.countContaining("signature verification failed for the response to update"), 1U);
  EXPECT_EQ(log.countContaining("signature verification failed for the response to "
                                "databases/1/items"),
            1U);
}

TEST_F(DAAPClientTest, WithoutPrimaryAccountNothingGoesOut) {
  LogCapture log;
  auto client = makeClient();
  const auto poll = pollAndWait(*client, false);
  ASSERT_TRUE(poll);
  EXPECT_FALSE(poll->success);
  EXPECT_TRUE(service_.actions().empty());
  const auto events = delegate_->events();
  ASSERT_EQ(eventNumbers(events), (std::vector<std::int64_t>{1}));
  EXPECT_FALSE(events[0].success);
  ASSERT_TRUE(events[0].error);
  EXPECT_EQ(events[0].error->domain, "DAAPClient");
  EXPECT_EQ(events[0].error->code, 0);
  EXPECT_EQ(events[0].error->description, "No primary account is present");
  EXPECT_EQ(log.countExactly("DAAPClient: Will not perform DAAP request for action login because "
                             "no primary account is present",
                             1),
            1U);
}

TEST_F(DAAPClientTest, FailedLoginWithoutSessionEndsThePoll) {
  signIn();
  service_.setResponder("login", [](const Received&) { return Answer{.status = 500}; });
  auto client = makeClient();
  const auto poll = pollAndWait(*client, true);
  ASSERT_TRUE(poll);
  EXPECT_FALSE(poll->success);
  EXPECT_EQ(service_.actions(), (std::vector<std::string>{"login"}));
  ASSERT_EQ(delegate_->events().size(), 1U);
  EXPECT_FALSE(delegate_->events()[0].success);
  EXPECT_TRUE(delegate_->events()[0].error);
  EXPECT_FALSE(client->sessionID());
}

TEST_F(DAAPClientTest, LoginThatGivesNoNumberKeepsTheOlderSession) {
  signIn();
  service_.setRevision(2, 31);
  auto client = startedClient(2);
  EXPECT_EQ(client->sessionID(), 31);
  service_.setResponder("login", [](const Received&) {
    return Answer{.body = document(container("mupd", {u32("mstt", 200), u32("musr", 2)}))};
  });
  delegate_->clear();
  const auto poll = pollAndWait(*client, false);
  ASSERT_TRUE(poll && poll->success);
  EXPECT_EQ(client->sessionID(), 31);
  EXPECT_EQ(service_.received("update").back().bodyText(), "session-id=31&revision-number=2");
  ASSERT_EQ(eventNumbers(delegate_->events()), (std::vector<std::int64_t>{1, 2}));
  EXPECT_FALSE(delegate_->events()[0].success);
}

TEST_F(DAAPClientTest, ErrorDocumentAsRevisionCountsAsSuccessWithoutRevision) {
  signIn();
  service_.setResponder("update", [](const Received&) {
    return Answer{.body = document(container("merr", {u32("mstt", 503), u32("aeRC", 30)}))};
  });
  auto client = startedClient(1);
  const auto events = delegate_->events();
  ASSERT_EQ(eventNumbers(events), (std::vector<std::int64_t>{1, 2}));
  EXPECT_TRUE(events[1].success);
  EXPECT_EQ(lookup(events[1].info, "response")["com.orvane.sonorel.reconnect-interval"],
            DAAPValue(30));
  EXPECT_FALSE(client->latestVersion());
  EXPECT_EQ(service_.count("items"), 0U);
}

TEST_F(DAAPClientTest, FailedItemsRequestKeepsTheOwnersRevisionForTheNextPoll) {
  signIn();
  service_.setRevision(4);
  service_.setResponder("items", [](const Received&) { return Answer{.status = 500}; });
  auto client = startedClient(2);
  ASSERT_EQ(delegate_->updates().size(), 1U);
  EXPECT_FALSE(delegate_->updates()[0].items);
  EXPECT_FALSE(delegate_->updates()[0].deleted);
  EXPECT_EQ(delegate_->updates()[0].latestVersion, 4);
  EXPECT_EQ(client->localVersion(), 2);
  EXPECT_FALSE(delegate_->events().back().success);
  EXPECT_EQ(delegate_->events().back().number, DAAPClient::kEventGetItems);

  service_.setItems({FakeCloudLibrary::item(7, "Seven")}, {});
  const auto poll = pollAndWait(*client, false);
  ASSERT_TRUE(poll && poll->success);
  EXPECT_EQ(itemIDs(poll->items), (std::vector<std::uint64_t>{7}));
  EXPECT_EQ(service_.count("items"), 2U);
  EXPECT_EQ(client->localVersion(), 4);
}

TEST_F(DAAPClientTest, ARevisionThatNeverComesEndsWithTheTimeoutAndPollingGoesOn) {
  startRuntime(1);  // seconds without progress before a request fails
  signIn();
  service_.setRevision(3);
  auto client = makeClient();
  service_.hold("update");
  const auto started = std::chrono::steady_clock::now();
  client->startUpdatingWithLocalVersion(1);
  ASSERT_TRUE(waitUntil([&] { return delegate_->events().size() == 2; }));
  const auto waited = std::chrono::steady_clock::now() - started;
  // The transport measures progress as an average over a few seconds, so
  // a request whose body went out gives up some seconds after the limit.
  EXPECT_GE(waited, 900ms);
  EXPECT_LT(waited, 15s);
  DAAPClient::pollingQueue()->sync([] {});
  EXPECT_TRUE(delegate_->updates().empty());  // an unknown revision ends the poll quietly
  EXPECT_EQ(service_.count("items"), 0U);
  ASSERT_EQ(eventNumbers(delegate_->events()), (std::vector<std::int64_t>{1, 2}));
  EXPECT_FALSE(delegate_->events()[1].success);
  EXPECT_TRUE(delegate_->events()[1].error);
  service_.release();

  const auto next = pollAndWait(*client, false);
  ASSERT_TRUE(next && next->success);
  EXPECT_EQ(client->latestVersion(), 3);
  EXPECT_EQ(service_.count("items"), 1U);
}

TEST_F(DAAPClientTest, StatesFollowTheSession) {
  signIn();
  service_.setRevision(6);
  auto client = makeClient();
  EXPECT_EQ(client->state(), State::Stopped);
  service_.hold("bag");
  client->startUpdatingWithLocalVersion(5);
  ASSERT_TRUE(waitUntil([&] { return service_.bagRequests() == 1; }));
  EXPECT_EQ(client->state(), State::WaitingForBag);
  EXPECT_FALSE(client->pollingTimer());
  service_.hold("login");  // in place of the bag
  ASSERT_TRUE(service_.waitForCount("login", 1));
  EXPECT_EQ(client->state(), State::NoSession);
  service_.release();
  DAAPClient::pollingQueue()->sync([] {});
  EXPECT_EQ(client->state(), State::InStep);
  EXPECT_EQ(client->localVersion(), 6);

  service_.setRevision(7);
  client->pollingQueue()->sync([] {});
  service_.setResponder("items", [](const Received&) { return Answer{.status = 500}; });
  ASSERT_TRUE(pollAndWait(*client, false));
  EXPECT_EQ(client->state(), State::Session);  // revision 7 seen, 6 held

  client->invalidateSession();
  EXPECT_FALSE(client->sessionID());
  EXPECT_FALSE(client->latestVersion());
  EXPECT_EQ(client->state(), State::NoSession);

  client->stopUpdating();
  EXPECT_EQ(client->state(), State::Stopped);
  EXPECT_FALSE(client->pollingTimer());
  EXPECT_FALSE(client->forcedRefreshTimer());
}

TEST_F(DAAPClientTest, PollingTimerRepeatsAtTheBagsPeriod) {
  signIn();
  service_.setRevision(2);
  service_.setServiceSettings(PlistDictionary{{"update-polling-frequency-secs", 0.25}});
  auto client = startedClient(2);
  EXPECT_DOUBLE_EQ(client->pollingFrequency(), 0.25);
  ASSERT_TRUE(service_.waitForCount("login", 4));
  EXPECT_EQ(service_.count("items"), 0U);  // the revisions agree: logins and updates only
}

TEST_F(DAAPClientTest, ForcedRefreshTimerAsksForItemsAndItsPeriodIsInMinutes) {
  signIn();
  service_.setRevision(2);
  service_.setServiceSettings(PlistDictionary{{"forced-refresh-frequency-minutes", 10080}});
  // The preference wins over the bag: 0.005 minutes are 0.3 seconds.
  writePreferences(
      {{std::string(DAAPClientPreferences::kDefaultsDAAPForcedRefreshIntervalKey), 0.005}});
  auto client = startedClient(2);
  EXPECT_DOUBLE_EQ(client->forcedRefreshFrequency(), 0.005);
  ASSERT_TRUE(service_.waitForCount("items", 2));
  const auto body = DAAPItemsRequest::parse(service_.received("items").at(0).body);
  ASSERT_TRUE(body);
  EXPECT_EQ(body->latestVersion, 2U);
  EXPECT_EQ(body->localVersion, 2U);
}

TEST_F(DAAPClientTest, PeriodsComeFromPreferenceThenBagThenDefault) {
  service_.setServiceSettings(std::nullopt);  // no "purchase-daap" at all
  auto client = makeClient();
  EXPECT_DOUBLE_EQ(client->pollingFrequency(), 3600);
  EXPECT_DOUBLE_EQ(client->forcedRefreshFrequency(), 10080);
  EXPECT_FALSE(client->baseURL());
  EXPECT_FALSE(client->daapURLWithAction("login"));

  service_.setServiceSettings(PlistDictionary{{"update-polling-frequency-secs", "120"},
                                              {"forced-refresh-frequency-minutes", 60}});
  runtime_->urlBag().load(0, true);
  EXPECT_DOUBLE_EQ(client->pollingFrequency(), 120);
  EXPECT_DOUBLE_EQ(client->forcedRefreshFrequency(), 60);
  EXPECT_EQ(client->baseURL(), service_.baseURL());

  writePreferences(
      {{std::string(DAAPClientPreferences::kDefaultsDAAPPollingIntervalKey), 30},
       {std::string(DAAPClientPreferences::kDefaultsDAAPForcedRefreshIntervalKey), -1}});
  EXPECT_DOUBLE_EQ(client->pollingFrequency(), 30);
  EXPECT_DOUBLE_EQ(client->forcedRefreshFrequency(), 60);  // a negative period is none

  service_.setServiceSettings(PlistDictionary{{"update-polling-frequency-secs", "often"}});
  runtime_->urlBag().load(0, true);
  writePreferences({});
  EXPECT_DOUBLE_EQ(client->pollingFrequency(), 3600);
}

TEST_F(DAAPClientTest, OnlyTheItemsActionAsksForPreorders) {
  auto client = makeClient();
  EXPECT_EQ(client->daapURLWithAction("login"), service_.baseURL() + "/login");
  EXPECT_EQ(client->daapURLWithAction("update"), service_.baseURL() + "/update");
  EXPECT_EQ(client->daapURLWithAction("databases"), service_.baseURL() + "/databases");
  EXPECT_EQ(client->daapURLWithAction("databases/12/items"),
            service_.baseURL() + "/databases/12/items?includePreorders=1");
  service_.setServiceSettings(PlistDictionary{{"base-url", service_.baseURL() + "/?shard=2"}});
  runtime_->urlBag().load(0, true);
  EXPECT_EQ(client->daapURLWithAction("databases/3/items"),
            service_.baseURL() + "/databases/3/items?shard=2&includePreorders=1");
}

TEST_F(DAAPClientTest, BagUpdateDropsTheSessionAndPollsButKeepsRunningTimers) {
  signIn();
  service_.setRevision(2, 50);
  auto client = startedClient(2);
  const auto polling = client->pollingTimer();
  const auto forced = client->forcedRefreshTimer();
  ASSERT_TRUE(polling && forced);
  service_.setRevision(2, 51);
  runtime_->urlBag().load(0, true);
  ASSERT_TRUE(service_.waitForCount("login", 2));
  DAAPClient::pollingQueue()->sync([] {});
  EXPECT_EQ(client->sessionID(), 51);
  // Let the run loop take up what the bag update posted.
  DispatchSemaphore ran;
  runLoop_.loop().perform([&] { ran.signal(); });
  ASSERT_TRUE(ran.waitFor(5s));
  EXPECT_EQ(client->pollingTimer(), polling);
  EXPECT_EQ(client->forcedRefreshTimer(), forced);
}

TEST_F(DAAPClientTest, ClientKeepsToTheBagTypeOfItsStoreClient) {
  signIn();
  service_.setRevision(2);
  VendStoreClient softwareStore = storeClient();
  softwareStore.setRequiredBagType(1);
  auto client = makeClient(nullptr, softwareStore);
  client->startUpdatingWithLocalVersion(2);
  ASSERT_TRUE(service_.waitForCount("update", 1));
  ASSERT_TRUE(waitUntil([&] { return client->pollingTimer().has_value(); }));
  DAAPClient::pollingQueue()->sync([] {});
  EXPECT_EQ(service_.bagTypes(), std::vector<std::string>{"1"}) << "settings come from its bag";
  // A refresh of another bag keeps the session; one of its own drops it.
  runtime_->urlBag().load(0, true);
  DAAPClient::pollingQueue()->sync([] {});
  EXPECT_EQ(service_.count("login"), 1U);
  runtime_->urlBag().load(1, true);
  DAAPClient::pollingQueue()->sync([] {});
  EXPECT_EQ(service_.count("login"), 2U);
}

TEST_F(DAAPClientTest, AClientMadeFromItsTypeAloneSendsTheVersionHeaders) {
  signIn();
  service_.setRevision(2);
  auto client = makeClient(
      nullptr, VendStoreClient::initWithStoreClientType(VendStoreClient::kBookApplication));
  ASSERT_TRUE(pollAndWait(*client, false));
  const Received login = service_.received("login").at(0);
  EXPECT_FALSE(login.header("Client-DAAP-Version").empty());
  EXPECT_FALSE(login.header("Client-Cloud-Purchase-Daap-Version").empty());
}

TEST_F(DAAPClientTest, AClearedDelegateIsToldNothingMore) {
  signIn();
  service_.setRevision(2);
  auto client = startedClient(1);
  ASSERT_EQ(delegate_->updates().size(), 1U);
  const std::size_t events = delegate_->events().size();
  client->setDelegate(nullptr);
  EXPECT_EQ(client->delegate(), nullptr);
  ASSERT_TRUE(pollAndWait(*client, true));
  EXPECT_EQ(service_.count("items"), 2U) << "the poll itself still runs";
  EXPECT_EQ(delegate_->updates().size(), 1U);
  EXPECT_EQ(delegate_->events().size(), events);
}

TEST_F(DAAPClientTest, StoppedClientIgnoresBagUpdatesAndKeepsItsSession) {
  signIn();
  service_.setRevision(2);
  auto client = startedClient(2);
  client->stopUpdating();
  // A running client beside it logs in again on the same bag update: once
  // it has, the stopped one has been given the update too.
  auto running = makeClient(std::make_shared<RecordingDelegate>());
  running->startUpdatingWithLocalVersion(2);
  ASSERT_TRUE(service_.waitForCount("update", 2));
  DAAPClient::pollingQueue()->sync([] {});
  const std::size_t logins = service_.count("login");
  service_.setRevision(2, 78);
  runtime_->urlBag().load(0, true);
  ASSERT_TRUE(waitUntil([&] { return running->sessionID() == 78; }));
  DAAPClient::pollingQueue()->sync([] {});
  EXPECT_EQ(service_.count("login"), logins + 1) << "the running client's alone";
  EXPECT_EQ(client->sessionID(), 77);
  EXPECT_EQ(client->state(), State::Stopped);
}

TEST_F(DAAPClientTest, TimersDoNothingOnceTheOwnerHasGone) {
  signIn();
  service_.setRevision(2);
  auto owner = std::make_shared<RecordingDelegate>();
  auto client = makeClient(owner);
  owner.reset();
  client->pollingTimerFired();
  client->forcedRefreshTimerFired();
  DAAPClient::pollingQueue()->sync([] {});
  EXPECT_TRUE(service_.actions().empty());
  // A poll asked for directly still runs, with nobody to tell.
  const auto poll = pollAndWait(*client, true);
  ASSERT_TRUE(poll && poll->success);
  EXPECT_EQ(service_.actions(), (std::vector<std::string>{"login", "update", "items"}));
}

TEST_F(DAAPClientTest, TicksDoNotPileUpBehindAPollThatHangs) {
  signIn();
  service_.setRevision(2);
  auto client = makeClient();
  service_.hold("login");
  client->pollingTimerFired();
  ASSERT_TRUE(service_.waitForCount("login", 1));
  for (int tick = 0; tick < 5; ++tick) client->pollingTimerFired();
  client->forcedRefreshTimerFired();
  client->forcedRefreshTimerFired();
  service_.release();
  DAAPClient::pollingQueue()->sync([] {});
  // The hanging poll, one waiting polling tick and one forced refresh.
  EXPECT_EQ(service_.count("login"), 3U);
  EXPECT_EQ(service_.count("items"), 1U);
}

TEST_F(DAAPClientTest, TwoClientsTakeTurnsOnTheOnePollingQueue) {
  signIn();
  service_.setRevision(2);
  auto first = makeClient();
  auto second = makeClient(std::make_shared<RecordingDelegate>());
  service_.hold("login");
  first->pollForUpdatesWithForcedUpdate(false);
  ASSERT_TRUE(service_.waitForCount("login", 1));
  // What the service had seen when the first poll came to its revision:
  // the second poll may not have logged in before then. Held by the
  // responder, which the service keeps after this body ends.
  auto loginsAtFirstUpdate = std::make_shared<std::atomic<std::size_t>>(0);
  service_.setResponder("update", [this, loginsAtFirstUpdate](const FakeCloudLibrary::Received&) {
    if (*loginsAtFirstUpdate == 0) *loginsAtFirstUpdate = service_.count("login");
    return FakeCloudLibrary::Answer{
        .body = document(container("mupd", {u32("mstt", 200), u32("musr", 2)}))};
  });
  auto secondDone = std::make_shared<std::atomic<bool>>(false);
  second->pollForUpdatesWithForcedUpdate(
      false, [secondDone](bool, const std::optional<DAAPArray>&, const std::optional<DAAPArray>&) {
        *secondDone = true;
      });
  service_.release();
  ASSERT_TRUE(waitUntil([&] { return secondDone->load(); }));
  EXPECT_EQ(loginsAtFirstUpdate->load(), 1U) << "the second poll waits for the first";
  EXPECT_EQ(service_.actions(), (std::vector<std::string>{"login", "update", "login", "update"}));
}

}  // namespace
}  // namespace larder::dmaptest
