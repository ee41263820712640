#include "platform/metadata/MetadataQueryPredicate.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

namespace larder {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

constexpr const char* kStoreQuery =
    "kHostItemQuaymartHasPurchaseRecord == 1 || "
    "kHostItemHostBundleIdentifier=='com.orvane.SetupHerald*'";

constexpr const char* kLegacyQuery =
    "kHostItemContentType=com.orvane.application-bundle && "
    "kHostItemQuaymartHasPurchaseRecord!=1 && kHostItemQuaymartIsDeveloperSigned!=1 && "
    "(kHostItemHostBundleIdentifier='com.orvane.Snapbox' || "
    "kHostItemHostBundleIdentifier='com.orvane.ReelcutApp')";

MetadataQueryPredicate parsed(std::string_view text) {
  Result<MetadataQueryPredicate> predicate = MetadataQueryPredicate::parse(text);
  EXPECT_TRUE(predicate.has_value()) << text << ": " << predicate.errorDescription();
  if (!predicate) return *MetadataQueryPredicate::parse("never == 1");
  return *predicate;
}

bool matches(std::string_view text, const PlistDictionary& attributes) {
  return parsed(text).matches(attributes);
}

std::string refusal(std::string_view text) {
  Result<MetadataQueryPredicate> predicate = MetadataQueryPredicate::parse(text);
  EXPECT_FALSE(predicate.has_value()) << text << " was accepted";
  if (predicate) return "";
  EXPECT_EQ(predicate.error().domain, MetadataQueryPredicate::kErrorDomain);
  EXPECT_FALSE(predicate.error().description.empty()) << text;
  return predicate.error().description;
}

PlistDictionary storeBundle() {
  return {{"kHostItemContentType", "com.orvane.application-bundle"},
          {"kHostItemHostBundleIdentifier", "com.example.Notes"},
          {"kHostItemQuaymartHasPurchaseRecord", std::int64_t{1}},
          {"kHostItemQuaymartIsDeveloperSigned", std::int64_t{0}},
          {"kHostItemQuaymartWareID", 401000001.0},
          {"kHostItemVersion", "2.1"}};
}

PlistDictionary legacyBundle(std::string identifier) {
  return {{"kHostItemContentType", "com.orvane.application-bundle"},
          {"kHostItemHostBundleIdentifier", std::move(identifier)},
          {"kHostItemQuaymartHasPurchaseRecord", std::int64_t{0}},
          {"kHostItemQuaymartIsDeveloperSigned", std::int64_t{0}}};
}

TEST(MetadataQueryPredicate, StoreQueryTakesPurchasedSoftwareAndTheInstaller) {
  EXPECT_TRUE(matches(kStoreQuery, storeBundle()));
  EXPECT_TRUE(matches(kStoreQuery, legacyBundle("com.orvane.SetupHerald")));
  EXPECT_TRUE(matches(kStoreQuery, legacyBundle("com.orvane.SetupHeraldBeta")));
  EXPECT_FALSE(matches(kStoreQuery, legacyBundle("com.orvane.Setup")));
  EXPECT_FALSE(matches(kStoreQuery, legacyBundle("com.example.Notes")));
}

TEST(MetadataQueryPredicate, LegacyQueryTakesListedBundlesWithoutPurchaseOrSignature) {
  EXPECT_TRUE(matches(kLegacyQuery, legacyBundle("com.orvane.Snapbox")));
  EXPECT_TRUE(matches(kLegacyQuery, legacyBundle("com.orvane.ReelcutApp")));
  EXPECT_FALSE(matches(kLegacyQuery, legacyBundle("com.orvane.Darkbench")));

  PlistDictionary purchased = legacyBundle("com.orvane.Snapbox");
  purchased["kHostItemQuaymartHasPurchaseRecord"] = std::int64_t{1};
  EXPECT_FALSE(matches(kLegacyQuery, purchased));

  PlistDictionary signedByDeveloper = legacyBundle("com.orvane.Snapbox");
  signedByDeveloper["kHostItemQuaymartIsDeveloperSigned"] = std::int64_t{1};
  EXPECT_FALSE(matches(kLegacyQuery, signedByDeveloper));

  PlistDictionary notABundle = legacyBundle("com.orvane.Snapbox");
  notABundle["kHostItemContentType"] = "com.orvane.folder";
  EXPECT_FALSE(matches(kLegacyQuery, notABundle));
}

// Each row: a query, the attributes it is asked about, and whether it matches.
TEST(MetadataQueryPredicate, MatchesAsTheQuerySays) {
  const PlistDictionary five{{"n", std::int64_t{5}}};
  const PlistDictionary beta{{"s", "beta"}};
  const PlistDictionary installer{{"id", "com.orvane.SetupHerald"}};
  const PlistDictionary one{{"n", std::int64_t{1}}};
  const PlistDictionary zero{{"n", 0.0}};
  struct Case {
    const char* query;
    PlistDictionary attributes;
    bool matches;
  };
  const std::vector<Case> cases{
      // && binds tighter than ||.
      {"a == 1 || b == 1 && a == 0", {{"a", std::int64_t{1}}, {"b", std::int64_t{0}}}, true},
      {"(a == 1 || b == 1) && a == 0", {{"a", std::int64_t{1}}, {"b", std::int64_t{0}}}, false},
      // Every operator on numbers; a quoted number is still a number.
      {"n == 5", five, true},
      {"n = 5", five, true},
      {"n != 5", five, false},
      {"n < 6", five, true},
      {"n < 5", five, false},
      {"n > 4.5", five, true},
      {"n <= 5", five, true},
      {"n >= 5.01", five, false},
      {"n == 5.0", five, true},
      {"n == '5'", five, true},
      {"n > -3", five, true},
      {"n == +5", five, true},
      // Numbers compare numerically; text that is no number compares byte by byte.
      {"n > 9", {{"n", std::int64_t{10}}}, true},
      {"v > 9", {{"v", "10"}}, true},
      {"v > 9", {{"v", "10.1.2"}}, false},
      // Large identifiers compare exactly.
      {"id == 9007199254740993", {{"id", std::int64_t{9007199254740993}}}, true},
      {"id == 9007199254740992", {{"id", std::int64_t{9007199254740993}}}, false},
      // Reals, flags and dates are numbers.
      {"w == 401000001", {{"w", 401000001.0}}, true},
      {"flag == 1", {{"flag", true}}, true},
      {"flag != 1", {{"flag", false}}, true},
      {"d > 1000", {{"d", PlistDate{1500.5}}}, true},
      {"d > 2000", {{"d", PlistDate{1500.5}}}, false},
      // Strings compare byte by byte, case included.
      {"s == beta", beta, true},
      {"s == \"beta\"", beta, true},
      {"s == Beta", beta, false},
      {"s > alpha", beta, true},
      {"s < gamma", beta, true},
      {"s >= beta && s <= beta", beta, true},
      {"s != alpha", beta, true},
      // Only a trailing star is a prefix wildcard, quoted or bare; an empty prefix takes all.
      {"id == 'com.orvane.SetupHerald*'", installer, true},
      {"id == com.orvane.*", installer, true},
      {"id == *", installer, true},
      {"id == 'com.orvane.SetupHeraldX*'", installer, false},
      {"id != 'org.*'", installer, true},
      {"id != 'com.*'", installer, false},
      {"id == 'com.*.SetupHerald'", installer, false},
      // Escapes: an escaped star is a character, an escaped backslash is not an escape.
      {R"(s == 'a\*')", {{"s", "a*"}}, true},
      {R"(s == 'a\*')", {{"s", "ab"}}, false},
      {R"(s == 'it\'s')", {{"s", "it's"}}, true},
      {R"(s == "say \"hi\"")", {{"s", "say \"hi\""}}, true},
      {R"(s == 'back\\*')", {{"s", "back\\slash"}}, true},
      // For ordering the wildcard is a plain star.
      {"s > 'a*'", {{"s", "ab"}}, true},
      {"s < 'a*'", {{"s", "ab"}}, false},
      // An absent attribute equals nothing and is unordered.
      {"missing == 1", {}, false},
      {"missing == *", {}, false},
      {"missing != 1", {}, true},
      {"missing != *", {}, true},
      {"missing < 1", {}, false},
      {"missing >= 1", {}, false},
      // Mismatched types are unequal and unordered; no wildcard on numbers.
      {"n == abc", one, false},
      {"n != abc", one, true},
      {"n < abc", one, false},
      {"n == 12*", {{"n", std::int64_t{123}}}, false},
      {"list == 1", {{"list", PlistArray{1}}}, false},
      {"list != 1", {{"list", PlistArray{1}}}, true},
      {"s == 1", {{"s", "one"}}, false},
      // inf and nan are words, not numbers.
      {"s == inf", {{"s", "inf"}}, true},
      {"n == nan", zero, false},
      {"s == -inf", {{"s", "-inf"}}, true},
      {"n != -nan", zero, true},
      {"n < -nan", zero, false},
      // Whitespace is free.
      {"  (\ta==1)\n&&b=='x'  ", {{"a", std::int64_t{1}}, {"b", "x"}}, true},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.query);
    EXPECT_EQ(matches(c.query, c.attributes), c.matches);
  }
}

TEST(MetadataQueryPredicate, NamesTheAttributesItReads) {
  EXPECT_THAT(parsed(kStoreQuery).attributeNames(),
              ElementsAre("kHostItemHostBundleIdentifier", "kHostItemQuaymartHasPurchaseRecord"));
}

TEST(MetadataQueryPredicate, CanonicalTextKeepsMeaningAndIsStable) {
  const MetadataQueryPredicate legacy = parsed(kLegacyQuery);
  const std::string canonical = legacy.canonicalText();
  EXPECT_EQ(canonical,
            "kHostItemContentType == \"com.orvane.application-bundle\" && "
            "kHostItemQuaymartHasPurchaseRecord != \"1\" && "
            "kHostItemQuaymartIsDeveloperSigned != \"1\" && "
            "(kHostItemHostBundleIdentifier == \"com.orvane.Snapbox\" || "
            "kHostItemHostBundleIdentifier == \"com.orvane.ReelcutApp\")");
  EXPECT_EQ(parsed(canonical).canonicalText(), canonical);
  EXPECT_TRUE(parsed(canonical).matches(legacyBundle("com.orvane.ReelcutApp")));
  EXPECT_EQ(parsed("((a == 1) || (b == 2)) || c == 3").canonicalText(),
            "a == \"1\" || b == \"2\" || c == \"3\"");
  EXPECT_EQ(parsed(R"(s == 'a\*b*')").canonicalText(), R"(s == "a\*b*")");
}

TEST(MetadataQueryPredicate, RefusesMalformedQueries) {
  EXPECT_THAT(refusal(""), HasSubstr("attribute"));
  EXPECT_THAT(refusal("a =="), HasSubstr("value"));
  EXPECT_THAT(refusal("a 1"), HasSubstr("operator"));
  EXPECT_THAT(refusal("== 1"), HasSubstr("attribute"));
  EXPECT_THAT(refusal("1 == a"), HasSubstr("attribute"));
  EXPECT_THAT(refusal("a == 1 &&"), HasSubstr("attribute"));
  EXPECT_THAT(refusal("a == 1 & b == 2"), HasSubstr("unexpected"));
  EXPECT_THAT(refusal("a == 1 | b == 2"), HasSubstr("unexpected"));
  EXPECT_THAT(refusal("!a"), HasSubstr("unexpected"));
  EXPECT_THAT(refusal("(a == 1"), HasSubstr("')'"));
  EXPECT_THAT(refusal("a == 1)"), HasSubstr("unexpected text"));
  EXPECT_THAT(refusal("a == 'open"), HasSubstr("unterminated"));
  EXPECT_THAT(refusal("a == 'x\\"), HasSubstr("unterminated"));
  EXPECT_THAT(refusal("a == 'x'cd"), HasSubstr("unexpected text"));
  EXPECT_THAT(refusal("a* == 1"), HasSubstr("attribute"));
  EXPECT_THAT(refusal("a.b == 1"), HasSubstr("attribute"));
  EXPECT_THAT(refusal("a == 1 b == 2"), HasSubstr("unexpected text"));
  EXPECT_THAT(refusal("()"), HasSubstr("attribute"));
}

TEST(MetadataQueryPredicate, BoundsNestingDepth) {
  const std::size_t limit = MetadataQueryPredicate::kMaxNestingDepth;
  const std::string deepest = std::string(limit, '(') + "a == 1" + std::string(limit, ')');
  EXPECT_TRUE(matches(deepest, {{"a", std::int64_t{1}}}));
  const std::string tooDeep = std::string(limit + 1, '(') + "a == 1" + std::string(limit + 1, ')');
  EXPECT_THAT(refusal(tooDeep), HasSubstr("nested too deeply"));
  EXPECT_THAT(refusal(std::string(100000, '(')), HasSubstr("query longer"));
  EXPECT_THAT(refusal(std::string(5000, '(')), HasSubstr("nested too deeply"));
}

TEST(MetadataQueryPredicate, LongFlatQueriesAreFine) {
  std::string text = "a == 0";
  for (int i = 1; i < 2000; ++i) text += " || a == " + std::to_string(i);
  EXPECT_TRUE(matches(text, {{"a", std::int64_t{1999}}}));
  EXPECT_FALSE(matches(text, {{"a", std::int64_t{2000}}}));
}

}  // namespace
}  // namespace larder
