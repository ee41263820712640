// The update request body for a map of 10,000 installed products, as the
// update check asks for it: installed software only, with and without gzip.
#include <benchmark/benchmark.h>

#include <memory>
#include <string>

#include "LoadedSoftwareMap.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/http/VendGzip.h"

namespace {

using larder::PlistArray;
using larder::PlistDictionary;
using larder::SoftwareMap;

constexpr std::size_t kProducts = 10'000;

struct Shared : larder::bench::LoadedSoftwareMap {
  Shared() : LoadedSoftwareMap(kProducts) {}
};

Shared& shared() {
  static Shared instance;
  return instance;
}

void requestBody(benchmark::State& state, bool shouldCompress) {
  Shared& s = shared();
  std::size_t bytes = 0;
  for (auto _ : state) {
    bool compressed = !shouldCompress;
    std::optional<larder::PlistData> body =
        s.map->updateRequestBodyData(&compressed, true, false, false, nullptr, shouldCompress, {});
    if (!body || compressed != shouldCompress) state.SkipWithError("no body of the kind asked");
    bytes = body ? body->size() : 0;
    benchmark::DoNotOptimize(body);
  }
  state.counters["body_bytes"] = static_cast<double>(bytes);
}

void BM_UpdateRequestBodyXmlGzip(benchmark::State& state) {
  requestBody(state, true);
}
BENCHMARK(BM_UpdateRequestBodyXmlGzip)->Unit(benchmark::kMillisecond)->Repetitions(10);

void BM_UpdateRequestBodyXml(benchmark::State& state) {
  requestBody(state, false);
}
BENCHMARK(BM_UpdateRequestBodyXml)->Unit(benchmark::kMillisecond)->Repetitions(10);

// For comparison: the same body made as a property-list tree and written by
// the general writer, which is what the body's own writer replaces.
void BM_UpdateRequestBodyThroughGeneralWriter(benchmark::State& state) {
  Shared& s = shared();
  for (auto _ : state) {
    PlistArray entries;
    for (const auto& product : s.map->allProducts()) {
      larder::LedgerSoftwareProductFields fields = product->snapshot();
      PlistDictionary entry{{"ware-id", std::to_string(*fields.itemIdentifier)},
                            {"installed-version-identifier", *fields.versionIdentifier},
                            {"HostBundleIdentifier", *fields.bundleIdentifier},
                            {"HostBundleShortVersionString", *fields.bundleVersion}};
      entries.emplace_back(std::move(entry));
    }
    std::string xml = larder::PropertyListSerialization::writeXml(
        PlistDictionary{{"local-software", std::move(entries)}});
    benchmark::DoNotOptimize(xml);
  }
}
BENCHMARK(BM_UpdateRequestBodyThroughGeneralWriter)->Unit(benchmark::kMillisecond)->Repetitions(5);

}  // namespace

BENCHMARK_MAIN();
