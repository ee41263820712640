#include "tools/larderctl/StoreCommands.h"

#include <chrono>
#include <iostream>
#include <map>
#include <thread>

#include "platform/plist/JsonConversion.h"
#include "tools/larderctl/ProgressBar.h"

namespace larder {
namespace {

constexpr std::int64_t kAllDownloadTypes = 3;
constexpr std::chrono::milliseconds kDownloadPollInterval{200};
// How long an ended download may take to show up as installed software.
constexpr std::chrono::seconds kInstalledSightingLimit{10};

std::string describeDownload(const PlistValue& download) {
  const PlistValue& metadata = download["metadata"];
  std::string line = std::to_string(metadata["itemIdentifier"].uint64Value());
  for (const char* key : {"bundleIdentifier", "bundleVersion", "title"}) {
    const std::string* text = metadata[key].string();
    line += "  ";
    line += text ? *text : "-";
  }
  return line;
}

}  // namespace

int StoreCommands::reportFailure(const PlistValue& error) const {
  if (json_) {
    std::cout << JsonConversion::toJson(error).dump() << std::endl;
  } else {
    const std::string* description = error["description"].string();
    std::cerr << "larderctl: " << (description ? *description : "failed") << " (code "
              << error["code"].int64Value() << ")" << std::endl;
  }
  return 1;
}

int StoreCommands::signIn(const std::string& accountName, std::optional<std::string> password) {
  if (!password) {
    std::string line;
    std::getline(std::cin, line);
    password = line;
  }
  PlistArray reply =
      client_.callStoreRuntime("SignIn", {accountName, *password}, kPurchaseTimeoutMicroseconds);
  if (!reply.at(0).boolValue()) return reportFailure(reply.at(2));
  if (json_) {
    std::cout << JsonConversion::toJson(PlistDictionary{{"accountID", reply.at(1)}}).dump()
              << std::endl;
  } else {
    std::cout << "signed in as " << accountName << " (account " << reply.at(1).uint64Value() << ")"
              << std::endl;
  }
  return 0;
}

int StoreCommands::signOut() {
  client_.callStoreRuntime("SignOut", {});
  return 0;
}

int StoreCommands::account() {
  PlistArray reply = client_.callStoreRuntime("PrimaryAccount", {});
  const PlistValue& account = reply.at(0);
  if (json_) {
    std::cout << JsonConversion::toJson(account).dump() << std::endl;
    return 0;
  }
  const std::string* name = account["orvaneID"].string();
  if (!name) {
    std::cout << "nobody is signed in" << std::endl;
    return 1;
  }
  std::cout << *name << " (account " << account["accountID"].uint64Value() << ")" << std::endl;
  return 0;
}

int StoreCommands::purchase(std::uint64_t itemIdentifier, const std::string& buyParameters,
                            bool wait) {
  const std::string parameters =
      buyParameters.empty() ? "itemId=" + std::to_string(itemIdentifier) : buyParameters;
  PlistArray reply = client_.callStoreRuntime("Purchase", {itemIdentifier, parameters},
                                              kPurchaseTimeoutMicroseconds);
  if (!reply.at(0).boolValue()) return reportFailure(reply.at(1));
  if (json_) {
    std::cout << JsonConversion::toJson(reply.at(2)).dump() << std::endl;
    return 0;
  }
  for (const PlistValue& download : *reply.at(2).array()) {
    std::cout << "downloading " << describeDownload(download) << std::endl;
  }
  return wait ? followDownloads(*reply.at(2).array()) : 0;
}

int StoreCommands::followDownloads(const PlistArray& started) {
  std::map<std::uint64_t, std::string> pending;
  for (const PlistValue& download : started) {
    const PlistValue& metadata = download["metadata"];
    const std::string* title = metadata["title"].string();
    pending.emplace(metadata["itemIdentifier"].uint64Value(), title ? *title : "");
  }
  ProgressBar bar(stderr);
  int status = 0;
  while (!pending.empty()) {
    const PlistArray reply = client_.callStoreRuntime("Downloads", {kAllDownloadTypes});
    std::map<std::uint64_t, double> progress;
    for (const PlistValue& download : *reply.at(0).array()) {
      const std::uint64_t item = download["metadata"]["itemIdentifier"].uint64Value();
      if (!pending.contains(item) || download["status"]["isFailed"].boolValue()) continue;
      progress.emplace(item, download["progress"].doubleValue());
    }
    for (auto entry = pending.begin(); entry != pending.end();) {
      if (progress.contains(entry->first)) {
        bar.show(progress[entry->first], entry->second);
        ++entry;
        continue;
      }
      bar.clear();
      if (!reportInstalled(entry->first, entry->second)) status = 1;
      entry = pending.erase(entry);
    }
    if (!pending.empty()) std::this_thread::sleep_for(kDownloadPollInterval);
  }
  return status;
}

// A download leaves the list when it has ended either way; the software
// map tells which, once its live query has seen the bundle arrive.
bool StoreCommands::reportInstalled(std::uint64_t itemIdentifier, const std::string& title) {
  const auto deadline = std::chrono::steady_clock::now() + kInstalledSightingLimit;
  do {
    const PlistValue product = client_.call("ProductForItemIdentifier", {itemIdentifier}).at(0);
    if (const std::string* path = product["bundlePath"].string()) {
      std::cout << "installed " << title << " at " << *path << std::endl;
      return true;
    }
    std::this_thread::sleep_for(kDownloadPollInterval);
  } while (std::chrono::steady_clock::now() < deadline);
  std::cerr << "larderctl: the download of " << title << " (" << itemIdentifier
            << ") ended without an installed application; the service's log says why" << std::endl;
  return false;
}

int StoreCommands::downloads(std::int64_t typeMask) {
  PlistArray reply = client_.callStoreRuntime("Downloads", {typeMask});
  if (json_) {
    std::cout << JsonConversion::toJson(reply.at(0)).dump() << std::endl;
    return 0;
  }
  for (const PlistValue& download : *reply.at(0).array())
    std::cout << describeDownload(download) << std::endl;
  return 0;
}

}  // namespace larder
