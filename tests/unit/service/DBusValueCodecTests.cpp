// Property-list values through real D-Bus message bodies.
#include <gtest/gtest.h>
#include <sdbus-c++/Error.h>
#include <sdbus-c++/Message.h>
#include <sdbus-c++/Types.h>

#include <cstdint>
#include <limits>
#include <map>
#include <string>

#include "client/DBusValueCodec.h"
#include "client/ServiceError.h"
#include "platform/log/TillLogManager.h"

// sdbus-c++ 1.2 builds its own variants on a message made without any bus
// connection; the function is exported but not declared in its headers.
namespace sdbus {
PlainMessage createPlainMessage();
}

namespace larder {
namespace {

constexpr std::string_view kSignature = "sa{sv}xtbdayaa{sv}as";

sdbus::PlainMessage sealed(std::string_view signature, const PlistArray& values) {
  sdbus::PlainMessage message = sdbus::createPlainMessage();
  DBusValueCodec::writeAll(message, signature, values);
  message.seal();
  return message;
}

PlistArray roundTrip(std::string_view signature, const PlistArray& values) {
  sdbus::PlainMessage message = sealed(signature, values);
  return DBusValueCodec::readAll(message, signature);
}

PlistDictionary richDictionary() {
  return PlistDictionary{
      {"string", "välue with ünïcode"},
      {"negative", std::int64_t{-9000000000}},
      {"huge", std::numeric_limits<std::uint64_t>::max()},
      {"flag", true},
      {"ratio", 0.125},
      {"bytes", PlistData{0, 255, 7}},
      {"list", PlistArray{"a", 1, false, PlistArray{2.5}, PlistDictionary{{"k", "v"}}}},
      {"nested", PlistDictionary{{"inner", PlistDictionary{{"deepest", std::int64_t{3}}}},
                                 {"emptyList", PlistArray{}},
                                 {"emptyDictionary", PlistDictionary{}}}},
      {"", "empty key"},
  };
}

TEST(DBusValueCodec, NestedValuesSurviveAMessage) {
  PlistArray values{
      "plain string",
      richDictionary(),
      std::numeric_limits<std::int64_t>::min(),
      std::numeric_limits<std::uint64_t>::max(),
      true,
      -1.5e300,
      PlistData{1, 2, 3, 0, 4},
      PlistArray{PlistDictionary{{"bundleIdentifier", "com.example.one"}, {"itemIdentifier", 1}},
                 PlistDictionary{},
                 PlistDictionary{{"list", PlistArray{PlistArray{PlistArray{"x"}}}}}},
      PlistArray{"first", "", "third"},
  };
  PlistArray read = roundTrip(kSignature, values);
  EXPECT_EQ(read, values);
  EXPECT_EQ(read[3].type(), PlistValue::Type::UnsignedInteger);
  EXPECT_EQ(read[1]["huge"].type(), PlistValue::Type::UnsignedInteger);
}

TEST(DBusValueCodec, AbsentValuesTravelAsEmptyValues) {
  PlistArray read = roundTrip(kSignature, {});
  PlistArray expected{"",          PlistDictionary{}, 0,           0, false, 0.0,
                      PlistData{}, PlistArray{},      PlistArray{}};
  EXPECT_EQ(read, expected);

  // Absent members of containers are left out; present ones keep their place.
  read = roundTrip("asa{sv}", {PlistArray{"a", PlistValue(), "b"},
                               PlistDictionary{{"kept", 1}, {"absent", PlistValue()}}});
  EXPECT_EQ(read, (PlistArray{PlistArray{"a", "b"}, PlistDictionary{{"kept", 1}}}));

  // A value of another type than the signature's is written as what it
  // converts to, never as a wrong body.
  read = roundTrip("sxa{sv}ay", {42, "17", "not a dictionary", "not data"});
  EXPECT_EQ(read, (PlistArray{"", 17, PlistDictionary{}, PlistData{}}));
}

// The type each entry of an a{sv} travels as.
std::map<std::string, std::string> variantTypes(const PlistDictionary& dictionary) {
  sdbus::PlainMessage message = sdbus::createPlainMessage();
  DBusValueCodec::write(message, "a{sv}", dictionary);
  message.seal();
  std::map<std::string, std::string> types;
  message.enterContainer("{sv}");
  for (std::size_t i = 0; i < dictionary.size(); ++i) {
    message.enterDictEntry("sv");
    std::string key;
    message >> key;
    std::string type;
    std::string contents;
    message.peekType(type, contents);
    sdbus::Variant value;
    message >> value;
    message.exitDictEntry();
    types[key] = contents;
  }
  return types;
}

// Identifiers of records travel as uint64, store versions as int64, dates
// as seconds.
TEST(DBusValueCodec, VariantsCarryNaturalTypesAndIdentifiersAreUnsigned) {
  const PlistDictionary dictionary{{"itemIdentifier", 5},
                                   {"accountID", std::uint64_t{7}},
                                   {"ware-id", 409183694},
                                   {"versionIdentifier", 5},
                                   {"itemIdentifierText", 5},
                                   {"date", PlistDate{1700000000.5}},
                                   {"real", 5.0},
                                   {"flag", false}};
  EXPECT_EQ(variantTypes(dictionary),
            (std::map<std::string, std::string>{{"itemIdentifier", "t"},
                                                {"accountID", "t"},
                                                {"ware-id", "t"},
                                                {"versionIdentifier", "x"},
                                                {"itemIdentifierText", "x"},
                                                {"date", "d"},
                                                {"real", "d"},
                                                {"flag", "b"}}));
  PlistArray read = roundTrip("a{sv}", {dictionary});
  EXPECT_EQ(read[0]["date"], PlistValue(1700000000.5));
  // A small unsigned value that is no identifier reads back as an integer.
  EXPECT_EQ(roundTrip("a{sv}", {PlistDictionary{{"small", std::uint64_t{5}}}})[0]["small"].type(),
            PlistValue::Type::Integer);
  EXPECT_EQ(read[0]["itemIdentifier"], PlistValue(5));

  for (const auto& [value, signature] :
       {std::pair{PlistValue("s"), "s"}, std::pair{PlistValue(), "s"},
        std::pair{PlistValue(PlistUid{1}), "t"}, std::pair{PlistValue(PlistArray{}), "av"},
        std::pair{PlistValue(PlistDictionary{}), "a{sv}"},
        std::pair{PlistValue(PlistData{}), "ay"}}) {
    EXPECT_EQ(DBusValueCodec::naturalSignature(value), signature) << describePlistValue(value);
  }
}

TEST(DBusValueCodec, OtherBasicTypesAndObjectPaths) {
  PlistArray read = roundTrip("ynqiuod", {255, -32768, 65535, std::int64_t{-2147483648LL},
                                          std::int64_t{4294967295LL}, "/com/example/Object", 2.0});
  EXPECT_EQ(read, (PlistArray{255, -32768, 65535, std::int64_t{-2147483648LL},
                              std::int64_t{4294967295LL}, "/com/example/Object", 2.0}));
  // An absent object path is the root path, the one that names no object.
  EXPECT_EQ(roundTrip("o", {}), PlistArray{"/"});
  EXPECT_EQ(roundTrip("o", {""}), PlistArray{"/"});
}

PlistValue nestedDictionaries(int levels) {
  PlistValue value = "leaf";
  for (int i = 0; i < levels; ++i) value = PlistDictionary{{"next", value}};
  return value;
}

TEST(DBusValueCodec, DeepNestingIsRefused) {
  EXPECT_EQ(roundTrip("a{sv}", {nestedDictionaries(8)}), PlistArray{nestedDictionaries(8)});

  sdbus::PlainMessage message = sealed("a{sv}", {nestedDictionaries(20)});
  EXPECT_THROW(DBusValueCodec::readAll(message, "a{sv}"), ServiceError);

  // Arrays of variants count as well.
  PlistValue arrays = "leaf";
  for (int i = 0; i < 20; ++i) arrays = PlistArray{arrays};
  sdbus::PlainMessage arrayMessage = sealed("av", {arrays});
  EXPECT_THROW(DBusValueCodec::readAll(arrayMessage, "av"), ServiceError);
}

TEST(DBusValueCodec, BodiesThatDoNotMatchTheSignatureAreRefused) {
  struct Case {
    const char* written;
    PlistArray values;
    const char* read;  // nullptr: refused already when written
  };
  const Case cases[] = {{"x", {5}, "s"},
                        {"s", {"only one"}, "ss"},
                        {"as", {PlistArray{"a"}}, "a{sv}"},
                        {"(ss)", {PlistArray{"a", "b"}}, nullptr}};
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.written) + " read as " + (c.read ? c.read : "nothing"));
    if (!c.read) {
      EXPECT_THROW(sealed(c.written, c.values), sdbus::Error);
      continue;
    }
    sdbus::PlainMessage message = sealed(c.written, c.values);
    EXPECT_THROW(DBusValueCodec::readAll(message, c.read), sdbus::Error);
  }
}

TEST(DBusValueCodec, SplitSignature) {
  EXPECT_EQ(DBusValueCodec::splitSignature("sa{sv}xaa{sv}(si)as"),
            (std::vector<std::string>{"s", "a{sv}", "x", "aa{sv}", "(si)", "as"}));
  EXPECT_TRUE(DBusValueCodec::splitSignature("").empty());
  for (const char* bad : {"(si", "aa", "a", "a{sv"}) {
    EXPECT_THROW(DBusValueCodec::splitSignature(bad), sdbus::Error) << bad;
  }
}

}  // namespace
}  // namespace larder
