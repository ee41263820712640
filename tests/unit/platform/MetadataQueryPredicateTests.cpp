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

PlistDictionary with(PlistDictionary attributes, const std::string& name, PlistValue value) {
  attributes[name] = std::move(value);
  return attributes;
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
  const PlistDictionary snapbox = legacyBundle("com.orvane.Snapbox");
  const std::vector<Case> cases{
      // The store's query takes purchased software and the installer.
      {kStoreQuery, storeBundle(), true},
      {kStoreQuery, legacyBundle("com.orvane.SetupHerald"), true},
      {kStoreQuery, legacyBundle("com.orvane.SetupHeraldBeta"), true},
      {kStoreQuery, legacyBundle("com.orvane.Setup"), false},
      {kStoreQuery, legacyBundle("com.example.Notes"), false},
      // The legacy query takes listed bundles without purchase or signature.
      {kLegacyQuery, snapbox, true},
      {kLegacyQuery, legacyBundle("com.orvane.ReelcutApp"), true},
      {kLegacyQuery, legacyBundle("com.orvane.Darkbench"), false},
      {kLegacyQuery, with(snapbox, "kHostItemQuaymartHasPurchaseRecord", std::int64_t{1}), false},
      {kLegacyQuery, with(snapbox, "kHostItemQuaymartIsDeveloperSigned", std::int64_t{1}), false},
      {kLegacyQuery, with(snapbox, "kHostItemContentType", "com.orvane.folder"), false},
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
  for (std::size_t row = 0; row < cases.size(); ++row) {
    SCOPED_TRACE(testing::Message() << "row " << row << ": " << cases[row].query);
    EXPECT_EQ(matches(cases[row].query, cases[row].attributes), cases[row].matches);
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

// Each row: a query and what its refusal says.
TEST(MetadataQueryPredicate, RefusesMalformedQueriesSayingWhy) {
  const std::size_t limit = MetadataQueryPredicate::kMaxNestingDepth;
  const std::string tooDeep = std::string(limit + 1, '(') + "a == 1" + std::string(limit + 1, ')');
  const std::pair<std::string, std::string> cases[] = {
      {"", "attribute"},
      {"a ==", "value"},
      {"a 1", "operator"},
      {"== 1", "attribute"},
      {"1 == a", "attribute"},
      {"a == 1 &&", "attribute"},
      {"a == 1 & b == 2", "unexpected"},
      {"a == 1 | b == 2", "unexpected"},
      {"!a", "unexpected"},
      {"(a == 1", "')'"},
      {"a == 1)", "unexpected text"},
      {"a == 'open", "unterminated"},
      {"a == 'x\\", "unterminated"},
      {"a == 'x'cd", "unexpected text"},
      {"a* == 1", "attribute"},
      {"a.b == 1", "attribute"},
      {"a == 1 b == 2", "unexpected text"},
      {"()", "attribute"},
      // Deep nesting, and long text, are refused before they cost a deep recursion.
      {tooDeep, "nested too deeply"},
      {std::string(100000, '('), "query longer"},
      {std::string(5000, '('), "nested too deeply"},
  };
  for (const auto& [query, says] : cases) {
    EXPECT_THAT(refusal(query), HasSubstr(says)) << query.substr(0, 60);
  }
}

// The deepest nesting allowed, and a long flat query, are fine.
TEST(MetadataQueryPredicate, TakesDeepAndLongQueriesWithinTheLimits) {
  const std::size_t limit = MetadataQueryPredicate::kMaxNestingDepth;
  const std::string deepest = std::string(limit, '(') + "a == 1" + std::string(limit, ')');
  EXPECT_TRUE(matches(deepest, {{"a", std::int64_t{1}}}));
  std::string text = "a == 0";
  for (int i = 1; i < 2000; ++i) text += " || a == " + std::to_string(i);
  EXPECT_TRUE(matches(text, {{"a", std::int64_t{1999}}}));
  EXPECT_FALSE(matches(text, {{"a", std::int64_t{2000}}}));
}

}  // namespace
}  // namespace larder
