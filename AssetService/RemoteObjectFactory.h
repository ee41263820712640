#pragma once

#include <memory>
#include <string>

#include "software-map/VendSoftwareMapObserver.h"
#include "update-controller/VendAvailableUpdatesObserver.h"
#include "update-controller/VendOSUpdateProgressObserver.h"
#include "update-controller/VendOSUpdateScanObserver.h"
#include "update-operation/VendUpdateDelegate.h"

namespace larder {

// Makes the service's handles on callback objects that a client exported:
// calls on them go to the client without waiting, and to nowhere once the
// client has gone. Two handles on one object of one client are the same
// observer.
class RemoteObjectFactory {
 public:
  virtual ~RemoteObjectFactory() = default;
  virtual std::shared_ptr<VendSoftwareMapObserver> softwareMapObserver(
      const std::string& peer, const std::string& objectPath) = 0;
  virtual std::shared_ptr<VendAvailableUpdatesObserver> availableUpdatesObserver(
      const std::string& peer, const std::string& objectPath) = 0;
  virtual std::shared_ptr<VendOSUpdateScanObserver> osUpdateScanObserver(
      const std::string& peer, const std::string& objectPath) = 0;
  virtual std::shared_ptr<VendOSUpdateProgressObserver> osUpdateProgressObserver(
      const std::string& peer, const std::string& objectPath) = 0;
  virtual std::shared_ptr<VendUpdateDelegate> updateDelegate(const std::string& peer,
                                                             const std::string& objectPath) = 0;
};

}  // namespace larder
