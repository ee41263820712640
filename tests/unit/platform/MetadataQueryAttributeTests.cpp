#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>

#include "platform/metadata/MetadataAttributes.h"
#include "platform/plist/PropertyListSerialization.h"
#include "tests/unit/platform/TemporaryFolderTest.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using Attributes = MetadataAttributes;

const PlistValue& valueOf(const PlistDictionary& attributes, std::string_view name) {
  auto found = attributes.find(name);
  return found == attributes.end() ? PlistValue::null() : found->second;
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

TEST(MetadataQueryAttributes, StoreBundleGivesEveryAttribute) {
  const PlistDictionary attributes =
      Attributes::fromPropertyLists("/A/Notes.app", bundleInfo(), purchaseRecord());
  EXPECT_EQ(valueOf(attributes, Attributes::kPath), PlistValue("/A/Notes.app"));
  EXPECT_EQ(valueOf(attributes, Attributes::kContentType),
            PlistValue("com.orvane.application-bundle"));
  EXPECT_EQ(valueOf(attributes, Attributes::kBundleIdentifier), PlistValue("com.example.Notes"));
  EXPECT_EQ(valueOf(attributes, Attributes::kVersion), PlistValue("2.1"));
  EXPECT_EQ(valueOf(attributes, Attributes::kIsDeveloperSigned), PlistValue(0));
  EXPECT_EQ(valueOf(attributes, Attributes::kHasPurchaseRecord), PlistValue(1));
  EXPECT_TRUE(valueOf(attributes, Attributes::kWareID).isReal());
  EXPECT_EQ(valueOf(attributes, Attributes::kWareID).doubleValue(), 401000001.0);
  EXPECT_EQ(valueOf(attributes, Attributes::kInstallerVersionID), PlistValue(7));
  EXPECT_EQ(valueOf(attributes, Attributes::kAccountReference), PlistValue("account-1"));
  EXPECT_EQ(valueOf(attributes, Attributes::kPurchaseDate), PlistValue(PlistDate{1600000000}));
}

TEST(MetadataQueryAttributes, VersionFallsBackToBundleVersion) {
  PlistDictionary info = bundleInfo();
  info.erase("HostBundleShortVersionString");
  EXPECT_EQ(valueOf(Attributes::fromPropertyLists("/A/N.app", info, {}), Attributes::kVersion),
            PlistValue("210"));
  info["HostBundleShortVersionString"] = "";
  EXPECT_EQ(valueOf(Attributes::fromPropertyLists("/A/N.app", info, {}), Attributes::kVersion),
            PlistValue("210"));
  info["HostBundleShortVersionString"] = 3;
  EXPECT_EQ(valueOf(Attributes::fromPropertyLists("/A/N.app", info, {}), Attributes::kVersion),
            PlistValue("210"));
}

TEST(MetadataQueryAttributes, NoPurchaseRecordGivesOnlyTheFlag) {
  for (const PlistValue& purchase : {PlistValue(), PlistValue(PlistArray{1, 2}), PlistValue("x")}) {
    const PlistDictionary attributes =
        Attributes::fromPropertyLists("/A/N.app", bundleInfo(), purchase);
    EXPECT_EQ(valueOf(attributes, Attributes::kHasPurchaseRecord), PlistValue(0));
    EXPECT_TRUE(valueOf(attributes, Attributes::kWareID).isNull());
    EXPECT_TRUE(valueOf(attributes, Attributes::kInstallerVersionID).isNull());
    EXPECT_TRUE(valueOf(attributes, Attributes::kAccountReference).isNull());
    EXPECT_TRUE(valueOf(attributes, Attributes::kPurchaseDate).isNull());
  }
}

TEST(MetadataQueryAttributes, IdentifiersWrittenAsTextAreRead) {
  PlistDictionary purchase = purchaseRecord();
  purchase["wareID"] = "401000002";
  purchase["installerVersionID"] = "12";
  PlistDictionary attributes = Attributes::fromPropertyLists("/A/N.app", {}, purchase);
  EXPECT_EQ(valueOf(attributes, Attributes::kWareID), PlistValue(401000002.0));
  EXPECT_EQ(valueOf(attributes, Attributes::kInstallerVersionID), PlistValue(12));

  purchase["wareID"] = "12abc";
  purchase["installerVersionID"] = PlistData{1, 2};
  attributes = Attributes::fromPropertyLists("/A/N.app", {}, purchase);
  EXPECT_TRUE(valueOf(attributes, Attributes::kWareID).isNull());
  EXPECT_TRUE(valueOf(attributes, Attributes::kInstallerVersionID).isNull());
  EXPECT_EQ(valueOf(attributes, Attributes::kHasPurchaseRecord), PlistValue(1));
}

TEST(MetadataQueryAttributes, WrongTypesAreAbsent) {
  const PlistDictionary info{{"HostBundleIdentifier", 5}, {"HostBundleVersion", PlistArray{}}};
  const PlistDictionary purchase{{"opaqueAccountIDString", 9}, {"purchaseDate", "yesterday"}};
  const PlistDictionary attributes = Attributes::fromPropertyLists("/A/N.app", info, purchase);
  EXPECT_TRUE(valueOf(attributes, Attributes::kBundleIdentifier).isNull());
  EXPECT_TRUE(valueOf(attributes, Attributes::kVersion).isNull());
  EXPECT_TRUE(valueOf(attributes, Attributes::kAccountReference).isNull());
  EXPECT_TRUE(valueOf(attributes, Attributes::kPurchaseDate).isNull());
}

TEST(MetadataQueryAttributes, DeveloperSignedOnlyWhenTrue) {
  auto signedValue = [](PlistValue flag) {
    PlistDictionary info = bundleInfo();
    info["HostBundleDeveloperSigned"] = std::move(flag);
    return valueOf(Attributes::fromPropertyLists("/A/N.app", info, {}),
                   Attributes::kIsDeveloperSigned);
  };
  EXPECT_EQ(signedValue(true), PlistValue(1));
  EXPECT_EQ(signedValue(false), PlistValue(0));
  EXPECT_EQ(signedValue("YES"), PlistValue(0));
  EXPECT_EQ(signedValue(PlistValue()), PlistValue(0));
}

TEST(MetadataQueryAttributes, ContentTypeOnlyForBundleFolders) {
  EXPECT_TRUE(valueOf(Attributes::fromPropertyLists("/A/Notes", {}, {}), Attributes::kContentType)
                  .isNull());
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

TEST_F(MetadataQueryBundleReading, ReadsBothPropertyListsFromDisk) {
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

TEST_F(MetadataQueryBundleReading, NotAFolderIsNoBundle) {
  EXPECT_FALSE(Attributes::readBundle(base_ + "/Missing.app").has_value());
  std::ofstream(base_ + "/File.app") << "x";
  EXPECT_FALSE(Attributes::readBundle(base_ + "/File.app").has_value());
  fs::create_symlink(base_ + "/Loop.app", base_ + "/Loop.app");
  EXPECT_FALSE(Attributes::readBundle(base_ + "/Loop.app").has_value());
}

}  // namespace
}  // namespace larder
