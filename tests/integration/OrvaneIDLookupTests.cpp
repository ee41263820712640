// Which account owns an installed application: the runtime's lookup
// operation and the software map's question, against larder-store on
// 127.0.0.1 and against no store at all.
#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <vector>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/services/VendOrvaneIDLookupOperation.h"
#include "tests/integration/InProcessRuntime.h"

namespace larder::testing {
namespace {

constexpr char kAccountName[] = "reader@example.org";
// How the purchase records of these tests name the account.
constexpr char kRecordAccount[] = "account-1";
constexpr char kOddAccount[] = "an id/with spaces & more=signs";
constexpr std::uint64_t kItemID = 3001;
constexpr char kWrongEnvironment[] = "SoftwareMap: App may be from wrong environment!";

class OrvaneIDLookupTest : public InProcessRuntimeTest {
 protected:
  void SetUp() override {
    catalogue_.addAccount({.accountID = 7001,
                           .orvaneID = kAccountName,
                           .password = "secret",
                           .opaqueID = kRecordAccount});
    catalogue_.addAccount({.accountID = 7002,
                           .orvaneID = "other@example.org",
                           .password = "other",
                           .opaqueID = kOddAccount});
  }

  void useNoStore() { useBag(kNoStoreURL); }

  // An installed application whose purchase record names `account`; no
  // record without one.
  LedgerSoftwareProductRef ownedProduct(std::optional<std::string> account = kRecordAccount) {
    const std::string path = platform_.installBundle(
        {platform_.root() + "/Applications", "Owned", "com.example.owned", "1.0"});
    if (account) {
      const PlistDictionary record{{"bundleIdentifier", "com.example.owned"},
                                   {"bundleVersion", "1.0"},
                                   {"wareID", kItemID},
                                   {"installerVersionID", std::int64_t{1}},
                                   {"opaqueAccountIDString", *account}};
      EXPECT_TRUE(FileIO::writeAtomically(path + "/purchase.plist",
                                          PropertyListSerialization::writeXml(record)));
    }
    auto product = SoftwareMap::createSoftwareProductForAppAtPath(path);
    EXPECT_TRUE(product);
    return product;
  }

  VendStoreClient client_ = VendStoreClient::initWithStoreClientType(0);
};

// MARK: the lookup operation

// One lookup of a purchase record and what it must end with.
struct Lookup {
  const char* name;
  std::optional<std::string> account = kRecordAccount;
  PlistValue wareID = kItemID;
  std::vector<std::string> faults = {};
  PlistDictionary bag = {};  // extra entries of the store's bag
  bool noStore = false;
  std::optional<std::string> orvaneID = std::nullopt;  // none: an error
  std::string errorDomain = "";                        // "": any
  std::optional<std::int64_t> code = std::nullopt;
  std::string description = "";
  std::uint64_t lookups = 1;  // requests that reached the route
  std::uint64_t bagRequests = 1;
};

void PrintTo(const Lookup& lookup, std::ostream* out) {
  *out << lookup.name;
}

class LookupOperationTest : public OrvaneIDLookupTest,
                            public ::testing::WithParamInterface<Lookup> {};

// Runs the lookup as the map does: as the sub-operation of a plain one.
TEST_P(LookupOperationTest, EndsAsTheStoreAnswers) {
  const Lookup& c = GetParam();
  if (c.noStore) {
    useNoStore();
  } else {
    if (!c.bag.empty()) catalogue_.setStoreSettings(c.bag);
    startStore(c.faults, 5);
  }
  VendPurchaseRecord record;
  record.bundleIdentifier = "com.example.owned";
  record.wareID = c.wareID;
  record.opaqueAccountIDString = c.account;
  auto lookup =
      VendOrvaneIDLookupOperation::orvaneIDLookupOperationForPurchaseRecord(record, client_);
  VendOperation host(client_);
  OptionalError error;
  EXPECT_EQ(host.runSubOperation(*lookup, &error), c.orvaneID.has_value());
  EXPECT_EQ(lookup->orvaneID(), c.orvaneID);
  EXPECT_EQ(error.has_value(), !c.orvaneID);
  if (error) {
    if (!c.errorDomain.empty()) {
      EXPECT_EQ(error->domain, c.errorDomain);
    }
    if (c.code) {
      EXPECT_EQ(error->code, *c.code);
    }
    EXPECT_FALSE(error->description.empty());
    EXPECT_NE(error->description.find(c.description), std::string::npos) << error->description;
  }
  if (store_) {
    EXPECT_EQ(requests("orvane-id-lookup"), c.lookups);
    EXPECT_EQ(requests("bag"), c.bagRequests);
  }
}

INSTANTIATE_TEST_SUITE_P(
    , LookupOperationTest,
    ::testing::Values(
        Lookup{.name = "TheStoreNamesTheAccountOfTheRecord", .orvaneID = kAccountName},
        // Text that means something in a query arrives as it was; a ware id
        // stored as text goes as it is.
        Lookup{.name = "AnOddAccountAndATextWareIDGoAsTheyAre",
               .account = kOddAccount,
               .wareID = "3001",
               .orvaneID = "other@example.org"},
        Lookup{.name = "AnAccountTheStoreDoesNotKnowIsA404",
               .account = "nobody",
               .errorDomain = std::string(VendStoreAnswer::kErrorDomain),
               .code = 404,
               .description = "No account owns this purchase."},
        Lookup{.name = "ARecordWithoutAccountIsNeverSent",
               .account = std::nullopt,
               .errorDomain = std::string(VendOrvaneIDLookupOperation::kErrorDomain),
               .code = VendOrvaneIDLookupOperation::kRecordNamesNoAccountCode,
               .lookups = 0,
               .bagRequests = 0},
        Lookup{.name = "ARecordWithAnEmptyAccountIsNeverSent",
               .account = "",
               .errorDomain = std::string(VendOrvaneIDLookupOperation::kErrorDomain),
               .code = VendOrvaneIDLookupOperation::kRecordNamesNoAccountCode,
               .lookups = 0,
               .bagRequests = 0},
        Lookup{
            .name = "ARecordWithoutWareIDIsRefusedByTheStore", .wareID = PlistValue(), .code = 400},
        Lookup{.name = "AnAnswerOfTheWrongShape",
               .faults = {"orvane-id-lookup=wrong-shape"},
               .code = VendStoreAnswer::kWrongShape},
        Lookup{.name = "AnAnswerThatIsNoPropertyList",
               .faults = {"orvane-id-lookup=not-plist"},
               .code = VendStoreAnswer::kNotPropertyList},
        Lookup{.name = "AServerError", .faults = {"orvane-id-lookup=500"}, .code = 500},
        // A dictionary without a name is no answer either: the bag sends
        // the lookup to the bag itself.
        Lookup{.name = "AnAnswerWithoutAName",
               .bag = {{"orvane-id-lookup", "/bag.plist"}},
               .code = VendStoreAnswer::kWrongShape,
               .lookups = 0,
               .bagRequests = 2},
        Lookup{.name = "ABagWithoutTheLookup",
               .bag = {{"orvane-id-lookup", std::int64_t{0}}},
               .code = 30,
               .lookups = 0},
        Lookup{.name = "NoStore", .noStore = true}),
    [](const auto& info) { return std::string(info.param.name); });

// MARK: the software map's question

TEST_F(OrvaneIDLookupTest, TheMapNamesTheOwnerOfAnInstalledApplication) {
  startStore();
  const auto product = ownedProduct();
  const LogLines log;
  EXPECT_EQ(SoftwareMap::lookupOrvaneIDForApp(product.get(), client_), kAccountName);
  EXPECT_EQ(log.at(3, "SoftwareMap: We know Orvane ID (case 3)").size(), 1u);
  EXPECT_TRUE(log.at(1, kWrongEnvironment).empty());
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 1u);
}

TEST_F(OrvaneIDLookupTest, WithoutProductOrPurchaseRecordTheStoreIsNotAsked) {
  startStore();
  const LogLines log;
  EXPECT_EQ(SoftwareMap::lookupOrvaneIDForApp(nullptr, client_), std::nullopt);
  const auto unowned = ownedProduct(std::nullopt);
  EXPECT_EQ(SoftwareMap::lookupOrvaneIDForApp(unowned.get(), client_), std::nullopt);
  const auto lines = log.at(1, "SoftwareMap: No purchase record in the bundle at ");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_NE(lines.front().find(unowned->bundlePath()), std::string::npos);
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 0u);
}

TEST_F(OrvaneIDLookupTest, WithNoStoreTheMapLogsTheFailureAndGivesNothing) {
  useNoStore();
  const auto product = ownedProduct();
  const LogLines log;
  EXPECT_EQ(SoftwareMap::lookupOrvaneIDForApp(product.get(), client_), std::nullopt);
  const std::string prefix = std::string(kWrongEnvironment) + " Lookup failed with error - ";
  const auto lines = log.at(1, prefix);
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_GT(lines.front().size(), prefix.size()) << "the error says something after the dash";
  EXPECT_TRUE(log.at(3, "SoftwareMap: We know Orvane ID").empty());
}

TEST_F(OrvaneIDLookupTest, AnOwnerTheStoreDoesNotKnowGivesNothing) {
  startStore();
  const auto product = ownedProduct("an account of another store");
  const LogLines log;
  EXPECT_EQ(SoftwareMap::lookupOrvaneIDForApp(product.get(), client_), std::nullopt);
  const auto lines = log.at(1, kWrongEnvironment);
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_NE(lines.front().find("No account owns this purchase."), std::string::npos);
  EXPECT_EQ(store_->requestCount("orvane-id-lookup"), 1u);
}

}  // namespace
}  // namespace larder::testing
