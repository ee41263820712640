#include "platform/dispatch/RunLoop.h"

#include <algorithm>
#include <cstdio>
#include <deque>
#include <exception>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <utility>

#include "platform/log/TillLogManager.h"
#include "platform/system/Mutex.h"

namespace larder {

namespace {

using Clock = RunLoop::Clock;

void reportEscapedException(const char* what) {
  TILL_LOG(0, "larder: run loop: work threw: %@", what);
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

  void runPostedLocked() REQUIRES(mutex);
  void fireDueTimersLocked() REQUIRES(mutex);
  void waitForWorkLocked(MutexLock& lock) REQUIRES(mutex);
  [[nodiscard]] std::optional<Clock::time_point> nextWakeUpLocked() const REQUIRES(mutex);
  std::shared_ptr<const std::function<void()>> takeTimerForFiringLocked(TimerId id,
                                                                        Clock::time_point now)
      REQUIRES(mutex);

  Mutex mutex;
  ConditionVariable wakeUp;
  std::deque<std::function<void()>> posted GUARDED_BY(mutex);
  std::map<TimerId, Timer> timers GUARDED_BY(mutex);
  std::set<ScheduleEntry> schedule GUARDED_BY(mutex);
  TimerId nextTimerId GUARDED_BY(mutex) = 1;
  bool stopRequested GUARDED_BY(mutex) = false;
};

RunLoop& RunLoop::main() {
  static RunLoop mainLoop;
  return mainLoop;
}

RunLoop::RunLoop() : state_(std::make_unique<State>()) {}

RunLoop::~RunLoop() = default;

void RunLoop::perform(std::function<void()> work) {
  MutexLock lock(state_->mutex);
  state_->posted.push_back(std::move(work));
  state_->wakeUp.notify_one();
}

RunLoop::TimerId RunLoop::addTimer(Clock::duration interval, bool repeats,
                                   std::function<void()> work, Clock::duration tolerance) {
  const Clock::duration shortest = repeats ? Clock::duration(1) : Clock::duration::zero();
  interval = std::max(interval, shortest);
  tolerance = std::max(tolerance, Clock::duration::zero());
  MutexLock lock(state_->mutex);
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
  MutexLock lock(state_->mutex);
  const auto timer = state_->timers.find(id);
  if (timer == state_->timers.end()) {
    return;
  }
  state_->schedule.erase({timer->second.due, id});
  state_->timers.erase(timer);
}

void RunLoop::run() {
  MutexLock lock(state_->mutex);
  while (!state_->stopRequested) {
    state_->runPostedLocked();
    state_->fireDueTimersLocked();
    state_->waitForWorkLocked(lock);
  }
  state_->stopRequested = false;
}

void RunLoop::stop() {
  MutexLock lock(state_->mutex);
  state_->stopRequested = true;
  state_->wakeUp.notify_all();
}

// Runs what was posted before this pass began; work posted meanwhile waits for the next pass, so
// that work which keeps posting more cannot starve the timers.
void RunLoop::State::runPostedLocked() {
  for (std::size_t budget = posted.size(); budget > 0 && !stopRequested; --budget) {
    std::function<void()> work = std::move(posted.front());
    posted.pop_front();
    mutex.unlock();
    invokeReportingExceptions(work);
    work = nullptr;  // captures are released outside the lock too
    mutex.lock();
  }
}

void RunLoop::State::fireDueTimersLocked() {
  const Clock::time_point now = Clock::now();
  while (!stopRequested && !schedule.empty() && schedule.begin()->first <= now) {
    const TimerId id = schedule.begin()->second;
    std::shared_ptr<const std::function<void()>> work = takeTimerForFiringLocked(id, now);
    mutex.unlock();
    invokeReportingExceptions(*work);
    work.reset();
    mutex.lock();
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

void RunLoop::State::waitForWorkLocked(MutexLock& lock) {
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
