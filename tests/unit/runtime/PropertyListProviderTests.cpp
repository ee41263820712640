#include <gtest/gtest.h>

#include <string>

#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/services/VendPropertyListProvider.h"

namespace larder {
namespace {

PlistData bytes(const std::string& text) {
  return {text.begin(), text.end()};
}

PlistData xml(const PlistValue& value) {
  return bytes(PropertyListSerialization::writeXml(value));
}

PlistDictionary downloadEntry(std::uint64_t item) {
  return PlistDictionary{
      {"metadata",
       PlistDictionary{
           {"itemIdentifier", item}, {"bundleIdentifier", "com.example.A"}, {"title", "A"}}},
      {"assets", PlistArray{PlistDictionary{{"type", 10},
                                            {"URL", "http://127.0.0.1:1/assets/1/A.tar"},
                                            {"fileSize", 4},
                                            {"numberOfBytesToHash", 4},
                                            {"hashes", PlistArray{std::string(64, 'a')}}}}}};
}

VendPropertyListProvider provider() {
  VendPropertyListProvider made(VendStoreClient::initWithStoreClientType(0));
  made.setShouldTriggerDownloads(false);
  return made;
}

TEST(VendPropertyListProvider, AnswersThatAreNotPropertyListsGiveAnErrorAndNoOutput) {
  for (const std::string& text :
       {std::string(), std::string("<html>busy</html>"), std::string("bplist00\xff\xff"),
        std::string("<plist><dict><key>a</key></plist>")}) {
    auto parser = provider();
    OptionalError error;
    EXPECT_FALSE(parser.parseData(bytes(text), &error)) << text;
    ASSERT_TRUE(error) << text;
    EXPECT_FALSE(error->description.empty());
    EXPECT_TRUE(parser.output().isNull());
  }
}

TEST(VendPropertyListProvider, TheProtocolSwitchDecidesWhetherAStoreFailureFailsTheParse) {
  const PlistData answer = xml(PlistDictionary{{"failureType", "item-unavailable"},
                                               {"customerMessage", "This item is gone."}});
  auto obeying = provider();
  OptionalError error;
  EXPECT_FALSE(obeying.parseData(answer, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->description, "This item is gone.");
  EXPECT_EQ(*PlistValue(error->userInfo)["failureType"].string(), "item-unavailable");

  auto ignoring = provider();
  ignoring.setShouldProcessProtocol(false);
  error.reset();
  EXPECT_TRUE(ignoring.parseData(answer, &error));
  EXPECT_FALSE(error);
  EXPECT_EQ(*ignoring.output()["customerMessage"].string(), "This item is gone.");
}

TEST(VendPropertyListProvider, DownloadsAreTakenUpOnlyWhenAskedAndMalformedOnesAreSkipped) {
  const PlistData answer = xml(PlistDictionary{
      {"downloads", PlistArray{downloadEntry(11), PlistValue("junk"),
                               PlistDictionary{{"metadata", 3}}, downloadEntry(12)}}});
  auto taking = provider();
  ASSERT_TRUE(taking.parseData(answer, nullptr));
  ASSERT_EQ(taking.downloads().size(), 2U);
  EXPECT_EQ(taking.downloads()[0]->metadata().itemIdentifier(), 11U);
  EXPECT_EQ(taking.downloads()[1]->metadata().itemIdentifier(), 12U);

  auto leaving = provider();
  leaving.setShouldProcessDownloads(false);
  ASSERT_TRUE(leaving.parseData(answer, nullptr));
  EXPECT_TRUE(leaving.downloads().empty());
  EXPECT_EQ(leaving.output()["downloads"].array()->size(), 4U);  // the output is the whole answer

  // A provider configured from another takes its switches, and migrating
  // takes over its results.
  auto configured = provider();
  configured.configureFromProvider(leaving);
  EXPECT_FALSE(configured.shouldProcessDownloads());
  EXPECT_FALSE(configured.shouldTriggerDownloads());
  configured.migrateOutputFromSubProvider(taking);
  EXPECT_EQ(configured.downloads().size(), 2U);
  EXPECT_EQ(configured.output(), taking.output());
}

}  // namespace
}  // namespace larder
