#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/value/PlistValue.h"

namespace larder {

// The identity a client presents on its connection. `identifier` keys the
// per-client registries; two connections with the same identifier share
// every per-client object.
class VendStoreClient {
 public:
  enum ClientType : std::int64_t {
    kStoreApplication = 0,
    kBookApplication = 1,
    kDeviceConfigurationTool = 2,
    kMetadataSearch = 3,
    kWebBrowser = 4,
  };

  VendStoreClient() = default;
  VendStoreClient(std::string identifier, std::int64_t clientType, std::int64_t frameworkVersion,
                  std::string agentPreferencesDomain, PlistDictionary daap = {});

  // The standard client of a type, with the identifier that type uses and
  // the DMAP versions of this build in `daap`.
  static VendStoreClient initWithStoreClientType(std::int64_t clientType);
  // Finds a client again from what a notification kept; nullopt for an
  // identifier that names no known client.
  static std::optional<VendStoreClient> knownClientWithIdentifier(std::string_view identifier,
                                                                  std::int64_t frameworkVersion);

  [[nodiscard]] const std::string& identifier() const { return identifier_; }
  [[nodiscard]] std::int64_t clientType() const { return clientType_; }
  [[nodiscard]] std::int64_t frameworkVersion() const { return frameworkVersion_; }
  [[nodiscard]] const std::string& agentPreferencesDomain() const {
    return agentPreferencesDomain_;
  }
  [[nodiscard]] const PlistDictionary& daap() const { return daap_; }
  // The type of URL bag that the client's store requests and settings come
  // from; 0, the default bag, unless set.
  [[nodiscard]] std::int64_t requiredBagType() const { return requiredBagType_; }
  void setRequiredBagType(std::int64_t bagType) { requiredBagType_ = bagType; }

  // Wire form: "identifier", "clientType", "frameworkVersion",
  // "agentPreferencesDomain", "daap", and "requiredBagType" when it is not
  // 0. A dictionary without a string
  // identifier gives a client with an empty identifier, which the
  // registries refuse.
  static VendStoreClient fromDictionary(const PlistDictionary& dictionary);
  [[nodiscard]] PlistDictionary toDictionary() const;
  [[nodiscard]] std::string description() const;

  friend bool operator==(const VendStoreClient&, const VendStoreClient&) = default;

 private:
  std::string identifier_;
  std::int64_t clientType_ = kStoreApplication;
  std::int64_t frameworkVersion_ = 0;
  std::string agentPreferencesDomain_;
  PlistDictionary daap_;
  std::int64_t requiredBagType_ = 0;
};

}  // namespace larder
