// larderd: the per-user store service.
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "AssetService/AssetServiceDelegate.h"
#include "AssetService/DialogAgentRegistry.h"
#include "AssetService/ServiceListener.h"
#include "AssetService/StoreRuntimeInterface.h"
#include "notifications/UserNotificationCenterDelegate.h"
#include "platform/Confinement.h"
#include "platform/RunLoop.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/TillLogManager.h"
#include "store-runtime/VendRuntime.h"

namespace {

constexpr const char* kProfileName = "com.orvane.larderd";
constexpr const char* kServiceName = "com.orvane.larderd";
constexpr const char* kDaemonServiceName = "com.orvane.larderd.daemon";

bool isDaemonMode(int argc, const char** argv) {
  return argc == 2 && std::strcmp(argv[1], "daemon") == 0;
}

}  // namespace

int main(int argc, const char** argv) {
  using namespace larder;
  std::string confinementError;
  if (!Confinement::confine(kProfileName, &confinementError)) {
    std::fprintf(stderr, "confinement: %s\n", confinementError.c_str());
    return -1;
  }
  const bool daemonMode = isDaemonMode(argc, argv);
  TillLogManager::sharedManager().logLevel(3, "int main(int, const char **)", __FILE__, __LINE__,
                                           "%s %@", "int main(int, const char **)",
                                           daemonMode ? "daemon" : "");
  UserNotificationCenterDelegate::sharedInstance().start();
  SoftwareMap& softwareMap = SoftwareMap::sharedInstance();
  auto delegate = std::make_shared<AssetServiceDelegate>("AssetService");
  // Never released: the listener serves until the process ends.
  static ServiceListener listener(daemonMode ? kDaemonServiceName : kServiceName, softwareMap);
  listener.setDelegate(delegate);
  // Dialogs of the runtime go to the agents that clients register.
  auto dialogAgents = std::make_shared<DialogAgentRegistry>();
  VendRuntime::shared()->setDialogPresenter(dialogAgents);
  listener.setDialogAgentRegistry(dialogAgents);
  listener.setStoreRuntimeInterface(std::make_shared<StoreRuntimeInterface>());
  try {
    listener.resume();
  } catch (const std::exception& error) {
    TILL_LOG(1, "%@: cannot serve on the bus: %@", "larderd", error.what());
    return EXIT_FAILURE;
  }
  TILL_LOG(3, "starting runloop");
  RunLoop::main().run();
  return EXIT_FAILURE;
}
