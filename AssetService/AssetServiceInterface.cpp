#include "AssetService/AssetServiceInterface.h"

#include "software-map/SoftwareMap.h"
#include "store-runtime/TillLogManager.h"

namespace larder {

namespace {

PlistDictionary wireForm(const LedgerSoftwareProductRef& product) {
  return product ? product->toDictionary() : PlistDictionary{};
}

}  // namespace

AssetServiceInterface::AssetServiceInterface(std::string peer, SoftwareMap& softwareMap,
                                             std::shared_ptr<RemoteObjectFactory> remoteObjects)
    : peer_(std::move(peer)),
      softwareMap_(softwareMap),
      remoteObjects_(std::move(remoteObjects)),
      requestQueue_(
          DispatchQueue::create("AssetServiceInterface " + peer_, DispatchQueue::Kind::Serial)) {}

std::optional<VendStoreClient> AssetServiceInterface::storeClient() const {
  std::lock_guard lock(storeClientMutex_);
  return storeClient_;
}

void AssetServiceInterface::setStoreClient(VendStoreClient storeClient) {
  std::lock_guard lock(storeClientMutex_);
  storeClient_ = std::move(storeClient);
}

void AssetServiceInterface::startService() {
  TILL_LOG(3, "%@: client %@ started service with %@", "AssetServiceInterface", peer_,
           storeClient());
}

void AssetServiceInterface::setStoreClientFromTypeIfNeeded(std::int64_t clientType) {
  std::lock_guard lock(storeClientMutex_);
  if (!storeClient_) storeClient_ = VendStoreClient::initWithStoreClientType(clientType);
}

PlistDictionary AssetServiceInterface::productForBundleIdentifier(
    const std::string& bundleIdentifier) {
  return wireForm(softwareMap_.productForBundleIdentifier(bundleIdentifier));
}

PlistDictionary AssetServiceInterface::productForItemIdentifier(std::uint64_t itemIdentifier) {
  return wireForm(softwareMap_.productForItemIdentifier(itemIdentifier));
}

PlistArray AssetServiceInterface::allProducts() {
  PlistArray products;
  for (const LedgerSoftwareProductRef& product : softwareMap_.allProducts()) {
    products.emplace_back(product->toDictionary());
  }
  return products;
}

PlistDictionary AssetServiceInterface::createSoftwareProductForAppAtPath(const std::string& path) {
  return wireForm(SoftwareMap::createSoftwareProductForAppAtPath(path));
}

PlistDictionary AssetServiceInterface::bundleInfoFromBundleAtPath(const std::string& path) {
  return SoftwareMap::bundleInfoFromBundleAtPath(path);
}

PlistData AssetServiceInterface::iconForApplicationWithBundeID(
    const std::string& bundleIdentifier) {
  return softwareMap_.iconDataForApplicationWithBundleID(bundleIdentifier).value_or(PlistData{});
}

std::string AssetServiceInterface::addSoftwareMapObserver(const std::string& objectPath) {
  std::shared_ptr<VendSoftwareMapObserver> observer;
  if (!objectPath.empty() && objectPath != "/" && remoteObjects_) {
    observer = remoteObjects_->softwareMapObserver(peer_, objectPath);
  }
  return softwareMap_.addObserver(std::move(observer));
}

void AssetServiceInterface::removeSoftwareMapObserver(const std::string& token) {
  softwareMap_.removeObserverWithToken(token);
}

}  // namespace larder
