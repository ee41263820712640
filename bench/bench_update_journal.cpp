// The installed-updates journal at 10,000 entries (and at 200, about what
// a busy month makes): one append, which reads, prunes, appends and writes
// the whole file atomically with its fsyncs; the read alone; and the store
// application's InstalledUpdatesJournal against larderd on a private bus.
//
// The append's clock moves on one second per iteration, and the entries,
// the appended ones too, are a second apart, so each append prunes the
// oldest entry and adds one: the journal keeps its size (checked after the
// loop) and every iteration does the prune. Each entry is an app update's
// record as the store sends it (ten keys, a short release-notes text),
// about 260 bytes in the file.

#include <benchmark/benchmark.h>
#include <signal.h>
#include <sys/wait.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <thread>

#include "BenchFiles.h"
#include "BenchProcesses.h"
#include "client/ServiceClient.h"
#include "platform/plist/PropertyListSerialization.h"
#include "update-queue/journal/UpdateJournal.h"

namespace {

namespace fs = std::filesystem;
using namespace larder;

constexpr int kEntries = 10'000;
// The first entry's date; the clock starts 30 days and half a second later.
constexpr double kFirstDate = 1'790'000'000;

PlistDictionary appEntry(int index, double date) {
  return {{"ware-id", std::uint64_t(400000000 + index)},
          {"bundle-id", "com.example.app" + std::to_string(index)},
          {"title", "Application " + std::to_string(index)},
          {"version", "2." + std::to_string(index % 50) + ".1"},
          {"action-params", "productType=C&price=0&salableAdamId=" + std::to_string(index)},
          {"release-date", PlistDate{1700000000}},
          {"release-notes",
           "Fixes and improvements to syncing, search and the widgets; "
           "faster start on large libraries."},
          {"artwork-url", "https://store.example/art/" + std::to_string(index) + ".png"},
          {"local.isStaged", true},
          {"installDate", PlistDate{date}}};
}

// A folder of the run's own, removed at the end.
class Scratch {
 public:
  Scratch() {
    std::string pattern = (fs::temp_directory_path() / "larder-bench-journal-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("mkdtemp");
    path_ = pattern;
  }
  ~Scratch() {
    std::error_code ignored;
    fs::remove_all(path_, ignored);
  }
  [[nodiscard]] const std::string& path() const { return path_; }

 private:
  std::string path_;
};

void writeJournal(const std::string& path, int entries, double firstDate) {
  PlistArray list;
  list.reserve(entries);
  for (int index = 0; index < entries; ++index)
    list.emplace_back(appEntry(index, firstDate + index));
  bench::writeFixture(path, PropertyListSerialization::writeBinary(PlistDictionary{
                                {std::string(UpdateJournal::kEntriesKey), std::move(list)}}));
}

void BM_AppendWithPruning(benchmark::State& state) {
  Scratch scratch;
  const std::string path = scratch.path() + "/Quaymart/updatejournal.plist";
  const auto size = static_cast<int>(state.range(0));
  writeJournal(path, size, kFirstDate);
  std::atomic<double> now{kFirstDate + UpdateJournal::kMaximumAgeSeconds - 0.5};
  UpdateJournal journal(path, [&now] { return PlistDate{now.load()}; });
  int appended = size;
  for (auto _ : state) {
    now.store(now.load() + 1);
    journal.appendCriticalUpdates({appEntry(appended, kFirstDate + appended)});
    ++appended;
  }
  // After the loop: the timing has ended.
  const auto kept = journal.installedUpdatesJournalIgnoringPendingUpdates(false);
  if (kept.size() != static_cast<std::size_t>(size)) {
    state.SkipWithError("the journal did not keep its size: the prune did not run");
  }
  state.counters["entries"] = static_cast<double>(kept.size());
  state.counters["fileBytes"] = static_cast<double>(fs::file_size(path));
}
BENCHMARK(BM_AppendWithPruning)
    ->Arg(kEntries)
    ->Arg(200)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

// The read that the bus request makes, in this process: the file read,
// parsed, pruned and the pending entries left out.
void BM_InstalledUpdatesJournalRead(benchmark::State& state) {
  Scratch scratch;
  const std::string path = scratch.path() + "/updatejournal.plist";
  const auto size = static_cast<int>(state.range(0));
  writeJournal(path, size, kFirstDate);
  UpdateJournal journal(path, [] { return PlistDate{kFirstDate + kEntries}; });
  std::size_t read = 0;
  for (auto _ : state) read = journal.installedUpdatesJournal().size();
  if (read != static_cast<std::size_t>(size)) state.SkipWithError("the read lost entries");
}
BENCHMARK(BM_InstalledUpdatesJournalRead)
    ->Arg(kEntries)
    ->Arg(200)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

// larderd on a private bus whose user's journal holds `entries` recent entries.
struct ServiceOnPrivateBus {
  explicit ServiceOnPrivateBus(int entries) {
    const std::string data = scratch.path() + "/data";
    using Seconds = std::chrono::duration<double>;
    const double now = Seconds(std::chrono::system_clock::now().time_since_epoch()).count();
    writeJournal(data + "/larder/Quaymart/updatejournal.plist", entries, now - entries - 60);
    fs::create_directories(scratch.path() + "/root/Applications");
    fs::create_directories(scratch.path() + "/home");
    pid = bench::spawn(
        {LARDERD_PATH},
        {"DBUS_SESSION_BUS_ADDRESS=" + bus.address(), "HOME=" + scratch.path() + "/home",
         "LARDER_ROOT=" + scratch.path() + "/root", "XDG_CACHE_HOME=" + scratch.path() + "/cache",
         "XDG_STATE_HOME=" + scratch.path() + "/state",
         "XDG_CONFIG_HOME=" + scratch.path() + "/config", "XDG_DATA_HOME=" + data,
         "LARDER_LOG_LEVEL=0"},
        -1);
    client =
        std::make_unique<ServiceClient>(sdbus::createSessionBusConnectionWithAddress(bus.address()),
                                        "com.orvane.larderd", 10'000'000);
    for (int attempt = 0; attempt < 250; ++attempt) {
      try {
        client->presentStoreClient(0);
        return;
      } catch (const std::exception&) {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
      }
    }
  }
  ~ServiceOnPrivateBus() {
    client.reset();
    ::kill(pid, SIGKILL);
    ::waitpid(pid, nullptr, 0);
  }

  Scratch scratch;
  bench::PrivateSessionBus bus;
  pid_t pid = -1;
  std::unique_ptr<ServiceClient> client;
};

void BM_InstalledUpdatesJournalOverTheBus(benchmark::State& state) {
  const auto size = static_cast<int>(state.range(0));
  ServiceOnPrivateBus service(size);
  std::size_t received = 0;
  for (auto _ : state) {
    const PlistArray reply = service.client->call("InstalledUpdatesJournal", {});
    const PlistArray* entries = reply.empty() ? nullptr : reply.front().array();
    received = entries ? entries->size() : 0;
    if (received != static_cast<std::size_t>(size)) {
      state.SkipWithError("the reply did not hold every entry");
      break;
    }
  }
  state.counters["entries"] = static_cast<double>(received);
}
BENCHMARK(BM_InstalledUpdatesJournalOverTheBus)
    ->Arg(kEntries)
    ->Arg(200)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
