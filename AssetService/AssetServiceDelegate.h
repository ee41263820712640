#pragma once

#include <memory>
#include <string>

#include "AssetService/AssetServiceInterface.h"

namespace larder {

class SoftwareMap;

// The listener's delegate: accepts every connection and makes its
// per-connection object. It keeps no state of its own.
class AssetServiceDelegate {
 public:
  explicit AssetServiceDelegate(std::string serviceName) : serviceName_(std::move(serviceName)) {}

  [[nodiscard]] const std::string& serviceName() const { return serviceName_; }

  // The object that answers the requests of one connection.
  static std::shared_ptr<AssetServiceInterface> clientInterface(
      std::string peer, SoftwareMap& softwareMap, std::shared_ptr<RemoteObjectFactory> remote);

 private:
  std::string serviceName_;
};

}  // namespace larder
