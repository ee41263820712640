#include "platform/background/BackgroundActivityScheduler.h"

#include <algorithm>
#include <map>
#include <utility>

#include "platform/system/Mutex.h"

namespace larder {

namespace {

using TimePoint = BackgroundActivityClock::TimePoint;
using Duration = BackgroundActivityClock::Duration;

bool isValid(const std::string& name, const BackgroundActivityCriteria& criteria,
             const BackgroundActivityScheduler::Handler& handler) {
  if (name.empty() || !handler) return false;
  if (criteria.delay < Duration::zero() || criteria.gracePeriod < Duration::zero()) return false;
  return !criteria.repeating || criteria.delay > Duration::zero();
}

}  // namespace

// The scheduler's state, shared with the tasks it hands to the clock and the handler queue so
// that those find out safely when the scheduler has gone. The clock is the scheduler's: the core
// only uses it under its mutex while not shut down.
class BackgroundActivityScheduler::Core : public std::enable_shared_from_this<Core> {
 public:
  Core(BackgroundActivityClock& clock, std::shared_ptr<BackgroundActivityPowerSource> power,
       std::shared_ptr<DispatchQueue> handlerQueue, Duration powerCheckInterval)
      : clock_(clock),
        power_(std::move(power)),
        handlerQueue_(std::move(handlerQueue)),
        powerCheckInterval_(powerCheckInterval) {}

  bool add(std::string name, BackgroundActivityCriteria criteria, Handler handler) {
    std::vector<Invocation> invocations;
    {
      MutexLock lock(mutex_);
      if (shutDown_) return false;
      const TimePoint now = clock_.now();
      Entry entry{{name, criteria, BackgroundActivityState::Waiting, now + criteria.delay, 0},
                  std::move(handler),
                  nextGeneration_++,
                  false};
      entries_.insert_or_assign(std::move(name), std::move(entry));
      evaluateLocked(now, invocations);
    }
    dispatch(std::move(invocations));
    return true;
  }

  bool remove(std::string_view name) {
    MutexLock lock(mutex_);
    auto found = entries_.find(name);
    if (found == entries_.end()) return false;
    entries_.erase(found);
    return true;
  }

  std::optional<BackgroundActivity> snapshot(std::string_view name) const {
    MutexLock lock(mutex_);
    auto found = entries_.find(name);
    if (found == entries_.end()) return std::nullopt;
    return found->second.activity;
  }

  std::vector<std::string> names() const {
    MutexLock lock(mutex_);
    std::vector<std::string> names;
    for (const auto& [name, entry] : entries_) names.push_back(name);
    return names;
  }

  void evaluate() {
    std::vector<Invocation> invocations;
    {
      MutexLock lock(mutex_);
      if (shutDown_) return;
      evaluateLocked(clock_.now(), invocations);
    }
    dispatch(std::move(invocations));
  }

  void shutDown() {
    MutexLock lock(mutex_);
    shutDown_ = true;
  }

 private:
  struct Entry {
    BackgroundActivity activity;
    Handler handler;
    std::uint64_t generation = 0;
    bool running = false;
  };

  struct Invocation {
    Handler handler;
    BackgroundActivity activity;
    BackgroundActivityState state;
    std::uint64_t generation;
  };

  bool isShutDown() const {
    MutexLock lock(mutex_);
    return shutDown_;
  }

  // Starts what is due, defers what has waited past its grace, and asks the clock for the next
  // moment anything can happen.
  void evaluateLocked(TimePoint now, std::vector<Invocation>& invocations) REQUIRES(mutex_) {
    std::optional<bool> onMains;
    auto mainsPower = [&] {
      if (!onMains) onMains = power_->isOnMainsPower();
      return *onMains;
    };
    for (auto& [name, entry] : entries_) {
      BackgroundActivity& activity = entry.activity;
      if (entry.running || activity.state == BackgroundActivityState::Done) continue;
      if (now < activity.due) continue;
      if (activity.criteria.allowBattery || mainsPower()) {
        startRun(entry, now, invocations);
      } else if (activity.state != BackgroundActivityState::Deferred &&
                 now >= activity.due + activity.criteria.gracePeriod) {
        activity.state = BackgroundActivityState::Deferred;
        invocations.push_back({entry.handler, activity, activity.state, entry.generation});
      }
    }
    std::stable_sort(invocations.begin(), invocations.end(), [](const auto& a, const auto& b) {
      return a.activity.criteria.priority == BackgroundActivityPriority::Utility &&
             b.activity.criteria.priority != BackgroundActivityPriority::Utility;
    });
    scheduleNextWakeUpLocked(now);
  }

  static void startRun(Entry& entry, TimePoint now, std::vector<Invocation>& invocations) {
    BackgroundActivity& activity = entry.activity;
    activity.state = BackgroundActivityState::Run;
    ++activity.runCount;
    if (activity.criteria.repeating) activity.due = now + activity.criteria.delay;
    entry.running = true;
    invocations.push_back({entry.handler, activity, activity.state, entry.generation});
  }

  // A wake-up that finds nothing to do is harmless, so a stale one is left rather than
  // cancelled: cancelling waits for a wake-up in progress, which may be waiting for our mutex.
  void scheduleNextWakeUpLocked(TimePoint now) REQUIRES(mutex_) {
    std::optional<TimePoint> next;
    auto consider = [&](TimePoint time) {
      if (!next || time < *next) next = time;
    };
    for (const auto& [name, entry] : entries_) {
      const BackgroundActivity& activity = entry.activity;
      if (entry.running || activity.state == BackgroundActivityState::Done) continue;
      if (now < activity.due) {
        consider(activity.due);
        continue;
      }
      if (activity.state != BackgroundActivityState::Deferred) {
        consider(activity.due + activity.criteria.gracePeriod);
      }
      consider(now + powerCheckInterval_);
    }
    if (!next) return;
    clock_.scheduleWakeUp(*next, [weak = weak_from_this()] {
      if (std::shared_ptr<Core> core = weak.lock()) core->evaluate();
    });
  }

  void didFinishRun(const std::string& name, std::uint64_t generation) {
    std::vector<Invocation> invocations;
    {
      MutexLock lock(mutex_);
      auto found = entries_.find(name);
      if (found == entries_.end() || found->second.generation != generation) return;
      Entry& entry = found->second;
      entry.running = false;
      entry.activity.state = entry.activity.criteria.repeating ? BackgroundActivityState::Waiting
                                                               : BackgroundActivityState::Done;
      if (!shutDown_) evaluateLocked(clock_.now(), invocations);
    }
    dispatch(std::move(invocations));
  }

  void dispatch(std::vector<Invocation> invocations) {
    for (Invocation& invocation : invocations) {
      handlerQueue_->async([weak = weak_from_this(), invocation = std::move(invocation)] {
        std::shared_ptr<Core> core = weak.lock();
        if (!core || core->isShutDown()) return;
        core->invoke(invocation);
      });
    }
  }

  void invoke(const Invocation& invocation) {
    const bool isRun = invocation.state == BackgroundActivityState::Run;
    try {
      invocation.handler(invocation.activity, invocation.state);
    } catch (...) {
      // The queue reports what escaped; the run is over all the same.
      if (isRun) didFinishRun(invocation.activity.name, invocation.generation);
      throw;
    }
    if (isRun) didFinishRun(invocation.activity.name, invocation.generation);
  }

  BackgroundActivityClock& clock_;
  const std::shared_ptr<BackgroundActivityPowerSource> power_;
  const std::shared_ptr<DispatchQueue> handlerQueue_;
  const Duration powerCheckInterval_;

  mutable Mutex mutex_;
  std::map<std::string, Entry, std::less<>> entries_ GUARDED_BY(mutex_);
  std::uint64_t nextGeneration_ GUARDED_BY(mutex_) = 1;
  bool shutDown_ GUARDED_BY(mutex_) = false;
};

BackgroundActivityScheduler::BackgroundActivityScheduler()
    : BackgroundActivityScheduler(Options{}) {}

BackgroundActivityScheduler::BackgroundActivityScheduler(Options options)
    : clock_(options.clock ? std::move(options.clock) : BackgroundActivityClock::system()) {
  if (!options.powerSource) options.powerSource = BackgroundActivityPowerSource::system();
  if (!options.handlerQueue) {
    options.handlerQueue =
        DispatchQueue::create("BackgroundActivityScheduler", DispatchQueue::Kind::Serial);
  }
  const Duration powerCheckInterval =
      std::max(options.powerCheckInterval, Duration(std::chrono::seconds(1)));
  core_ = std::make_shared<Core>(*clock_, std::move(options.powerSource),
                                 std::move(options.handlerQueue), powerCheckInterval);
}

BackgroundActivityScheduler::~BackgroundActivityScheduler() {
  core_->shutDown();
  clock_->cancelWakeUp();
}

bool BackgroundActivityScheduler::registerActivity(std::string name,
                                                   BackgroundActivityCriteria criteria,
                                                   Handler handler) {
  if (!isValid(name, criteria, handler)) return false;
  return core_->add(std::move(name), criteria, std::move(handler));
}

bool BackgroundActivityScheduler::unregisterActivity(std::string_view name) {
  return core_->remove(name);
}

std::optional<BackgroundActivity> BackgroundActivityScheduler::activity(
    std::string_view name) const {
  return core_->snapshot(name);
}

std::vector<std::string> BackgroundActivityScheduler::activityNames() const {
  return core_->names();
}

void BackgroundActivityScheduler::powerSourceDidChange() {
  core_->evaluate();
}

}  // namespace larder
