#include "tools/larderctl/StoreCommands.h"

#include <iostream>

#include "store-runtime/JsonConversion.h"

namespace larder {
namespace {

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

int StoreCommands::purchase(std::uint64_t itemIdentifier, const std::string& buyParameters) {
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
  return 0;
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
