// The account lookup operation against a scripted store in this process:
// the request it makes, and the answers it takes and refuses.
#include <gtest/gtest.h>
#include <httplib.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/http/VendRequestSigner.h"
#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendOrvaneIDLookupOperation.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;

// A store with a bag that points the lookup at "/who", which answers with
// whatever the test set and remembers every request.
class ScriptedLookupStore {
 public:
  struct Seen {
    std::string method;
    std::string target;
    bool signedRequest = false;
  };

  ScriptedLookupStore() {
    server_.Get("/bag.plist", [this](const httplib::Request&, httplib::Response& response) {
      const PlistDictionary bag{{"orvane-id-lookup", url("/who")}};
      response.set_content(PropertyListSerialization::writeXml(bag), "application/x-plist");
    });
    server_.Get("/who", [this](const httplib::Request& request, httplib::Response& response) {
      std::lock_guard lock(mutex_);
      seen_.push_back({request.method, request.target,
                       request.has_header(std::string(VendRequestSigner::kSignatureHeader))});
      response.status = status_;
      response.set_content(answer_, "application/x-plist");
    });
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
    while (!server_.is_running()) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  ~ScriptedLookupStore() {
    server_.stop();
    thread_.join();
  }
  ScriptedLookupStore(const ScriptedLookupStore&) = delete;
  ScriptedLookupStore& operator=(const ScriptedLookupStore&) = delete;

  [[nodiscard]] std::string url(std::string_view path) const {
    return "http://127.0.0.1:" + std::to_string(port_) + std::string(path);
  }

  void answerWith(const PlistValue& answer, int status = 200) {
    std::lock_guard lock(mutex_);
    answer_ = PropertyListSerialization::writeXml(answer);
    status_ = status;
  }

  [[nodiscard]] std::vector<Seen> seen() const {
    std::lock_guard lock(mutex_);
    return seen_;
  }

 private:
  httplib::Server server_;
  int port_ = 0;
  std::thread thread_;
  mutable std::mutex mutex_;
  std::string answer_;
  int status_ = 200;
  std::vector<Seen> seen_;
};

VendPurchaseRecord recordOf(PlistValue wareID, std::optional<std::string> account) {
  VendPurchaseRecord record;
  record.wareID = std::move(wareID);
  record.opaqueAccountIDString = std::move(account);
  return record;
}

class OrvaneIDLookupOperationTest : public ::testing::Test {
 protected:
  void SetUp() override {
    directory_ = fs::temp_directory_path() /
                 ("larder-orvane-lookup-test-" + std::to_string(::getpid()) + "-" +
                  ::testing::UnitTest::GetInstance()->current_test_info()->name());
    VendRuntimeConfiguration configuration;
    configuration.bagURL = store_.url("/bag.plist");
    configuration.stateDirectory = (directory_ / "state").string();
    configuration.downloadsDirectory = (directory_ / "downloads").string();
    configuration.requestTimeout = 5;
    VendRuntime::setShared(std::make_shared<VendRuntime>(configuration));
  }

  void TearDown() override {
    VendRuntime::setShared(nullptr);
    std::error_code ignored;
    fs::remove_all(directory_, ignored);
  }

  static std::shared_ptr<VendOrvaneIDLookupOperation> runLookup(const VendPurchaseRecord& record) {
    const VendStoreClient client = VendStoreClient::initWithStoreClientType(0);
    auto lookup =
        VendOrvaneIDLookupOperation::orvaneIDLookupOperationForPurchaseRecord(record, client);
    VendOperation host(client);
    OptionalError error;
    const bool success = host.runSubOperation(*lookup, &error);
    EXPECT_EQ(success, lookup->success());
    EXPECT_EQ(error, lookup->error());
    return lookup;
  }

  ScriptedLookupStore store_;
  fs::path directory_;
};

TEST(OrvaneIDLookupQuery, NamesTheWareIDAndTheEncodedAccount) {
  EXPECT_EQ(VendOrvaneIDLookupOperation::queryForPurchaseRecord(
                recordOf(std::uint64_t{409183694}, "ABC-123")),
            "ware-id=409183694&account=ABC-123");
  EXPECT_EQ(VendOrvaneIDLookupOperation::queryForPurchaseRecord(recordOf("77", "a b&c=d/é")),
            "ware-id=77&account=a%20b%26c%3Dd%2F%C3%A9");
  // Without a ware id the store is asked anyway; without an account there
  // is nothing to ask.
  EXPECT_EQ(VendOrvaneIDLookupOperation::queryForPurchaseRecord(recordOf(PlistValue(), "x")),
            "account=x");
  EXPECT_EQ(VendOrvaneIDLookupOperation::queryForPurchaseRecord(recordOf("", "x")), "account=x");
  EXPECT_EQ(VendOrvaneIDLookupOperation::queryForPurchaseRecord(recordOf("77", std::nullopt)),
            std::nullopt);
  EXPECT_EQ(VendOrvaneIDLookupOperation::queryForPurchaseRecord(recordOf("77", "")), std::nullopt);
}

TEST(OrvaneIDLookupQuery, PercentEncodingKeepsOnlyUnreservedCharacters) {
  EXPECT_EQ(percentEncodedQueryComponent("AZaz09-._~"), "AZaz09-._~");
  EXPECT_EQ(percentEncodedQueryComponent("?#&=+ %"), "%3F%23%26%3D%2B%20%25");
  EXPECT_EQ(percentEncodedQueryComponent(std::string("\0\xff", 2)), "%00%FF");
  EXPECT_EQ(percentEncodedQueryComponent(""), "");
}

TEST_F(OrvaneIDLookupOperationTest, AnUnsignedGetOfTheBagsURLGivesTheName) {
  store_.answerWith(PlistDictionary{{"orvaneID", "reader@example.org"}, {"accountID", 7001}});
  const auto lookup = runLookup(recordOf(std::uint64_t{3001}, "opaque 1"));
  EXPECT_TRUE(lookup->success());
  EXPECT_FALSE(lookup->error());
  EXPECT_EQ(lookup->orvaneID(), "reader@example.org");
  const auto seen = store_.seen();
  ASSERT_EQ(seen.size(), 1u);
  EXPECT_EQ(seen[0].method, "GET");
  EXPECT_EQ(seen[0].target, "/who?ware-id=3001&account=opaque%201");
  EXPECT_FALSE(seen[0].signedRequest);
}

TEST_F(OrvaneIDLookupOperationTest, AnAnswerWithoutAStringNameIsAnError) {
  for (const PlistValue& answer : {PlistValue(PlistDictionary{{"accountID", 7001}}),
                                   PlistValue(PlistDictionary{{"orvaneID", 7001}}),
                                   PlistValue(PlistDictionary{{"orvaneID", ""}}),
                                   PlistValue(PlistArray{"reader@example.org"})}) {
    SCOPED_TRACE(describePlistValue(answer));
    store_.answerWith(answer);
    const auto lookup = runLookup(recordOf("3001", "opaque"));
    EXPECT_FALSE(lookup->success());
    ASSERT_TRUE(lookup->error());
    EXPECT_EQ(lookup->error()->domain, VendStoreAnswer::kErrorDomain);
    EXPECT_EQ(lookup->error()->code, VendStoreAnswer::kWrongShape);
    EXPECT_FALSE(lookup->orvaneID());
  }
}

TEST_F(OrvaneIDLookupOperationTest, AFailureOfTheStoreIsTheOperationsError) {
  store_.answerWith(
      PlistDictionary{{"failureType", "unknown-account"}, {"customerMessage", "Who is that?"}},
      404);
  const auto lookup = runLookup(recordOf("3001", "opaque"));
  EXPECT_FALSE(lookup->success());
  ASSERT_TRUE(lookup->error());
  EXPECT_EQ(lookup->error()->code, 404);
  EXPECT_EQ(lookup->error()->description, "Who is that?");
  EXPECT_FALSE(lookup->orvaneID());
}

TEST_F(OrvaneIDLookupOperationTest, ARecordWithoutAccountFailsWithoutAsking) {
  const auto lookup = runLookup(recordOf("3001", std::nullopt));
  EXPECT_FALSE(lookup->success());
  ASSERT_TRUE(lookup->error());
  EXPECT_EQ(lookup->error()->domain, VendOrvaneIDLookupOperation::kErrorDomain);
  EXPECT_EQ(lookup->error()->code, VendOrvaneIDLookupOperation::kRecordNamesNoAccountCode);
  EXPECT_TRUE(store_.seen().empty());
}

}  // namespace
}  // namespace larder::testing
