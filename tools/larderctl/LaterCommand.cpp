#include "tools/larderctl/LaterCommand.h"

#include <iostream>
#include <nlohmann/json.hpp>

#include "platform/plist/JsonConversion.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"
#include "tools/larderctl/ExitStatus.h"

namespace larder {

std::int64_t LaterCommand::modeOf(const std::string& when) {
  if (when == "tonight") return 1;
  if (when == "hour") return 2;
  return 3;
}

int LaterCommand::run(const LaterOptions& options) {
  if (options.cancel) {
    client_.call("CancelUpdatesToBeInstalledLater", {});
    std::cout << "Nothing waits for later any more." << std::endl;
    return kExitSuccess;
  }
  if (options.when) {
    // The request has no reply; the list that follows is what it did.
    client_.call("InstallAvailableUpdatesLaterWithMode", {modeOf(*options.when)});
    if (*options.when == "tomorrow") {
      std::cout << "You will be reminded of the available updates tomorrow." << std::endl;
      return kExitSuccess;
    }
  }
  return list();
}

// The app updates come from the service; the OS updates and whether the
// agent is armed from the machine, which holds them.
int LaterCommand::list() {
  const PlistArray answer = client_.call("AppUpdatesToInstallLater", {});
  const PlistArray apps =
      answer.empty() || !answer.front().array() ? PlistArray{} : *answer.front().array();
  PlistArray os;
  for (const SysupQuaymartUpdate& update :
       SysupQuaymartUpdateController::sharedUpdateController().updatesToBeInstalledLater()) {
    os.emplace_back(update.productKey());
  }
  const std::optional<std::int64_t> mode = LedgerTwilightAgent::armedMode();
  if (json_) {
    PlistDictionary document{{"appUpdates", apps}, {"osUpdates", os}};
    if (mode) document["armedMode"] = *mode;
    std::cout << JsonConversion::toJson(document).dump(2) << std::endl;
  } else {
    static constexpr const char* kMoments[] = {"", "tonight", "in an hour", "tomorrow"};
    if (mode && *mode >= 1 && *mode <= 3) {
      std::cout << "Armed: " << kMoments[*mode] << '\n';
    } else {
      std::cout << "Armed: no\n";
    }
    for (const PlistValue& app : apps) std::cout << "app " << *app.string() << '\n';
    for (const PlistValue& key : os) std::cout << "os  " << *key.string() << '\n';
    std::cout << std::flush;
  }
  return apps.empty() && os.empty() ? kExitNothingToDo : kExitSuccess;
}

}  // namespace larder
