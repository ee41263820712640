// larderd: the per-user store service.
#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <thread>

#include "AssetService/AssetServiceDelegate.h"
#include "AssetService/DialogAgentRegistry.h"
#include "AssetService/NotificationsInterface.h"
#include "AssetService/ServiceEntry.h"
#include "AssetService/ServiceListener.h"
#include "AssetService/StoreRuntimeInterface.h"
#include "notifications/activation/UserNotificationCenterDelegate.h"
#include "notifications/center/UserNotificationCenter.h"
#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/dispatch/RunLoop.h"
#include "platform/log/TillLogManager.h"
#include "platform/system/Confinement.h"
#include "platform/system/StopSignals.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "update-controller/UpdateController.h"

namespace {

using larder::ServiceEntry;

// How long the writes queued before a stop may take to reach the disk.
constexpr std::chrono::seconds kStopWriteBound{2};

bool isDaemonMode(int argc, const char** argv) {
  return argc == 2 && std::strcmp(argv[1], ServiceEntry::kDaemonArgument) == 0;
}

// Any other argument means no argument, so `larderd --help` starts the
// service all the same; whoever typed it learns what happened.
void tellAboutIgnoredArguments(int argc, const char** argv, const char* serviceName) {
  if (argc == 1 || isDaemonMode(argc, argv)) return;
  std::string words;
  for (int index = 1; index < argc; ++index) {
    words += words.empty() ? "\"" : " \"";
    words += argv[index];
    words += '"';
  }
  std::fprintf(stderr,
               "larderd %s: ignoring %s (the only argument is \"daemon\"); serving as %s. "
               "larderctl talks to the service; see larderd(8).\n",
               LARDER_VERSION, words.c_str(), serviceName);
}

// Waits, at most `kStopWriteBound`, for what the map, the update queues and
// the notification centers have queued for the disk.
bool finishPendingWrites() {
  auto finished = std::make_shared<larder::DispatchSemaphore>();
  std::thread([finished] {
    larder::SoftwareMap::sharedInstance().finishPendingWrites();
    larder::UpdateController::finishPendingWritesOfAllControllers();
    larder::UserNotificationCenter::finishPendingWritesOfAllCenters();
    finished->signal();
  }).detach();
  return finished->waitFor(kStopWriteBound);
}

// No static destructor runs: they would wait for requests that may wait
// for a person without a time limit, and everything worth keeping is on
// disk by now.
[[noreturn]] void stopOrderly(larder::ServiceListener& listener, int signal) {
  TILL_LOG(2, "%@: %@ received, stopping", "larderd", strsignal(signal));
  listener.stopServing();
  if (!finishPendingWrites()) {
    TILL_LOG(1, "%@: queued writes did not finish within %@ s; stopping without them", "larderd",
             kStopWriteBound.count());
  }
  TILL_LOG(2, "%@: stopped", "larderd");
  std::fflush(stderr);
  std::_Exit(EXIT_SUCCESS);
}

}  // namespace

int main(int argc, const char** argv) {
  using namespace larder;
  if (auto confined = Confinement::confine(ServiceEntry::kProfileName); !confined) {
    std::fprintf(stderr, "confinement: %s\n", confined.error().description.c_str());
    return -1;
  }
  StopSignals::block();
  const bool daemonMode = isDaemonMode(argc, argv);
  const char* serviceName =
      daemonMode ? ServiceEntry::kDaemonServiceName : ServiceEntry::kServiceName;
  tellAboutIgnoredArguments(argc, argv, serviceName);
  TillLogManager::sharedManager().logLevel(3, "int main(int, const char **)", __FILE__, __LINE__,
                                           "%s %@", "int main(int, const char **)",
                                           daemonMode ? "daemon" : "");
  TILL_LOG(2, "larderd %@ serving as %@", LARDER_VERSION, serviceName);
  UserNotificationCenterDelegate::sharedInstance().start();
  SoftwareMap& softwareMap = SoftwareMap::sharedInstance();
  auto delegate = std::make_shared<AssetServiceDelegate>("AssetService");
  // Never released: the listener serves until the process ends.
  static ServiceListener listener(serviceName, softwareMap);
  listener.setDelegate(delegate);
  // Dialogs of the runtime go to the agents that clients register.
  auto dialogAgents = std::make_shared<DialogAgentRegistry>();
  VendRuntime::shared()->setDialogPresenter(dialogAgents);
  listener.setDialogAgentRegistry(dialogAgents);
  listener.setStoreRuntimeInterface(std::make_shared<StoreRuntimeInterface>());
  listener.setNotificationsInterface(std::make_shared<NotificationsInterface>());
  try {
    listener.resume();
  } catch (const std::exception& error) {
    TILL_LOG(1, "%@: cannot serve on the bus: %@", "larderd", error.what());
    return EXIT_FAILURE;
  }
  // The stop runs on the main thread once its run loop has let go.
  static std::atomic<int> stopSignal{0};
  StopSignals::watch([](int signal) {
    stopSignal.store(signal);
    RunLoop::main().stop();
  });
  TILL_LOG(3, "starting runloop");
  RunLoop::main().run();
  stopOrderly(listener, stopSignal.load());
}
