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

PlistData bigEndian(std::initializer_list<std::uint64_t> numbers, int width) {
  PlistData bytes;
  for (const std::uint64_t value : numbers) {
    const PlistData one = number("", value, width).bytes;
    bytes.insert(bytes.end(), one.begin(), one.end());
  }
  return bytes;
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
      EXPECT_TRUE(lookup(*item->additionalInfo(), "name").isNull());
      continue;
    }
    ++infoEntries;
    EXPECT_EQ(lookup(*item->additionalInfo(), plain.key), expectedValue(plain, index))
        << plain.code << " -> " << plain.key;
  }
  EXPECT_EQ(item->additionalInfo()->size(), infoEntries);
}

TEST(DAAPTableRoundTripTest, DictionaryDocumentsHoldEveryTagOfTheirTable) {
  const struct {
    const char* top;
    const std::vector<PlainTag>& table;
  } cases[] = {{"msrv", kServerInfoTags},
               {"cmst", kDACPPropertyTags},
               {"cmgt", kDACPPropertyTags},
               {"merr", kErrorTags}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.top);
    const DAAPValue value = decode(container(c.top, everyTagOf(c.table)));
    ASSERT_TRUE(value.isDictionary());
    expectEveryEntry(*value.dictionary(), c.table);
  }
}

TEST(DAAPTableRoundTripTest, FlavorTags) {
  const DAAPItemRef item =
      decodeItem({container("aefl", {container("aeif", everyTagOf(kFlavorTags))})});
  const DAAPValue& flavors =
      lookup(*item->additionalInfo(), "com.orvane.sonorel.item-flavor-listing");
  ASSERT_TRUE(flavors.isArray());
  ASSERT_EQ(flavors.array()->size(), 1u);
  expectEveryEntry(*flavors.array()->at(0).dictionary(), kFlavorTags);
}

TEST(DAAPTableRoundTripTest, ListingHeaderTagsOfEveryListingCode) {
  for (const char* top : kListingCodes) {
    SCOPED_TRACE(top);
    std::vector<Tag> tags = everyTagOf(kListingHeaderTags);
    tags.push_back(u32("mrco", 2));
    tags.push_back(container(
        "mlcl", {container("mlit", {u32("miid", 11)}), container("mlit", {u32("miid", 12)})}));
    tags.push_back(container("mshl", {container("mlit", {raw("mshc", {0x00, 0x41})})}));
    tags.push_back(container("mudl", {u64("mild", 5), u64("mild", 6)}));
    tags.push_back(container("abgn", {text("mlit", "Fiction")}));
    const DAAPValue header = decode(container(top, tags));
    ASSERT_TRUE(header.isDictionary());
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

TEST(DAAPTableRoundTripTest, CollectionsOfContentCodesAndControlPrompts) {
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
    if (top.shape == Shape::NumberOrNull) {
      EXPECT_EQ(value, DAAPValue(std::int64_t{1234}));
    }
  }
  EXPECT_EQ(decode(seeds.at(0).second)["dmap.listing"].array()->size(), 2u);
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

// ------------------------------------------- tags with rules of their own

// One document, what it decodes to as a whole, and the log lines it gives
// (each a fragment of one line; no other lines).
struct DocumentCase {
  const char* name;
  Tag document;
  DAAPValue expected;
  std::vector<std::string> log;
};

void expectDocuments(const std::vector<DocumentCase>& cases) {
  for (const DocumentCase& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture log;
    EXPECT_EQ(decode(c.document), c.expected);
    for (const std::string& line : c.log) {
      EXPECT_EQ(log.countContaining(line),
                static_cast<std::size_t>(std::count(c.log.begin(), c.log.end(), line)))
          << line;
    }
    EXPECT_EQ(log.size(), c.log.size()) << ::testing::PrintToString(log.texts());
  }
}

TEST(DAAPDocumentRulesTest, LoginErrorListingHeaderAndServerInfo) {
  const std::vector<DocumentCase> cases{
      {"session id is signed, the last one counts",
       container("mlog", {u32("mlid", 1), u32("mlid", 0xffffffff)}),
       std::int64_t{-1},
       {}},
      {"login without a session id", container("mlog", {u32("mstt", 200)}), {}, {}},
      {"session id of three bytes", container("mlog", {raw("mlid", {0, 0, 1})}), {}, {}},
      {"status other than 200 is logged and parsing goes on",
       container("mlog", {u32("mstt", 503), u32("mlid", 8)}),
       std::int64_t{8},
       {"DAAPParser: DMAP returned status code 503"}},
      {"status of the wrong size is silent",
       container("mlog", {u32("mstt", 200), raw("mstt", {0, 0})}),
       {},
       {}},
      {"error of eight bytes", container("merr", {raw("zzzz", {})}), {}, {}},
      {"error of nine bytes",
       container("merr", {raw("zzzz", {1})}),
       dictionaryOf({}),
       {"Unknown code: 'zzzz', size=1, value=1"}},
      {"update with a revision only has no listing",
       container("mupd", {u32("musr", 0x42)}),
       dictionaryOf({{"dmap.serverrevision", std::int64_t{66}}}),
       {}},
      {"deleted id of the wrong size",
       container("mupd", {container("mudl", {u64("mild", 1), u32("mild", 2), u64("mild", 3)})}),
       dictionaryOf({{"dmap.deletedidlisting", DAAPArray{std::int64_t{1}, std::int64_t{3}}}}),
       {"DAAPParser: setUInt64 being passed a 4 byte value for: <dmap.longitemid>!"}},
      {"server info MAC addresses",
       container("msrv", {container("msml", {u64("msma", 0x001b638445e6ULL),
                                             u64("msma", 0xa1b2c3d4e5f6)})}),
       dictionaryOf({{"macAddresses",
                      DAAPArray{std::int64_t{0x001b638445e6}, std::int64_t{0xa1b2c3d4e5f6}}}}),
       {}},
      {"control prompts without items, item id of eight bytes",
       container("cmcp", {u64("miid", 0x8000000000000001ULL)}),
       dictionaryOf({{"dmap.itemid", std::uint64_t{0x8000000000000001ULL}}}),
       {}},
      {"control prompt item id of two bytes",
       container("cmcp", {raw("miid", {1, 2})}),
       dictionaryOf({}),
       {"DAAPParser: setUInt64 being passed a 2 byte value for: <dmap.itemid>!"}},
  };
  expectDocuments(cases);
}

TEST(DAAPDocumentRulesTest, PlayStatusAndPropertyResponses) {
  const PlistData canp = bigEndian({1, 2, 3, 0x80000004, 99}, 4);  // 20 bytes: one too many
  const auto secondScreen = [](const std::string& body) {
    return container("cmst",
                     {text("ceSD", "<plist version=\"1.0\"><dict>" + body + "</dict></plist>")});
  };
  const std::vector<DocumentCase> cases{
      {"now playing identifiers ignore the declared length",
       container("cmst", {raw("canp", canp)}),
       dictionaryOf({{"databaseID", std::int64_t{1}},
                     {"com.orvane.sonorel.orms-playlistid", std::int64_t{2}},
                     {"dmap.containeritemid", std::int64_t{3}},
                     {"dmap.itemid", std::int64_t{0x80000004}}}),
       {}},
      {"now playing identifiers of eight bytes",
       container("cmst", {raw("capl", bigEndian({5, 6, 7, 0x8000000000000008ULL}, 8))}),
       dictionaryOf({{"databaseID", std::int64_t{5}},
                     {"com.orvane.sonorel.orms-playlistid", std::int64_t{6}},
                     {"dmap.containeritemid", std::int64_t{7}},
                     {"dmap.itemid", std::uint64_t{0x8000000000000008ULL}}}),
       {}},
      {"only identifiers wholly inside the value",
       container("cmst", {raw("canp", PlistData(canp.begin(), canp.begin() + 9))}),
       dictionaryOf({{"databaseID", std::int64_t{1}},
                     {"com.orvane.sonorel.orms-playlistid", std::int64_t{2}}}),
       {}},
      {"artwork checksum number becomes text",
       container("cmst", {u32("aeCS", 1234)}),
       dictionaryOf({{"com.orvane.sonorel.artworkchecksum", "1234"}}),
       {}},
      {"artwork checksum text becomes a number",
       container("cmst", {text("aeCS", "77")}),
       dictionaryOf({{"com.orvane.sonorel.artworkchecksum", std::int64_t{77}}}),
       {}},
      {"song id only at four bytes, chapter flag, volume, casu silently skipped",
       container("cmgt", {u64("aeSI", 5), u8("aeHC", 1), u32("cmvo", 25), raw("casu", {1})}),
       dictionaryOf({{"com.orvane.sonorel.has-chapter-data", std::int64_t{1}},
                     {"volume", static_cast<double>(0.25f)}}),
       {"DAAPParser: setUInt32 being passed a 8 byte value for: "
        "<com.orvane.sonorel.orms-songid>!"}},
      {"chapter flag other than one", container("cmgt", {u8("aeHC", 0)}), dictionaryOf({}), {}},
      {"queue modes of one are stored and logged",
       container("cmst", {u8("ceQu", 1), u8("ceMQ", 1)}),
       dictionaryOf({{"com.orvane.sonorel.playqueue-mode", std::int64_t{1}},
                     {"com.orvane.sonorel.manually-queued", std::int64_t{1}}}),
       {"DAAPParser: **QUEUE** kExtDACPPlayQueueModeCode: YES",
        "DAAPParser: **QUEUE** kExtDACPItemManuallyQueuedCode: YES"}},
      {"queue modes other than one are only logged",
       container("cmst", {u8("ceQu", 0), u8("ceMQ", 2)}),
       dictionaryOf({}),
       {"DAAPParser: **QUEUE** kExtDACPPlayQueueModeCode: NO",
        "DAAPParser: **QUEUE** kExtDACPItemManuallyQueuedCode: NO"}},
      {"queue values are logged with what was stored",
       container("cmst", {u32("ceNQ", 4), text("ceQF", "Up Next"), u32("ceQW", 30), u8("ceNQ", 1)}),
       dictionaryOf({{"com.orvane.sonorel.num-manually-queued", std::int64_t{4}},
                     {"com.orvane.sonorel.active-queue-feed-name", "Up Next"},
                     {"com.orvane.sonorel.playqueue-warning-threshold", std::int64_t{30}}}),
       {"DAAPParser: **QUEUE** kExtDACPNumManuallyQueuedTracksCode, 4",
        "DAAPParser: **QUEUE** kExtDACPActiveQueueFeedNameCode, \"Up Next\"",
        "DAAPParser: **QUEUE** kExtDACPAddToPlayQueueWarningThresholdCodeNameStr, 30",
        "DAAPParser: setUInt32 being passed a 1 byte value for: "
        "<com.orvane.sonorel.num-manually-queued>!",
        "DAAPParser: **QUEUE** kExtDACPNumManuallyQueuedTracksCode, 4"}},
      {"queue descriptions are only logged with their size",
       container("cmst", {text("ceQI", "abc"), text("ceQn", "name"), text("ceQr", ""),
                          text("ceQa", "a"), text("ceQg", "gg"), u64("ceQs", 1)}),
       dictionaryOf({}),
       {"DAAPParser: **QUEUE** kExtDACPQueueIndexCode, size:3",
        "DAAPParser: **QUEUE** kExtDACPPlayQueueNameCode, size:4",
        "DAAPParser: **QUEUE** kExtDACPPlayQueueArtistCode, size:0",
        "DAAPParser: **QUEUE** kExtDACPPlayQueueAlbumCode, size:1",
        "DAAPParser: **QUEUE** kExtDACPPlayQueueGenreCode, size:2",
        "DAAPParser: **QUEUE** kExtDACPPlayQueueSpecCode, size:8"}},
      {"second screen id and url",
       secondScreen("<key>id</key><integer>42</integer><key>url</key><string>x:y</string>"),
       dictionaryOf({{"secondScreenWareID", std::int64_t{42}}, {"secondScreenURL", "x:y"}}),
       {}},
      {"second screen empty id and url",
       secondScreen("<key>id</key><string></string><key>url</key><string></string>"),
       dictionaryOf({}),
       {}},
      {"second screen not a dictionary",
       container("cmst", {text("ceSD", "<plist version=\"1.0\"><string>s</string></plist>")}),
       dictionaryOf({}),
       {}},
  };
  expectDocuments(cases);
}

// --------------------------------------------------- listing item rules

TEST(DAAPListingItemTest, TagsWithRulesOfTheirOwnFillTheInfo) {
  const PlistData half = [] {
    const float value = 0.5f;
    PlistData bytes(4);
    std::memcpy(bytes.data(), &value, 4);
    return bytes;
  }();
  const std::string studio =
      "<plist version=\"1.0\"><dict><key>studio</key><string>North</string></dict></plist>";
  struct Case {
    const char* name;
    std::vector<Tag> tags;
    DAAPDictionary info;
    std::vector<std::string> log;
    const char* itemName = nullptr;
  };
  const std::vector<Case> cases{
      {"numbers of eight, four and four bytes",
       {u64("mpco", 0x8000000000000001ULL), u32("aeMk", 0x80000000),
        u64("aeSI", 0x8000000000000002ULL)},
       dictionaryOf({{"dmap.parentcontainerid", std::uint64_t{0x8000000000000001ULL}},
                     {"com.orvane.sonorel.extended-media-kind", std::int64_t{0x80000000}},
                     {"com.orvane.sonorel.orms-songid", std::uint64_t{0x8000000000000002ULL}}}),
       {}},
      {"numbers of four, one and four bytes",
       {u32("mpco", 0x80000003), u8("aeMk", 0x81), u32("aeSI", 0x80000004)},
       dictionaryOf({{"dmap.parentcontainerid", std::int64_t{0x80000003}},
                     {"com.orvane.sonorel.extended-media-kind", std::int64_t{0x81}},
                     {"com.orvane.sonorel.orms-songid", std::int64_t{0x80000004}}}),
       {}},
      {"numbers of other sizes are skipped silently",
       {raw("mpco", {1, 2}), raw("aeMk", {1, 2}), raw("aeSI", {1})},
       {},
       {}},
      {"chapter and video flags of one",
       {u8("aeHC", 1), u8("aeHV", 1)},
       dictionaryOf({{"com.orvane.sonorel.has-chapter-data", std::int64_t{1}},
                     {"com.orvane.sonorel.has-video", std::int64_t{1}}}),
       {}},
      {"chapter and video flags other than one",
       {u8("aeHC", 0), u8("aeHV", 0), u8("aeHV", 2)},
       {},
       {}},
      {"artwork checksum number is text",
       {u32("aeCS", 1234)},
       dictionaryOf({{"com.orvane.sonorel.artworkchecksum", "1234"}}),
       {}},
      {"artwork checksum text stays text",
       {text("aeCS", "77")},
       dictionaryOf({{"com.orvane.sonorel.artworkchecksum", "77"}}),
       {}},
      {"embedded values",
       {text("aeMX", studio), raw("pfdt", {0, 1, 0xff}), raw("mshc", {0x00, 0x42}),
        u32("cmvo", 50)},
       dictionaryOf({{"com.orvane.sonorel.movie-info-xml", dictionaryOf({{"studio", "North"}})},
                     {"fileData", PlistData{0, 1, 0xff}},
                     {"headerItemCharacter", "B"},
                     {"volume", static_cast<double>(0.5f)}}),
       {}},
      {"embedded list that is no dictionary, character of one byte",
       {text("aeMX", "<plist version=\"1.0\"><array/></plist>"), raw("mshc", {0x42})},
       {},
       {}},
      {"pairs of a dictionary container",
       {container("mdcl", {text("mdvl", "v1"), text("mdky", "k1"), text("mdky", "name"),
                           text("mdvl", "Named")})},
       dictionaryOf({{"k1", "v1"}}),
       {},
       "Named"},
      {"mlit inside an item is skipped, as are the ignored codes",
       {container("mlit", {text("minm", "inner")}), text("aePI", "x"), text("aeTr", "x"),
        u8("asdk", 1), u32("cmik", 1), text("minm", "outer")},
       {},
       {},
       "outer"},
      {"queue warning threshold",
       {u32("ceQW", 25)},
       dictionaryOf({{"com.orvane.sonorel.playqueue-warning-threshold", std::int64_t{25}}}),
       {"DAAPParser: **QUEUE** kExtDACPAddToPlayQueueWarningThresholdCodeNameStr, 25"}},
      {"wrong size for one tag leaves the rest",
       {u8("astm", 1), text("asgn", "Poetry"), raw("asyr", {7, 0xe4})},
       dictionaryOf({{"daap.songgenre", "Poetry"}, {"daap.songyear", std::int64_t{2020}}}),
       {"DAAPParser: setUInt32 being passed a 1 byte value for: <daap.songtime>!"}},
      {"unknown tag is logged and skipped",
       {u32("qqqq", 1), text("minm", "after")},
       {},
       {"Unknown code: 'qqqq', size=4"},
       "after"},
      {"empty text leaves a name alone", {text("minm", "Kept"), raw("minm", {})}, {}, {}, "Kept"},
      // The value's type comes from the cmvt before it.
      {"value without a type", {u32("cval", 5)}, {}, {}},
      {"boolean",
       {u16("cmvt", 1), raw("cval", {1, 0, 0, 0})},
       dictionaryOf({{"type", "boolean"}, {"value", true}}),
       {}},
      {"undefined",
       {u16("cmvt", 2), u16("cval", 0x8001)},
       dictionaryOf({{"type", "undefined"}, {"value", std::int64_t{0x8001}}}),
       {}},
      {"uint32",
       {u16("cmvt", 3), u32("cval", 0x80000002)},
       dictionaryOf({{"type", "uint32"}, {"value", std::int64_t{0x80000002}}}),
       {}},
      {"float in host order",
       {u16("cmvt", 4), raw("cval", half)},
       dictionaryOf({{"type", "float"}, {"value", 0.5}}),
       {}},
      {"indexed",
       {u16("cmvt", 5), text("cval", "five")},
       dictionaryOf({{"type", "indexed"}, {"value", "five"}}),
       {}},
      {"keyed",
       {u16("cmvt", 6), text("cval", "six")},
       dictionaryOf({{"type", "keyed"}, {"value", "six"}}),
       {}},
      {"string",
       {u16("cmvt", 7), text("cval", "seven")},
       dictionaryOf({{"type", "string"}, {"value", "seven"}}),
       {}},
      {"type 8 has no value",
       {u16("cmvt", 8), u32("cval", 1)},
       dictionaryOf({{"type", "undefined"}}),
       {}},
      {"group has no value",
       {u16("cmvt", 12), u32("cval", 1)},
       dictionaryOf({{"type", "group"}}),
       {}},
      {"type 0 has no value",
       {u16("cmvt", 0), u32("cval", 1)},
       dictionaryOf({{"type", "undefined"}}),
       {}},
      {"type of the wrong size keeps the one before",
       {u16("cmvt", 3), u32("cmvt", 1), u32("cval", 9)},
       dictionaryOf({{"type", "uint32"}, {"value", std::int64_t{9}}}),
       {}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture log;
    const DAAPItemRef item = decodeItem(c.tags);
    ASSERT_TRUE(item);
    EXPECT_EQ(*item->additionalInfo(), c.info);
    for (const std::string& line : c.log) EXPECT_EQ(log.countContaining(line), 1u) << line;
    EXPECT_EQ(log.size(), c.log.size()) << ::testing::PrintToString(log.texts());
    if (c.itemName) {
      EXPECT_EQ(item->name(), c.itemName);
    }
  }
}

TEST(DAAPListingItemTest, ItemIdBySizeAndFallbackOnLongItemId) {
  EXPECT_EQ(decodeItem({u64("miid", 0x0102030405060708ULL)})->itemID(), 0x0102030405060708ULL);
  EXPECT_EQ(decodeItem({u32("miid", 0xfffffffe)})->itemID(), 0xfffffffeULL);
  LogCapture log;
  EXPECT_EQ(decodeItem({raw("miid", {0, 9}), u64("mild", 1234)})->itemID(), 1234u);
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
  EXPECT_EQ(decodeItem({raw("asal", {0})})->songalbum(), "");  // one zero byte is text
}

TEST(DAAPListingItemTest, NestedListingsAndSpeakersAreFrozenItems) {
  const DAAPItemRef item =
      decodeItem({container("cmvl", {container("mlit", {text("minm", "inner")})})});
  const DAAPValue& context = lookup(*item->additionalInfo(), "context");
  ASSERT_TRUE(context.isArray());
  ASSERT_EQ(context.array()->size(), 1u);
  EXPECT_EQ(context.array()->at(0).item()->name(), "inner");
  EXPECT_TRUE(context.array()->at(0).item()->isFrozen());

  const DAAPValue group = decode(container("ceGI", {container("mlit", {u32("miid", 3)})}));
  ASSERT_TRUE(group.isArray());
  EXPECT_EQ(group.array()->at(0).item()->itemID(), 3u);
  EXPECT_TRUE(group.array()->at(0).item()->isFrozen());

  const DAAPValue speakers = decode(container(
      "casp", {container("mdcl", {text("minm", "Kitchen"), u64("msma", 0x001b638445e6ULL),
                                  u8("caia", 1), u8("caip", 1), u8("cahp", 0), u32("cmvo", 40)}),
               container("mdcl", {text("minm", "Den")})}));
  ASSERT_EQ(speakers.array()->size(), 2u);
  const DAAPItemRef kitchen = speakers.array()->at(0).item();
  EXPECT_TRUE(kitchen->isFrozen());
  EXPECT_EQ(kitchen->name(), "Kitchen");
  EXPECT_EQ(kitchen->objectForKey("macAddress").uint64Value(), 0x001b638445e6ULL);
  EXPECT_EQ(kitchen->objectForKey("selected"), DAAPValue(true));
  EXPECT_EQ(kitchen->objectForKey("isPlaying"), DAAPValue(true));
  EXPECT_EQ(kitchen->objectForKey("hasPassword").int64Value(), 0);
  EXPECT_EQ(speakers.array()->at(1).item()->name(), "Den");
}

// --------------------------------------------------- listing header rules

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
    SCOPED_TRACE(code);
    const DAAPValue header = decode(container(
        "abro", {container(code, {text("mlit", "One"), raw("mlit", {0}), raw("mlit", {0xff})})}));
    const DAAPArray& items = *header["items"].array();
    ASSERT_EQ(items.size(), 3u);
    EXPECT_EQ(items[0].item()->name(), "One");
    EXPECT_EQ(items[1].item()->name(), std::string(1, '\0'));  // no special case for one zero
    EXPECT_FALSE(items[2].item()->name().has_value());         // not UTF-8: no name
    for (const DAAPValue& item : items) EXPECT_TRUE(item.item()->isFrozen());
  }
}

TEST(DAAPListingHeaderTest, StatusInsideACollectionIsSkippedSilently) {
  LogCapture log;
  const DAAPValue header = decode(container(
      "apso", {container("mlcl", {u32("mstt", 500), container("mlit", {u32("miid", 4)})})}));
  EXPECT_EQ(header["dmap.listing"].array()->size(), 1u);
  EXPECT_EQ(log.size(), 0u);
}

}  // namespace
}  // namespace larder
