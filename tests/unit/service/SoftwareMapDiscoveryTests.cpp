// Discovery of installed bundles and its merge into the records the map
// already holds; the notices observers get about it.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <set>
#include <string>
#include <vector>

#include "ServiceTestSupport.h"
#include "software-map/SoftwareMap.h"

namespace larder::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::UnorderedElementsAre;

// "8-4-4-4-12" upper-case hexadecimal digits.
bool isUpperCaseUuid(const std::string& text) {
  if (text.size() != 36) return false;
  for (std::size_t i = 0; i < text.size(); ++i) {
    bool dash = i == 8 || i == 13 || i == 18 || i == 23;
    char c = text[i];
    if (dash ? c != '-' : !((c >= '0' && c <= '9') || (c >= 'A' && c <= 'F'))) return false;
  }
  return true;
}

class SoftwareMapDiscoveryTest : public ServiceTest {
 protected:
  static std::vector<std::int64_t> statesOf(const std::vector<RecordingObserver::Call>& calls) {
    std::vector<std::int64_t> states;
    for (const auto& call : calls) states.push_back(call.state);
    return states;
  }
  static std::vector<std::string> pathsOf(const std::vector<RecordingObserver::Call>& calls,
                                          std::int64_t state) {
    std::vector<std::string> paths;
    for (const auto& call : calls) {
      if (call.state == state) paths.push_back(call.fieldsAtCall.bundlePath);
    }
    return paths;
  }
};

TEST_F(SoftwareMapDiscoveryTest, DiscoveryTakesStoreBundlesAndTheSetupHeraldOnly) {
  std::string store = makeStoreBundle(rootApplications(), "Store", "com.example.store", "1.0", 1);
  std::string herald = makeBundle(rootApplications(), "Install Something",
                                  "com.orvane.SetupHerald.Sonoma", "14.0", std::nullopt, "21A5");
  std::string plain =
      makeBundle(rootApplications(), "Plain", "com.example.plain", "1.0", std::nullopt);
  std::string malformed =
      makeBundle(rootApplications(), "Malformed", "com.example.malformed", "1.0", std::nullopt);
  writeText(malformed + "/purchase.plist", "<?xml version=\"1.0\"?><plist><dict><key>");
  std::string empty =
      makeBundle(homeApplications(), "Empty", "com.example.empty", "1.0", std::nullopt);
  writeText(empty + "/purchase.plist", "");
  std::string listRecord =
      makeBundle(homeApplications(), "ListRecord", "com.example.list", "1.0", std::nullopt);
  writePlist(listRecord + "/purchase.plist", PlistArray{"bundleIdentifier", "com.example.list"});
  // A damaged record of an installer is no reason to skip the installer.
  std::string damagedHerald = makeBundle(rootApplications(), "Damaged Herald",
                                         "com.orvane.SetupHeraldBeta", "1.0", std::nullopt, "7");
  writeText(damagedHerald + "/purchase.plist", "\x01\x02 not a property list");
  // Not a bundle: wrong extension, a file, too deep below /Applications.
  makeStoreBundle(rootApplications(), "Folder.notapp", "com.example.notapp", "1.0", 2);
  std::filesystem::rename(rootApplications() + "/Folder.notapp.app",
                          rootApplications() + "/Folder.notapp");
  writeText(rootApplications() + "/File.app", "not a folder");
  makeStoreBundle(rootApplications() + "/One/Two", "Deep", "com.example.deep", "1.0", 3);
  // Every kind of application folder is scanned.
  std::string nested =
      makeStoreBundle(rootApplications() + "/Games", "Nested", "com.example.nested", "1.0", 4);
  std::string volume =
      makeStoreBundle(volumeApplications("Backup"), "OnVolume", "com.example.volume", "1.0", 5);
  std::string home = makeStoreBundle(homeApplications(), "AtHome", "com.example.home", "1.0", 6);

  SoftwareMap map(options(storePath(), true));
  map.waitUntilIdle();
  std::vector<std::string> expected{store, herald, damagedHerald, nested, volume, home};
  std::sort(expected.begin(), expected.end());
  EXPECT_EQ(testing::pathsOf(map.allProducts()), expected);

  LedgerSoftwareProductRef setup = map.productForBundleIdentifier("com.orvane.SetupHerald.Sonoma");
  ASSERT_NE(setup, nullptr);
  LedgerSoftwareProductFields fields = setup->snapshot();
  EXPECT_EQ(fields.bundleVersion, "21A5") << "installers carry their build version";
  EXPECT_EQ(fields.itemIdentifier, std::nullopt);
  EXPECT_TRUE(fields.installed);
  EXPECT_EQ(fields.source, LedgerSoftwareProduct::kSourceRegistryOrPurchaseRecord);
  ASSERT_NE(map.productForBundleIdentifier("com.orvane.SetupHeraldBeta"), nullptr);
  EXPECT_EQ(map.productForBundleIdentifier("com.orvane.SetupHeraldBeta")->bundleVersion(), "7");
  for (const char* skipped : {"com.example.plain", "com.example.malformed", "com.example.empty",
                              "com.example.list", "com.example.notapp", "com.example.deep"}) {
    EXPECT_EQ(map.productForBundleIdentifier(skipped), nullptr) << skipped;
  }
}

TEST_F(SoftwareMapDiscoveryTest, RecoveryEnvironmentDisablesDiscovery) {
  makeStoreBundle(rootApplications(), "Store", "com.example.store", "1.0", 1);
  // Set at all, the empty value included, is recovery.
  struct Case {
    const char* value;  // nullptr: unset
    std::size_t productsFound;
  };
  for (const Case& c : {Case{nullptr, 1}, Case{"", 0}, Case{"1", 0}}) {
    const std::string value = c.value ? c.value : "";
    if (c.value)
      ::setenv("__OSINSTALL_ENVIRONMENT", c.value, 1);
    else
      ::unsetenv("__OSINSTALL_ENVIRONMENT");
    LogCapture log;
    // A store of its own: recovery keeps what an earlier case stored.
    SoftwareMap map(options(storePath(c.value ? "set-" + value : "unset"), true));
    map.waitUntilIdle();
    EXPECT_EQ(map.allProducts().size(), c.productsFound)
        << "value: " << (c.value ? value : "unset");
    EXPECT_EQ(log.countExactly("SoftwareMap: Running in recovery mode (" + value +
                                   ") - Disabling all software map sources",
                               1),
              c.value ? 1U : 0U)
        << log.dump();
  }
}

TEST_F(SoftwareMapDiscoveryTest, ReloadMergesIntoTheSameRecordsAndNotifiesInOrder) {
  std::string changedA =
      makeStoreBundle(rootApplications(), "ChangeA", "com.example.change-a", "1.0", 11, 1100);
  std::string changedB =
      makeStoreBundle(homeApplications(), "ChangeB", "com.example.change-b", "2.0", 12, 1200);
  std::string removedA =
      makeStoreBundle(rootApplications(), "GoneA", "com.example.gone-a", "1.0", 13);
  std::string removedB =
      makeStoreBundle(volumeApplications("V"), "GoneB", "com.example.gone-b", "1.0", 14);
  std::string steady =
      makeStoreBundle(rootApplications(), "Steady", "com.example.steady", "1.0", 15);

  SoftwareMap map(options(storePath(), true));
  map.waitUntilIdle();
  ASSERT_EQ(map.allProducts().size(), 5U);
  LedgerSoftwareProductRef recordA = map.productForBundleIdentifier("com.example.change-a");
  LedgerSoftwareProductRef recordB = map.productForItemIdentifier(12);
  LedgerSoftwareProductRef goneA = map.productForBundleIdentifier("com.example.gone-a");
  LedgerSoftwareProductRef goneB = map.productForBundleIdentifier("com.example.gone-b");
  LedgerSoftwareProductRef steadyRecord = map.productForBundleIdentifier("com.example.steady");
  ASSERT_TRUE(recordA && recordB && goneA && goneB && steadyRecord);
  ASSERT_EQ(recordA->snapshot().versionIdentifier, 1100);

  auto observer = std::make_shared<RecordingObserver>();
  std::string token = map.addObserver(observer);

  // A new version without an installer version; another with a new
  // account; two bundles gone; two new ones.
  writePlist(changedA + "/purchase.plist", Purchase{"com.example.change-a", "1.1", PlistValue(11),
                                                    PlistValue(), "account-ChangeA", 1600000000.0}
                                               .toDictionary());
  writePlist(changedB + "/purchase.plist", Purchase{"com.example.change-b", "2.0", PlistValue(12),
                                                    PlistValue(1200), "other-account", 1600000000.0}
                                               .toDictionary());
  std::filesystem::remove_all(removedA);
  std::filesystem::remove_all(removedB);
  std::string addedA = makeStoreBundle(rootApplications(), "NewA", "com.example.new-a", "1.0", 16);
  std::string addedB = makeStoreBundle(homeApplications(), "NewB", "com.example.new-b", "1.0", 17);

  map.reloadFromApplicationRegistry();
  map.waitUntilIdle();

  // The records callers hold now show the new values.
  EXPECT_EQ(map.productForBundleIdentifier("com.example.change-a"), recordA);
  LedgerSoftwareProductFields a = recordA->snapshot();
  EXPECT_EQ(a.bundleVersion, "1.1");
  EXPECT_EQ(a.versionIdentifier, std::nullopt);
  EXPECT_EQ(a.itemIdentifier, 11U);
  EXPECT_TRUE(a.installed);
  EXPECT_EQ(map.productForItemIdentifier(12), recordB);
  EXPECT_EQ(recordB->snapshot().accountOpaqueID, "other-account");
  EXPECT_EQ(map.productForBundleIdentifier("com.example.steady"), steadyRecord);

  // Removed records leave every index and say they are not installed.
  EXPECT_FALSE(goneA->snapshot().installed);
  EXPECT_FALSE(goneB->snapshot().installed);
  EXPECT_EQ(map.productForBundleIdentifier("com.example.gone-a"), nullptr);
  EXPECT_EQ(map.productForItemIdentifier(14), nullptr);
  ASSERT_NE(map.productForBundleIdentifier("com.example.new-b"), nullptr);
  EXPECT_EQ(map.productForItemIdentifier(17)->bundlePath(), addedB);
  EXPECT_EQ(map.allProducts().size(), 5U);

  std::vector<RecordingObserver::Call> calls = observer->calls();
  EXPECT_THAT(statesOf(calls), ElementsAre(kSoftwareProductAdded, kSoftwareProductAdded,
                                           kSoftwareProductChanged, kSoftwareProductChanged,
                                           kSoftwareProductRemoved, kSoftwareProductRemoved));
  EXPECT_THAT(pathsOf(calls, kSoftwareProductAdded), UnorderedElementsAre(addedA, addedB));
  EXPECT_THAT(pathsOf(calls, kSoftwareProductChanged), UnorderedElementsAre(changedA, changedB));
  EXPECT_THAT(pathsOf(calls, kSoftwareProductRemoved), UnorderedElementsAre(removedA, removedB));
  for (const auto& call : calls) {
    if (call.state == kSoftwareProductChanged && call.fieldsAtCall.bundlePath == changedA) {
      EXPECT_EQ(call.product, recordA) << "observers get the shared record";
      EXPECT_EQ(call.fieldsAtCall.bundleVersion, "1.1");
    }
    if (call.state == kSoftwareProductRemoved) {
      EXPECT_FALSE(call.fieldsAtCall.installed);
    }
  }

  // Nothing changed since: nothing to tell.
  observer->clear();
  map.reloadFromApplicationRegistry();
  map.waitUntilIdle();
  EXPECT_TRUE(observer->calls().empty());

  // The store follows the merge.
  map.removeObserverWithToken(token);
  SoftwareMap reread(options(storePath(), false));
  ASSERT_NE(reread.productForBundleIdentifier("com.example.change-a"), nullptr);
  EXPECT_EQ(reread.productForBundleIdentifier("com.example.change-a")->snapshot(), a);
  EXPECT_EQ(reread.productForBundleIdentifier("com.example.gone-b"), nullptr);
}

TEST_F(SoftwareMapDiscoveryTest, OnlyTheSourceDifferingIsNoChange) {
  std::string app =
      makeStoreBundle(rootApplications(), "Known", "com.example.known", "3.0", 21, 2100);
  // What discovery would read, but as the metadata query found it.
  LedgerSoftwareProductFields remembered = storedRecord(app, "com.example.known", "3.0", 21, 2100);
  remembered.accountOpaqueID = "account-Known";
  remembered.purchaseDate = PlistDate{1600000000.0};
  remembered.source = LedgerSoftwareProduct::kSourceMetadataQuery;
  writeBytes(storePath(), archivedStore({remembered}));

  SoftwareMap map(options(storePath(), false));
  LedgerSoftwareProductRef record = map.productForBundleIdentifier("com.example.known");
  ASSERT_NE(record, nullptr);
  auto observer = std::make_shared<RecordingObserver>();
  map.addObserver(observer);
  map.reloadFromApplicationRegistry();
  map.waitUntilIdle();
  EXPECT_TRUE(observer->calls().empty()) << "a change of source alone was announced";
  EXPECT_EQ(map.productForBundleIdentifier("com.example.known"), record);
  EXPECT_EQ(record->snapshot().source, LedgerSoftwareProduct::kSourceRegistryOrPurchaseRecord);

  // A real difference in the same situation is announced.
  record->update([](LedgerSoftwareProductFields& fields) { fields.accountOpaqueID = "stale"; });
  map.reloadFromApplicationRegistry();
  map.waitUntilIdle();
  ASSERT_EQ(observer->calls().size(), 1U);
  EXPECT_EQ(observer->calls()[0].state, kSoftwareProductChanged);
  EXPECT_EQ(record->snapshot().accountOpaqueID, "account-Known");
}

TEST_F(SoftwareMapDiscoveryTest, SingleBundleReadingAndBundleInfo) {
  std::string app = makeBundle(rootApplications(), "Reader", "com.example.reader", "4.2",
                               Purchase{"com.example.reader", "4.2", PlistValue("808"),
                                        PlistValue(9), "reader-account", std::nullopt},
                               "4200");
  LedgerSoftwareProductRef product = SoftwareMap::createSoftwareProductForAppAtPath(app);
  ASSERT_NE(product, nullptr);
  LedgerSoftwareProductFields fields = product->snapshot();
  EXPECT_EQ(fields.bundlePath, app);
  EXPECT_EQ(fields.bundleIdentifier, "com.example.reader");
  EXPECT_EQ(fields.bundleVersion, "4.2");
  EXPECT_EQ(fields.itemIdentifier, 808U);
  EXPECT_EQ(fields.versionIdentifier, 9);
  EXPECT_EQ(fields.accountOpaqueID, "reader-account");
  EXPECT_TRUE(fields.installed);

  EXPECT_EQ(SoftwareMap::createSoftwareProductForAppAtPath(rootApplications() + "/Missing.app"),
            nullptr);
  PlistDictionary info = SoftwareMap::bundleInfoFromBundleAtPath(app);
  EXPECT_EQ(PlistValue(info)["HostBundleVersion"], PlistValue("4200"));
  EXPECT_TRUE(SoftwareMap::bundleInfoFromBundleAtPath(rootApplications() + "/Missing.app").empty());
}

TEST_F(SoftwareMapDiscoveryTest, IconComesFromTheChosenBundlesResources) {
  std::string app = makeStoreBundle(rootApplications(), "Iconic", "com.example.iconic", "1.0", 41);
  std::filesystem::create_directories(app + "/resources");
  writeText(app + "/resources/AppIcon.png", "PNGDATA");
  SoftwareMap map(options(storePath(), true));
  map.waitUntilIdle();
  std::optional<PlistData> icon = map.iconDataForApplicationWithBundleID("com.example.iconic");
  ASSERT_TRUE(icon);
  EXPECT_EQ(std::string(icon->begin(), icon->end()), "PNGDATA");
  EXPECT_FALSE(map.iconDataForApplicationWithBundleID("com.example.nothing"));
}

// The service makes its map and starts accepting clients at once; a client
// that registers while the store is still loading must still hear about
// what the first discovery finds.
TEST_F(SoftwareMapDiscoveryTest, ObserverAddedDuringTheLoadHearsTheDiscovery) {
  std::vector<LedgerSoftwareProductFields> stored;
  for (int i = 0; i < 2000; ++i) {
    LedgerSoftwareProductFields fields;
    fields.bundlePath = "/Applications/Old" + std::to_string(i) + ".app";
    fields.bundleIdentifier = "com.example.old" + std::to_string(i);
    stored.push_back(fields);
  }
  writeBytes(storePath(), archivedStore(stored));
  std::string app = makeStoreBundle(rootApplications(), "Early", "com.example.early", "1.0", 51);
  TillLogManager::sharedManager().setLevel(1);
  auto observer = std::make_shared<RecordingObserver>();
  SoftwareMap map(options(storePath(), true));
  map.addObserver(observer);
  map.waitUntilIdle();
  EXPECT_THAT(pathsOf(observer->calls(), kSoftwareProductAdded), ElementsAre(app));
}

TEST_F(SoftwareMapDiscoveryTest, ObserverTokensAndRemoval) {
  SoftwareMap map(options(storePath(), false));

  LogCapture log;
  std::string nullToken = map.addObserver(nullptr);
  EXPECT_TRUE(isUpperCaseUuid(nullToken)) << nullToken;
  auto first = std::make_shared<RecordingObserver>();
  auto second = std::make_shared<RecordingObserver>();
  std::string firstToken = map.addObserver(first);
  std::string secondToken = map.addObserver(second);
  std::set<std::string> tokens{nullToken, firstToken, secondToken};
  for (int i = 0; i < 20; ++i) tokens.insert(map.addObserver(nullptr));
  EXPECT_EQ(tokens.size(), 23U) << "tokens repeat";
  EXPECT_TRUE(isUpperCaseUuid(firstToken)) << firstToken;

  // The null observer was never stored.
  map.removeObserverWithToken(nullToken);
  EXPECT_TRUE(log.hasOnce(
      "SoftwareMap: Could not find SoftwareMap observer to remove for token: " + nullToken, 3));

  auto product = std::make_shared<LedgerSoftwareProduct>(
      LedgerSoftwareProductFields{.bundlePath = "/Applications/Told.app"});
  map.notifyObserversAboutProduct(product, kSoftwareProductChanged);
  ASSERT_EQ(first->calls().size(), 1U);
  ASSERT_EQ(second->calls().size(), 1U);
  EXPECT_EQ(first->calls()[0].product, product);
  EXPECT_EQ(first->calls()[0].state, kSoftwareProductChanged);

  map.removeObserverWithToken(firstToken);
  EXPECT_TRUE(log.hasOnce("SoftwareMap: Removed SoftwareMap observer for token: " + firstToken, 3));
  map.notifyObserversAboutProduct(product, kSoftwareProductRemoved);
  EXPECT_EQ(first->calls().size(), 1U) << "a removed observer was still told";
  ASSERT_EQ(second->calls().size(), 2U);
  EXPECT_EQ(second->calls()[1].state, kSoftwareProductRemoved);

  // A second removal finds nothing.
  map.removeObserverWithToken(firstToken);
  EXPECT_TRUE(log.hasOnce(
      "SoftwareMap: Could not find SoftwareMap observer to remove for token: " + firstToken, 3));
  map.removeObserverWithToken(secondToken);
}

}  // namespace
}  // namespace larder::testing
