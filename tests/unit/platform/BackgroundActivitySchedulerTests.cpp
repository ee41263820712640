#include "platform/background/BackgroundActivityScheduler.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "platform/dispatch/DispatchSemaphore.h"
#include "tests/unit/platform/TemporaryFolderTest.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using Duration = BackgroundActivityClock::Duration;
using TimePoint = BackgroundActivityClock::TimePoint;
using State = BackgroundActivityState;

// Time moves only when the test says so; wake-ups fire on the test's thread.
class FakeClock final : public BackgroundActivityClock {
 public:
  [[nodiscard]] TimePoint now() const override {
    std::lock_guard lock(mutex_);
    return now_;
  }

  void scheduleWakeUp(TimePoint time, std::function<void()> wake) override {
    std::lock_guard lock(mutex_);
    request_ = Request{time, std::move(wake)};
  }

  void cancelWakeUp() override {
    std::lock_guard lock(mutex_);
    request_.reset();
  }

  [[nodiscard]] std::optional<TimePoint> pendingWakeUp() const {
    std::lock_guard lock(mutex_);
    if (!request_) return std::nullopt;
    return request_->time;
  }

  // Sets the time; a wake-up due by then fires, at the time it asked for.
  void advanceTo(TimePoint time) {
    std::function<void()> wake;
    {
      std::lock_guard lock(mutex_);
      if (request_ && request_->time <= time) {
        now_ = std::max(now_, request_->time);
        wake = std::move(request_->wake);
        request_.reset();
      } else {
        now_ = std::max(now_, time);
      }
    }
    if (wake) wake();
  }

  std::function<void()> takePendingWakeUp() {
    std::lock_guard lock(mutex_);
    std::function<void()> wake = request_ ? std::move(request_->wake) : nullptr;
    request_.reset();
    return wake;
  }

 private:
  struct Request {
    TimePoint time;
    std::function<void()> wake;
  };
  mutable std::mutex mutex_;
  TimePoint now_{};
  std::optional<Request> request_;
};

class FakePowerSource final : public BackgroundActivityPowerSource {
 public:
  [[nodiscard]] bool isOnMainsPower() const override { return onMains_; }
  void set(bool onMains) { onMains_ = onMains; }

 private:
  std::atomic<bool> onMains_{true};
};

struct Call {
  std::string name;
  State state;
  Duration at;  // since the start of the test's clock
  std::uint64_t runCount;
  friend bool operator==(const Call&, const Call&) = default;
};

void PrintTo(const Call& call, std::ostream* out) {
  *out << call.name << " " << toString(call.state) << " at "
       << std::chrono::duration_cast<std::chrono::minutes>(call.at).count() << " min, run "
       << call.runCount;
}

BackgroundActivityCriteria periodicReload() {
  return {.repeating = true,
          .delay = 10h,
          .gracePeriod = 2h,
          .priority = BackgroundActivityPriority::Maintenance,
          .allowBattery = false};
}

class BackgroundActivitySchedulerTest : public ::testing::Test {
 protected:
  BackgroundActivitySchedulerTest() { makeScheduler(handlerQueue_); }

  void TearDown() override {
    scheduler_.reset();
    flush();
  }

  void makeScheduler(std::shared_ptr<DispatchQueue> queue) {
    scheduler_.reset();
    scheduler_ = std::make_unique<BackgroundActivityScheduler>(
        BackgroundActivityScheduler::Options{clock_, power_, std::move(queue), kPowerCheck});
  }

  BackgroundActivityScheduler::Handler recordingHandler() {
    return [this](const BackgroundActivity& activity, State state) {
      std::lock_guard lock(mutex_);
      calls_.push_back({activity.name, state, clock_->now().time_since_epoch(), activity.runCount});
    };
  }

  bool add(const std::string& name, BackgroundActivityCriteria criteria) {
    return scheduler_->registerActivity(name, criteria, recordingHandler());
  }

  void flush() {
    handlerQueue_->sync([] {});
  }

  // Moves the clock on by `by`, stopping at every wake-up on the way and letting the handlers it
  // started finish before going on, as they would in the hours between.
  void pass(Duration by) {
    const TimePoint target = clock_->now() + by;
    flush();
    for (int step = 0; step < 100000; ++step) {
      std::optional<TimePoint> next = clock_->pendingWakeUp();
      if (!next || *next > target) break;
      clock_->advanceTo(*next);
      flush();
    }
    clock_->advanceTo(target);
    flush();
  }

  // Moves the clock on by `by` and gives the calls that came meanwhile.
  std::vector<Call> after(Duration by) {
    pass(by);
    return takeCalls();
  }

  std::vector<Call> takeCalls() {
    std::lock_guard lock(mutex_);
    return std::exchange(calls_, {});
  }

  static constexpr Duration kPowerCheck = 1min;

  std::shared_ptr<FakeClock> clock_ = std::make_shared<FakeClock>();
  std::shared_ptr<FakePowerSource> power_ = std::make_shared<FakePowerSource>();
  std::shared_ptr<DispatchQueue> handlerQueue_ =
      DispatchQueue::create("BackgroundActivitySchedulerTests", DispatchQueue::Kind::Serial);
  std::unique_ptr<BackgroundActivityScheduler> scheduler_;
  std::mutex mutex_;
  std::vector<Call> calls_;
};

TEST_F(BackgroundActivitySchedulerTest, RepeatingActivityRunsEveryInterval) {
  ASSERT_TRUE(add("reload", periodicReload()));
  EXPECT_THAT(after(10h - 1s), IsEmpty());
  EXPECT_THAT(after(1s), ElementsAre(Call{"reload", State::Run, 10h, 1}));
  EXPECT_THAT(after(10h), ElementsAre(Call{"reload", State::Run, 20h, 2}));
  EXPECT_THAT(after(25h),
              ElementsAre(Call{"reload", State::Run, 30h, 3}, Call{"reload", State::Run, 40h, 4}));
  const std::optional<BackgroundActivity> activity = scheduler_->activity("reload");
  ASSERT_TRUE(activity.has_value());
  EXPECT_EQ(activity->state, State::Waiting);
  EXPECT_EQ(activity->due.time_since_epoch(), 50h);
  EXPECT_EQ(activity->runCount, 4u);
}

TEST_F(BackgroundActivitySchedulerTest, OneTimeActivityRunsOnceAfterItsDelayOrAtOnceWithout) {
  ASSERT_TRUE(add("now", {}));
  ASSERT_TRUE(add("once", {.delay = 5min}));
  flush();
  EXPECT_THAT(takeCalls(), ElementsAre(Call{"now", State::Run, 0h, 1}));
  EXPECT_THAT(after(1h), ElementsAre(Call{"once", State::Run, 5min, 1}));
  EXPECT_THAT(after(10h), IsEmpty());
  EXPECT_EQ(scheduler_->activity("once")->state, State::Done);
}

// One activity that may not run on battery and one that may.
TEST_F(BackgroundActivitySchedulerTest, OnBatteryItWaitsHearsDeferredAndRunsOnMains) {
  power_->set(false);
  ASSERT_TRUE(add("reload", periodicReload()));
  BackgroundActivityCriteria anyPower = periodicReload();
  anyPower.allowBattery = true;
  anyPower.delay = 20h;
  ASSERT_TRUE(add("sync", anyPower));
  EXPECT_THAT(after(10h), IsEmpty()) << "due, but waiting within its grace period";
  EXPECT_EQ(scheduler_->activity("reload")->state, State::Waiting);
  EXPECT_THAT(after(2h), ElementsAre(Call{"reload", State::Deferred, 12h, 0}));
  EXPECT_THAT(after(5h), IsEmpty()) << "deferred once, never run on battery";

  power_->set(true);
  scheduler_->powerSourceDidChange();
  flush();
  EXPECT_THAT(takeCalls(), ElementsAre(Call{"reload", State::Run, 17h, 1}));
  EXPECT_EQ(scheduler_->activity("reload")->due.time_since_epoch(), 27h);
  power_->set(false);
  EXPECT_THAT(after(3h), ElementsAre(Call{"sync", State::Run, 20h, 1}));
}

TEST_F(BackgroundActivitySchedulerTest, MainsReturningWithinGraceIsNoticedByThePowerCheck) {
  power_->set(false);
  ASSERT_TRUE(add("reload", periodicReload()));
  pass(11h);
  power_->set(true);
  EXPECT_THAT(after(kPowerCheck), ElementsAre(Call{"reload", State::Run, 11h + kPowerCheck, 1}));
}

TEST_F(BackgroundActivitySchedulerTest, OccurrencesMissedOnBatteryAreNotMadeUp) {
  power_->set(false);
  ASSERT_TRUE(add("reload", periodicReload()));
  EXPECT_THAT(after(45h), ElementsAre(Call{"reload", State::Deferred, 12h, 0}));
  power_->set(true);
  EXPECT_THAT(after(kPowerCheck), ElementsAre(Call{"reload", State::Run, 45h + kPowerCheck, 1}));
  EXPECT_THAT(after(10h), ElementsAre(Call{"reload", State::Run, 55h + kPowerCheck, 2}));
}

TEST_F(BackgroundActivitySchedulerTest, UtilityGoesBeforeMaintenanceAtTheSameMoment) {
  ASSERT_TRUE(add("a.tidy", {.delay = 1h, .priority = BackgroundActivityPriority::Maintenance}));
  ASSERT_TRUE(add("b.fetch", {.delay = 1h, .priority = BackgroundActivityPriority::Utility}));
  ASSERT_TRUE(add("c.tidy", {.delay = 1h, .priority = BackgroundActivityPriority::Maintenance}));
  EXPECT_THAT(after(1h),
              ElementsAre(Call{"b.fetch", State::Run, 1h, 1}, Call{"a.tidy", State::Run, 1h, 1},
                          Call{"c.tidy", State::Run, 1h, 1}));
}

TEST_F(BackgroundActivitySchedulerTest, RunsOfOneActivityNeverOverlap) {
  auto concurrent = DispatchQueue::create("overlap", DispatchQueue::Kind::Concurrent);
  makeScheduler(concurrent);
  DispatchSemaphore started;
  DispatchSemaphore release;
  std::atomic<int> running{0};
  std::atomic<int> mostAtOnce{0};
  std::mutex timesMutex;
  std::vector<Duration> runTimes;
  ASSERT_TRUE(scheduler_->registerActivity("long", {.repeating = true, .delay = 1h},
                                           [&](const BackgroundActivity&, State state) {
                                             if (state != State::Run) return;
                                             mostAtOnce = std::max(mostAtOnce.load(), ++running);
                                             {
                                               std::lock_guard lock(timesMutex);
                                               runTimes.push_back(clock_->now().time_since_epoch());
                                             }
                                             started.signal();
                                             release.wait();
                                             --running;
                                           }));
  clock_->advanceTo(TimePoint(1h));
  ASSERT_TRUE(started.waitFor(2s));
  clock_->advanceTo(TimePoint(2h + 30min));  // due again at 2h, while the first still runs
  EXPECT_FALSE(clock_->pendingWakeUp().has_value() &&
               *clock_->pendingWakeUp() <= TimePoint(2h + 30min));
  release.signal();
  ASSERT_TRUE(started.waitFor(2s)) << "the run that came due meanwhile follows the first";
  release.signal();
  concurrent->barrierSync([] {});
  EXPECT_EQ(mostAtOnce.load(), 1);
  std::lock_guard lock(timesMutex);
  EXPECT_THAT(runTimes, ElementsAre(Duration(1h), Duration(2h + 30min)));
}

TEST_F(BackgroundActivitySchedulerTest, RegisteringAgainReplacesTheActivity) {
  ASSERT_TRUE(add("reload", periodicReload()));
  pass(5h);
  BackgroundActivityCriteria sooner = periodicReload();
  sooner.delay = 1h;
  ASSERT_TRUE(add("reload", sooner));
  EXPECT_THAT(after(1h), ElementsAre(Call{"reload", State::Run, 6h, 1}));
  EXPECT_THAT(scheduler_->activityNames(), ElementsAre("reload"));
}

TEST_F(BackgroundActivitySchedulerTest, UnregisteredActivityRunsNoMore) {
  ASSERT_TRUE(add("reload", periodicReload()));
  pass(10h);
  EXPECT_EQ(takeCalls().size(), 1u);
  EXPECT_TRUE(scheduler_->unregisterActivity("reload"));
  EXPECT_FALSE(scheduler_->unregisterActivity("reload"));
  EXPECT_THAT(after(30h), IsEmpty());
  EXPECT_FALSE(scheduler_->activity("reload").has_value());
}

TEST_F(BackgroundActivitySchedulerTest, RefusesWhatCannotBeScheduled) {
  EXPECT_FALSE(add("", {}));
  EXPECT_FALSE(scheduler_->registerActivity("no.handler", {}, nullptr));
  EXPECT_FALSE(add("no.interval", {.repeating = true}));
  EXPECT_FALSE(add("negative", {.delay = -1s}));
  EXPECT_FALSE(add("negative.grace", {.delay = 1s, .gracePeriod = -1s}));
  EXPECT_THAT(scheduler_->activityNames(), IsEmpty());
}

TEST_F(BackgroundActivitySchedulerTest, NothingIsCalledOnceTheSchedulerIsGone) {
  ASSERT_TRUE(add("reload", periodicReload()));
  ASSERT_TRUE(add("late", {.delay = 3h}));
  clock_->advanceTo(TimePoint(1h));
  scheduler_->registerActivity("stale", {.delay = 1min}, recordingHandler());
  std::function<void()> staleWakeUp = clock_->takePendingWakeUp();
  ASSERT_TRUE(staleWakeUp);
  scheduler_.reset();
  EXPECT_FALSE(clock_->pendingWakeUp().has_value());
  clock_->advanceTo(TimePoint(30h));
  staleWakeUp();  // a wake-up that was already on its way
  flush();
  EXPECT_THAT(takeCalls(), IsEmpty());
}

TEST_F(BackgroundActivitySchedulerTest, HandlerThatThrowsEndsItsRunAllTheSame) {
  std::atomic<int> runs{0};
  ASSERT_TRUE(scheduler_->registerActivity("flaky", {.repeating = true, .delay = 1h},
                                           [&](const BackgroundActivity&, State state) {
                                             if (state == State::Run && ++runs == 1)
                                               throw std::runtime_error("first run fails");
                                           }));
  pass(3h);
  EXPECT_EQ(runs.load(), 3);
}

struct Supply {
  std::string name;
  std::string type;
  std::optional<int> online;
};

class BackgroundActivityPowerSourceTest : public TemporaryFolderTest {
 protected:
  // Writes the supplies into `folder`, below the test's root, and gives its path.
  std::string supplies(const std::string& folder, const std::vector<Supply>& list) const {
    const std::string path = base_ + "/" + folder;
    fs::create_directories(path);
    for (const Supply& supply : list) {
      fs::create_directories(path + "/" + supply.name);
      std::ofstream(path + "/" + supply.name + "/type") << supply.type << "\n";
      if (supply.online)
        std::ofstream(path + "/" + supply.name + "/online") << *supply.online << "\n";
    }
    return path;
  }
};

TEST_F(BackgroundActivityPowerSourceTest, ReadsMainsFromTheSupplyFolder) {
  const Supply battery{"BAT0", "Battery", std::nullopt};
  struct Case {
    const char* name;
    std::vector<Supply> supplies;
    bool onMains;
  };
  const std::vector<Case> cases{
      {"no supplies: a desktop", {}, true},
      {"laptop plugged in", {{"AC", "Mains", 1}, battery}, true},
      {"laptop unplugged", {{"AC", "Mains", 0}, battery}, false},
      {"offline usb source", {battery, {"ucsi-source-psy-1", "USB", 0}}, false},
      {"usb-c charger counts as mains",
       {battery, {"ucsi-source-psy-1", "USB", 0}, {"ucsi-source-psy-2", "USB_C", 1}},
       true},
      {"offline mains without battery still means battery", {{"AC", "Mains", 0}}, false},
  };
  for (std::size_t index = 0; index < cases.size(); ++index) {
    SCOPED_TRACE(cases[index].name);
    const std::string folder = supplies(std::to_string(index), cases[index].supplies);
    EXPECT_EQ(BackgroundActivityPowerSource::mainsPowerInSupplyFolder(folder),
              cases[index].onMains);
  }
  EXPECT_TRUE(BackgroundActivityPowerSource::mainsPowerInSupplyFolder(base_ + "/missing"));
}

TEST_F(BackgroundActivityPowerSourceTest, SystemSourceReadsBelowThePlatformRoot) {
  ::setenv("LARDER_ROOT", base_.c_str(), 1);
  const auto source = BackgroundActivityPowerSource::system();
  supplies("sys/class/power_supply", {{"AC", "Mains", 0}, {"BAT0", "Battery", std::nullopt}});
  EXPECT_FALSE(source->isOnMainsPower());
  supplies("sys/class/power_supply", {{"AC", "Mains", 1}});
  EXPECT_TRUE(source->isOnMainsPower()) << "read afresh at every question";
}

TEST(BackgroundActivitySystemClock, WakesUpAtTheTimeAndNotAfterCancel) {
  const auto clock = BackgroundActivityClock::system();
  const TimePoint start = clock->now();
  DispatchSemaphore woke;
  std::atomic<bool> early{false};
  clock->scheduleWakeUp(start + 20ms, [&] {
    early = clock->now() < start + 20ms;
    woke.signal();
  });
  ASSERT_TRUE(woke.waitFor(2s));
  EXPECT_FALSE(early.load());

  std::atomic<bool> cancelledFired{false};
  clock->scheduleWakeUp(clock->now() + 30ms, [&] { cancelledFired = true; });
  clock->cancelWakeUp();
  // Another clock's wake-up, due after the cancelled one, is the sign that its time has passed.
  const auto yardstick = BackgroundActivityClock::system();
  yardstick->scheduleWakeUp(clock->now() + 60ms, [&] { woke.signal(); });
  ASSERT_TRUE(woke.waitFor(2s));
  EXPECT_FALSE(cancelledFired.load());
}

TEST(BackgroundActivitySystemClock, SchedulerRunsOnRealTimers) {
  DispatchSemaphore ran;
  std::atomic<int> runs{0};
  auto power = std::make_shared<FakePowerSource>();
  auto queue = DispatchQueue::create("real", DispatchQueue::Kind::Serial);
  BackgroundActivityScheduler scheduler({nullptr, power, queue, 1min});
  ASSERT_TRUE(scheduler.registerActivity("soon", {.repeating = true, .delay = 20ms},
                                         [&](const BackgroundActivity&, State state) {
                                           if (state == State::Run && ++runs <= 2) ran.signal();
                                         }));
  EXPECT_TRUE(ran.waitFor(2s));
  EXPECT_TRUE(ran.waitFor(2s)) << "and again one interval later";
}

}  // namespace
}  // namespace larder
