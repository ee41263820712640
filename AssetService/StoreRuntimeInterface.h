#pragma once

#include <memory>
#include <span>
#include <string_view>

#include <sdbus-c++/IObject.h>
#include <sdbus-c++/Message.h>

#include "AssetService/BusMethod.h"

namespace larder {

// "com.orvane.larderd.StoreRuntime" on the service object: the store
// runtime's accounts, purchases and downloads for tools and scripts
// (`larderctl signin`, `purchase`, `downloads`). Every method answers from
// the runtime's service queue, so the bus thread never waits for the store.
class StoreRuntimeInterface : public std::enable_shared_from_this<StoreRuntimeInterface> {
 public:
  static constexpr std::string_view kInterfaceName = "com.orvane.larderd.StoreRuntime";

  static std::span<const BusMethod> methods();
  static const BusMethod* findMethod(std::string_view member);

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
