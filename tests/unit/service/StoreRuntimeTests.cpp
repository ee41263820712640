// Version ordering, log formatting and the product record's two encodings.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include "platform/log/TillLogManager.h"
#include "platform/plist/KeyedArchive.h"
#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/records/LedgerSoftwareProduct.h"

namespace larder {
namespace {

int sign(int value) {
  return (value > 0) - (value < 0);
}

// Each pair is compared in both directions, so that a comparison that
// ignores its argument order cannot pass. Digit runs compare as numbers,
// even beyond any machine integer, and leading zeros do not count; a
// version that continues where the other ends is the greater one; letters
// compare by character, after digits, with bytes above 127 unsigned.
TEST(CompareVersionStrings, OrdersPairsByNumericRunsThenCharacters) {
  // Pairs "a<b" or "a=b", separated by ';'.
  const std::string_view pairs =
      "1.9<1.10;1.2.9<1.2.10;9<10;2.99<10.0;1.0.9<1.1;4.5.6=4.5.6;"
      "1.99999999999999999999998<1.99999999999999999999999;"
      "99999999999999999999<100000000000000000000;"
      "1.01=1.1;007=7;1.000=1.0;0=000;1.09<1.10;1.009<1.9.1;"
      "1.0<1.0.0;1<1.0;<0;<1.0;=;"
      "1.0a<1.0b;1.0<1.0a;1.0b2<1.0b10;2.0 beta<2.0 gamma;1.1<1.a;Z<a;1.0z<1.0\xC3\xA9";
  for (std::size_t at = 0; at < pairs.size();) {
    const std::string_view pair = pairs.substr(at, pairs.find(';', at) - at);
    at += pair.size() + 1;
    const std::size_t op = pair.find_first_of("<=");
    const std::string_view a = pair.substr(0, op), b = pair.substr(op + 1);
    const int order = pair[op] == '<' ? -1 : 0;
    EXPECT_EQ(sign(compareVersionStrings(a, b)), order) << pair;
    EXPECT_EQ(sign(compareVersionStrings(b, a)), -order) << pair << ", reversed";
  }
}

TEST(CompareVersionStrings, OrderIsConsistentAcrossAMixedSet) {
  const std::vector<std::string> versions = {"",     "0",   "1",      "1.0",  "1.0.0", "1.0a",
                                             "1.01", "1.1", "1.9",    "1.10", "1.10a", "2",
                                             "2.0b", "10",  "10.0.1", "a",    "a1",    "a10"};
  for (const std::string& a : versions) {
    EXPECT_EQ(compareVersionStrings(a, a), 0) << a;
    for (const std::string& b : versions) {
      int ab = compareVersionStrings(a, b);
      EXPECT_EQ(sign(ab), -sign(compareVersionStrings(b, a))) << a << " / " << b;
      EXPECT_TRUE(ab == -1 || ab == 0 || ab == 1) << "result is not -1, 0 or 1: " << ab;
      for (const std::string& c : versions) {
        if (ab <= 0 && compareVersionStrings(b, c) <= 0) {
          EXPECT_LE(compareVersionStrings(a, c), 0) << a << " <= " << b << " <= " << c;
        }
      }
    }
  }
}

// MARK: log formatting

LogArgument num(auto value) {
  return LogArgument::number(value);
}

TEST(TillLogFormat, ConversionsTakeTheArgumentsInOrder) {
  struct Case {
    const char* format;
    std::vector<LogArgument> arguments;
    const char* expected;
  };
  const std::vector<Case> cases{
      {"%@: took %.4f seconds for %ld records",
       {"Map", num(0.5), num(std::int64_t{12})},
       "Map: took 0.5000 seconds for 12 records"},
      {"%s|%d|%lu|%lld|%-4s|%x|%5.1f|%03d",
       {"a", num(-7), num(std::size_t{8}), num(9LL), "e", num(255), num(3.14159), num(4)},
       "a|-7|8|9|e|ff|  3.1|004"},
      {"(%@)", {"{\n    key = 1;\n}"}, "({\n    key = 1;\n})"},
      // Arguments are never scanned for conversions themselves.
      {"%@ and %@", {"%@ %s %% %n", "two"}, "%@ %s %% %n and two"},
      // "%@" and "%s" print a number plainly; other conversions convert it.
      {"%@ %s %@",
       {num(42), num(0.25), num(std::uint64_t{18446744073709551615ULL})},
       "42 0.25 18446744073709551615"},
      {"%d %f %.2e", {num(2.9), num(2), num(1500)}, "2 2.000000 1.50e+03"},
      {"%lu", {num(-1)}, "18446744073709551615"},
      // Text given where a number was meant is printed as it is.
      {"%ld / %.4f", {"many", "some"}, "many / some"},
      {"100%% done", {}, "100% done"},
      {"%%%@%%", {"x"}, "%x%"},
      {"%@ %@ %ld", {"only"}, "only (null) (null)"},
      {"%.4f", {}, "(null)"},
      {"just %@", {"one", "two"}, "just one"},
      // A '%' with no conversion after it is kept as text.
      {"ends with %", {"unused"}, "ends with %"},
      {"%.4", {"unused"}, "%.4"},
      {"", {"unused"}, ""},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(TillLogManager::formatMessage(c.format, c.arguments), c.expected) << c.format;
  }
}

TEST(TillLogFormat, LongTextIsCutAndSaysItsLength) {
  const std::string request(10 * 1024 * 1024, 'm');
  const std::string line = TillLogManager::formatMessage("dialog \"%@\" shown", {request});
  EXPECT_LT(line.size(), 3 * LogArgument::kMaxTextBytes);
  EXPECT_TRUE(line.starts_with("dialog \"mmmm")) << line.substr(0, 20);
  EXPECT_TRUE(line.ends_with("\u2026(10485760 bytes)\" shown")) << line.substr(line.size() - 40);
  // A cut never splits a character.
  std::string wide = "x";
  while (wide.size() <= LogArgument::kMaxTextBytes) wide += "\u00e9";
  const std::string cut = TillLogManager::formatMessage("%@", {wide});
  EXPECT_TRUE(cut.starts_with("x\u00e9"));
  EXPECT_NE(cut.find("\u00e9\u2026("), std::string::npos) << "ends on a whole character";
  EXPECT_EQ(TillLogManager::formatMessage("%@", {"short"}), "short");
}

// Arguments describe themselves; sinks get lines of the enabled levels
// while they are registered.
TEST(TillLogFormat, SinksGetTheEnabledLevelsWithTheArgumentsDescribed) {
  auto& log = TillLogManager::sharedManager();
  const int saved = log.level();
  std::vector<std::pair<int, std::string>> lines;
  {
    auto handle = log.addSink([&](int level, const std::string& line) {
      if (line.starts_with("t:")) lines.emplace_back(level, line);
    });
    log.setLevel(2);
    TILL_LOG(1, "t: %@ %@ %@ %.4f %lu", std::int64_t{-5}, true, std::string_view("text"),
             0.123456789, std::size_t{5});
    TILL_LOG(3, "t: three");
    TILL_LOG(2, "t: %@ %@ %@", std::optional<std::string>(), std::optional<std::int64_t>(42),
             std::shared_ptr<LedgerSoftwareProduct>());
    TILL_LOG(1, "t: %@", PlistValue(PlistDictionary{{"a", 1}, {"b", "x"}}));
    TILL_LOG(1, "t: %@", PlistValue(PlistArray{1, PlistArray{}}));
    TILL_LOG(1, "t: %@",
             std::make_shared<LedgerSoftwareProduct>(
                 LedgerSoftwareProductFields{.bundlePath = "/A.app", .bundleIdentifier = "com.a"}));
  }
  TILL_LOG(1, "t: after removal");
  log.setLevel(saved);
  using ::testing::Pair;
  EXPECT_THAT(
      lines,
      ::testing::ElementsAre(
          Pair(1, "t: -5 1 text 0.1235 5"), Pair(2, "t: (null) 42 (null)"),
          Pair(1, "t: {\n    a = 1;\n    b = \"x\";\n}"), Pair(1, "t: (\n    1,\n    (\n    )\n)"),
          Pair(1, ::testing::StartsWith("t: <LedgerSoftwareProduct: bundleIdentifier=com.a "))));
}

// MARK: product record

LedgerSoftwareProductFields completeFields() {
  LedgerSoftwareProductFields fields;
  fields.bundlePath = "/Applications/Ledger Test.app";
  fields.bundleIdentifier = "com.example.ledger";
  fields.bundleVersion = "3.1.4";
  fields.itemIdentifier = std::numeric_limits<std::uint64_t>::max() - 7;  // above INT64_MAX
  fields.versionIdentifier = -123456789012;
  fields.accountOpaqueID = "ACCOUNT-0001";
  fields.purchaseDate = PlistDate{1500000000.25};
  fields.installed = true;
  fields.source = LedgerSoftwareProduct::kSourceMetadataQuery;
  fields.isLegacyApp = true;
  fields.metadataChangeIsExpected = true;
  fields.expectedBundleVersion = "3.2";
  fields.expectedStoreVersion = 9001;
  return fields;
}

// Both forms, for a record with every field and one with the path alone:
// an absent field must stay absent, not come back as an empty value.
TEST(LedgerSoftwareProduct, BothFormsRoundTripEveryFieldButTheQueryHandle) {
  LedgerSoftwareProductFields full = completeFields();
  full.mdItemRef = 77;
  LedgerSoftwareProductFields sparse;
  sparse.bundlePath = "/Applications/Sparse.app";
  for (const LedgerSoftwareProductFields& fields : {full, sparse}) {
    SCOPED_TRACE(fields.bundlePath);
    LedgerSoftwareProductFields expected = fields;
    expected.mdItemRef = 0;
    PlistDictionary encoded = LedgerSoftwareProduct(fields).encodeWithCoder();
    EXPECT_EQ(KeyedArchive::classNameOf(encoded), LedgerSoftwareProduct::kClassName);
    EXPECT_FALSE(encoded.contains("mdItemRef"));
    // Through the bytes the store is made of.
    auto root = KeyedArchive::unarchivedRoot(KeyedArchive::archivedData(encoded),
                                             {std::string(LedgerSoftwareProduct::kClassName)});
    ASSERT_TRUE(root) << root.errorDescription();
    auto decoded = LedgerSoftwareProduct::initWithCoder(*root);
    ASSERT_NE(decoded, nullptr);
    EXPECT_EQ(decoded->snapshot(), expected) << decoded->description();

    PlistDictionary wire = LedgerSoftwareProduct(fields).toDictionary();
    EXPECT_FALSE(wire.contains("$class"));
    EXPECT_EQ(LedgerSoftwareProduct::fieldsFromDictionary(wire), expected);
    EXPECT_EQ(PlistValue(wire)["installed"], PlistValue(fields.installed));
    if (fields.bundleIdentifier) continue;
    for (const char* key :
         {"bundleIdentifier", "bundleVersion", "itemIdentifier", "versionIdentifier",
          "accountOpaqueID", "purchaseDate", "expectedBundleVersion", "expectedStoreVersion"}) {
      EXPECT_FALSE(wire.contains(key) || encoded.contains(key)) << key;
    }
  }
  PlistDictionary wire = LedgerSoftwareProduct(full).toDictionary();
  EXPECT_EQ(PlistValue(wire)["purchaseDate"], PlistValue(PlistDate{1500000000.25}));
  // Peers may send a date as seconds.
  wire["purchaseDate"] = 1500000000.25;
  EXPECT_EQ(LedgerSoftwareProduct::fieldsFromDictionary(wire).purchaseDate,
            PlistDate{1500000000.25});
  EXPECT_EQ(LedgerSoftwareProduct::fieldsFromDictionary({}), LedgerSoftwareProductFields{});
}

TEST(LedgerSoftwareProduct, DecodingRefusesRecordsThatAreNotOurs) {
  PlistDictionary good = LedgerSoftwareProduct(completeFields()).encodeWithCoder();
  ASSERT_NE(LedgerSoftwareProduct::initWithCoder(good), nullptr);

  struct WrongField {
    const char* key;
    PlistValue value;
  };
  // An absent value stands for a missing key.
  const std::vector<WrongField> wrongFields = {
      {"bundlePath", 5},
      {"bundleIdentifier", 5},
      {"bundleVersion", PlistArray{}},
      {"itemIdentifier", "12"},
      {"versionIdentifier", PlistDictionary{}},
      {"accountOpaqueID", 1.5},
      {"purchaseDate", "yesterday"},
      {"installed", "yes"},
      {"source", PlistData{1, 2}},
      {"expectedBundleVersion", true},
      {"expectedStoreVersion", "9001"},
      {"bundlePath", PlistValue()},
      {"bundlePath", ""},
      {"$class", "Evil"},
      {"$class", PlistValue()},
  };
  for (const WrongField& wrong : wrongFields) {
    PlistDictionary damaged = good;
    if (wrong.value.isNull()) {
      damaged.erase(wrong.key);
    } else {
      damaged[wrong.key] = wrong.value;
    }
    EXPECT_EQ(LedgerSoftwareProduct::initWithCoder(damaged), nullptr)
        << wrong.key << " " << describePlistValue(wrong.value);
  }
  EXPECT_EQ(LedgerSoftwareProduct::initWithCoder(PlistValue("LedgerSoftwareProduct")), nullptr);
}

}  // namespace
}  // namespace larder
