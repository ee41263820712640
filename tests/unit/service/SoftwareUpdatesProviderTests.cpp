// The update check's answer: which lists are present, and what the output
// dictionary holds, whatever shape the store's answer has.
#include <gtest/gtest.h>

#include "UpdateQueueTestSupport.h"
#include "platform/plist/PropertyListSerialization.h"
#include "update-queue/SoftwareUpdatesProvider.h"

namespace larder::testing {
namespace {

struct Parsed {
  bool ok = false;
  OptionalError error;
  std::shared_ptr<SoftwareUpdatesProvider> provider;
};

Parsed parse(const std::string& bytes) {
  Parsed parsed;
  parsed.provider =
      SoftwareUpdatesProvider::providerWithStoreClient(VendStoreClient::initWithStoreClientType(0));
  parsed.ok = parsed.provider->parseData(PlistData(bytes.begin(), bytes.end()), &parsed.error);
  return parsed;
}

Parsed parse(const PlistValue& answer) {
  return parse(PropertyListSerialization::writeXml(answer));
}

TEST(SoftwareUpdatesProvider, EachListIsPresentOnlyWhenTheAnswerHeldItAsAnArray) {
  Parsed emptyItems = parse(PlistDictionary{{"items", PlistArray{}}});
  ASSERT_TRUE(emptyItems.ok);
  ASSERT_TRUE(emptyItems.provider->availableUpdates());
  EXPECT_TRUE(emptyItems.provider->availableUpdates()->empty());
  EXPECT_FALSE(emptyItems.provider->incompatibleUpdates());
  EXPECT_EQ(emptyItems.provider->output(),
            PlistValue(PlistDictionary{{"availableUpdates", PlistArray{}}}));

  Parsed both = parse(
      PlistDictionary{{"items", PlistArray{storeItem(1, "a", "1"), "junk", storeItem(2, "b", "1")}},
                      {"incompatible-items", PlistArray{PlistDictionary{}, storeItem(3, "c", "1")}},
                      {"other", "left to the property-list layer"}});
  ASSERT_TRUE(both.ok);
  EXPECT_EQ(identifiersOf(*both.provider->availableUpdates()), (std::vector<std::uint64_t>{1, 2}));
  EXPECT_EQ(identifiersOf(*both.provider->incompatibleUpdates()), (std::vector<std::uint64_t>{3}));
  const PlistArray* output = both.provider->output()["availableUpdates"].array();
  ASSERT_NE(output, nullptr);
  ASSERT_EQ(output->size(), 2U);
  EXPECT_EQ((*output)[1], PlistValue(storeItem(2, "b", "1")));
  EXPECT_TRUE(both.provider->output()["other"].isNull()) << "the output holds the two lists alone";

  for (const PlistValue& answer :
       {PlistValue(PlistDictionary{}), PlistValue(PlistDictionary{{"items", "all of them"}}),
        PlistValue(PlistArray{storeItem(1, "a", "1")}), PlistValue("text")}) {
    Parsed parsed = parse(answer);
    EXPECT_TRUE(parsed.ok) << describePlistValue(answer);
    EXPECT_FALSE(parsed.provider->availableUpdates()) << describePlistValue(answer);
    EXPECT_FALSE(parsed.provider->incompatibleUpdates());
    EXPECT_EQ(parsed.provider->output(), PlistValue(PlistDictionary{}));
  }
}

TEST(SoftwareUpdatesProvider, AnAnswerThatIsNoPropertyListOrAFailureSetsNothing) {
  for (const std::string& bytes :
       {std::string("<html>maintenance</html>"), std::string(),
        PropertyListSerialization::writeXml(PlistDictionary{
            {"failureType", "busy"}, {"items", PlistArray{storeItem(1, "a", "1")}}})}) {
    Parsed parsed = parse(bytes);
    EXPECT_FALSE(parsed.ok) << bytes;
    EXPECT_TRUE(parsed.error) << bytes;
    EXPECT_FALSE(parsed.provider->availableUpdates());
    EXPECT_TRUE(parsed.provider->output().isNull());
  }
}

}  // namespace
}  // namespace larder::testing
