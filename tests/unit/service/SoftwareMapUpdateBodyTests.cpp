// The update request body that the software map makes for the store, and
// the map's answers about which bundle an incoming version replaces and
// whether a pushed install may go ahead.
#include <gtest/gtest.h>

#include <cstdint>
#include <filesystem>
#include <latch>
#include <limits>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "ServiceTestSupport.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/http/VendGzip.h"

namespace larder::testing {
namespace {

// What a call gave, with its out arguments. The out bools start as the
// opposite of what a correct call leaves, unless the call must not touch
// them, so that a forgotten write shows.
struct Body {
  std::optional<PlistData> data;
  bool compressed = true;
  bool hadBundledApps = true;
};

struct BodyRequest {
  bool installed = false;
  bool bundled = false;
  bool conditionally = false;
  bool compress = false;
  std::vector<std::string> skipList;
};

std::string textOf(const PlistData& bytes) {
  return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
}

class SoftwareMapUpdateBodyTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    // The manifest is held for the life of the process; every case starts
    // as a fresh process would.
    SoftwareMap::resetBundledManifestForTesting();
  }
  void TearDown() override {
    SoftwareMap::resetBundledManifestForTesting();
    ServiceTest::TearDown();
  }

  static std::string manifestPath() { return Environment::rootedPath("/var/db/.QMTManifest"); }

  static void writeManifest(const PlistValue& rows) { writePlist(manifestPath(), rows); }

  static Body requestBody(SoftwareMap& map, const BodyRequest& request) {
    Body body;
    body.data = map.updateRequestBodyData(&body.compressed, request.installed, request.bundled,
                                          request.conditionally, &body.hadBundledApps,
                                          request.compress, request.skipList);
    return body;
  }

  // The uncompressed body read back: the writer's output must be a
  // property list that the platform reads, byte for byte what the general
  // writer makes of the same dictionary.
  static PlistDictionary parsedBody(const Body& body) {
    EXPECT_TRUE(body.data.has_value());
    if (!body.data) return {};
    EXPECT_FALSE(body.compressed);
    auto parsed = PropertyListSerialization::read(*body.data);
    EXPECT_TRUE(parsed.has_value()) << parsed.errorDescription() << "\n" << textOf(*body.data);
    if (!parsed || !parsed->isDictionary()) {
      ADD_FAILURE() << "the body is not a dictionary:\n" << textOf(*body.data);
      return {};
    }
    EXPECT_EQ(textOf(*body.data), PropertyListSerialization::writeXml(*parsed));
    return *parsed->dictionary();
  }

  // The entries of one list by their "ware-id" as text (installed
  // software sends it as text); every ware id appears once.
  static std::map<std::string, PlistValue> entriesByWareID(const PlistValue& list) {
    std::map<std::string, PlistValue> entries;
    EXPECT_TRUE(list.isArray()) << describePlistValue(list);
    if (!list.isArray()) return entries;
    for (const PlistValue& entry : *list.array()) {
      const std::string* text = entry["ware-id"].string();
      EXPECT_NE(text, nullptr) << describePlistValue(entry);
      std::string key = text ? *text : describePlistValue(entry);
      EXPECT_TRUE(entries.emplace(key, entry).second) << "ware id twice: " << key;
    }
    return entries;
  }

  std::unique_ptr<SoftwareMap> emptyMap() { return mapWithRecords({}); }

  // Four rows as a machine's manifest has them, and the entries they give.
  static PlistArray manifestRows() {
    return {PlistDictionary{{"bundleID", "com.example.bundled.pages"},
                            {"version", "7.1"},
                            {"wareID", "409201541"},
                            {"installerVersionID", "824364771"}},
            PlistDictionary{{"bundleID", "com.example.bundled.keynote"},
                            {"version", "12.0"},
                            {"wareID", std::int64_t{409183694}},
                            {"installerVersionID", std::int64_t{5}}},
            PlistDictionary{{"bundleID", "com.example.bundled.numbers"}},
            PlistDictionary{{"wareID", PlistValue(std::numeric_limits<std::uint64_t>::max())},
                            {"version", "1.0"}}};
  }
  static PlistArray manifestEntries() {
    return {PlistDictionary{{"HostBundleIdentifier", "com.example.bundled.pages"},
                            {"HostBundleShortVersionString", "7.1"},
                            {"ware-id", "409201541"},
                            {"installed-version-identifier", std::int64_t{824364771}}},
            PlistDictionary{{"HostBundleIdentifier", "com.example.bundled.keynote"},
                            {"HostBundleShortVersionString", "12.0"},
                            {"ware-id", std::int64_t{409183694}},
                            {"installed-version-identifier", std::int64_t{5}}},
            PlistDictionary{{"HostBundleIdentifier", "com.example.bundled.numbers"}},
            PlistDictionary{{"ware-id", PlistValue(std::numeric_limits<std::uint64_t>::max())},
                            {"HostBundleShortVersionString", "1.0"}}};
  }
};

// MARK: installed software

TEST_F(SoftwareMapUpdateBodyTest, InstalledEntriesCarryTheRecordsValuesAndLeaveOutAbsentOnes) {
  LedgerSoftwareProductFields full =
      storedRecord(rootApplications() + "/Full.app", "com.example.full", "2.4.1", 7001, 101);
  full.accountOpaqueID = "not sent";
  LedgerSoftwareProductFields sparse =
      storedRecord(rootApplications() + "/Sparse.app", "com.example.sparse", std::nullopt, 7002);
  LedgerSoftwareProductFields nameless =
      storedRecord(homeApplications() + "/Nameless.app", std::nullopt, "0",
                   std::numeric_limits<std::uint64_t>::max(), -5);
  // The OS installer has no item identifier and is not sent.
  LedgerSoftwareProductFields installer =
      storedRecord(rootApplications() + "/Setup.app", "com.example.setup", "5.0");
  // Text that looks like markup survives the trip; an empty value is a
  // value, and is sent.
  LedgerSoftwareProductFields hostile =
      storedRecord(rootApplications() + "/Hostile.app", "com.example.<dict>&amp;</string>]]>\"'",
                   "ü€😀 \t1.0\n ", 1);
  LedgerSoftwareProductFields empty = storedRecord(rootApplications() + "/Empty.app", "", "", 2, 0);
  auto map = mapWithRecords({full, sparse, nameless, installer, hostile, empty});

  LogCapture log;
  Body body = requestBody(*map, {.installed = true});
  PlistDictionary parsed = parsedBody(body);
  EXPECT_FALSE(body.compressed);
  EXPECT_TRUE(body.hadBundledApps) << "written only when the bundled list is made";
  ASSERT_EQ(parsed.size(), 1U) << describePlistValue(parsed);
  std::map<std::string, PlistValue> entries = entriesByWareID(parsed["local-software"]);
  std::map<std::string, PlistValue> expected{
      {"7001", PlistDictionary{{"ware-id", "7001"},
                               {"installed-version-identifier", std::int64_t{101}},
                               {"HostBundleIdentifier", "com.example.full"},
                               {"HostBundleShortVersionString", "2.4.1"}}},
      {"7002",
       PlistDictionary{{"ware-id", "7002"}, {"HostBundleIdentifier", "com.example.sparse"}}},
      {"18446744073709551615", PlistDictionary{{"ware-id", "18446744073709551615"},
                                               {"installed-version-identifier", std::int64_t{-5}},
                                               {"HostBundleShortVersionString", "0"}}},
      {"1", PlistDictionary{{"ware-id", "1"},
                            {"HostBundleIdentifier", *hostile.bundleIdentifier},
                            {"HostBundleShortVersionString", *hostile.bundleVersion}}},
      {"2", PlistDictionary{{"ware-id", "2"},
                            {"installed-version-identifier", 0},
                            {"HostBundleIdentifier", ""},
                            {"HostBundleShortVersionString", ""}}},
  };
  EXPECT_EQ(entries, expected);

  EXPECT_TRUE(log.hasOnce("SoftwareMap: installed: 1; bundled: 0; conditional: 0", 2));
  // The same dictionary goes to the side file at level 3.
  std::optional<PlistData> side =
      FileIO::read(stateFolder() + "/UpdateQueueRequstBody.plist").optional();
  ASSERT_TRUE(side.has_value());
  EXPECT_EQ(PropertyListSerialization::read(*side), PlistValue(parsed));
}

TEST_F(SoftwareMapUpdateBodyTest, OnlyThePreferredCopyOfAnApplicationIsSent) {
  // Equal versions: the copy in /Applications wins. Different versions:
  // the newer one wins wherever it is. The installer version tells the
  // copies apart.
  makeStoreBundle(rootApplications(), "Twin", "com.example.twin", "3.0", 9001, 11);
  makeStoreBundle(homeApplications(), "Twin", "com.example.twin", "3.0", 9001, 22);
  makeStoreBundle(rootApplications(), "Older", "com.example.older", "3.0", 9002, 33);
  std::string newer =
      makeStoreBundle(homeApplications(), "Older", "com.example.older", "3.1", 9002, 44);
  SoftwareMap map(options(storePath(), true));
  map.waitUntilIdle();
  ASSERT_EQ(map.allProducts().size(), 4U);

  std::map<std::string, PlistValue> entries =
      entriesByWareID(parsedBody(requestBody(map, {.installed = true}))["local-software"]);
  ASSERT_EQ(entries.size(), 2U);
  EXPECT_EQ(entries["9001"]["installed-version-identifier"], PlistValue(std::int64_t{11}));
  EXPECT_EQ(entries["9002"]["installed-version-identifier"], PlistValue(std::int64_t{44})) << newer;
  EXPECT_EQ(entries["9002"]["HostBundleShortVersionString"], PlistValue("3.1"));
}

TEST_F(SoftwareMapUpdateBodyTest, TheSkipListKeepsItemsOutByItemOrBundleIdentifier) {
  std::vector<LedgerSoftwareProductFields> records;
  for (int i = 0; i < 4; ++i) {
    const std::string n = std::to_string(i);
    records.push_back(storedRecord(rootApplications() + "/S" + n + ".app", "com.example.s" + n,
                                   std::nullopt, 7000 + i));
  }
  auto map = mapWithRecords(records);
  auto sentWareIDs = [&](std::vector<std::string> skipList) {
    std::vector<std::string> sent;
    PlistDictionary body = parsedBody(requestBody(*map, {.installed = true, .skipList = skipList}));
    for (const auto& entry : entriesByWareID(body["local-software"])) sent.push_back(entry.first);
    return sent;
  };
  EXPECT_EQ(sentWareIDs({"com.example.s1", "7003"}), (std::vector<std::string>{"7000", "7002"}));
  // Whole values only: parts, other spellings and other cases match nothing.
  EXPECT_EQ(sentWareIDs({"700", "07000", "7000 ", "com.example.s", "COM.EXAMPLE.S2", ""}),
            (std::vector<std::string>{"7000", "7001", "7002", "7003"}));
}

// MARK: bundled software

TEST_F(SoftwareMapUpdateBodyTest, BundledEntriesFollowTheManifestInItsOrder) {
  PlistArray rows = manifestRows();
  // Rows that are not dictionaries are skipped; values of types the store
  // would not understand are left out.
  rows.insert(rows.begin() + 1, PlistValue("not a row"));
  rows.push_back(PlistDictionary{{"bundleID", std::int64_t{5}},
                                 {"version", PlistArray{}},
                                 {"wareID", PlistDictionary{}},
                                 {"installerVersionID", PlistData{1, 2}}});
  writeManifest(rows);
  auto map = emptyMap();

  LogCapture log;
  Body body = requestBody(*map, {.bundled = true});
  PlistArray expected = manifestEntries();
  expected.emplace_back(PlistDictionary{});
  EXPECT_EQ(parsedBody(body), (PlistDictionary{{"bundled-software", expected}}));
  EXPECT_TRUE(body.hadBundledApps);
  EXPECT_TRUE(
      log.hasOnce("SoftwareMap: Bundled applications manifest row 1 is not a "
                  "dictionary, skipping it",
                  1));
  EXPECT_TRUE(log.hasOnce("SoftwareMap: installed: 0; bundled: 1; conditional: 0", 2));
}

TEST_F(SoftwareMapUpdateBodyTest, TheManifestIsReadOnceForTheWholeProcess) {
  writeManifest(manifestRows());
  auto map = emptyMap();
  LogCapture log;
  PlistDictionary first = parsedBody(requestBody(*map, {.bundled = true}));
  ASSERT_EQ(first, (PlistDictionary{{"bundled-software", manifestEntries()}}));

  // Neither a changed file, nor a removed one, nor another map instance
  // sees anything but the list read first.
  writeManifest(PlistArray{PlistDictionary{{"bundleID", "com.example.changed"}}});
  EXPECT_EQ(parsedBody(requestBody(*map, {.bundled = true})), first);
  std::filesystem::remove(manifestPath());
  auto other = emptyMap();
  Body fromOther = requestBody(*other, {.bundled = true});
  EXPECT_EQ(parsedBody(fromOther), first);
  EXPECT_TRUE(fromOther.hadBundledApps);
  EXPECT_EQ(log.countContaining("bundled applications from " + manifestPath(), 2), 1U)
      << log.dump();

  // A manifest that was read empty is held as well.
  SoftwareMap::resetBundledManifestForTesting();
  writeManifest(PlistArray{});
  Body empty = requestBody(*map, {.bundled = true});
  EXPECT_FALSE(empty.hadBundledApps);
  writeManifest(manifestRows());
  Body stillEmpty = requestBody(*map, {.bundled = true});
  EXPECT_EQ(parsedBody(stillEmpty), (PlistDictionary{{"bundled-software", PlistArray{}}}));
  EXPECT_FALSE(stillEmpty.hadBundledApps);
}

TEST_F(SoftwareMapUpdateBodyTest, AMissingOrUnusableManifestGivesAnEmptyListAndIsTriedAgain) {
  auto map = emptyMap();
  struct Case {
    std::string what;
    std::optional<std::string> contents;  // nullopt: no file
    std::string expectedLine;
    int level;
  };
  const std::string path = manifestPath();
  const std::vector<Case> cases{
      {"missing", std::nullopt, "SoftwareMap: No bundled applications manifest at " + path, 3},
      {"not a property list", "<plist><array><dict>",
       "SoftwareMap: Could not read the bundled applications manifest at " + path, 1},
      {"empty file", "", "SoftwareMap: Could not read the bundled applications manifest at " + path,
       1},
      {"a dictionary",
       PropertyListSerialization::writeXml(PlistDictionary{{"bundleID", "com.example.x"}}),
       "SoftwareMap: Bundled applications manifest at " + path + " is not a list, ignoring it", 1},
      {"a folder", std::nullopt, "SoftwareMap: No bundled applications manifest at " + path, 3},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    std::filesystem::remove_all(path);
    if (c.contents) writeText(path, *c.contents);
    if (c.what == "a folder") std::filesystem::create_directories(path);
    LogCapture log;
    // An empty map still sends its (empty) list.
    Body body = requestBody(*map, {.installed = true, .bundled = true});
    EXPECT_EQ(parsedBody(body), (PlistDictionary{{"local-software", PlistArray{}},
                                                 {"bundled-software", PlistArray{}}}));
    EXPECT_FALSE(body.hadBundledApps);
    EXPECT_EQ(log.countContaining(c.expectedLine, c.level), 1U) << log.dump();
    EXPECT_EQ(log.countContaining("bundled applications from"), 0U) << log.dump();
  }

  // The next request after any of them reads the file that is there now.
  std::filesystem::remove_all(path);
  writeManifest(manifestRows());
  Body repaired = requestBody(*map, {.bundled = true});
  EXPECT_EQ(parsedBody(repaired), (PlistDictionary{{"bundled-software", manifestEntries()}}));
  EXPECT_TRUE(repaired.hadBundledApps);
}

TEST_F(SoftwareMapUpdateBodyTest, ThreadsThatMeetAtTheFirstReadAllSeeTheWholeList) {
  PlistArray rows;
  PlistArray expected;
  for (int i = 0; i < 3000; ++i) {
    const std::string identifier = "com.example.b" + std::to_string(i);
    rows.emplace_back(PlistDictionary{{"bundleID", identifier}, {"wareID", std::int64_t{i}}});
    expected.emplace_back(
        PlistDictionary{{"HostBundleIdentifier", identifier}, {"ware-id", std::int64_t{i}}});
  }
  writeManifest(rows);
  auto map = emptyMap();
  LogCapture log;
  constexpr int kThreads = 6;
  std::latch start(kThreads);
  std::vector<Body> bodies(kThreads);
  std::vector<std::thread> threads;
  for (Body& body : bodies) {
    threads.emplace_back([&] {
      start.arrive_and_wait();
      body = requestBody(*map, {.bundled = true});
    });
  }
  for (std::thread& thread : threads) thread.join();
  for (const Body& body : bodies) {
    EXPECT_EQ(parsedBody(body), (PlistDictionary{{"bundled-software", expected}}));
    EXPECT_TRUE(body.hadBundledApps);
  }
  EXPECT_EQ(log.countContaining("Read 3000 bundled applications", 2), 1U) << log.dump();
}

// MARK: conditions

TEST_F(SoftwareMapUpdateBodyTest, TheConditionAloneAlsoBringsTheBundledList) {
  writeManifest(manifestRows());
  LedgerSoftwareProductFields record =
      storedRecord(rootApplications() + "/Only.app", "com.example.only", std::nullopt, 42);
  auto map = mapWithRecords({record});
  const PlistArray local{
      PlistDictionary{{"ware-id", "42"}, {"HostBundleIdentifier", "com.example.only"}}};
  const PlistArray bundledList = manifestEntries();

  // The condition brings the bundled list as asking for it does.
  const std::tuple<bool, bool, bool> rows[] = {{false, false, true}, {true, false, true},
                                               {true, true, true},   {true, true, false},
                                               {true, false, false}, {false, false, false}};
  for (const auto& [installed, bundled, conditionally] : rows) {
    const std::string flags = "installed: " + std::to_string(installed) +
                              "; bundled: " + std::to_string(bundled) +
                              "; conditional: " + std::to_string(conditionally);
    SCOPED_TRACE(flags);
    PlistDictionary expected;
    if (installed) expected.emplace("local-software", local);
    if (bundled || conditionally) expected.emplace("bundled-software", bundledList);
    LogCapture log;
    Body body;
    body.hadBundledApps = false;
    body.data = map->updateRequestBodyData(&body.compressed, installed, bundled, conditionally,
                                           &body.hadBundledApps, false, {});
    EXPECT_EQ(parsedBody(body), expected);
    EXPECT_EQ(body.hadBundledApps, bundled || conditionally)
        << "set to true when the list is made, and only then";
    EXPECT_TRUE(log.hasOnce("SoftwareMap: " + flags, 2));
  }
}

TEST_F(SoftwareMapUpdateBodyTest, ACompressedBodyIsTheGzipOfTheSameXml) {
  writeManifest(manifestRows());
  std::vector<LedgerSoftwareProductFields> records;
  for (int i = 0; i < 300; ++i) {
    const std::string n = std::to_string(i);
    records.push_back(storedRecord(rootApplications() + "/Z" + n + ".app", "com.example.z" + n,
                                   "1." + n, 100000 + i, 9 * i));
  }
  auto map = mapWithRecords(records);
  LogCapture log;
  Body plain = requestBody(*map, {.installed = true, .bundled = true, .skipList = {"100007"}});
  Body zipped = requestBody(
      *map, {.installed = true, .bundled = true, .compress = true, .skipList = {"100007"}});
  EXPECT_EQ(entriesByWareID(parsedBody(plain)["local-software"]).size(), 299U);
  ASSERT_TRUE(zipped.data.has_value());
  EXPECT_TRUE(zipped.compressed);
  EXPECT_TRUE(zipped.hadBundledApps);
  EXPECT_EQ(std::string(zipped.data->begin(), zipped.data->begin() + 2), "\x1f\x8b");
  EXPECT_LT(zipped.data->size(), plain.data->size() / 4);
  EXPECT_EQ(VendCopyGunzippedDataForData(*zipped.data), plain.data);
  EXPECT_TRUE(log.hasOnce("SoftwareMap: Compressed the request body", 2));
  // Out arguments may be absent.
  std::optional<PlistData> anonymous =
      map->updateRequestBodyData(nullptr, true, true, false, nullptr, true, {"100007"});
  ASSERT_TRUE(anonymous.has_value());
  EXPECT_EQ(VendCopyGunzippedDataForData(*anonymous), plain.data);
}

// MARK: path to upgrade and pushed installs

// One machine for every lookup; each identifier stands for one situation.
class SoftwareMapUpgradePathTest : public SoftwareMapUpdateBodyTest {
 protected:
  void SetUp() override {
    SoftwareMapUpdateBodyTest::SetUp();
    // In the map: a store copy in an application folder; a bundle that is
    // gone (a replaceable copy with its identifier on disk is not looked
    // for); one gone without a version; a store copy outside the
    // application folders.
    mapped_ = makeStoreBundle(rootApplications(), "Mapped", "com.example.mapped", "5.0", 1);
    gone_ = rootApplications() + "/Gone.app";
    makeStoreBundle(homeApplications(), "Gone", "com.example.gone", "1.0", 2);
    aside_ =
        makeStoreBundle(temporary() + "/root/Elsewhere", "Aside", "com.example.aside", "1.0", 5);
    // Not in the map: a store copy, a bundle that is no store software,
    // and a store copy without a version.
    loose_ = makeStoreBundle(rootApplications(), "Loose", "com.example.loose", "1.9", 3);
    plain_ = makeBundle(rootApplications(), "Plain", "com.example.plain", "1.0", std::nullopt);
    makeStoreBundle(rootApplications(), "Unversioned", "com.example.unversioned", "", 4);
    // Both in the map: a newer copy that is no store software (no place to
    // install) and an older store copy beside it, which stands in the way.
    dualPlain_ = makeBundle(rootApplications(), "Dual", "com.example.dual", "2.0", std::nullopt);
    dualStore_ = makeStoreBundle(homeApplications(), "Dual", "com.example.dual", "1.0", 7);
    map_ =
        mapWithRecords({storedRecord(mapped_, "com.example.mapped", "5.0", 1),
                        storedRecord(gone_, "com.example.gone", "1.0"),
                        storedRecord(rootApplications() + "/Vanished.app", "com.example.vanished"),
                        storedRecord(aside_, "com.example.aside", "1.0"),
                        storedRecord(dualPlain_, "com.example.dual", "2.0"),
                        storedRecord(dualStore_, "com.example.dual", "1.0", 7)});
  }

  std::string mapped_, gone_, aside_, loose_, plain_, dualPlain_, dualStore_;
  std::unique_ptr<SoftwareMap> map_;
};

TEST_F(SoftwareMapUpgradePathTest, TheBundleToReplaceIsTheMappedCopyOrANewerStoreCopyOnDisk) {
  struct Case {
    std::string identifier;
    std::string version;
    std::optional<std::string> expected;
  };
  const Case cases[] = {
      // A mapped copy is the answer whatever the version.
      {"com.example.mapped", "0.1", mapped_},
      {"com.example.mapped", "5.0", mapped_},
      {"com.example.mapped", "6.0", mapped_},
      {"com.example.mapped", "", mapped_},
      // An unmapped store copy is the answer only for a newer version.
      {"com.example.loose", "1.10", loose_},
      {"com.example.loose", "2", loose_},
      {"com.example.loose", "1.9.1", loose_},
      {"com.example.loose", "1.9", std::nullopt},
      {"com.example.loose", "01.9", std::nullopt},
      {"com.example.loose", "1.8", std::nullopt},
      {"com.example.loose", "1.09", std::nullopt},
      {"com.example.loose", "", std::nullopt},
      // Unmapped bundles that are no store software or have no version
      // are not taken.
      {"com.example.plain", "2.0", std::nullopt},
      {"com.example.unversioned", "2.0", std::nullopt},
      {"com.example.nowhere", "1.0", std::nullopt},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.identifier + " " + c.version);
    LogCapture log;
    EXPECT_EQ(map_->productPathToUpgradeForBundleIdentifier(c.identifier, c.version), c.expected);
    std::string line = "SoftwareMap: No app was found with bundle ID " + c.identifier;
    if (c.expected == mapped_) line = "SoftwareMap: Found app at " + mapped_ + " using SoftwareMap";
    if (c.expected == loose_) {
      line = "SoftwareMap: Found app at " + loose_ + " with bundle ID " + c.identifier +
             " using AppRegistry";
    }
    EXPECT_TRUE(log.hasOnce(line + " to upgrade to " + c.version, 1));
    const bool plain = c.identifier == "com.example.plain";
    EXPECT_EQ(log.countContaining("isQuaymartAppAtPath or isUpdatableAtPath failed"),
              plain ? 1U : 0U);
    if (plain) {
      EXPECT_TRUE(log.hasOnce(
          "SoftwareMap: isQuaymartAppAtPath or isUpdatableAtPath failed for app at " + plain_, 3));
    }
  }

  // A mapped copy that cannot be replaced ends the search.
  LogCapture log;
  EXPECT_EQ(map_->productPathToUpgradeForBundleIdentifier("com.example.gone", "2.0"), std::nullopt);
  EXPECT_TRUE(log.hasOnce("SoftwareMap: Found app at " + gone_ +
                              " using SoftwareMap but it is not upgradable, "
                              "productPathToUpgradeForBundleIdentifier:versionNumber will "
                              "return nil",
                          1));
  EXPECT_EQ(log.countContaining("AppRegistry"), 0U);
  EXPECT_EQ(log.countContaining("No app was found"), 0U);
}

TEST_F(SoftwareMapUpgradePathTest, APushIsRefusedOnlyWhereAStoreCopyItCannotReplaceStandsInTheWay) {
  const std::pair<std::string, std::string> allowed[] = {
      {"com.example.mapped", "1.0"},
      {"com.example.nowhere", "1.0"},  // nothing on the machine
      // Found, but no place to install; and no other copy stands in the way.
      {"com.example.aside", "2.0"},
      {"com.example.vanished", "2.0"},
      {"com.example.loose", "4.0"},
      // The copy would not be replaced, but the map does not know it, so
      // nothing is found in the way.
      {"com.example.loose", "1.8"},
  };
  for (const auto& [identifier, version] : allowed) {
    EXPECT_TRUE(map_->shouldAllowAutoPushForBundleID(identifier, version))
        << identifier << " " << version;
  }
  ASSERT_EQ(map_->productPathToUpgradeForBundleIdentifier("com.example.dual", "3.0"), dualPlain_);
  EXPECT_FALSE(map_->shouldAllowAutoPushForBundleID("com.example.dual", "3.0"));
  // Without the store copy the same push goes ahead.
  std::filesystem::remove(dualStore_ + "/purchase.plist");
  EXPECT_TRUE(map_->shouldAllowAutoPushForBundleID("com.example.dual", "3.0"));
}

}  // namespace
}  // namespace larder::testing
