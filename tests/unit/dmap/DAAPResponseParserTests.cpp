// Every response parser on documents written with DAAPBuffer: each tag of
// each table comes back under its key with the value that was written, and
// the tags with handling of their own behave as the protocol says.

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>

#include "DAAPTestSupport.h"
#include "dmap/DAAPItem.h"

namespace larder {
namespace {

using namespace dmaptest;  // NOLINT(google-build-using-namespace)

// Checks that `dictionary` holds exactly the table's entries as written.
void expectEveryEntry(const DAAPDictionary& dictionary, const std::vector<PlainTag>& table,
                      std::size_t extraEntries = 0) {
  for (std::size_t index = 0; index < table.size(); ++index) {
    EXPECT_EQ(lookup(dictionary, table[index].key), expectedValue(table[index], index))
        << table[index].code << " -> " << table[index].key;
  }
  EXPECT_EQ(dictionary.size(), table.size() + extraEntries);
}

DAAPItemRef decodeItem(std::vector<Tag> children) {
  const DAAPValue value = decode(container("medc", std::move(children)));
  EXPECT_TRUE(value.isItem());
  return value.item();
}

const DAAPValue& infoOf(const DAAPItemRef& item, std::string_view key) {
  return lookup(*item->additionalInfo(), key);
}

// ------------------------------------------------------ every table tag

TEST(DAAPTableRoundTripTest, ListingItemPlainTags) {
  const DAAPItemRef item = decodeItem(everyTagOf(kListingItemTags));
  ASSERT_TRUE(item);
  EXPECT_TRUE(item->isFrozen());
  std::size_t infoEntries = 0;
  for (std::size_t index = 0; index < kListingItemTags.size(); ++index) {
    const PlainTag& plain = kListingItemTags[index];
    if (std::string_view(plain.key) == "name") {  // a property of the item, not an entry
      EXPECT_EQ(item->name(), *expectedValue(plain, index).string());
      EXPECT_TRUE(infoOf(item, "name").isNull());
      continue;
    }
    ++infoEntries;
    EXPECT_EQ(infoOf(item, plain.key), expectedValue(plain, index))
        << plain.code << " -> " << plain.key;
  }
  EXPECT_EQ(item->additionalInfo()->size(), infoEntries);
}

TEST(DAAPTableRoundTripTest, ServerInfoTagsAndMacAddresses) {
  std::vector<Tag> tags = everyTagOf(kServerInfoTags);
  tags.push_back(
      container("msml", {u64("msma", 0x001b638445e6ULL), u64("msma", 0xa1b2c3d4e5f6ULL)}));
  const DAAPValue info = decode(container("msrv", tags));
  ASSERT_TRUE(info.isDictionary());
  expectEveryEntry(*info.dictionary(), kServerInfoTags, 1);
  EXPECT_EQ(info["macAddresses"], DAAPValue(DAAPArray{std::uint64_t{0x001b638445e6ULL},
                                                      std::uint64_t{0xa1b2c3d4e5f6ULL}}));
}

TEST(DAAPTableRoundTripTest, DACPPropertyTagsOfBothDocumentCodes) {
  for (const char* top : {"cmst", "cmgt"}) {
    const DAAPValue properties = decode(container(top, everyTagOf(kDACPPropertyTags)));
    ASSERT_TRUE(properties.isDictionary()) << top;
    expectEveryEntry(*properties.dictionary(), kDACPPropertyTags);
  }
}

TEST(DAAPTableRoundTripTest, FlavorTags) {
  const DAAPItemRef item =
      decodeItem({container("aefl", {container("aeif", everyTagOf(kFlavorTags))})});
  const DAAPValue& flavors = infoOf(item, "com.orvane.sonorel.item-flavor-listing");
  ASSERT_TRUE(flavors.isArray());
  ASSERT_EQ(flavors.array()->size(), 1u);
  expectEveryEntry(*flavors.array()->at(0).dictionary(), kFlavorTags);
}

TEST(DAAPTableRoundTripTest, ListingHeaderTagsOfEveryListingCode) {
  for (const char* top : {"abro", "adbs", "aeBR", "agal", "agar", "aply", "apso", "avdb", "caci",
                          "cmbu", "cprp", "mctl", "mscr", "mupd"}) {
    std::vector<Tag> tags = everyTagOf(kListingHeaderTags);
    tags.push_back(u32("mrco", 2));
    tags.push_back(container(
        "mlcl", {container("mlit", {u32("miid", 11)}), container("mlit", {u32("miid", 12)})}));
    tags.push_back(container("mshl", {container("mlit", {raw("mshc", {0x00, 0x41})})}));
    tags.push_back(container("mudl", {u64("mild", 5), u64("mild", 6)}));
    tags.push_back(container("abgn", {text("mlit", "Fiction")}));
    const DAAPValue header = decode(container(top, tags));
    ASSERT_TRUE(header.isDictionary()) << top;
    expectEveryEntry(*header.dictionary(), kListingHeaderTags, 5);
    EXPECT_EQ(header["dmap.returnedcount"].int64Value(), 2);
    const DAAPArray& listing = *header["dmap.listing"].array();
    ASSERT_EQ(listing.size(), 2u);
    EXPECT_EQ(listing[0].item()->itemID(), 11u);
    EXPECT_EQ(listing[1].item()->itemID(), 12u);
    const DAAPArray& headers = *header["headers"].array();
    ASSERT_EQ(headers.size(), 1u);
    EXPECT_EQ(headers[0].item()->objectForKey("headerItemCharacter"), DAAPValue("A"));
    EXPECT_EQ(header["dmap.deletedidlisting"],
              DAAPValue(DAAPArray{std::int64_t{5}, std::int64_t{6}}));
    EXPECT_EQ(header["items"].array()->at(0).item()->name(), "Fiction");
  }
}

TEST(DAAPTableRoundTripTest, ErrorTags) {
  const DAAPValue error = decode(container("merr", everyTagOf(kErrorTags)));
  ASSERT_TRUE(error.isDictionary());
  expectEveryEntry(*error.dictionary(), kErrorTags);
}

TEST(DAAPTableRoundTripTest, ContentCodeTags) {
  std::vector<Tag> entry = everyTagOf(kContentCollectionTags);
  entry.push_back(u16("mcty", 0x8005));
  const DAAPValue codes =
      decode(container("mccr", {u32("mstt", 200), container("mdcl", entry),
                                container("mdcl", {text("mcna", "dmap.itemid")})}));
  ASSERT_TRUE(codes.isArray());
  ASSERT_EQ(codes.array()->size(), 2u);
  expectEveryEntry(*codes.array()->at(0).dictionary(), kContentCollectionTags, 1);
  EXPECT_EQ(codes.array()->at(0)["dmap.contentcodestype"].int64Value(), 0x8005);
  EXPECT_EQ(codes.array()->at(1)["dmap.contentcodesname"], DAAPValue("dmap.itemid"));
}

TEST(DAAPTableRoundTripTest, ControlPromptTags) {
  const DAAPValue response = decode(container(
      "cmcp", {u32("mstt", 200), container("mdcl", everyTagOf(kControlPromptCollectionTags)),
               container("mdcl", {text("cmce", "second")}), u32("miid", 77)}));
  ASSERT_TRUE(response.isDictionary());
  const DAAPArray& prompts = *response["items"].array();
  ASSERT_EQ(prompts.size(), 2u);
  expectEveryEntry(*prompts[0].dictionary(), kControlPromptCollectionTags);
  EXPECT_EQ(prompts[1]["name"], DAAPValue("second"));
  EXPECT_EQ(response["dmap.itemid"].int64Value(), 77);
  EXPECT_EQ(response.dictionary()->size(), 2u);
}

// ------------------------------------------------------ dispatch by code

TEST(DAAPDispatchTest, EveryTopLevelCodeGivesItsKindOfResult) {
  EXPECT_TRUE(decode(container("cacr", {u32("miid", 1)})).isItem());
  EXPECT_TRUE(decode(container("medc", {u32("miid", 1)})).isItem());
  const DAAPValue speakers =
      decode(container("casp", {u32("mstt", 200), container("mdcl", {text("minm", "Den")})}));
  ASSERT_TRUE(speakers.isArray());
  EXPECT_EQ(speakers.array()->at(0).item()->name(), "Den");
  EXPECT_TRUE(speakers.array()->at(0).item()->isFrozen());
  const DAAPValue group = decode(container("ceGI", {container("mlit", {u32("miid", 3)})}));
  ASSERT_TRUE(group.isArray());
  EXPECT_EQ(group.array()->at(0).item()->itemID(), 3u);
  EXPECT_TRUE(decode(container("cmcp", {})).isDictionary());
  EXPECT_TRUE(decode(container("cmgt", {})).isDictionary());
  EXPECT_TRUE(decode(container("cmst", {})).isDictionary());
  EXPECT_TRUE(decode(container("mccr", {})).isArray());
  EXPECT_TRUE(decode(container("msrv", {})).isDictionary());
  EXPECT_EQ(decode(container("mlog", {u32("mstt", 200), u32("mlid", 9)})),
            DAAPValue(std::int64_t{9}));
}

// Each seed document (the fuzz targets' starting points) is a non-empty
// result of its code's shape, so that fuzzing starts from documents that
// reach the parsers' insides.
TEST(DAAPDispatchTest, EverySeedDocumentDecodesToSomethingOfItsCodesShape) {
  const std::vector<std::pair<std::string, Tag>> seeds = seedDocuments();
  ASSERT_EQ(seeds.size(), kTopLevelCodes.size());
  for (const TopLevelCode& top : kTopLevelCodes) {
    SCOPED_TRACE(top.code);
    const auto seed = std::find_if(seeds.begin(), seeds.end(),
                                   [&](const auto& entry) { return entry.first == top.code; });
    ASSERT_NE(seed, seeds.end());
    const DAAPValue value = decode(seed->second);
    EXPECT_TRUE(hasShape(value, top.shape)) << value.description();
    if (const DAAPDictionary* dictionary = value.dictionary()) {
      EXPECT_FALSE(dictionary->empty());
    }
    if (const DAAPArray* array = value.array()) {
      EXPECT_FALSE(array->empty());
    }
  }
  EXPECT_EQ(decode(seeds.at(0).second)["dmap.listing"].array()->size(), 2u);
  const auto login = std::find_if(seeds.begin(), seeds.end(),
                                  [](const auto& entry) { return entry.first == "mlog"; });
  EXPECT_EQ(decode(login->second).int64Value(), 1234);
}

TEST(DAAPDispatchTest, SeedBookItemKeepsEveryFieldTheLibraryReads) {
  const DAAPValue item = decode(container("medc", bookItem(6).children));
  const DAAPDictionary fields = item.item()->dictionaryRepresentation();
  for (const char* key :
       {"com.orvane.sonorel.orms-songid", "daap.songgenre", "daap.sortname",
        "daap.songdatepurchased", "com.orvane.sonorel.item-flavor-listing",
        "com.orvane.sonorel.publication-version", "com.orvane.sonorel.display-publication-version",
        "com.orvane.sonorel.store.expected-release-date",
        "com.orvane.sonorel.cloud-purchased-token", "dmap.itemid",
        "com.orvane.sonorel.cloud-artwork-url", "com.orvane.sonorel.extended-media-kind"}) {
    EXPECT_FALSE(lookup(fields, key).isNull()) << key;
  }
  EXPECT_EQ(lookup(fields, "dmap.itemid").int64Value(), 6);
}

// --------------------------------------------------- listing header rules

TEST(DAAPListingHeaderTest, UpdateWithRevisionOnlyHasNoListing) {
  const DAAPValue header = decode(container("mupd", {u32("musr", 0x42)}));
  EXPECT_EQ(header["dmap.serverrevision"].int64Value(), 66);
  EXPECT_TRUE(header["dmap.listing"].isNull());
}

TEST(DAAPListingHeaderTest, ReturnedCountIsACapacityHintOnlyWhenItComesFirst) {
  std::vector<Tag> items(3, container("mlit", {u32("miid", 1)}));
  const DAAPValue before = decode(container("adbs", {u32("mrco", 3), container("mlcl", items)}));
  EXPECT_EQ(before["dmap.listing"].array()->capacity(), 3u);
  const DAAPValue after = decode(container("adbs", {container("mlcl", items), u32("mrco", 3)}));
  EXPECT_EQ(after["dmap.returnedcount"].int64Value(), 3);
  EXPECT_EQ(after["dmap.listing"].array()->size(), 3u);
}

TEST(DAAPListingHeaderTest, BrowseResultsAreNamedFrozenItemsOfAnyOfFourCodes) {
  for (const char* code : {"abal", "abar", "abcp", "abgn"}) {
    const DAAPValue header = decode(container(
        "abro", {container(code, {text("mlit", "One"), raw("mlit", {0}), raw("mlit", {0xff})})}));
    const DAAPArray& items = *header["items"].array();
    ASSERT_EQ(items.size(), 3u) << code;
    EXPECT_EQ(items[0].item()->name(), "One");
    EXPECT_EQ(items[1].item()->name(), std::string(1, '\0'));  // no special case for one zero
    EXPECT_FALSE(items[2].item()->name().has_value());         // not UTF-8: no name
    for (const DAAPValue& item : items) EXPECT_TRUE(item.item()->isFrozen());
  }
}

TEST(DAAPListingHeaderTest, DeletedIdOfWrongSizeLogsAndAddsNothing) {
  LogCapture log;
  const DAAPValue header = decode(
      container("mupd", {container("mudl", {u64("mild", 1), u32("mild", 2), u64("mild", 3)})}));
  EXPECT_EQ(header["dmap.deletedidlisting"],
            DAAPValue(DAAPArray{std::int64_t{1}, std::int64_t{3}}));
  EXPECT_EQ(log.countExactly("DAAPParser: setUInt64 being passed a 4 byte value for: "
                             "<dmap.longitemid>!"),
            1u);
}

TEST(DAAPListingHeaderTest, StatusInsideACollectionIsSkippedSilently) {
  LogCapture log;
  const DAAPValue header = decode(container(
      "apso", {container("mlcl", {u32("mstt", 500), container("mlit", {u32("miid", 4)})})}));
  EXPECT_EQ(header["dmap.listing"].array()->size(), 1u);
  EXPECT_EQ(log.size(), 0u);
}

// ------------------------------------------------------ login and error

TEST(DAAPLoginTest, SessionIdIsSignedAndTheLastOneCounts) {
  EXPECT_EQ(decode(container("mlog", {u32("mlid", 1), u32("mlid", 0xffffffff)})),
            DAAPValue(std::int64_t{-1}));
  EXPECT_TRUE(decode(container("mlog", {u32("mstt", 200)})).isNull());
  EXPECT_TRUE(decode(container("mlog", {raw("mlid", {0, 0, 1})})).isNull());
}

TEST(DAAPLoginTest, StatusOtherThan200IsLoggedAndParsingGoesOn) {
  LogCapture log;
  EXPECT_EQ(decode(container("mlog", {u32("mstt", 503), u32("mlid", 8)})),
            DAAPValue(std::int64_t{8}));
  EXPECT_EQ(log.countExactly("DAAPParser: DMAP returned status code 503"), 1u);
  log.clear();
  decode(container("mlog", {u32("mstt", 200), raw("mstt", {0, 0})}));
  EXPECT_EQ(log.size(), 0u);
}

TEST(DAAPErrorTest, BelowNineBytesGivesNothing) {
  EXPECT_TRUE(decode(container("merr", {raw("zzzz", {})})).isNull());  // 8 bytes
  const DAAPValue nine = decode(container("merr", {raw("zzzz", {1})}));
  ASSERT_TRUE(nine.isDictionary());
  EXPECT_TRUE(nine.dictionary()->empty());
}

// --------------------------------------------------- listing item rules

TEST(DAAPListingItemTest, ItemIdBySizeAndFallbackOnLongItemId) {
  EXPECT_EQ(decodeItem({u64("miid", 0x0102030405060708ULL)})->itemID(), 0x0102030405060708ULL);
  EXPECT_EQ(decodeItem({u32("miid", 0xfffffffe)})->itemID(), 0xfffffffeULL);
  LogCapture log;
  const DAAPItemRef fallback = decodeItem({raw("miid", {0, 9}), u64("mild", 1234)});
  EXPECT_EQ(fallback->itemID(), 1234u);
  EXPECT_EQ(log.size(), 0u);
}

TEST(DAAPListingItemTest, HotFieldsGoToTheirProperties) {
  const DAAPItemRef item =
      decodeItem({text("minm", "Book"), text("asal", "Album"), text("asar", "Artist"),
                  text("asaa", "Album Artist"), u64("asai", 0x8877665544332211ULL),
                  u32("mcti", 0x80000001), u8("mdst", 3)});
  EXPECT_EQ(item->name(), "Book");
  EXPECT_EQ(item->songalbum(), "Album");
  EXPECT_EQ(item->songartist(), "Artist");
  EXPECT_EQ(item->songalbumartist(), "Album Artist");
  EXPECT_EQ(item->songalbumid(), 0x8877665544332211ULL);
  EXPECT_EQ(item->containerItemID(), 0x80000001u);
  EXPECT_EQ(item->downloadStatus(), 3);
  EXPECT_TRUE(item->additionalInfo()->empty());
  EXPECT_EQ(item->objectForKey("daap.songalbumid"), DAAPValue("9833440827789222417"));
}

TEST(DAAPListingItemTest, EmptyTextLeavesHotFieldsAlone) {
  const DAAPItemRef item = decodeItem({text("minm", "Kept"), raw("minm", {}), raw("asal", {0})});
  EXPECT_EQ(item->name(), "Kept");
  EXPECT_EQ(item->songalbum(), "");
}

TEST(DAAPListingItemTest, VariableWidthNumbers) {
  LogCapture log;
  const DAAPItemRef eight = decodeItem({u64("mpco", 0x8000000000000001ULL), u32("aeMk", 0x80000000),
                                        u64("aeSI", 0x8000000000000002ULL)});
  EXPECT_EQ(infoOf(eight, "dmap.parentcontainerid").uint64Value(), 0x8000000000000001ULL);
  EXPECT_EQ(infoOf(eight, "com.orvane.sonorel.extended-media-kind").int64Value(), 0x80000000);
  EXPECT_EQ(infoOf(eight, "com.orvane.sonorel.orms-songid").uint64Value(), 0x8000000000000002ULL);
  const DAAPItemRef four =
      decodeItem({u32("mpco", 0x80000003), u8("aeMk", 0x81), u32("aeSI", 0x80000004)});
  EXPECT_EQ(infoOf(four, "dmap.parentcontainerid").int64Value(), 0x80000003);
  EXPECT_EQ(infoOf(four, "com.orvane.sonorel.extended-media-kind").int64Value(), 0x81);
  EXPECT_EQ(infoOf(four, "com.orvane.sonorel.orms-songid").int64Value(), 0x80000004);
  const DAAPItemRef odd = decodeItem({raw("mpco", {1, 2}), raw("aeMk", {1, 2}), raw("aeSI", {1})});
  EXPECT_TRUE(odd->additionalInfo()->empty());
  EXPECT_EQ(log.size(), 0u);  // other sizes are skipped without a line
}

TEST(DAAPListingItemTest, ChapterAndVideoFlagsOnlyWhenOne) {
  const DAAPItemRef set = decodeItem({u8("aeHC", 1), u8("aeHV", 1)});
  EXPECT_EQ(infoOf(set, "com.orvane.sonorel.has-chapter-data").int64Value(), 1);
  EXPECT_EQ(infoOf(set, "com.orvane.sonorel.has-video").int64Value(), 1);
  const DAAPItemRef clear = decodeItem({u8("aeHC", 0), u8("aeHV", 0), u8("aeHV", 2)});
  EXPECT_TRUE(infoOf(clear, "com.orvane.sonorel.has-video").isNull());
  EXPECT_TRUE(infoOf(clear, "com.orvane.sonorel.has-chapter-data").isNull());
}

TEST(DAAPListingItemTest, ArtworkChecksumIsAlwaysText) {
  EXPECT_EQ(infoOf(decodeItem({u32("aeCS", 1234)}), "com.orvane.sonorel.artworkchecksum"),
            DAAPValue("1234"));
  EXPECT_EQ(infoOf(decodeItem({text("aeCS", "77")}), "com.orvane.sonorel.artworkchecksum"),
            DAAPValue("77"));
}

TEST(DAAPListingItemTest, EmbeddedValues) {
  const std::string plist =
      "<plist version=\"1.0\"><dict><key>studio</key><string>North</string></dict></plist>";
  const DAAPItemRef item = decodeItem(
      {text("aeMX", plist), raw("pfdt", {0, 1, 0xff}), raw("mshc", {0x00, 0x42}), u32("cmvo", 50)});
  EXPECT_EQ(infoOf(item, "com.orvane.sonorel.movie-info-xml")["studio"], DAAPValue("North"));
  EXPECT_EQ(infoOf(item, "fileData"), DAAPValue(PlistData{0, 1, 0xff}));
  EXPECT_EQ(infoOf(item, "headerItemCharacter"), DAAPValue("B"));
  EXPECT_EQ(infoOf(item, "volume"), DAAPValue(static_cast<double>(0.5f)));
  const DAAPItemRef notADictionary =
      decodeItem({text("aeMX", "<plist version=\"1.0\"><array/></plist>"), raw("mshc", {0x42})});
  EXPECT_TRUE(notADictionary->additionalInfo()->empty());
}

TEST(DAAPListingItemTest, PairsOfADictionaryContainerLandInTheItem) {
  const DAAPItemRef item =
      decodeItem({container("mdcl", {text("mdvl", "v1"), text("mdky", "k1"), text("mdky", "name"),
                                     text("mdvl", "Named")})});
  EXPECT_EQ(infoOf(item, "k1"), DAAPValue("v1"));
  EXPECT_EQ(item->name(), "Named");
}

TEST(DAAPListingItemTest, NestedListingIsTheContext) {
  const DAAPItemRef item =
      decodeItem({container("cmvl", {container("mlit", {text("minm", "inner")})})});
  const DAAPValue& context = infoOf(item, "context");
  ASSERT_TRUE(context.isArray());
  ASSERT_EQ(context.array()->size(), 1u);
  EXPECT_EQ(context.array()->at(0).item()->name(), "inner");
  EXPECT_TRUE(context.array()->at(0).item()->isFrozen());
}

TEST(DAAPListingItemTest, MlitInsideAnItemIsSkippedAndDoesNotNest) {
  LogCapture log;
  const DAAPItemRef item =
      decodeItem({container("mlit", {text("minm", "inner")}), text("aePI", "x"), text("aeTr", "x"),
                  u8("asdk", 1), u32("cmik", 1), text("minm", "outer")});
  EXPECT_EQ(item->name(), "outer");
  EXPECT_TRUE(item->additionalInfo()->empty());
  EXPECT_EQ(log.size(), 0u);
}

TEST(DAAPListingItemTest, ValueWithoutTypeIsSkipped) {
  LogCapture log;
  const DAAPItemRef item = decodeItem({u32("cval", 5)});
  EXPECT_TRUE(infoOf(item, "value").isNull());
  EXPECT_EQ(log.size(), 0u);
}

TEST(DAAPListingItemTest, ValueTypeDecidesHowTheValueIsRead) {
  float half = 0.5f;
  PlistData floatBytes(4);
  std::memcpy(floatBytes.data(), &half, 4);
  struct Case {
    std::uint16_t type;
    Tag value;
    const char* typeName;
    DAAPValue expected;
  };
  const std::vector<Case> cases{
      {1, raw("cval", {1, 0, 0, 0}), "boolean", true},
      {2, u16("cval", 0x8001), "undefined", std::int64_t{0x8001}},
      {3, u32("cval", 0x80000002), "uint32", std::int64_t{0x80000002}},
      {4, raw("cval", floatBytes), "float", 0.5},
      {5, text("cval", "five"), "indexed", "five"},
      {6, text("cval", "six"), "keyed", "six"},
      {7, text("cval", "seven"), "string", "seven"},
  };
  for (const Case& c : cases) {
    const DAAPItemRef item = decodeItem({u16("cmvt", c.type), c.value});
    EXPECT_EQ(infoOf(item, "type"), DAAPValue(c.typeName)) << c.type;
    EXPECT_EQ(infoOf(item, "value"), c.expected) << c.type;
  }
  for (const std::uint16_t skipped : {std::uint16_t{8}, std::uint16_t{12}, std::uint16_t{0}}) {
    const DAAPItemRef item = decodeItem({u16("cmvt", skipped), u32("cval", 1)});
    EXPECT_TRUE(infoOf(item, "value").isNull()) << skipped;
  }
}

TEST(DAAPListingItemTest, ValueTypeOfWrongSizeKeepsTheOneBefore) {
  const DAAPItemRef item = decodeItem({u16("cmvt", 3), u32("cmvt", 1), u32("cval", 9)});
  EXPECT_EQ(infoOf(item, "type"), DAAPValue("uint32"));
  EXPECT_EQ(infoOf(item, "value").int64Value(), 9);
}

TEST(DAAPListingItemTest, QueueWarningThresholdIsStoredAndLogged) {
  LogCapture log;
  const DAAPItemRef item = decodeItem({u32("ceQW", 25)});
  EXPECT_EQ(infoOf(item, "com.orvane.sonorel.playqueue-warning-threshold").int64Value(), 25);
  EXPECT_EQ(log.countExactly(
                "DAAPParser: **QUEUE** kExtDACPAddToPlayQueueWarningThresholdCodeNameStr, 25"),
            1u);
}

TEST(DAAPListingItemTest, WrongSizeForOneTagLeavesTheRestOfTheItem) {
  LogCapture log;
  const DAAPItemRef item =
      decodeItem({u8("astm", 1), text("asgn", "Poetry"), raw("asyr", {7, 0xe4})});
  EXPECT_TRUE(infoOf(item, "daap.songtime").isNull());
  EXPECT_EQ(infoOf(item, "daap.songgenre"), DAAPValue("Poetry"));
  EXPECT_EQ(infoOf(item, "daap.songyear").int64Value(), 2020);
  EXPECT_EQ(log.countExactly("DAAPParser: setUInt32 being passed a 1 byte value for: "
                             "<daap.songtime>!"),
            1u);
}

TEST(DAAPListingItemTest, UnknownTagIsLoggedAndSkipped) {
  LogCapture log;
  const DAAPItemRef item = decodeItem({u32("qqqq", 1), text("minm", "after")});
  EXPECT_EQ(item->name(), "after");
  EXPECT_EQ(log.countContaining("Unknown code: 'qqqq', size=4"), 1u);
}

// ------------------------------------------------------- DACP responses

TEST(DAAPDACPTest, NowPlayingIdentifiersIgnoreTheDeclaredLength) {
  PlistData canp;
  for (std::uint32_t value : {1u, 2u, 3u, 0x80000004u, 99u}) {
    for (int shift = 24; shift >= 0; shift -= 8)
      canp.push_back(static_cast<std::uint8_t>(value >> shift));
  }
  PlistData capl;
  for (std::uint64_t value : {5ULL, 6ULL, 7ULL, 0x8000000000000008ULL}) {
    for (int shift = 56; shift >= 0; shift -= 8)
      capl.push_back(static_cast<std::uint8_t>(value >> shift));
  }
  const DAAPValue canpResponse = decode(container("cmst", {raw("canp", canp)}));  // 20 bytes
  EXPECT_EQ(canpResponse["databaseID"].int64Value(), 1);
  EXPECT_EQ(canpResponse["com.orvane.sonorel.orms-playlistid"].int64Value(), 2);
  EXPECT_EQ(canpResponse["dmap.containeritemid"].int64Value(), 3);
  EXPECT_EQ(canpResponse["dmap.itemid"].int64Value(), 0x80000004);
  const DAAPValue caplResponse = decode(container("cmst", {raw("capl", capl)}));
  EXPECT_EQ(caplResponse["databaseID"].int64Value(), 5);
  EXPECT_EQ(caplResponse["dmap.itemid"].uint64Value(), 0x8000000000000008ULL);
  // Shorter than four numbers: only those wholly inside the value.
  const DAAPValue partial =
      decode(container("cmst", {raw("canp", PlistData(canp.begin(), canp.begin() + 9))}));
  EXPECT_EQ(partial["databaseID"].int64Value(), 1);
  EXPECT_EQ(partial["com.orvane.sonorel.orms-playlistid"].int64Value(), 2);
  EXPECT_TRUE(partial["dmap.containeritemid"].isNull());
}

TEST(DAAPDACPTest, ArtworkChecksumIsTextOrNumber) {
  EXPECT_EQ(decode(container("cmst", {u32("aeCS", 1234)}))["com.orvane.sonorel.artworkchecksum"],
            DAAPValue("1234"));
  EXPECT_EQ(decode(container("cmst", {text("aeCS", "77")}))["com.orvane.sonorel.artworkchecksum"],
            DAAPValue(std::int64_t{77}));
}

TEST(DAAPDACPTest, SongIdOnlyAtFourBytesAndChapterFlagOnlyWhenOne) {
  LogCapture log;
  const DAAPValue response =
      decode(container("cmgt", {u64("aeSI", 5), u8("aeHC", 1), u32("cmvo", 25), raw("casu", {1})}));
  EXPECT_TRUE(response["com.orvane.sonorel.orms-songid"].isNull());
  EXPECT_EQ(log.countExactly("DAAPParser: setUInt32 being passed a 8 byte value for: "
                             "<com.orvane.sonorel.orms-songid>!"),
            1u);
  EXPECT_EQ(response["com.orvane.sonorel.has-chapter-data"].int64Value(), 1);
  EXPECT_EQ(response["volume"], DAAPValue(static_cast<double>(0.25f)));
  EXPECT_EQ(response.dictionary()->size(), 2u);
  EXPECT_EQ(log.size(), 1u);  // casu is skipped silently
  EXPECT_TRUE(decode(container("cmgt", {u8("aeHC", 0)})).dictionary()->empty());
}

TEST(DAAPDACPTest, QueueModesStoreOnlyWhenOneAndAlwaysLog) {
  LogCapture log;
  const DAAPValue on = decode(container("cmst", {u8("ceQu", 1), u8("ceMQ", 1)}));
  EXPECT_EQ(on["com.orvane.sonorel.playqueue-mode"].int64Value(), 1);
  EXPECT_EQ(on["com.orvane.sonorel.manually-queued"].int64Value(), 1);
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPPlayQueueModeCode: YES"), 1u);
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPItemManuallyQueuedCode: YES"), 1u);
  const DAAPValue off = decode(container("cmst", {u8("ceQu", 0), u8("ceMQ", 2)}));
  EXPECT_TRUE(off.dictionary()->empty());
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPPlayQueueModeCode: NO"), 1u);
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPItemManuallyQueuedCode: NO"), 1u);
}

TEST(DAAPDACPTest, QueueValuesAreStoredAndLoggedWithWhatWasStored) {
  LogCapture log;
  const DAAPValue response = decode(
      container("cmst", {u32("ceNQ", 4), text("ceQF", "Up Next"), u32("ceQW", 30), u8("ceNQ", 1)}));
  EXPECT_EQ(response["com.orvane.sonorel.num-manually-queued"].int64Value(), 4);
  EXPECT_EQ(response["com.orvane.sonorel.active-queue-feed-name"], DAAPValue("Up Next"));
  EXPECT_EQ(response["com.orvane.sonorel.playqueue-warning-threshold"].int64Value(), 30);
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPNumManuallyQueuedTracksCode, 4"), 2u);
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPActiveQueueFeedNameCode, \"Up Next\""),
            1u);
  EXPECT_EQ(log.countExactly(
                "DAAPParser: **QUEUE** kExtDACPAddToPlayQueueWarningThresholdCodeNameStr, 30"),
            1u);
}

TEST(DAAPDACPTest, QueueDescriptionsAreOnlyLoggedWithTheirSize) {
  LogCapture log;
  const DAAPValue response =
      decode(container("cmst", {text("ceQI", "abc"), text("ceQn", "name"), text("ceQr", ""),
                                text("ceQa", "a"), text("ceQg", "gg"), u64("ceQs", 1)}));
  EXPECT_TRUE(response.dictionary()->empty());
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPQueueIndexCode, size:3"), 1u);
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPPlayQueueNameCode, size:4"), 1u);
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPPlayQueueArtistCode, size:0"), 1u);
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPPlayQueueAlbumCode, size:1"), 1u);
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPPlayQueueGenreCode, size:2"), 1u);
  EXPECT_EQ(log.countExactly("DAAPParser: **QUEUE** kExtDACPPlayQueueSpecCode, size:8"), 1u);
}

TEST(DAAPDACPTest, SecondScreenInfoTakesNonEmptyIdAndUrl) {
  const auto plist = [](std::string body) {
    return text("ceSD", "<plist version=\"1.0\"><dict>" + body + "</dict></plist>");
  };
  const DAAPValue both = decode(container(
      "cmst", {plist("<key>id</key><integer>42</integer><key>url</key><string>x:y</string>")}));
  EXPECT_EQ(both["secondScreenWareID"].int64Value(), 42);
  EXPECT_EQ(both["secondScreenURL"], DAAPValue("x:y"));
  const DAAPValue empty = decode(
      container("cmst", {plist("<key>id</key><string></string><key>url</key><string></string>")}));
  EXPECT_TRUE(empty.dictionary()->empty());
  const DAAPValue notADictionary = decode(
      container("cmst", {text("ceSD", "<plist version=\"1.0\"><string>s</string></plist>")}));
  EXPECT_TRUE(notADictionary.dictionary()->empty());
}

TEST(DAAPControlPromptTest, ItemsOnlyWhenThereAreSomeAndItemIdBySize) {
  const DAAPValue without = decode(container("cmcp", {u64("miid", 0x8000000000000001ULL)}));
  EXPECT_TRUE(without["items"].isNull());
  EXPECT_EQ(without["dmap.itemid"].uint64Value(), 0x8000000000000001ULL);
  LogCapture log;
  const DAAPValue odd = decode(container("cmcp", {raw("miid", {1, 2})}));
  EXPECT_TRUE(odd.dictionary()->empty());
  EXPECT_EQ(log.countExactly("DAAPParser: setUInt64 being passed a 2 byte value for: "
                             "<dmap.itemid>!"),
            1u);
}

TEST(DAAPSpeakersTest, SpeakersAreFrozenItemsWithTheirSettings) {
  const DAAPValue speakers = decode(container(
      "casp", {container("mdcl", {text("minm", "Kitchen"), u64("msma", 0x001b638445e6ULL),
                                  u8("caia", 1), u8("caip", 1), u8("cahp", 0), u32("cmvo", 40)}),
               container("mdcl", {text("minm", "Den")})}));
  ASSERT_EQ(speakers.array()->size(), 2u);
  const DAAPItemRef kitchen = speakers.array()->at(0).item();
  EXPECT_EQ(kitchen->objectForKey("macAddress").uint64Value(), 0x001b638445e6ULL);
  EXPECT_EQ(kitchen->objectForKey("selected"), DAAPValue(true));
  EXPECT_EQ(kitchen->objectForKey("isPlaying"), DAAPValue(true));
  EXPECT_EQ(kitchen->objectForKey("hasPassword").int64Value(), 0);
}

}  // namespace
}  // namespace larder
