// The update controller's two figures: the badge count over a large queue,
// and telling observers on the bus of a change.
//
// The badge is asked with automatic updates of both kinds on, so that every
// branch of the count runs: the app updates are filtered by their marks and
// the OS updates by those that would install by themselves. Each question
// reads its preferences and the system update framework's file afresh.
//
// The observers live in a client on a private bus; ten of the hundred
// belong to a connection that has gone. Each is told the whole lists, so the
// figure is taken with a queue of the size a machine has (20 app updates)
// and ten times that. The client answers each call only
// after 2 ms, so a service that waited for its observers would take at
// least 180 ms per change.

#include <benchmark/benchmark.h>
#include <sdbus-c++/sdbus-c++.h>
#include <stdlib.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <thread>

#include "AssetService/DBusRemoteObjectFactory.h"
#include "BenchProcesses.h"
#include "BenchUpdatePlatform.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PreferenceStore.h"
#include "update-controller/UpdateController.h"

namespace {

namespace fs = std::filesystem;
using namespace larder;

constexpr int kAppUpdates = 5'000;
constexpr int kOSUpdates = 50;
constexpr int kObservers = 100;
constexpr int kGoneObservers = 10;

PlistDictionary appUpdate(int index) {
  PlistDictionary update{{"ware-id", std::uint64_t(100000 + index)},
                         {"bundle-id", "com.example.app" + std::to_string(index)},
                         {"title", "App " + std::to_string(index)},
                         {"version", "2.0"},
                         {"release-date", PlistDate{1700000000}}};
  if (index % 3 == 0) update[std::string(LedgerUpdate::kHasBeenSeenByUserKey)] = true;
  return update;
}

PlistDictionary osUpdate(int index) {
  return {{"productKey", "OS-" + std::to_string(index)},
          {"title", "System update " + std::to_string(index)},
          {"versionString", "1." + std::to_string(index)},
          {"isRecommended", true},
          {"restartRequired", index % 2 == 0},
          {"allowedToUseInstallLater", index % 4 == 0}};
}

// A platform root, caches and preferences of the run's own, with the queue's
// cache and the framework's catalogue laid out and scanned.
class UpdateFixture {
 public:
  UpdateFixture() {
    PlistArray catalog;
    for (int index = 0; index < kOSUpdates; ++index) catalog.emplace_back(osUpdate(index));
    PlatformStateFile::named(SysupQuaymartUpdateController::kStateFileName)
        .updateDictionary([&](PlistDictionary& state) { state["catalog"] = catalog; });
    scan();
    (void)PreferenceStore::setValue(kDefaultsAutoUpdateEnabledKey, true, kDaemonDefaultsID);
    (void)PreferenceStore::setValue(kDefaultsAutoUpdateRestartRequiredEnabledKey, true,
                                    kDaemonDefaultsID);
  }

  // A controller whose update queue starts with `appUpdates` updates.
  std::shared_ptr<UpdateController> controllerWithAppUpdates(int appUpdates) {
    PlistArray updates;
    for (int index = 0; index < appUpdates; ++index) updates.emplace_back(appUpdate(index));
    return platform_.controllerWithUpdates("bench-" + std::to_string(appUpdates), updates);
  }

 private:
  static void scan() {
    std::atomic<bool> done{false};
    SysupQuaymartUpdateController::sharedUpdateController()
        .startScanningForUpdatesIncludingPrerelease(
            true, true, true, nullptr, [](double) {}, [&](const OptionalError&) { done = true; });
    while (!done) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }

  bench::BenchUpdatePlatform platform_{"larder-bench-updates"};
};

UpdateFixture& fixture() {
  static UpdateFixture instance;
  return instance;
}

void BM_AvailableUpdatesBadgeCount(benchmark::State& state) {
  auto made = fixture().controllerWithAppUpdates(kAppUpdates);
  UpdateController& controller = *made;
  std::uint64_t count = 0;
  for (auto _ : state) {
    count = controller.availableUpdatesBadgeCount();
    benchmark::DoNotOptimize(count);
  }
  state.counters["badge"] = static_cast<double>(count);
}
BENCHMARK(BM_AvailableUpdatesBadgeCount)->Unit(benchmark::kMicrosecond);

// A client on the private bus with 90 observer objects that each take 2 ms
// to answer, and ten registrations of a client that has gone.
class ObserverClients {
 public:
  explicit ObserverClients(const std::string& address)
      : service_(sdbus::createSessionBusConnectionWithAddress(address)),
        client_(sdbus::createSessionBusConnectionWithAddress(address)),
        factory_(*service_) {
    client_->enterEventLoopAsync();
    service_->enterEventLoopAsync();
    const std::string peer = client_->getUniqueName();
    for (int index = 0; index < kObservers - kGoneObservers; ++index) {
      const std::string path = "/bench/Observer" + std::to_string(index);
      auto object = sdbus::createObject(*client_, path);
      object->registerMethod("com.orvane.larderd.VendAvailableUpdatesObserver",
                             "AvailableUpdatesDidChangedWithUpdatesOsUpdatesBadgeCount",
                             "aa{sv}aa{sv}t", "", [this](sdbus::MethodCall) {
                               std::this_thread::sleep_for(std::chrono::milliseconds(2));
                               received_.fetch_add(1);
                             });
      object->finishRegistration();
      objects_.push_back(std::move(object));
      observers_.push_back(factory_.availableUpdatesObserver(peer, path));
    }
    // A unique name that no connection holds any longer.
    std::string gone;
    {
      auto leaving = sdbus::createSessionBusConnectionWithAddress(address);
      gone = leaving->getUniqueName();
    }
    for (int index = 0; index < kGoneObservers; ++index) {
      observers_.push_back(
          factory_.availableUpdatesObserver(gone, "/bench/Gone" + std::to_string(index)));
    }
  }
  ~ObserverClients() {
    client_->leaveEventLoop();
    service_->leaveEventLoop();
  }

  const std::vector<std::shared_ptr<VendAvailableUpdatesObserver>>& observers() const {
    return observers_;
  }
  std::int64_t received() const { return received_.load(); }

 private:
  std::unique_ptr<sdbus::IConnection> service_;
  std::unique_ptr<sdbus::IConnection> client_;
  DBusRemoteObjectFactory factory_;
  std::vector<std::unique_ptr<sdbus::IObject>> objects_;
  std::vector<std::shared_ptr<VendAvailableUpdatesObserver>> observers_;
  std::atomic<std::int64_t> received_{0};
};

void BM_AvailableUpdatesDidChangeToBusObservers(benchmark::State& state) {
  larder::bench::PrivateSessionBus bus;
  ObserverClients clients(bus.address());
  auto made = fixture().controllerWithAppUpdates(static_cast<int>(state.range(0)));
  UpdateController& controller = *made;
  for (const auto& observer : clients.observers()) controller.addAvailableUpdatesObserver(observer);
  std::int64_t changes = 0;
  for (auto _ : state) {
    controller.availableUpdatesDidChange();
    ++changes;
  }
  for (const auto& observer : clients.observers())
    controller.removeAvailableUpdatesObserver(observer);
  // Every live observer hears every change, after the timing.
  const std::int64_t expected = changes * (kObservers - kGoneObservers);
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::minutes(5);
  while (clients.received() < expected && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  state.counters["delivered"] =
      benchmark::Counter(static_cast<double>(clients.received()) / static_cast<double>(expected));
}
BENCHMARK(BM_AvailableUpdatesDidChangeToBusObservers)
    ->ArgName("appUpdates")
    ->Arg(20)
    ->Arg(200)
    ->Unit(benchmark::kMillisecond)
    ->Iterations(20)
    ->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
