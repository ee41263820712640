// Secure decoding of keyed archives: a file names only classes the caller
// allowed, at any depth.
#include <gtest/gtest.h>

#include <set>
#include <string>

#include "platform/plist/KeyedArchive.h"
#include "platform/plist/PropertyListSerialization.h"

namespace larder {
namespace {

using Allowed = std::set<std::string, std::less<>>;

const Allowed kEverything{"dictionary", "array", "string", "number", "data", "date", "Record"};

Allowed without(std::string_view className) {
  Allowed allowed = kEverything;
  allowed.erase(std::string(className));
  return allowed;
}

Result<PlistValue> decode(const PlistValue& root, const Allowed& allowed) {
  return KeyedArchive::unarchivedRoot(KeyedArchive::archivedData(root), allowed);
}

// Why `data` is refused as an archive; empty when it is not.
std::string refusal(const PlistData& data) {
  return KeyedArchive::unarchivedRoot(data, kEverything).errorDescription();
}

PlistValue sampleRecord() {
  PlistDictionary record = KeyedArchive::record("Record");
  record.emplace("field", "value");
  // A record's fields are its own business: they are not decoded, so an
  // unknown class inside them does not stop the archive.
  record.emplace("inner", KeyedArchive::record("Unlisted"));
  return record;
}

// A tree that uses every class: dictionary > array > dictionary > leaves.
PlistValue everyClassTree() {
  return KeyedArchive::dictionary({
      {"list", KeyedArchive::array({
                   "text",
                   42,
                   2.5,
                   true,
                   PlistData{0, 1, 2},
                   PlistDate{1234567890},
                   KeyedArchive::dictionary({{"deep", "leaf"}, {"record", sampleRecord()}}),
               })},
      {"name", "top"},
  });
}

TEST(KeyedArchive, NestedContainersUnwrapIntoPlainValues) {
  Result<PlistValue> decoded = decode(everyClassTree(), kEverything);
  ASSERT_TRUE(decoded) << decoded.errorDescription();
  PlistValue expected = PlistDictionary{
      {"list", PlistArray{"text", 42, 2.5, true, PlistData{0, 1, 2}, PlistDate{1234567890},
                          PlistDictionary{{"deep", "leaf"}, {"record", sampleRecord()}}}},
      {"name", "top"},
  };
  EXPECT_EQ(*decoded, expected);
  EXPECT_EQ(KeyedArchive::classNameOf((*decoded)["list"].array()->back()["record"]), "Record");

  // Empty containers are fine too.
  std::optional<PlistValue> empty =
      decode(KeyedArchive::dictionary({{"a", KeyedArchive::array({})}}), kEverything);
  ASSERT_TRUE(empty);
  EXPECT_EQ(*empty, PlistValue(PlistDictionary{{"a", PlistArray{}}}));
}

TEST(KeyedArchive, EveryClassMustBeAllowedWhereverItAppears) {
  for (const char* className :
       {"dictionary", "array", "string", "number", "data", "date", "Record"}) {
    const std::string error = decode(everyClassTree(), without(className)).errorDescription();
    EXPECT_FALSE(error.empty()) << className << " was admitted although not allowed";
    EXPECT_NE(error.find(className), std::string::npos) << className << ": " << error;
  }
  // Each leaf class alone at the root.
  const std::vector<std::pair<PlistValue, const char*>> roots = {
      {"text", "string"},     {7, "number"},          {false, "number"},         {0.5, "number"},
      {PlistData{9}, "data"}, {PlistDate{1}, "date"}, {sampleRecord(), "Record"}};
  for (const auto& [root, className] : roots) {
    EXPECT_TRUE(decode(root, Allowed{className})) << className;
    EXPECT_FALSE(decode(root, without(className))) << className;
  }
  // A class allowed at the root does not let others in below it.
  EXPECT_FALSE(decode(KeyedArchive::array({KeyedArchive::array({KeyedArchive::record("Evil")})}),
                      Allowed{"array"}));
  EXPECT_TRUE(decode(KeyedArchive::array({KeyedArchive::array({KeyedArchive::record("Evil")})}),
                     Allowed{"array", "Evil"}));
}

TEST(KeyedArchive, MalformedObjectsAreRefused) {
  std::vector<std::pair<const char*, PlistValue>> cases = {
      {"plain dictionary without class", PlistDictionary{{"key", "value"}}},
      {"class that is not a string", PlistDictionary{{"$class", 5}}},
      {"dictionary without entries", PlistDictionary{{"$class", "dictionary"}}},
      {"dictionary with array entries",
       PlistDictionary{{"$class", "dictionary"}, {"$entries", PlistArray{}}}},
      {"array without items", PlistDictionary{{"$class", "array"}}},
      {"array with dictionary items",
       PlistDictionary{{"$class", "array"}, {"$items", PlistDictionary{}}}},
      {"bare array", PlistArray{"a"}},
      {"uid", PlistUid{3}},
      {"bad value deep inside",
       KeyedArchive::dictionary({{"a", KeyedArchive::array({PlistDictionary{{"x", 1}}})}})},
  };
  for (const auto& [name, root] : cases) {
    EXPECT_FALSE(decode(root, kEverything).errorDescription().empty()) << name;
  }
}

TEST(KeyedArchive, DataThatIsNotAnArchiveIsRefused) {
  PlistData garbage{'n', 'o', 't', ' ', 'a', 'n', ' ', 'a', 'r', 'c', 'h', 'i', 'v', 'e'};
  EXPECT_FALSE(refusal(garbage).empty());
  EXPECT_FALSE(refusal(PlistData{}).empty());

  // A property list, but not from our archiver.
  PlistData foreign = PropertyListSerialization::writeBinary(PlistDictionary{
      {"$archiver", "SomeoneElse"}, {"$version", 1}, {"$top", PlistDictionary{{"root", "x"}}}});
  EXPECT_EQ(refusal(foreign), "not a keyed archive");
  EXPECT_EQ(refusal(PropertyListSerialization::writeBinary(PlistArray{"x"})),
            "not a keyed archive");

  // Ours, but with nothing at the top.
  PlistData rootless = PropertyListSerialization::writeBinary(PlistDictionary{
      {"$archiver", "larder.KeyedArchive"}, {"$version", 1}, {"$top", PlistDictionary{}}});
  EXPECT_EQ(refusal(rootless), "keyed archive without root object");

  // Every prefix of a real archive is refused rather than half read.
  PlistData whole = KeyedArchive::archivedData(everyClassTree());
  for (std::size_t length = 0; length < whole.size(); length += 7) {
    PlistData prefix(whole.begin(), whole.begin() + static_cast<std::ptrdiff_t>(length));
    EXPECT_FALSE(KeyedArchive::unarchivedRoot(prefix, kEverything)) << "length " << length;
  }
}

TEST(KeyedArchive, NestingBeyondTheLimitIsRefused) {
  auto nested = [](int levels) {
    PlistValue value = "leaf";
    for (int i = 0; i < levels; ++i) value = KeyedArchive::array({value});
    return value;
  };
  EXPECT_TRUE(decode(nested(100), kEverything));
  EXPECT_EQ(decode(nested(200), kEverything).errorDescription(), "archive nested too deeply");
}

}  // namespace
}  // namespace larder
