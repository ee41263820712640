// The bottom layer: the writer, the frame of a document, the typed setters
// with their size rules and log lines, single-value decoders, flavors and
// key/value pairs.

#include <gtest/gtest.h>

#include <chrono>
#include <cstring>

#include "DAAPTestSupport.h"
#include "dmap/DAAPItem.h"

namespace larder {
namespace {

using dmaptest::bytesOf;
using dmaptest::container;
using dmaptest::decode;
using dmaptest::document;
using dmaptest::LogCapture;
using dmaptest::raw;
using dmaptest::text;
using dmaptest::u32;
using dmaptest::u64;
using dmaptest::u8;

DAAPParser& parser() {
  return DAAPParser::sharedInstance();
}

std::int64_t secondsFromNow(std::int64_t offset) {
  return std::chrono::duration_cast<std::chrono::seconds>(
             std::chrono::system_clock::now().time_since_epoch())
             .count() +
         offset;
}

PlistData bigEndian32(std::uint32_t value) {
  return {static_cast<std::uint8_t>(value >> 24), static_cast<std::uint8_t>(value >> 16),
          static_cast<std::uint8_t>(value >> 8), static_cast<std::uint8_t>(value)};
}

// ---------------------------------------------------------------- writer

TEST(DAAPBufferTest, EveryAppendReturnsWhereItsValueStarts) {
  DAAPBuffer buffer;
  EXPECT_EQ(buffer.appendHeader("mlog"_dmap, 30), 4u);  // the size field
  EXPECT_EQ(buffer.appendUInt8(7, "mstt"_dmap), 16u);
  EXPECT_EQ(buffer.appendUInt64(0x0102030405060708ULL, "mper"_dmap), 25u);
  EXPECT_EQ(buffer.appendUTF8String(std::string_view("ab"), "minm"_dmap), 41u);
  EXPECT_EQ(buffer.appendHeader("mlcl"_dmap, 0), 47u);
  EXPECT_EQ(buffer.appendUInt32(200, "mstt"_dmap), 59u);
  EXPECT_EQ(buffer.length(), 63u);
  const PlistData expected{'m', 'l', 'o', 'g', 0, 0, 0, 30,  'm', 's', 't', 't', 0,   0, 0, 1, 7,
                           'm', 'p', 'e', 'r', 0, 0, 0, 8,   1,   2,   3,   4,   5,   6, 7, 8, 'm',
                           'i', 'n', 'm', 0,   0, 0, 2, 'a', 'b', 'm', 'l', 'c', 'l', 0, 0, 0, 0,
                           'm', 's', 't', 't', 0, 0, 0, 4,   0,   0,   0,   0xc8};
  EXPECT_EQ(buffer.data(), expected);
}

TEST(DAAPBufferTest, StringBytesGoOutAsGivenWithTheirLength) {
  DAAPBuffer buffer;
  const PlistData binary{0x00, 0xff, 0x80, 0x00};
  buffer.appendUTF8String(std::span<const std::uint8_t>(binary), "pfdt"_dmap);
  EXPECT_EQ(buffer.data(), (PlistData{'p', 'f', 'd', 't', 0, 0, 0, 4, 0x00, 0xff, 0x80, 0x00}));
}

TEST(DAAPBufferTest, MendSizeRewritesAContainerSizeAndRefusesOffsetsOutside) {
  DAAPBuffer buffer;
  const std::size_t sizeOffset = buffer.appendHeader("mlog"_dmap, 0);
  buffer.appendUInt32(42, "mlid"_dmap);
  ASSERT_TRUE(buffer.mendSize(sizeOffset, 12));
  EXPECT_EQ(DAAPParser::decodeData(buffer.data()).int64Value(), 42);
  EXPECT_FALSE(buffer.mendSize(buffer.length() - 3, 1));
  EXPECT_FALSE(buffer.mendSize(buffer.length() + 10, 1));
  EXPECT_EQ(buffer.data()[7], 12);
}

// ---------------------------------------------------------------- frame

TEST(DAAPFrameTest, DocumentsShorterThanAHeaderGiveNothingSilently) {
  LogCapture log;
  const PlistData full = document(container("mlog", {u32("mlid", 5)}));
  for (std::size_t length = 0; length < 8; ++length) {
    EXPECT_TRUE(DAAPParser::decodeData(std::span(full).first(length)).isNull()) << length;
  }
  EXPECT_EQ(log.size(), 0u);
}

TEST(DAAPFrameTest, DeclaredSizeAboveWhatIsPresentIsLoggedAndGivesNothing) {
  LogCapture log;
  PlistData data = document(container("mlog", {u32("mlid", 5)}));
  data[7] = 13;  // one byte more than the 12 present
  EXPECT_TRUE(DAAPParser::decodeData(data).isNull());
  EXPECT_EQ(log.countExactly(
                "DAAPParser: DMAPParser parseStream: got 12 bytes; expected 13; code 'mlog'"),
            1u);
}

TEST(DAAPFrameTest, BytesBehindTheTopLevelTagAreIgnored) {
  PlistData data = document(container("mlog", {u32("mlid", 77)}));
  const PlistData tail = document(container("mlog", {u32("mlid", 5)}));
  data.insert(data.end(), tail.begin(), tail.end());
  data.push_back(0xff);
  EXPECT_EQ(DAAPParser::decodeData(data), DAAPValue(std::int64_t{77}));
}

TEST(DAAPFrameTest, ArsvGivesNothingAndLogsNothing) {
  LogCapture log;
  EXPECT_TRUE(decode(container("arsv", {u32("mstt", 200)})).isNull());
  EXPECT_EQ(log.size(), 0u);
}

TEST(DAAPFrameTest, UnknownTopLevelCodeGivesNothingAndLogsIt) {
  LogCapture log;
  EXPECT_TRUE(decode(container("zzzz", {})).isNull());
  EXPECT_EQ(log.countExactly("DAAPParser: Unknown code: 'zzzz', size=0"), 1u);
}

TEST(DAAPFrameTest, DecodeHexStringDropsBlanksAndAnOddLastDigit) {
  LogCapture log;
  const DAAPValue session =
      DAAPParser::decodeHexString("6d6c6f67 0000000c\n6d 6c 69 64 00000004 0000002A f");
  EXPECT_EQ(session, DAAPValue(std::int64_t{42}));
  EXPECT_EQ(log.countExactly("DAAPParser: Converted command: <6d6c6f67 0000000c 6d6c6964 00000004 "
                             "0000002a>"),
            1u);
}

TEST(DAAPFrameTest, DecodeHexStringOfTooFewBytesGivesNothing) {
  EXPECT_TRUE(DAAPParser::decodeHexString("6d6c6f67 000000").isNull());
  EXPECT_TRUE(DAAPParser::decodeHexString("").isNull());
}

// ------------------------------------------------------- unknown tags

class DAAPUnknownCodeTest : public ::testing::Test {
 protected:
  // Unknown tags inside a server-info document, which knows none of them.
  void decodeWithin(std::vector<dmaptest::Tag> children) {
    children.push_back(u32("mstt", 200));
    const DAAPValue info = decode(container("msrv", std::move(children)));
    // The walk goes on past every unknown tag.
    ASSERT_TRUE(info.isDictionary());
    EXPECT_EQ(info["dmap.status"].int64Value(), 200);
  }
  LogCapture log_;
};

TEST_F(DAAPUnknownCodeTest, EachSizeHasItsOwnLine) {
  const PlistData two{0x01, 0x02};
  const PlistData four{0x01, 0x02, 0x03, 0x04};
  std::uint16_t twoInHostOrder = 0;
  std::uint32_t fourInHostOrder = 0;
  std::memcpy(&twoInHostOrder, two.data(), 2);
  std::memcpy(&fourInHostOrder, four.data(), 4);
  char hex[16];
  std::snprintf(hex, sizeof hex, "%x", fourInHostOrder);

  decodeWithin({raw("zzz0", {}), u8("zzz1", 7), raw("zzz2", two), raw("zzz4", four), u64("zzz8", 1),
                text("zzz5", "hello")});
  EXPECT_EQ(log_.countExactly("DAAPParser: Unknown code: 'zzz0', size=0"), 1u);
  EXPECT_EQ(log_.countExactly("DAAPParser: Unknown code: 'zzz1', size=1, value=7"), 1u);
  EXPECT_EQ(log_.countExactly("DAAPParser: Unknown code: 'zzz2', size=2, value=" +
                              std::to_string(twoInHostOrder)),
            1u);
  EXPECT_EQ(
      log_.countExactly("DAAPParser: Unknown code: 'zzz4', size=4, value=0x" + std::string(hex)),
      1u);
  EXPECT_EQ(log_.countExactly("DAAPParser: Unknown code: 'zzz8', size=8"), 1u);
  EXPECT_EQ(log_.countExactly("DAAPParser: Unknown code: 'zzz5', size=5, value=hello"), 1u);
}

TEST_F(DAAPUnknownCodeTest, TextValueStopsAtZeroAndHidesControlBytes) {
  decodeWithin({raw("zzzt", {'a', 'b', 0, 'c', 'd'}), raw("zzzc", {'x', '\n', 'y'}),
                raw({"\x01\n\xff~", 4}, {})});
  EXPECT_EQ(log_.countExactly("DAAPParser: Unknown code: 'zzzt', size=5, value=ab"), 1u);
  EXPECT_EQ(log_.countExactly("DAAPParser: Unknown code: 'zzzc', size=3, value=x.y"), 1u);
  EXPECT_EQ(log_.countExactly("DAAPParser: Unknown code: '...~', size=0"), 1u);
}

TEST_F(DAAPUnknownCodeTest, LongTextValueIsCutForTheLog) {
  decodeWithin({text("zzzl", std::string(5000, 'q'))});
  EXPECT_EQ(log_.countExactly("DAAPParser: Unknown code: 'zzzl', size=5000, value=" +
                              std::string(256, 'q')),
            1u);
}

TEST_F(DAAPUnknownCodeTest, EmbeddedXmlCodeOutOfPlaceHasItsOwnLine) {
  decodeWithin({text("aeMX", "<plist/>")});
  EXPECT_EQ(log_.countExactly("DAAPParser: xmlcode!"), 1u);
  EXPECT_EQ(log_.countContaining("Unknown code"), 0u);
}

// -------------------------------------------------------------- setters

using Setter = void (DAAPParser::*)(DAAPParser::Bytes, const DAAPReceiver&, const DAAPKey&) const;

struct SetterRule {
  const char* name;
  Setter setter;
  std::vector<std::size_t> acceptedSizes;
};

class DAAPSetterSizeTest : public ::testing::TestWithParam<SetterRule> {};

TEST_P(DAAPSetterSizeTest, WrongSizesLogAndStoreNothingAcceptedSizesStore) {
  const SetterRule& rule = GetParam();
  const PlistData bytes(12, 0x01);
  for (std::size_t size = 0; size <= 12; ++size) {
    LogCapture log;
    DAAPDictionary receiver;
    (parser().*rule.setter)(std::span(bytes).first(size), receiver, DAAPKey("some.key"));
    const bool accepted = std::find(rule.acceptedSizes.begin(), rule.acceptedSizes.end(), size) !=
                          rule.acceptedSizes.end();
    if (accepted) {
      EXPECT_EQ(receiver.size(), 1u) << rule.name << " size " << size;
      EXPECT_EQ(log.size(), 0u) << rule.name << " size " << size;
    } else {
      EXPECT_TRUE(receiver.empty()) << rule.name << " size " << size;
      EXPECT_EQ(log.countExactly("DAAPParser: " + std::string(rule.name) + " being passed a " +
                                 std::to_string(size) + " byte value for: <some.key>!"),
                1u)
          << rule.name << " size " << size;
      EXPECT_EQ(log.size(), 1u);
    }
  }
}

INSTANTIATE_TEST_SUITE_P(
    EverySetter, DAAPSetterSizeTest,
    ::testing::Values(SetterRule{"setBool", &DAAPParser::setBool, {1, 2, 4, 8}},
                      SetterRule{"setSInt8", &DAAPParser::setSInt8, {1}},
                      SetterRule{"setUInt8", &DAAPParser::setUInt8, {1}},
                      SetterRule{"setSInt16", &DAAPParser::setSInt16, {2}},
                      SetterRule{"setUInt16", &DAAPParser::setUInt16, {2}},
                      SetterRule{"setUInt32", &DAAPParser::setUInt32, {4}},
                      SetterRule{"setFloat32", &DAAPParser::setFloat32, {4}},
                      SetterRule{"setUInt64", &DAAPParser::setUInt64, {8}},
                      SetterRule{"setDate", &DAAPParser::setDate, {4}}),
    [](const auto& info) { return std::string(info.param.name); });

class DAAPSetterValueTest : public ::testing::Test {
 protected:
  DAAPValue set(Setter setter, const PlistData& bytes, std::string_view key = "k") {
    DAAPDictionary receiver;
    (parser().*setter)(bytes, receiver, DAAPKey(key));
    return lookup(receiver, key);
  }
};

// What each setter stores for the bytes it accepts; DAAPValue equality is
// type-exact, so a value stored as the wrong kind of number fails too.
TEST_F(DAAPSetterValueTest, SettersDecodeTheirBytes) {
  const float volume = 0.75f;
  PlistData hostFloat(4);
  std::memcpy(hostFloat.data(), &volume, 4);
  struct Case {
    const char* name;
    Setter setter;
    PlistData bytes;
    DAAPValue expected;
  };
  const std::vector<Case> cases{
      // A flag reads only its first byte, whatever its size.
      {"bool 4 set", &DAAPParser::setBool, {0x01, 0x00, 0x00, 0x00}, DAAPValue(true)},
      {"bool 4 last byte", &DAAPParser::setBool, {0x00, 0x00, 0x00, 0x01}, DAAPValue(false)},
      {"bool 1 nonzero", &DAAPParser::setBool, {0x02}, DAAPValue(true)},
      {"bool 2 last byte", &DAAPParser::setBool, {0, 1}, DAAPValue(false)},
      {"bool 8", &DAAPParser::setBool, {0xff, 0, 0, 0, 0, 0, 0, 0}, DAAPValue(true)},
      // Integers are big-endian with their signedness.
      {"sint8", &DAAPParser::setSInt8, {0xff}, DAAPValue(-1)},
      {"uint8", &DAAPParser::setUInt8, {0xff}, DAAPValue(255)},
      {"sint16", &DAAPParser::setSInt16, {0xff, 0xfe}, DAAPValue(-2)},
      {"uint16", &DAAPParser::setUInt16, {0xff, 0xfe}, DAAPValue(65534)},
      {"uint16 order", &DAAPParser::setUInt16, {0x01, 0x02}, DAAPValue(0x0102)},
      {"uint32",
       &DAAPParser::setUInt32,
       {0xfe, 0x02, 0x03, 0x04},
       DAAPValue(std::int64_t{0xfe020304})},
      {"uint64 above int64",
       &DAAPParser::setUInt64,
       {0xff, 0xee, 0xdd, 0xcc, 0xbb, 0xaa, 0x99, 0x88},
       DAAPValue(std::uint64_t{0xffeeddccbbaa9988ULL})},
      {"uint64 small", &DAAPParser::setUInt64, {0, 0, 0, 0, 0, 0, 0x01, 0x02}, DAAPValue(0x0102)},
      // A float is read in host order, without a swap.
      {"float32", &DAAPParser::setFloat32, hostFloat, DAAPValue(0.75)},
      // Dates are unsigned seconds since 1970.
      {"date", &DAAPParser::setDate, {0x5f, 0x5e, 0x10, 0x00}, DAAPValue(PlistDate{1600000000.0})},
      {"date unsigned",
       &DAAPParser::setDate,
       {0xff, 0xff, 0xff, 0xff},
       DAAPValue(PlistDate{4294967295.0})},
      {"string of one zero byte", &DAAPParser::setString, {0x00}, DAAPValue("")},
      {"string of two zero bytes",
       &DAAPParser::setString,
       {0x00, 0x00},
       DAAPValue(std::string(2, '\0'))},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    EXPECT_EQ(set(c.setter, c.bytes, "daap.songdateadded"), c.expected);
  }
}

TEST_F(DAAPSetterValueTest, FutureReleaseDateIsBogusOtherFutureDatesStand) {
  LogCapture log;
  const auto aYearAhead = static_cast<std::uint32_t>(secondsFromNow(365 * 24 * 3600));
  const PlistData future = bigEndian32(aYearAhead);
  EXPECT_TRUE(set(&DAAPParser::setDate, future, "daap.songdatereleased").isNull());
  EXPECT_EQ(log.countExactly("DAAPParser: skipping bogus date:" +
                             DAAPValue(PlistDate{static_cast<double>(aYearAhead)}).description() +
                             " for daap.songdatereleased"),
            1u);
  log.clear();
  EXPECT_EQ(set(&DAAPParser::setDate, future, "daap.songdateadded").date()->secondsSince1970,
            aYearAhead);
  EXPECT_EQ(set(&DAAPParser::setDate, future, "com.orvane.sonorel.store.expected-release-date")
                .date()
                ->secondsSince1970,
            aYearAhead);
  const PlistData past = bigEndian32(static_cast<std::uint32_t>(secondsFromNow(-3600)));
  EXPECT_TRUE(set(&DAAPParser::setDate, past, "daap.songdatereleased").isDate());
  EXPECT_EQ(log.size(), 0u);
}

TEST_F(DAAPSetterValueTest, DatesDescribeThemselvesInUTC) {
  EXPECT_EQ(DAAPValue(PlistDate{1600000000}).description(), "2020-09-13 12:26:40 +0000");
  EXPECT_EQ(DAAPValue(PlistDate{0}).description(), "1970-01-01 00:00:00 +0000");
}

TEST_F(DAAPSetterValueTest, StringOfZeroLengthStoresAndLogsNothing) {
  LogCapture log;
  DAAPDictionary receiver{{DAAPKey("k"), DAAPValue("old")}};
  parser().setString({}, receiver, DAAPKey("k"));
  EXPECT_EQ(lookup(receiver, "k"), DAAPValue("old"));
  EXPECT_EQ(log.size(), 0u);
}

TEST_F(DAAPSetterValueTest, StringThatIsNotUTF8RemovesWhatTheKeyHeld) {
  DAAPDictionary receiver{{DAAPKey("k"), DAAPValue("old")}, {DAAPKey("other"), DAAPValue(1)}};
  parser().setString(PlistData{0xc3, 0x28}, receiver, DAAPKey("k"));
  EXPECT_TRUE(lookup(receiver, "k").isNull());
  EXPECT_EQ(receiver.size(), 1u);
  parser().setString(bytesOf("caf\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80"), receiver, DAAPKey("k"));
  EXPECT_EQ(lookup(receiver, "k"), DAAPValue("caf\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80"));
}

TEST_F(DAAPSetterValueTest, SettersWriteIntoItemsThroughKeyedAccess) {
  DAAPItem item;
  parser().setString(bytesOf("Title"), item, DAAPKey("name"));
  parser().setUInt32(PlistData{0, 0, 0, 9}, item, DAAPKey("daap.songtime"));
  EXPECT_EQ(item.name(), "Title");
  EXPECT_TRUE(item.objectForKey("name").isNull());
  EXPECT_EQ(item.objectForKey("daap.songtime").int64Value(), 9);
}

// --------------------------------------------------- single-value decoders

TEST(DAAPValueDecoderTest, UTF8RejectsMalformedText) {
  for (const PlistData& invalid :
       {PlistData{0xc0, 0x80}, PlistData{0xed, 0xa0, 0x80}, PlistData{0xf5, 0x80, 0x80, 0x80},
        PlistData{0xe2, 0x82}, PlistData{0x80}, PlistData{0xf4, 0x90, 0x80, 0x80},
        PlistData{'a', 'b', 'c', 'd', 'e', 'f', 'g', 'h', 0xff}}) {
    EXPECT_FALSE(parser().parseUTF8String(invalid).has_value());
  }
  EXPECT_EQ(parser().parseUTF8String({}), "");
  EXPECT_EQ(parser().parseUTF8String(PlistData{0}), "");
  EXPECT_EQ(parser().parseUTF8String(bytesOf("\xf4\x8f\xbf\xbf")), "\xf4\x8f\xbf\xbf");
}

TEST(DAAPValueDecoderTest, UnicodeCharacterIsExactlyTwoBytesOfUTF16) {
  EXPECT_EQ(parser().parseUnicodeCharacter(PlistData{0x00, 0x41}), "A");
  EXPECT_EQ(parser().parseUnicodeCharacter(PlistData{0x00, 0xe9}), "\xc3\xa9");
  EXPECT_EQ(parser().parseUnicodeCharacter(PlistData{0x20, 0xac}), "\xe2\x82\xac");
  EXPECT_FALSE(parser().parseUnicodeCharacter(PlistData{0x41}).has_value());
  EXPECT_FALSE(parser().parseUnicodeCharacter(PlistData{0x00, 0x41, 0x00}).has_value());
  EXPECT_FALSE(parser().parseUnicodeCharacter(PlistData{0xd8, 0x3d}).has_value());
}

TEST(DAAPValueDecoderTest, SwapInt64BigToHostStaysInsideTheValue) {
  EXPECT_EQ(parser().SwapInt64BigToHost(PlistData{1, 2, 3, 4, 5, 6, 7, 8}), 0x0102030405060708ULL);
  EXPECT_EQ(parser().SwapInt64BigToHost(PlistData{0x00, 0x1b, 0x63, 0x84, 0x45, 0xe6}),
            0x001b638445e6ULL);
  EXPECT_EQ(parser().SwapInt64BigToHost(PlistData{1, 2, 3, 4, 5, 6, 7, 8, 9, 10}),
            0x0102030405060708ULL);
  EXPECT_EQ(parser().SwapInt64BigToHost({}), 0u);
}

TEST(DAAPValueDecoderTest, XmlContentIsAnyPropertyList) {
  LogCapture log;
  const DAAPValue dictionary = parser().processXMLContent(
      bytesOf("<?xml version=\"1.0\" encoding=\"UTF-8\"?><plist version=\"1.0\"><dict><key>id</key>"
              "<string>42</string></dict></plist>"));
  EXPECT_EQ(dictionary["id"], DAAPValue("42"));
  const DAAPValue array = parser().processXMLContent(
      bytesOf("<plist version=\"1.0\"><array><integer>1</integer></array></plist>"));
  ASSERT_TRUE(array.isArray());
  EXPECT_EQ(array.array()->at(0).int64Value(), 1);
  EXPECT_EQ(log.size(), 0u);

  EXPECT_TRUE(parser().processXMLContent({}).isNull());
  EXPECT_EQ(log.size(), 0u);
  EXPECT_TRUE(parser().processXMLContent(bytesOf("not a plist <")).isNull());
  EXPECT_EQ(log.countContaining("DAAPParser: Attempting to process XML response: "), 1u);
}

TEST(DAAPValueDecoderTest, TypeForDRCPValueTypeNamesEveryType) {
  const std::vector<std::pair<std::uint32_t, std::string_view>> named{
      {1, "boolean"}, {3, "uint32"}, {4, "float"},   {5, "indexed"}, {6, "keyed"},
      {7, "string"},  {12, "group"}, {13, "action"}, {14, "node"},   {15, "item"},
      {16, "image"},  {18, "point"}, {19, "dpad"},   {20, "touch"}};
  for (const auto& [number, name] : named) {
    EXPECT_EQ(DAAPParser::typeForDRCPValueType(number), name);
  }
  for (const std::uint32_t other : {0u, 2u, 8u, 9u, 10u, 11u, 17u, 21u, 0xffffffffu}) {
    EXPECT_EQ(DAAPParser::typeForDRCPValueType(other), "undefined") << other;
  }
}

// --------------------------------------------------------------- flavors

TEST(DAAPFlavorTest, UnwrappedListingIsOneFlavor) {
  const PlistData bytes = [] {
    DAAPBuffer buffer;
    buffer.appendUInt32(7, "aefd"_dmap);
    buffer.appendUTF8String(std::string_view("epub"), "asfm"_dmap);
    return buffer.data();
  }();
  const DAAPArray flavors = parser().processFlavors(bytes);
  ASSERT_EQ(flavors.size(), 1u);
  EXPECT_EQ(flavors[0]["com.orvane.sonorel.item-flavor-id"].int64Value(), 7);
  EXPECT_EQ(flavors[0]["daap.songformat"], DAAPValue("epub"));
}

TEST(DAAPFlavorTest, ThreeWrappedFlavorsAreThreeAndAnyChildCodeCounts) {
  DAAPBuffer buffer;
  container("aeif", {u32("aefd", 1)}).writeTo(buffer);
  container("aeif", {u32("aefd", 2)}).writeTo(buffer);
  container("zzzz", {u32("aefd", 3)}).writeTo(buffer);
  const DAAPArray flavors = parser().processFlavors(buffer.data());
  ASSERT_EQ(flavors.size(), 3u);
  for (std::size_t index = 0; index < 3; ++index) {
    EXPECT_EQ(flavors[index]["com.orvane.sonorel.item-flavor-id"].uint64Value(), index + 1);
  }
}

TEST(DAAPFlavorTest, WrappedEmptyFlavorIsStillAppended) {
  DAAPBuffer buffer;
  container("aeif", {}).writeTo(buffer);
  const DAAPArray flavors = parser().processFlavors(buffer.data());
  ASSERT_EQ(flavors.size(), 1u);
  EXPECT_TRUE(flavors[0].dictionary()->empty());
}

TEST(DAAPFlavorTest, FlavorWithoutKnownTagsIsReportedAndGivesNone) {
  LogCapture log;
  DAAPBuffer buffer;
  buffer.appendUInt32(7, "qqqq"_dmap);
  EXPECT_TRUE(parser().processFlavors(buffer.data()).empty());
  EXPECT_EQ(log.countExactly("DAAPParser: Flavor doesn't look correct like the correct size."), 1u);
  EXPECT_EQ(log.countExactly("DAAPParser: Unknown code: 'qqqq', size=12, value=qqqq"), 1u);
  EXPECT_EQ(log.countExactly("DAAPParser: Unknown code: 'qqqq', size=4, value=0x7000000"), 1u);
}

TEST(DAAPFlavorTest, EmptyOrTinyValuesAreNotReadBeyondTheirEnd) {
  LogCapture log;
  EXPECT_TRUE(parser().processFlavors({}).empty());
  EXPECT_EQ(log.countExactly("DAAPParser: Unknown code: '....', size=0"), 1u);
  EXPECT_TRUE(parser().processFlavors(bytesOf("ae")).empty());
  EXPECT_EQ(log.countExactly("DAAPParser: Unknown code: 'ae..', size=2, value=" +
                             std::to_string(static_cast<unsigned>('a' | ('e' << 8)))),
            1u);
}

// ------------------------------------------------------------ dict pairs

PlistData pairBytes(std::vector<dmaptest::Tag> children) {
  DAAPBuffer buffer;
  for (const auto& child : children) child.writeTo(buffer);
  return buffer.data();
}

TEST(DAAPParseDictTest, KeyAndValueInEitherOrderMakeTheSameEntry) {
  DAAPDictionary keyFirst;
  DAAPDictionary valueFirst;
  parser().parseDict(pairBytes({text("mdky", "color"), text("mdvl", "blue")}), keyFirst);
  parser().parseDict(pairBytes({text("mdvl", "blue"), text("mdky", "color")}), valueFirst);
  EXPECT_EQ(keyFirst, valueFirst);
  EXPECT_EQ(lookup(keyFirst, "color"), DAAPValue("blue"));
  EXPECT_EQ(keyFirst.size(), 1u);
}

TEST(DAAPParseDictTest, KeyWithoutValueCarriesOverAndOtherChildrenAreSkippedSilently) {
  LogCapture log;
  DAAPDictionary receiver;
  parser().parseDict(pairBytes({text("mdky", "first"), text("mdky", "second"), u32("zzzz", 1),
                                text("mdvl", "2"), text("mdvl", "lonely")}),
                     receiver);
  EXPECT_EQ(receiver.size(), 1u);
  EXPECT_EQ(lookup(receiver, "second"), DAAPValue("2"));
  EXPECT_EQ(log.size(), 0u);
}

TEST(DAAPParseDictTest, PairsGoThroughKeyedAccessOfAnItem) {
  DAAPItem item;
  parser().parseDict(pairBytes({text("mdky", "name"), text("mdvl", "Speaker"), text("mdky", "room"),
                                text("mdvl", "Kitchen")}),
                     item);
  EXPECT_EQ(item.name(), "Speaker");
  EXPECT_EQ(item.objectForKey("room"), DAAPValue("Kitchen"));
}

}  // namespace
}  // namespace larder
