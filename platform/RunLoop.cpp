#include "platform/RunLoop.h"

#include <algorithm>
#include <condition_variable>
#include <cstdio>
#include <deque>
#include <exception>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>

namespace larder {

namespace {

using Clock = RunLoop::Clock;

void reportEscapedException(const char* what) {
  const std::string line = std::string("larder: run loop: work threw: ") + what + '\n';
  std::fwrite(line.data(), 1, line.size(), stderr);
  std::fflush(stderr);
}

void invokeReportingExceptions(const std::function<void()>& work) noexcept {
  try {
    work();
  } catch (const std::exception& error) {
    reportEscapedException(error.what());
  } catch (...) {
    reportEscapedException("a non-standard exception");
  }
}

Clock::time_point saturatingAdd(Clock::time_point time, Clock::duration delta) {
  if (delta > Clock::time_point::max() - time) {
    return Clock::time_point::max();
  }
  return time + delta;
}

// Keeps a repeating timer on the grid `due + k * interval`, so lateness never accumulates, and
// skips the grid points the loop has already passed instead of firing them in a burst.
Clock::time_point nextDue(Clock::time_point previousDue, Clock::duration interval,
                          Clock::time_point now) {
  const Clock::time_point next = saturatingAdd(previousDue, interval);
  if (next > now) {
    return next;
  }
  const auto missed = (now - previousDue) / interval;
  return saturatingAdd(previousDue, (missed + 1) * interval);
}

}  // namespace

struct RunLoop::State {
  struct Timer {
    Clock::time_point due;
    Clock::duration interval;
    Clock::duration tolerance;
    bool repeats;
    // Shared so that the work outlives a cancel issued while it runs.
    std::shared_ptr<const std::function<void()>> work;
  };
  // Ordered by due time, then by id: ids grow in creation order.
  using ScheduleEntry = std::pair<Clock::time_point, TimerId>;

  void runPostedLocked(std::unique_lock<std::mutex>& lock);
  void fireDueTimersLocked(std::unique_lock<std::mutex>& lock);
  void waitForWorkLocked(std::unique_lock<std::mutex>& lock);
  [[nodiscard]] std::optional<Clock::time_point> nextWakeUpLocked() const;
  std::shared_ptr<const std::function<void()>> takeTimerForFiringLocked(TimerId id,
                                                                        Clock::time_point now);

  std::mutex mutex;
  std::condition_variable wakeUp;
  std::deque<std::function<void()>> posted;
  std::map<TimerId, Timer> timers;
  std::set<ScheduleEntry> schedule;
  TimerId nextTimerId = 1;
  bool stopRequested = false;
};

RunLoop& RunLoop::main() {
  static RunLoop mainLoop;
  return mainLoop;
}

RunLoop::RunLoop() : state_(std::make_unique<State>()) {}

RunLoop::~RunLoop() = default;

void RunLoop::perform(std::function<void()> work) {
  std::lock_guard lock(state_->mutex);
  state_->posted.push_back(std::move(work));
  state_->wakeUp.notify_one();
}

RunLoop::TimerId RunLoop::addTimer(Clock::duration interval, bool repeats,
                                   std::function<void()> work, Clock::duration tolerance) {
  const Clock::duration shortest = repeats ? Clock::duration(1) : Clock::duration::zero();
  interval = std::max(interval, shortest);
  tolerance = std::max(tolerance, Clock::duration::zero());
  std::lock_guard lock(state_->mutex);
  const TimerId id = state_->nextTimerId++;
  const Clock::time_point due = saturatingAdd(Clock::now(), interval);
  state_->timers.emplace(
      id, State::Timer{due, interval, tolerance, repeats,
                       std::make_shared<const std::function<void()>>(std::move(work))});
  state_->schedule.emplace(due, id);
  state_->wakeUp.notify_one();
  return id;
}

void RunLoop::cancelTimer(TimerId id) {
  std::lock_guard lock(state_->mutex);
  const auto timer = state_->timers.find(id);
  if (timer == state_->timers.end()) {
    return;
  }
  state_->schedule.erase({timer->second.due, id});
  state_->timers.erase(timer);
}

void RunLoop::run() {
  std::unique_lock lock(state_->mutex);
  while (!state_->stopRequested) {
    state_->runPostedLocked(lock);
    state_->fireDueTimersLocked(lock);
    state_->waitForWorkLocked(lock);
  }
  state_->stopRequested = false;
}

void RunLoop::stop() {
  std::lock_guard lock(state_->mutex);
  state_->stopRequested = true;
  state_->wakeUp.notify_all();
}

// Runs what was posted before this pass began; work posted meanwhile waits for the next pass, so
// that work which keeps posting more cannot starve the timers.
void RunLoop::State::runPostedLocked(std::unique_lock<std::mutex>& lock) {
  for (std::size_t budget = posted.size(); budget > 0 && !stopRequested; --budget) {
    std::function<void()> work = std::move(posted.front());
    posted.pop_front();
    lock.unlock();
    invokeReportingExceptions(work);
    work = nullptr;  // captures are released outside the lock too
    lock.lock();
  }
}

void RunLoop::State::fireDueTimersLocked(std::unique_lock<std::mutex>& lock) {
  const Clock::time_point now = Clock::now();
  while (!stopRequested && !schedule.empty() && schedule.begin()->first <= now) {
    const TimerId id = schedule.begin()->second;
    std::shared_ptr<const std::function<void()>> work = takeTimerForFiringLocked(id, now);
    lock.unlock();
    invokeReportingExceptions(*work);
    work.reset();
    lock.lock();
  }
}

// Re-arms a repeating timer before its work runs, so that the work may cancel it.
std::shared_ptr<const std::function<void()>> RunLoop::State::takeTimerForFiringLocked(
    TimerId id, Clock::time_point now) {
  auto entry = timers.find(id);
  Timer& timer = entry->second;
  schedule.erase({timer.due, id});
  std::shared_ptr<const std::function<void()>> work = timer.work;
  if (timer.repeats) {
    timer.due = nextDue(timer.due, timer.interval, std::max(now, Clock::now()));
    schedule.emplace(timer.due, id);
  } else {
    timers.erase(entry);
  }
  return work;
}

void RunLoop::State::waitForWorkLocked(std::unique_lock<std::mutex>& lock) {
  if (stopRequested || !posted.empty()) {
    return;
  }
  // Any wake-up, spurious or not, sends the loop round once more: it re-checks everything.
  if (const std::optional<Clock::time_point> wakeUpAt = nextWakeUpLocked()) {
    wakeUp.wait_until(lock, *wakeUpAt);
  } else {
    wakeUp.wait(lock);
  }
}

// The latest moment that still honours every timer's tolerance: waking then lets timers that
// allow it fire together with later ones.
std::optional<Clock::time_point> RunLoop::State::nextWakeUpLocked() const {
  std::optional<Clock::time_point> earliest;
  for (const auto& [id, timer] : timers) {
    const Clock::time_point latest = saturatingAdd(timer.due, timer.tolerance);
    if (!earliest || latest < *earliest) {
      earliest = latest;
    }
  }
  return earliest;
}

}  // namespace larder
