#include "tools/larderctl/InstallCommand.h"

#include <algorithm>
#include <chrono>
#include <future>
#include <iostream>

#include "platform/plist/JsonConversion.h"
#include "tools/larderctl/ExitStatus.h"
#include "tools/larderctl/ProgressBar.h"
#include "tools/larderctl/ValueText.h"

namespace larder {
namespace {

constexpr std::chrono::milliseconds kProgressInterval{200};
constexpr std::int64_t kAllDownloadTypes = 3;

std::string titleOf(const PlistValue& update) {
  const std::string* title = update["title"].string();
  return title && !title->empty()
             ? *title
             : "item " + std::to_string(update["itemIdentifier"].uint64Value());
}

std::string reasonOf(const PlistValue& error) {
  return ValueText::textOr(error["description"], "the service gave no reason") + " (code " +
         std::to_string(error["code"].int64Value()) + ")";
}

bool isError(const PlistValue& error) {
  const PlistDictionary* fields = error.dictionary();
  return fields && !fields->empty();
}

}  // namespace

InstallCommand::InstallCommand(ServiceClient& client, ServiceClient& runner, bool json)
    : client_(client), runner_(runner), json_(json) {
  // Exported before any start, so that no word of the run can slip by.
  runner_.exportCallbackObject(kDelegatePath, "VendUpdateDelegate",
                               "AppUpdateFinishedPurchaseWithSuccessErrorResponse",
                               "a{sv}ba{sv}a{sv}", [inbox = inbox_](const PlistArray& arguments) {
                                 MutexLock lock(inbox->mutex);
                                 inbox->finished.insert_or_assign(
                                     arguments.at(0)["itemIdentifier"].uint64Value(), arguments);
                               });
}

int InstallCommand::run(const InstallOptions& options) {
  if (!options.tags.empty()) return installByTags(options);
  const Choice choice = choose(options);
  for (const std::string& missing : choice.missing) {
    std::cerr << "larderctl: " << missing << " is not an available update; see `larderctl "
              << "updates` and `larderctl os-updates`" << std::endl;
  }
  if (!choice.missing.empty()) return kExitFailure;
  if (choice.apps.empty() && choice.osUpdates.empty()) {
    if (!json_) std::cout << "Nothing to install." << std::endl;
    return kExitNothingToDo;
  }
  return startUpdates(choice);
}

InstallCommand::Choice InstallCommand::choose(const InstallOptions& options) const {
  Choice choice;
  const PlistValue apps = client_.call("AvailableUpdates", {}).at(0);
  // No tags: every available OS update carries all of none.
  const PlistValue os = client_.call("UpdatesForTags", PlistArray{PlistValue(PlistArray{})}).at(0);
  const PlistArray& appList = apps.array() ? *apps.array() : PlistArray{};
  const PlistArray& osList = os.array() ? *os.array() : PlistArray{};
  if (options.all) {
    choice.apps = appList;
    choice.osUpdates = osList;
    return choice;
  }
  if (options.critical) {
    for (const PlistValue& update : osList) {
      if (update["isCritical"].boolValue()) choice.osUpdates.push_back(update);
    }
    return choice;
  }
  for (std::uint64_t item : options.items) {
    auto found = std::ranges::find_if(
        appList, [&](const PlistValue& u) { return u["itemIdentifier"].uint64Value() == item; });
    if (found == appList.end()) {
      choice.missing.push_back("item " + std::to_string(item));
    } else {
      choice.apps.push_back(*found);
    }
  }
  for (const std::string& key : options.osKeys) {
    auto found = std::ranges::find_if(osList, [&](const PlistValue& u) {
      const std::string* productKey = u["productKey"].string();
      return productKey && *productKey == key;
    });
    if (found == osList.end()) {
      choice.missing.push_back("OS update " + key);
    } else {
      choice.osUpdates.push_back(*found);
    }
  }
  return choice;
}

int InstallCommand::startUpdates(const Choice& choice) {
  // The reply comes when the run has ended; the progress is drawn meanwhile.
  std::future<PlistArray> reply =
      std::async(std::launch::async, [this, apps = choice.apps, os = choice.osUpdates] {
        return runner_.call("StartAppUpdatesAndOSUpdatesWithDelegate",
                            {apps, os, std::string(kDelegatePath)}, kRunTimeoutMicroseconds);
      });
  std::map<std::uint64_t, std::string> titles;
  for (const PlistValue& update : choice.apps) {
    titles.emplace(update["itemIdentifier"].uint64Value(), titleOf(update));
  }
  ProgressBar bar(stderr);
  while (reply.wait_for(kProgressInterval) != std::future_status::ready) {
    if (titles.empty()) continue;
    const PlistArray downloads = client_.callStoreRuntime("Downloads", {kAllDownloadTypes});
    for (const PlistValue& download : *downloads.at(0).array()) {
      auto found = titles.find(download["metadata"]["itemIdentifier"].uint64Value());
      if (found == titles.end()) continue;
      bar.show(download["progress"].doubleValue(), found->second);
      break;
    }
  }
  bar.clear();
  const PlistArray outcome = reply.get();  // a bus failure reaches main's handler
  const bool success = outcome.at(0).boolValue();
  const PlistValue& runError = outcome.at(1);
  bool allInstalled = true;
  for (const PlistValue& update : choice.apps) {
    allInstalled = reportApp(update, runError) && allInstalled;
  }
  for (const PlistValue& update : choice.osUpdates) {
    allInstalled = reportOS(update, success, runError) && allInstalled;
  }
  if (json_) {
    MutexLock lock(inbox_->mutex);
    PlistArray finished;
    for (const auto& [item, arguments] : inbox_->finished) {
      finished.emplace_back(PlistDictionary{
          {"update", arguments.at(0)}, {"success", arguments.at(1)}, {"error", arguments.at(2)}});
    }
    std::cout << JsonConversion::toJson(PlistDictionary{{"success", success && allInstalled},
                                                        {"error", runError},
                                                        {"appUpdates", finished},
                                                        {"osUpdates", choice.osUpdates}})
                     .dump()
              << std::endl;
  }
  return success && allInstalled ? kExitSuccess : kExitFailure;
}

// The delegate's word on the purchase first: without it, the run's own
// error, or its silence, is all there is to say.
bool InstallCommand::reportApp(const PlistValue& update, const PlistValue& runError) const {
  const std::uint64_t item = update["itemIdentifier"].uint64Value();
  std::optional<PlistArray> finished;
  {
    MutexLock lock(inbox_->mutex);
    if (auto found = inbox_->finished.find(item); found != inbox_->finished.end()) {
      finished = found->second;
    }
  }
  const bool purchased = finished && finished->at(1).boolValue();
  const bool ok = purchased && !isError(runError);
  if (json_) return ok;
  if (ok) {
    std::cout << "updated " << titleOf(update) << " to " << ValueText::textOr(update["version"])
              << std::endl;
    return true;
  }
  const PlistValue& error = finished && isError(finished->at(2)) ? finished->at(2) : runError;
  std::cerr << "larderctl: the update of " << titleOf(update) << " (item " << item << ") failed: "
            << (isError(error) ? reasonOf(error) : "the run ended without a word of it")
            << std::endl;
  return false;
}

bool InstallCommand::reportOS(const PlistValue& update, bool success,
                              const PlistValue& runError) const {
  const std::string key = ValueText::textOr(update["productKey"]);
  if (json_) return success;
  if (success) {
    std::cout << "installed OS update " << key << " (" << ValueText::textOr(update["title"]) << ")"
              << std::endl;
    return true;
  }
  std::cerr << "larderctl: the OS update " << key << " failed: " << reasonOf(runError) << std::endl;
  return false;
}

int InstallCommand::installByTags(const InstallOptions& options) {
  PlistDictionary fallback;
  if (options.fallbackItem) {
    fallback = {{"buyParams", "itemId=" + std::to_string(*options.fallbackItem)},
                {"itemIdentifier", *options.fallbackItem}};
  }
  const PlistArray reply = client_.call(
      "StartAppInstallWithTagsFallbackPurchase",
      {PlistArray(options.tags.begin(), options.tags.end()), fallback}, kRunTimeoutMicroseconds);
  const bool success = reply.at(0).boolValue();
  if (json_) {
    std::cout << JsonConversion::toJson(PlistDictionary{{"success", success},
                                                        {"identifier", reply.at(1)},
                                                        {"response", reply.at(2)},
                                                        {"error", reply.at(3)}})
                     .dump()
              << std::endl;
  } else if (success) {
    std::cout << "installing " << ValueText::textOr(reply.at(1)) << std::endl;
  } else {
    std::cerr << "larderctl: the install for the tags failed: " << reasonOf(reply.at(3))
              << std::endl;
  }
  return success ? kExitSuccess : kExitFailure;
}

int InstallCommand::cancel(const std::vector<std::string>& productKeys) {
  // One argument, the array: spelled out, since braces around a lone
  // array would copy it instead.
  client_.call("CancelOSUpdatesWithProductKeys",
               PlistArray{PlistValue(PlistArray(productKeys.begin(), productKeys.end()))});
  if (!json_) {
    std::cout << "asked to cancel the installs of " << productKeys.size() << " OS update"
              << (productKeys.size() == 1 ? "" : "s") << std::endl;
  }
  return kExitSuccess;
}

}  // namespace larder
