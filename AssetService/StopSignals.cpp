#include "AssetService/StopSignals.h"

#include <pthread.h>

#include <csignal>
#include <thread>

namespace larder {

namespace {

sigset_t stopSignals() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGTERM);
  sigaddset(&set, SIGINT);
  return set;
}

}  // namespace

void StopSignals::block() {
  const sigset_t set = stopSignals();
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
}

void StopSignals::watch(std::function<void(int signal)> onStop) {
  std::thread([onStop = std::move(onStop)] {
    const sigset_t set = stopSignals();
    int signal = 0;
    while (sigwait(&set, &signal) != 0) {
    }
    onStop(signal);
  }).detach();
}

}  // namespace larder
