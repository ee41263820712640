// Documents written to hurt: lengths that point outside their container or
// the document, empty and enormous values, deep nesting, truncation at every
// byte. None may crash, read outside the input (the sanitizer builds check
// that), allocate without bound, or give anything but the documented result.

#include <gtest/gtest.h>

#include <random>

#include "DAAPTestSupport.h"
#include "dmap/DAAPDocumentBudget.h"
#include "dmap/DAAPItem.h"
#include "platform/plist/PropertyListSerialization.h"

namespace larder {
namespace {

using namespace dmaptest;  // NOLINT(google-build-using-namespace)

// A document with a bit of everything, for truncation and corruption.
Tag richListing() {
  return container(
      "mupd",
      {u32("mstt", 200), u32("mrco", 2), u32("musr", 9),
       container("mlcl",
                 {container("mlit", {u32("miid", 1), text("minm", "First"), u64("asai", 5),
                                     container("aefl", {container("aeif", {u32("aefd", 1)})}),
                                     container("mdcl", {text("mdky", "k"), text("mdvl", "v")}),
                                     u16("cmvt", 3), u32("cval", 4),
                                     container("cmvl", {container("mlit", {u32("miid", 3)})})}),
                  container("mlit", {u32("miid", 2), text("asgn", "Drama")})}),
       container("mudl", {u64("mild", 7)})});
}

void setTopLevelSize(PlistData& data, std::uint32_t size) {
  for (std::size_t index = 0; index < 4; ++index) {
    data[4 + index] = static_cast<std::uint8_t>(size >> (24 - 8 * index));
  }
}

// What must hold for any body under `top`: the result has the shape the
// code decides, every entry was made of at least a header's worth of the
// body, and the result converts to a property list.
void expectShapeAndBound(const TopLevelCode& top, const PlistData& body) {
  const DAAPValue value = decode(raw(top.code, body));
  ASSERT_TRUE(hasShape(value, top.shape)) << top.code << ": " << value.description();
  if (const DAAPDictionary* dictionary = value.dictionary()) {
    EXPECT_LE(dictionary->size(), body.size() / 8) << top.code;
  }
  if (const DAAPArray* array = value.array()) {
    EXPECT_LE(array->size(), body.size() / 8) << top.code;
  }
  EXPECT_EQ(value.toPlist().isNull(), value.isNull()) << top.code;
}

TEST(DAAPHostileTest, HostileBodiesUnderEveryTopLevelCodeKeepTheCodesShapeAndStayBounded) {
  // Every code any parser knows with an empty value: nothing may be read
  // from an empty value.
  std::vector<Tag> empties;
  for (const char* code :
       {"miid", "minm", "asal", "asar", "asaa", "asai", "mcti", "mdst", "mdcl", "mpco",
        "aeMk", "aeSI", "aeHC", "aeHV", "aeCS", "aefl", "aeMX", "pfdt", "mshc", "cmvl",
        "cmvo", "cmvt", "cval", "ceQW", "canp", "capl", "ceQu", "ceMQ", "ceNQ", "ceQF",
        "ceSD", "mlid", "mstt", "mcty", "msml", "msma", "mild", "mlcl", "mshl", "mudl",
        "abal", "mrco", "mlit", "asgn", "asdp", "mper", "caia", "asyr", "aeif"}) {
    empties.push_back(raw(code, {}));
  }
  // Values one byte short and one byte long of every fixed width.
  std::vector<Tag> offWidths;
  for (const char* code : {"miid", "mcti", "mlid", "mcty", "canp", "capl", "cmvo", "asai", "msma",
                           "mstt", "mdst", "asyr", "aeSI", "aeCS"}) {
    for (const std::size_t size : {1u, 3u, 5u, 7u, 9u, 15u, 17u, 31u, 33u}) {
      offWidths.push_back(raw(code, PlistData(size, 0x7f)));
    }
  }
  struct Case {
    const char* name;
    std::vector<Tag> tags;
    std::function<void(const DAAPValue& item, const LogCapture& log)> checkItem;
  };
  const std::vector<Case> cases{
      {"empty body",
       {},
       [](const DAAPValue& item, const LogCapture& log) {
         // The bound leaves nothing in an empty body's result; an error needs nine bytes.
         EXPECT_TRUE(decode(container("merr", {})).isNull());
         EXPECT_TRUE(decode(container("mlog", {})).isNull());
         EXPECT_TRUE(item.item()->additionalInfo()->empty());
         EXPECT_EQ(log.size(), 0u);
       }},
      {"empty value of every known code", empties,
       [&](const DAAPValue& item, const LogCapture&) {
         EXPECT_TRUE(decode(container("mlog", empties)).isNull())
             << "no session id in an empty value";
         EXPECT_EQ(item.item()->itemID(), 0u);
         EXPECT_EQ(item.item()->objectForKey("fileData"), DAAPValue(PlistData{}));
         EXPECT_TRUE(item.item()->objectForKey("context").array()->empty());
       }},
      {"values off every fixed width", offWidths,
       [](const DAAPValue& item, const LogCapture&) {
         EXPECT_EQ(item.item()->itemID(), 0u);  // no size matched 4 or 8
         EXPECT_EQ(item.item()->containerItemID(), 0x7f7f7f7fu);
       }},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture log;
    const PlistData body = bodyOf(c.tags);
    for (const TopLevelCode& top : kTopLevelCodes) expectShapeAndBound(top, body);
    const DAAPValue item = decode(raw("medc", body));
    ASSERT_TRUE(item.isItem());
    c.checkItem(item, log);
  }
}

TEST(DAAPHostileTest, RandomBodiesUnderEveryTopLevelCodeKeepTheCodesShapeAndStayBounded) {
  std::mt19937 random(777);
  for (const TopLevelCode& top : kTopLevelCodes) {
    for (int round = 0; round < 500; ++round) {
      PlistData body(random() % 200);
      for (std::uint8_t& byte : body) byte = static_cast<std::uint8_t>(random());
      SCOPED_TRACE(round);
      expectShapeAndBound(top, body);
    }
  }
}

// Lengths that point past their container or the document: each row names
// the length field it breaks, what must still come out, and the one line
// that reports it.
TEST(DAAPHostileTest, LengthsBeyondTheirContainerEndThatWalkOnly) {
  LogCapture log;
  // The item claims 1000 bytes for its album while its container holds 12;
  // the listing goes on with the next item.
  PlistData data = document(container(
      "mupd", {container("mlcl", {container("mlit", {u32("miid", 1), text("asal", "abcd")}),
                                  container("mlit", {u32("miid", 2)})})}));
  // mupd(8) mlcl(8) mlit(8) miid(12) asal header: its length field sits 4 bytes in.
  const std::size_t albumLength = 8 + 8 + 8 + 12 + 4;
  ASSERT_EQ(data[albumLength - 4], 'a');
  data[albumLength + 2] = 0x03;
  data[albumLength + 3] = 0xe8;
  const DAAPValue header = DAAPParser::decodeData(data);
  const DAAPArray& listing = *header["dmap.listing"].array();
  ASSERT_EQ(listing.size(), 2u);
  EXPECT_EQ(listing[0].item()->itemID(), 1u);
  EXPECT_FALSE(listing[0].item()->songalbum().has_value());
  EXPECT_TRUE(listing[0].item()->isFrozen());
  EXPECT_EQ(listing[1].item()->itemID(), 2u);
  EXPECT_EQ(log.countExactly("DAAPParser: tag 'asal' claims 1000 bytes, but its container has 4 "
                             "left; rest skipped"),
            1u);

  // Too few bytes left for a header.
  Tag item = container("medc", {u32("miid", 1)});
  item.children.push_back(raw("zzzz", {}));
  PlistData stray = document(item);
  stray.resize(stray.size() - 3);  // 5 bytes of a header left
  setTopLevelSize(stray, static_cast<std::uint32_t>(stray.size() - 8));
  EXPECT_EQ(DAAPParser::decodeData(stray).item()->itemID(), 1u);
  EXPECT_EQ(log.countExactly("DAAPParser: 5 stray bytes at the end of a container skipped"), 1u);
  EXPECT_EQ(log.size(), 2u);
}

TEST(DAAPHostileTest, HugeCapacityHintReservesNoMoreThanTheBytesCanHold) {
  const DAAPValue header = decode(container(
      "adbs", {u32("mrco", 0xffffffff), container("mlcl", {container("mlit", {u32("miid", 1)})})}));
  EXPECT_EQ(header["dmap.returnedcount"].int64Value(), 0xffffffff);
  const DAAPArray& listing = *header["dmap.listing"].array();
  EXPECT_EQ(listing.size(), 1u);
  EXPECT_LE(listing.capacity(), 20u / 8u);
}

TEST(DAAPHostileTest, DeeplyNestedListingsStopAtTheBound) {
  LogCapture log;
  Tag nested = container("mlit", {u32("miid", 1000)});
  for (int level = 0; level < 200; ++level) {
    nested = container(
        "mlit", {u32("miid", static_cast<std::uint32_t>(level)), container("cmvl", {nested})});
  }
  const DAAPValue value = decode(container("ceGI", {nested}));
  ASSERT_TRUE(value.isArray());
  int depth = 0;
  DAAPItemRef item = value.array()->at(0).item();
  while (item) {
    const DAAPValue context = item->objectForKey("context");
    if (!context.isArray() || context.array()->empty()) break;
    item = context.array()->at(0).item();
    ++depth;
  }
  EXPECT_EQ(depth, DAAPParser::kMaxListingDepth);
  EXPECT_EQ(log.countExactly("DAAPParser: listing nested deeper than 16 levels; 'cmvl' skipped"),
            1u);
}

TEST(DAAPHostileTest, DeeplyNestedEmbeddedPropertyListIsRefused) {
  LogCapture log;
  std::string plist = "<plist version=\"1.0\">";
  for (int level = 0; level < 5000; ++level) plist += "<array>";
  for (int level = 0; level < 5000; ++level) plist += "</array>";
  plist += "</plist>";
  const DAAPValue item = decode(container("medc", {text("aeMX", plist), u32("miid", 4)}));
  EXPECT_EQ(item.item()->itemID(), 4u);
  EXPECT_TRUE(item.item()->objectForKey("com.orvane.sonorel.movie-info-xml").isNull());
  EXPECT_EQ(log.countContaining("Attempting to process XML response"), 1u);
}

TEST(DAAPHostileTest, EmbeddedListsShareOneBudgetProportionalToTheDocument) {
  // Each list names one string from many places: 4,000 bytes that decode to
  // 200,000, and sixteen of them in one document.
  const std::string shared(4000, 'x');
  const PlistData list = PropertyListSerialization::writeBinary(
      PlistDictionary{{"k", PlistArray(50, PlistValue(shared))}});
  std::vector<Tag> items;
  for (std::uint32_t id = 1; id <= 16; ++id) {
    items.push_back(container("mlit", {u32("miid", id), raw("aeMX", list)}));
  }
  const PlistData data = document(container("mupd", {container("mlcl", std::move(items))}));
  const DAAPValue value = DAAPParser::decodeData(data);
  const DAAPArray* listing = value["dmap.listing"].array();
  ASSERT_TRUE(listing);
  ASSERT_EQ(listing->size(), 16U) << "the items stay";
  std::size_t decoded = 0;
  std::size_t kept = 0;
  for (const DAAPValue& item : *listing) {
    const DAAPValue info = item.item()->objectForKey("com.orvane.sonorel.movie-info-xml");
    if (info.isNull()) continue;
    ++kept;
    decoded += info["k"].array()->size() * shared.size();
  }
  EXPECT_GE(kept, 1U) << "a list within the budget is read";
  EXPECT_LE(decoded, DAAPDocumentBudget::kBytesPerDocumentByte * data.size());
}

TEST(DAAPHostileTest, ManyNestedContainersOfEveryOtherKindDoNotRecurse) {
  // Containers that the parsers treat as values, nested 10000 deep: the
  // document is walked once, not descended into.
  constexpr std::uint32_t kLevels = 10000;
  DAAPBuffer nested;
  for (std::uint32_t level = 0; level < kLevels; ++level) {
    nested.appendHeader("mdcl"_dmap, 8 * (kLevels - 1 - level) + 12);
  }
  nested.appendUInt32(1, "mstt"_dmap);
  const Tag deep = raw("mdcl", PlistData(nested.bytes().begin() + 8, nested.bytes().end()));
  const DAAPValue item = decode(container("medc", {deep, u32("miid", 6)}));
  EXPECT_EQ(item.item()->itemID(), 6u);
  const DAAPValue codes = decode(container("mccr", {deep}));
  EXPECT_EQ(codes.array()->size(), 1u);
}

TEST(DAAPHostileTest, TruncatedAtEveryByteGivesNothing) {
  LogCapture log;
  const PlistData full = document(richListing());
  ASSERT_TRUE(DAAPParser::decodeData(full).isDictionary());
  for (std::size_t length = 0; length < full.size(); ++length) {
    EXPECT_TRUE(DAAPParser::decodeData(std::span(full).first(length)).isNull()) << length;
  }
  // Every cut from 8 bytes on is reported once; shorter ones are silent.
  EXPECT_EQ(log.countContaining("DMAPParser parseStream: got"), full.size() - 8);
}

TEST(DAAPHostileTest, TruncatedInsideWithAMendedTopLevelSizeParsesWhatIsWhole) {
  const PlistData full = document(richListing());
  std::size_t itemsSeen = 0;
  for (std::size_t length = 8; length <= full.size(); ++length) {
    PlistData cut(full.begin(), full.begin() + static_cast<std::ptrdiff_t>(length));
    setTopLevelSize(cut, static_cast<std::uint32_t>(length - 8));
    const DAAPValue header = DAAPParser::decodeData(cut);
    ASSERT_TRUE(header.isDictionary()) << length;
    if (const DAAPArray* listing = header["dmap.listing"].array()) {
      for (const DAAPValue& item : *listing) EXPECT_TRUE(item.item()->isFrozen());
      itemsSeen += listing->size();
    }
  }
  EXPECT_GT(itemsSeen, 0u);
  const DAAPValue whole = DAAPParser::decodeData(full);
  EXPECT_EQ(whole["dmap.listing"].array()->size(), 2u);
  EXPECT_EQ(whole["dmap.deletedidlisting"].array()->size(), 1u);
}

TEST(DAAPHostileTest, CorruptedBytesNeverBreakTheResultKind) {
  const PlistData full = document(richListing());
  std::mt19937 random(12345);
  for (int round = 0; round < 20000; ++round) {
    PlistData corrupted = full;
    const int flips = 1 + static_cast<int>(random() % 4);
    for (int flip = 0; flip < flips; ++flip) {
      // Keep the top-level header so that the walk below it is exercised.
      const std::size_t at = 8 + random() % (corrupted.size() - 8);
      corrupted[at] = static_cast<std::uint8_t>(random());
    }
    ASSERT_TRUE(DAAPParser::decodeData(corrupted).isDictionary()) << round;
  }
}

}  // namespace
}  // namespace larder
