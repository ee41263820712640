#include "tools/larderctl/UpdatesCommand.h"

#include <iomanip>
#include <iostream>
#include <sstream>

#include "platform/plist/JsonConversion.h"
#include "tools/larderctl/ExitStatus.h"
#include "tools/larderctl/Spinner.h"
#include "tools/larderctl/ValueText.h"

namespace larder {
namespace {

std::string marksOf(const PlistValue& update) {
  std::string marks;
  if (update["hasBeenSeenByUser"].boolValue()) marks += "seen ";
  if (update["isStaged"].boolValue()) marks += "staged ";
  if (std::int64_t code = update["autoUpdateAbortCode"].int64Value(); code != 0) {
    marks += "abort=" + std::to_string(code) + " ";
  }
  if (!marks.empty()) marks.pop_back();
  return marks;
}

}  // namespace

int UpdatesCommand::run(bool check) {
  PlistValue success = true;
  PlistValue error = PlistDictionary{};
  PlistValue available;
  if (check) {
    Spinner spinner(stderr, "asking the store for updates");
    PlistArray reply =
        client_.call("CheckForUpdatesWithUserHasSeenUpdates", {false}, kCheckTimeoutMicroseconds);
    success = reply.at(0);
    available = reply.at(1);
    error = reply.at(2);
  } else {
    available = client_.call("AvailableUpdates", {}).at(0);
  }
  const PlistValue incompatible = client_.call("IncompatibleUpdates", {}).at(0);
  const PlistArray& updates = available.array() ? *available.array() : PlistArray{};
  if (json_) {
    printJson(success, available, incompatible, error);
  } else {
    if (!success.boolValue()) {
      std::cerr << "larderctl: the update check failed: "
                << ValueText::textOr(error["description"], "unknown") << " (code "
                << error["code"].int64Value() << "); showing what the service knew" << std::endl;
    }
    // After a failed check an empty list says nothing about the store.
    if (!updates.empty() || success.boolValue()) printTable(updates, false);
    if (const PlistArray* list = incompatible.array(); list && !list->empty()) {
      std::cout << "\nIncompatible with this machine:\n";
      printTable(*list, true);
    }
  }
  if (!success.boolValue()) return kExitFailure;
  return updates.empty() ? kExitNothingToDo : kExitSuccess;
}

void UpdatesCommand::printTable(const PlistArray& updates, bool incompatible) const {
  if (updates.empty()) {
    if (!incompatible) std::cout << "No updates available." << std::endl;
    return;
  }
  std::cout << std::left << std::setw(12) << "ITEM" << std::setw(34) << "BUNDLE ID" << std::setw(12)
            << "VERSION" << std::setw(28) << "TITLE"
            << "MARKS" << '\n';
  for (const PlistValue& update : updates) {
    std::cout << std::left << std::setw(12) << update["itemIdentifier"].uint64Value()
              << std::setw(34) << ValueText::textOr(update["bundleID"]) << std::setw(12)
              << ValueText::textOr(update["version"]) << std::setw(28)
              << ValueText::textOr(update["title"]) << marksOf(update) << '\n';
  }
  std::cout << std::flush;
}

void UpdatesCommand::printJson(const PlistValue& success, const PlistValue& available,
                               const PlistValue& incompatible, const PlistValue& error) const {
  PlistDictionary result{
      {"success", success}, {"updates", available}, {"incompatibleUpdates", incompatible}};
  if (const PlistDictionary* failure = error.dictionary(); failure && !failure->empty()) {
    result.emplace("error", error);
  }
  std::cout << JsonConversion::toJson(result).dump() << std::endl;
}

}  // namespace larder
