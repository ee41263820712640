// The account lookup operation against a store on 127.0.0.1: the request
// it makes, and the answers it takes and refuses.
#include <gtest/gtest.h>

#include "RuntimeTestSupport.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/http/VendRequestSigner.h"
#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/services/VendOrvaneIDLookupOperation.h"

namespace larder::testing {
namespace {

VendPurchaseRecord recordOf(PlistValue wareID, std::optional<std::string> account) {
  VendPurchaseRecord record;
  record.wareID = std::move(wareID);
  record.opaqueAccountIDString = std::move(account);
  return record;
}

TEST(OrvaneIDLookupQuery, NamesTheWareIDAndTheEncodedAccount) {
  const struct {
    PlistValue wareID;
    std::optional<std::string> account;
    std::optional<std::string> query;
  } cases[] = {
      {"77", "a b&c=d/é", "ware-id=77&account=a%20b%26c%3Dd%2F%C3%A9"},
      // Without a ware id the store is asked anyway.
      {PlistValue(), "x", "account=x"},
      {"", "x", "account=x"},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(VendOrvaneIDLookupOperation::queryForPurchaseRecord(recordOf(c.wareID, c.account)),
              c.query)
        << describePlistValue(c.wareID) << " " << c.account.value_or("(none)");
  }
  const std::pair<std::string, std::string> encodings[] = {{"AZaz09-._~", "AZaz09-._~"},
                                                           {"?#&=+ %", "%3F%23%26%3D%2B%20%25"},
                                                           {std::string("\0\xff", 2), "%00%FF"},
                                                           {"", ""}};
  for (const auto& [text, encoded] : encodings)
    EXPECT_EQ(percentEncodedQueryComponent(text), encoded) << text;
}

// A store whose bag points the lookup at "/who".
class OrvaneIDLookupOperationTest : public ::testing::Test {
 protected:
  OrvaneIDLookupOperationTest() {
    store_.add("/bag.plist", PropertyListSerialization::writeXml(
                                 PlistDictionary{{"orvane-id-lookup", store_.url("/who")}}));
  }

  void answerWith(const PlistValue& answer, int status = 200) {
    store_.add("/who", PropertyListSerialization::writeXml(answer), StoreServer::Fault::kNone,
               status);
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

  StoreServer store_;
  SharedRuntime runtime_{store_.url("/bag.plist")};
};

TEST_F(OrvaneIDLookupOperationTest, AnUnsignedGetOfTheBagsURLGivesTheName) {
  answerWith(PlistDictionary{{"orvaneID", "reader@example.org"}, {"accountID", 7001}});
  const auto lookup = runLookup(recordOf(std::uint64_t{3001}, "opaque 1"));
  EXPECT_TRUE(lookup->success());
  EXPECT_FALSE(lookup->error());
  EXPECT_EQ(lookup->orvaneID(), "reader@example.org");
  // Only GET is served: any other method would leave no request here.
  const auto seen = store_.requests("/who");
  ASSERT_EQ(seen.size(), 1u);
  EXPECT_EQ(seen[0].target, "/who?ware-id=3001&account=opaque%201");
  EXPECT_FALSE(seen[0].headers.contains(std::string(VendRequestSigner::kSignatureHeader)));
}

TEST_F(OrvaneIDLookupOperationTest, AnAnswerWithoutAStringNameIsAnError) {
  for (const PlistValue& answer : {PlistValue(PlistDictionary{{"accountID", 7001}}),
                                   PlistValue(PlistDictionary{{"orvaneID", 7001}}),
                                   PlistValue(PlistDictionary{{"orvaneID", ""}}),
                                   PlistValue(PlistArray{"reader@example.org"})}) {
    SCOPED_TRACE(describePlistValue(answer));
    answerWith(answer);
    const auto lookup = runLookup(recordOf("3001", "opaque"));
    EXPECT_FALSE(lookup->success());
    ASSERT_TRUE(lookup->error());
    EXPECT_EQ(lookup->error()->domain, VendStoreAnswer::kErrorDomain);
    EXPECT_EQ(lookup->error()->code, VendStoreAnswer::kWrongShape);
    EXPECT_FALSE(lookup->orvaneID());
  }
}

}  // namespace
}  // namespace larder::testing
