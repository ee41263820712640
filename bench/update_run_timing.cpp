// One background update run from start to end, as a program to be timed
// from outside against `curl-and-tar.sh` (fetching and unpacking the same
// packages with public tools).
//
//   larder-update-run-timing --prepare DIR
//     lays out DIR/catalogue (a larder-store catalogue of 100 items whose
//     2.0 packages hold a 1 MiB program) and DIR/pristine (the installed 1.0
//     bundles, each with its purchase record).
//   larder-update-run-timing --run DIR
//     copies DIR/pristine to a fresh DIR/work, starts larder-store on
//     loopback, signs in, runs ONE background run that checks the store,
//     stages and installs every update, and exits 0 only when all 100
//     bundles are at 2.0.
//
// The copy of the 1.0 bundles is in every run on both sides, so the two
// commands do the same work around the update itself.

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <stdexcept>
#include <string>

#include "bench/BenchFiles.h"
#include "bench/BenchProcesses.h"
#include "bench/BenchStoreProcess.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendAccountService.h"
#include "store-runtime/services/VendServiceProxy.h"
#include "update-controller/UpdateController.h"
#include "update-operation/UpdateOperation.h"

namespace {

namespace fs = std::filesystem;
using namespace larder;

constexpr int kItems = 100;
constexpr std::size_t kPayloadBytes = 1u << 20u;
constexpr std::size_t kInstalledPayloadBytes = 4096;
constexpr std::uint64_t kFirstWareID = 50000;
constexpr char kAccountName[] = "bench@example.com";
constexpr char kPassword[] = "pw";
constexpr char kOpaqueAccountID[] = "account-1";

std::string appName(int index) {
  return "App" + std::to_string(index);
}
std::uint64_t wareID(int index) {
  return kFirstWareID + static_cast<std::uint64_t>(index);
}

void writePlist(const fs::path& path, const PlistDictionary& contents) {
  bench::writeFixture(path.string(), PropertyListSerialization::writeXml(contents));
}

// A bundle "<folder>/AppN.app" at `version` with a purchase record and a
// program of `payloadBytes` bytes that differ from app to app and version
// to version, so that nothing is shared or compressible.
fs::path writeBundle(const fs::path& folder, int index, const std::string& version,
                     std::size_t payloadBytes) {
  const fs::path bundle = folder / (appName(index) + ".app");
  fs::create_directories(bundle / "bin");
  const std::string identifier = "com.example.bench" + std::to_string(index);
  writePlist(bundle / "bundle.plist", {{"HostBundleIdentifier", identifier},
                                       {"HostBundleShortVersionString", version},
                                       {"HostBundleVersion", version},
                                       {"HostBundleExecutable", appName(index)}});
  writePlist(bundle / "purchase.plist", {{"bundleIdentifier", identifier},
                                         {"bundleVersion", version},
                                         {"wareID", wareID(index)},
                                         {"installerVersionID", std::int64_t(1)},
                                         {"opaqueAccountIDString", kOpaqueAccountID},
                                         {"purchaseDate", PlistDate{1700000000}}});
  std::string bytes(payloadBytes, '\0');
  std::uint64_t state = (wareID(index) + version.size()) * 0x9E3779B97F4A7C15ULL + version.back();
  for (char& byte : bytes) {
    state ^= state << 13U;
    state ^= state >> 7U;
    state ^= state << 17U;
    byte = static_cast<char>(state & 0xFFU);
  }
  bench::writeFixture((bundle / "bin" / appName(index)).string(), bytes);
  fs::permissions(bundle / "bin" / appName(index), fs::perms::owner_all);
  return bundle;
}

void prepare(const fs::path& dir) {
  fs::remove_all(dir);
  const fs::path catalogue = dir / "catalogue";
  fs::create_directories(catalogue / "items");
  PlistArray accounts{PlistDictionary{{"accountID", std::uint64_t(1)},
                                      {"orvaneID", kAccountName},
                                      {"password", kPassword},
                                      {"storeFrontID", "143441"},
                                      {"opaqueID", kOpaqueAccountID}}};
  bench::writeFixture((catalogue / "accounts.plist").string(),
                      PropertyListSerialization::writeXml(accounts));
  for (int index = 0; index < kItems; ++index) {
    const fs::path bundle = writeBundle(dir / "bundles", index, "2.0", kPayloadBytes);
    const fs::path item = catalogue / "items" / std::to_string(wareID(index));
    fs::create_directories(item);
    const std::string package = appName(index) + ".tar";
    if (bench::waitFor(bench::spawn(
            {LARDER_STORE_PATH, "pack", bundle.string(), (item / package).string()}, {}, -1)) !=
        0) {
      throw std::runtime_error("larder-store pack " + bundle.string() + " failed");
    }
    writePlist(item / "item.plist", {{"ware-id", wareID(index)},
                                     {"bundle-id", "com.example.bench" + std::to_string(index)},
                                     {"title", appName(index)},
                                     {"version", "2.0"},
                                     {"release-date", PlistDate{1700000000}},
                                     {"package", package},
                                     {"action-params", "productType=C&price=0&itemId=" +
                                                           std::to_string(wareID(index))}});
    writeBundle(dir / "pristine" / "Applications", index, "1.0", kInstalledPayloadBytes);
  }
  fs::remove_all(dir / "bundles");
}

bool signIn(const VendStoreClient& client) {
  VendServiceProxy proxy(client);
  bool signedIn = false;
  proxy.accountServiceSynchronousBlock([&](VendAccountService& service, DispatchSemaphore& done) {
    service.signIn(kAccountName, kPassword, [&](bool success, std::uint64_t, const OptionalError&) {
      signedIn = success;
      done.signal();
    });
  });
  return signedIn;
}

// How many of the installed bundles are at 2.0.
int bundlesAtNewVersion(const fs::path& applications) {
  int updated = 0;
  for (int index = 0; index < kItems; ++index) {
    auto bytes = FileIO::read((applications / (appName(index) + ".app") / "bundle.plist").string());
    std::optional<PlistValue> info;
    if (bytes) info = PropertyListSerialization::read(*bytes).optional();
    const std::string* version = info ? (*info)["HostBundleShortVersionString"].string() : nullptr;
    if (version && *version == "2.0") ++updated;
  }
  return updated;
}

int run(const fs::path& dir) {
  const fs::path work = dir / "work";
  fs::remove_all(work);
  fs::create_directories(work / "home");
  fs::copy(dir / "pristine", work / "root", fs::copy_options::recursive);
  ::setenv("LARDER_ROOT", (work / "root").c_str(), 1);
  ::setenv("HOME", (work / "home").c_str(), 1);
  ::setenv("XDG_CACHE_HOME", (work / "home/.cache").c_str(), 1);
  ::setenv("XDG_STATE_HOME", (work / "home/.local/state").c_str(), 1);
  ::setenv("XDG_CONFIG_HOME", (work / "home/.config").c_str(), 1);
  fs::create_directories(VendFileManager::cacheDirectoryPathWithName(kDaemonDefaultsID));
  if (!PreferenceStore::setValue(kDefaultsAutoUpdateEnabledKey, true, kDaemonDefaultsID)) {
    throw std::runtime_error("cannot switch automatic updates on");
  }

  bench::StoreProcess store(LARDER_STORE_PATH, dir / "catalogue");
  VendRuntimeConfiguration configuration;
  configuration.bagURL = store.bagURL();
  configuration.stateDirectory = (work / "home/.local/state/larder").string();
  configuration.downloadsDirectory = (work / "home/.cache/com.orvane.larderd/Downloads").string();
  VendRuntime::setShared(std::make_shared<VendRuntime>(configuration));
  const VendStoreClient client =
      VendStoreClient::fromDictionary({{"identifier", "com.orvane.quaymart"}});
  if (!signIn(client)) throw std::runtime_error("the sign-in failed");

  SoftwareMap::Options options;
  options.persistedStorePath = (work / "home/.cache/com.orvane.tradeline/SoftwareMap").string();
  options.liveQueries = false;
  options.periodicReload = false;
  SoftwareMap map(options);
  map.waitUntilIdle();
  std::shared_ptr<UpdateController> controller = UpdateController::make(client, map);
  auto operation = std::make_shared<UpdateOperation>(
      client, std::weak_ptr<UpdateOperationController>(controller));
  operation->changeSettings([](UpdateOperationSettings& s) {
    s.shouldCheckForAndStageAppUpdates = true;
    s.shouldStartAutoInstallOfUpdates = true;
  });
  OptionalError error;
  const bool ran = operation->runSyncReturningError(&error);
  controller->updateQueue()->finishPendingWrites();
  const int updated = bundlesAtNewVersion(work / "root/Applications");
  VendRuntime::setShared(nullptr);
  if (!ran || updated != kItems) {
    std::cerr << "update run: " << updated << " of " << kItems << " bundles at 2.0"
              << (error ? ": " + error->description : std::string()) << "\n";
    return 1;
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  const std::string mode = argc == 3 ? argv[1] : "";
  if (mode != "--prepare" && mode != "--run") {
    std::cerr << "usage: larder-update-run-timing --prepare DIR | --run DIR\n";
    return 2;
  }
  try {
    if (mode == "--prepare") {
      prepare(fs::absolute(argv[2]));
      return 0;
    }
    return run(fs::absolute(argv[2]));
  } catch (const std::exception& failure) {
    std::cerr << "larder-update-run-timing: " << failure.what() << "\n";
    return 1;
  }
}
