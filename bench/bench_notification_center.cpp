// What posting a notification costs the poster, and what the list file of
// delivered notifications costs the center.
//
// The poster's cost is timed against a server that takes 50 ms for each
// Notify: the center must not make its caller wait for it. The list file
// is rewritten on each change, but writes that queue up while one runs
// are folded into one; its size and write time for 1,000 notifications
// bound what a long-running service pays.

#include <benchmark/benchmark.h>

#include <time.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "notifications/center/DeliveredNotificationList.h"
#include "notifications/center/UserNotificationCenter.h"
#include "tests/unit/TemporaryFolder.h"
#include "tests/unit/notifications/FakeNotificationServer.h"

namespace larder {
namespace {

using Clock = std::chrono::steady_clock;

// About what the update machinery posts: a title, a sentence, two
// buttons and a few entries of user info.
UserNotification typicalNotification(int index) {
  UserNotification notification;
  notification.title = "Updates Available";
  notification.informativeText =
      "Photo Editor, Mail Sorter and 3 more applications have updates ready to install.";
  notification.actionButtonTitle = "Update";
  notification.otherButtonTitle = "Later";
  notification.displayStyle = UserNotification::kAlert;
  notification.alternateActionButtonTitles = {"Try Tonight", "Remind Me Tomorrow"};
  notification.userInfo = PlistDictionary{
      {"Source", "update-controller"},
      {"bundleIdentifiers", PlistArray{"com.example.photo-editor", "com.example.mail-sorter"}},
      {"count", std::int64_t{5 + index % 3}},
  };
  return notification;
}

double threadCpuSeconds() {
  timespec now{};
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}

bool waitFor(const std::function<bool()>& condition) {
  const auto deadline = Clock::now() + std::chrono::seconds(30);
  while (!condition()) {
    if (Clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

// The caller's time of one delivery while the server takes 50 ms a call.
// Notify calls pile up on the center's queue meanwhile, as they would
// behind a hung server, and the list grows to 2,000 notifications, whose
// writes run beside the deliveries.
void BM_DeliverWithSlowServer(benchmark::State& state) {
  testing::TemporaryFolder folder("larder-bench-notifications");
  auto server = std::make_shared<testing::FakeNotificationServer>();
  server->setDelay(std::chrono::milliseconds(50));
  auto center = UserNotificationCenter::makeForTesting(
      "com.example.bench", UserNotificationCenter::kSystemCenter, folder / "list.plist");
  center->setServer(server);
  std::vector<double> microseconds;
  std::vector<double> cpuMicroseconds;
  microseconds.reserve(static_cast<std::size_t>(state.max_iterations));
  cpuMicroseconds.reserve(static_cast<std::size_t>(state.max_iterations));
  for (auto _ : state) {
    const auto start = Clock::now();
    const double cpuStart = threadCpuSeconds();
    UserNotification delivered = center->deliverNotification(typicalNotification(0));
    const double cpu = threadCpuSeconds() - cpuStart;
    const std::chrono::duration<double> elapsed = Clock::now() - start;
    state.SetIterationTime(elapsed.count());
    microseconds.push_back(elapsed.count() * 1e6);
    cpuMicroseconds.push_back(cpu * 1e6);
    benchmark::DoNotOptimize(delivered);
  }
  std::ranges::sort(microseconds);
  std::ranges::sort(cpuMicroseconds);
  state.counters["median_us"] = microseconds[microseconds.size() / 2];
  state.counters["p99_us"] = microseconds[microseconds.size() * 99 / 100];
  state.counters["max_us"] = microseconds.back();
  // The same on the caller's own processor time: what is left of the
  // largest wall times once time spent waiting for a processor is taken out.
  state.counters["cpu_p99_us"] = cpuMicroseconds[cpuMicroseconds.size() * 99 / 100];
  state.counters["cpu_max_us"] = cpuMicroseconds.back();
  // Calls the server has answered while the poster went on.
  state.counters["shown_meanwhile"] = static_cast<double>(server->waitForCalls(0).size());
}
BENCHMARK(BM_DeliverWithSlowServer)
    ->Iterations(2000)
    ->UseManualTime()
    ->Unit(benchmark::kMicrosecond);

// 1,000 deliveries and then 1,000 removals in a row, as the poster sees
// them, and the writes of the list that follow (until the file holds the
// empty list). The list is at its largest, 1,000 notifications, halfway.
void BM_ThousandPostsAndRemovals(benchmark::State& state) {
  testing::TemporaryFolder folder("larder-bench-notifications");
  const std::string path = folder / "list.plist";
  std::size_t largestFile = 0;
  double callerSeconds = 0;
  for (auto _ : state) {
    auto center = UserNotificationCenter::makeForTesting(
        "com.example.bench", UserNotificationCenter::kSystemCenter, path);
    center->setServer(std::make_shared<testing::FakeNotificationServer>());
    const auto start = Clock::now();
    std::vector<UserNotification> delivered;
    for (int index = 0; index < 1000; ++index) {
      delivered.push_back(center->deliverNotification(typicalNotification(index)));
    }
    const auto halfway = Clock::now();
    largestFile = std::max(
        largestFile, DeliveredNotificationList::encode(center->deliveredNotifications()).size());
    const auto removalsStart = Clock::now();
    for (const UserNotification& notification : delivered) {
      center->removeDeliveredNotification(notification);
    }
    callerSeconds +=
        std::chrono::duration<double>((halfway - start) + (Clock::now() - removalsStart)).count();
    if (!waitFor([&] { return DeliveredNotificationList(path).read().empty(); })) {
      state.SkipWithError("the list file never became empty");
    }
  }
  state.counters["caller_ms_per_2000_calls"] =
      benchmark::Counter(callerSeconds * 1e3 / static_cast<double>(state.iterations()));
  state.counters["file_bytes_at_1000"] = static_cast<double>(largestFile);
}
BENCHMARK(BM_ThousandPostsAndRemovals)->Iterations(5)->Unit(benchmark::kMillisecond)->UseRealTime();

// 1,000 posts in a row, each taking away the one before it, as the
// catalogue replaces a kind: the file stays at one notification, and one
// write of it (encoding, write, fsync, rename) is what each change costs.
void BM_PostsReplacingEachOther(benchmark::State& state) {
  testing::TemporaryFolder folder("larder-bench-notifications");
  const std::string path = folder / "list.plist";
  auto center = UserNotificationCenter::makeForTesting("com.example.bench",
                                                       UserNotificationCenter::kSystemCenter, path);
  center->setServer(std::make_shared<testing::FakeNotificationServer>());
  std::optional<UserNotification> previous;
  for (int index = 0; index < 1000; ++index) {
    UserNotification delivered = center->deliverNotification(typicalNotification(index));
    if (previous) center->removeDeliveredNotification(*previous);
    previous = delivered;
  }
  const std::vector<UserNotification> kept = center->deliveredNotifications();
  if (!waitFor([&] { return DeliveredNotificationList(path).read().size() == kept.size(); })) {
    state.SkipWithError("the list file never caught up");
  }
  DeliveredNotificationList list(folder / "steady.plist");
  for (auto _ : state) {
    if (!list.write(kept)) state.SkipWithError("cannot write the list");
  }
  state.counters["notifications_kept"] = static_cast<double>(kept.size());
  state.counters["file_bytes"] = static_cast<double>(std::filesystem::file_size(path));
}
BENCHMARK(BM_PostsReplacingEachOther)->Unit(benchmark::kMillisecond)->UseRealTime();

// One write of the list file (encoding, write, fsync, rename), its
// encoding alone, and one read of it (at the start of the service), for
// 1,000 notifications.
void BM_ListFileOfAThousand(benchmark::State& state) {
  testing::TemporaryFolder folder("larder-bench-notifications");
  DeliveredNotificationList list(folder / "list.plist");
  std::vector<UserNotification> notifications;
  auto center = UserNotificationCenter::makeForTesting(
      "com.example.bench", UserNotificationCenter::kApplicationCenter, folder / "unused.plist");
  for (int index = 0; index < 1000; ++index) {
    notifications.push_back(center->deliverNotification(typicalNotification(index)));
  }
  enum Step { kWrite, kRead, kEncode };
  const auto step = static_cast<Step>(state.range(0));
  if (!list.write(notifications)) state.SkipWithError("cannot write the list");
  for (auto _ : state) {
    if (step == kRead) {
      benchmark::DoNotOptimize(list.read());
    } else if (step == kEncode) {
      benchmark::DoNotOptimize(DeliveredNotificationList::encode(notifications));
    } else if (!list.write(notifications)) {
      state.SkipWithError("cannot write the list");
    }
  }
  state.counters["file_bytes"] = static_cast<double>(std::filesystem::file_size(list.path()));
  state.SetLabel(step == kRead ? "read" : step == kEncode ? "encode" : "write");
}
BENCHMARK(BM_ListFileOfAThousand)
    ->Arg(0)
    ->Arg(1)
    ->Arg(2)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

}  // namespace
}  // namespace larder

BENCHMARK_MAIN();
