// Encoding and decoding a catalogue of installed products: our binary codec
// against libplist's.

#include <benchmark/benchmark.h>
#include <plist/plist.h>

#include <memory>
#include <optional>
#include <string>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/value/PlistValue.h"

namespace {

using larder::PlistArray;
using larder::PlistData;
using larder::PlistDate;
using larder::PlistDictionary;
using larder::PlistValue;
using larder::PropertyListSerialization;

constexpr int kProducts = 10'000;

struct PlistNodeDeleter {
  void operator()(void* node) const { plist_free(node); }
};
using PlistNode = std::unique_ptr<void, PlistNodeDeleter>;

PlistValue productRecord(int index) {
  const std::string number = std::to_string(index);
  PlistDictionary record;
  record["bundlePath"] = "/Applications/App" + number + ".app";
  record["bundleIdentifier"] = "com.example.app" + number;
  record["bundleVersion"] = "1.2.3";
  record["shortVersion"] = "1.2";
  record["title"] = "App " + number;
  record["artistName"] = "Example Developer";
  record["kind"] = "software";
  record["itemId"] = std::int64_t{400'000'000} + index;
  record["storefrontId"] = 143441;
  record["genreId"] = 6002 + index % 20;
  record["sizeInBytes"] = std::int64_t{1'000'000} * (index % 500 + 1);
  record["purchaseDate"] = PlistDate{1'600'000'000.0 + index * 37.5};
  record["isInstalled"] = index % 3 != 0;
  record["hasUpdate"] = index % 7 == 0;
  return record;
}

const PlistValue& catalogue() {
  static const PlistValue value = [] {
    PlistArray records;
    records.reserve(kProducts);
    for (int index = 0; index < kProducts; ++index) records.push_back(productRecord(index));
    return PlistValue(std::move(records));
  }();
  return value;
}

PlistNode libplistRecord(int index) {
  const std::string number = std::to_string(index);
  PlistNode record(plist_new_dict());
  const auto set = [&](const char* key, plist_t node) {
    plist_dict_set_item(record.get(), key, node);
  };
  set("bundlePath", plist_new_string(("/Applications/App" + number + ".app").c_str()));
  set("bundleIdentifier", plist_new_string(("com.example.app" + number).c_str()));
  set("bundleVersion", plist_new_string("1.2.3"));
  set("shortVersion", plist_new_string("1.2"));
  set("title", plist_new_string(("App " + number).c_str()));
  set("artistName", plist_new_string("Example Developer"));
  set("kind", plist_new_string("software"));
  set("itemId", plist_new_uint(400'000'000u + static_cast<unsigned>(index)));
  set("storefrontId", plist_new_uint(143441));
  set("genreId", plist_new_uint(6002u + static_cast<unsigned>(index % 20)));
  set("sizeInBytes", plist_new_uint(1'000'000ull * static_cast<unsigned>(index % 500 + 1)));
  const double since2001 = 1'600'000'000.0 + index * 37.5 - 978307200.0;
  const auto seconds = static_cast<std::int32_t>(since2001);
  const auto microseconds = static_cast<std::int32_t>((since2001 - seconds) * 1e6);
  set("purchaseDate", plist_new_date(seconds, microseconds));
  set("isInstalled", plist_new_bool(index % 3 != 0));
  set("hasUpdate", plist_new_bool(index % 7 == 0));
  return record;
}

PlistNode libplistCatalogue() {
  PlistNode array(plist_new_array());
  for (int index = 0; index < kProducts; ++index) {
    plist_array_append_item(array.get(), libplistRecord(index).release());
  }
  return array;
}

PlistData libplistEncode(plist_t node) {
  char* raw = nullptr;
  std::uint32_t length = 0;
  plist_to_bin(node, &raw, &length);
  PlistData bytes(raw, raw + length);
  plist_to_bin_free(raw);
  return bytes;
}

void BM_EncodeCatalogue(benchmark::State& state) {
  const PlistValue& value = catalogue();
  std::size_t bytes = 0;
  for (auto _ : state) {
    const PlistData encoded = PropertyListSerialization::writeBinary(value);
    bytes = encoded.size();
    benchmark::DoNotOptimize(encoded.data());
  }
  state.counters["fileBytes"] = static_cast<double>(bytes);
}
BENCHMARK(BM_EncodeCatalogue)->Unit(benchmark::kMillisecond);

// The encoder at two catalogue sizes, so that work growing faster than the
// number of records shows in the fitted complexity.
void BM_EncodeCatalogueBySize(benchmark::State& state) {
  const auto count = static_cast<int>(state.range(0));
  PlistArray records;
  records.reserve(static_cast<std::size_t>(count));
  for (int index = 0; index < count; ++index) records.push_back(productRecord(index));
  const PlistValue value(std::move(records));
  for (auto _ : state) {
    const PlistData encoded = PropertyListSerialization::writeBinary(value);
    benchmark::DoNotOptimize(encoded.data());
  }
  state.SetComplexityN(state.range(0));
}
BENCHMARK(BM_EncodeCatalogueBySize)
    ->Arg(10'000)
    ->Arg(40'000)
    ->Complexity(benchmark::oN)
    ->Unit(benchmark::kMillisecond);

// Decoding alone: releasing the tree of the previous iteration is kept out
// of the timed region, since it costs as much as building it.
void BM_DecodeCatalogue(benchmark::State& state) {
  const PlistData encoded = PropertyListSerialization::writeBinary(catalogue());
  std::optional<PlistValue> value;
  for (auto _ : state) {
    value = PropertyListSerialization::readBinary(encoded);
    if (!value) state.SkipWithError("decode failed");
    benchmark::DoNotOptimize(value);
    state.PauseTiming();
    value.reset();
    state.ResumeTiming();
  }
}
BENCHMARK(BM_DecodeCatalogue)->Unit(benchmark::kMillisecond);

void BM_DecodeAndFreeCatalogue(benchmark::State& state) {
  const PlistData encoded = PropertyListSerialization::writeBinary(catalogue());
  for (auto _ : state) {
    std::optional<PlistValue> value = PropertyListSerialization::readBinary(encoded);
    if (!value) state.SkipWithError("decode failed");
    benchmark::DoNotOptimize(value);
  }
}
BENCHMARK(BM_DecodeAndFreeCatalogue)->Unit(benchmark::kMillisecond);

void BM_LibplistEncodeCatalogue(benchmark::State& state) {
  const PlistNode node = libplistCatalogue();
  std::size_t bytes = 0;
  for (auto _ : state) {
    const PlistData encoded = libplistEncode(node.get());
    bytes = encoded.size();
    benchmark::DoNotOptimize(encoded.data());
  }
  state.counters["fileBytes"] = static_cast<double>(bytes);
}
BENCHMARK(BM_LibplistEncodeCatalogue)->Unit(benchmark::kMillisecond);

void BM_LibplistDecodeCatalogue(benchmark::State& state) {
  const PlistData encoded = libplistEncode(libplistCatalogue().get());
  PlistNode node;
  for (auto _ : state) {
    plist_t raw = nullptr;
    plist_from_bin(reinterpret_cast<const char*>(encoded.data()),
                   static_cast<std::uint32_t>(encoded.size()), &raw);
    node.reset(raw);
    if (!node) state.SkipWithError("decode failed");
    benchmark::DoNotOptimize(raw);
    state.PauseTiming();
    node.reset();
    state.ResumeTiming();
  }
}
BENCHMARK(BM_LibplistDecodeCatalogue)->Unit(benchmark::kMillisecond);

void BM_LibplistDecodeAndFreeCatalogue(benchmark::State& state) {
  const PlistData encoded = libplistEncode(libplistCatalogue().get());
  for (auto _ : state) {
    plist_t raw = nullptr;
    plist_from_bin(reinterpret_cast<const char*>(encoded.data()),
                   static_cast<std::uint32_t>(encoded.size()), &raw);
    const PlistNode node(raw);
    if (!node) state.SkipWithError("decode failed");
    benchmark::DoNotOptimize(raw);
  }
}
BENCHMARK(BM_LibplistDecodeAndFreeCatalogue)->Unit(benchmark::kMillisecond);

// Our reader on libplist's encoding of the same catalogue, to show the
// decode cost does not depend on whose writer made the file.
void BM_DecodeLibplistEncodedCatalogue(benchmark::State& state) {
  const PlistData encoded = libplistEncode(libplistCatalogue().get());
  std::optional<PlistValue> value;
  for (auto _ : state) {
    value = PropertyListSerialization::readBinary(encoded);
    if (!value) state.SkipWithError("decode failed");
    benchmark::DoNotOptimize(value);
    state.PauseTiming();
    value.reset();
    state.ResumeTiming();
  }
}
BENCHMARK(BM_DecodeLibplistEncodedCatalogue)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
