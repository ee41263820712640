// Costs of the dispatch queue operations the service leans on. The one that matters most is a
// synchronous reader on a concurrent queue: every lookup is one, from several threads at once, so
// its cost alone and how it scales with a second reader thread are both measured.

#include <benchmark/benchmark.h>

#include <atomic>
#include <map>
#include <memory>
#include <string>
#include <thread>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/DispatchSemaphore.h"

namespace larder {
namespace {

DispatchQueue& sharedConcurrentQueue() {
  static const std::shared_ptr<DispatchQueue> queue =
      DispatchQueue::create("bench.concurrent", DispatchQueue::Kind::Concurrent);
  return *queue;
}

// The fast path alone: a block that does next to nothing.
void BM_ConcurrentSyncReader(benchmark::State& state) {
  DispatchQueue& queue = sharedConcurrentQueue();
  int value = 0;
  for (auto _ : state) {
    queue.sync([&value] { benchmark::DoNotOptimize(++value); });
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ConcurrentSyncReader)->Threads(1)->Threads(2)->UseRealTime()->Repetitions(5);

// A table about the size of the service's registry. A block of a few lookups in it costs on the
// order of 100 ns: the kind of block readers really run.
const std::map<std::string, int>& sampleTable() {
  static const std::map<std::string, int> table = [] {
    std::map<std::string, int> entries;
    for (int i = 0; i < 1000; ++i) {
      entries.emplace("com.example.application." + std::to_string(i), i);
    }
    return entries;
  }();
  return table;
}

class LookupBlock {
 public:
  explicit LookupBlock(int seed) {
    for (int i = 0; i < kLookups; ++i) {
      keys_[i] = "com.example.application." + std::to_string((seed * 131 + i * 197) % 1000);
    }
  }

  [[nodiscard]] int run() const {
    const auto& table = sampleTable();
    int sum = 0;
    for (const std::string& key : keys_) {
      sum += table.find(key)->second;
    }
    return sum;
  }

 private:
  static constexpr int kLookups = 5;
  std::string keys_[kLookups];
};

void BM_ConcurrentSyncReaderLookup(benchmark::State& state) {
  DispatchQueue& queue = sharedConcurrentQueue();
  const LookupBlock block(state.thread_index());
  for (auto _ : state) {
    int found = 0;
    queue.sync([&] { found = block.run(); });
    benchmark::DoNotOptimize(found);
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ConcurrentSyncReaderLookup)->Threads(1)->Threads(2)->UseRealTime()->Repetitions(5);

// The same block without any queue: the ceiling the readers above can reach on this machine.
void BM_LookupWithoutQueue(benchmark::State& state) {
  const LookupBlock block(state.thread_index());
  for (auto _ : state) {
    benchmark::DoNotOptimize(block.run());
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_LookupWithoutQueue)->Threads(1)->Threads(2)->UseRealTime()->Repetitions(5);

void BM_ConcurrentBarrierSync(benchmark::State& state) {
  auto queue = DispatchQueue::create("bench.barrier", DispatchQueue::Kind::Concurrent);
  int value = 0;
  for (auto _ : state) {
    queue->barrierSync([&value] { benchmark::DoNotOptimize(++value); });
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ConcurrentBarrierSync)->Repetitions(5);

void BM_SerialSync(benchmark::State& state) {
  auto queue = DispatchQueue::create("bench.serial", DispatchQueue::Kind::Serial);
  int value = 0;
  for (auto _ : state) {
    queue->sync([&value] { benchmark::DoNotOptimize(++value); });
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_SerialSync)->Repetitions(5);

// Hands an item to the worker thread and waits for it in line: the cost of a round trip through
// a serial queue, wake-up of the worker included.
void BM_SerialAsyncThenSyncRoundTrip(benchmark::State& state) {
  auto queue = DispatchQueue::create("bench.roundtrip", DispatchQueue::Kind::Serial);
  int value = 0;
  for (auto _ : state) {
    queue->async([&value] { benchmark::DoNotOptimize(++value); });
    queue->sync([&value] { benchmark::DoNotOptimize(value); });
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_SerialAsyncThenSyncRoundTrip)->Repetitions(5);

// Two threads handing a token back and forth through semaphores: what waking a sleeping thread
// costs on this machine, the floor under the round trip above.
void BM_ThreadWakeUpRoundTrip(benchmark::State& state) {
  DispatchSemaphore ping;
  DispatchSemaphore pong;
  std::atomic<bool> done{false};
  std::thread partner([&] {
    for (;;) {
      ping.wait();
      if (done) {
        return;
      }
      pong.signal();
    }
  });
  for (auto _ : state) {
    ping.signal();
    pong.wait();
  }
  done = true;
  ping.signal();
  partner.join();
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ThreadWakeUpRoundTrip)->Repetitions(5);

// Many items handed over in a row: the throughput of a serial queue's worker.
void BM_SerialAsyncBatch(benchmark::State& state) {
  auto queue = DispatchQueue::create("bench.batch", DispatchQueue::Kind::Serial);
  int value = 0;
  constexpr int kBatch = 1000;
  for (auto _ : state) {
    for (int i = 0; i < kBatch; ++i) {
      queue->async([&value] { benchmark::DoNotOptimize(++value); });
    }
    queue->sync([] {});
  }
  state.SetItemsProcessed(state.iterations() * kBatch);
}
BENCHMARK(BM_SerialAsyncBatch)->Repetitions(5);

// The same on a concurrent queue, whose workers take the items in parallel; the barrier at the
// end waits for all of them.
void BM_ConcurrentAsyncBatch(benchmark::State& state) {
  auto queue = DispatchQueue::create("bench.concurrent-batch", DispatchQueue::Kind::Concurrent);
  std::atomic<int> value{0};
  constexpr int kBatch = 1000;
  for (auto _ : state) {
    for (int i = 0; i < kBatch; ++i) {
      queue->async([&value] { value.fetch_add(1, std::memory_order_relaxed); });
    }
    queue->barrierSync([] {});
  }
  state.SetItemsProcessed(state.iterations() * kBatch);
}
BENCHMARK(BM_ConcurrentAsyncBatch)->Repetitions(5);

}  // namespace
}  // namespace larder

BENCHMARK_MAIN();
