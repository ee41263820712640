#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "platform/metadata/MetadataAttributes.h"
#include "platform/plist/PropertyListSerialization.h"

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

class MetadataQueryBundleReading : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "larder-mdattr-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    folder_ = pattern;
    bundle_ = folder_ + "/Notes.app";
    fs::create_directories(bundle_);
  }
  void TearDown() override {
    std::error_code ignored;
    fs::remove_all(folder_, ignored);
  }

  void writeFile(const std::string& name, std::string_view contents) const {
    std::ofstream(bundle_ + "/" + name, std::ios::binary) << contents;
  }
  void writePlist(const std::string& name, const PlistDictionary& dictionary) const {
    writeFile(name, PropertyListSerialization::writeXml(PlistValue(dictionary)));
  }
  PlistDictionary read() const {
    std::optional<Attributes::Reading> reading = Attributes::readBundle(bundle_);
    EXPECT_TRUE(reading.has_value());
    return reading ? reading->attributes : PlistDictionary{};
  }

  std::string folder_;
  std::string bundle_;
};

TEST_F(MetadataQueryBundleReading, ReadsBothPropertyListsFromDisk) {
  writePlist("bundle.plist", bundleInfo());
  const PlistData binary = PropertyListSerialization::writeBinary(PlistValue(purchaseRecord()));
  writeFile("purchase.plist", std::string(binary.begin(), binary.end()));
  const std::optional<Attributes::Reading> reading = Attributes::readBundle(bundle_);
  ASSERT_TRUE(reading.has_value());
  EXPECT_TRUE(reading->hasInformationPropertyList);
  EXPECT_EQ(reading->attributes,
            Attributes::fromPropertyLists(bundle_, bundleInfo(), purchaseRecord()));
}

TEST_F(MetadataQueryBundleReading, DamagedFilesCountAsAbsent) {
  writeFile("bundle.plist", "<?xml version=\"1.0\"?><plist><dict><key>");
  writeFile("purchase.plist", "");
  const std::optional<Attributes::Reading> reading = Attributes::readBundle(bundle_);
  ASSERT_TRUE(reading.has_value());
  EXPECT_FALSE(reading->hasInformationPropertyList);
  EXPECT_EQ(valueOf(reading->attributes, Attributes::kHasPurchaseRecord), PlistValue(0));
  EXPECT_EQ(valueOf(reading->attributes, Attributes::kPath), PlistValue(bundle_));
}

TEST_F(MetadataQueryBundleReading, PipeInPlaceOfAPlistDoesNotBlock) {
  ASSERT_EQ(::mkfifo((bundle_ + "/purchase.plist").c_str(), 0644), 0);
  writePlist("bundle.plist", bundleInfo());
  EXPECT_EQ(valueOf(read(), Attributes::kHasPurchaseRecord), PlistValue(0));
}

TEST_F(MetadataQueryBundleReading, FolderOrDanglingLinkInPlaceOfAPlist) {
  fs::create_directories(bundle_ + "/purchase.plist");
  fs::create_symlink(bundle_ + "/nowhere.plist", bundle_ + "/bundle.plist");
  const PlistDictionary attributes = read();
  EXPECT_EQ(valueOf(attributes, Attributes::kHasPurchaseRecord), PlistValue(0));
  EXPECT_TRUE(valueOf(attributes, Attributes::kBundleIdentifier).isNull());
}

TEST_F(MetadataQueryBundleReading, OversizedPlistIsNotRead) {
  PlistDictionary huge = purchaseRecord();
  huge["padding"] = std::string(Attributes::kMaxSourceFileBytes, 'x');
  writePlist("purchase.plist", huge);
  EXPECT_EQ(valueOf(read(), Attributes::kHasPurchaseRecord), PlistValue(0));
}

TEST_F(MetadataQueryBundleReading, NotAFolderIsNoBundle) {
  EXPECT_FALSE(Attributes::readBundle(folder_ + "/Missing.app").has_value());
  std::ofstream(folder_ + "/File.app") << "x";
  EXPECT_FALSE(Attributes::readBundle(folder_ + "/File.app").has_value());
  fs::create_symlink(folder_ + "/Loop.app", folder_ + "/Loop.app");
  EXPECT_FALSE(Attributes::readBundle(folder_ + "/Loop.app").has_value());
}

}  // namespace
}  // namespace larder
