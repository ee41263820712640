// The service as its clients see it: larderd on a private bus with a
// temporary platform, spoken to over D-Bus.
#include <gtest/gtest.h>

#include <sdbus-c++/Error.h>
#include <sdbus-c++/IProxy.h>
#include <csignal>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <mutex>
#include <nlohmann/json.hpp>

#include "client/ServiceRequests.h"
#include "platform/plist/KeyedArchive.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/http/VendGzip.h"
#include "tests/integration/LarderctlProcess.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;

class ServiceTest : public ::testing::Test {
 protected:
  std::string installStoreApp(const std::string& folder, const std::string& name,
                              const std::string& identifier, const std::string& version,
                              std::uint64_t itemIdentifier, const std::string& icon = "") {
    return platform.installBundle({folder, name, identifier, version, itemIdentifier, 1, icon});
  }
  std::string applications() const { return platform.root() + "/Applications"; }
  std::string homeApplications() const { return platform.home() + "/Applications"; }

  std::unique_ptr<ServiceProcess> startService(std::vector<std::string> arguments = {},
                                               std::map<std::string, std::string> env = {}) {
    auto service =
        std::make_unique<ServiceProcess>(platform, bus, std::move(arguments), std::move(env));
    EXPECT_TRUE(service->waitUntilServing()) << service->log();
    return service;
  }

  // Runs the service once, to its first write of the map.
  void persistTheMap() {
    auto first = startService();
    ASSERT_TRUE(first->waitForLog("Updated persisted SoftwareMap at")) << first->log();
    first->stop();
  }

  TemporaryPlatform platform;
  PrivateBus bus;
};

// The dictionary the request answers with; empty when it answers none.
PlistDictionary ask(ServiceClient& client, const std::string& request, PlistArray arguments) {
  const PlistArray reply = client.call(request, std::move(arguments));
  const PlistDictionary* dictionary = reply.empty() ? nullptr : reply.at(0).dictionary();
  return dictionary ? *dictionary : PlistDictionary{};
}

std::string field(const PlistDictionary& record, const std::string& key) {
  auto found = record.find(key);
  if (found == record.end()) return "<absent>";
  if (const std::string* text = found->second.string()) return *text;
  return std::to_string(found->second.int64Value());
}

TEST_F(ServiceTest, AnswersLookupsForDiscoveredStoreSoftware) {
  std::string foo =
      installStoreApp(applications(), "Foo", "com.example.foo", "2.1", 1001, "PNGDATA");
  installStoreApp(homeApplications(), "Bar", "com.example.bar", "1.0", 1002);
  std::string plain = platform.installBundle({applications(), "Plain", "com.example.plain"});
  auto service = startService();
  ASSERT_TRUE(service->waitForLog("MetadataQuery initial load took")) << service->log();
  auto client = connectClient(bus);

  PlistArray all = client->call("AllProducts", {});
  ASSERT_TRUE(all.at(0).array());
  EXPECT_EQ(all.at(0).array()->size(), 2u) << "software without purchase record is not in the map";

  PlistDictionary byBundle = ask(*client, "ProductForBundleIdentifier", {"com.example.foo"});
  EXPECT_EQ(field(byBundle, "bundlePath"), foo);
  EXPECT_EQ(field(byBundle, "bundleVersion"), "2.1");
  EXPECT_EQ(field(byBundle, "itemIdentifier"), "1001");
  EXPECT_EQ(field(byBundle, "accountOpaqueID"), "account-1");
  EXPECT_EQ(field(byBundle, "source"), "2") << "the live query has taken the record over";
  EXPECT_EQ(field(byBundle, "installed"), "1");

  PlistDictionary byItem = ask(*client, "ProductForItemIdentifier", {std::uint64_t{1002}});
  EXPECT_EQ(field(byItem, "bundleIdentifier"), "com.example.bar");
  EXPECT_TRUE(ask(*client, "ProductForItemIdentifier", {std::uint64_t{0}}).empty());
  EXPECT_TRUE(ask(*client, "ProductForBundleIdentifier", {"com.example.none"}).empty());

  PlistDictionary created = ask(*client, "CreateSoftwareProductForAppAtPath", {plain});
  EXPECT_EQ(field(created, "bundleIdentifier"), "com.example.plain");
  EXPECT_EQ(field(created, "itemIdentifier"), "<absent>");
  EXPECT_TRUE(ask(*client, "CreateSoftwareProductForAppAtPath", {plain + "/missing"}).empty());

  PlistDictionary info = ask(*client, "BundleInfoFromBundleAtPath", {foo});
  EXPECT_EQ(field(info, "HostBundleIdentifier"), "com.example.foo");
  PlistArray icon = client->call("IconForApplicationWithBundeID", {"com.example.foo"});
  ASSERT_TRUE(icon.at(0).data());
  EXPECT_EQ(std::string(icon.at(0).data()->begin(), icon.at(0).data()->end()), "PNGDATA");
}

TEST_F(ServiceTest, PrefersTheCopyInTheApplicationsFolder) {
  installStoreApp(homeApplications(), "Twin", "com.example.twin", "3.0", 77);
  std::string preferred = installStoreApp(applications(), "Twin", "com.example.twin", "3.0", 77);
  auto service = startService();
  ASSERT_TRUE(service->waitForLog("Software map rebuild took"));
  auto client = connectClient(bus);
  PlistDictionary product = ask(*client, "ProductForBundleIdentifier", {"com.example.twin"});
  EXPECT_EQ(field(product, "bundlePath"), preferred);
  EXPECT_EQ(field(ask(*client, "ProductForItemIdentifier", {std::uint64_t{77}}), "bundlePath"),
            preferred);
  EXPECT_FALSE(service->logLines("Preferring (in /Applications)").empty());
}

// systemd and the end of a session stop the service with SIGTERM, a
// terminal with SIGINT: the change the map has just taken reaches the disk
// before the service exits 0. The fillers make the write take a while.
TEST_F(ServiceTest, AStopSignalFinishesTheQueuedWritesAndExitsZero) {
  for (int index = 0; index < 400; ++index) {
    const std::string name = "Filler" + std::to_string(index);
    installStoreApp(applications(), name, "com.example.filler" + std::to_string(index), "1.0",
                    static_cast<std::uint64_t>(20000 + index));
  }
  for (const int signal : {SIGTERM, SIGINT}) {
    SCOPED_TRACE(strsignal(signal));
    auto service = startService();
    ASSERT_TRUE(service->waitForLog("Software map rebuild took")) << service->log();
    const std::string identifier = "com.example.late" + std::to_string(signal);
    const std::string late = installStoreApp(applications(), "Late" + std::to_string(signal),
                                             identifier, "1.0", static_cast<std::uint64_t>(signal));
    auto client = connectClient(bus);
    ASSERT_TRUE(eventually(
        [&] { return !ask(*client, "ProductForBundleIdentifier", {identifier}).empty(); }));
    EXPECT_EQ(service->process().stop(signal), 0) << service->log();
    EXPECT_EQ(service->logLines("larderd: stopped").size(), 1u) << service->log();
    const auto stored = FileIO::read(platform.persistedStorePath());
    ASSERT_TRUE(stored);
    EXPECT_NE(std::string(stored->begin(), stored->end()).find(late), std::string::npos);
  }
}

// The transport, the digests and the unpacker are opened on first use:
// a service that has not spoken to a store maps none of them.
TEST_F(ServiceTest, AnIdleServiceMapsNeitherTheTransportNorTheUnpacker) {
  installStoreApp(applications(), "Foo", "com.example.foo", "1.0", 5);
  auto service = startService();
  ASSERT_TRUE(service->waitForLog("Software map rebuild took")) << service->log();
  std::ifstream maps("/proc/" + std::to_string(service->process().pid()) + "/maps");
  const std::string mapped((std::istreambuf_iterator<char>(maps)),
                           std::istreambuf_iterator<char>());
  ASSERT_NE(mapped.find("libc.so"), std::string::npos);
  for (const char* library : {"libcurl.so", "libcrypto.so", "libarchive.so"}) {
    EXPECT_EQ(mapped.find(library), std::string::npos) << library;
  }
}

// In recovery mode the persisted store alone answers and is never written;
// a damaged one costs one line and leaves the map empty.
TEST_F(ServiceTest, RecoveryModeAnswersFromThePersistedStoreAndNeverChangesIt) {
  const std::string foo = installStoreApp(applications(), "Foo", "com.example.foo", "1.0", 5);
  persistTheMap();
  fs::remove_all(foo);
  const PlistData good = *FileIO::read(platform.persistedStorePath());
  const std::vector<std::pair<std::string, PlistData>> stores{
      {"intact", good},
      {"truncated", PlistData(good.begin(), good.begin() + static_cast<long>(good.size() / 2))},
      {"garbage", PlistData(300, 0xA5)},
      {"wrong root", KeyedArchive::archivedData(KeyedArchive::array({PlistValue("x")}))},
  };
  for (const auto& [name, bytes] : stores) {
    SCOPED_TRACE(name);
    ASSERT_TRUE(FileIO::writeAtomically(platform.persistedStorePath(), bytes));
    auto service = startService({}, {{"__OSINSTALL_ENVIRONMENT", "1"}});
    auto client = connectClient(bus);
    const PlistArray all = client->call("AllProducts", {});
    ASSERT_TRUE(all.at(0).array());
    EXPECT_EQ(all.at(0).array()->size(), bytes == good ? 1u : 0u);
    if (bytes == good) {
      EXPECT_EQ(
          field(ask(*client, "ProductForBundleIdentifier", {"com.example.foo"}), "bundlePath"),
          foo);
    } else {
      // Its own line aside, the damage costs exactly one level 1 line.
      EXPECT_EQ(service->logLines("<3>").size() - service->logLines("recovery mode").size(), 1u)
          << service->log();
      EXPECT_EQ(
          service->logLines("Persisted SoftwareMap did not contain appsByPath dictionary.").size(),
          1u);
    }
    EXPECT_EQ(service->logLines("Running in recovery mode (1) - Disabling all software map sources")
                  .size(),
              1u);
    EXPECT_TRUE(service->logLines("Software map rebuild took").empty());
    EXPECT_TRUE(service->process().isRunning());
    service.reset();
    EXPECT_EQ(FileIO::read(platform.persistedStorePath()), bytes);
  }
}

TEST_F(ServiceTest, BadRequestsGetAnEmptyAnswerOrANamedErrorAndTheServiceGoesOn) {
  installStoreApp(applications(), "Foo", "com.example.foo", "1.0", 5);
  auto service = startService();
  auto connection = bus.connect();
  auto proxy = sdbus::createProxy(*connection, "com.orvane.larderd", "/com/orvane/larderd");
  const std::string interface(ServiceRequests::kInterfaceName);
  EXPECT_THROW(
      proxy->callMethod("ProductForBundleIdentifier").onInterface(interface).withArguments(42),
      sdbus::Error);
  EXPECT_THROW(proxy->callMethod("ProductForItemIdentifier")
                   .onInterface(interface)
                   .withArguments(std::string("x")),
               sdbus::Error);
  EXPECT_THROW(proxy->callMethod("NoSuchRequest").onInterface(interface), sdbus::Error);
  // A store client of the wrong shape is taken as it comes.
  std::map<std::string, sdbus::Variant> odd{{"identifier", sdbus::Variant(std::int32_t{7})},
                                            {"clientType", sdbus::Variant(std::string("x"))}};
  EXPECT_NO_THROW(proxy->callMethod("SetStoreClient").onInterface(interface).withArguments(odd));

  auto client = connectClient(bus);
  ASSERT_TRUE(service->waitForLog("Software map rebuild took"));
  EXPECT_EQ(
      field(ask(*client, "ProductForBundleIdentifier", {"com.example.foo"}), "itemIdentifier"),
      "5");
  client->presentStoreClient(0);
  EXPECT_EQ(client->call("AvailableUpdatesBadgeCount", {}).at(0).uint64Value(), 0u);
  PlistArray incompatible = client->call("IncompatibleUpdates", {});
  ASSERT_EQ(incompatible.size(), 1u);
  EXPECT_TRUE(incompatible.at(0).array() && incompatible.at(0).array()->empty());
  // A short timeout tells an error that comes at once from silence.
  auto quick = std::make_unique<ServiceClient>(bus.connect(), "com.orvane.larderd", 2'000'000);
  const auto errorOf = [](const std::function<void()>& call) {
    try {
      call();
    } catch (const sdbus::Error& error) {
      return error.getName();
    }
    return std::string("(answered)");
  };
  EXPECT_EQ(errorOf([&] { quick->call("PollForPurchasedBooks", {}); }),
            "com.orvane.larderd.Error.NotAvailable")
      << "its reply belongs to the book library";
  EXPECT_EQ(errorOf([&] { quick->call("UnhideAllOSUpdates", {}); }),
            "com.orvane.larderd.Error.NoStoreClient")
      << "no store client, so no update controller";
  EXPECT_EQ(errorOf([&] { quick->call("CheckForUpdatesWithUserHasSeenUpdates", {false}); }),
            "com.orvane.larderd.Error.NoStoreClient")
      << "no store client, so no update queue";
  EXPECT_TRUE(service->process().isRunning());
}

TEST_F(ServiceTest, TheUpdateRequestBodyListsTheInstalledStoreSoftware) {
  const std::string ledger =
      installStoreApp(applications(), "Ledger", "com.example.ledger", "1.4", 4242);
  auto service = startService();
  auto client = connectClient(bus);
  client->presentStoreClient(0);
  ASSERT_TRUE(eventually([&] {
    const PlistArray found =
        client->call("ProductForBundleIdentifier", {std::string("com.example.ledger")});
    return found.at(0).dictionary() && !found.at(0).dictionary()->empty();
  }));
  PlistArray reply =
      client->call("HttpPostBodyWithInstalledAppsBundledAppsConditionally", {true, false, false});
  ASSERT_EQ(reply.size(), 3u);
  ASSERT_TRUE(reply.at(0).data());
  EXPECT_TRUE(reply.at(1).boolValue()) << "the body is asked for compressed";
  EXPECT_FALSE(reply.at(2).boolValue()) << "no bundled software was asked for";
  auto xml = VendCopyGunzippedDataForData(*reply.at(0).data());
  ASSERT_TRUE(xml);
  auto body = PropertyListSerialization::read(*xml);
  ASSERT_TRUE(body);
  const PlistArray* local = (*body)["local-software"].array();
  ASSERT_TRUE(local);
  ASSERT_EQ(local->size(), 1u);
  EXPECT_EQ(*(*local)[0]["ware-id"].string(), "4242");
  EXPECT_FALSE((*body)["bundled-software"].array());
}

TEST_F(ServiceTest, ModeFollowsTheArgumentsAndAnIgnoredOneIsNamed) {
  struct Case {
    std::vector<std::string> arguments;
    std::string busName;
    std::string logLine;
  };
  const std::string kStarted = "int main(int, const char **)";
  for (const Case& c :
       {Case{{"daemon"}, "com.orvane.larderd.daemon", kStarted},
        Case{{"daemon", "extra"}, "com.orvane.larderd", kStarted},
        Case{{"Daemon"}, "com.orvane.larderd", kStarted},
        Case{{"--help"},
             "com.orvane.larderd",
             "larderd " LARDER_VERSION ": ignoring \"--help\" (the only argument is \"daemon\"); "
             "serving as com.orvane.larderd."}}) {
    SCOPED_TRACE(::testing::PrintToString(c.arguments));
    ServiceProcess service(platform, bus, c.arguments);
    EXPECT_TRUE(service.waitUntilServing(c.busName)) << service.log();
    EXPECT_TRUE(eventually([&] { return service.logLines(c.logLine).size() == 1; }))
        << service.log();
    service.stop();
  }
}

// The callbacks a client's observer object receives: (a text field of the
// product, state).
struct Heard {
  std::mutex mutex;
  std::vector<std::pair<std::string, std::int64_t>> calls;
  std::vector<std::pair<std::string, std::int64_t>> snapshot() {
    std::lock_guard lock(mutex);
    return calls;
  }
  std::size_t size() { return snapshot().size(); }
  // An observer that records `key` of each product it hears of.
  std::function<void(const PlistValue&, std::int64_t)> recording(const std::string& key) {
    return [this, key](const PlistValue& product, std::int64_t state) {
      std::lock_guard lock(mutex);
      calls.emplace_back(product[key].string() ? *product[key].string() : "", state);
    };
  }
};

// Observers on the bus, `larderctl --json watch` among them, hear an
// announced update once.
TEST_F(ServiceTest, ObserversHearChangesAndAGoneClientCostsNothing) {
  std::string foo = installStoreApp(applications(), "Foo", "com.example.foo", "1.0", 5);
  auto service = startService();
  ASSERT_TRUE(service->waitForLog("Software map rebuild took"));
  Larderctl watch(platform, bus, std::vector<std::string>{"--json", "watch"}, "watch");
  ASSERT_TRUE(service->waitForLog("SoftwareMap added observer with token"));

  auto staying = connectClient(bus);
  Heard heard;
  staying->exportSoftwareMapObserver("/test/Observer", heard.recording("bundleVersion"));
  std::string token = *staying->call("AddSoftwareMapObserver", {"/test/Observer"}).at(0).string();
  {
    auto leaving = connectClient(bus);
    leaving->exportSoftwareMapObserver("/test/Observer", [](const PlistValue&, std::int64_t) {});
    leaving->call("AddSoftwareMapObserver", {"/test/Observer"});
  }
  std::string emptyToken = *staying->call("AddSoftwareMapObserver", {"/"}).at(0).string();
  EXPECT_NE(emptyToken, token);

  auto updater = connectClient(bus);
  updater->call("ProductAtPathWillBeUpdatedToBundleVersionStoreVersion",
                {foo, "2.0", std::int64_t{9}});
  // The whole bundle is replaced, as an install does: a scan that comes
  // after the announcement finds 2.0 too, not a record that says 2.0 beside
  // an information list that still says 1.0.
  platform.installBundle({applications(), "Foo", "com.example.foo", "2.0", 5, 9});
  updater->call("ProductAtPathWasUpdatedToBundleVersionStoreVersion",
                {foo, true, "2.0", std::int64_t{9}});

  ASSERT_TRUE(eventually([&] { return heard.size() >= 1; })) << service->log();
  EXPECT_EQ(heard.snapshot(), (std::vector{std::make_pair(std::string("2.0"), std::int64_t{2})}));
  EXPECT_EQ(
      field(ask(*updater, "ProductForBundleIdentifier", {"com.example.foo"}), "bundleVersion"),
      "2.0");
  EXPECT_TRUE(service->logLines("does not match expected value").empty());
  ASSERT_TRUE(eventually([&] { return watch.output().find('\n') != std::string::npos; }));
  const auto printed = nlohmann::json::parse(watch.output().substr(0, watch.output().find('\n')));
  EXPECT_EQ(printed["stateName"], "Changed");
  EXPECT_EQ(printed["product"]["bundleVersion"], "2.0");
  const auto removed = service->logLines("Removed SoftwareMap observer for token").size();
  EXPECT_EQ(watch.process().stop(SIGINT), 0);
  EXPECT_TRUE(eventually([&] {
    return service->logLines("Removed SoftwareMap observer for token").size() > removed;
  })) << "SIGINT unregisters the watch";

  staying->call("RemoveSoftwareMapObserver", {token});
  staying->call("RemoveSoftwareMapObserver", {emptyToken});
  EXPECT_EQ(
      service->logLines("Could not find SoftwareMap observer to remove for token: " + emptyToken)
          .size(),
      1u);
  EXPECT_TRUE(service->process().isRunning());
}

TEST_F(ServiceTest, TheMapFollowsTheDiskAndAnnouncedUpdatesStayQuiet) {
  std::string staged = platform.directory() + "/staging";
  fs::create_directories(staged);
  std::string kept = installStoreApp(applications(), "Kept", "com.example.kept", "1.0", 11);
  auto service = startService();
  ASSERT_TRUE(service->waitForLog("MetadataQuery initial load took")) << service->log();

  auto client = connectClient(bus);
  Heard heard;
  client->exportSoftwareMapObserver("/test/Changes", heard.recording("bundlePath"));
  client->call("AddSoftwareMapObserver", {"/test/Changes"});

  // A bundle copied in: one Added.
  std::string prepared = installStoreApp(staged, "Fresh", "com.example.fresh", "1.0", 12);
  std::string fresh = applications() + "/Fresh.app";
  fs::rename(prepared, fresh);
  ASSERT_TRUE(eventually([&] { return heard.size() >= 1; })) << service->log();
  EXPECT_EQ(heard.snapshot().at(0), std::make_pair(fresh, std::int64_t{0}));
  EXPECT_EQ(field(ask(*client, "ProductForItemIdentifier", {std::uint64_t{12}}), "bundlePath"),
            fresh);

  // Its purchase record edited: Changed.
  TemporaryPlatform::writePurchaseRecord(fresh, "com.example.fresh", "1.0", 12, 99);
  ASSERT_TRUE(eventually([&] { return heard.size() >= 2; })) << service->log();
  EXPECT_EQ(heard.snapshot().at(1), std::make_pair(fresh, std::int64_t{2}));

  // An announced update that replaces the bundle: no Removed, no Added; the
  // record keeps its identity and the report tells the change once.
  client->call("ProductAtPathWillBeUpdatedToBundleVersionStoreVersion",
               {kept, "2.0", std::int64_t{2}});
  std::string replacement = installStoreApp(staged, "Kept", "com.example.kept", "2.0", 11);
  TemporaryPlatform::writePurchaseRecord(replacement, "com.example.kept", "2.0", 11, 2);
  fs::remove_all(kept);
  fs::rename(replacement, kept);
  ASSERT_TRUE(service->waitForLog("App reported as removed in MetadataQuery update, but ignoring"))
      << service->log();
  client->call("ProductAtPathWasUpdatedToBundleVersionStoreVersion",
               {kept, true, "2.0", std::int64_t{2}});
  EXPECT_EQ(field(ask(*client, "ProductForBundleIdentifier", {"com.example.kept"}), "bundlePath"),
            kept);

  // Deleted: Removed.
  fs::remove_all(fresh);
  ASSERT_TRUE(eventually([&] {
    auto calls = heard.snapshot();
    return std::find(calls.begin(), calls.end(), std::make_pair(fresh, std::int64_t{1})) !=
           calls.end();
  })) << service->log();
  for (const auto& [path, state] : heard.snapshot()) {
    EXPECT_FALSE(path == kept && (state == 0 || state == 1))
        << "the announced update was told as " << state;
  }
  EXPECT_TRUE(ask(*client, "ProductForItemIdentifier", {std::uint64_t{12}}).empty());
}

TEST_F(ServiceTest, OlderSoftwareOfTheMakerIsFoundFromItsMinimumVersionOn) {
  platform.installBundle({applications(), "Snapbox", "com.orvane.Snapbox", "9.1.2"});
  platform.installBundle({applications(), "Quire", "com.orvane.Anvil.Quire", "4.0"});
  platform.installBundle({applications(), "Tally", "com.orvane.Anvil.Tally", "1.9"});
  platform.installBundle({applications(), "Unlisted", "com.orvane.Unlisted", "50.0"});
  auto service = startService();
  ASSERT_TRUE(eventually([&] {
    return service->logLines("MetadataQuery initial load took").size() >= 2;
  })) << service->log();
  auto client = connectClient(bus);
  PlistDictionary snapbox = ask(*client, "ProductForBundleIdentifier", {"com.orvane.Snapbox"});
  EXPECT_EQ(field(snapbox, "itemIdentifier"), "400000101");
  EXPECT_EQ(field(snapbox, "versionIdentifier"), "0");
  EXPECT_EQ(field(snapbox, "isLegacyApp"), "1");
  EXPECT_EQ(field(snapbox, "source"), "3");
  EXPECT_FALSE(ask(*client, "ProductForBundleIdentifier", {"com.orvane.Anvil.Quire"}).empty())
      << "exactly the minimum version is enough";
  EXPECT_TRUE(ask(*client, "ProductForBundleIdentifier", {"com.orvane.Anvil.Tally"}).empty());
  EXPECT_TRUE(ask(*client, "ProductForBundleIdentifier", {"com.orvane.Unlisted"}).empty());
}

}  // namespace
}  // namespace larder::testing
