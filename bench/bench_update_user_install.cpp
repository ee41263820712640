// A user-started install of one update of 50 MiB from larder-store on
// loopback, from the start request to the relaunched application: the
// rights check, the run's quit of the running app (its dialog answered at
// once), the purchase, the download with its chunk digests, the install
// and the relaunch.
//
// Each iteration starts from the installed 1.0 bundle, running, with the
// update known to the queue (copy, launch, map and store check are outside
// the timing). Counter `relaunched` is 1 when the 2.0 app was running again
// at the end; anything else fails the benchmark.

#include <benchmark/benchmark.h>
#include <signal.h>
#include <sys/wait.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <future>
#include <stdexcept>
#include <string>
#include <thread>

#include "bench/BenchFiles.h"
#include "bench/BenchProcesses.h"
#include "bench/BenchStoreProcess.h"
#include "bench/BenchUpdatePlatform.h"
#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "running-apps/RunningApplication.h"
#include "store-runtime/dialogs/VendDialogPresenter.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendAccountService.h"
#include "store-runtime/services/VendServiceProxy.h"
#include "update-controller/UpdateController.h"

namespace {

namespace fs = std::filesystem;
using namespace larder;

constexpr std::uint64_t kWareID = 61001;
constexpr char kBundleID[] = "com.example.bench.install";
constexpr std::size_t kPayloadBytes = 50u << 20u;
constexpr char kAccount[] = "bench@example.com";
constexpr char kPassword[] = "pw";

void writePlist(const fs::path& path, const PlistDictionary& contents) {
  bench::writeFixture(path.string(), PropertyListSerialization::writeXml(contents));
}

// "<folder>/Notes.app" at `version`: a program that sleeps, run with the
// shell and sleep copied into the bundle as they will be once installed at
// `installedPath`, and `payloadBytes` of data that do not compress.
fs::path writeBundle(const fs::path& folder, const std::string& version,
                     const fs::path& installedPath, std::size_t payloadBytes) {
  const fs::path bundle = folder / "Notes.app";
  fs::create_directories(bundle / "bin");
  writePlist(bundle / "bundle.plist", {{"HostBundleIdentifier", kBundleID},
                                       {"HostBundleShortVersionString", version},
                                       {"HostBundleVersion", version},
                                       {"HostBundleExecutable", "Notes"}});
  writePlist(bundle / "purchase.plist", {{"bundleIdentifier", kBundleID},
                                         {"bundleVersion", version},
                                         {"wareID", kWareID},
                                         {"installerVersionID", std::int64_t(1)},
                                         {"opaqueAccountIDString", "account-1"},
                                         {"purchaseDate", PlistDate{1700000000}}});
  fs::copy_file("/bin/sh", bundle / "bin/sh", fs::copy_options::overwrite_existing);
  fs::copy_file("/bin/sleep", bundle / "bin/sleep", fs::copy_options::overwrite_existing);
  const std::string installed = installedPath.string();
  bench::writeFixture((bundle / "bin/Notes").string(),
                      "#!" + installed + "/bin/sh\nexec " + installed + "/bin/sleep 600\n");
  fs::permissions(bundle / "bin/Notes", fs::perms::owner_all);
  std::string bytes(payloadBytes, '\0');
  std::uint64_t state = 0x9E3779B97F4A7C15ULL + version.size();
  for (char& byte : bytes) {
    state ^= state << 13U;
    state ^= state >> 7U;
    state ^= state << 17U;
    byte = static_cast<char>(state & 0xFFU);
  }
  bench::writeFixture((bundle / "payload.bin").string(), bytes);
  return bundle;
}

// The user who agrees to every dialog at once.
class AgreeingPresenter final : public VendDialogPresenter {
 public:
  void present(const VendDialog&, Reply reply) override {
    reply(VendDialogAnswer{VendDialogButton::kOK, {}});
  }
  void dismiss(std::string_view, std::int64_t) override {}
};

std::string versionOf(const fs::path& bundle) {
  auto bytes = FileIO::read((bundle / "bundle.plist").string());
  if (!bytes) return {};
  std::optional<PlistValue> info = PropertyListSerialization::read(*bytes).optional();
  const std::string* version = info ? (*info)["HostBundleShortVersionString"].string() : nullptr;
  return version ? *version : std::string();
}

void killNotes() {
  for (const auto& app : RunningApplication::runningApplicationsWithBundleIdentifier(kBundleID)) {
    ::kill(app->pid(), SIGKILL);
  }
  while (!RunningApplication::runningApplicationsWithBundleIdentifier(kBundleID).empty()) {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
}

void BM_UserStartedInstallOf50MiBToRelaunch(benchmark::State& state) {
  bench::BenchUpdatePlatform platform("bench-user-install");
  const std::string base = platform.base();
  const fs::path applications = base + "/root/Applications";
  const fs::path installed = applications / "Notes.app";
  const fs::path catalogue = base + "/catalogue";
  const fs::path item = catalogue / "items" / std::to_string(kWareID);
  fs::create_directories(item);
  writePlist(item / "item.plist", {{"ware-id", kWareID},
                                   {"bundle-id", kBundleID},
                                   {"title", "Notes"},
                                   {"version", "2.0"},
                                   {"release-date", PlistDate{1700000000}},
                                   {"package", "Notes.tar"},
                                   {"action-params", "itemId=" + std::to_string(kWareID)}});
  bench::writeFixture((catalogue / "accounts.plist").string(),
                      PropertyListSerialization::writeXml(
                          PlistArray{PlistDictionary{{"accountID", std::uint64_t(1)},
                                                     {"orvaneID", kAccount},
                                                     {"password", kPassword},
                                                     {"storeFrontID", "143441"},
                                                     {"opaqueID", "account-1"}}}));
  const fs::path packed = writeBundle(base + "/packed", "2.0", installed, kPayloadBytes);
  if (bench::waitFor(bench::spawn(
          {LARDER_STORE_PATH, "pack", packed.string(), (item / "Notes.tar").string()}, {}, -1)) !=
      0) {
    state.SkipWithError("larder-store pack failed");
    return;
  }
  bench::StoreProcess store(LARDER_STORE_PATH, catalogue);
  VendRuntimeConfiguration configuration;
  configuration.bagURL = store.bagURL();
  configuration.stateDirectory = base + "/state/larder";
  configuration.downloadsDirectory = base + "/cache/com.orvane.larderd/Downloads";
  VendRuntime::setShared(std::make_shared<VendRuntime>(configuration));
  VendRuntime::shared()->setDialogPresenter(std::make_shared<AgreeingPresenter>());
  const VendStoreClient client =
      VendStoreClient::fromDictionary({{"identifier", "com.orvane.quaymart"}});
  bool signedIn = false;
  VendServiceProxy(client).accountServiceSynchronousBlock(
      [&](VendAccountService& service, DispatchSemaphore& done) {
        service.signIn(kAccount, kPassword, [&](bool success, std::uint64_t, const OptionalError&) {
          signedIn = success;
          done.signal();
        });
      });
  if (!signedIn) {
    state.SkipWithError("the sign-in failed");
    return;
  }

  std::int64_t relaunched = 0;
  for (auto _ : state) {
    state.PauseTiming();
    killNotes();
    fs::remove_all(installed);
    writeBundle(applications, "1.0", installed, 4096);
    fs::remove_all(base + "/SoftwareMap");
    SoftwareMap::Options options;
    options.persistedStorePath = base + "/SoftwareMap";
    options.liveQueries = false;
    options.periodicReload = false;
    SoftwareMap map(options);
    map.waitUntilIdle();
    std::shared_ptr<UpdateController> controller = UpdateController::make(client, map);
    DispatchSemaphore checked;
    controller->updateQueue()->checkForUpdatesWithCompletionHandler(
        [&](bool, const auto&, const auto&, const auto&) { checked.signal(); });
    checked.wait();
    LedgerUpdateRef update = controller->updateQueue()->availableUpdateWithItemIdentifier(kWareID);
    Result<pid_t> first = RunningApplication::launchBundle(installed.string());
    if (!update || !first) {
      state.SkipWithError("no update known, or the 1.0 app did not start");
      break;
    }
    while (!RunningApplication::withPid(*first)) {
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    state.ResumeTiming();

    std::promise<bool> ended;
    controller->startAppUpdates(
        std::vector<LedgerUpdateRef>{update}, UpdateController::OSUpdateList{}, nullptr,
        [&](bool success, const OptionalError&) { ended.set_value(success); });
    const bool success = ended.get_future().get() && versionOf(installed) == "2.0";
    bool running = false;
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (success && !running && std::chrono::steady_clock::now() < deadline) {
      for (const auto& app :
           RunningApplication::runningApplicationsWithBundleIdentifier(kBundleID)) {
        running = running || app->pid() != *first;
      }
      if (!running) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }

    state.PauseTiming();
    relaunched = running ? 1 : 0;
    controller->updateQueue()->finishPendingWrites();
    controller.reset();
    state.ResumeTiming();
    if (!running) {
      state.SkipWithError("the 2.0 app was not running again at the end");
      break;
    }
  }
  killNotes();
  state.counters["relaunched"] = static_cast<double>(relaunched);
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * kPayloadBytes));
  VendRuntime::setShared(nullptr);
}
BENCHMARK(BM_UserStartedInstallOf50MiBToRelaunch)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime()
    ->Iterations(5);

}  // namespace

BENCHMARK_MAIN();
