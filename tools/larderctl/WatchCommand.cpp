#include "tools/larderctl/WatchCommand.h"

#include <sdbus-c++/Error.h>

#include <cerrno>
#include <csignal>
#include <ctime>
#include <iostream>

#include "client/DistributedNotificationProtocol.h"
#include "platform/system/StopSignals.h"
#include "tools/larderctl/ExitStatus.h"

namespace larder {
namespace {

// How often the command looks for news of the service between signals.
constexpr long kPollNanoseconds = 100'000'000;

}  // namespace

WatchCommand::WatchCommand(ServiceClient& client, bool json, std::function<void()> present)
    : client_(client), json_(json), present_(std::move(present)), printer_(json) {}

std::string WatchCommand::registerObserver() {
  return *client_.call("AddSoftwareMapObserver", {std::string(kObserverPath)}).at(0).string();
}

bool WatchCommand::waitForStop(const std::function<bool()>& onRestart) {
  client_.watchServiceOwner(
      [news = news_](bool present) { (present ? news->arrived : news->lost).store(true); });
  const sigset_t signals = StopSignals::set();
  const timespec poll{0, kPollNanoseconds};
  while (::sigtimedwait(&signals, nullptr, &poll) < 0) {
    if (news_->lost.exchange(false)) {
      std::cerr << "larderctl: larderd stopped; waiting for it to start again" << std::endl;
    }
    if (news_->arrived.exchange(false) && !onRestart()) return false;
  }
  return true;
}

int WatchCommand::run() {
  client_.exportSoftwareMapObserver(kObserverPath,
                                    [this](const PlistValue& product, std::int64_t state) {
                                      printer_.printChange(product, state);
                                    });
  std::string token = registerObserver();
  if (!json_) std::cerr << "larderctl: watching the software map (token " << token << ")\n";
  // A restarted service has forgotten its observers: register again.
  bool stopped = waitForStop([this, &token] {
    try {
      present_();
      token = registerObserver();
      std::cerr << "larderctl: larderd restarted; watching again (token " << token << ")"
                << std::endl;
      return true;
    } catch (const sdbus::Error& error) {
      std::cerr << "larderctl: larderd restarted but did not take the observer: "
                << error.getMessage() << std::endl;
      token.clear();
      return false;
    }
  });
  if (!token.empty()) {
    try {
      client_.call("RemoveSoftwareMapObserver", {token});
    } catch (const sdbus::Error&) {
      // The service is gone, and its observers with it.
    }
  }
  return stopped ? kExitSuccess : kExitFailure;
}

int WatchCommand::runBadge() {
  using Protocol = DistributedNotificationProtocol;
  client_.watchSignal(Protocol::kInterfaceName, Protocol::kSignal, Protocol::kSignature,
                      [json = json_](const PlistArray& values) {
                        if (*values.at(0).string() != Protocol::kBadgeName ||
                            *values.at(1).string() != Protocol::kBadgeObject) {
                          return;
                        }
                        const std::uint64_t count =
                            values.at(2)[Protocol::kBadgeCountKey].uint64Value();
                        if (json) {
                          std::cout << "{\"badgeCount\":" << count << "}" << std::endl;
                        } else {
                          std::cout << "badge " << count << std::endl;
                        }
                      });
  if (!json_) std::cerr << "larderctl: watching the store's badge\n";
  // A signal needs no registration: a restarted service is heard as it is.
  waitForStop([] {
    std::cerr << "larderctl: larderd restarted; still watching the badge" << std::endl;
    return true;
  });
  return kExitSuccess;
}

}  // namespace larder
