#include "AssetService/AssetServiceInterface.h"

#include "client/ServiceError.h"
#include "platform/log/TillLogManager.h"
#include "software-map/SoftwareMap.h"
#include "update-controller/UpdateController.h"
#include "update-queue/UpdateQueue.h"

namespace larder {

namespace {

bool namesAnObject(const std::string& objectPath) {
  return !objectPath.empty() && objectPath != "/";
}

PlistDictionary wireForm(const LedgerSoftwareProductRef& product) {
  return product ? product->toDictionary() : PlistDictionary{};
}

PlistArray wireForm(const UpdateQueue::UpdateList& updates) {
  PlistArray wire;
  wire.reserve(updates.size());
  for (const LedgerUpdateRef& update : updates) wire.emplace_back(update->toDictionary());
  return wire;
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
  MutexLock lock(storeClientMutex_);
  return storeClient_;
}

void AssetServiceInterface::setStoreClient(VendStoreClient storeClient) {
  MutexLock lock(storeClientMutex_);
  storeClient_ = std::move(storeClient);
}

void AssetServiceInterface::startService() {
  TILL_LOG(3, "%@: client %@ started service with %@", "AssetServiceInterface", peer_,
           storeClient());
}

void AssetServiceInterface::setStoreClientFromTypeIfNeeded(std::int64_t clientType) {
  MutexLock lock(storeClientMutex_);
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
  if (namesAnObject(objectPath) && remoteObjects_) {
    observer = remoteObjects_->softwareMapObserver(peer_, objectPath);
  }
  return softwareMap_.addObserver(std::move(observer));
}

void AssetServiceInterface::removeSoftwareMapObserver(const std::string& token) {
  softwareMap_.removeObserverWithToken(token);
}

std::optional<std::string> AssetServiceInterface::lookupOrvaneIDForApp(
    const PlistValue& product) const {
  const PlistDictionary* fields = product.dictionary();
  std::optional<LedgerSoftwareProduct> record;
  if (fields && !fields->empty()) {
    record.emplace(LedgerSoftwareProduct::fieldsFromDictionary(*fields));
  }
  // The lookup works without a store client too, as every request about
  // installed software does; it then speaks for the store application.
  const VendStoreClient client = storeClient().value_or(
      VendStoreClient::initWithStoreClientType(VendStoreClient::kStoreApplication));
  return SoftwareMap::lookupOrvaneIDForApp(record ? &*record : nullptr, client);
}

// --- Available updates ---

std::shared_ptr<UpdateQueue> AssetServiceInterface::updateQueue() const {
  std::optional<VendStoreClient> client = storeClient();
  return UpdateController::updateQueueForStoreClient(client ? &*client : nullptr);
}

std::shared_ptr<UpdateController> AssetServiceInterface::updateController() const {
  std::optional<VendStoreClient> client = storeClient();
  return UpdateController::updateControllerForStoreClient(client ? &*client : nullptr);
}

std::shared_ptr<VendAvailableUpdatesObserver> AssetServiceInterface::availableUpdatesObserver(
    const std::string& objectPath) const {
  if (!namesAnObject(objectPath) || !remoteObjects_) return nullptr;
  return remoteObjects_->availableUpdatesObserver(peer_, objectPath);
}

std::shared_ptr<VendOSUpdateScanObserver> AssetServiceInterface::osUpdateScanObserver(
    const std::string& objectPath) const {
  if (!namesAnObject(objectPath) || !remoteObjects_) return nullptr;
  return remoteObjects_->osUpdateScanObserver(peer_, objectPath);
}

std::shared_ptr<VendOSUpdateProgressObserver> AssetServiceInterface::osUpdateProgressObserver(
    const std::string& objectPath) const {
  if (!namesAnObject(objectPath) || !remoteObjects_) return nullptr;
  return remoteObjects_->osUpdateProgressObserver(peer_, objectPath);
}

std::shared_ptr<VendUpdateDelegate> AssetServiceInterface::updateDelegate(
    const std::string& objectPath) const {
  if (!namesAnObject(objectPath) || !remoteObjects_) return nullptr;
  return remoteObjects_->updateDelegate(peer_, objectPath);
}

bool AssetServiceInterface::isBookClient() const {
  std::optional<VendStoreClient> client = storeClient();
  return client && client->clientType() == VendStoreClient::kBookApplication;
}

PlistArray AssetServiceInterface::availableUpdates() const {
  // Book updates come with the book library; until then a book client has
  // none to list.
  if (isBookClient()) return {};
  auto queue = updateQueue();
  return queue ? wireForm(*queue->availableUpdates()) : PlistArray{};
}

PlistDictionary AssetServiceInterface::availableUpdateWithItemIdentifier(
    std::uint64_t itemIdentifier) const {
  auto queue = updateQueue();
  auto update = queue ? queue->availableUpdateWithItemIdentifier(itemIdentifier) : nullptr;
  return update ? update->toDictionary() : PlistDictionary{};
}

PlistArray AssetServiceInterface::incompatibleUpdates() const {
  auto queue = updateQueue();
  auto list = queue ? queue->incompatibleUpdates() : nullptr;
  return list ? wireForm(*list) : PlistArray{};
}

void AssetServiceInterface::checkForUpdatesWithUserHasSeenUpdates(
    bool userHasSeenUpdates, std::function<void(PlistArray)> reply) const {
  // Book clients check for book updates, which come with the book library:
  // until then their check finds nothing.
  if (isBookClient()) {
    if (reply) reply({false, PlistArray{}, PlistDictionary{}});
    return;
  }
  auto queue = updateQueue();
  // Without a store client there is no queue for the reply to belong to;
  // the caller hears so at once instead of waiting out its timeout.
  if (!queue) {
    if (reply) throw ServiceError::noStoreClient("CheckForUpdatesWithUserHasSeenUpdates");
    return;
  }
  queue->checkForUpdatesWithCompletionHandler(
      [queue, userHasSeenUpdates, reply = std::move(reply)](
          bool success, const UpdateQueue::UpdateList& available,
          const std::optional<UpdateQueue::UpdateList>& incompatible, const OptionalError& error) {
        if (userHasSeenUpdates) {
          queue->setUserHasSeenAllUpdates(available,
                                          incompatible.value_or(UpdateQueue::UpdateList{}));
        }
        if (!reply) return;
        reply({success, wireForm(available), error ? error->toDictionary() : PlistDictionary{}});
      });
}

}  // namespace larder
