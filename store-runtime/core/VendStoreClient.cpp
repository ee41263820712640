#include "store-runtime/core/VendStoreClient.h"

#include <array>

namespace larder {

namespace {

constexpr std::int64_t kCurrentFrameworkVersion = 1;

// The identifier of the standard client of each type, by type.
constexpr std::array<std::string_view, 5> kStandardIdentifiers = {
    "com.orvane.quaymart", "com.orvane.books", "com.orvane.outfitter", "com.orvane.lantern",
    "com.orvane.wayfarer"};

// The DMAP protocol versions this build speaks, which the cloud library
// service reads from every request's headers.
PlistDictionary standardDAAPSettings() {
  return {{"Client-DAAP-Version", "3.13"}, {"Client-Cloud-Purchase-Daap-Version", "1"}};
}

}  // namespace

VendStoreClient::VendStoreClient(std::string identifier, std::int64_t clientType,
                                 std::int64_t frameworkVersion, std::string agentPreferencesDomain,
                                 PlistDictionary daap)
    : identifier_(std::move(identifier)),
      clientType_(clientType),
      frameworkVersion_(frameworkVersion),
      agentPreferencesDomain_(std::move(agentPreferencesDomain)),
      daap_(std::move(daap)) {}

VendStoreClient VendStoreClient::initWithStoreClientType(std::int64_t clientType) {
  bool known =
      clientType >= 0 && clientType < static_cast<std::int64_t>(kStandardIdentifiers.size());
  std::string identifier =
      known ? std::string(kStandardIdentifiers[static_cast<std::size_t>(clientType)])
            : "com.orvane.storeclient." + std::to_string(clientType);
  return {identifier, clientType, kCurrentFrameworkVersion, identifier, standardDAAPSettings()};
}

std::optional<VendStoreClient> VendStoreClient::knownClientWithIdentifier(
    std::string_view identifier, std::int64_t frameworkVersion) {
  for (std::size_t type = 0; type < kStandardIdentifiers.size(); ++type) {
    if (kStandardIdentifiers[type] == identifier) {
      VendStoreClient client = initWithStoreClientType(static_cast<std::int64_t>(type));
      client.frameworkVersion_ = frameworkVersion;
      return client;
    }
  }
  return std::nullopt;
}

VendStoreClient VendStoreClient::fromDictionary(const PlistDictionary& dictionary) {
  PlistValue wrapped(dictionary);
  VendStoreClient client;
  if (const std::string* identifier = wrapped["identifier"].string()) {
    client.identifier_ = *identifier;
  }
  client.clientType_ = wrapped["clientType"].int64Value();
  client.frameworkVersion_ = wrapped["frameworkVersion"].int64Value();
  if (const std::string* domain = wrapped["agentPreferencesDomain"].string()) {
    client.agentPreferencesDomain_ = *domain;
  } else {
    client.agentPreferencesDomain_ = client.identifier_;
  }
  if (const PlistDictionary* daap = wrapped["daap"].dictionary()) client.daap_ = *daap;
  client.requiredBagType_ = wrapped["requiredBagType"].int64Value();
  return client;
}

PlistDictionary VendStoreClient::toDictionary() const {
  PlistDictionary dictionary{{"identifier", identifier_},
                             {"clientType", clientType_},
                             {"frameworkVersion", frameworkVersion_},
                             {"agentPreferencesDomain", agentPreferencesDomain_},
                             {"daap", daap_}};
  if (requiredBagType_ != 0) dictionary.emplace("requiredBagType", requiredBagType_);
  return dictionary;
}

std::string VendStoreClient::description() const {
  return "<VendStoreClient: identifier=" + identifier_ +
         " clientType=" + std::to_string(clientType_) + ">";
}

}  // namespace larder
