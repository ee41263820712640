#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <string>

#include "client/ServiceClient.h"
#include "tools/larderctl/ProductPrinter.h"

namespace larder {

// `larderctl watch`: prints software map changes until interrupted. When
// the service restarts, its observers are gone with it: the command
// registers again and says so on standard error.
class WatchCommand {
 public:
  static constexpr const char* kObserverPath = "/com/orvane/larderctl/SoftwareMapObserver";

  // `present` shows the client to a service that has just started.
  WatchCommand(ServiceClient& client, bool json, std::function<void()> present);

  // Until SIGINT or SIGTERM, which the caller blocked before the bus
  // connection started its thread.
  int run();
  // The same for the badge: each badge message the service sends, as its
  // count (JSON: {"badgeCount": N}).
  int runBadge();

 private:
  // Written on the bus thread, read on the command's.
  struct OwnerNews {
    std::atomic<bool> arrived{false};
    std::atomic<bool> lost{false};
  };

  std::string registerObserver();
  // Waits for a stop signal, calling `onRestart` each time the service has
  // started again and saying on standard error when it stopped; false when
  // `onRestart` failed.
  bool waitForStop(const std::function<bool()>& onRestart);

  ServiceClient& client_;
  bool json_;
  std::function<void()> present_;
  ProductPrinter printer_;
  std::shared_ptr<OwnerNews> news_ = std::make_shared<OwnerNews>();
};

}  // namespace larder
