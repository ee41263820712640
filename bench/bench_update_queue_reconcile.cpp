// The end of an update check: an answer of 5,000 updates reconciled with a
// cache of 5,000, half of them the same updates, the file written. The
// queue is remade from its cache before each iteration, outside the timing.
// Run it with standard error sent to /dev/null: the log goes there.
#include <benchmark/benchmark.h>
#include <cstdlib>

#include <memory>
#include <string>

#include "LoadedSoftwareMap.h"
#include "bench/BenchFiles.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "update-queue/LoadUpdateQueueOperation.h"
#include "update-queue/UpdateQueue.h"

namespace {

using larder::LedgerUpdate;
using larder::PlistArray;
using larder::PlistDictionary;
using larder::UpdateQueue;

constexpr std::uint64_t kUpdates = 5'000;

PlistDictionary item(std::uint64_t wareID, const std::string& version) {
  return PlistDictionary{{"ware-id", wareID},
                         {"bundle-id", "com.example.app" + std::to_string(wareID)},
                         {"title", "App " + std::to_string(wareID)},
                         {"version", version},
                         {"action-params", "productType=C&itemId=" + std::to_string(wareID)},
                         {"release-date", larder::PlistDate{1700000000}},
                         {"size", std::int64_t{123456789}}};
}

struct Shared : larder::bench::LoadedSoftwareMap {
  Shared() : LoadedSoftwareMap(1) {
    ::setenv("XDG_CACHE_HOME", fixture.cacheHome().c_str(), 1);
    PlistArray cached;
    for (std::uint64_t id = 1; id <= kUpdates; ++id) {
      PlistDictionary entry = item(id, "1.0");
      entry.emplace(LedgerUpdate::kHasBeenSeenByUserKey, true);
      cached.emplace_back(std::move(entry));
    }
    cache = larder::PropertyListSerialization::writeBinary(
        PlistDictionary{{"updates", cached}, {"incompatibleUpdates", PlistArray{}}});
    // Half of the answer is already known, half is new.
    for (std::uint64_t id = kUpdates / 2 + 1; id <= kUpdates / 2 + kUpdates; ++id) {
      answer.push_back(LedgerUpdate::initWithDictionary(item(id, "2.0")));
    }
  }

  larder::PlistData cache;
  UpdateQueue::UpdateList answer;
};

Shared& shared() {
  static Shared instance;
  return instance;
}

// The argument is the log level: 0 for the work alone, 2 (the default) to
// include the lines it logs, 2,500 of them for the updates that went.
void BM_ReconcileAnswerWithCache(benchmark::State& state) {
  Shared& s = shared();
  larder::TillLogManager::sharedManager().setLevel(static_cast<int>(state.range(0)));
  const std::string path = UpdateQueue::cachePath().value_or("");
  std::size_t kept = 0;
  for (auto _ : state) {
    state.PauseTiming();
    larder::bench::writeFixture(path, s.cache);
    auto queue =
        std::make_shared<UpdateQueue>(larder::VendStoreClient::initWithStoreClientType(0),
                                      std::weak_ptr<larder::UpdateQueueDelegate>(), *s.map);
    larder::LoadUpdateQueueOperation operation(larder::VendStoreClient::initWithStoreClientType(0),
                                               *s.map);
    operation.setAvailableUpdates(s.answer);
    state.ResumeTiming();
    queue->updateCheckDidFinish(operation, true, std::nullopt);
    kept = queue->availableUpdates()->size();
  }
  if (kept != kUpdates) state.SkipWithError("the reconciled list has the wrong length");
  state.counters["updates"] = static_cast<double>(kept);
  larder::TillLogManager::sharedManager().setLevel(0);
}
BENCHMARK(BM_ReconcileAnswerWithCache)
    ->Arg(0)
    ->Arg(2)
    ->Unit(benchmark::kMillisecond)
    ->Repetitions(10);

}  // namespace

BENCHMARK_MAIN();
