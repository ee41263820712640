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

// Checks a < b in both directions, so that a comparison that ignores its
// argument order cannot pass.
void expectLess(std::string_view a, std::string_view b) {
  EXPECT_LT(compareVersionStrings(a, b), 0) << '"' << a << "\" < \"" << b << '"';
  EXPECT_GT(compareVersionStrings(b, a), 0) << '"' << b << "\" > \"" << a << '"';
}

void expectSame(std::string_view a, std::string_view b) {
  EXPECT_EQ(compareVersionStrings(a, b), 0) << '"' << a << "\" == \"" << b << '"';
  EXPECT_EQ(compareVersionStrings(b, a), 0) << '"' << b << "\" == \"" << a << '"';
}

TEST(CompareVersionStrings, DigitRunsCompareAsNumbers) {
  expectLess("1.9", "1.10");
  expectLess("1.2.9", "1.2.10");
  expectLess("9", "10");
  expectLess("2.99", "10.0");
  expectLess("1.0.9", "1.1");
  // Runs longer than any machine integer still compare by value.
  expectLess("1.99999999999999999999998", "1.99999999999999999999999");
  expectLess("99999999999999999999", "100000000000000000000");
  expectSame("4.5.6", "4.5.6");
}

TEST(CompareVersionStrings, LeadingZerosDoNotCount) {
  expectSame("1.01", "1.1");
  expectSame("007", "7");
  expectSame("1.000", "1.0");
  expectSame("0", "000");
  expectLess("1.09", "1.10");
  expectLess("1.009", "1.9.1");
}

TEST(CompareVersionStrings, MissingComponentsAndEmptyStrings) {
  // A version that continues where the other ends is the greater one.
  expectLess("1.0", "1.0.0");
  expectLess("1", "1.0");
  expectLess("", "0");
  expectLess("", "1.0");
  expectSame("", "");
}

TEST(CompareVersionStrings, LettersCompareByCharacter) {
  expectLess("1.0a", "1.0b");
  expectLess("1.0", "1.0a");
  expectLess("1.0b2", "1.0b10");
  expectLess("2.0 beta", "2.0 gamma");
  // A digit sorts before a letter in the same position.
  expectLess("1.1", "1.a");
  expectLess("Z", "a");
  // Bytes above 127 compare as unsigned.
  expectLess("1.0z", "1.0\xC3\xA9");
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
  std::vector<std::string> sorted = versions;
  std::sort(sorted.begin(), sorted.end(), [](const std::string& a, const std::string& b) {
    return compareVersionStrings(a, b) < 0;
  });
  auto before = [&](const std::string& a, const std::string& b) {
    return std::find(sorted.begin(), sorted.end(), a) < std::find(sorted.begin(), sorted.end(), b);
  };
  EXPECT_TRUE(before("1.9", "1.10"));
  EXPECT_TRUE(before("1.10", "10"));
  EXPECT_TRUE(before("2", "10.0.1"));
}

// MARK: log formatting

LogArgument num(auto value) {
  return LogArgument::number(value);
}

TEST(TillLogFormat, ConversionsTakeTheArgumentsInOrder) {
  using Log = TillLogManager;
  EXPECT_EQ(Log::formatMessage("%@: took %.4f seconds for %ld records",
                               {"Map", num(0.5), num(std::int64_t{12})}),
            "Map: took 0.5000 seconds for 12 records");
  EXPECT_EQ(Log::formatMessage(
                "%s|%d|%lu|%lld|%-4s|%x|%5.1f|%03d",
                {"a", num(-7), num(std::size_t{8}), num(9LL), "e", num(255), num(3.14159), num(4)}),
            "a|-7|8|9|e|ff|  3.1|004");
  EXPECT_EQ(Log::formatMessage("(%@)", {"{\n    key = 1;\n}"}), "({\n    key = 1;\n})");
  // Arguments are never scanned for conversions themselves.
  EXPECT_EQ(Log::formatMessage("%@ and %@", {"%@ %s %% %n", "two"}), "%@ %s %% %n and two");
}

TEST(TillLogFormat, NumbersFollowTheConversionTextFollowsItself) {
  using Log = TillLogManager;
  // "%@" and "%s" print a number plainly.
  EXPECT_EQ(Log::formatMessage("%@ %s %@",
                               {num(42), num(0.25), num(std::uint64_t{18446744073709551615ULL})}),
            "42 0.25 18446744073709551615");
  // A number converts as the conversion asks.
  EXPECT_EQ(Log::formatMessage("%d %f %.2e", {num(2.9), num(2), num(1500)}), "2 2.000000 1.50e+03");
  EXPECT_EQ(Log::formatMessage("%lu", {num(-1)}), "18446744073709551615");
  // Text given where a number was meant is printed as it is.
  EXPECT_EQ(Log::formatMessage("%ld / %.4f", {"many", "some"}), "many / some");
}

TEST(TillLogFormat, PercentSignsAndMissingArguments) {
  using Log = TillLogManager;
  EXPECT_EQ(Log::formatMessage("100%% done", {}), "100% done");
  EXPECT_EQ(Log::formatMessage("%%%@%%", {"x"}), "%x%");
  EXPECT_EQ(Log::formatMessage("%@ %@ %ld", {"only"}), "only (null) (null)");
  EXPECT_EQ(Log::formatMessage("%.4f", {}), "(null)");
  // Extra arguments are left out.
  EXPECT_EQ(Log::formatMessage("just %@", {"one", "two"}), "just one");
  // A '%' with no conversion after it is kept as text.
  EXPECT_EQ(Log::formatMessage("ends with %", {"unused"}), "ends with %");
  EXPECT_EQ(Log::formatMessage("%.4", {"unused"}), "%.4");
  EXPECT_EQ(Log::formatMessage("", {"unused"}), "");
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

TEST(TillLogFormat, LoggedArgumentsDescribeThemselves) {
  auto& log = TillLogManager::sharedManager();
  int saved = log.level();
  log.setLevel(1);
  std::vector<std::string> lines;
  {
    auto handle = log.addSink([&](int, const std::string& line) {
      if (line.starts_with("describe:")) lines.push_back(line);
    });
    TILL_LOG(1, "describe: %@ %@ %@ %.4f %lu", std::int64_t{-5}, true, std::string_view("text"),
             0.123456789, std::size_t{5});
    TILL_LOG(1, "describe: %@ %@ %@", std::optional<std::string>(), std::optional<std::int64_t>(42),
             std::shared_ptr<LedgerSoftwareProduct>());
    TILL_LOG(1, "describe: %@", PlistValue(PlistDictionary{{"a", 1}, {"b", "x"}}));
    TILL_LOG(1, "describe: %@", PlistValue(PlistArray{1, PlistArray{}}));
    TILL_LOG(1, "describe: %@",
             std::make_shared<LedgerSoftwareProduct>(
                 LedgerSoftwareProductFields{.bundlePath = "/A.app", .bundleIdentifier = "com.a"}));
  }
  log.setLevel(saved);
  EXPECT_THAT(
      lines,
      ::testing::ElementsAre(
          "describe: -5 1 text 0.1235 5", "describe: (null) 42 (null)",
          "describe: {\n    a = 1;\n    b = \"x\";\n}", "describe: (\n    1,\n    (\n    )\n)",
          ::testing::StartsWith("describe: <LedgerSoftwareProduct: bundleIdentifier=com.a ")));
}

TEST(TillLogFormat, SinksReceiveLinesAtEnabledLevelsOnly) {
  auto& log = TillLogManager::sharedManager();
  int saved = log.level();
  std::vector<std::pair<int, std::string>> received;
  {
    auto handle = log.addSink(
        [&](int level, const std::string& line) { received.emplace_back(level, line); });
    log.setLevel(2);
    TILL_LOG(1, "%@ one %ld", "sink-test", 1);
    TILL_LOG(3, "%@ three", "sink-test");
    TILL_LOG(2, "%@ two", "sink-test");
  }
  TILL_LOG(1, "%@ after removal", "sink-test");
  log.setLevel(saved);
  std::vector<std::pair<int, std::string>> ours;
  for (const auto& entry : received) {
    if (entry.second.starts_with("sink-test")) ours.push_back(entry);
  }
  EXPECT_THAT(ours, ::testing::ElementsAre(std::pair<int, std::string>{1, "sink-test one 1"},
                                           std::pair<int, std::string>{2, "sink-test two"}));
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

TEST(LedgerSoftwareProduct, ArchiveRoundTripKeepsEveryFieldButTheQueryHandle) {
  LedgerSoftwareProductFields full = completeFields();
  full.mdItemRef = 77;
  LedgerSoftwareProductFields sparse;
  sparse.bundlePath = "/Applications/Sparse.app";
  for (const LedgerSoftwareProductFields& fields : {full, sparse}) {
    PlistDictionary encoded = LedgerSoftwareProduct(fields).encodeWithCoder();
    EXPECT_EQ(KeyedArchive::classNameOf(encoded), LedgerSoftwareProduct::kClassName);
    EXPECT_FALSE(encoded.contains("mdItemRef"));
    // Through the bytes the store is made of.
    PlistData bytes = KeyedArchive::archivedData(encoded);
    auto root =
        KeyedArchive::unarchivedRoot(bytes, {std::string(LedgerSoftwareProduct::kClassName)});
    ASSERT_TRUE(root) << root.errorDescription();
    auto decoded = LedgerSoftwareProduct::initWithCoder(*root);
    ASSERT_NE(decoded, nullptr);
    LedgerSoftwareProductFields expected = fields;
    expected.mdItemRef = 0;
    EXPECT_EQ(decoded->snapshot(), expected) << decoded->description();
  }
}

TEST(LedgerSoftwareProduct, AbsentFieldsAreAbsentInBothForms) {
  LedgerSoftwareProductFields sparse;
  sparse.bundlePath = "/Applications/Sparse.app";
  LedgerSoftwareProduct product(sparse);
  for (const PlistDictionary& form : {product.toDictionary(), product.encodeWithCoder()}) {
    for (const char* key :
         {"bundleIdentifier", "bundleVersion", "itemIdentifier", "versionIdentifier",
          "accountOpaqueID", "purchaseDate", "expectedBundleVersion", "expectedStoreVersion"}) {
      EXPECT_FALSE(form.contains(key)) << key;
    }
    EXPECT_EQ(PlistValue(form)["bundlePath"], PlistValue("/Applications/Sparse.app"));
    EXPECT_EQ(PlistValue(form)["installed"], PlistValue(false));
  }
  EXPECT_FALSE(product.toDictionary().contains("$class"));
}

TEST(LedgerSoftwareProduct, WireFormRoundTrip) {
  LedgerSoftwareProductFields fields = completeFields();
  PlistDictionary wire = LedgerSoftwareProduct(fields).toDictionary();
  EXPECT_EQ(PlistValue(wire)["bundleVersion"], PlistValue("3.1.4"));
  EXPECT_EQ(PlistValue(wire)["purchaseDate"], PlistValue(PlistDate{1500000000.25}));
  EXPECT_EQ(LedgerSoftwareProduct::fieldsFromDictionary(wire), fields);

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
  const std::vector<WrongField> wrongTypes = {
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
  };
  for (const WrongField& wrong : wrongTypes) {
    PlistDictionary damaged = good;
    damaged[wrong.key] = wrong.value;
    EXPECT_EQ(LedgerSoftwareProduct::initWithCoder(damaged), nullptr) << wrong.key;
  }

  PlistDictionary pathless = good;
  pathless.erase("bundlePath");
  EXPECT_EQ(LedgerSoftwareProduct::initWithCoder(pathless), nullptr);
  pathless["bundlePath"] = "";
  EXPECT_EQ(LedgerSoftwareProduct::initWithCoder(pathless), nullptr);

  PlistDictionary otherClass = good;
  otherClass["$class"] = "Evil";
  EXPECT_EQ(LedgerSoftwareProduct::initWithCoder(otherClass), nullptr);
  PlistDictionary classless = good;
  classless.erase("$class");
  EXPECT_EQ(LedgerSoftwareProduct::initWithCoder(classless), nullptr);
  EXPECT_EQ(LedgerSoftwareProduct::initWithCoder(PlistValue("LedgerSoftwareProduct")), nullptr);
}

TEST(LedgerSoftwareProduct, UpdatesAreSeenThroughEverySharedReference) {
  auto product = std::make_shared<LedgerSoftwareProduct>(completeFields());
  std::shared_ptr<LedgerSoftwareProduct> alias = product;
  product->update([](LedgerSoftwareProductFields& fields) { fields.bundleVersion = "4.0"; });
  EXPECT_EQ(alias->bundleVersion(), "4.0");
  EXPECT_EQ(alias->bundlePath(), "/Applications/Ledger Test.app");
  EXPECT_EQ(alias->itemIdentifier(), std::numeric_limits<std::uint64_t>::max() - 7);
  EXPECT_THAT(alias->description(),
              ::testing::AllOf(::testing::HasSubstr("bundleIdentifier=com.example.ledger"),
                               ::testing::HasSubstr("bundleVersion=4.0"),
                               ::testing::HasSubstr("bundlePath=/Applications/Ledger Test.app")));
}

}  // namespace
}  // namespace larder
