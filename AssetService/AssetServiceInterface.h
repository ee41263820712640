#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "AssetService/RemoteObjectFactory.h"
#include "platform/dispatch/DispatchQueue.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/core/VendStoreClient.h"

namespace larder {

class SoftwareMap;
class UpdateController;
class UpdateQueue;

// One client connection: the client's store client and the queue its
// requests run on. It holds nothing else; every request resolves the
// object that does the work anew.
class AssetServiceInterface {
 public:
  AssetServiceInterface(std::string peer, SoftwareMap& softwareMap,
                        std::shared_ptr<RemoteObjectFactory> remoteObjects);

  [[nodiscard]] const std::string& peer() const { return peer_; }
  [[nodiscard]] const std::shared_ptr<DispatchQueue>& requestQueue() const { return requestQueue_; }

  [[nodiscard]] std::optional<VendStoreClient> storeClient() const;
  void setStoreClient(VendStoreClient storeClient);
  void startService();
  // For the requests that name a client type of their own: sets a client
  // of that type when the connection has none, and leaves an existing one.
  void setStoreClientFromTypeIfNeeded(std::int64_t clientType);

  // Installed software.
  [[nodiscard]] PlistDictionary productForBundleIdentifier(const std::string& bundleIdentifier);
  [[nodiscard]] PlistDictionary productForItemIdentifier(std::uint64_t itemIdentifier);
  [[nodiscard]] PlistArray allProducts();
  [[nodiscard]] PlistDictionary createSoftwareProductForAppAtPath(const std::string& path);
  [[nodiscard]] PlistDictionary bundleInfoFromBundleAtPath(const std::string& path);
  [[nodiscard]] PlistData iconForApplicationWithBundeID(const std::string& bundleIdentifier);
  [[nodiscard]] std::string addSoftwareMapObserver(const std::string& objectPath);
  void removeSoftwareMapObserver(const std::string& token);

  // The account that owns the product the client sent (an empty record is
  // no product); asks the store and blocks until it has answered.
  [[nodiscard]] std::optional<std::string> lookupOrvaneIDForApp(const PlistValue& product) const;

  [[nodiscard]] SoftwareMap& softwareMap() const { return softwareMap_; }
  // The update controller of the connection's store client; nullptr without one.
  [[nodiscard]] std::shared_ptr<UpdateController> updateController() const;
  // Handles on the callback objects the client exported; nullptr for no
  // object ("/" or empty) or without a bus.
  [[nodiscard]] std::shared_ptr<VendAvailableUpdatesObserver> availableUpdatesObserver(
      const std::string& objectPath) const;
  [[nodiscard]] std::shared_ptr<VendOSUpdateScanObserver> osUpdateScanObserver(
      const std::string& objectPath) const;
  [[nodiscard]] std::shared_ptr<VendOSUpdateProgressObserver> osUpdateProgressObserver(
      const std::string& objectPath) const;
  [[nodiscard]] std::shared_ptr<VendUpdateDelegate> updateDelegate(
      const std::string& objectPath) const;
  // The update queue of the connection's store client; nullptr without one.
  [[nodiscard]] std::shared_ptr<UpdateQueue> updateQueue() const;
  // Book clients ask for book updates where others ask for app updates.
  [[nodiscard]] bool isBookClient() const;

  // Available updates and installs. The reply carries the records' wire
  // forms; without a queue the requests answer as their table row says.
  [[nodiscard]] PlistArray availableUpdates() const;
  [[nodiscard]] PlistDictionary availableUpdateWithItemIdentifier(
      std::uint64_t itemIdentifier) const;
  [[nodiscard]] PlistArray incompatibleUpdates() const;
  // Replies (success, updates, error) when the check ends.
  void checkForUpdatesWithUserHasSeenUpdates(bool userHasSeenUpdates,
                                             std::function<void(PlistArray)> reply) const;

 private:
  std::string peer_;
  SoftwareMap& softwareMap_;
  std::shared_ptr<RemoteObjectFactory> remoteObjects_;
  std::shared_ptr<DispatchQueue> requestQueue_;
  mutable Mutex storeClientMutex_;
  std::optional<VendStoreClient> storeClient_ GUARDED_BY(storeClientMutex_);
};

}  // namespace larder
