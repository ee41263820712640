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

// A dictionary without a name, or an array, is the service's store tests'
// business; a name that is no text, or empty, is this one's.
TEST_F(OrvaneIDLookupOperationTest, AnUnsignedGetOfTheBagsURLGivesTheNameOnlyIfItIsText) {
  const std::pair<PlistValue, std::optional<std::string>> answers[] = {
      {"reader@example.org", "reader@example.org"}, {7001, std::nullopt}, {"", std::nullopt}};
  for (const auto& [name, expected] : answers) {
    SCOPED_TRACE(describePlistValue(name));
    store_.add("/who", PropertyListSerialization::writeXml(
                           PlistDictionary{{"orvaneID", name}, {"accountID", 7001}}));
    const auto lookup = runLookup(recordOf(std::uint64_t{3001}, "opaque 1"));
    EXPECT_EQ(lookup->orvaneID(), expected);
    EXPECT_EQ(lookup->success(), expected.has_value());
    EXPECT_EQ(lookup->error().has_value(), !expected);
    if (!expected && lookup->error()) {
      EXPECT_EQ(std::pair(lookup->error()->domain, lookup->error()->code),
                std::pair(std::string(VendStoreAnswer::kErrorDomain),
                          std::int64_t{VendStoreAnswer::kWrongShape}));
    }
  }
  // Only GET is served: any other method would leave no request here.
  const auto seen = store_.requests("/who");
  ASSERT_EQ(seen.size(), 3u);
  EXPECT_EQ(seen[0].target, "/who?ware-id=3001&account=opaque%201");
  EXPECT_FALSE(seen[0].headers.contains(std::string(VendRequestSigner::kSignatureHeader)));
}

}  // namespace
}  // namespace larder::testing
