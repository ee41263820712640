// Reading one preference: the domain file is opened and parsed at every
// read, so the cost of a read is the cost of the file. Set beside the bare
// read of the same file's bytes, which no parser can beat.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <cstdlib>
#include <filesystem>
#include <string>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/host/PreferenceStore.h"

namespace {

namespace fs = std::filesystem;
using larder::FileIO;
using larder::PlistArray;
using larder::PlistDate;
using larder::PlistValue;
using larder::PreferenceScope;
using larder::PreferenceStore;
using larder::PropertyListSerialization;

constexpr std::string_view kDomain = "com.orvane.SoftwareUpdate";
constexpr int kKeys = 50;
constexpr const char* kReadKey = "BenchKey25";

// A domain of the usual mix of values, written by the store itself so that
// its format is the one a real read meets.
PlistValue valueForIndex(int index) {
  switch (index % 5) {
    case 0:
      return PlistValue(index % 2 == 0);
    case 1:
      return PlistValue(std::int64_t{86400} * index);
    case 2:
      return PlistValue("https://store.example.com/path/" + std::to_string(index));
    case 3:
      return PlistValue(PlistDate{1'700'000'000.0 + index});
    default:
      return PlistValue(PlistArray{PlistValue("a"), PlistValue(std::int64_t{index})});
  }
}

// A private configuration folder and platform root for the run.
class PreferenceTree {
 public:
  PreferenceTree() {
    std::string pattern = (fs::temp_directory_path() / "larder-bench-prefs-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) std::abort();
    base_ = pattern;
    ::setenv("LARDER_ROOT", (base_ + "/root").c_str(), 1);
    ::setenv("XDG_CONFIG_HOME", (base_ + "/config").c_str(), 1);
    for (int index = 0; index < kKeys; ++index) {
      const std::string key = "BenchKey" + std::to_string(index);
      if (!PreferenceStore::setValue(key, valueForIndex(index), kDomain, PreferenceScope::User)) {
        std::abort();
      }
    }
  }
  ~PreferenceTree() {
    std::error_code ignored;
    fs::remove_all(base_, ignored);
  }
  PreferenceTree(const PreferenceTree&) = delete;
  PreferenceTree& operator=(const PreferenceTree&) = delete;

  [[nodiscard]] static std::string domainFile() {
    return PreferenceStore::pathFor(kDomain, PreferenceScope::User);
  }

 private:
  std::string base_;
};

const PreferenceTree& tree() {
  static const PreferenceTree instance;
  return instance;
}

void BM_ReadDomainFileBytes(benchmark::State& state) {
  const std::string path = tree().domainFile();
  std::size_t bytes = 0;
  for (auto _ : state) {
    auto contents = FileIO::read(path);
    if (!contents) {
      state.SkipWithError("cannot read the domain file");
      return;
    }
    bytes = contents->size();
    benchmark::DoNotOptimize(contents);
  }
  state.counters["fileBytes"] = static_cast<double>(bytes);
}
BENCHMARK(BM_ReadDomainFileBytes);

// The parse alone, from bytes already in hand: what a read adds to the bare read.
void BM_ParseDomainFileBytes(benchmark::State& state) {
  auto contents = FileIO::read(tree().domainFile());
  if (!contents) {
    state.SkipWithError("cannot read the domain file");
    return;
  }
  for (auto _ : state) {
    auto value = PropertyListSerialization::read(*contents);
    if (!value) {
      state.SkipWithError("the domain file does not parse");
      return;
    }
    benchmark::DoNotOptimize(value);
  }
}
BENCHMARK(BM_ParseDomainFileBytes);

// The key is in the user's file, so scope app finds it without the machine's.
void BM_PreferenceValueForKey(benchmark::State& state) {
  (void)tree();
  const auto scope = static_cast<PreferenceScope>(state.range(0));
  for (auto _ : state) {
    PlistValue value = PreferenceStore::valueForKey(kReadKey, kDomain, scope);
    if (value.isNull()) {
      state.SkipWithError("the key was not found");
      return;
    }
    benchmark::DoNotOptimize(value);
  }
}
BENCHMARK(BM_PreferenceValueForKey)
    ->ArgName("scope")
    ->Arg(static_cast<int>(PreferenceScope::App))
    ->Arg(static_cast<int>(PreferenceScope::User));

// A key in neither file: scope app also opens the machine's file, which is missing.
void BM_PreferenceValueForMissingKey(benchmark::State& state) {
  (void)tree();
  for (auto _ : state) {
    PlistValue value = PreferenceStore::valueForKey("NoSuchKey", kDomain);
    benchmark::DoNotOptimize(value);
  }
}
BENCHMARK(BM_PreferenceValueForMissingKey);

}  // namespace

BENCHMARK_MAIN();
