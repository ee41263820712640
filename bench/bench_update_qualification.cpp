// Qualification of app updates by a run (`appUpdatesToStageOrInstallNow`)
// over a queue of 2,000 updates, in the two shapes a background run takes:
//
// - a stage run (stage and auto-install on) where nothing is staged yet:
//   the filter alone, which asks each update whether automatic updates are
//   on;
// - an install-only run (stage off, auto-install on) where every update was
//   staged earlier and held back with code 3 (its app ran): each update is
//   asked again whether its app runs, which scans /proc, looks up the
//   bundles with its identifier and probes the plug-in host's file.
//
// Every updated app is installed as a 1.0 bundle in the platform root, as
// on a machine that has these updates. The queue is laid out as its cache
// file before the controller is made, so it starts with the 2,000 records.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <filesystem>

#include "BenchFiles.h"
#include "BenchUpdatePlatform.h"
#include "bench/BenchUpdatePlatform.h"
#include "platform/plist/PropertyListSerialization.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/host/PreferenceStore.h"
#include "update-controller/UpdateController.h"
#include "update-operation/UpdateOperation.h"

namespace {

namespace fs = std::filesystem;
using namespace larder;

constexpr int kAppUpdates = 2'000;

std::string bundleIdentifier(int index) {
  return "com.example.app" + std::to_string(index);
}

// The cache record of one update; staged ones carry the abort code of the
// run that held them back.
PlistDictionary queuedUpdate(int index, bool staged) {
  PlistDictionary update{{std::string(LedgerUpdate::kWareIDKey), std::uint64_t(100000 + index)},
                         {std::string(LedgerUpdate::kBundleIDKey), bundleIdentifier(index)},
                         {std::string(LedgerUpdate::kTitleKey), "App " + std::to_string(index)},
                         {std::string(LedgerUpdate::kVersionKey), "2.0"},
                         {std::string(LedgerUpdate::kReleaseDateKey), PlistDate{1700000000}}};
  if (staged) {
    update[std::string(LedgerUpdate::kIsStagedKey)] = true;
    update[std::string(LedgerUpdate::kAutoUpdateAbortCodeKey)] =
        std::int64_t(UpdateOperation::kAbortAppRunning);
  }
  return update;
}

// A platform root of the benchmark's own with the 2,000 apps installed.
class QualificationFixture {
 public:
  QualificationFixture() {
    for (int index = 0; index < kAppUpdates; ++index) installApp(index);
    (void)PreferenceStore::setValue(kDefaultsAutoUpdateEnabledKey, true, kDaemonDefaultsID);
  }

  // A controller whose queue starts with the 2,000 updates.
  std::shared_ptr<UpdateController> controllerWithUpdates(bool staged) {
    PlistArray updates;
    for (int index = 0; index < kAppUpdates; ++index) {
      updates.emplace_back(queuedUpdate(index, staged));
    }
    return platform_.controllerWithUpdates(staged ? "bench-staged" : "bench-new", updates);
  }

 private:
  void installApp(int index) const {
    const std::string path =
        platform_.base() + "/root/Applications/App" + std::to_string(index) + ".app";
    fs::create_directories(path + "/bin");
    bench::writeFixture(path + "/bundle.plist",
                        PropertyListSerialization::writeXml(PlistDictionary{
                            {"HostBundleIdentifier", bundleIdentifier(index)},
                            {"HostBundleShortVersionString", "1.0"},
                            {"HostBundleVersion", "1.0"},
                            {"HostBundleExecutable", "App" + std::to_string(index)}}));
  }

  bench::BenchUpdatePlatform platform_{"larder-bench-qualify"};
};

QualificationFixture& fixture() {
  static QualificationFixture instance;
  return instance;
}

void qualify(benchmark::State& state, bool staged, bool stage, bool autoInstall) {
  std::shared_ptr<UpdateController> controller = fixture().controllerWithUpdates(staged);
  auto run = std::make_shared<UpdateOperation>(
      controller->storeClient(), std::weak_ptr<UpdateOperationController>(controller));
  run->changeSettings([&](UpdateOperationSettings& s) {
    s.shouldCheckForAndStageAppUpdates = stage;
    s.shouldStartAutoInstallOfUpdates = autoInstall;
  });
  std::size_t qualified = 0;
  for (auto _ : state) {
    MutexLock lock(UpdateOperation::synchronizationLock());
    qualified = run->appUpdatesToStageOrInstallNow().size();
  }
  // Nothing runs, so no update is held back: a figure over fewer would
  // time the wrong work.
  if (qualified != kAppUpdates) state.SkipWithError("not every update qualified");
  state.counters["qualified"] = static_cast<double>(qualified);
  controller->updateQueue()->finishPendingWrites();
}

void BM_QualifyStageRunNothingStaged(benchmark::State& state) {
  qualify(state, false, true, true);
}
BENCHMARK(BM_QualifyStageRunNothingStaged)->Unit(benchmark::kMillisecond);

void BM_QualifyInstallOnlyRunAllStagedCode3(benchmark::State& state) {
  qualify(state, true, false, true);
}
BENCHMARK(BM_QualifyInstallOnlyRunAllStagedCode3)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
