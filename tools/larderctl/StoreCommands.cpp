#include "tools/larderctl/StoreCommands.h"

#include <iostream>
#include <optional>

#include "platform/plist/JsonConversion.h"
#include "tools/larderctl/DownloadFollower.h"
#include "tools/larderctl/ExitStatus.h"
#include "tools/larderctl/Spinner.h"

namespace larder {

std::string StoreCommands::describeDownload(const PlistValue& download) {
  const PlistValue& metadata = download["metadata"];
  std::string line = std::to_string(metadata["itemIdentifier"].uint64Value());
  for (const char* key : {"bundleIdentifier", "bundleVersion", "title"}) {
    const std::string* text = metadata[key].string();
    line += "  ";
    line += text ? *text : "-";
  }
  return line;
}

int StoreCommands::reportFailure(std::string_view what, const PlistValue& error, bool json) {
  if (json) {
    std::cout << JsonConversion::toJson(error).dump() << std::endl;
  } else {
    const std::string* description = error["description"].string();
    std::cerr << "larderctl: " << what
              << " failed: " << (description ? *description : "the service gave no reason")
              << " (code " << error["code"].int64Value() << ")" << std::endl;
  }
  return kExitFailure;
}

int StoreCommands::signIn(const std::string& accountName, std::optional<std::string> password) {
  if (!password) {
    std::string line;
    std::getline(std::cin, line);
    password = line;
  }
  PlistArray reply;
  {
    Spinner spinner(stderr, "signing in as " + accountName);
    reply =
        client_.callStoreRuntime("SignIn", {accountName, *password}, kPurchaseTimeoutMicroseconds);
  }
  if (!reply.at(0).boolValue()) return reportFailure("signing in as " + accountName, reply.at(2));
  if (json_) {
    std::cout << JsonConversion::toJson(PlistDictionary{{"accountID", reply.at(1)}}).dump()
              << std::endl;
  } else {
    std::cout << "signed in as " << accountName << " (account " << reply.at(1).uint64Value() << ")"
              << std::endl;
  }
  return kExitSuccess;
}

int StoreCommands::signOut() {
  client_.callStoreRuntime("SignOut", {});
  return kExitSuccess;
}

int StoreCommands::account() {
  PlistArray reply = client_.callStoreRuntime("PrimaryAccount", {});
  const PlistValue& account = reply.at(0);
  const std::string* name = account["orvaneID"].string();
  if (json_) {
    std::cout << (name ? JsonConversion::toJson(account).dump() : "null") << std::endl;
  } else if (name) {
    std::cout << *name << " (account " << account["accountID"].uint64Value() << ")" << std::endl;
  } else {
    std::cout << "nobody is signed in" << std::endl;
  }
  return name ? kExitSuccess : kExitFailure;
}

int StoreCommands::purchase(std::uint64_t itemIdentifier, const std::string& buyParameters,
                            bool wait) {
  const std::string parameters =
      buyParameters.empty() ? "itemId=" + std::to_string(itemIdentifier) : buyParameters;
  std::optional<DownloadFollower> follower;
  if (wait) follower.emplace(client_, json_);
  PlistArray reply;
  {
    Spinner spinner(stderr, "buying item " + std::to_string(itemIdentifier) + " from the store");
    reply = client_.callStoreRuntime("Purchase", {itemIdentifier, parameters},
                                     kPurchaseTimeoutMicroseconds);
  }
  if (!reply.at(0).boolValue()) {
    return reportFailure("the purchase of item " + std::to_string(itemIdentifier), reply.at(1));
  }
  const PlistArray& started = *reply.at(2).array();
  if (json_ && !wait) std::cout << JsonConversion::toJson(started).dump() << std::endl;
  if (!json_) {
    if (started.empty()) std::cout << "the store sent nothing to download" << std::endl;
    for (const PlistValue& download : started) {
      std::cout << "downloading " << describeDownload(download) << std::endl;
    }
  }
  return follower ? follower->follow(started) : kExitSuccess;
}

int StoreCommands::downloads(std::int64_t typeMask) {
  PlistArray reply = client_.callStoreRuntime("Downloads", {typeMask});
  const PlistArray& list = *reply.at(0).array();
  if (json_) {
    std::cout << JsonConversion::toJson(list).dump() << std::endl;
  } else if (list.empty()) {
    std::cout << "no downloads in progress" << std::endl;
  } else {
    for (const PlistValue& download : list) std::cout << describeDownload(download) << std::endl;
  }
  return kExitSuccess;
}

}  // namespace larder
