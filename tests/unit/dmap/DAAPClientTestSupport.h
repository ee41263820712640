// Scaffolding of the session tests: a cloud library service on 127.0.0.1
// whose every answer a test can script, a delegate that records what it is
// told, a run loop on a thread of its own, and a private runtime, root and
// preference folder.
#pragma once

#include <gtest/gtest.h>
#include <httplib.h>

#include <chrono>
#include <condition_variable>
#include <cstdlib>
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
#include "dmap/DAAPItemsRequest.h"
#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/RunLoop.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/accounts/VendAccountStore.h"
#include "store-runtime/http/VendRequestSigner.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "tests/unit/ScopedEnvironment.h"

namespace larder::dmaptest {

namespace fs = std::filesystem;

using ScopedEnvironment = larder::testing::ScopedEnvironment;

class TemporaryFolder {
 public:
  TemporaryFolder() {
    std::string pattern = (fs::temp_directory_path() / "larder-daap-XXXXXX").string();
    path_ = ::mkdtemp(pattern.data());
  }
  ~TemporaryFolder() {
    std::error_code ignored;
    fs::remove_all(path_, ignored);
  }
  TemporaryFolder(const TemporaryFolder&) = delete;
  TemporaryFolder& operator=(const TemporaryFolder&) = delete;
  [[nodiscard]] const std::string& path() const { return path_; }

 private:
  std::string path_;
};

// A run loop served by a thread of its own, standing in for the main one.
class RunLoopThread {
 public:
  RunLoopThread() : thread_([this] { loop_.run(); }) {}
  ~RunLoopThread() {
    loop_.stop();
    thread_.join();
  }
  RunLoopThread(const RunLoopThread&) = delete;
  RunLoopThread& operator=(const RunLoopThread&) = delete;
  RunLoop& loop() { return loop_; }

 private:
  RunLoop loop_;
  std::thread thread_;
};

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
    [[nodiscard]] bool hasHeader(const std::string& name) const { return headers.contains(name); }
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
