#include "tools/larderctl/RunsCommand.h"

#include <ctime>
#include <iomanip>
#include <iostream>
#include <sstream>

#include "platform/plist/JsonConversion.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "tools/larderctl/ExitStatus.h"
#include "tools/larderctl/StoreCommands.h"

namespace larder {

namespace {

// Install and stage-only downloads.
constexpr std::int64_t kAllDownloads = 3;

std::string heldBack(const PlistValue& entry) {
  const std::string* reason = entry["abortReason"].string();
  return "held back: " + (reason ? *reason : std::string("no reason given")) + " (code " +
         std::to_string(entry["abortCode"].int64Value()) + ")";
}

const PlistValue* listedUpdate(const PlistArray& listed, const std::string& itemIdentifier) {
  for (const PlistValue& update : listed) {
    if (std::to_string(update["itemIdentifier"].uint64Value()) == itemIdentifier) return &update;
  }
  return nullptr;
}

}  // namespace

std::string RunsCommand::localTime(const PlistValue& date) {
  if (!date.isDate()) return "-";
  const std::time_t time = static_cast<std::time_t>(date.date()->secondsSince1970);
  std::tm parts{};
  localtime_r(&time, &parts);
  std::ostringstream text;
  text << std::put_time(&parts, "%Y-%m-%d %H:%M:%S");
  return text.str();
}

PlistDictionary RunsCommand::readLastAudit() {
  if (auto bytes = FileIO::read(auditFilePath())) {
    if (auto value = PropertyListSerialization::read(*bytes); value && value->dictionary()) {
      return *value->dictionary();
    }
  }
  return {};
}

std::string RunsCommand::auditFilePath() {
  return Environment::cacheHome() + "/" + std::string(kDaemonDefaultsID) +
         "/UpdateOperationAudit.plist";
}

std::string RunsCommand::outcome(const PlistValue& entry, const PlistValue* listed) {
  const bool staged = listed && (*listed)["isStaged"].boolValue();
  if (entry["shouldInstall"].boolValue()) return listed ? "install failed" : "installed";
  if (entry["abortCode"].int64Value() == 0) return staged ? "staged" : "not installed";
  return (staged ? "staged, " : "") + heldBack(entry);
}

int RunsCommand::run() {
  const PlistValue downloads = client_.callStoreRuntime("Downloads", {kAllDownloads}).at(0);
  const PlistValue listed = client_.call("AvailableUpdates", {}).at(0);
  const PlistDictionary audit = readLastAudit();
  if (json_) {
    std::cout << JsonConversion::toJson(PlistDictionary{{"inProgress", downloads},
                                                        {"lastRun", audit},
                                                        {"updates", listed}})
                     .dump()
              << std::endl;
    return audit.empty() ? kExitNothingToDo : kExitSuccess;
  }
  printInProgress(downloads.array() ? *downloads.array() : PlistArray{});
  if (audit.empty()) {
    std::cout << "no background run has been recorded yet" << std::endl;
    return kExitNothingToDo;
  }
  printLastRun(audit, listed.array() ? *listed.array() : PlistArray{});
  return kExitSuccess;
}

void RunsCommand::printInProgress(const PlistArray& downloads) const {
  if (downloads.empty()) {
    std::cout << "nothing downloading or installing now" << std::endl;
    return;
  }
  std::cout << "in progress:" << std::endl;
  for (const PlistValue& download : downloads) {
    std::cout << "  " << StoreCommands::describeDownload(download) << "  "
              << static_cast<int>(download["progress"].doubleValue() * 100) << "%" << std::endl;
  }
}

void RunsCommand::printLastRun(const PlistDictionary& audit, const PlistArray& listed) const {
  const PlistValue record(audit);
  std::cout << "last background run: " << localTime(record["runDate"]) << std::endl;
  auto print = [](const std::string& name, const std::string& what) {
    std::cout << "  " << std::left << std::setw(28) << name << what << std::endl;
  };
  if (const PlistDictionary* apps = record["appUpdates"].dictionary()) {
    for (const auto& [item, entry] : *apps) {
      const PlistValue* update = listedUpdate(listed, item);
      const std::string* title = update ? (*update)["title"].string() : nullptr;
      print((title ? *title + " " : std::string()) + "(" + item + ")", outcome(entry, update));
    }
  }
  if (const PlistDictionary* os = record["osUpdates"].dictionary()) {
    for (const auto& [key, entry] : *os) {
      print(key, entry["shouldInstall"].boolValue() ? "installing or installed" : heldBack(entry));
    }
  }
}

}  // namespace larder
