#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <plist/plist.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <limits>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/plist/Utf8.h"
#include "platform/value/PlistValue.h"

namespace larder {
namespace {

using Type = PlistValue::Type;

constexpr double kEpochOffset2001 = 978307200.0;
constexpr std::int64_t kInt64Max = std::numeric_limits<std::int64_t>::max();
constexpr std::int64_t kInt64Min = std::numeric_limits<std::int64_t>::min();
constexpr std::uint64_t kUint64Max = std::numeric_limits<std::uint64_t>::max();

struct PlistNodeDeleter {
  void operator()(void* node) const { plist_free(node); }
};
using PlistNode = std::unique_ptr<void, PlistNodeDeleter>;

PlistData bytesOf(std::string_view text) {
  return PlistData(text.begin(), text.end());
}

Result<PlistValue> readBytes(const PlistData& bytes, const PlistReadLimits& limits = {}) {
  return PropertyListSerialization::read(std::span<const std::uint8_t>(bytes), limits);
}

// Where two values first differ, as a path, or "" when they are the same. Type-exact, so a
// value that comes back as another kind of number differs; two NaN reals are the same value.
std::string firstDifference(const PlistValue& a, const PlistValue& b,
                            const std::string& path = "/") {
  if (a.type() != b.type()) return path + " (type)";
  if (a.isReal()) {
    const double x = a.doubleValue();
    const double y = b.doubleValue();
    return (std::isnan(x) && std::isnan(y)) || x == y ? "" : path;
  }
  if (const PlistArray* left = a.array()) {
    const PlistArray& right = *b.array();
    if (left->size() != right.size()) return path + " (size)";
    for (std::size_t index = 0; index < left->size(); ++index) {
      std::string found =
          firstDifference((*left)[index], right[index], path + std::to_string(index) + "/");
      if (!found.empty()) return found;
    }
    return "";
  }
  if (const PlistDictionary* left = a.dictionary()) {
    const PlistDictionary& right = *b.dictionary();
    if (left->size() != right.size()) return path + " (keys)";
    for (const auto& [key, member] : *left) {
      const auto other = right.find(key);
      if (other == right.end()) return path + key + " (missing)";
      std::string found = firstDifference(member, other->second, path + key + "/");
      if (!found.empty()) return found;
    }
    return "";
  }
  return a == b ? "" : path;
}

PlistValue nestedArrays(std::size_t depth) {
  PlistValue value = PlistArray{};
  for (std::size_t level = 1; level < depth; ++level) value = PlistArray{std::move(value)};
  return value;
}

PlistData sequence(std::initializer_list<int> bytes) {
  PlistData out;
  for (const int byte : bytes) out.push_back(static_cast<std::uint8_t>(byte));
  return out;
}

PlistData withPayload(PlistData header, std::size_t count, std::uint8_t byte) {
  header.insert(header.end(), count, byte);
  return header;
}

void appendBigEndian(PlistData& out, std::uint64_t value, unsigned width) {
  for (unsigned shift = width * 8; shift > 0; shift -= 8) {
    out.push_back(static_cast<std::uint8_t>(value >> (shift - 8)));
  }
}

// `file` with `width` bytes at `at` overwritten by `value`, big-endian.
PlistData patched(PlistData file, std::size_t at, std::uint64_t value, unsigned width) {
  PlistData bytes;
  appendBigEndian(bytes, value, width);
  std::copy(bytes.begin(), bytes.end(), file.begin() + static_cast<long>(at));
  return file;
}

// Assembles a binary property list from hand-written objects, so that tests
// can state exactly the bytes a reader is given.
PlistData assembleBinary(const std::vector<PlistData>& objects, std::uint64_t topObject = 0,
                         unsigned referenceWidth = 1) {
  PlistData out = bytesOf("bplist00");
  std::vector<std::uint64_t> offsets;
  for (const PlistData& object : objects) {
    offsets.push_back(out.size());
    out.insert(out.end(), object.begin(), object.end());
  }
  const std::uint64_t tableOffset = out.size();
  for (const std::uint64_t offset : offsets) appendBigEndian(out, offset, 2);
  out.insert(out.end(), 6, 0);
  out.push_back(2);
  out.push_back(static_cast<std::uint8_t>(referenceWidth));
  appendBigEndian(out, objects.size(), 8);
  appendBigEndian(out, topObject, 8);
  appendBigEndian(out, tableOffset, 8);
  return out;
}

struct Trailer {
  std::uint8_t offsetWidth;
  std::uint8_t referenceWidth;
  std::uint64_t objectCount;
  std::uint64_t offsetTableOffset;
};

Trailer trailerOf(const PlistData& file) {
  const std::size_t at = file.size() - 32;
  const auto number = [&](std::size_t from) {
    std::uint64_t value = 0;
    for (std::size_t index = from; index < from + 8; ++index) value = (value << 8) | file.at(index);
    return value;
  };
  return {file.at(at + 6), file.at(at + 7), number(at + 8), number(at + 24)};
}

// The bytes of the root object of a file that holds only that object.
PlistData soleObjectBytes(const PlistValue& value) {
  const PlistData file = PropertyListSerialization::writeBinary(value);
  const Trailer trailer = trailerOf(file);
  EXPECT_EQ(trailer.objectCount, 1u);
  return PlistData(file.begin() + 8, file.begin() + static_cast<long>(trailer.offsetTableOffset));
}

PlistValue everyKindOfValue() {
  const PlistDictionary nested{
      {"name", "inner"}, {"list", PlistArray{1, 2, 3, "four", PlistArray{}, PlistDictionary{}}}};
  PlistArray manyElements;
  for (int index = 0; index < 40; ++index) manyElements.emplace_back(index * 1000);
  return PlistDictionary{
      {"true", true},
      {"false", false},
      {"zero", 0},
      {"small", 5},
      {"twoBytes", 300},
      {"fourBytes", 70000},
      {"eightBytes", std::int64_t{5'000'000'000}},
      {"negative", -42},
      {"int64Min", kInt64Min},
      {"int64Max", kInt64Max},
      {"aboveInt64", kUint64Max},
      {"real", 3.25},
      {"tinyReal", 1e-300},
      {"negativeReal", -0.1},
      {"infinity", std::numeric_limits<double>::infinity()},
      {"date", PlistDate{1700000000.125}},
      {"dateBefore2001", PlistDate{946684800.5}},
      {"data", PlistData{0, 1, 0, 255, 0}},
      {"emptyData", PlistData{}},
      {"ascii", "/Applications/App1234.app"},
      {"unicode",
       "h\xC3\xA9llo w\xC3\xB6rld \xE2\x80\x94 \xE6\x97\xA5\xE6\x9C\xAC \xF0\x9F\x98\x80"},
      {"empty", ""},
      {"long", std::string(300, 'x')},
      {"emptyArray", PlistArray{}},
      {"emptyDictionary", PlistDictionary{}},
      {"uid", PlistUid{42}},
      {"bigUid", PlistUid{0x12345678}},
      {"nested", PlistArray{nested, nested}},
      {"manyElements", manyElements},
      {"\xE2\x9C\x93 unicode key", "value"}};
}

PlistValue productCatalogue(int count) {
  PlistArray records;
  for (int index = 0; index < count; ++index) {
    const std::string number = std::to_string(index);
    records.emplace_back(
        PlistDictionary{{"bundlePath", "/Applications/App" + number + ".app"},
                        {"bundleIdentifier", "com.example.app" + number},
                        {"bundleVersion", "1.2.3"},
                        {"shortVersion", "1.2"},
                        {"title", "App " + number},
                        {"artistName", "Example Developer"},
                        {"kind", "software"},
                        {"itemId", std::int64_t{400'000'000} + index},
                        {"storefrontId", 143441},
                        {"genreId", 6002 + index % 20},
                        {"sizeInBytes", std::int64_t{1'000'000} * (index % 500 + 1)},
                        {"purchaseDate", PlistDate{1'600'000'000.0 + index * 37.5}},
                        {"isInstalled", index % 3 != 0},
                        {"hasUpdate", index % 7 == 0}});
  }
  return records;
}

// Builds libplist's own tree, independently of the code under test.
PlistNode toLibplist(const PlistValue& value) {
  switch (value.type()) {
    case Type::Boolean:
      return PlistNode(plist_new_bool(value.boolValue()));
    case Type::Integer:
      return PlistNode(plist_new_uint(value.uint64Value()));
    case Type::UnsignedInteger: {
      // libplist makes a 16-byte integer only when it reads one.
      PlistData object = sequence({0x14, 0, 0, 0, 0, 0, 0, 0, 0});
      appendBigEndian(object, value.uint64Value(), 8);
      const PlistData file = assembleBinary({object});
      plist_t node = nullptr;
      plist_from_bin(reinterpret_cast<const char*>(file.data()),
                     static_cast<std::uint32_t>(file.size()), &node);
      return PlistNode(node);
    }
    case Type::Real:
      return PlistNode(plist_new_real(value.doubleValue()));
    case Type::String:
      return PlistNode(plist_new_string(value.string()->c_str()));
    case Type::Data:
      return PlistNode(plist_new_data(reinterpret_cast<const char*>(value.data()->data()),
                                      value.data()->size()));
    case Type::Date: {
      const double since2001 = value.date()->secondsSince1970 - kEpochOffset2001;
      const double seconds = std::floor(since2001);
      return PlistNode(plist_new_date(static_cast<std::int32_t>(seconds),
                                      static_cast<std::int32_t>((since2001 - seconds) * 1e6)));
    }
    case Type::Uid:
      return PlistNode(plist_new_uid(value.uid()->value));
    case Type::Array: {
      PlistNode array(plist_new_array());
      for (const PlistValue& element : *value.array()) {
        plist_array_append_item(array.get(), toLibplist(element).release());
      }
      return array;
    }
    case Type::Dictionary: {
      PlistNode dictionary(plist_new_dict());
      for (const auto& [key, member] : *value.dictionary()) {
        plist_dict_set_item(dictionary.get(), key.c_str(), toLibplist(member).release());
      }
      return dictionary;
    }
    case Type::Null:
      break;
  }
  return PlistNode(plist_new_dict());
}

// libplist's own encoding of a tree: two trees built apart are the same when these are.
PlistData libplistBinary(plist_t node) {
  char* raw = nullptr;
  std::uint32_t length = 0;
  plist_to_bin(node, &raw, &length);
  const PlistData bytes(raw, raw + length);
  plist_to_bin_free(raw);
  return bytes;
}

// What reading some bytes must give: without an `error`, acceptance (as `value`, when
// given); otherwise a refusal whose text holds `error`.
struct ReadCase {
  std::string name;
  PlistData bytes;
  std::optional<PlistValue> value;
  std::optional<std::string> error;  // "": any refusal
  PlistReadLimits limits = {};
};

void expectRead(const ReadCase& c) {
  SCOPED_TRACE(c.name);
  const auto start = std::chrono::steady_clock::now();
  const Result<PlistValue> read = readBytes(c.bytes, c.limits);
  // However far the input would expand, the reader is quick to say so.
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  if (!c.error) {
    ASSERT_TRUE(read) << read.errorDescription();
    if (c.value) {
      EXPECT_EQ(firstDifference(*read, *c.value), "");
    }
    return;
  }
  ASSERT_FALSE(read) << "accepted";
  EXPECT_EQ(read.error().domain, PropertyListSerialization::kErrorDomain);
  EXPECT_FALSE(read.error().description.empty());
  EXPECT_THAT(read.error().description, testing::HasSubstr(*c.error));
}

// A refusal whose text holds `says` ("": any refusal).
struct Refusal {
  std::string name;
  PlistData bytes;
  std::string says;
};

TEST(PlistValueTest, UnsignedConstructorKeepsSmallValuesSigned) {
  EXPECT_EQ(PlistValue(std::uint64_t{5}).type(), Type::Integer);
  const auto largestSigned = static_cast<std::uint64_t>(kInt64Max);
  EXPECT_EQ(PlistValue(largestSigned).type(), Type::Integer);
  EXPECT_EQ(PlistValue(largestSigned + 1).type(), Type::UnsignedInteger);
  EXPECT_EQ(PlistValue(largestSigned + 1).uint64Value(), largestSigned + 1);
}

TEST(PlistValueTest, ValuesConvertIntoEachOther) {
  EXPECT_EQ(PlistValue(3.9).int64Value(), 3);
  EXPECT_EQ(PlistValue(-3.9).int64Value(), -3);
  EXPECT_EQ(PlistValue(std::nan("")).int64Value(), 0);
  EXPECT_EQ(PlistValue(1e300).int64Value(), kInt64Max);
  EXPECT_EQ(PlistValue(-1e300).int64Value(), kInt64Min);
  EXPECT_EQ(PlistValue(1e300).uint64Value(), kUint64Max);
  EXPECT_EQ(PlistValue(true).int64Value(), 1);
  EXPECT_EQ(PlistValue(false).doubleValue(), 0.0);
  EXPECT_EQ(PlistValue(-1).uint64Value(), kUint64Max);
  EXPECT_EQ(PlistValue(kUint64Max).int64Value(), -1);
  EXPECT_DOUBLE_EQ(PlistValue(7).doubleValue(), 7.0);
  EXPECT_TRUE(PlistValue(0.5).boolValue());
  EXPECT_FALSE(PlistValue(0.0).boolValue());
  EXPECT_FALSE(PlistValue(std::nan("")).boolValue());
  EXPECT_TRUE(PlistValue(-2).boolValue());
  // Strings read as decimal numbers, after leading blanks and up to what is no digit.
  EXPECT_EQ(PlistValue("  -42abc").int64Value(), -42);
  EXPECT_EQ(PlistValue("+7").int64Value(), 7);
  EXPECT_EQ(PlistValue("12.9").int64Value(), 12);
  EXPECT_EQ(PlistValue("abc").int64Value(), 0);
  EXPECT_EQ(PlistValue("").int64Value(), 0);
  EXPECT_EQ(PlistValue("99999999999999999999").int64Value(), kInt64Max);
  EXPECT_EQ(PlistValue("-99999999999999999999").int64Value(), kInt64Min);
  EXPECT_EQ(PlistValue("18446744073709551615").uint64Value(), kUint64Max);
  EXPECT_EQ(PlistValue("\t\n 400000123 ").uint64Value(), 400000123u);
  EXPECT_DOUBLE_EQ(PlistValue("  2.5e3xyz").doubleValue(), 2500.0);
  EXPECT_DOUBLE_EQ(PlistValue("+1.5").doubleValue(), 1.5);
  EXPECT_DOUBLE_EQ(PlistValue("-0.25").doubleValue(), -0.25);
  EXPECT_EQ(PlistValue("x1").doubleValue(), 0.0);
  // Strings read as flags.
  for (const char* yes : {"YES", "true", " 1", "007", "-3"}) {
    EXPECT_TRUE(PlistValue(yes).boolValue()) << yes;
  }
  for (const char* no : {"NO", "false", "000", ""}) EXPECT_FALSE(PlistValue(no).boolValue()) << no;
  // Other types convert to zero.
  EXPECT_EQ(PlistValue().int64Value(), 0);
  EXPECT_EQ(PlistValue(PlistDate{1e9}).doubleValue(), 0.0);
  EXPECT_EQ(PlistValue(PlistUid{9}).int64Value(), 0);
  EXPECT_FALSE(PlistValue(PlistArray{1}).boolValue());
  EXPECT_EQ(PlistValue(PlistData{1, 2}).uint64Value(), 0u);
}

TEST(PlistValueTest, EqualityIsDeepAndTypeExact) {
  EXPECT_EQ(everyKindOfValue(), everyKindOfValue());
  PlistValue changed = everyKindOfValue();
  (*(*changed.dictionary())["nested"].array())[1].dictionary()->at("name") = "other";
  EXPECT_FALSE(changed == everyKindOfValue());
  EXPECT_FALSE(PlistValue(5) == PlistValue(5.0));
  EXPECT_FALSE(PlistValue(1) == PlistValue(true));
  EXPECT_FALSE(PlistValue("5") == PlistValue(5));
  EXPECT_TRUE(PlistValue() == PlistValue());
  EXPECT_FALSE(PlistValue() == PlistValue(PlistDictionary{}));
  EXPECT_FALSE(PlistValue(PlistArray{1, 2}) == PlistValue(PlistArray{2, 1}));
}

// Each value alone in a file, and the exact bytes of its object: the
// smallest integer width that fits, every marker, long lengths after it.
TEST(BinaryPlistWriterTest, WritesExactObjectEncodings) {
  struct Case {
    const char* name;
    PlistValue value;
    PlistData expected;
  };
  const std::vector<Case> cases{
      {"int 1 byte", 5, sequence({0x10, 0x05})},
      {"int 1 byte max", 255, sequence({0x10, 0xFF})},
      {"int 2 bytes", 300, sequence({0x11, 0x01, 0x2C})},
      {"int 4 bytes", 70000, sequence({0x12, 0x00, 0x01, 0x11, 0x70})},
      {"int 8 bytes", std::int64_t{5'000'000'000},
       sequence({0x13, 0x00, 0x00, 0x00, 0x01, 0x2A, 0x05, 0xF2, 0x00})},
      {"negative int", -2, sequence({0x13, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFE})},
      {"above int64", kUint64Max,
       sequence({0x14, 0, 0, 0, 0, 0, 0, 0, 0, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF})},
      {"true", true, sequence({0x09})},
      {"false", false, sequence({0x08})},
      {"real", 1.5, sequence({0x23, 0x3F, 0xF8, 0, 0, 0, 0, 0, 0})},
      // 1.5 seconds after the format's epoch, 2001-01-01T00:00:00Z.
      {"date", PlistDate{kEpochOffset2001 + 1.5}, sequence({0x33, 0x3F, 0xF8, 0, 0, 0, 0, 0, 0})},
      {"data", PlistData{0, 7}, sequence({0x42, 0x00, 0x07})},
      {"ascii", "abc", sequence({0x53, 'a', 'b', 'c'})},
      {"utf16", "\xC3\xA9", sequence({0x61, 0x00, 0xE9})},
      {"surrogate pair", "\xF0\x9F\x98\x80", sequence({0x62, 0xD8, 0x3D, 0xDE, 0x00})},
      {"uid 1 byte", PlistUid{7}, sequence({0x80, 0x07})},
      {"uid 2 bytes", PlistUid{300}, sequence({0x81, 0x01, 0x2C})},
      {"uid 4 bytes", PlistUid{70000}, sequence({0x83, 0x00, 0x01, 0x11, 0x70})},
      {"long string", std::string(20, 'a'), withPayload(sequence({0x5F, 0x10, 20}), 20, 'a')},
      {"long data", PlistData(1000, 1), withPayload(sequence({0x4F, 0x11, 0x03, 0xE8}), 1000, 1)},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    EXPECT_EQ(soleObjectBytes(c.value), c.expected);
  }
}

TEST(BinaryPlistWriterTest, WritesHeaderTrailerOffsetTableAndKeysBeforeValues) {
  const PlistData file = PropertyListSerialization::writeBinary(5);
  const PlistData expected = sequence(
      {'b', 'p', 'l', 'i', 's', 't', '0', '0', 0x10, 0x05, 0x08, 0, 0, 0, 0, 0, 0, 1, 1, 0, 0, 0,
       0,   0,   0,   0,   1,   0,   0,   0,   0,    0,    0,    0, 0, 0, 0, 0, 0, 0, 0, 0, 10});
  EXPECT_EQ(file, expected);
  const PlistData dictionary = PropertyListSerialization::writeBinary(PlistDictionary{{"k", 1}});
  EXPECT_EQ(trailerOf(dictionary).objectCount, 3u);
  EXPECT_EQ(trailerOf(dictionary).referenceWidth, 1);
  // Root dictionary first, then its key and its value.
  EXPECT_EQ(PlistData(dictionary.begin() + 8, dictionary.begin() + 11),
            sequence({0xD1, 0x01, 0x02}));
}

TEST(BinaryPlistWriterTest, StoresEqualStringsOnce) {
  PlistArray records;
  for (int index = 0; index < 1000; ++index) {
    records.emplace_back(
        PlistDictionary{{"bundleIdentifier", "com.example.shared"}, {"index", index}});
  }
  const PlistData file = PropertyListSerialization::writeBinary(records);
  const std::string text(file.begin(), file.end());
  for (const std::string needle : {"bundleIdentifier", "com.example.shared"}) {
    EXPECT_NE(text.find(needle), std::string::npos) << needle;
    EXPECT_EQ(text.find(needle), text.rfind(needle)) << needle << " is stored more than once";
  }
  // The root, 1000 dictionaries, 1000 distinct integers and three strings
  // (two keys and one value).
  EXPECT_EQ(trailerOf(file).objectCount, 2004u);
  EXPECT_EQ(readBytes(file), PlistValue(records));
}

// The one strict UTF-8 check that property lists and DMAP text share: what
// it takes, what it refuses, and that text it takes is left as it is by the
// repair that property lists apply.
struct Utf8Case {
  const char* what;
  std::string text;
  bool wellFormed;
};

TEST(Utf8Test, TakesWellFormedTextAndRefusesTheRest) {
  const std::string eight(8, 'a');
  const Utf8Case cases[] = {
      {"empty", "", true},
      {"a zero byte", std::string("a\0b", 3), true},
      {"two bytes", "caf\xC3\xA9", true},
      {"three bytes", "\xE2\x82\xAC", true},
      {"four bytes", "\xF0\x9F\x98\x80", true},
      {"a genuine U+FFFD", "\xEF\xBF\xBD", true},
      {"the last code point", "\xF4\x8F\xBF\xBF", true},
      {"overlong two bytes", "\xC0\xAF", false},
      {"overlong three bytes", "\xE0\x80\xAF", false},
      {"overlong four bytes", "\xF0\x80\x80\xAF", false},
      {"an encoded surrogate", "\xED\xA0\x80", false},
      {"above U+10FFFF", "\xF4\x90\x80\x80", false},
      {"a lead byte beyond F4", "\xF5\x80\x80\x80", false},
      {"a truncated sequence", "\xE2\x82", false},
      {"a lone continuation byte", "\x80", false},
      {"a broken continuation", "\xE2\x28\xA1", false},
      // ASCII is skipped eight bytes at a time: what follows a whole run,
      // and what sits inside a second one, is still looked at.
      {"bad byte after eight ASCII", eight + "\xFF", false},
      {"bad byte ending a run", std::string(7, 'a') + "\x80" + eight, false},
      {"bad byte inside the second run", eight + "abc\x80" + "defg", false},
      {"truncated after two runs", eight + eight + "\xC3", false},
      {"good text between runs", eight + "\xC3\xA9" + eight + "b", true},
  };
  for (const Utf8Case& sample : cases) {
    EXPECT_EQ(isWellFormedUtf8(sample.text), sample.wellFormed) << sample.what;
    EXPECT_EQ(toWellFormedUtf8(sample.text) == sample.text, sample.wellFormed) << sample.what;
  }
}

TEST(BinaryPlistWriterTest, ReplacesMalformedUtf8) {
  const PlistValue broken = std::string(
      "a\xFF"
      "b\xC3");
  EXPECT_EQ(readBytes(PropertyListSerialization::writeBinary(broken)), PlistValue("a\xEF\xBF\xBD"
                                                                                  "b\xEF\xBF\xBD"));
  // Encoded surrogates are not UTF-8 either.
  const PlistValue surrogate = std::string("\xED\xA0\x80");
  EXPECT_EQ(readBytes(PropertyListSerialization::writeBinary(surrogate)),
            PlistValue("\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD"));
}

TEST(PropertyListRoundTripTest, BinaryKeepsValues) {
  struct Case {
    const char* name;
    PlistValue value;
  };
  const std::vector<Case> cases{
      {"every kind", everyKindOfValue()},
      {"integer root", 1},
      {"int64 min root", kInt64Min},
      {"string root", "root"},
      {"real root", 2.5},
      {"false root", false},
      {"date root", PlistDate{0.25}},
      {"empty data root", PlistData{}},
      {"uid root", PlistUid{0}},
      {"empty array root", PlistArray{}},
      // Other readers (libplist among them) take UIDs of at most 32 bits;
      // ours keeps the full 64.
      {"64-bit uids", PlistArray{PlistUid{0x1234567890ull}, PlistUid{~std::uint64_t{0}}}},
      {"NaN", PlistArray{std::nan("")}},
      // Enough objects for 4-byte references and offsets.
      {"large catalogue", productCatalogue(10'000)},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const Result<PlistValue> back = readBytes(PropertyListSerialization::writeBinary(c.value));
    ASSERT_TRUE(back) << back.errorDescription();
    EXPECT_EQ(firstDifference(*back, c.value), "");
  }
}

// XML has no UID type and libplist keeps whole seconds in XML dates: every
// other kind of value comes back as it went.
TEST(PropertyListRoundTripTest, XmlKeepsValuesButWholeSecondsAndUids) {
  PlistValue value = everyKindOfValue();
  PlistDictionary& entries = *value.dictionary();
  entries.erase("uid");
  entries.erase("bigUid");
  entries["date"] = PlistDate{1700000000.0};
  entries["dateBefore2001"] = PlistDate{946684800.0};
  const std::string xml = PropertyListSerialization::writeXml(value);
  EXPECT_NE(xml.find("<integer>18446744073709551615</integer>"), std::string::npos);
  EXPECT_NE(xml.find("<integer>-42</integer>"), std::string::npos);
  const auto back = PropertyListSerialization::read(xml);
  ASSERT_TRUE(back) << back.errorDescription();
  EXPECT_EQ(firstDifference(*back, value), "");

  const PlistValue dates =
      PlistArray{PlistDate{1700000000.75}, PlistDate{kEpochOffset2001 - 99.75}};
  EXPECT_EQ(PropertyListSerialization::read(PropertyListSerialization::writeXml(dates)),
            PlistValue(PlistArray{PlistDate{1700000000.0}, PlistDate{kEpochOffset2001 - 100.0}}));
  // A UID comes back as a dictionary of one key.
  const auto uid =
      PropertyListSerialization::read(PropertyListSerialization::writeXml(PlistUid{7}));
  ASSERT_TRUE(uid && uid->isDictionary());
  ASSERT_EQ(uid->dictionary()->size(), 1u);
  EXPECT_EQ(uid->dictionary()->begin()->second, PlistValue(7));
}

TEST(PropertyListRoundTripTest, EachFormatSkipsNullsAndWritesNullRootAsEmptyDictionary) {
  const PlistValue withNulls = PlistDictionary{
      {"kept", PlistArray{1, PlistValue(), 2, PlistDictionary{{"n", PlistValue()}}}},
      {"dropped", PlistValue()}};
  const PlistValue withoutNulls = PlistDictionary{{"kept", PlistArray{1, 2, PlistDictionary{}}}};
  for (const auto& [format, start] :
       {std::pair{PlistFormat::Binary, "bplist00"}, std::pair{PlistFormat::Xml, "<?xml"}}) {
    SCOPED_TRACE(start);
    const PlistData written = PropertyListSerialization::write(withNulls, format);
    EXPECT_EQ(std::string(written.begin(), written.begin() + 5), std::string(start, 5));
    EXPECT_EQ(readBytes(written), withoutNulls);
    EXPECT_EQ(readBytes(PropertyListSerialization::write(PlistValue(), format)),
              PlistValue(PlistDictionary{}));
  }
}

TEST(BinaryPlistInteropTest, LibplistReadsWhatWeWrite) {
  // The catalogue has enough objects for 4-byte references and offsets.
  for (const PlistValue& value : {everyKindOfValue(), productCatalogue(12'000)}) {
    const PlistData bytes = PropertyListSerialization::writeBinary(value);
    plist_t node = nullptr;
    plist_from_bin(reinterpret_cast<const char*>(bytes.data()),
                   static_cast<std::uint32_t>(bytes.size()), &node);
    const PlistNode owned(node);
    ASSERT_TRUE(owned);
    EXPECT_TRUE(libplistBinary(node) == libplistBinary(toLibplist(value).get()))
        << "libplist read another tree from " << bytes.size() << " bytes";
  }
}

TEST(BinaryPlistInteropTest, WeReadWhatLibplistWrites) {
  for (const PlistValue& written : {everyKindOfValue(), productCatalogue(5'000)}) {
    const Result<PlistValue> back = readBytes(libplistBinary(toLibplist(written).get()));
    ASSERT_TRUE(back) << back.errorDescription();
    EXPECT_EQ(firstDifference(*back, written), "");
  }
}

// Levels of arrays, each holding its successor twice: 2^levels values from a
// file of a few bytes per level.
PlistData fanOutFile(int levels) {
  std::vector<PlistData> objects;
  for (int level = 0; level < levels; ++level) {
    objects.push_back(sequence({0xA2, level + 1, level + 1}));
  }
  objects.push_back(sequence({0x10, 0x01}));
  return assembleBinary(objects);
}

PlistValue fanOutValue(int levels) {
  PlistValue value = 1;
  for (int level = 0; level < levels; ++level) value = PlistArray{value, value};
  return value;
}

PlistData utf16String(std::initializer_list<int> units) {
  PlistData object = sequence({0x60 | static_cast<int>(units.size())});
  for (const int unit : units) appendBigEndian(object, static_cast<std::uint64_t>(unit), 2);
  return assembleBinary({object});
}

// Deep documents must be refused before libplist builds (and recursively
// frees) a tree for them; the check on the parsed tree has its own wording.
const std::string kRefusedBeforeParsing = "XML property list: nesting deeper than ";

std::string xmlNestedArrays(std::size_t depth, std::string_view open = "<array>",
                            std::string_view close = "</array>") {
  std::string xml = "<plist>";
  for (std::size_t level = 0; level < depth; ++level) xml += open;
  for (std::size_t level = 0; level < depth; ++level) xml += close;
  return xml + "</plist>";
}

TEST(PropertyListReaderTest, TakesWhatOtherWritersWrite) {
  PlistData negative = sequence({0x14});  // a sign-extended 16-byte integer
  negative.insert(negative.end(), 15, 0xFF);
  negative.push_back(0xFE);
  const std::string document = R"(<?xml version="1.0" encoding="UTF-8"?>
<!DOCTYPE plist PUBLIC "-//x//DTD PLIST 1.0//EN" "about:blank">
<plist version="1.0">
<dict>
  <!-- a comment -->
  <key>name</key><string>caf&#xE9; &amp; more</string>
  <key>count</key><integer>-12</integer>
  <key>big</key><integer>18446744073709551615</integer>
  <key>ratio</key><real>0.5</real>
  <key>when</key><date>2001-01-01T00:01:40Z</date>
  <key>blob</key><data>AAEC</data>
  <key>on</key><true/>
  <key>list</key><array><string><![CDATA[<raw>]]></string><array/><dict/></array>
</dict>
</plist>)";
  const PlistValue replacement("\xEF\xBF\xBD");
  const std::vector<ReadCase> cases{
      {"4-byte real", assembleBinary({sequence({0x22, 0x3F, 0xC0, 0x00, 0x00})}), 1.5},
      {"16-byte negative integer", assembleBinary({negative}), -2},
      {"unsorted keys",
       assembleBinary({sequence({0xD2, 0x01, 0x02, 0x03, 0x04}), sequence({0x51, 'z'}),
                       sequence({0x51, 'a'}), sequence({0x10, 0x01}), sequence({0x10, 0x02})}),
       PlistDictionary{{"a", 2}, {"z", 1}}},
      {"2-byte references", assembleBinary({sequence({0xA1, 0x00, 0x01}), sequence({0x09})}, 0, 2),
       PlistArray{true}},
      {"shared objects are copied",
       assembleBinary({sequence({0xA3, 0x01, 0x01, 0x02}), sequence({0x51, 'x'}),
                       sequence({0xA2, 0x01, 0x01})}),
       PlistArray{"x", "x", PlistArray{"x", "x"}}},
      {"surrogate pair", utf16String({0xD83D, 0xDE00}), "\xF0\x9F\x98\x80"},
      {"unpaired high surrogate", utf16String({0xD83D}), replacement},
      {"unpaired low surrogate", utf16String({0xDE00}), replacement},
      {"reversed pair", utf16String({0xDE00, 0xD83D}), "\xEF\xBF\xBD\xEF\xBF\xBD"},
      {"high surrogate before a letter", utf16String({0xD83D, 0x0041}),
       "\xEF\xBF\xBD"
       "A"},
      {"zero unit", utf16String({0x00E9, 0x0000, 0x4E2D}),
       std::string("\xC3\xA9\0\xE4\xB8\xAD", 6)},
      {"8-bit string read as Latin-1", assembleBinary({sequence({0x53, 'c', 0xE9, 0xFF})}),
       "c\xC3\xA9\xC3\xBF"},
      {"XML document", bytesOf(document),
       PlistDictionary{{"name", "caf\xC3\xA9 & more"},
                       {"count", -12},
                       {"big", kUint64Max},
                       {"ratio", 0.5},
                       {"when", PlistDate{kEpochOffset2001 + 100}},
                       {"blob", PlistData{0, 1, 2}},
                       {"on", true},
                       {"list", PlistArray{"<raw>", PlistArray{}, PlistDictionary{}}}}},
      {"XML encoded surrogate", bytesOf("<plist><string>a&#xD800;b</string></plist>"),
       "a\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD"
       "b"},
  };
  for (const ReadCase& c : cases) expectRead(c);
}

// Each input is broken in one way; the refusal says how.
TEST(PropertyListReaderTest, RefusesMalformedInputSayingWhy) {
  const PlistData three = PropertyListSerialization::writeBinary(PlistArray{1, "two", 3.0});
  const std::size_t trailer = three.size() - 32;
  const PlistData two = PropertyListSerialization::writeBinary(PlistArray{1, 2});
  const std::size_t secondEntry = trailerOf(two).offsetTableOffset + 1;
  ASSERT_EQ(trailerOf(two).offsetWidth, 1);
  std::vector<Refusal> cases{
      {"bad magic", patched(three, 0, 'X', 1), ""},
      {"other version", patched(three, 6, '1', 1), "version"},
      {"offset size 0", patched(three, trailer + 6, 0, 1), "offset size"},
      {"offset size 9", patched(three, trailer + 6, 9, 1), "offset size"},
      {"reference size 0", patched(three, trailer + 7, 0, 1), "reference size"},
      {"no objects", patched(three, trailer + 8, 0, 8), "no objects"},
      {"object count max", patched(three, trailer + 8, ~std::uint64_t{0}, 8), "offset table"},
      {"object count 2^61", patched(three, trailer + 8, std::uint64_t{1} << 61, 8), "offset table"},
      {"top object past the end", patched(three, trailer + 16, 4, 8), "top object"},
      {"top object max", patched(three, trailer + 16, ~std::uint64_t{0}, 8), "top object"},
      {"offset table in the header", patched(three, trailer + 24, 3, 8), "offset table"},
      {"offset table past the end", patched(three, trailer + 24, three.size(), 8), "offset table"},
      {"offset table offset wraps", patched(three, trailer + 24, ~std::uint64_t{0} - 7, 8),
       "offset table"},
      {"object beyond the file", patched(two, secondEntry, 0xF0, 1), "out of range"},
      {"object in the offset table", patched(two, secondEntry, secondEntry - 1, 1), "out of range"},
      {"object in the header", patched(two, secondEntry, 3, 1), "out of range"},
      {"array reference out of range",
       assembleBinary({sequence({0xA1, 0x05}), sequence({0x10, 0x01})}), "reference out of range"},
      {"dictionary reference out of range",
       assembleBinary({sequence({0xD1, 0x01, 0x09}), sequence({0x51, 'k'}), sequence({0x09})}),
       "reference out of range"},
      {"array holding itself", assembleBinary({sequence({0xA1, 0x00})}), "contains itself"},
      {"arrays holding each other",
       assembleBinary({sequence({0xA1, 0x01}), sequence({0xA1, 0x00})}), "contains itself"},
      {"dictionary holding itself",
       assembleBinary({sequence({0xD1, 0x01, 0x00}), sequence({0x51, 'k'})}), "contains itself"},
      {"null", assembleBinary({sequence({0x00})}), "unsupported"},
      {"fill", assembleBinary({sequence({0x0F})}), "unsupported"},
      {"marker 0x70", assembleBinary({sequence({0x70})}), "unsupported"},
      {"set", assembleBinary({sequence({0xC0})}), "unsupported"},
      {"32-byte integer", assembleBinary({sequence({0x15, 0, 0})}), "integer"},
      {"2-byte real", assembleBinary({sequence({0x21, 0, 0})}), "real"},
      {"4-byte date", assembleBinary({sequence({0x32, 0, 0, 0, 0})}), "date"},
      {"truncated integer", assembleBinary({sequence({0x13, 0, 0})}), "integer out of range"},
      {"16-byte integer beyond 64 bits",
       assembleBinary({sequence({0x14, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0})}),
       "64 bits"},
      {"key not a string",
       assembleBinary({sequence({0xD1, 0x01, 0x02}), sequence({0x10, 0x01}), sequence({0x09})}),
       "key is not a string"},
      {"bad length marker", assembleBinary({sequence({0x5F, 0x23, 0, 0, 0, 0, 0, 0, 0, 0})}),
       "bad length marker"},
      {"XML empty", {}, "empty"},
      {"XML blank", bytesOf("   \n"), ""},
      {"XML no markup", bytesOf("not a property list"), ""},
      {"XML key without value", bytesOf("<plist><dict><key>a</key></plist>"), ""},
      {"XML unclosed string", bytesOf("<plist><array><string>x</array></plist>"), ""},
      {"XML unclosed tag", bytesOf("<plist><integer>1</integer"), ""},
  };
  // Declared lengths far beyond the file, for every kind of object that has one.
  for (const int marker : {0x4F, 0x5F, 0x6F, 0xAF, 0xDF}) {
    for (const std::uint64_t length :
         {std::uint64_t{1} << 62, ~std::uint64_t{0}, std::uint64_t{0x7FFFFFFFFFFFFFFF}}) {
      PlistData object = sequence({marker, 0x13});
      appendBigEndian(object, length, 8);
      object.push_back('a');
      cases.push_back({"marker " + std::to_string(marker) + " length " + std::to_string(length),
                       assembleBinary({object}), "out of range"});
    }
    cases.push_back({"marker " + std::to_string(marker) + " 4-byte length",
                     assembleBinary({sequence({marker, 0x12, 0x7F, 0xFF, 0xFF, 0xFF})}),
                     "out of range"});
  }
  for (const Refusal& c : cases) expectRead({c.name, c.bytes, {}, c.says});
  EXPECT_FALSE(PropertyListSerialization::readXml({}).errorDescription().empty());
}

// Each limit takes what is exactly at it and refuses what is one beyond.
TEST(PropertyListReaderTest, LimitsHoldExactlyAtTheirBoundary) {
  PlistArray hundred;
  for (int index = 0; index < 100; ++index) hundred.emplace_back(index);
  PlistData sharedText = sequence({0xAF, 0x11, 0x03, 0xE8});  // 1000 references to one string
  sharedText.insert(sharedText.end(), 1000, 0x01);
  const PlistData sharedTextFile =
      assembleBinary({sharedText, withPayload(sequence({0x5F, 0x11, 0x03, 0xE8}), 1000, 'a')});
  const PlistData everyKind = PropertyListSerialization::writeBinary(everyKindOfValue());
  const std::string twoEntries =
      "<plist><dict><key>a</key><integer>1</integer><key>b</key><integer>2</integer></dict>"
      "</plist>";
  // An empty container is a level.
  const PlistData empty = bytesOf("<plist><dict><key>k</key><array/></dict></plist>");
  const auto binary = [](const PlistValue& value) {
    return PropertyListSerialization::writeBinary(value);
  };
  const PlistValue deep = nestedArrays(513);
  const PlistData fanOut = fanOutFile(16);
  const PlistData xmlTwo = bytesOf(twoEntries);
  const std::vector<ReadCase> cases{
      {"binary depth 512", binary(nestedArrays(512)), nestedArrays(512)},
      {"binary depth 513", binary(deep), {}, "nesting deeper than 512"},
      {"binary depth 513 of 600", binary(deep), deep, {}, {.maxDepth = 600}},
      {"binary empty container",
       binary(PlistDictionary{{"k", PlistArray{}}}),
       {},
       "nesting deeper than 1",
       {.maxDepth = 1}},
      // The array and its hundred integers.
      {"101 objects", binary(hundred), hundred, {}, {.maxObjects = 101}},
      {"101 of 100 objects", binary(hundred), {}, "objects", {.maxObjects = 100}},
      {"101 of 3 objects", binary(hundred), {}, "objects", {.maxObjects = 3}},
      // Every copy of a shared object counts.
      {"2^61 copies", fanOutFile(60), {}, "objects", {.maxObjects = 100'000}},
      {"2^17 - 1 copies of 100000", fanOut, {}, "objects", {.maxObjects = 100'000}},
      {"2^17 - 1 copies", fanOut, fanOutValue(16), {}, {.maxObjects = (1u << 17) - 1}},
      {"2^17 - 1 copies of 2^17 - 2", fanOut, {}, "objects", {.maxObjects = (1u << 17) - 2}},
      {"shared text over", sharedTextFile, {}, "bytes", {.maxBytes = 100'000}},
      {"shared text within",
       sharedTextFile,
       PlistArray(1000, PlistValue(std::string(1000, 'a'))),
       {},
       {.maxBytes = 1'000'000}},
      {"binary over size", everyKind, {}, "larger than", {.maxBytes = everyKind.size() - 1}},
      {"XML depth 512", bytesOf(xmlNestedArrays(512)), nestedArrays(512)},
      {"XML depth 513", bytesOf(xmlNestedArrays(513)), {}, kRefusedBeforeParsing + "512"},
      {"XML depth 11 of 10",
       bytesOf(xmlNestedArrays(11)),
       {},
       kRefusedBeforeParsing + "10",
       {.maxDepth = 10}},
      {"XML empty container", empty, PlistDictionary{{"k", PlistArray{}}}, {}, {.maxDepth = 2}},
      {"XML empty container over", empty, {}, kRefusedBeforeParsing + "1", {.maxDepth = 1}},
      // Deep enough that releasing libplist's tree would overflow the stack.
      {"XML depth 1000000", bytesOf(xmlNestedArrays(1'000'000)), {}, kRefusedBeforeParsing},
      // The dictionary, two keys, two values.
      {"XML 5 objects", xmlTwo, {}, {}, {.maxObjects = 5}},
      {"XML 5 of 4 objects", xmlTwo, {}, "objects", {.maxObjects = 4}},
      {"XML over size", xmlTwo, {}, "larger than", {.maxBytes = twoEntries.size() - 1}},
  };
  for (const ReadCase& c : cases) expectRead(c);
}

// Each document hides a "</array>" (or the start of the document) from
// libplist in a different way, so every one is 600 levels deep. The nesting
// scan must see them as libplist does and refuse them before parsing; with a
// higher limit libplist must parse them, which shows they really are that deep.
TEST(XmlPlistReaderTest, DepthScanTokenizesLikeLibplist) {
  const std::vector<std::string> documents = {
      xmlNestedArrays(600, "<array><string><![CDATA[</array>]]></string>"),
      xmlNestedArrays(600, "<array><!-- </array> -->"),
      xmlNestedArrays(600, "<array><!--> </array> -->"),
      xmlNestedArrays(600, "<array><?pi \"?></array>\"?>"),
      "<!DOCTYPE plist \"a[b\">" + xmlNestedArrays(600),
      "<!DOCTYPE plist [ \"]>\" ]>" + xmlNestedArrays(600),
      xmlNestedArrays(600, std::string("<array\0>", 8), std::string("</array\0>", 9)),
      xmlNestedArrays(600, "<array a=\"</array>\">"),
  };
  for (const std::string& xml : documents) {
    expectRead({xml.substr(0, 60), bytesOf(xml), {}, kRefusedBeforeParsing});
    expectRead({xml.substr(0, 60) + " within 600", bytesOf(xml), {}, {}, {.maxDepth = 600}});
  }
}

TEST(BinaryPlistReaderTest, RefusesEveryTruncation) {
  const PlistData file = PropertyListSerialization::writeBinary(everyKindOfValue());
  for (std::size_t length = 0; length < file.size(); ++length) {
    const PlistData prefix(file.begin(), file.begin() + static_cast<long>(length));
    expectRead({"first " + std::to_string(length) + " bytes", prefix, {}, ""});
    EXPECT_FALSE(PropertyListSerialization::readBinary(prefix).errorDescription().empty());
  }
}

TEST(BinaryPlistReaderTest, SurvivesEverySingleByteCorruption) {
  const PlistData file = PropertyListSerialization::writeBinary(everyKindOfValue());
  std::size_t accepted = 0;
  for (std::size_t at = 0; at < file.size(); ++at) {
    for (const int replacement : {0x00, 0xFF, file[at] ^ 0x80, (file[at] + 1) & 0xFF}) {
      PlistData corrupted = file;
      corrupted[at] = static_cast<std::uint8_t>(replacement);
      const Result<PlistValue> value = readBytes(corrupted);
      if (!value) {
        EXPECT_FALSE(value.error().description.empty());
        continue;
      }
      ++accepted;
      // Whatever is accepted must encode and decode to itself.
      const Result<PlistValue> again = readBytes(PropertyListSerialization::writeBinary(*value));
      ASSERT_TRUE(again) << "byte " << at;
      EXPECT_EQ(firstDifference(*value, *again), "") << "byte " << at;
    }
  }
  // Many corruptions (a changed character, a changed number) are still
  // valid files; the test is meant to decode some of them.
  EXPECT_GT(accepted, 0u);
}

}  // namespace
}  // namespace larder
