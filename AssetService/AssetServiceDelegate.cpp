#include "AssetService/AssetServiceDelegate.h"

namespace larder {

std::shared_ptr<AssetServiceInterface> AssetServiceDelegate::clientInterface(
    std::string peer, SoftwareMap& softwareMap, std::shared_ptr<RemoteObjectFactory> remote) {
  return std::make_shared<AssetServiceInterface>(std::move(peer), softwareMap, std::move(remote));
}

}  // namespace larder
