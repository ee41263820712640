// Lookups and load of the software map with 10,000 products.
#include <benchmark/benchmark.h>

#include <chrono>
#include <memory>
#include <random>

#include "LoadedSoftwareMap.h"
#include "ProductStoreFixture.h"
#include "platform/log/TillLogManager.h"
#include "software-map/SoftwareMap.h"

namespace {

using larder::SoftwareMap;
using larder::bench::ProductStoreFixture;

constexpr std::size_t kProducts = 10'000;

struct Shared : larder::bench::LoadedSoftwareMap {
  Shared() : LoadedSoftwareMap(kProducts) {
    for (std::size_t i = 0; i < kProducts; ++i) {
      identifiers.push_back(ProductStoreFixture::bundleIdentifier(i));
    }
  }
  std::vector<std::string> identifiers;
};

Shared& shared() {
  static Shared instance;
  return instance;
}

void BM_ProductForBundleIdentifier(benchmark::State& state) {
  Shared& s = shared();
  std::minstd_rand random(static_cast<unsigned>(state.thread_index()) + 1);
  benchmark::IterationCount found = 0;
  for (auto _ : state) {
    const std::string& identifier = s.identifiers[random() % kProducts];
    found += s.map->productForBundleIdentifier(identifier) != nullptr;
  }
  if (found != state.iterations()) state.SkipWithError("a lookup found nothing");
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ProductForBundleIdentifier)->Threads(1)->Threads(2)->UseRealTime();

void BM_ProductForItemIdentifier(benchmark::State& state) {
  Shared& s = shared();
  std::minstd_rand random(7);
  for (auto _ : state) {
    benchmark::DoNotOptimize(s.map->productForItemIdentifier(400000000 + random() % kProducts));
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ProductForItemIdentifier);

// From construction to the first answered lookup: the whole load of the
// persisted store, read, decode and secondary maps included. Tearing the
// map down is not part of it.
void BM_LoadPersistedStore(benchmark::State& state) {
  Shared& s = shared();
  for (auto _ : state) {
    auto start = std::chrono::steady_clock::now();
    auto map = std::make_unique<SoftwareMap>(SoftwareMap::Options{s.fixture.storePath(), false});
    if (!map->productForBundleIdentifier(s.identifiers[42])) state.SkipWithError("not loaded");
    state.SetIterationTime(
        std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count());
    map.reset();
  }
}
BENCHMARK(BM_LoadPersistedStore)->UseManualTime()->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
