#pragma once

#include <memory>
#include <string>

#include "software-map/VendSoftwareMapObserver.h"

namespace larder {

// Makes the service's handles on callback objects that a client exported:
// calls on them go to the client without waiting, and to nowhere once the
// client has gone.
class RemoteObjectFactory {
 public:
  virtual ~RemoteObjectFactory() = default;
  virtual std::shared_ptr<VendSoftwareMapObserver> softwareMapObserver(
      const std::string& peer, const std::string& objectPath) = 0;
};

}  // namespace larder
