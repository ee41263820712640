#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>

#include "platform/metadata/MetadataAttributes.h"
#include "platform/plist/PropertyListSerialization.h"
#include "tests/unit/platform/TemporaryFolderTest.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using Attributes = MetadataAttributes;

// The attributes named in `expected` ("Version=... WareID=...", without the common prefix), in
// the same form: absent ones as "-", reals and dates marked, so that a wrong kind shows.
std::string described(const PlistDictionary& attributes, std::string_view expected) {
  std::string text;
  std::istringstream names{std::string(expected)};
  for (std::string word; names >> word;) {
    const std::string name = word.substr(0, word.find('='));
    const std::string key = (name.starts_with("_") ? "_kHostItem" : "kHostItem") +
                            (name.starts_with("_") ? name.substr(1) : name);
    const auto found = attributes.find(key);
    const PlistValue& value = found == attributes.end() ? PlistValue::null() : found->second;
    text += (text.empty() ? "" : " ") + name + "=";
    if (value.isNull())
      text += "-";
    else if (value.string())
      text += *value.string();
    else if (value.isReal())
      text += "real:" + std::to_string(value.int64Value());
    else if (value.date())
      text += "date:" + std::to_string(std::int64_t(value.date()->secondsSince1970));
    else
      text += std::to_string(value.int64Value());
  }
  return text;
}

PlistDictionary purchaseRecord() {
  return {{"bundleIdentifier", "com.example.Notes"}, {"bundleVersion", "2.1"},
          {"wareID", std::int64_t{401000001}},       {"installerVersionID", std::int64_t{7}},
          {"opaqueAccountIDString", "account-1"},    {"purchaseDate", PlistDate{1600000000}}};
}

PlistDictionary bundleInfo() {
  return {{"HostBundleIdentifier", "com.example.Notes"},
          {"HostBundleShortVersionString", "2.1"},
          {"HostBundleVersion", "210"}};
}

PlistDictionary with(PlistDictionary base, const PlistDictionary& changes) {
  for (const auto& [key, value] : changes) base[key] = value;
  return base;
}

TEST(MetadataQueryAttributes, ComeFromTheBundleInformationAndThePurchaseRecord) {
  const char* const noPurchase =
      "QuaymartHasPurchaseRecord=0 QuaymartWareID=- QuaymartInstallerVersionID=- "
      "_QuaymartRefID=- QuaymartPurchaseDate=-";
  PlistDictionary noShortVersion = bundleInfo();
  noShortVersion.erase("HostBundleShortVersionString");
  const auto signedBy = [](PlistValue flag) {
    return with(bundleInfo(), {{"HostBundleDeveloperSigned", std::move(flag)}});
  };
  const auto version = [](PlistValue text) {
    return with(bundleInfo(), {{"HostBundleShortVersionString", std::move(text)}});
  };
  struct Case {
    const char* name;
    PlistValue info;
    PlistValue purchase;
    std::string expected;
    std::string path = "/A/N.app";
  };
  const std::vector<Case> cases{
      {"store bundle", bundleInfo(), purchaseRecord(),
       "Path=/A/Notes.app ContentType=com.orvane.application-bundle "
       "HostBundleIdentifier=com.example.Notes Version=2.1 QuaymartIsDeveloperSigned=0 "
       "QuaymartHasPurchaseRecord=1 QuaymartWareID=real:401000001 "
       "QuaymartInstallerVersionID=7 _QuaymartRefID=account-1 QuaymartPurchaseDate=date:1600000000",
       "/A/Notes.app"},
      {"no short version", noShortVersion, {}, "Version=210"},
      {"empty short version", version(""), {}, "Version=210"},
      {"short version a number", version(3), {}, "Version=210"},
      {"no purchase record", bundleInfo(), {}, noPurchase},
      {"purchase record an array", bundleInfo(), PlistArray{1, 2}, noPurchase},
      {"purchase record a string", bundleInfo(), "x", noPurchase},
      {"identifiers written as text",
       {},
       with(purchaseRecord(), {{"wareID", "401000002"}, {"installerVersionID", "12"}}),
       "QuaymartWareID=real:401000002 QuaymartInstallerVersionID=12"},
      {"identifiers that are no numbers",
       {},
       with(purchaseRecord(), {{"wareID", "12abc"}, {"installerVersionID", PlistData{1, 2}}}),
       "QuaymartWareID=- QuaymartInstallerVersionID=- QuaymartHasPurchaseRecord=1"},
      {"wrong types",
       PlistDictionary{{"HostBundleIdentifier", 5}, {"HostBundleVersion", PlistArray{}}},
       PlistDictionary{{"opaqueAccountIDString", 9}, {"purchaseDate", "yesterday"}},
       "HostBundleIdentifier=- Version=- _QuaymartRefID=- QuaymartPurchaseDate=-"},
      {"developer signed", signedBy(true), {}, "QuaymartIsDeveloperSigned=1"},
      {"signed false", signedBy(false), {}, "QuaymartIsDeveloperSigned=0"},
      {"signed as text", signedBy("YES"), {}, "QuaymartIsDeveloperSigned=0"},
      {"not a bundle folder", {}, {}, "ContentType=-", "/A/Notes"},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(described(Attributes::fromPropertyLists(c.path, c.info, c.purchase), c.expected),
              c.expected)
        << c.name;
  }
  EXPECT_FALSE(Attributes::isBundleName(".app"));
  EXPECT_TRUE(Attributes::isBundleName("x.app"));
  EXPECT_FALSE(Attributes::isBundleName("x.apps"));
}

class MetadataQueryBundleReading : public TemporaryFolderTest {
 protected:
  static void writeFile(const std::string& path, std::string_view contents) {
    std::ofstream(path, std::ios::binary) << contents;
  }
};

TEST_F(MetadataQueryBundleReading, ReadsBothPropertyListsOfAFolderFromDisk) {
  const std::string bundle = base_ + "/Notes.app";
  fs::create_directories(bundle);
  writeFile(bundle + "/bundle.plist", PropertyListSerialization::writeXml(bundleInfo()));
  const PlistData binary = PropertyListSerialization::writeBinary(PlistValue(purchaseRecord()));
  writeFile(bundle + "/purchase.plist", std::string(binary.begin(), binary.end()));
  const std::optional<Attributes::Reading> reading = Attributes::readBundle(bundle);
  ASSERT_TRUE(reading.has_value());
  EXPECT_TRUE(reading->hasInformationPropertyList);
  EXPECT_EQ(reading->attributes,
            Attributes::fromPropertyLists(bundle, bundleInfo(), purchaseRecord()));
  EXPECT_FALSE(Attributes::readBundle(base_ + "/Missing.app").has_value());
  std::ofstream(base_ + "/File.app") << "x";
  EXPECT_FALSE(Attributes::readBundle(base_ + "/File.app").has_value());
  fs::create_symlink(base_ + "/Loop.app", base_ + "/Loop.app");
  EXPECT_FALSE(Attributes::readBundle(base_ + "/Loop.app").has_value());
}

// Every kind of damage, tried on each of the two files: the damaged one
// counts as absent, the other is read all the same, and nothing blocks.
TEST_F(MetadataQueryBundleReading, DamagedFilesCountAsAbsent) {
  using Damage = std::function<void(const std::string& path, const PlistDictionary& contents)>;
  const std::vector<std::pair<const char*, Damage>> damages{
      {"truncated",
       [](const std::string& path, const PlistDictionary&) {
         writeFile(path, "<?xml version=\"1.0\"?><plist><dict><key>");
       }},
      {"empty", [](const std::string& path, const PlistDictionary&) { writeFile(path, ""); }},
      {"pipe", [](const std::string& path,
                  const PlistDictionary&) { ASSERT_EQ(::mkfifo(path.c_str(), 0644), 0); }},
      {"folder",
       [](const std::string& path, const PlistDictionary&) { fs::create_directories(path); }},
      {"dangling link",
       [](const std::string& path, const PlistDictionary&) {
         fs::create_symlink(path + ".nowhere", path);
       }},
      {"oversized",
       [](const std::string& path, const PlistDictionary& contents) {
         PlistDictionary huge = contents;
         huge["padding"] = std::string(Attributes::kMaxSourceFileBytes, 'x');
         writeFile(path, PropertyListSerialization::writeXml(huge));
       }},
  };
  int count = 0;
  for (const auto& [name, damage] : damages) {
    for (const bool damageInformation : {true, false}) {
      SCOPED_TRACE(std::string(name) + (damageInformation ? " bundle.plist" : " purchase.plist"));
      const std::string bundle = base_ + "/" + std::to_string(++count) + ".app";
      fs::create_directories(bundle);
      // What reading should see: nothing in place of the damaged file.
      const PlistValue info = damageInformation ? PlistValue() : PlistValue(bundleInfo());
      const PlistValue purchase = damageInformation ? PlistValue(purchaseRecord()) : PlistValue();
      if (damageInformation) {
        damage(bundle + "/bundle.plist", bundleInfo());
        writeFile(bundle + "/purchase.plist", PropertyListSerialization::writeXml(purchase));
      } else {
        writeFile(bundle + "/bundle.plist", PropertyListSerialization::writeXml(info));
        damage(bundle + "/purchase.plist", purchaseRecord());
      }
      const std::optional<Attributes::Reading> reading = Attributes::readBundle(bundle);
      ASSERT_TRUE(reading.has_value());
      EXPECT_EQ(reading->hasInformationPropertyList, !damageInformation);
      EXPECT_EQ(reading->attributes, Attributes::fromPropertyLists(bundle, info, purchase));
    }
  }
}

}  // namespace
}  // namespace larder
