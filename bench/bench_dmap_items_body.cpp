// Building the body of the cloud library's items request for an owner who
// holds 10,000 items: one 36-byte token entry per item, from the token
// pairs the owner hands over. Target: at most 2 ms per body.
//
// `BM_ItemsBody` times `DAAPClient::itemsRequestBody` alone, as a poll
// calls it with the owner's pairs in hand; `BM_TokenPairsAndItemsBody`
// adds making the pairs with `tokenPairWithCloudID`, which is the owner's
// work, for scale.

#include <benchmark/benchmark.h>

#include <cstdint>
#include <string>

#include "dmap/DAAPClient.h"
#include "dmap/DAAPMediaKindQuery.h"

namespace {

using larder::DAAPClient;

constexpr std::int64_t kDefaultPairs = 10000;

DAAPClient::TokenPairs makePairs(std::int64_t count) {
  DAAPClient::TokenPairs pairs;
  pairs.reserve(static_cast<std::size_t>(count));
  for (std::int64_t index = 0; index < count; ++index) {
    const auto cloudID = static_cast<std::uint64_t>(0x5000000000ULL + index * 7919);
    const auto token = static_cast<std::uint32_t>(index * 2654435761U);
    pairs.push_back(*DAAPClient::tokenPairWithCloudID(cloudID, token));
  }
  return pairs;
}

std::optional<std::string> query() {
  const std::vector<std::int64_t> kinds{2, 64};
  return larder::DAAPMediaKindQuery::text(kinds);
}

void BM_ItemsBody(benchmark::State& state) {
  const DAAPClient::TokenPairs pairs = makePairs(state.range(0));
  const std::optional<std::string> mediaKinds = query();
  std::size_t bytes = 0;
  for (auto _ : state) {
    const larder::PlistData body =
        DAAPClient::itemsRequestBody(1700000000, 77, 42, 41, mediaKinds, pairs);
    bytes = body.size();
    benchmark::DoNotOptimize(body.data());
    benchmark::ClobberMemory();
  }
  state.counters["pairs"] = static_cast<double>(state.range(0));
  state.counters["body_bytes"] = static_cast<double>(bytes);
  state.SetItemsProcessed(state.iterations() * state.range(0));
  state.SetBytesProcessed(state.iterations() * static_cast<std::int64_t>(bytes));
}
BENCHMARK(BM_ItemsBody)->Arg(kDefaultPairs)->Arg(100000)->Unit(benchmark::kMicrosecond);

void BM_TokenPairsAndItemsBody(benchmark::State& state) {
  const std::optional<std::string> mediaKinds = query();
  for (auto _ : state) {
    const DAAPClient::TokenPairs pairs = makePairs(state.range(0));
    const larder::PlistData body =
        DAAPClient::itemsRequestBody(1700000000, 77, 42, 41, mediaKinds, pairs);
    benchmark::DoNotOptimize(body.data());
    benchmark::ClobberMemory();
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(BM_TokenPairsAndItemsBody)->Arg(kDefaultPairs)->Unit(benchmark::kMicrosecond);

}  // namespace

BENCHMARK_MAIN();
