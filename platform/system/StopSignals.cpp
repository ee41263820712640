#include "platform/system/StopSignals.h"

#include <pthread.h>

#include <thread>

namespace larder {

sigset_t StopSignals::set() {
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  return signals;
}

void StopSignals::block() {
  const sigset_t signals = set();
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
}

void StopSignals::watch(std::function<void(int signal)> onStop) {
  std::thread([onStop = std::move(onStop)] {
    const sigset_t signals = set();
    int signal = 0;
    while (sigwait(&signals, &signal) != 0) {
    }
    onStop(signal);
  }).detach();
}

}  // namespace larder
