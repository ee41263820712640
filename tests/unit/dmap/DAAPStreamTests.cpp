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

using namespace dmaptest;  // NOLINT(google-build-using-namespace)

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

// A document's frame: each row is the bytes, what they decode to, and the
// log lines they give (each a fragment of one line; no other lines).
TEST(DAAPFrameTest, TheTopLevelTagDecidesWhatADocumentGives) {
  const PlistData login = document(container("mlog", {u32("mlid", 77)}));
  const auto withSize = [&](std::uint32_t size) {
    PlistData data = login;
    for (std::size_t index = 0; index < 4; ++index) {
      data[4 + index] = static_cast<std::uint8_t>(size >> (24 - 8 * index));
    }
    return data;
  };
  PlistData trailing = login;
  for (const std::uint8_t byte : document(container("mlog", {u32("mlid", 5)}))) {
    trailing.push_back(byte);
  }
  trailing.push_back(0xff);
  struct Case {
    std::string name;
    PlistData bytes;
    DAAPValue expected;
    std::vector<std::string> log;
  };
  std::vector<Case> cases{
      {"whole", login, std::int64_t{77}, {}},
      {"bytes behind the top-level tag are ignored", trailing, std::int64_t{77}, {}},
      {"one byte more declared than present",
       withSize(13),
       {},
       {"got 12 bytes; expected 13; code 'mlog'"}},
      {"size with the top bit clear, far beyond", withSize(0x7fffffff), {}, {"got 12 bytes"}},
      {"size with the top bit set", withSize(0x80000000), {}, {"got 12 bytes"}},
      {"largest size", withSize(0xffffffff), {}, {"got 12 bytes"}},
      {"acknowledgement gives nothing silently",
       document(container("arsv", {u32("mstt", 200)})),
       {},
       {}},
      {"unknown top-level code",
       document(container("zzzz", {})),
       {},
       {"DAAPParser: Unknown code: 'zzzz', size=0"}},
  };
  for (std::size_t length = 0; length < 8; ++length) {
    cases.push_back({"shorter than a header: " + std::to_string(length),
                     PlistData(login.begin(), login.begin() + static_cast<std::ptrdiff_t>(length)),
                     {},
                     {}});
  }
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture log;
    EXPECT_EQ(DAAPParser::decodeData(c.bytes), c.expected);
    for (const std::string& line : c.log) EXPECT_EQ(log.countContaining(line), 1u) << line;
    EXPECT_EQ(log.size(), c.log.size());
  }
}

TEST(DAAPFrameTest, DecodeHexStringDropsBlanksAndAnOddLastDigit) {
  LogCapture log;
  const DAAPValue session =
      DAAPParser::decodeHexString("6d6c6f67 0000000c\n6d 6c 69 64 00000004 0000002A f");
  EXPECT_EQ(session, DAAPValue(std::int64_t{42}));
  EXPECT_EQ(log.countExactly("DAAPParser: Converted command: <6d6c6f67 0000000c 6d6c6964 00000004 "
                             "0000002a>"),
            1u);
  EXPECT_TRUE(DAAPParser::decodeHexString("6d6c6f67 000000").isNull());
  EXPECT_TRUE(DAAPParser::decodeHexString("").isNull());
}

// ------------------------------------------------------- unknown tags

// Unknown tags inside a server-info document, which knows none of them:
// each is logged by its size, and the walk goes on past it.
TEST(DAAPUnknownCodeTest, EachSizeHasItsOwnLine) {
  const PlistData two{0x01, 0x02};
  const PlistData four{0x01, 0x02, 0x03, 0x04};
  std::uint16_t twoInHostOrder = 0;
  std::uint32_t fourInHostOrder = 0;
  std::memcpy(&twoInHostOrder, two.data(), 2);
  std::memcpy(&fourInHostOrder, four.data(), 4);
  char hex[16];
  std::snprintf(hex, sizeof hex, "%x", fourInHostOrder);
  const struct {
    Tag tag;
    std::string line;
  } cases[] = {
      {raw("zzz0", {}), "'zzz0', size=0"},
      {u8("zzz1", 7), "'zzz1', size=1, value=7"},
      {raw("zzz2", two), "'zzz2', size=2, value=" + std::to_string(twoInHostOrder)},
      {raw("zzz4", four), "'zzz4', size=4, value=0x" + std::string(hex)},
      {u64("zzz8", 1), "'zzz8', size=8"},
      {text("zzz5", "hello"), "'zzz5', size=5, value=hello"},
      // Text stops at a zero and hides control bytes, in the code too.
      {raw("zzzt", {'a', 'b', 0, 'c', 'd'}), "'zzzt', size=5, value=ab"},
      {raw("zzzc", {'x', '\n', 'y'}), "'zzzc', size=3, value=x.y"},
      {raw({"\x01\n\xff~", 4}, {}), "'...~', size=0"},
      {text("zzzl", std::string(5000, 'q')), "'zzzl', size=5000, value=" + std::string(256, 'q')},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.line);
    LogCapture log;
    const DAAPValue info = decode(container("msrv", {c.tag, u32("mstt", 200)}));
    EXPECT_EQ(info, DAAPValue(dictionaryOf({{"dmap.status", std::int64_t{200}}})));
    EXPECT_EQ(log.countExactly("DAAPParser: Unknown code: " + c.line), 1u);
    EXPECT_EQ(log.size(), 1u);
  }
  LogCapture log;  // an embedded list out of place has a line of its own
  decode(container("msrv", {text("aeMX", "<plist/>")}));
  EXPECT_EQ(log.countExactly("DAAPParser: xmlcode!"), 1u);
  EXPECT_EQ(log.size(), 1u);
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
  // The log line shows the date in UTC.
  EXPECT_EQ(DAAPValue(PlistDate{1600000000}).description(), "2020-09-13 12:26:40 +0000");
  EXPECT_EQ(DAAPValue(PlistDate{0}).description(), "1970-01-01 00:00:00 +0000");
}

TEST_F(DAAPSetterValueTest, StringsOfNoBytesStoreNothingThoseNotUTF8RemoveWhatTheKeyHeld) {
  LogCapture log;
  DAAPDictionary receiver{{DAAPKey("k"), DAAPValue("old")}, {DAAPKey("other"), DAAPValue(1)}};
  parser().setString({}, receiver, DAAPKey("k"));
  EXPECT_EQ(lookup(receiver, "k"), DAAPValue("old"));
  EXPECT_EQ(log.size(), 0u);
  parser().setString(PlistData{0xc3, 0x28}, receiver, DAAPKey("k"));
  EXPECT_TRUE(lookup(receiver, "k").isNull());
  EXPECT_EQ(receiver.size(), 1u);
  parser().setString(bytesOf("caf\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80"), receiver, DAAPKey("k"));
  EXPECT_EQ(lookup(receiver, "k"), DAAPValue("caf\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80"));
  DAAPItem item;  // setters write into items through keyed access
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

DAAPDictionary flavor(std::uint32_t identifier) {
  return dictionaryOf({{"com.orvane.sonorel.item-flavor-id", std::int64_t{identifier}}});
}

TEST(DAAPFlavorTest, FlavorsAreWrappedOrOneUnwrappedListing) {
  const std::string kNoFlavor = "DAAPParser: Flavor doesn't look correct like the correct size.";
  const struct {
    const char* name;
    PlistData bytes;
    DAAPArray expected;
    std::vector<std::string> log;
  } cases[] = {
      {"an unwrapped listing is one flavor",
       bodyOf({u32("aefd", 7), text("asfm", "epub")}),
       {dictionaryOf(
           {{"com.orvane.sonorel.item-flavor-id", std::int64_t{7}}, {"daap.songformat", "epub"}})},
       {}},
      {"any child code wraps a flavor",
       bodyOf({container("aeif", {u32("aefd", 1)}), container("aeif", {u32("aefd", 2)}),
               container("zzzz", {u32("aefd", 3)})}),
       {flavor(1), flavor(2), flavor(3)},
       {}},
      {"a wrapped empty flavor is still appended",
       bodyOf({container("aeif", {})}),
       {DAAPDictionary{}},
       {}},
      {"a flavor without known tags is reported and gives none",
       bodyOf({u32("qqqq", 7)}),
       {},
       {kNoFlavor, "DAAPParser: Unknown code: 'qqqq', size=12, value=qqqq",
        "DAAPParser: Unknown code: 'qqqq', size=4, value=0x7000000"}},
      {"empty", {}, {}, {kNoFlavor, "DAAPParser: Unknown code: '....', size=0"}},
      {"shorter than a header is not read beyond its end",
       bytesOf("ae"),
       {},
       {"DAAPParser: 2 stray bytes at the end of a container skipped", kNoFlavor,
        "DAAPParser: Unknown code: 'ae..', size=2, value=" +
            std::to_string(static_cast<unsigned>('a' | ('e' << 8)))}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture log;
    EXPECT_EQ(DAAPValue(parser().processFlavors(c.bytes)), DAAPValue(c.expected));
    for (const std::string& line : c.log) EXPECT_EQ(log.countExactly(line), 1u) << line;
    EXPECT_EQ(log.size(), c.log.size());
  }
}

// ------------------------------------------------------------ dict pairs

TEST(DAAPParseDictTest, KeysAndValuesPairInEitherOrder) {
  const struct {
    const char* name;
    std::vector<Tag> tags;
    DAAPDictionary expected;
  } cases[] = {
      {"key first",
       {text("mdky", "color"), text("mdvl", "blue")},
       dictionaryOf({{"color", "blue"}})},
      {"value first",
       {text("mdvl", "blue"), text("mdky", "color")},
       dictionaryOf({{"color", "blue"}})},
      {"a key without value carries over; other children and a lone value are skipped",
       {text("mdky", "first"), text("mdky", "second"), u32("zzzz", 1), text("mdvl", "2"),
        text("mdvl", "lonely")},
       dictionaryOf({{"second", "2"}})},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture log;
    DAAPDictionary receiver;
    parser().parseDict(bodyOf(c.tags), receiver);
    EXPECT_EQ(receiver, c.expected);
    EXPECT_EQ(log.size(), 0u);
  }
  DAAPItem item;  // through keyed access of an item
  parser().parseDict(bodyOf({text("mdky", "name"), text("mdvl", "Speaker"), text("mdky", "room"),
                             text("mdvl", "Kitchen")}),
                     item);
  EXPECT_EQ(item.name(), "Speaker");
  EXPECT_EQ(item.objectForKey("room"), DAAPValue("Kitchen"));
}

}  // namespace
}  // namespace larder
