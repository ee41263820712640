// One realistic document for every top-level code. The test checks that each
// decodes to the kind of result its code promises; with LARDER_DMAP_SEED_DIR
// set it also writes them there, which is how fuzz/corpus/dmap/ was made:
//   LARDER_DMAP_SEED_DIR=fuzz/corpus/dmap larder_dmap_tests --gtest_filter='DAAPSeed*'

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "DAAPProtocolTables.h"
#include "DAAPTestSupport.h"
#include "dmap/DAAPItem.h"

namespace larder {
namespace {

using namespace dmaptest;  // NOLINT(google-build-using-namespace)

Tag bookItem(std::uint32_t identifier) {
  return container(
      "mlit", {u32("miid", identifier),
               text("minm", "A Tale of Two Harbours"),
               text("asar", "J. Doe"),
               text("asal", "Harbours"),
               u64("asai", 0x1122334455667788ULL),
               u8("mikd", 2),
               text("asgn", "Fiction"),
               text("assn", "Tale of Two Harbours"),
               u32("asdp", 1600000000),
               u64("aepv", 3),
               text("aePd", "1.2"),
               u32("aeto", 0xfeedbeef),
               u32("aeMk", 8),
               u64("aeSI", 987654321),
               text("aeCa", "https://art.example/{w}x{h}.jpg"),
               u32("ajEd", 1700000000),
               u32("aeCS", 4242),
               u64("mper", 0x0a0b0c0d0e0f1011ULL),
               container("aefl", {container("aeif", {u32("aefd", 1), text("asfm", "epub"),
                                                     u64("asls", 1048576), text("aeRp", "p=1")})}),
               container("mdcl", {text("mdky", "custom"), text("mdvl", "value")}),
               u16("cmvt", 3),
               u32("cval", 5),
               raw("mshc", {0, 'A'})});
}

std::vector<std::pair<std::string, Tag>> seedDocuments() {
  std::vector<std::pair<std::string, Tag>> seeds;
  for (const char* code : {"abro", "adbs", "aeBR", "agal", "agar", "aply", "apso", "avdb", "caci",
                           "cmbu", "cprp", "mctl", "mscr", "mupd"}) {
    seeds.emplace_back(
        code, container(code, {u32("mstt", 200), u8("muty", 0), u32("mtco", 2), u32("mrco", 2),
                               u32("musr", 17), container("mlcl", {bookItem(1), bookItem(2)}),
                               container("mudl", {u64("mild", 99)}),
                               container("abgn", {text("mlit", "Fiction")})}));
  }
  seeds.emplace_back("cacr", container("cacr", {u32("miid", 5), text("minm", "x")}));
  seeds.emplace_back("medc", container("medc", bookItem(6).children));
  seeds.emplace_back(
      "casp",
      container("casp", {u32("mstt", 200),
                         container("mdcl", {text("minm", "Kitchen"), u64("msma", 0x1b638445e6),
                                            u8("caia", 1), u32("cmvo", 50)})}));
  seeds.emplace_back(
      "ceGI",
      container("ceGI", {container("mlit", {u32("miid", 7), container("cmvl", {bookItem(8)})})}));
  seeds.emplace_back(
      "cmcp",
      container("cmcp",
                {u32("mstt", 200), u32("miid", 9),
                 container("mdcl", {text("cmca", "a"), text("cmcv", "v"), text("cmce", "n")})}));
  std::vector<Tag> dacp = everyTagOf(kDACPPropertyTags);
  dacp.push_back(raw("canp", PlistData(16, 1)));
  dacp.push_back(u8("ceQu", 1));
  dacp.push_back(text("ceSD",
                      "<plist version=\"1.0\"><dict><key>id</key><string>1</string>"
                      "</dict></plist>"));
  seeds.emplace_back("cmgt", container("cmgt", dacp));
  seeds.emplace_back("cmst", container("cmst", dacp));
  seeds.emplace_back(
      "mccr", container("mccr", {u32("mstt", 200), container("mdcl", {u32("mcnm", 0x6d696964),
                                                                      text("mcna", "dmap.itemid"),
                                                                      u16("mcty", 5)})}));
  seeds.emplace_back("merr", container("merr", {u32("mstt", 503), u32("aeRC", 60)}));
  seeds.emplace_back("mlog", container("mlog", {u32("mstt", 200), u32("mlid", 1234)}));
  std::vector<Tag> info = everyTagOf(kServerInfoTags);
  info.push_back(container("msml", {u64("msma", 1)}));
  seeds.emplace_back("msrv", container("msrv", info));
  seeds.emplace_back("arsv", container("arsv", {u32("mstt", 200)}));
  return seeds;
}

TEST(DAAPSeedCorpusTest, EveryTopLevelCodeHasADocumentThatDecodesToItsKind) {
  const std::vector<std::pair<std::string, Tag>> seeds = seedDocuments();
  EXPECT_EQ(seeds.size(), 26u);
  for (const auto& [name, top] : seeds) {
    const DAAPValue value = decode(top);
    if (name == "arsv") {
      EXPECT_TRUE(value.isNull());
    } else if (name == "cacr" || name == "medc") {
      EXPECT_TRUE(value.isItem()) << name;
    } else if (name == "casp" || name == "ceGI" || name == "mccr") {
      ASSERT_TRUE(value.isArray()) << name;
      EXPECT_FALSE(value.array()->empty()) << name;
    } else if (name == "mlog") {
      EXPECT_EQ(value.int64Value(), 1234);
    } else {
      ASSERT_TRUE(value.isDictionary()) << name;
      EXPECT_FALSE(value.dictionary()->empty()) << name;
    }
  }
}

TEST(DAAPSeedCorpusTest, BookItemKeepsEveryFieldTheLibraryReads) {
  const DAAPValue item = decode(container("medc", bookItem(6).children));
  const DAAPDictionary fields = item.item()->dictionaryRepresentation();
  for (const char* key :
       {"com.orvane.sonorel.orms-songid", "daap.songgenre", "daap.sortname",
        "daap.songdatepurchased", "com.orvane.sonorel.item-flavor-listing",
        "com.orvane.sonorel.publication-version", "com.orvane.sonorel.display-publication-version",
        "com.orvane.sonorel.store.expected-release-date",
        "com.orvane.sonorel.cloud-purchased-token", "dmap.itemid",
        "com.orvane.sonorel.cloud-artwork-url", "com.orvane.sonorel.extended-media-kind"}) {
    EXPECT_FALSE(lookup(fields, key).isNull()) << key;
  }
  EXPECT_EQ(lookup(fields, "dmap.itemid").int64Value(), 6);
}

TEST(DAAPSeedCorpusTest, WritesTheSeedsWhenAskedTo) {
  const char* directory = std::getenv("LARDER_DMAP_SEED_DIR");
  if (!directory) GTEST_SKIP() << "LARDER_DMAP_SEED_DIR not set";
  std::filesystem::create_directories(directory);
  for (const auto& [name, top] : seedDocuments()) {
    const PlistData bytes = document(top);
    const std::filesystem::path path = std::filesystem::path(directory) / (name + ".dmap");
    std::ofstream(path, std::ios::binary)
        .write(reinterpret_cast<const char*>(bytes.data()),
               static_cast<std::streamsize>(bytes.size()));
    std::ifstream written(path, std::ios::binary);
    const PlistData readBack((std::istreambuf_iterator<char>(written)), {});
    EXPECT_EQ(readBack, bytes) << path;
  }
}

}  // namespace
}  // namespace larder
