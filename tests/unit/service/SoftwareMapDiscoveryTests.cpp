// Discovery of installed bundles and its merge into the records the map
// already holds; the notices observers get about it.
#include <gtest/gtest.h>

#include <filesystem>
#include <regex>
#include <set>
#include <string>
#include <vector>

#include "ServiceTestSupport.h"
#include "software-map/SoftwareMap.h"

namespace larder::testing {
namespace {

using SoftwareMapDiscoveryTest = ServiceTest;

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
  EXPECT_EQ(pathsOf(map.allProducts()), expected);

  // Installers carry their build version.
  EXPECT_EQ(map.productForBundleIdentifier("com.orvane.SetupHerald.Sonoma")->snapshot(),
            storedRecord(herald, "com.orvane.SetupHerald.Sonoma", "21A5"));
  EXPECT_EQ(map.productForBundleIdentifier("com.orvane.SetupHeraldBeta")->bundleVersion(), "7");
}

// Set at all is recovery, even when empty.
TEST_F(SoftwareMapDiscoveryTest, AnEmptyRecoveryVariableStillDisablesDiscovery) {
  makeStoreBundle(rootApplications(), "Store", "com.example.store", "1.0", 1);
  ::setenv("__OSINSTALL_ENVIRONMENT", "", 1);
  LogCapture log;
  SoftwareMap map(options(storePath(), true));
  map.waitUntilIdle();
  EXPECT_TRUE(map.allProducts().empty());
  EXPECT_TRUE(log.hasOnce(
      "SoftwareMap: Running in recovery mode () - Disabling all software map sources", 1));
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
  makeStoreBundle(rootApplications(), "Steady", "com.example.steady", "1.0", 15);
  SoftwareMap map(options(storePath(), true));
  map.waitUntilIdle();
  ASSERT_EQ(map.allProducts().size(), 5U);
  LedgerSoftwareProductRef recordA = map.productForBundleIdentifier("com.example.change-a");
  LedgerSoftwareProductRef recordB = map.productForItemIdentifier(12);
  LedgerSoftwareProductRef goneA = map.productForBundleIdentifier("com.example.gone-a");
  LedgerSoftwareProductRef steady = map.productForBundleIdentifier("com.example.steady");
  auto observer = std::make_shared<RecordingObserver>();
  std::string token = map.addObserver(observer);

  // A new version without an installer version; another with a new
  // account; two bundles gone; two new ones.
  Purchase newA{"com.example.change-a", "1.1",       PlistValue(11), PlistValue(),
                "account-ChangeA",      1600000000.0};
  writePlist(changedA + "/purchase.plist", newA.toDictionary());
  writePlist(changedB + "/purchase.plist", Purchase{"com.example.change-b", "2.0", PlistValue(12),
                                                    PlistValue(1200), "other-account", 1600000000.0}
                                               .toDictionary());
  std::filesystem::remove_all(removedA);
  std::filesystem::remove_all(removedB);
  std::string addedA = makeStoreBundle(rootApplications(), "NewA", "com.example.new-a", "1.0", 16);
  std::string addedB = makeStoreBundle(homeApplications(), "NewB", "com.example.new-b", "1.0", 17);
  map.reloadFromApplicationRegistry();
  map.waitUntilIdle();

  // The records callers hold show the new values; removed ones leave every
  // index and say they are not installed.
  LedgerSoftwareProductFields a = storedRecord(changedA, "com.example.change-a", "1.1", 11);
  a.accountOpaqueID = newA.account;
  a.purchaseDate = PlistDate{*newA.purchaseDate};
  EXPECT_EQ(recordA->snapshot(), a);
  EXPECT_EQ(map.productForBundleIdentifier("com.example.change-a"), recordA);
  EXPECT_EQ(map.productForItemIdentifier(12), recordB);
  EXPECT_EQ(recordB->snapshot().accountOpaqueID, "other-account");
  EXPECT_EQ(map.productForBundleIdentifier("com.example.steady"), steady);
  EXPECT_FALSE(goneA->snapshot().installed);
  EXPECT_EQ(map.productForBundleIdentifier("com.example.gone-a"), nullptr);
  EXPECT_EQ(map.productForItemIdentifier(14), nullptr);
  EXPECT_EQ(map.productForItemIdentifier(17)->bundlePath(), addedB);
  EXPECT_EQ(map.allProducts().size(), 5U);

  std::vector<std::int64_t> states;
  std::vector<std::string> told;
  const auto line = [](std::int64_t state, const std::string& path, const std::string& version,
                       bool installed = true) {
    return std::to_string(state) + " " + path + " " + version + (installed ? "" : " gone");
  };
  for (const auto& call : observer->calls()) {
    states.push_back(call.state);
    const LedgerSoftwareProductFields& f = call.fieldsAtCall;
    told.push_back(line(call.state, f.bundlePath, f.bundleVersion.value_or(""), f.installed));
    if (f.bundlePath == changedA) EXPECT_EQ(call.product, recordA) << "the shared record";
  }
  EXPECT_EQ(states, (std::vector<std::int64_t>{kSoftwareProductAdded, kSoftwareProductAdded,
                                               kSoftwareProductChanged, kSoftwareProductChanged,
                                               kSoftwareProductRemoved, kSoftwareProductRemoved}));
  std::vector<std::string> expected{line(kSoftwareProductAdded, addedA, "1.0"),
                                    line(kSoftwareProductAdded, addedB, "1.0"),
                                    line(kSoftwareProductChanged, changedA, "1.1"),
                                    line(kSoftwareProductChanged, changedB, "2.0"),
                                    line(kSoftwareProductRemoved, removedA, "1.0", false),
                                    line(kSoftwareProductRemoved, removedB, "1.0", false)};
  std::sort(told.begin(), told.end());
  std::sort(expected.begin(), expected.end());
  EXPECT_EQ(told, expected);

  // Nothing changed since: nothing to tell.
  map.reloadFromApplicationRegistry();
  map.waitUntilIdle();
  EXPECT_EQ(observer->calls().size(), 6U);

  // The store follows the merge.
  map.removeObserverWithToken(token);
  SoftwareMap reread(options(storePath(), false));
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
  std::vector<std::string> added;
  for (const auto& call : observer->calls()) {
    if (call.state == kSoftwareProductAdded) added.push_back(call.fieldsAtCall.bundlePath);
  }
  EXPECT_EQ(added, std::vector<std::string>{app});
}

TEST_F(SoftwareMapDiscoveryTest, ObserverTokensAreDistinctUuidsAndRemovedObserversAreNotTold) {
  SoftwareMap map(options(storePath(), false));
  LogCapture log;
  auto first = std::make_shared<RecordingObserver>();
  auto second = std::make_shared<RecordingObserver>();
  const std::string firstToken = map.addObserver(first);
  const std::string nullToken = map.addObserver(nullptr);
  std::set<std::string> tokens{firstToken, nullToken, map.addObserver(second)};
  for (int i = 0; i < 20; ++i) tokens.insert(map.addObserver(nullptr));
  EXPECT_EQ(tokens.size(), 23U) << "tokens repeat";
  for (const std::string& token : tokens) {
    EXPECT_TRUE(std::regex_match(token, std::regex("[0-9A-F]{8}(-[0-9A-F]{4}){3}-[0-9A-F]{12}")))
        << token;
  }
  auto product = std::make_shared<LedgerSoftwareProduct>(
      LedgerSoftwareProductFields{.bundlePath = "/Applications/Told.app"});
  map.notifyObserversAboutProduct(product, kSoftwareProductChanged);
  map.removeObserverWithToken(firstToken);
  map.notifyObserversAboutProduct(product, kSoftwareProductRemoved);
  ASSERT_EQ(first->calls().size(), 1U) << "a removed observer was still told";
  EXPECT_EQ(first->calls()[0].product, product);
  EXPECT_EQ(first->calls()[0].state, kSoftwareProductChanged);
  ASSERT_EQ(second->calls().size(), 2U);
  EXPECT_EQ(second->calls()[1].state, kSoftwareProductRemoved);
  EXPECT_TRUE(log.hasOnce("SoftwareMap: Removed SoftwareMap observer for token: " + firstToken, 3));

  // A null observer was never stored, and a second removal finds nothing.
  for (const std::string& token : {nullToken, firstToken}) {
    map.removeObserverWithToken(token);
    EXPECT_TRUE(log.hasOnce(
        "SoftwareMap: Could not find SoftwareMap observer to remove for token: " + token, 3));
  }
}

}  // namespace
}  // namespace larder::testing
