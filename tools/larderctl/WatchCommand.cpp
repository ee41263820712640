#include "tools/larderctl/WatchCommand.h"

#include <sdbus-c++/Error.h>

#include <cerrno>
#include <csignal>
#include <ctime>
#include <iostream>

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

int WatchCommand::run() {
  client_.exportSoftwareMapObserver(kObserverPath,
                                    [this](const PlistValue& product, std::int64_t state) {
                                      printer_.printChange(product, state);
                                    });
  client_.watchServiceOwner(
      [news = news_](bool present) { (present ? news->arrived : news->lost).store(true); });
  std::string token = registerObserver();
  if (!json_) std::cerr << "larderctl: watching the software map (token " << token << ")\n";
  const sigset_t signals = StopSignals::set();
  const timespec poll{0, kPollNanoseconds};
  while (::sigtimedwait(&signals, nullptr, &poll) < 0) {
    if (news_->lost.exchange(false)) {
      token.clear();
      std::cerr << "larderctl: larderd stopped; waiting for it to start again" << std::endl;
    }
    if (!news_->arrived.exchange(false)) continue;
    try {
      present_();
      token = registerObserver();
      std::cerr << "larderctl: larderd restarted; watching again (token " << token << ")"
                << std::endl;
    } catch (const sdbus::Error& error) {
      std::cerr << "larderctl: larderd restarted but did not take the observer: "
                << error.getMessage() << std::endl;
      return kExitFailure;
    }
  }
  if (!token.empty()) client_.call("RemoveSoftwareMapObserver", {token});
  return kExitSuccess;
}

}  // namespace larder
