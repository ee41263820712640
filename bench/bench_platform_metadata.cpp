// Costs of the live metadata query the software map keeps: how soon a bundle that lands in an
// application folder reaches the owner as "added" (the coalescing delay is most of it, by
// design), and how long the first gathering takes on a machine with 2,000 store bundles.

#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/metadata/MetadataQuery.h"
#include "platform/metadata/MetadataQueryPredicate.h"
#include "platform/plist/PropertyListSerialization.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

constexpr const char* kStoreQuery =
    "kHostItemQuaymartHasPurchaseRecord == 1 || "
    "kHostItemHostBundleIdentifier=='com.orvane.SetupHerald*'";
constexpr auto kPatience = std::chrono::seconds(10);

// A private platform root and home folder for the length of one benchmark.
class PlatformTree {
 public:
  PlatformTree() {
    std::string pattern = (fs::temp_directory_path() / "larder-bench-mdq-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) std::abort();
    base_ = pattern;
    fs::create_directories(applications());
    fs::create_directories(home() + "/Applications");
    fs::create_directories(staging());
    ::setenv("LARDER_ROOT", (base_ + "/root").c_str(), 1);
    ::setenv("HOME", home().c_str(), 1);
  }
  ~PlatformTree() {
    std::error_code ignored;
    fs::remove_all(base_, ignored);
  }
  PlatformTree(const PlatformTree&) = delete;
  PlatformTree& operator=(const PlatformTree&) = delete;

  [[nodiscard]] std::string applications() const { return base_ + "/root/Applications"; }
  [[nodiscard]] std::string home() const { return base_ + "/home"; }
  [[nodiscard]] std::string staging() const { return base_ + "/staging"; }

 private:
  std::string base_;
};

void writeText(const std::string& path, const std::string& text) {
  std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
}

void writeStoreBundle(const std::string& path, int number) {
  fs::create_directories(path + "/resources");
  const std::string identifier = "com.example.bench" + std::to_string(number);
  writeText(path + "/bundle.plist",
            PropertyListSerialization::writeXml(PlistDictionary{
                {"HostBundleIdentifier", identifier}, {"HostBundleShortVersionString", "1.0"}}));
  writeText(path + "/purchase.plist", PropertyListSerialization::writeXml(PlistDictionary{
                                          {"bundleIdentifier", identifier},
                                          {"bundleVersion", "1.0"},
                                          {"wareID", std::int64_t{400000000} + number},
                                          {"installerVersionID", std::int64_t{1}},
                                          {"opaqueAccountIDString", "bench"},
                                          {"purchaseDate", PlistDate{1700000000}}}));
}

// Signals for each kind of event; the benchmark waits for the one it caused.
struct QueryEvents {
  DispatchSemaphore finished;
  DispatchSemaphore added;
  DispatchSemaphore removed;
};

std::shared_ptr<MetadataQuery> startedQuery(QueryEvents& events) {
  auto query = MetadataQuery::create(kStoreQuery, {"kHostItemQuaymartWareID"});
  query->setQueue(DispatchQueue::create("bench.metadata", DispatchQueue::Kind::Serial));
  query->setHandlers({[&events](MetadataQuery&) { events.finished.signal(); },
                      [&events](MetadataQuery&, const MetadataQueryUpdate& update) {
                        for (std::size_t i = 0; i < update.added.size(); ++i) events.added.signal();
                        for (std::size_t i = 0; i < update.removed.size(); ++i) {
                          events.removed.signal();
                        }
                      },
                      nullptr});
  if (!query->start()) return nullptr;
  return query;
}

double percentile(std::vector<double> values, double fraction) {
  if (values.empty()) return 0;
  std::sort(values.begin(), values.end());
  const auto index = static_cast<std::size_t>(fraction * static_cast<double>(values.size() - 1));
  return values[index];
}

// A prepared bundle renamed into a watched folder, as an installer finishing its work does.
void BM_BundleLandingToAdded(benchmark::State& state) {
  PlatformTree tree;
  QueryEvents events;
  std::shared_ptr<MetadataQuery> query = startedQuery(events);
  if (!query || !events.finished.waitFor(kPatience)) {
    state.SkipWithError("query did not start");
    return;
  }
  std::vector<double> milliseconds;
  int number = 0;
  for (auto _ : state) {
    const std::string name = "/Landed" + std::to_string(number++) + ".app";
    writeStoreBundle(tree.staging() + name, number);
    const Clock::time_point landed = Clock::now();
    fs::rename(tree.staging() + name, tree.applications() + name);
    if (!events.added.waitFor(kPatience)) {
      state.SkipWithError("no added event");
      break;
    }
    const std::chrono::duration<double> latency = Clock::now() - landed;
    state.SetIterationTime(latency.count());
    milliseconds.push_back(latency.count() * 1000);
    // Gone again before the next landing, so that each one meets a quiet query.
    fs::remove_all(tree.applications() + name);
    if (!events.removed.waitFor(kPatience)) {
      state.SkipWithError("no removed event");
      break;
    }
  }
  query->stop();
  state.counters["median_ms"] = percentile(milliseconds, 0.5);
  state.counters["p90_ms"] = percentile(milliseconds, 0.9);
  state.counters["max_ms"] = percentile(milliseconds, 1.0);
}
BENCHMARK(BM_BundleLandingToAdded)->UseManualTime()->Iterations(100)->Unit(benchmark::kMillisecond);

// From `start` to the finished event, over 2,000 bundles with purchase records in the folders
// of the root and of the home folder.
void BM_InitialGathering(benchmark::State& state) {
  const int bundles = static_cast<int>(state.range(0));
  PlatformTree tree;
  for (int number = 0; number < bundles; ++number) {
    const std::string folder = number % 4 == 3
                                   ? tree.home() + "/Applications"
                                   : tree.applications() + "/Group" + std::to_string(number % 3);
    writeStoreBundle(folder + "/App" + std::to_string(number) + ".app", number);
  }
  for (auto _ : state) {
    QueryEvents events;
    const Clock::time_point started = Clock::now();
    std::shared_ptr<MetadataQuery> query = startedQuery(events);
    if (!query || !events.finished.waitFor(kPatience * 6)) {
      state.SkipWithError("no finished event");
      break;
    }
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - started).count());
    if (query->resultCount() != static_cast<std::size_t>(bundles)) {
      state.SkipWithError("the gathering missed bundles");
      break;
    }
    query->stop();
  }
  state.counters["bundles"] = bundles;
}
BENCHMARK(BM_InitialGathering)
    ->Arg(2000)
    ->UseManualTime()
    ->Iterations(5)
    ->Unit(benchmark::kMillisecond);

// The predicate alone, on the attributes of one bundle: what each re-read costs on top of I/O.
void BM_StoreQueryPredicate(benchmark::State& state) {
  const std::optional<MetadataQueryPredicate> predicate = MetadataQueryPredicate::parse(
      "kHostItemContentType=com.orvane.application-bundle && "
      "kHostItemQuaymartHasPurchaseRecord!=1 && kHostItemQuaymartIsDeveloperSigned!=1 && "
      "(kHostItemHostBundleIdentifier='com.orvane.Snapbox' || "
      "kHostItemHostBundleIdentifier='com.orvane.ReelcutApp' || "
      "kHostItemHostBundleIdentifier='com.orvane.Fleetdesk')");
  const PlistDictionary attributes{{"kHostItemContentType", "com.orvane.application-bundle"},
                                   {"kHostItemQuaymartHasPurchaseRecord", std::int64_t{0}},
                                   {"kHostItemQuaymartIsDeveloperSigned", std::int64_t{0}},
                                   {"kHostItemHostBundleIdentifier", "com.orvane.Fleetdesk"}};
  for (auto _ : state) benchmark::DoNotOptimize(predicate->matches(attributes));
}
BENCHMARK(BM_StoreQueryPredicate);

}  // namespace
}  // namespace larder

BENCHMARK_MAIN();
