#pragma once

#include <sdbus-c++/IConnection.h>

#include <memory>
#include <string>

#include "AssetService/RemoteObjectFactory.h"
#include "platform/dispatch/DispatchQueue.h"

namespace larder {

// Handles on clients' callback objects over the service's bus connection.
// Each call is queued and sent in order on a queue of the factory's own,
// without waiting for an answer, so that neither the service's thread nor a
// slow client, nor one that has gone, is held up: a call to a client that
// has gone simply goes nowhere.
class DBusRemoteObjectFactory final : public RemoteObjectFactory {
 public:
  // The connection must outlive the factory and the handles it makes.
  explicit DBusRemoteObjectFactory(sdbus::IConnection& connection);
  ~DBusRemoteObjectFactory() override;
  DBusRemoteObjectFactory(const DBusRemoteObjectFactory&) = delete;
  DBusRemoteObjectFactory& operator=(const DBusRemoteObjectFactory&) = delete;

  std::shared_ptr<VendSoftwareMapObserver> softwareMapObserver(
      const std::string& peer, const std::string& objectPath) override;
  std::shared_ptr<VendAvailableUpdatesObserver> availableUpdatesObserver(
      const std::string& peer, const std::string& objectPath) override;
  std::shared_ptr<VendOSUpdateScanObserver> osUpdateScanObserver(
      const std::string& peer, const std::string& objectPath) override;
  std::shared_ptr<VendOSUpdateProgressObserver> osUpdateProgressObserver(
      const std::string& peer, const std::string& objectPath) override;
  std::shared_ptr<VendUpdateDelegate> updateDelegate(const std::string& peer,
                                                     const std::string& objectPath) override;

 private:
  sdbus::IConnection& connection_;
  // Every call to every client, in the order they were made.
  std::shared_ptr<DispatchQueue> sendQueue_;
};

}  // namespace larder
