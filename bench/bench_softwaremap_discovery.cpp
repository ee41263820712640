// Discovery of 10,000 bundles, the merge barrier, lookups while a discovery
// runs, and the time from a bundle landing in a folder to an observer.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <mutex>
#include <random>
#include <thread>

#include "bench/BenchFiles.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "software-map/SoftwareMap.h"

namespace {

namespace fs = std::filesystem;
using larder::PlistDictionary;
using larder::SoftwareMap;

constexpr std::size_t kBundles = 10'000;

void writeBundle(const std::string& folder, std::size_t i) {
  std::string path = folder + "/App" + std::to_string(i) + ".app";
  std::string identifier = "com.example.app" + std::to_string(i);
  fs::create_directories(path);
  larder::bench::writeFixture(
      path + "/bundle.plist",
      larder::PropertyListSerialization::writeXml(PlistDictionary{
          {"HostBundleIdentifier", identifier}, {"HostBundleShortVersionString", "1.0"}}));
  larder::bench::writeFixture(path + "/purchase.plist",
                              larder::PropertyListSerialization::writeXml(
                                  PlistDictionary{{"bundleIdentifier", identifier},
                                                  {"bundleVersion", "1.0"},
                                                  {"wareID", static_cast<std::int64_t>(500000 + i)},
                                                  {"installerVersionID", 3},
                                                  {"opaqueAccountIDString", "account"}}));
}

struct Platform {
  Platform() {
    std::string pattern = (fs::temp_directory_path() / "larder-discovery-XXXXXX").string();
    directory = mkdtemp(pattern.data());
    fs::create_directories(directory + "/root/Applications");
    fs::create_directories(directory + "/home/Applications");
    fs::create_directories(directory + "/staging");
    setenv("LARDER_ROOT", (directory + "/root").c_str(), 1);
    setenv("HOME", (directory + "/home").c_str(), 1);
    setenv("XDG_CACHE_HOME", (directory + "/home/.cache").c_str(), 1);
    setenv("XDG_STATE_HOME", (directory + "/home/.local/state").c_str(), 1);
    larder::TillLogManager::sharedManager().setLevel(1);
    for (std::size_t i = 0; i < kBundles; ++i) writeBundle(directory + "/root/Applications", i);
  }
  ~Platform() {
    std::error_code code;
    fs::remove_all(directory, code);
  }
  std::string store() const { return directory + "/home/.cache/SoftwareMap"; }
  std::string directory;
};

Platform& platform() {
  static Platform instance;
  return instance;
}

SoftwareMap::Options scanOnly() {
  SoftwareMap::Options options;
  options.persistedStorePath = platform().store();
  options.discoverApplications = false;
  options.liveQueries = false;
  options.periodicReload = false;
  return options;
}

// Scan of the application folders and the merge, as at start and every ten
// hours; the merge barrier's own time comes from its log line.
void BM_DiscoveryOf10000Bundles(benchmark::State& state) {
  platform();
  SoftwareMap map(scanOnly());
  double barrierSeconds = 0;
  auto sink = larder::TillLogManager::sharedManager().addSink([&](int, const std::string& line) {
    constexpr std::string_view kPrefix = "SoftwareMap: Software map rebuild took ";
    if (line.starts_with(kPrefix)) barrierSeconds = std::atof(line.c_str() + kPrefix.size());
  });
  for (auto _ : state) {
    map.reloadFromApplicationRegistry();
  }
  if (map.allProducts().size() != kBundles) state.SkipWithError("discovery missed bundles");
  state.counters["merge_barrier_ms"] = barrierSeconds * 1000;
}
BENCHMARK(BM_DiscoveryOf10000Bundles)->Unit(benchmark::kMillisecond)->Iterations(3)->UseRealTime();

// Lookups while a full discovery runs beside them.
void BM_LookupDuringDiscovery(benchmark::State& state) {
  platform();
  SoftwareMap map(scanOnly());
  map.reloadFromApplicationRegistry();
  std::atomic<bool> stop{false};
  std::thread discovery([&] {
    while (!stop) map.reloadFromApplicationRegistry();
  });
  std::minstd_rand random(3);
  std::vector<std::string> identifiers;
  for (std::size_t i = 0; i < kBundles; ++i)
    identifiers.push_back("com.example.app" + std::to_string(i));
  std::vector<double> nanoseconds;
  nanoseconds.reserve(4'000'000);
  for (auto _ : state) {
    const std::string& identifier = identifiers[random() % kBundles];
    auto start = std::chrono::steady_clock::now();
    benchmark::DoNotOptimize(map.productForBundleIdentifier(identifier));
    nanoseconds.push_back(
        std::chrono::duration<double, std::nano>(std::chrono::steady_clock::now() - start).count());
  }
  stop = true;
  discovery.join();
  std::sort(nanoseconds.begin(), nanoseconds.end());
  state.counters["median_ns"] = nanoseconds[nanoseconds.size() / 2];
  state.counters["p99_ns"] = nanoseconds[nanoseconds.size() * 99 / 100];
}
BENCHMARK(BM_LookupDuringDiscovery)->UseRealTime()->Iterations(2'000'000);

// From a bundle renamed into the application folder to the observer's Added.
class LandingObserver final : public larder::VendSoftwareMapObserver {
 public:
  void softwareProductUpdatedState(const larder::LedgerSoftwareProductRef& product,
                                   std::int64_t state) override {
    if (state != larder::kSoftwareProductAdded) return;
    std::lock_guard lock(mutex);
    landed.push_back(product->bundlePath());
    condition.notify_all();
  }
  std::mutex mutex;
  std::condition_variable condition;
  std::vector<std::string> landed;
};

void BM_LandingToObserver(benchmark::State& state) {
  platform();
  SoftwareMap::Options options = scanOnly();
  options.discoverApplications = true;
  options.liveQueries = true;
  SoftwareMap map(options);
  auto observer = std::make_shared<LandingObserver>();
  map.addObserver(observer);
  map.waitUntilIdle();
  std::this_thread::sleep_for(std::chrono::seconds(2));  // the queries' first gathering
  std::size_t next = kBundles;
  for (auto _ : state) {
    state.PauseTiming();
    writeBundle(platform().directory + "/staging", next);
    std::string name = "App" + std::to_string(next) + ".app";
    std::string target = platform().directory + "/root/Applications/" + name;
    ++next;
    state.ResumeTiming();
    auto start = std::chrono::steady_clock::now();
    fs::rename(platform().directory + "/staging/" + name, target);
    std::unique_lock lock(observer->mutex);
    bool arrived = observer->condition.wait_for(lock, std::chrono::seconds(5), [&] {
      return std::find(observer->landed.begin(), observer->landed.end(), target) !=
             observer->landed.end();
    });
    if (!arrived) state.SkipWithError("the observer never heard of the bundle");
    state.SetIterationTime(
        std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count());
  }
}
BENCHMARK(BM_LandingToObserver)->UseManualTime()->Iterations(20)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
