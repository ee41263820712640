// A 200 MB package from the reference store, fetched and checked chunk by
// chunk by the download layer (a stage-only download: fetch, check, keep),
// against `curl -s -o FILE URL` of the same file in the same run. Reports
// both throughputs and their ratio; the target is a ratio of at least 0.8.
#include <archive.h>
#include <archive_entry.h>
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <filesystem>
#include <mutex>
#include <optional>
#include <random>
#include <stdexcept>
#include <string>
#include <vector>

#include "BenchProcesses.h"
#include "bench/BenchFiles.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/download/VendDownloadManager.h"
#include "store-runtime/http/VendHTTPTransfer.h"
#include "store-runtime/records/TillPurchase.h"
#include "store-runtime/records/TillPurchaseResponse.h"

extern char** environ;

namespace {

namespace fs = std::filesystem;
using namespace larder;

constexpr std::uint64_t kWareID = 900;
constexpr std::size_t kPayloadBytes = 200u << 20u;

// A package whose payload is pseudo-random, so that nothing on the way can
// compress it; written in blocks, never whole in memory.
void writePackage(const fs::path& path) {
  archive* writer = archive_write_new();
  archive_write_set_format_pax_restricted(writer);
  archive_write_open_filename(writer, path.c_str());
  auto header = [&](const std::string& name, unsigned type, la_int64_t size) {
    archive_entry* entry = archive_entry_new();
    archive_entry_set_pathname(entry, name.c_str());
    archive_entry_set_filetype(entry, type);
    archive_entry_set_perm(entry, type == AE_IFDIR ? 0755 : 0644);
    archive_entry_set_size(entry, size);
    archive_write_header(writer, entry);
    archive_entry_free(entry);
  };
  header("Bench.app/", AE_IFDIR, 0);
  const std::string info = PropertyListSerialization::writeXml(
      PlistDictionary{{"HostBundleIdentifier", "com.example.bench"}, {"HostBundleVersion", "1.0"}});
  header("Bench.app/bundle.plist", AE_IFREG, static_cast<la_int64_t>(info.size()));
  archive_write_data(writer, info.data(), info.size());
  header("Bench.app/resources/payload.bin", AE_IFREG, kPayloadBytes);
  std::mt19937_64 generator(42);
  std::vector<std::uint64_t> block((1u << 20u) / sizeof(std::uint64_t));
  for (std::size_t written = 0; written < kPayloadBytes;
       written += block.size() * sizeof(std::uint64_t)) {
    for (std::uint64_t& word : block) word = generator();
    archive_write_data(writer, block.data(), block.size() * sizeof(std::uint64_t));
  }
  archive_write_close(writer);
  archive_write_free(writer);
}

void writeCatalogue(const fs::path& catalogue) {
  const fs::path item = catalogue / "items" / std::to_string(kWareID);
  fs::create_directories(item);
  writePackage(item / "Bench.tar");
  const PlistDictionary entry{{"ware-id", static_cast<std::int64_t>(kWareID)},
                              {"bundle-id", "com.example.bench"},
                              {"title", "Bench"},
                              {"version", "1.0"},
                              {"package", "Bench.tar"},
                              {"accountLess", true}};
  larder::bench::writeFixture((item / "item.plist").string(),
                              PropertyListSerialization::writeXml(entry));
}

pid_t spawn(const std::vector<std::string>& argv, int stdoutFd) {
  return larder::bench::spawn(argv, {}, stdoutFd);
}

// The reference store on a free port, serving a catalogue of one item.
class ReferenceStore {
 public:
  explicit ReferenceStore(const fs::path& catalogue) {
    int pipeFds[2];
    if (::pipe(pipeFds) != 0) throw std::runtime_error("pipe");
    pid_ = spawn({LARDER_STORE_PATH, "--catalogue", catalogue.string(), "--port", "0"}, pipeFds[1]);
    ::close(pipeFds[1]);
    if (pid_ < 0) throw std::runtime_error("cannot start larder-store");
    FILE* output = ::fdopen(pipeFds[0], "r");
    char line[512] = {};
    const bool got = std::fgets(line, sizeof(line), output) != nullptr;
    std::fclose(output);
    const std::string text = got ? line : "";
    const std::string prefix = "larder-store listening on ";
    if (text.rfind(prefix, 0) != 0) throw std::runtime_error("larder-store said: " + text);
    baseURL_ = text.substr(prefix.size());
    while (!baseURL_.empty() && (baseURL_.back() == '\n' || baseURL_.back() == '\r'))
      baseURL_.pop_back();
  }
  ~ReferenceStore() {
    ::kill(pid_, SIGTERM);
    ::waitpid(pid_, nullptr, 0);
  }
  ReferenceStore(const ReferenceStore&) = delete;
  ReferenceStore& operator=(const ReferenceStore&) = delete;

  // The download of the item, as the store's purchase answer gives it.
  [[nodiscard]] std::shared_ptr<TillDownload> purchase() const {
    const VendHTTPTransfer::Result bagAnswer =
        VendHTTPTransfer::perform(VendURLRequest(baseURL_ + "/bag.plist"));
    std::optional<PlistValue> bag = PropertyListSerialization::read(bagAnswer.body);
    const std::string* buyURL = bag ? (*bag)["buy-product"].string() : nullptr;
    if (!buyURL) throw std::runtime_error("the bag has no buy-product URL");
    TillPurchase purchase =
        TillPurchase::purchaseWithBuyParameters("itemId=" + std::to_string(kWareID));
    purchase.setIsAccountLessPurchase(true);
    VendURLRequest request(*buyURL);
    request.setMethod("POST");
    const std::string body = PropertyListSerialization::writeXml(purchase.toDictionary());
    request.setBody(PlistData(body.begin(), body.end()));
    request.setValue("application/x-plist", "Content-Type");
    const VendHTTPTransfer::Result answer = VendHTTPTransfer::perform(request);
    std::optional<PlistValue> parsed = PropertyListSerialization::read(answer.body);
    const PlistDictionary* dictionary = parsed ? parsed->dictionary() : nullptr;
    std::optional<TillPurchaseResponse> response =
        dictionary ? TillPurchaseResponse::fromDictionary(*dictionary) : std::nullopt;
    if (!response || response->downloads().size() != 1) {
      throw std::runtime_error("the purchase answered HTTP " +
                               std::to_string(answer.response.statusCode));
    }
    return response->downloads().front();
  }

 private:
  pid_t pid_ = -1;
  std::string baseURL_;
};

double seconds(std::chrono::steady_clock::duration duration) {
  return std::chrono::duration<double>(duration).count();
}

// Processor time, user and system, of this process or of its waited-for
// children: on a busy machine the ratio of wall times tends to the ratio
// of these.
double processorSeconds(int who) {
  rusage usage{};
  ::getrusage(who, &usage);
  return static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
         static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
}

struct Timing {
  double wall = 0;
  double processor = 0;
};

Timing timeCurl(const std::string& url, const fs::path& file) {
  const double processorBefore = processorSeconds(RUSAGE_CHILDREN);
  const auto started = std::chrono::steady_clock::now();
  const pid_t pid = spawn({"curl", "-s", "-o", file.string(), url}, -1);
  int status = 0;
  ::waitpid(pid, &status, 0);
  const double elapsed = seconds(std::chrono::steady_clock::now() - started);
  if (pid < 0 || !WIFEXITED(status) || WEXITSTATUS(status) != 0)
    throw std::runtime_error("curl failed");
  const double processor = processorSeconds(RUSAGE_CHILDREN) - processorBefore;
  fs::remove(file);
  return {elapsed, processor};
}

Timing timeDownload(VendDownloadManager& manager, const std::shared_ptr<TillDownload>& download,
                    const fs::path& downloads) {
  const double processorBefore = processorSeconds(RUSAGE_SELF);
  std::mutex mutex;
  std::condition_variable done;
  std::optional<OptionalError> outcome;
  const auto started = std::chrono::steady_clock::now();
  manager.performDownload(download, [&](bool, OptionalError error) {
    std::lock_guard lock(mutex);
    outcome = std::move(error);
    done.notify_all();
  });
  std::unique_lock lock(mutex);
  done.wait(lock, [&] { return outcome.has_value(); });
  const double elapsed = seconds(std::chrono::steady_clock::now() - started);
  if (*outcome) throw std::runtime_error((*outcome)->description);
  const double processor = processorSeconds(RUSAGE_SELF) - processorBefore;
  fs::remove_all(downloads);  // the next round fetches again
  return {elapsed, processor};
}

void BM_DownloadAgainstCurl(benchmark::State& state) {
  const fs::path base =
      fs::temp_directory_path() / ("larder-bench-download-" + std::to_string(::getpid()));
  fs::create_directories(base);
  try {
    writeCatalogue(base / "catalogue");
    ReferenceStore store(base / "catalogue");
    std::shared_ptr<TillDownload> download = store.purchase();
    download->setDownloadType(TillDownload::kStageOnly);
    const std::string url = download->assets().front().URLRequest().url();
    const auto bytes = static_cast<double>(download->assets().front().fileSize());

    VendRuntimeConfiguration configuration;
    configuration.downloadsDirectory = (base / "downloads").string();
    VendDownloadManager manager(configuration);
    timeCurl(url, base / "warm.tar");  // the store's file into the page cache

    Timing curlTotal;
    Timing oursTotal;
    std::size_t round = 0;
    for (auto _ : state) {
      // Alternate who goes first, so that neither always meets a disk that
      // is still writing back the other's file.
      Timing curl;
      Timing ours;
      if (round++ % 2 == 0) {
        curl = timeCurl(url, base / "curl.tar");
        ours = timeDownload(manager, download, base / "downloads");
      } else {
        ours = timeDownload(manager, download, base / "downloads");
        curl = timeCurl(url, base / "curl.tar");
      }
      state.SetIterationTime(ours.wall);
      curlTotal.wall += curl.wall;
      curlTotal.processor += curl.processor;
      oursTotal.wall += ours.wall;
      oursTotal.processor += ours.processor;
    }
    const double rounds = static_cast<double>(round);
    state.counters["larder_MBps"] = bytes * rounds / oursTotal.wall / 1e6;
    state.counters["curl_MBps"] = bytes * rounds / curlTotal.wall / 1e6;
    state.counters["ratio"] = curlTotal.wall / oursTotal.wall;
    state.counters["larder_cpu_s"] = oursTotal.processor / rounds;
    state.counters["curl_cpu_s"] = curlTotal.processor / rounds;
    state.SetBytesProcessed(static_cast<std::int64_t>(bytes * rounds));
  } catch (const std::exception& failure) {
    state.SkipWithError(failure.what());
  }
  std::error_code ignored;
  fs::remove_all(base, ignored);
}
BENCHMARK(BM_DownloadAgainstCurl)->Iterations(8)->UseManualTime()->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
