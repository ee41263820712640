// The software map's persisted store: what a discovery writes, what a later
// process reads back, and how damaged files are survived.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <random>
#include <string>
#include <vector>

#include "ServiceTestSupport.h"
#include "platform/plist/KeyedArchive.h"
#include "platform/system/FileIO.h"
#include "software-map/SoftwareMap.h"

namespace larder::testing {
namespace {

constexpr const char* kNoDictionaryLine =
    "SoftwareMap: Persisted SoftwareMap did not contain appsByPath dictionary.";
constexpr const char* kNotFoundLine = "SoftwareMap: Persisted SoftwareMap not found";
constexpr const char* kEmptySummaryLine =
    "SoftwareMap: After loading persisted store, SoftwareMap is {\n}";

class SoftwareMapStoreTest : public ServiceTest {
 protected:
  LedgerSoftwareProductFields record(int index) const {
    const std::string n = std::to_string(index);
    LedgerSoftwareProductFields fields =
        storedRecord(rootApplications() + "/Stored" + n + ".app", "com.example.stored" + n,
                     "1." + n, static_cast<std::uint64_t>(7000 + index), 100 + index);
    fields.accountOpaqueID = "acct" + n;
    fields.purchaseDate = PlistDate{1400000000.0 + index};
    return fields;
  }

  std::vector<LedgerSoftwareProductFields> records(int count) const {
    std::vector<LedgerSoftwareProductFields> result;
    for (int i = 0; i < count; ++i) result.push_back(record(i));
    return result;
  }

  // Loads `bytes` as the store of a map that does not look at the disk
  // otherwise; checks that nothing was loaded and that the damage was
  // reported by `expectedLine` and nothing else.
  void expectEmptyMapFrom(const std::optional<PlistData>& bytes, const std::string& what,
                          const std::string& expectedLine, int expectedLevel) {
    std::string path = storePath(what);
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    if (bytes) writeBytes(path, *bytes);
    LogCapture log;
    {
      SoftwareMap map(options(path, false));
      map.waitUntilIdle();
      EXPECT_TRUE(map.allProducts().empty()) << what;
      EXPECT_EQ(map.productForBundleIdentifier("com.example.stored0"), nullptr) << what;
    }
    EXPECT_EQ(log.countExactly(expectedLine, expectedLevel), 1U) << what << "\n" << log.dump();
    for (const char* other : {kNoDictionaryLine, kNotFoundLine}) {
      if (expectedLine != other) {
        EXPECT_EQ(log.countExactly(other), 0U) << what << "\n" << log.dump();
      }
    }
    EXPECT_EQ(log.countContaining("Exception loading persisted SoftwareMap"), 0U) << what;
    EXPECT_EQ(log.countExactly(kEmptySummaryLine, 2), 1U) << what << "\n" << log.dump();
  }
};

TEST_F(SoftwareMapStoreTest, LaterMapAnswersFromWhatDiscoveryStored) {
  Purchase numeric{"com.example.numeric", "2.4.1",          PlistValue(5551),
                   PlistValue(88),        "opaque-numeric", 1300000000.0};
  Purchase textual{"com.example.textual", "1.0",        PlistValue("1234567890123"),
                   PlistValue("42"),      std::nullopt, std::nullopt};
  std::string numericPath =
      makeBundle(rootApplications(), "Numeric", "com.example.numeric", "2.4.1", numeric);
  std::string textualPath =
      makeBundle(homeApplications(), "Textual", "com.example.textual", "1.0", textual);
  std::string installerPath =
      makeBundle(rootApplications() + "/Utilities", "Setup", "com.orvane.SetupHerald.Helper", "5.0",
                 std::nullopt, "512");

  LedgerSoftwareProductFields n =
      storedRecord(numericPath, "com.example.numeric", "2.4.1", 5551, 88);
  n.accountOpaqueID = "opaque-numeric";
  n.purchaseDate = PlistDate{1300000000.0};
  std::vector<LedgerSoftwareProductFields> expected{
      storedRecord(installerPath, "com.orvane.SetupHerald.Helper", "512"), n,
      storedRecord(textualPath, "com.example.textual", "1.0", 1234567890123U, 42)};
  const auto byPath = [](const auto& a, const auto& b) { return a.bundlePath < b.bundlePath; };
  std::sort(expected.begin(), expected.end(), byPath);
  const auto snapshots = [&](SoftwareMap& map) {
    std::vector<LedgerSoftwareProductFields> fields;
    for (const auto& product : map.allProducts()) fields.push_back(product->snapshot());
    std::sort(fields.begin(), fields.end(), byPath);
    return fields;
  };
  {
    SoftwareMap first(options(storePath(), true));
    first.waitUntilIdle();
    ASSERT_TRUE(snapshots(first) == expected) << "discovery read other values";
  }
  // A second process, without discovery, gives the same answers.
  SoftwareMap second(options(storePath(), false));
  EXPECT_TRUE(snapshots(second) == expected);
  for (const LedgerSoftwareProductFields& fields : expected) {
    LedgerSoftwareProductRef loaded = second.productForBundleIdentifier(*fields.bundleIdentifier);
    ASSERT_NE(loaded, nullptr) << *fields.bundleIdentifier;
    if (fields.itemIdentifier) {
      EXPECT_EQ(second.productForItemIdentifier(*fields.itemIdentifier), loaded)
          << "both indexes hold the same record";
    }
  }
  EXPECT_EQ(second.productForItemIdentifier(0), nullptr);
}

TEST_F(SoftwareMapStoreTest, DamagedStoresGiveAnEmptyMap) {
  PlistData good = archivedStore(records(3));
  ASSERT_GT(good.size(), 64U);
  auto archived = [](const PlistValue& root) { return KeyedArchive::archivedData(root); };
  auto bytesOf = [](const std::string& text) { return PlistData(text.begin(), text.end()); };
  std::mt19937 generator(20240611);
  PlistData noise(4096);
  for (auto& byte : noise) byte = static_cast<std::uint8_t>(generator());
  // Noise behind a valid header.
  PlistData headed = noise;
  std::copy_n(good.begin(), 8, headed.begin());
  // The real store with its middle scrambled.
  PlistData scrambled = good;
  for (std::size_t i = scrambled.size() / 4; i < scrambled.size() / 2; ++i) {
    scrambled[i] = static_cast<std::uint8_t>(generator());
  }
  PlistDictionary evil = KeyedArchive::record("Evil");
  evil.emplace("bundlePath", rootApplications() + "/Evil.app");
  PlistDictionary byPath{{record(0).bundlePath, LedgerSoftwareProduct(record(0)).encodeWithCoder()},
                         {rootApplications() + "/Evil.app", evil}};

  struct Case {
    std::string name;
    std::optional<PlistData> bytes;  // nullopt: no file
    const char* line = kNoDictionaryLine;
    int level = 1;
  };
  std::vector<Case> cases{
      {"noise", noise},
      {"headed-noise", headed},
      {"scrambled", scrambled},
      {"evil-class", archived(KeyedArchive::dictionary(
                         {{"appsByPath", KeyedArchive::dictionary(std::move(byPath))}}))},
      {"array-root",
       archived(KeyedArchive::array({LedgerSoftwareProduct(record(0)).encodeWithCoder()}))},
      {"plain-array-root", archived(PlistArray{"plain"})},
      {"string-entry", archived(KeyedArchive::dictionary({{"appsByPath", "text"}}))},
      {"no-entry", archived(KeyedArchive::dictionary({{"other", "text"}}))},
      {"not-an-archive",
       PropertyListSerialization::writeBinary(PlistDictionary{{"appsByPath", PlistDictionary{}}})},
      {"xml", bytesOf(PropertyListSerialization::writeXml(PlistDictionary{{"appsByPath", 1}}))},
      {"empty", PlistData{}, kNotFoundLine, 2},
      {"missing", std::nullopt, kNotFoundLine, 2},
  };
  for (std::size_t length : {std::size_t{1}, std::size_t{8}, std::size_t{9}, good.size() / 3,
                             good.size() / 2, good.size() - 33, good.size() - 1}) {
    cases.push_back({"truncated-" + std::to_string(length),
                     PlistData(good.begin(), good.begin() + static_cast<std::ptrdiff_t>(length))});
  }
  for (const Case& c : cases) expectEmptyMapFrom(c.bytes, c.name, c.line, c.level);
}

TEST_F(SoftwareMapStoreTest, DamagedStoreIsReplacedByTheNextDiscovery) {
  writeBytes(storePath(), PlistData{'b', 'p', 'l', 'i', 's', 't', '0', '0', 0xFF, 0xFF});
  std::string app = makeStoreBundle(rootApplications(), "Fresh", "com.example.fresh", "1.0", 31);
  {
    SoftwareMap map(options(storePath(), false));
    EXPECT_TRUE(map.allProducts().empty());
    map.reloadFromApplicationRegistry();
    EXPECT_EQ(pathsOf(map.allProducts()), std::vector<std::string>{app});
  }
  SoftwareMap reread(options(storePath(), false));
  ASSERT_NE(reread.productForBundleIdentifier("com.example.fresh"), nullptr);
  EXPECT_EQ(reread.productForItemIdentifier(31)->bundlePath(), app);
}

TEST_F(SoftwareMapStoreTest, RecordsThatBreakTheirOwnRulesAreDroppedAlone) {
  PlistDictionary byPath;
  byPath.emplace(record(0).bundlePath, LedgerSoftwareProduct(record(0)).encodeWithCoder());
  // Keyed under another path than its own.
  byPath.emplace(rootApplications() + "/Elsewhere.app",
                 LedgerSoftwareProduct(record(1)).encodeWithCoder());
  // A field of the wrong type.
  PlistDictionary wrongType = LedgerSoftwareProduct(record(2)).encodeWithCoder();
  wrongType["bundleVersion"] = 3;
  byPath.emplace(record(2).bundlePath, wrongType);
  writeBytes(storePath(), KeyedArchive::archivedData(KeyedArchive::dictionary(
                              {{"appsByPath", KeyedArchive::dictionary(std::move(byPath))}})));
  LogCapture log;
  SoftwareMap map(options(storePath(), false));
  EXPECT_EQ(pathsOf(map.allProducts()), std::vector<std::string>{record(0).bundlePath});
  ASSERT_NE(map.productForBundleIdentifier("com.example.stored0"), nullptr);
  EXPECT_EQ(map.productForBundleIdentifier("com.example.stored0")->snapshot(), record(0));
  EXPECT_EQ(map.productForBundleIdentifier("com.example.stored1"), nullptr);
  EXPECT_EQ(map.productForBundleIdentifier("com.example.stored2"), nullptr);
  EXPECT_EQ(log.countExactly(kNoDictionaryLine), 0U);
}

TEST_F(SoftwareMapStoreTest, SmallStoreIsDescribedInTheLogLineLargeOneInASideFile) {
  const std::string sideFile = stateFolder() + "/appsByPath.plist";
  for (int count : {5, 6}) {
    SCOPED_TRACE(count);
    PlistDictionary described;
    for (const auto& fields : records(count)) {
      described.emplace(fields.bundlePath, LedgerSoftwareProduct(fields).toDictionary());
    }
    const std::string path = storePath(std::to_string(count));
    writeBytes(path, archivedStore(records(count)));
    LogCapture log;
    SoftwareMap map(options(path, false));
    map.waitUntilIdle();
    const std::string prefix = "SoftwareMap: After loading persisted store, SoftwareMap ";
    if (count == 5) {
      const std::string description = describePlistValue(PlistValue(described));
      EXPECT_NE(description.find("bundleIdentifier = \"com.example.stored4\";"), std::string::npos);
      EXPECT_TRUE(log.hasOnce(prefix + "is " + description, 2));
      EXPECT_FALSE(std::filesystem::exists(sideFile));
      continue;
    }
    EXPECT_TRUE(log.hasOnce(prefix + "has 6 items", 2));
    EXPECT_EQ(log.countContaining(prefix + "is"), 0U);
    std::optional<PlistData> bytes = FileIO::read(sideFile).optional();
    ASSERT_TRUE(bytes) << sideFile;
    EXPECT_EQ(PropertyListSerialization::read(*bytes), PlistValue(described));
  }
}

// A process killed mid-write leaves its temporary file; the next start
// removes those of dead writers (and of its own id, reused across restarts)
// and nothing else. A write that fails says so and only so.
TEST_F(SoftwareMapStoreTest, StartRemovesStaleTemporariesAndAFailedWriteIsNotReportedAsDone) {
  const pid_t child = ::fork();
  if (child == 0) ::_exit(0);
  ASSERT_GT(child, 0);
  ::waitpid(child, nullptr, 0);
  const std::string store = storePath();
  const std::string dead = store + ".tmp-" + std::to_string(child) + "-4242";
  const std::string ours = store + ".tmp-" + std::to_string(::getpid()) + "-7";
  const std::string living = store + ".tmp-1-9";
  const std::string unrelated = store + ".tmp-notes";
  for (const auto& path : {dead, ours, living, unrelated}) writeBytes(path, PlistData{'x'});
  {
    SoftwareMap map(options(store, false));
    map.waitUntilIdle();
  }
  EXPECT_FALSE(std::filesystem::exists(dead));
  EXPECT_FALSE(std::filesystem::exists(ours));
  EXPECT_TRUE(std::filesystem::exists(living));
  EXPECT_TRUE(std::filesystem::exists(unrelated));

  makeStoreBundle(rootApplications(), "Fresh", "com.example.fresh", "1.0", 31);
  const std::string blocked = stateFolder() + "/not-a-folder";
  writeBytes(blocked, PlistData{'x'});
  LogCapture log;
  {
    SoftwareMap map(options(blocked + "/SoftwareMap", false));
    map.reloadFromApplicationRegistry();
    map.waitUntilIdle();
  }
  EXPECT_EQ(log.countContaining("Exception writing persisted SoftwareMap"), 1U) << log.dump();
  EXPECT_EQ(log.countContaining("Updated persisted SoftwareMap"), 0U) << log.dump();
}

// The load is the first barrier of the map's queue: a lookup made at once
// waits for it instead of answering from a map still being filled.
TEST_F(SoftwareMapStoreTest, LookupRightAfterConstructionWaitsForTheLoad) {
  constexpr int kRecords = 5000;
  std::vector<LedgerSoftwareProductFields> many;
  for (int i = 0; i < kRecords; ++i) {
    const std::string n = std::to_string(i);
    many.push_back(
        storedRecord("/Applications/Bulk" + n + ".app", "com.example.bulk" + n, "1.0", 900000 + i));
  }
  writeBytes(storePath(), archivedStore(many));
  // Detail logging would describe every record; the barrier is the subject.
  TillLogManager::sharedManager().setLevel(1);

  {
    SoftwareMap map(options(storePath(), false));
    LedgerSoftwareProductRef last = map.productForBundleIdentifier("com.example.bulk4999");
    ASSERT_NE(last, nullptr);
    EXPECT_EQ(last->bundlePath(), "/Applications/Bulk4999.app");
  }
  {
    SoftwareMap map(options(storePath(), false));
    LedgerSoftwareProductRef byItem = map.productForItemIdentifier(900000 + 2500);
    ASSERT_NE(byItem, nullptr);
    EXPECT_EQ(byItem->bundleIdentifier(), "com.example.bulk2500");
  }
  {
    SoftwareMap map(options(storePath(), false));
    EXPECT_EQ(map.allProducts().size(), static_cast<std::size_t>(kRecords));
  }
}

}  // namespace
}  // namespace larder::testing
