// What it costs to find the running applications among many processes: the
// scan of /proc that every question of the application helper starts with.
// 1,000 sleeping processes run beside the benchmark, a few of them from
// inside an application bundle.

#include <benchmark/benchmark.h>

#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>
#include <algorithm>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "running-apps/RunningApplication.h"

extern char** environ;

namespace larder {
namespace {

namespace fs = std::filesystem;

constexpr int kProcesses = 1000;
constexpr int kBundleProcesses = 5;
constexpr const char* kIdentifier = "org.larder.bench.sleeper";

// Sleeping processes for the length of the benchmark; every
// `bundleEvery`-th runs the copy of sleep inside a bundle.
class SleepingProcesses {
 public:
  SleepingProcesses() {
    std::string pattern = (fs::temp_directory_path() / "larder-bench-apps-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) std::abort();
    base_ = pattern;
    const std::string bundle = base_ + "/Sleeper.app";
    fs::create_directories(bundle + "/bin");
    std::ofstream(bundle + "/bundle.plist")
        << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
           "<key>HostBundleIdentifier</key><string>"
        << kIdentifier << "</string></dict></plist>\n";
    fs::copy_file("/bin/sleep", bundle + "/bin/sleep");
    const int bundleEvery = kProcesses / kBundleProcesses;
    for (int index = 0; index < kProcesses; ++index) {
      start(index % bundleEvery == 0 ? bundle + "/bin/sleep" : "/bin/sleep");
    }
  }
  ~SleepingProcesses() {
    for (pid_t pid : pids_) ::kill(pid, SIGKILL);
    for (pid_t pid : pids_) ::waitpid(pid, nullptr, 0);
    std::error_code ignored;
    fs::remove_all(base_, ignored);
  }
  SleepingProcesses(const SleepingProcesses&) = delete;
  SleepingProcesses& operator=(const SleepingProcesses&) = delete;

  [[nodiscard]] std::size_t count() const { return pids_.size(); }

 private:
  void start(std::string program) {
    std::string seconds = "600";
    std::vector<char*> argv{program.data(), seconds.data(), nullptr};
    pid_t pid = -1;
    if (::posix_spawn(&pid, program.c_str(), nullptr, nullptr, argv.data(), environ) == 0) {
      pids_.push_back(pid);
    }
  }

  std::string base_;
  std::vector<pid_t> pids_;
};

// Times `scan` among the sleeping processes; it returns how many of the
// bundle's processes it found, all of which must be.
template <typename Scan>
void timeScan(benchmark::State& state, Scan&& scan) {
  SleepingProcesses processes;
  if (processes.count() != kProcesses) {
    state.SkipWithError("could not start the processes");
    return;
  }
  std::size_t found = 0;
  for (auto _ : state) found = scan();
  if (found != kBundleProcesses) state.SkipWithError("the bundle processes were not all found");
  state.counters["processes"] = static_cast<double>(processes.count());
}

void BM_AllRunningApplications(benchmark::State& state) {
  timeScan(state, [] {
    auto applications = RunningApplication::allRunningApplications();
    benchmark::DoNotOptimize(applications);
    return static_cast<std::size_t>(std::count_if(
        applications.begin(), applications.end(),
        [](const auto& application) { return application->bundleIdentifier() == kIdentifier; }));
  });
}
BENCHMARK(BM_AllRunningApplications)->Unit(benchmark::kMillisecond);

void BM_RunningApplicationsWithBundleIdentifier(benchmark::State& state) {
  timeScan(state, [] {
    auto applications = RunningApplication::runningApplicationsWithBundleIdentifier(kIdentifier);
    benchmark::DoNotOptimize(applications);
    return applications.size();
  });
}
BENCHMARK(BM_RunningApplicationsWithBundleIdentifier)->Unit(benchmark::kMillisecond);

}  // namespace
}  // namespace larder

BENCHMARK_MAIN();
