#pragma once

#include <csignal>
#include <functional>

namespace larder {

// SIGTERM (systemd, the end of a session) and SIGINT (a terminal) ask a
// program to stop. They are taken by one thread (sigwait) or a descriptor
// (signalfd), so that the stop runs as ordinary code and not inside a
// signal handler.
class StopSignals {
 public:
  // SIGTERM and SIGINT.
  static sigset_t set();
  // Blocks both in the calling thread and so in every thread it starts
  // afterwards; call before any thread starts, or one of them may take the
  // signal with its default action and end the process on the spot.
  static void block();
  // Waits, on a thread of its own, for the first of them and hands it to
  // `onStop` on that thread.
  static void watch(std::function<void(int signal)> onStop);
};

}  // namespace larder
