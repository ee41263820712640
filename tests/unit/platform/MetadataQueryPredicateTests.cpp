#include "platform/metadata/MetadataQueryPredicate.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <string>

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
  std::string error;
  std::optional<MetadataQueryPredicate> predicate = MetadataQueryPredicate::parse(text, &error);
  EXPECT_TRUE(predicate.has_value()) << text << ": " << error;
  if (!predicate) return *MetadataQueryPredicate::parse("never == 1");
  return *predicate;
}

bool matches(std::string_view text, const PlistDictionary& attributes) {
  return parsed(text).matches(attributes);
}

std::string refusal(std::string_view text) {
  std::string error;
  std::optional<MetadataQueryPredicate> predicate = MetadataQueryPredicate::parse(text, &error);
  EXPECT_FALSE(predicate.has_value()) << text << " was accepted";
  EXPECT_FALSE(error.empty()) << text;
  return error;
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

TEST(MetadataQueryPredicate, AndBindsTighterThanOr) {
  const PlistDictionary attributes{{"a", std::int64_t{1}}, {"b", std::int64_t{0}}};
  EXPECT_TRUE(matches("a == 1 || b == 1 && a == 0", attributes));
  EXPECT_FALSE(matches("(a == 1 || b == 1) && a == 0", attributes));
}

TEST(MetadataQueryPredicate, EveryComparisonOperatorOnNumbers) {
  const PlistDictionary attributes{{"n", std::int64_t{5}}};
  EXPECT_TRUE(matches("n == 5", attributes));
  EXPECT_TRUE(matches("n = 5", attributes));
  EXPECT_FALSE(matches("n != 5", attributes));
  EXPECT_TRUE(matches("n < 6", attributes));
  EXPECT_FALSE(matches("n < 5", attributes));
  EXPECT_TRUE(matches("n > 4.5", attributes));
  EXPECT_TRUE(matches("n <= 5", attributes));
  EXPECT_FALSE(matches("n >= 5.01", attributes));
  EXPECT_TRUE(matches("n == 5.0", attributes));
  EXPECT_TRUE(matches("n == '5'", attributes)) << "a quoted number is still a number";
  EXPECT_TRUE(matches("n > -3", attributes));
  EXPECT_TRUE(matches("n == +5", attributes));
}

TEST(MetadataQueryPredicate, NumbersCompareNumericallyNotAsText) {
  EXPECT_TRUE(matches("n > 9", {{"n", std::int64_t{10}}}));
  EXPECT_TRUE(matches("v > 9", {{"v", "10"}})) << "both texts read as numbers";
  EXPECT_FALSE(matches("v > 9", {{"v", "10.1.2"}})) << "not a number: byte order, '1' < '9'";
}

TEST(MetadataQueryPredicate, LargeIdentifiersCompareExactly) {
  const PlistDictionary attributes{{"id", std::int64_t{9007199254740993}}};
  EXPECT_TRUE(matches("id == 9007199254740993", attributes));
  EXPECT_FALSE(matches("id == 9007199254740992", attributes));
}

TEST(MetadataQueryPredicate, RealsBooleansAndDatesAreNumbers) {
  EXPECT_TRUE(matches("w == 401000001", {{"w", 401000001.0}}));
  EXPECT_TRUE(matches("flag == 1", {{"flag", true}}));
  EXPECT_TRUE(matches("flag != 1", {{"flag", false}}));
  EXPECT_TRUE(matches("d > 1000", {{"d", PlistDate{1500.5}}}));
  EXPECT_FALSE(matches("d > 2000", {{"d", PlistDate{1500.5}}}));
}

TEST(MetadataQueryPredicate, StringsCompareByteByByte) {
  const PlistDictionary attributes{{"s", "beta"}};
  EXPECT_TRUE(matches("s == beta", attributes));
  EXPECT_TRUE(matches("s == \"beta\"", attributes));
  EXPECT_FALSE(matches("s == Beta", attributes)) << "case matters";
  EXPECT_TRUE(matches("s > alpha", attributes));
  EXPECT_TRUE(matches("s < gamma", attributes));
  EXPECT_TRUE(matches("s >= beta && s <= beta", attributes));
  EXPECT_TRUE(matches("s != alpha", attributes));
}

TEST(MetadataQueryPredicate, TrailingStarIsAPrefixWildcard) {
  const PlistDictionary attributes{{"id", "com.orvane.SetupHerald"}};
  EXPECT_TRUE(matches("id == 'com.orvane.SetupHerald*'", attributes));
  EXPECT_TRUE(matches("id == com.orvane.*", attributes)) << "bare words take it too";
  EXPECT_TRUE(matches("id == *", attributes)) << "an empty prefix matches every string";
  EXPECT_FALSE(matches("id == 'com.orvane.SetupHeraldX*'", attributes));
  EXPECT_TRUE(matches("id != 'org.*'", attributes));
  EXPECT_FALSE(matches("id != 'com.*'", attributes));
  EXPECT_FALSE(matches("id == 'com.*.SetupHerald'", attributes)) << "only a trailing star";
}

TEST(MetadataQueryPredicate, EscapedStarIsACharacter) {
  EXPECT_TRUE(matches(R"(s == 'a\*')", {{"s", "a*"}}));
  EXPECT_FALSE(matches(R"(s == 'a\*')", {{"s", "ab"}}));
  EXPECT_TRUE(matches(R"(s == 'it\'s')", {{"s", "it's"}}));
  EXPECT_TRUE(matches(R"(s == "say \"hi\"")", {{"s", "say \"hi\""}}));
  EXPECT_TRUE(matches(R"(s == 'back\\*')", {{"s", "back\\slash"}})) << "escaped backslash, star";
}

TEST(MetadataQueryPredicate, WildcardIsAPlainStarForOrdering) {
  EXPECT_TRUE(matches("s > 'a*'", {{"s", "ab"}}));
  EXPECT_FALSE(matches("s < 'a*'", {{"s", "ab"}}));
}

TEST(MetadataQueryPredicate, AbsentAttributeEqualsNothing) {
  const PlistDictionary none;
  EXPECT_FALSE(matches("missing == 1", none));
  EXPECT_FALSE(matches("missing == *", none));
  EXPECT_TRUE(matches("missing != 1", none));
  EXPECT_TRUE(matches("missing != *", none));
  EXPECT_FALSE(matches("missing < 1", none));
  EXPECT_FALSE(matches("missing >= 1", none));
}

TEST(MetadataQueryPredicate, MismatchedTypesAreUnequalAndUnordered) {
  EXPECT_FALSE(matches("n == abc", {{"n", std::int64_t{1}}}));
  EXPECT_TRUE(matches("n != abc", {{"n", std::int64_t{1}}}));
  EXPECT_FALSE(matches("n < abc", {{"n", std::int64_t{1}}}));
  EXPECT_FALSE(matches("n == 12*", {{"n", std::int64_t{123}}})) << "no wildcard on numbers";
  EXPECT_FALSE(matches("list == 1", {{"list", PlistArray{1}}}));
  EXPECT_TRUE(matches("list != 1", {{"list", PlistArray{1}}}));
  EXPECT_FALSE(matches("s == 1", {{"s", "one"}}));
}

TEST(MetadataQueryPredicate, InfAndNanAreWordsNotNumbers) {
  EXPECT_TRUE(matches("s == inf", {{"s", "inf"}}));
  EXPECT_FALSE(matches("n == nan", {{"n", 0.0}}));
  EXPECT_TRUE(matches("s == -inf", {{"s", "-inf"}}));
  EXPECT_TRUE(matches("n != -nan", {{"n", 0.0}}));
  EXPECT_FALSE(matches("n < -nan", {{"n", 0.0}}));
}

TEST(MetadataQueryPredicate, WhitespaceIsFree) {
  EXPECT_TRUE(matches("  (\ta==1)\n&&b=='x'  ", {{"a", std::int64_t{1}}, {"b", "x"}}));
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
