#include <gtest/gtest.h>
#include <plist/plist.h>

#include <algorithm>
#include <bit>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <string>
#include <vector>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/value/PlistValue.h"

namespace larder {
namespace {

using Type = PlistValue::Type;

constexpr double kEpochOffset2001 = 978307200.0;

// ---------------------------------------------------------------------------
// Helpers

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

// Equality that treats two NaN reals as the same value.
bool sameValue(const PlistValue& a, const PlistValue& b) {
  if (a.type() != b.type()) return false;
  if (a.isReal()) {
    const double x = a.doubleValue();
    const double y = b.doubleValue();
    return (std::isnan(x) && std::isnan(y)) || x == y;
  }
  if (const PlistArray* left = a.array()) {
    const PlistArray& right = *b.array();
    return left->size() == right.size() &&
           std::equal(left->begin(), left->end(), right.begin(), sameValue);
  }
  if (const PlistDictionary* left = a.dictionary()) {
    const PlistDictionary& right = *b.dictionary();
    return left->size() == right.size() &&
           std::equal(left->begin(), left->end(), right.begin(), [](const auto& x, const auto& y) {
             return x.first == y.first && sameValue(x.second, y.second);
           });
  }
  return a == b;
}

// Where two values first differ, as a path, or "" when they are the same.
std::string firstDifference(const PlistValue& a, const PlistValue& b,
                            const std::string& path = "") {
  const std::string here = path.empty() ? "/" : path;
  if (a.type() != b.type()) return here + " (type)";
  if (const PlistArray* left = a.array()) {
    const PlistArray& right = *b.array();
    if (left->size() != right.size()) return here + " (size)";
    for (std::size_t index = 0; index < left->size(); ++index) {
      std::string found =
          firstDifference((*left)[index], right[index], path + "/" + std::to_string(index));
      if (!found.empty()) return found;
    }
    return "";
  }
  if (const PlistDictionary* left = a.dictionary()) {
    const PlistDictionary& right = *b.dictionary();
    for (const auto& [key, member] : *left) {
      const auto other = right.find(key);
      if (other == right.end()) return path + "/" + key + " (missing)";
      std::string found = firstDifference(member, other->second, path + "/" + key);
      if (!found.empty()) return found;
    }
    return left->size() == right.size() ? "" : here + " (extra keys)";
  }
  return sameValue(a, b) ? "" : here;
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

void appendBigEndian(PlistData& out, std::uint64_t value, unsigned width) {
  for (unsigned shift = width * 8; shift > 0; shift -= 8) {
    out.push_back(static_cast<std::uint8_t>(value >> (shift - 8)));
  }
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
  std::uint64_t topObject;
  std::uint64_t offsetTableOffset;
};

std::uint64_t readBigEndian(const PlistData& bytes, std::size_t at, unsigned width) {
  std::uint64_t value = 0;
  for (unsigned index = 0; index < width; ++index) value = (value << 8) | bytes.at(at + index);
  return value;
}

Trailer trailerOf(const PlistData& file) {
  const std::size_t at = file.size() - 32;
  return {file.at(at + 6), file.at(at + 7), readBigEndian(file, at + 8, 8),
          readBigEndian(file, at + 16, 8), readBigEndian(file, at + 24, 8)};
}

// The bytes of the root object of a file that holds only that object.
PlistData soleObjectBytes(const PlistValue& value) {
  const PlistData file = PropertyListSerialization::writeBinary(value);
  const Trailer trailer = trailerOf(file);
  EXPECT_EQ(trailer.objectCount, 1u);
  return PlistData(file.begin() + 8, file.begin() + static_cast<long>(trailer.offsetTableOffset));
}

PlistValue everyKindOfValue() {
  PlistDictionary nested;
  nested["name"] = "inner";
  nested["list"] = PlistArray{1, 2, 3, "four", PlistArray{}, PlistDictionary{}};
  PlistArray manyElements;
  for (int index = 0; index < 40; ++index) manyElements.emplace_back(index * 1000);

  PlistDictionary root;
  root["true"] = true;
  root["false"] = false;
  root["zero"] = 0;
  root["small"] = 5;
  root["twoBytes"] = 300;
  root["fourBytes"] = 70000;
  root["eightBytes"] = std::int64_t{5'000'000'000};
  root["negative"] = -42;
  root["int64Min"] = std::numeric_limits<std::int64_t>::min();
  root["int64Max"] = std::numeric_limits<std::int64_t>::max();
  root["aboveInt64"] = std::numeric_limits<std::uint64_t>::max();
  root["real"] = 3.25;
  root["tinyReal"] = 1e-300;
  root["negativeReal"] = -0.1;
  root["infinity"] = std::numeric_limits<double>::infinity();
  root["date"] = PlistDate{1700000000.125};
  root["dateBefore2001"] = PlistDate{946684800.5};
  root["data"] = PlistData{0, 1, 0, 255, 0};
  root["emptyData"] = PlistData{};
  root["ascii"] = "/Applications/App1234.app";
  root["unicode"] =
      "h\xC3\xA9llo w\xC3\xB6rld \xE2\x80\x94 \xE6\x97\xA5\xE6\x9C\xAC \xF0\x9F\x98\x80";
  root["empty"] = "";
  root["long"] = std::string(300, 'x');
  root["emptyArray"] = PlistArray{};
  root["emptyDictionary"] = PlistDictionary{};
  root["uid"] = PlistUid{42};
  root["bigUid"] = PlistUid{0x12345678};
  root["nested"] = PlistArray{PlistValue(nested), PlistValue(nested)};
  root["manyElements"] = manyElements;
  root["\xE2\x9C\x93 unicode key"] = "value";
  return root;
}

PlistValue productRecord(int index) {
  const std::string number = std::to_string(index);
  PlistDictionary record;
  record["bundlePath"] = "/Applications/App" + number + ".app";
  record["bundleIdentifier"] = "com.example.app" + number;
  record["bundleVersion"] = "1.2.3";
  record["shortVersion"] = "1.2";
  record["title"] = "App " + number;
  record["artistName"] = "Example Developer";
  record["kind"] = "software";
  record["itemId"] = std::int64_t{400'000'000} + index;
  record["storefrontId"] = 143441;
  record["genreId"] = 6002 + index % 20;
  record["sizeInBytes"] = std::int64_t{1'000'000} * (index % 500 + 1);
  record["purchaseDate"] = PlistDate{1'600'000'000.0 + index * 37.5};
  record["isInstalled"] = index % 3 != 0;
  record["hasUpdate"] = index % 7 == 0;
  return record;
}

PlistValue productCatalogue(int count) {
  PlistArray records;
  records.reserve(static_cast<std::size_t>(count));
  for (int index = 0; index < count; ++index) records.push_back(productRecord(index));
  return records;
}

// Builds libplist's own tree, independently of the code under test.
PlistNode toLibplist(const PlistValue& value) {
  switch (value.type()) {
    case Type::Boolean:
      return PlistNode(plist_new_bool(value.boolValue()));
    case Type::Integer:
    case Type::UnsignedInteger:
      return PlistNode(plist_new_uint(value.uint64Value()));
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

// Compares libplist's tree with ours, node by node.
void expectMatchesLibplist(plist_t node, const PlistValue& expected, const std::string& path) {
  SCOPED_TRACE(path);
  ASSERT_NE(node, nullptr);
  switch (expected.type()) {
    case Type::Boolean: {
      ASSERT_EQ(plist_get_node_type(node), PLIST_BOOLEAN);
      std::uint8_t flag = 0;
      plist_get_bool_val(node, &flag);
      EXPECT_EQ(flag != 0, expected.boolValue());
      break;
    }
    case Type::Integer:
    case Type::UnsignedInteger: {
      ASSERT_EQ(plist_get_node_type(node), PLIST_UINT);
      std::uint64_t bits = 0;
      plist_get_uint_val(node, &bits);
      EXPECT_EQ(bits, expected.uint64Value());
      break;
    }
    case Type::Real: {
      ASSERT_EQ(plist_get_node_type(node), PLIST_REAL);
      double real = 0;
      plist_get_real_val(node, &real);
      EXPECT_EQ(real, expected.doubleValue());
      break;
    }
    case Type::String: {
      ASSERT_EQ(plist_get_node_type(node), PLIST_STRING);
      std::uint64_t length = 0;
      const char* text = plist_get_string_ptr(node, &length);
      EXPECT_EQ(std::string(text, length), *expected.string());
      break;
    }
    case Type::Data: {
      ASSERT_EQ(plist_get_node_type(node), PLIST_DATA);
      std::uint64_t length = 0;
      const char* bytes = plist_get_data_ptr(node, &length);
      const PlistData actual(bytes, bytes + length);
      EXPECT_EQ(actual, *expected.data());
      break;
    }
    case Type::Date: {
      ASSERT_EQ(plist_get_node_type(node), PLIST_DATE);
      std::int32_t seconds = 0;
      std::int32_t microseconds = 0;
      plist_get_date_val(node, &seconds, &microseconds);
      // libplist's accessor hands out the fraction of a date before 2001
      // without its sign.
      const double fraction = std::abs(microseconds) / 1e6;
      const double since2001 = seconds < 0 ? seconds - fraction : seconds + fraction;
      EXPECT_NEAR(since2001 + kEpochOffset2001, expected.date()->secondsSince1970, 1e-6);
      break;
    }
    case Type::Uid: {
      ASSERT_EQ(plist_get_node_type(node), PLIST_UID);
      std::uint64_t uid = 0;
      plist_get_uid_val(node, &uid);
      EXPECT_EQ(uid, expected.uid()->value);
      break;
    }
    case Type::Array: {
      ASSERT_EQ(plist_get_node_type(node), PLIST_ARRAY);
      const PlistArray& elements = *expected.array();
      ASSERT_EQ(plist_array_get_size(node), elements.size());
      for (std::uint32_t index = 0; index < elements.size(); ++index) {
        expectMatchesLibplist(plist_array_get_item(node, index), elements[index],
                              path + "/" + std::to_string(index));
      }
      break;
    }
    case Type::Dictionary: {
      ASSERT_EQ(plist_get_node_type(node), PLIST_DICT);
      const PlistDictionary& entries = *expected.dictionary();
      ASSERT_EQ(plist_dict_get_size(node), entries.size());
      for (const auto& [key, member] : entries) {
        expectMatchesLibplist(plist_dict_get_item(node, key.c_str()), member, path + "/" + key);
      }
      break;
    }
    case Type::Null:
      FAIL() << "null has no counterpart";
  }
}

PlistNode libplistFromBinary(const PlistData& bytes) {
  plist_t node = nullptr;
  plist_from_bin(reinterpret_cast<const char*>(bytes.data()),
                 static_cast<std::uint32_t>(bytes.size()), &node);
  return PlistNode(node);
}

PlistData libplistToBinary(const PlistValue& value) {
  const PlistNode node = toLibplist(value);
  char* raw = nullptr;
  std::uint32_t length = 0;
  plist_to_bin(node.get(), &raw, &length);
  PlistData bytes(raw, raw + length);
  plist_to_bin_free(raw);
  return bytes;
}

void expectReadFails(const PlistData& bytes, const std::string& errorPart = "",
                     const PlistReadLimits& limits = {}) {
  const Result<PlistValue> value = readBytes(bytes, limits);
  ASSERT_FALSE(value.has_value());
  const std::string& error = value.error().description;
  EXPECT_EQ(value.error().domain, PropertyListSerialization::kErrorDomain);
  EXPECT_FALSE(error.empty());
  if (!errorPart.empty()) {
    EXPECT_NE(error.find(errorPart), std::string::npos) << error;
  }
}

// ---------------------------------------------------------------------------
// PlistValue

TEST(PlistValueTest, UnsignedConstructorKeepsSmallValuesSigned) {
  EXPECT_EQ(PlistValue(std::uint64_t{5}).type(), Type::Integer);
  const auto largestSigned = static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
  EXPECT_EQ(PlistValue(largestSigned).type(), Type::Integer);
  EXPECT_EQ(PlistValue(largestSigned + 1).type(), Type::UnsignedInteger);
  EXPECT_EQ(PlistValue(largestSigned + 1).uint64Value(), largestSigned + 1);
}

TEST(PlistValueTest, NumbersConvertIntoEachOther) {
  EXPECT_EQ(PlistValue(3.9).int64Value(), 3);
  EXPECT_EQ(PlistValue(-3.9).int64Value(), -3);
  EXPECT_EQ(PlistValue(std::nan("")).int64Value(), 0);
  EXPECT_EQ(PlistValue(1e300).int64Value(), std::numeric_limits<std::int64_t>::max());
  EXPECT_EQ(PlistValue(-1e300).int64Value(), std::numeric_limits<std::int64_t>::min());
  EXPECT_EQ(PlistValue(1e300).uint64Value(), std::numeric_limits<std::uint64_t>::max());
  EXPECT_EQ(PlistValue(true).int64Value(), 1);
  EXPECT_EQ(PlistValue(false).doubleValue(), 0.0);
  EXPECT_EQ(PlistValue(-1).uint64Value(), std::numeric_limits<std::uint64_t>::max());
  EXPECT_EQ(PlistValue(std::numeric_limits<std::uint64_t>::max()).int64Value(), -1);
  EXPECT_DOUBLE_EQ(PlistValue(7).doubleValue(), 7.0);
  EXPECT_TRUE(PlistValue(0.5).boolValue());
  EXPECT_FALSE(PlistValue(0.0).boolValue());
  EXPECT_FALSE(PlistValue(std::nan("")).boolValue());
  EXPECT_TRUE(PlistValue(-2).boolValue());
}

TEST(PlistValueTest, StringsReadAsDecimalNumbers) {
  EXPECT_EQ(PlistValue("  -42abc").int64Value(), -42);
  EXPECT_EQ(PlistValue("+7").int64Value(), 7);
  EXPECT_EQ(PlistValue("12.9").int64Value(), 12);
  EXPECT_EQ(PlistValue("abc").int64Value(), 0);
  EXPECT_EQ(PlistValue("").int64Value(), 0);
  EXPECT_EQ(PlistValue("99999999999999999999").int64Value(),
            std::numeric_limits<std::int64_t>::max());
  EXPECT_EQ(PlistValue("-99999999999999999999").int64Value(),
            std::numeric_limits<std::int64_t>::min());
  EXPECT_EQ(PlistValue("18446744073709551615").uint64Value(),
            std::numeric_limits<std::uint64_t>::max());
  EXPECT_EQ(PlistValue("\t\n 400000123 ").uint64Value(), 400000123u);
  EXPECT_DOUBLE_EQ(PlistValue("  2.5e3xyz").doubleValue(), 2500.0);
  EXPECT_DOUBLE_EQ(PlistValue("+1.5").doubleValue(), 1.5);
  EXPECT_DOUBLE_EQ(PlistValue("-0.25").doubleValue(), -0.25);
  EXPECT_EQ(PlistValue("x1").doubleValue(), 0.0);
}

TEST(PlistValueTest, StringsReadAsFlags) {
  EXPECT_TRUE(PlistValue("YES").boolValue());
  EXPECT_TRUE(PlistValue("true").boolValue());
  EXPECT_TRUE(PlistValue(" 1").boolValue());
  EXPECT_TRUE(PlistValue("007").boolValue());
  EXPECT_TRUE(PlistValue("-3").boolValue());
  EXPECT_FALSE(PlistValue("NO").boolValue());
  EXPECT_FALSE(PlistValue("false").boolValue());
  EXPECT_FALSE(PlistValue("000").boolValue());
  EXPECT_FALSE(PlistValue("").boolValue());
}

TEST(PlistValueTest, OtherTypesConvertToZero) {
  EXPECT_EQ(PlistValue().int64Value(), 0);
  EXPECT_EQ(PlistValue(PlistDate{1e9}).doubleValue(), 0.0);
  EXPECT_EQ(PlistValue(PlistUid{9}).int64Value(), 0);
  EXPECT_FALSE(PlistValue(PlistArray{1}).boolValue());
  EXPECT_EQ(PlistValue(PlistData{1, 2}).uint64Value(), 0u);
}

TEST(PlistValueTest, SubscriptFindsMembersAndOtherwiseGivesNull) {
  const PlistValue value = PlistDictionary{{"a", PlistDictionary{{"b", 2}}}, {"c", "text"}};
  EXPECT_EQ(value["a"]["b"].int64Value(), 2);
  EXPECT_TRUE(value["missing"].isNull());
  EXPECT_TRUE(value["c"]["b"].isNull());
  EXPECT_TRUE(PlistValue(5)["a"].isNull());
  EXPECT_EQ(&value["missing"], &PlistValue::null());
  EXPECT_TRUE(PlistValue::null().isNull());
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

// ---------------------------------------------------------------------------
// Binary writer: exact encodings

PlistData withPayload(PlistData header, std::size_t count, std::uint8_t byte) {
  header.insert(header.end(), count, byte);
  return header;
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
      {"above int64", std::numeric_limits<std::uint64_t>::max(),
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

TEST(BinaryPlistWriterTest, WritesHeaderTrailerAndOffsetTable) {
  const PlistData file = PropertyListSerialization::writeBinary(5);
  const PlistData expected = sequence(
      {'b', 'p', 'l', 'i', 's', 't', '0', '0', 0x10, 0x05, 0x08, 0, 0, 0, 0, 0, 0, 1, 1, 0, 0, 0,
       0,   0,   0,   0,   1,   0,   0,   0,   0,    0,    0,    0, 0, 0, 0, 0, 0, 0, 0, 0, 10});
  EXPECT_EQ(file, expected);
}

TEST(BinaryPlistWriterTest, WritesDictionaryKeysThenValues) {
  const PlistData file = PropertyListSerialization::writeBinary(PlistDictionary{{"k", 1}});
  const Trailer trailer = trailerOf(file);
  EXPECT_EQ(trailer.objectCount, 3u);
  EXPECT_EQ(trailer.referenceWidth, 1);
  // Root dictionary first, then its key and its value.
  EXPECT_EQ(PlistData(file.begin() + 8, file.begin() + 11), sequence({0xD1, 0x01, 0x02}));
}

TEST(BinaryPlistWriterTest, StoresEqualStringsOnce) {
  PlistArray records;
  for (int index = 0; index < 1000; ++index) {
    records.emplace_back(
        PlistDictionary{{"bundleIdentifier", "com.example.shared"}, {"index", index}});
  }
  const PlistData file = PropertyListSerialization::writeBinary(records);
  const std::string text(file.begin(), file.end());
  const auto occurrences = [&](const std::string& needle) {
    std::size_t count = 0;
    for (std::size_t at = text.find(needle); at != std::string::npos;
         at = text.find(needle, at + 1)) {
      ++count;
    }
    return count;
  };
  EXPECT_EQ(occurrences("bundleIdentifier"), 1u);
  EXPECT_EQ(occurrences("com.example.shared"), 1u);
  // The root, 1000 dictionaries, 1000 distinct integers and three strings
  // (two keys and one value).
  EXPECT_EQ(trailerOf(file).objectCount, 2004u);
  EXPECT_EQ(readBytes(file), PlistValue(records));
}

TEST(BinaryPlistWriterTest, WidensReferencesAndOffsetsWhenNeeded) {
  PlistArray strings;
  for (int index = 0; index < 70000; ++index) strings.emplace_back("s" + std::to_string(index));
  const PlistValue value = strings;
  const PlistData file = PropertyListSerialization::writeBinary(value);
  const Trailer trailer = trailerOf(file);
  EXPECT_EQ(trailer.referenceWidth, 4);
  EXPECT_EQ(trailer.offsetWidth, 4);
  EXPECT_EQ(readBytes(file), value);
}

TEST(BinaryPlistWriterTest, ReplacesMalformedUtf8) {
  const PlistValue broken = std::string(
      "a\xFF"
      "b\xC3");
  EXPECT_EQ(readBytes(PropertyListSerialization::writeBinary(broken)), PlistValue("a\xEF\xBF\xBD"
                                                                                  "b\xEF\xBF\xBD"));
  // Encoded surrogates are not UTF-8 either.
  const PlistValue surrogate = std::string("\xED\xA0\x80");
  const std::optional<PlistValue> back =
      readBytes(PropertyListSerialization::writeBinary(surrogate));
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, PlistValue("\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD"));
}

// ---------------------------------------------------------------------------
// Round trips

// NaN included, hence sameValue; equality is otherwise type-exact, so a
// value that came back as another kind of number fails here too.
TEST(PropertyListRoundTripTest, BinaryKeepsValues) {
  struct Case {
    const char* name;
    PlistValue value;
  };
  const std::vector<Case> cases{
      {"every kind", everyKindOfValue()},
      {"integer root", 1},
      {"int64 min root", std::numeric_limits<std::int64_t>::min()},
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
      {"large catalogue", productCatalogue(10'000)},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);

    const Result<PlistValue> back = readBytes(PropertyListSerialization::writeBinary(c.value));
    ASSERT_TRUE(back) << back.errorDescription();
    EXPECT_EQ(firstDifference(*back, c.value), "");
  }
}

// XML has no UID type and libplist keeps whole seconds in XML dates, so this
// value leaves both out; they have tests of their own below.
PlistValue xmlFaithfulValue() {
  PlistValue value = everyKindOfValue();
  PlistDictionary& entries = *value.dictionary();
  entries.erase("uid");
  entries.erase("bigUid");
  entries["date"] = PlistDate{1700000000.0};
  entries["dateBefore2001"] = PlistDate{946684800.0};
  return value;
}

TEST(PropertyListRoundTripTest, XmlKeepsEveryKindOfValue) {
  const PlistValue value = xmlFaithfulValue();
  const std::string xml = PropertyListSerialization::writeXml(value);
  EXPECT_NE(xml.find("<plist"), std::string::npos);
  EXPECT_NE(xml.find("<integer>18446744073709551615</integer>"), std::string::npos);
  EXPECT_NE(xml.find("<integer>-42</integer>"), std::string::npos);
  const auto back = PropertyListSerialization::read(xml);
  ASSERT_TRUE(back) << back.errorDescription();
  EXPECT_EQ(*back, value);
  EXPECT_EQ((*back)["aboveInt64"].type(), Type::UnsignedInteger);
  EXPECT_EQ((*back)["int64Min"].type(), Type::Integer);
}

TEST(PropertyListRoundTripTest, XmlDatesKeepWholeSeconds) {
  const PlistValue value =
      PlistArray{PlistDate{1700000000.75}, PlistDate{kEpochOffset2001 - 99.75}};
  const std::optional<PlistValue> back =
      PropertyListSerialization::read(PropertyListSerialization::writeXml(value));
  ASSERT_TRUE(back);
  EXPECT_EQ((*back->array())[0], PlistValue(PlistDate{1700000000.0}));
  EXPECT_EQ((*back->array())[1], PlistValue(PlistDate{kEpochOffset2001 - 100.0}));
}

TEST(PropertyListRoundTripTest, XmlCarriesUidsAsOneKeyDictionaries) {
  const std::optional<PlistValue> back =
      PropertyListSerialization::read(PropertyListSerialization::writeXml(PlistUid{7}));
  ASSERT_TRUE(back);
  ASSERT_TRUE(back->isDictionary());
  ASSERT_EQ(back->dictionary()->size(), 1u);
  EXPECT_EQ(back->dictionary()->begin()->second, PlistValue(7));
}

TEST(PropertyListRoundTripTest, SkipsNullsAndWritesNullRootAsEmptyDictionary) {
  const PlistValue withNulls = PlistDictionary{
      {"kept", PlistArray{1, PlistValue(), 2, PlistDictionary{{"n", PlistValue()}}}},
      {"dropped", PlistValue()}};
  const PlistValue withoutNulls = PlistDictionary{{"kept", PlistArray{1, 2, PlistDictionary{}}}};
  for (const PlistFormat format : {PlistFormat::Binary, PlistFormat::Xml}) {
    SCOPED_TRACE(format == PlistFormat::Binary ? "binary" : "xml");
    EXPECT_EQ(readBytes(PropertyListSerialization::write(withNulls, format)), withoutNulls);
    EXPECT_EQ(readBytes(PropertyListSerialization::write(PlistValue(), format)),
              PlistValue(PlistDictionary{}));
  }
}

TEST(PropertyListRoundTripTest, WriteDispatchesOnFormat) {
  const PlistValue value = PlistDictionary{{"a", 1}};
  const PlistData binary = PropertyListSerialization::write(value, PlistFormat::Binary);
  const PlistData xml = PropertyListSerialization::write(value, PlistFormat::Xml);
  EXPECT_EQ(std::string(binary.begin(), binary.begin() + 8), "bplist00");
  EXPECT_NE(std::string(xml.begin(), xml.end()).find("<dict>"), std::string::npos);
  EXPECT_EQ(readBytes(binary), value);
  EXPECT_EQ(readBytes(xml), value);
}

// ---------------------------------------------------------------------------
// Cross-checks against libplist's own binary codec

TEST(BinaryPlistInteropTest, LibplistReadsWhatWeWrite) {
  // The catalogue has enough objects for 4-byte references and offsets.
  for (const PlistValue& value : {everyKindOfValue(), productCatalogue(12'000)}) {
    const PlistData bytes = PropertyListSerialization::writeBinary(value);
    SCOPED_TRACE(bytes.size());
    const PlistNode node = libplistFromBinary(bytes);
    ASSERT_TRUE(node);
    expectMatchesLibplist(node.get(), value, "");
  }
}

TEST(BinaryPlistInteropTest, WeReadWhatLibplistWrites) {
  PlistValue value = everyKindOfValue();
  // libplist 2.2 writes every 64-bit integer as a signed 8-byte one, so the
  // one above INT64_MAX cannot come back as such.
  value.dictionary()->erase("aboveInt64");
  for (const PlistValue& written : {value, productCatalogue(5'000)}) {
    const Result<PlistValue> back = readBytes(libplistToBinary(written));
    ASSERT_TRUE(back) << back.errorDescription();
    EXPECT_EQ(firstDifference(*back, written), "");
  }
}

// ---------------------------------------------------------------------------
// Binary reader: hostile and malformed input

TEST(BinaryPlistReaderTest, RefusesEveryTruncation) {
  const PlistData file = PropertyListSerialization::writeBinary(everyKindOfValue());
  for (std::size_t length = 0; length < file.size(); ++length) {
    SCOPED_TRACE(length);
    const PlistData prefix(file.begin(), file.begin() + static_cast<long>(length));
    expectReadFails(prefix);
    EXPECT_FALSE(PropertyListSerialization::readBinary(prefix).errorDescription().empty());
  }
}

TEST(BinaryPlistReaderTest, RefusesBadTrailers) {
  const PlistData file = PropertyListSerialization::writeBinary(PlistArray{1, "two", 3.0});
  const std::size_t trailer = file.size() - 32;
  const auto patched = [&](std::size_t at, std::uint64_t value, unsigned width) {
    PlistData copy = file;
    for (unsigned index = 0; index < width; ++index) {
      copy[at + index] = static_cast<std::uint8_t>(value >> (8 * (width - 1 - index)));
    }
    return copy;
  };
  struct Case {
    std::size_t at;  // within the trailer
    std::uint64_t value;
    unsigned width;
    const char* error;
  };
  const std::vector<Case> cases{
      {6, 0, 1, "offset size"},
      {6, 9, 1, "offset size"},
      {7, 0, 1, "reference size"},
      {8, 0, 8, "no objects"},
      {8, ~std::uint64_t{0}, 8, "offset table"},
      {8, std::uint64_t{1} << 61, 8, "offset table"},
      {16, 4, 8, "top object"},
      {16, ~std::uint64_t{0}, 8, "top object"},
      {24, 3, 8, "offset table"},
      {24, file.size(), 8, "offset table"},
      {24, ~std::uint64_t{0} - 7, 8, "offset table"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(testing::Message() << "trailer+" << c.at << " = " << c.value);
    expectReadFails(patched(trailer + c.at, c.value, c.width), c.error);
  }
  expectReadFails(patched(0, 'X', 1));
  PlistData otherVersion = file;
  otherVersion[6] = '1';
  expectReadFails(otherVersion, "version");
}

TEST(BinaryPlistReaderTest, RefusesObjectOffsetsOutsideTheObjectArea) {
  PlistData file = PropertyListSerialization::writeBinary(PlistArray{1, 2});
  const Trailer trailer = trailerOf(file);
  ASSERT_EQ(trailer.offsetWidth, 1);
  file[trailer.offsetTableOffset + 1] = 0xF0;  // beyond the end of the file
  expectReadFails(file, "out of range");
  file[trailer.offsetTableOffset + 1] = static_cast<std::uint8_t>(trailer.offsetTableOffset);
  expectReadFails(file, "out of range");
  file[trailer.offsetTableOffset + 1] = 3;  // inside the header
  expectReadFails(file, "out of range");
}

// Hand-assembled files, each broken in one way, and what the refusal says.
TEST(BinaryPlistReaderTest, RefusesMalformedObjects) {
  struct Case {
    std::vector<PlistData> objects;
    const char* error;
  };
  const std::vector<Case> cases{
      {{sequence({0xA1, 0x05}), sequence({0x10, 0x01})}, "reference out of range"},
      {{sequence({0xD1, 0x01, 0x09}), sequence({0x51, 'k'}), sequence({0x09})},
       "reference out of range"},
      {{sequence({0xA1, 0x00})}, "contains itself"},
      {{sequence({0xA1, 0x01}), sequence({0xA1, 0x00})}, "contains itself"},
      {{sequence({0xD1, 0x01, 0x00}), sequence({0x51, 'k'})}, "contains itself"},
      {{sequence({0x00})}, "unsupported"},  // null
      {{sequence({0x0F})}, "unsupported"},  // fill
      {{sequence({0x70})}, "unsupported"},
      {{sequence({0xC0})}, "unsupported"},  // set
      {{sequence({0x15, 0, 0})}, "integer"},
      {{sequence({0x21, 0, 0})}, "real"},
      {{sequence({0x32, 0, 0, 0, 0})}, "date"},
      {{sequence({0x13, 0, 0})}, "integer out of range"},
      {{sequence({0x14, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0})}, "64 bits"},
      {{sequence({0xD1, 0x01, 0x02}), sequence({0x10, 0x01}), sequence({0x09})},
       "key is not a string"},
      {{sequence({0x5F, 0x23, 0, 0, 0, 0, 0, 0, 0, 0})}, "bad length marker"},
  };
  for (std::size_t index = 0; index < cases.size(); ++index) {
    SCOPED_TRACE(index);
    expectReadFails(assembleBinary(cases[index].objects), cases[index].error);
  }
}

TEST(BinaryPlistReaderTest, CopiesSharedObjects) {
  const PlistData file = assembleBinary(
      {sequence({0xA3, 0x01, 0x01, 0x02}), sequence({0x51, 'x'}), sequence({0xA2, 0x01, 0x01})});

  const Result<PlistValue> value = readBytes(file);
  ASSERT_TRUE(value) << value.errorDescription();
  EXPECT_EQ(*value, PlistValue(PlistArray{"x", "x", PlistArray{"x", "x"}}));
}

TEST(BinaryPlistReaderTest, EnforcesTheDepthLimit) {
  const PlistData atLimit = PropertyListSerialization::writeBinary(nestedArrays(512));
  const PlistData overLimit = PropertyListSerialization::writeBinary(nestedArrays(513));
  EXPECT_TRUE(readBytes(atLimit));
  expectReadFails(overLimit, "nesting deeper than 512");
  PlistReadLimits deeper;
  deeper.maxDepth = 600;
  EXPECT_EQ(readBytes(overLimit, deeper), nestedArrays(513));
}

TEST(BinaryPlistReaderTest, EnforcesTheObjectLimit) {
  PlistArray hundred;
  for (int index = 0; index < 100; ++index) hundred.emplace_back(index);
  const PlistData file = PropertyListSerialization::writeBinary(hundred);
  PlistReadLimits limits;
  limits.maxObjects = 101;  // the array and its hundred integers
  EXPECT_TRUE(readBytes(file, limits));
  limits.maxObjects = 100;
  expectReadFails(file, "objects", limits);
  limits.maxObjects = 3;
  expectReadFails(file, "objects", limits);
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

TEST(BinaryPlistReaderTest, CountsEveryCopyOfASharedObject) {
  PlistReadLimits limits;
  limits.maxObjects = 100'000;
  const auto start = std::chrono::steady_clock::now();
  expectReadFails(fanOutFile(60), "objects", limits);
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  const PlistData sixteenLevels = fanOutFile(16);
  expectReadFails(sixteenLevels, "objects", limits);
  limits.maxObjects = (1u << 17) - 1;  // exactly the 2^17 - 1 values it expands to
  const std::optional<PlistValue> expanded = readBytes(sixteenLevels, limits);
  ASSERT_TRUE(expanded);
  const PlistValue* innermost = &*expanded;
  for (int level = 0; level < 16; ++level) innermost = &(*innermost->array())[1];
  EXPECT_EQ(*innermost, PlistValue(1));
  limits.maxObjects = (1u << 17) - 2;
  expectReadFails(sixteenLevels, "objects", limits);
}

TEST(BinaryPlistReaderTest, CountsDecodedBytesOfSharedStrings) {
  std::vector<PlistData> objects;
  PlistData array = sequence({0xAF, 0x11, 0x03, 0xE8});  // 1000 elements
  array.insert(array.end(), 1000, 0x01);
  objects.push_back(array);
  PlistData text = sequence({0x5F, 0x11, 0x03, 0xE8});  // 1000 characters
  text.insert(text.end(), 1000, 'a');
  objects.push_back(text);
  const PlistData file = assembleBinary(objects);
  PlistReadLimits limits;
  limits.maxBytes = 100'000;
  expectReadFails(file, "bytes", limits);
  limits.maxBytes = 1'000'000;
  const std::optional<PlistValue> value = readBytes(file, limits);
  ASSERT_TRUE(value);
  EXPECT_EQ(value->array()->size(), 1000u);
  EXPECT_EQ(*(*value->array())[999].string(), std::string(1000, 'a'));
}

TEST(BinaryPlistReaderTest, RefusesInputOverTheSizeLimit) {
  const PlistData file = PropertyListSerialization::writeBinary(everyKindOfValue());
  PlistReadLimits limits;
  limits.maxBytes = file.size() - 1;
  expectReadFails(file, "larger than", limits);
}

TEST(BinaryPlistReaderTest, RefusesHugeDeclaredLengths) {
  const auto withLength = [](int marker, std::uint64_t length) {
    PlistData object = sequence({marker, 0x13});
    appendBigEndian(object, length, 8);
    object.push_back('a');
    return object;
  };
  for (const int marker : {0x4F, 0x5F, 0x6F, 0xAF, 0xDF}) {
    SCOPED_TRACE(marker);
    expectReadFails(assembleBinary({withLength(marker, std::uint64_t{1} << 62)}), "out of range");
    expectReadFails(assembleBinary({withLength(marker, ~std::uint64_t{0})}), "out of range");
    expectReadFails(assembleBinary({withLength(marker, 0x7FFFFFFFFFFFFFFFull)}), "out of range");
    expectReadFails(assembleBinary({sequence({marker, 0x12, 0x7F, 0xFF, 0xFF, 0xFF})}),
                    "out of range");
  }
}

TEST(BinaryPlistReaderTest, AcceptsOtherWritersEncodings) {
  // 4-byte reals, sign-extended 16-byte integers, unsorted keys.
  EXPECT_EQ(readBytes(assembleBinary({sequence({0x22, 0x3F, 0xC0, 0x00, 0x00})})), PlistValue(1.5));
  PlistData negative = sequence({0x14});
  negative.insert(negative.end(), 15, 0xFF);
  negative.push_back(0xFE);
  EXPECT_EQ(readBytes(assembleBinary({negative})), PlistValue(-2));
  const PlistData unsorted =
      assembleBinary({sequence({0xD2, 0x01, 0x02, 0x03, 0x04}), sequence({0x51, 'z'}),
                      sequence({0x51, 'a'}), sequence({0x10, 0x01}), sequence({0x10, 0x02})});
  EXPECT_EQ(readBytes(unsorted), PlistValue(PlistDictionary{{"a", 2}, {"z", 1}}));
  const PlistData twoByteReferences =
      assembleBinary({sequence({0xA1, 0x00, 0x01}), sequence({0x09})}, 0, 2);
  EXPECT_EQ(readBytes(twoByteReferences), PlistValue(PlistArray{true}));
}

TEST(BinaryPlistReaderTest, ReplacesUnpairedSurrogates) {
  const auto utf16 = [](std::initializer_list<int> units) {
    PlistData object = sequence({0x60 | static_cast<int>(units.size())});
    for (const int unit : units) appendBigEndian(object, static_cast<std::uint64_t>(unit), 2);
    return readBytes(assembleBinary({object}));
  };
  const PlistValue replacement("\xEF\xBF\xBD");
  EXPECT_EQ(utf16({0xD83D, 0xDE00}), PlistValue("\xF0\x9F\x98\x80"));
  EXPECT_EQ(utf16({0xD83D}), replacement);
  EXPECT_EQ(utf16({0xDE00}), replacement);
  EXPECT_EQ(utf16({0xDE00, 0xD83D}), PlistValue("\xEF\xBF\xBD\xEF\xBF\xBD"));
  EXPECT_EQ(utf16({0xD83D, 0x0041}), PlistValue("\xEF\xBF\xBD"
                                                "A"));
  EXPECT_EQ(utf16({0x00E9, 0x0000, 0x4E2D}), PlistValue(std::string("\xC3\xA9\0\xE4\xB8\xAD", 6)));
}

TEST(BinaryPlistReaderTest, ReadsHighBytesInEightBitStringsAsLatin1) {
  EXPECT_EQ(readBytes(assembleBinary({sequence({0x53, 'c', 0xE9, 0xFF})})),
            PlistValue("c\xC3\xA9\xC3\xBF"));
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
      const std::optional<PlistValue> again =
          readBytes(PropertyListSerialization::writeBinary(*value));
      ASSERT_TRUE(again) << "byte " << at;
      EXPECT_TRUE(sameValue(*value, *again)) << "byte " << at;
    }
  }
  // Many corruptions (a changed character, a changed number) are still
  // valid files; the test is meant to decode some of them.
  EXPECT_GT(accepted, 0u);
}

// ---------------------------------------------------------------------------
// XML reader

TEST(XmlPlistReaderTest, ReadsADocument) {
  const std::string xml = R"(<?xml version="1.0" encoding="UTF-8"?>
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
  const auto value = PropertyListSerialization::read(xml);
  ASSERT_TRUE(value) << value.errorDescription();
  const PlistValue expected =
      PlistDictionary{{"name", "caf\xC3\xA9 & more"},
                      {"count", -12},
                      {"big", std::numeric_limits<std::uint64_t>::max()},
                      {"ratio", 0.5},
                      {"when", PlistDate{kEpochOffset2001 + 100}},
                      {"blob", PlistData{0, 1, 2}},
                      {"on", true},
                      {"list", PlistArray{"<raw>", PlistArray{}, PlistDictionary{}}}};
  EXPECT_EQ(*value, expected);
}

TEST(XmlPlistReaderTest, RefusesEmptyAndMalformedInput) {
  expectReadFails(PlistData{}, "empty");
  EXPECT_FALSE(PropertyListSerialization::readXml({}).errorDescription().empty());
  expectReadFails(bytesOf("   \n"));
  expectReadFails(bytesOf("not a property list"));
  expectReadFails(bytesOf("<plist><dict><key>a</key></plist>"));
  expectReadFails(bytesOf("<plist><array><string>x</array></plist>"));
  expectReadFails(bytesOf("<plist><integer>1</integer"));
}

TEST(XmlPlistReaderTest, ReplacesEncodedSurrogates) {
  const std::optional<PlistValue> value =
      PropertyListSerialization::read("<plist><string>a&#xD800;b</string></plist>");
  ASSERT_TRUE(value);
  EXPECT_EQ(*value, PlistValue("a\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD"
                               "b"));
}

// Deep documents must be refused before libplist builds (and recursively
// frees) a tree for them; the check on the parsed tree has its own wording.
const std::string kRefusedBeforeParsing = "XML property list: nesting deeper than ";

std::string xmlNestedArrays(std::size_t depth, std::string_view filler = "") {
  std::string xml = "<plist>";
  for (std::size_t level = 0; level < depth; ++level) {
    xml += "<array>";
    xml += filler;
  }
  for (std::size_t level = 0; level < depth; ++level) xml += "</array>";
  return xml + "</plist>";
}

TEST(XmlPlistReaderTest, EnforcesTheDepthLimit) {
  EXPECT_EQ(PropertyListSerialization::read(xmlNestedArrays(512)), nestedArrays(512));
  expectReadFails(bytesOf(xmlNestedArrays(513)), kRefusedBeforeParsing + "512");
  PlistReadLimits limits;
  limits.maxDepth = 10;
  expectReadFails(bytesOf(xmlNestedArrays(11)), kRefusedBeforeParsing + "10", limits);
  // An empty container is a level too, as it is in binary documents.
  limits.maxDepth = 2;
  EXPECT_TRUE(
      PropertyListSerialization::read("<plist><dict><key>k</key><array/></dict></plist>", limits));
  limits.maxDepth = 1;
  expectReadFails(bytesOf("<plist><dict><key>k</key><array/></dict></plist>"),
                  kRefusedBeforeParsing + "1", limits);
  expectReadFails(PropertyListSerialization::writeBinary(PlistDictionary{{"k", PlistArray{}}}),
                  "nesting deeper than 1", limits);
}

TEST(XmlPlistReaderTest, RefusesVeryDeepDocumentsWithoutCrashing) {
  // Deep enough that releasing libplist's tree would overflow the stack.
  expectReadFails(bytesOf(xmlNestedArrays(1'000'000)), kRefusedBeforeParsing);
}

// Each filler hides a "</array>" (or the start of the document) from libplist
// in a different way, so every one of these documents is 600 levels deep.
// The nesting scan must see them as libplist does and refuse them before
// parsing; with a higher limit libplist must parse them, which shows the
// documents really are that deep.
TEST(XmlPlistReaderTest, DepthScanTokenizesLikeLibplist) {
  const std::vector<std::string> documents = {
      xmlNestedArrays(600, "<string><![CDATA[</array>]]></string>"),
      xmlNestedArrays(600, "<!-- </array> -->"),
      xmlNestedArrays(600, "<!--> </array> -->"),
      xmlNestedArrays(600, "<?pi \"?></array>\"?>"),
      "<!DOCTYPE plist \"a[b\">" + xmlNestedArrays(600),
      "<!DOCTYPE plist [ \"]>\" ]>" + xmlNestedArrays(600),
  };
  PlistReadLimits deepEnough;
  deepEnough.maxDepth = 600;
  for (const std::string& xml : documents) {
    SCOPED_TRACE(xml.substr(0, 60));
    expectReadFails(bytesOf(xml), kRefusedBeforeParsing);
    const auto read = PropertyListSerialization::read(xml, deepEnough);
    EXPECT_TRUE(read) << read.errorDescription();
  }
  std::string withNul = "<plist>";
  for (int level = 0; level < 600; ++level) withNul += std::string("<array\0>", 8);
  for (int level = 0; level < 600; ++level) withNul += std::string("</array\0>", 9);
  withNul += "</plist>";
  expectReadFails(bytesOf(withNul), kRefusedBeforeParsing);
  EXPECT_TRUE(PropertyListSerialization::read(withNul, deepEnough));

  std::string attributes = "<plist>";
  for (int level = 0; level < 600; ++level) attributes += "<array a=\"</array>\">";
  for (int level = 0; level < 600; ++level) attributes += "</array>";
  attributes += "</plist>";
  expectReadFails(bytesOf(attributes), kRefusedBeforeParsing);
  const auto read = PropertyListSerialization::read(attributes, deepEnough);
  EXPECT_TRUE(read) << read.errorDescription();
}

TEST(XmlPlistReaderTest, EnforcesTheObjectAndSizeLimits) {
  const std::string xml =
      "<plist><dict><key>a</key><integer>1</integer><key>b</key><integer>2</integer></dict>"
      "</plist>";
  PlistReadLimits limits;
  limits.maxObjects = 5;  // the dictionary, two keys, two values
  EXPECT_TRUE(PropertyListSerialization::read(xml, limits));
  limits.maxObjects = 4;
  expectReadFails(bytesOf(xml), "objects", limits);
  limits = {};
  limits.maxBytes = xml.size() - 1;
  expectReadFails(bytesOf(xml), "larger than", limits);
}

}  // namespace
}  // namespace larder
