#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>

namespace larder {

// The main thread's run loop: timers and work posted from other threads run
// here, one at a time. `run` returns only after `stop`; a `stop` that comes
// while the loop is not running makes the next `run` return at once, so a
// stop racing with start-up is not lost. Work that throws is logged and the
// loop goes on.
class RunLoop {
 public:
  using Clock = std::chrono::steady_clock;
  using TimerId = std::uint64_t;

  static RunLoop& main();

  RunLoop();
  ~RunLoop();
  RunLoop(const RunLoop&) = delete;
  RunLoop& operator=(const RunLoop&) = delete;

  // Runs `work` on the loop's thread, after the work posted before it.
  void perform(std::function<void()> work);

  // Fires `work` after `interval`, then every `interval` when `repeats`.
  // Tolerance lets the loop fire late by up to that much to group wakeups.
  // A repeating timer keeps to its original schedule: a late fire does not
  // shift the next ones. When the loop was busy past several due times, the
  // timer fires once as soon as the loop is free and the other missed fires
  // are dropped rather than run in a burst. Timers due at the same time fire
  // in the order they were added.
  TimerId addTimer(Clock::duration interval, bool repeats, std::function<void()> work,
                   Clock::duration tolerance = Clock::duration::zero());
  // Safe to call from any thread, also from inside the timer's own work.
  void cancelTimer(TimerId id);

  void run();
  void stop();

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace larder
