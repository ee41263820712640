#include "platform/dispatch/RunLoop.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/dispatch/DispatchSemaphore.h"

namespace larder {
namespace {

using namespace std::chrono_literals;
using Clock = RunLoop::Clock;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

constexpr auto kGenerous = 5s;

// Runs the loop on the calling thread. Should the test's own stop never come, a watchdog stops
// the loop so that the test fails instead of hanging.
[[nodiscard]] bool runStoppedByTheTest(RunLoop& loop, Clock::duration limit = kGenerous) {
  DispatchSemaphore returned;
  std::atomic<bool> watchdogFired{false};
  std::thread watchdog([&] {
    if (!returned.waitFor(limit)) {
      watchdogFired = true;
      loop.stop();
    }
  });
  loop.run();
  returned.signal();
  watchdog.join();
  return !watchdogFired;
}

TEST(RunLoop, PerformedWorkRunsInOrderOnTheLoopThread) {
  RunLoop loop;
  constexpr int kProducers = 3;
  constexpr int kItemsEach = 200;
  // Touched only on the loop thread.
  std::vector<std::pair<int, int>> ran;
  bool allOnLoopThread = true;
  const auto loopThread = std::this_thread::get_id();

  std::vector<std::thread> producers;
  for (int producer = 0; producer < kProducers; ++producer) {
    producers.emplace_back([&, producer] {
      for (int sequence = 0; sequence < kItemsEach; ++sequence) {
        loop.perform([&, producer, sequence] {
          allOnLoopThread = allOnLoopThread && std::this_thread::get_id() == loopThread;
          ran.emplace_back(producer, sequence);
          if (ran.size() == kProducers * kItemsEach) loop.stop();
        });
      }
    });
  }
  ASSERT_TRUE(runStoppedByTheTest(loop));
  for (auto& producer : producers) producer.join();

  EXPECT_TRUE(allOnLoopThread);
  ASSERT_EQ(ran.size(), std::size_t{kProducers * kItemsEach});
  std::vector<int> nextExpected(kProducers, 0);
  for (const auto& [producer, sequence] : ran) {
    ASSERT_EQ(sequence, nextExpected[producer]) << "producer " << producer;
    ++nextExpected[producer];
  }
}

TEST(RunLoop, WorkPerformedFromInsideWorkRunsAfterIt) {
  RunLoop loop;
  std::vector<std::string> order;
  loop.perform([&] {
    loop.perform([&] {
      order.emplace_back("nested");
      loop.stop();
    });
    order.emplace_back("outer");
  });
  loop.perform([&] { order.emplace_back("second"); });
  ASSERT_TRUE(runStoppedByTheTest(loop));
  EXPECT_THAT(order, ElementsAre("outer", "second", "nested"));
}

TEST(RunLoop, StopFromAnotherThreadEndsRunAndTheLoopCanRunAgain) {
  RunLoop loop;
  DispatchSemaphore running;
  loop.perform([&] { running.signal(); });
  std::thread stopper([&] {
    running.wait();
    loop.stop();
  });
  ASSERT_TRUE(runStoppedByTheTest(loop));
  stopper.join();

  bool ranAgain = false;
  loop.perform([&] {
    ranAgain = true;
    loop.stop();
  });
  ASSERT_TRUE(runStoppedByTheTest(loop));
  EXPECT_TRUE(ranAgain);
}

TEST(RunLoop, StopBeforeRunMakesRunReturnAtOnce) {
  RunLoop loop;
  loop.stop();
  bool ran = false;
  loop.addTimer(2s, false, [&] { ran = true; });
  const auto before = Clock::now();
  ASSERT_TRUE(runStoppedByTheTest(loop));
  EXPECT_LT(Clock::now() - before, 1s);
  EXPECT_FALSE(ran);
}

// A one-shot timer cancelled (twice) before it is due, and a repeating one cancelled from its own
// work.
TEST(RunLoop, CancelledTimersFireNoMore) {
  RunLoop loop;
  bool oneShotFired = false;
  const RunLoop::TimerId oneShot = loop.addTimer(10ms, false, [&] { oneShotFired = true; });
  loop.cancelTimer(oneShot);
  loop.cancelTimer(oneShot);
  int fired = 0;
  RunLoop::TimerId id = 0;
  id = loop.addTimer(2ms, true, [&] {
    if (++fired == 3) {
      loop.cancelTimer(id);
      // Long enough for a dozen more fires, had the cancel not worked.
      loop.addTimer(30ms, false, [&] { loop.stop(); });
    }
  });
  ASSERT_TRUE(runStoppedByTheTest(loop));
  EXPECT_EQ(fired, 3);
  EXPECT_FALSE(oneShotFired);
}

TEST(RunLoop, RepeatingTimerCancelledFromAnotherThreadStopsFiring) {
  RunLoop loop;
  std::atomic<int> fired{0};
  std::atomic<bool> cancelReturned{false};
  std::atomic<bool> firedAfterCancel{false};
  DispatchSemaphore firedThreeTimes;
  const RunLoop::TimerId id = loop.addTimer(2ms, true, [&] {
    if (cancelReturned) firedAfterCancel = true;
    if (++fired == 3) firedThreeTimes.signal();
  });
  std::thread canceller([&] {
    firedThreeTimes.wait();
    loop.cancelTimer(id);
    cancelReturned = true;
    loop.addTimer(30ms, false, [&] { loop.stop(); });
  });
  ASSERT_TRUE(runStoppedByTheTest(loop));
  canceller.join();
  EXPECT_GE(fired, 3);
  EXPECT_FALSE(firedAfterCancel);
}

// Each one-shot timer fires once, not before it is due.
TEST(RunLoop, TimersFireOnceInDueOrderAndTimersDueTogetherInCreationOrder) {
  RunLoop loop;
  std::vector<std::string> order;
  auto record = [&order](std::string name) { return [&order, name] { order.push_back(name); }; };
  const auto added = Clock::now();
  Clock::time_point lastFiredAt;
  // Added in the reverse of their due order.
  loop.addTimer(30ms, false, [&] {
    order.emplace_back("30ms");
    lastFiredAt = Clock::now();
  });
  loop.addTimer(20ms, false, record("20ms"));
  loop.addTimer(10ms, false, record("10ms"));
  // All due by the time the loop starts.
  for (int i = 0; i < 5; ++i) loop.addTimer(0ms, false, record("now-" + std::to_string(i)));
  loop.addTimer(50ms, false, [&] { loop.stop(); });
  ASSERT_TRUE(runStoppedByTheTest(loop));
  EXPECT_THAT(order,
              ElementsAre("now-0", "now-1", "now-2", "now-3", "now-4", "10ms", "20ms", "30ms"));
  EXPECT_GE(lastFiredAt - added, 30ms);
}

TEST(RunLoop, RepeatingTimerDoesNotDriftWhenItsWorkTakesTime) {
  RunLoop loop;
  constexpr auto kInterval = 10ms;
  constexpr int kFires = 8;
  std::vector<Clock::time_point> firedAt;
  RunLoop::TimerId id = 0;
  const auto added = Clock::now();
  id = loop.addTimer(kInterval, true, [&] {
    firedAt.push_back(Clock::now());
    // Work that takes a good part of the interval: a timer that schedules its next fire from
    // the end of its work falls behind by this much every time.
    std::this_thread::sleep_for(6ms);
    if (firedAt.size() == kFires) {
      loop.cancelTimer(id);
      loop.stop();
    }
  });
  ASSERT_TRUE(runStoppedByTheTest(loop));
  ASSERT_EQ(firedAt.size(), std::size_t{kFires});
  for (int k = 1; k <= kFires; ++k) {
    EXPECT_GE(firedAt[k - 1] - added, k * kInterval) << "fire " << k << " came early";
  }
  const auto lastLateness = firedAt.back() - (added + kFires * kInterval);
  EXPECT_LT(lastLateness, 25ms) << "lateness accumulated over " << kFires << " fires";
}

TEST(RunLoop, RepeatingTimerSkipsMissedFiresInsteadOfBursting) {
  RunLoop loop;
  constexpr auto kInterval = 10ms;
  std::vector<Clock::time_point> firedAt;
  Clock::time_point blockEnded;
  RunLoop::TimerId id = 0;
  id = loop.addTimer(kInterval, true, [&] {
    firedAt.push_back(Clock::now());
    if (firedAt.size() == 1) {
      // The loop is kept busy for ten intervals.
      std::this_thread::sleep_for(10 * kInterval);
      blockEnded = Clock::now();
    }
    if (firedAt.size() == 6) {
      loop.cancelTimer(id);
      loop.stop();
    }
  });
  ASSERT_TRUE(runStoppedByTheTest(loop));
  ASSERT_EQ(firedAt.size(), 6u);
  // One late fire right after the busy spell, then at most one scheduled fire can follow within
  // half an interval; a burst would fire the nine missed ones back to back.
  const auto firesSoonAfterBlock = std::count_if(
      firedAt.begin() + 1, firedAt.end(),
      [&](Clock::time_point at) { return at >= blockEnded && at < blockEnded + kInterval / 2; });
  EXPECT_GE(firesSoonAfterBlock, 1);
  EXPECT_LE(firesSoonAfterBlock, 2);
}

TEST(RunLoop, ToleranceLetsATimerFireLaterTogetherWithAnother) {
  RunLoop loop;
  Clock::time_point relaxedAt;
  Clock::time_point strictAt;
  const auto added = Clock::now();
  loop.addTimer(
      10ms, false, [&] { relaxedAt = Clock::now(); }, 30ms);
  loop.addTimer(25ms, false, [&] {
    strictAt = Clock::now();
    loop.stop();
  });
  ASSERT_TRUE(runStoppedByTheTest(loop));
  // Deferred to the other timer's wake-up rather than woken for alone: not
  // before that timer was due, whatever the load on the machine.
  EXPECT_GE(relaxedAt - added, 25ms) << "the two timers did not share a wake-up";
  EXPECT_LE(relaxedAt, strictAt);
}

TEST(RunLoop, WorkThatThrowsIsReportedAndTheLoopGoesOn) {
  RunLoop loop;
  bool ranAfter = false;
  loop.perform([] { throw std::runtime_error("posted work failed"); });
  loop.addTimer(1ms, false, [] { throw std::runtime_error("timer work failed"); });
  loop.addTimer(20ms, false, [&] {
    ranAfter = true;
    loop.stop();
  });
  ::testing::internal::CaptureStderr();
  const bool stopped = runStoppedByTheTest(loop);
  const std::string errors = ::testing::internal::GetCapturedStderr();
  ASSERT_TRUE(stopped);
  EXPECT_TRUE(ranAfter);
  EXPECT_THAT(errors, HasSubstr("posted work failed"));
  EXPECT_THAT(errors, HasSubstr("timer work failed"));
}

}  // namespace
}  // namespace larder
