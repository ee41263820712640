#pragma once

#include <memory>
#include <span>
#include <string_view>

#include <sdbus-c++/IObject.h>
#include <sdbus-c++/Message.h>

#include "AssetService/BusMethodExport.h"

namespace larder {

// The store runtime's accounts, purchases and downloads for tools and scripts
// on the bus (`larderctl signin`, `purchase`, `downloads`). Every method answers from
// the runtime's service queue, so the bus thread never waits for the store.
class StoreRuntimeInterface : public std::enable_shared_from_this<StoreRuntimeInterface> {
 public:
  // Adds the methods to the service object before its registration ends.
  void exportOn(sdbus::IObject& object);

 private:
  void signIn(sdbus::MethodCall call);
  void signOut(sdbus::MethodCall call);
  void primaryAccount(sdbus::MethodCall call);
  void purchase(sdbus::MethodCall call);
  void downloads(sdbus::MethodCall call);
};

}  // namespace larder
