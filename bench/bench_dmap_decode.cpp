// Decoding the cloud library's answer to a full poll: a listing of 100,000
// book items of about 25 tags each. Reports tags per second on one core and
// how many allocations each stored value costs.
//
// Allocations are counted by replacing the global operator new/delete of
// this executable; only the decode is counted, not the destruction of the
// result.

#include <benchmark/benchmark.h>

#include <atomic>
#include <cstdlib>
#include <new>
#include <string>

#include "dmap/DAAPBuffer.h"
#include "dmap/DAAPCode.h"
#include "dmap/DAAPItem.h"
#include "dmap/DAAPParser.h"

// GCC sees malloc'd blocks reach free() through inlined new/delete pairs
// and warns, though the pair below is exactly malloc and free.
#if defined(__GNUC__) && !defined(__clang__)
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"
#endif

namespace {

std::atomic<std::size_t> allocationCount{0};

}  // namespace

// NOLINTBEGIN(cppcoreguidelines-no-malloc): the counting allocator itself.
void* operator new(std::size_t size) {
  allocationCount.fetch_add(1, std::memory_order_relaxed);
  if (void* block = std::malloc(size == 0 ? 1 : size)) return block;
  throw std::bad_alloc();
}
void* operator new[](std::size_t size) {
  return operator new(size);
}
void operator delete(void* block) noexcept {
  std::free(block);
}
void operator delete[](void* block) noexcept {
  std::free(block);
}
void operator delete(void* block, std::size_t) noexcept {
  std::free(block);
}
void operator delete[](void* block, std::size_t) noexcept {
  std::free(block);
}
// NOLINTEND(cppcoreguidelines-no-malloc)

namespace {

using larder::DAAPArray;
using larder::DAAPBuffer;
using larder::DAAPDictionary;
using larder::DAAPItemRef;
using larder::DAAPParser;
using larder::DAAPValue;
using larder::operator""_dmap;

constexpr std::uint32_t kItems = 100'000;

// Writes tags and counts them; containers get their size mended at the end.
class ListingWriter {
 public:
  std::size_t open(std::uint32_t code) {
    ++tags_;
    return buffer_.appendHeader(code, 0);
  }
  void close(std::size_t sizeOffset) {
    buffer_.mendSize(sizeOffset, static_cast<std::uint32_t>(buffer_.length() - sizeOffset - 4));
  }
  void u8(std::uint32_t code, std::uint8_t value) { ++tags_, buffer_.appendUInt8(value, code); }
  void u32(std::uint32_t code, std::uint32_t value) { ++tags_, buffer_.appendUInt32(value, code); }
  void u64(std::uint32_t code, std::uint64_t value) { ++tags_, buffer_.appendUInt64(value, code); }
  void text(std::uint32_t code, const std::string& value) {
    ++tags_, buffer_.appendUTF8String(std::string_view(value), code);
  }
  [[nodiscard]] std::size_t tags() const { return tags_; }
  [[nodiscard]] larder::PlistData data() const { return buffer_.data(); }

 private:
  DAAPBuffer buffer_;
  std::size_t tags_ = 0;
};

// A book as the purchased-books listing sends it: 27 tags, counting the
// item, flavor-listing and flavor containers.
void writeBook(ListingWriter& out, std::uint32_t index) {
  const std::string number = std::to_string(index);
  const std::size_t item = out.open("mlit"_dmap);
  out.u32("miid"_dmap, 1'000'000 + index);
  out.text("minm"_dmap, "The Lighthouse Keeper's Daughter, Volume " + number);
  out.text("asar"_dmap, "Margaret Ellison");
  out.text("asal"_dmap, "Harbour Lights");
  out.u64("asai"_dmap, 0x0100000000000000ULL + index % 5000);
  out.u8("mikd"_dmap, 2);
  out.text("asgn"_dmap, "Historical Fiction");
  out.text("assn"_dmap, "Lighthouse Keeper's Daughter, Volume " + number);
  out.u32("asdp"_dmap, 1'600'000'000 + index * 60);
  out.u32("asda"_dmap, 1'600'000'000 + index * 60);
  out.u64("aepv"_dmap, 3 + index % 4);
  out.text("aePd"_dmap, "1.3");
  out.u32("aeto"_dmap, 0x10000000 + index);
  out.u32("aeMk"_dmap, 8);
  out.u64("aeSI"_dmap, 900'000'000ULL + index);
  out.text("aeCa"_dmap, "https://artwork.example.net/image/thumb/" + number + "/{w}x{h}bb.{f}");
  out.u32("ajEd"_dmap, 1'500'000'000);
  out.u32("aeCS"_dmap, 7'700 + index);
  out.u64("mper"_dmap, 0x5a5a000000000000ULL + index);
  out.u64("aeCd"_dmap, 4'000'000'000ULL + index);
  const std::size_t flavors = out.open("aefl"_dmap);
  const std::size_t flavor = out.open("aeif"_dmap);
  out.u32("aefd"_dmap, 1);
  out.text("asfm"_dmap, "epub");
  out.u64("asls"_dmap, 2'500'000 + index);
  out.text("aeRp"_dmap, "productType=EBOOK&salableAdamId=" + number + "&pricingParameters=RDWN");
  out.close(flavor);
  out.close(flavors);
  out.close(item);
}

struct Listing {
  larder::PlistData bytes;
  std::size_t tags = 0;
};

const Listing& listing() {
  static const Listing built = [] {
    ListingWriter out;
    const std::size_t top = out.open("mupd"_dmap);
    out.u32("mstt"_dmap, 200);
    out.u8("muty"_dmap, 0);
    out.u32("mtco"_dmap, kItems);
    out.u32("mrco"_dmap, kItems);
    out.u32("musr"_dmap, 4242);
    const std::size_t items = out.open("mlcl"_dmap);
    for (std::uint32_t index = 0; index < kItems; ++index) writeBook(out, index);
    out.close(items);
    out.close(top);
    return Listing{out.data(), out.tags()};
  }();
  return built;
}

std::size_t storedValues(const DAAPValue& value);

// Every value a parse stored: dictionary entries, array elements that are
// not containers themselves, and an item's fixed fields that a tag set.
std::size_t storedValues(const DAAPItemRef& item) {
  std::size_t count = (item->name() ? 1 : 0) + (item->songalbum() ? 1 : 0) +
                      (item->songartist() ? 1 : 0) + (item->songalbumartist() ? 1 : 0) +
                      (item->itemID() != 0 ? 1 : 0) + (item->songalbumid() != 0 ? 1 : 0) +
                      (item->containerItemID() != 0 ? 1 : 0) +
                      (item->downloadStatus() != 0 ? 1 : 0);
  for (const auto& [key, element] : *item->additionalInfo()) count += storedValues(element);
  return count;
}

std::size_t storedValues(const DAAPValue& value) {
  if (const DAAPItemRef item = value.item()) return storedValues(item);
  if (const DAAPArray* array = value.array()) {
    std::size_t count = 0;
    for (const DAAPValue& element : *array) count += storedValues(element);
    return count;
  }
  if (const DAAPDictionary* dictionary = value.dictionary()) {
    std::size_t count = 0;
    for (const auto& [key, element] : *dictionary) {
      const bool isContainer = element.isArray() || element.isDictionary() || element.isItem();
      count += isContainer ? storedValues(element) : 1;
    }
    return count;
  }
  return 1;
}

void checkResult(benchmark::State& state, const DAAPValue& result) {
  const DAAPArray* items = result["dmap.listing"].array();
  if (!items || items->size() != kItems) state.SkipWithError("the listing did not decode");
}

void BM_DecodeListing(benchmark::State& state) {
  const Listing& input = listing();
  std::size_t allocations = 0;
  std::size_t stored = 0;
  for (auto _ : state) {
    const std::size_t before = allocationCount.load(std::memory_order_relaxed);
    DAAPValue result = DAAPParser::decodeData(input.bytes);
    allocations = allocationCount.load(std::memory_order_relaxed) - before;
    benchmark::DoNotOptimize(result);
    state.PauseTiming();
    checkResult(state, result);
    stored = storedValues(result);
    result = DAAPValue();  // destruction is not part of the decode
    state.ResumeTiming();
  }
  state.counters["tags"] = static_cast<double>(input.tags);
  state.counters["document_bytes"] = static_cast<double>(input.bytes.size());
  state.counters["tags/s"] = benchmark::Counter(static_cast<double>(input.tags),
                                                benchmark::Counter::kIsIterationInvariantRate);
  state.counters["stored_values"] = static_cast<double>(stored);
  state.counters["allocs"] = static_cast<double>(allocations);
  state.counters["allocs_per_value"] =
      static_cast<double>(allocations) / static_cast<double>(stored);
  state.counters["allocs_per_item"] = static_cast<double>(allocations) / kItems;
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * input.bytes.size()));
}
BENCHMARK(BM_DecodeListing)->Unit(benchmark::kMillisecond)->MinTime(3.0);

// The same with the destruction of the result counted in, as a caller that
// drops the listing after use pays it.
void BM_DecodeAndReleaseListing(benchmark::State& state) {
  const Listing& input = listing();
  for (auto _ : state) {
    DAAPValue result = DAAPParser::decodeData(input.bytes);
    benchmark::DoNotOptimize(result);
  }
  state.counters["tags/s"] = benchmark::Counter(static_cast<double>(input.tags),
                                                benchmark::Counter::kIsIterationInvariantRate);
}
BENCHMARK(BM_DecodeAndReleaseListing)->Unit(benchmark::kMillisecond)->MinTime(3.0);

}  // namespace

BENCHMARK_MAIN();
