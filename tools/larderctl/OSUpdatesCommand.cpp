#include "tools/larderctl/OSUpdatesCommand.h"

#include <future>
#include <iomanip>
#include <iostream>

#include "platform/plist/JsonConversion.h"
#include "tools/larderctl/ExitStatus.h"
#include "tools/larderctl/ProgressBar.h"
#include "tools/larderctl/ValueText.h"

namespace larder {
namespace {

std::string marksOf(const PlistValue& update) {
  std::string marks;
  if (update["isCritical"].boolValue()) marks += "critical ";
  if (update["isRecommended"].boolValue()) marks += "recommended ";
  if (update["allowedToUseInstallLater"].boolValue()) marks += "later-ok ";
  if (!marks.empty()) marks.pop_back();
  return marks;
}

}  // namespace

int OSUpdatesCommand::run(const OSUpdatesOptions& options) {
  if (options.scan) {
    PlistValue error = scan();
    if (const PlistDictionary* failure = error.dictionary(); failure && !failure->empty()) {
      std::cerr << "larderctl: the OS update scan failed: "
                << ValueText::textOr(error["description"], "unknown") << " (code "
                << error["code"].int64Value() << ")" << std::endl;
      return kExitFailure;
    }
  }
  // One argument that is a list: a braced list holding one PlistArray would
  // copy it instead.
  if (!options.hide.empty() &&
      !changeHidden("HideOSUpdatesWithProductKeys",
                    PlistArray{PlistValue(PlistArray(options.hide.begin(), options.hide.end()))},
                    "hide the OS updates")) {
    return kExitFailure;
  }
  if (options.unhideAll && !changeHidden("UnhideAllOSUpdates", {}, "unhide the OS updates")) {
    return kExitFailure;
  }
  // No tags: every available update carries all of none.
  PlistValue updates = client_.call("UpdatesForTags", PlistArray{PlistValue(PlistArray{})}).at(0);
  const PlistArray& list = updates.array() ? *updates.array() : PlistArray{};
  print(list);
  return list.empty() ? kExitNothingToDo : kExitSuccess;
}

PlistValue OSUpdatesCommand::scan() {
  auto finished = std::make_shared<std::promise<PlistValue>>();
  std::future<PlistValue> outcome = finished->get_future();
  auto progress = std::make_shared<ProgressBar>(stderr);
  client_.exportCallbackObject(kScanObserverPath, "VendOSUpdateScanObserver",
                               "OsUpdateScanForTagsDidProgressWithPercentCompleteIsFinishedError",
                               "asdba{sv}", [finished, progress](const PlistArray& arguments) {
                                 if (!arguments.at(2).boolValue()) {
                                   progress->show(arguments.at(1).doubleValue() / 100.0,
                                                  "scanning for OS updates");
                                   return;
                                 }
                                 progress->clear();
                                 try {
                                   finished->set_value(arguments.at(3));
                                 } catch (const std::future_error&) {
                                   // A second end (a scan that another client started ends too).
                                 }
                               });
  client_.call("AddOSUpdateScanObserver", {std::string(kScanObserverPath)});
  client_.call(
      "StartOSUpdateScanWithForceFullScanReportProgressImmediatelyLaunchedFromNotificationUserHasSe"
      "en"
      "AllUpdatesCheckForOtherUpdates",
      {true, true, false, false, false});
  std::future_status status = outcome.wait_for(std::chrono::microseconds(kScanTimeoutMicroseconds));
  client_.call("RemoveOSUpdateScanObserver", {std::string(kScanObserverPath)});
  if (status != std::future_status::ready) {
    return PlistDictionary{{"description", "the scan did not end within 10 minutes"},
                           {"code", std::int64_t{-1}}};
  }
  return outcome.get();
}

bool OSUpdatesCommand::changeHidden(const std::string& member, const PlistArray& arguments,
                                    const std::string& what) {
  if (client_.call(member, arguments).at(0).boolValue()) return true;
  std::cerr << "larderctl: not authorized to " << what
            << "; the machine's authorization service refused" << std::endl;
  return false;
}

void OSUpdatesCommand::print(const PlistArray& updates) const {
  if (json_) {
    std::cout << JsonConversion::toJson(PlistValue(updates)).dump() << std::endl;
    return;
  }
  if (updates.empty()) {
    std::cout << "No OS updates available." << std::endl;
    return;
  }
  std::cout << std::left << std::setw(28) << "PRODUCT KEY" << std::setw(14) << "VERSION"
            << std::setw(34) << "TITLE"
            << "MARKS" << '\n';
  for (const PlistValue& update : updates) {
    std::cout << std::left << std::setw(28) << ValueText::textOr(update["productKey"])
              << std::setw(14) << ValueText::textOr(update["versionString"]) << std::setw(34)
              << ValueText::textOr(update["title"]) << marksOf(update) << '\n';
  }
  std::cout << std::flush;
}

}  // namespace larder
