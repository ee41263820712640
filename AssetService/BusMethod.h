#pragma once

#include <map>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include <sdbus-c++/Error.h>
#include <sdbus-c++/IObject.h>
#include <sdbus-c++/Message.h>

#include "AssetService/ServiceError.h"

namespace larder {

// One method of an interface the service exports beside its request
// table, as the bus describes it.
struct BusMethod {
  std::string_view member;
  std::string_view inSignature;
  std::vector<std::string> inNames;
  std::string_view outSignature;
  std::vector<std::string> outNames;
  // Sent without waiting for an answer.
  bool noReply = false;
};

// The method of `methods` named `member`, or null.
inline const BusMethod* findBusMethod(std::span<const BusMethod> methods, std::string_view member) {
  for (const BusMethod& method : methods) {
    if (method.member == member) return &method;
  }
  return nullptr;
}

// Adds `methods` of `interfaceName` to the object, each handled by the
// target's member function of the same name. A D-Bus error thrown by a
// handler becomes the call's error reply, and so does any other failure,
// as the service's Failed error: a caller is never left to its timeout.
template <typename Target>
void exportBusMethods(
    sdbus::IObject& object, std::string_view interfaceName, std::span<const BusMethod> methods,
    const std::map<std::string_view, void (Target::*)(sdbus::MethodCall)>& handlers,
    const std::shared_ptr<Target>& target) {
  for (const BusMethod& method : methods) {
    auto handler = handlers.at(method.member);
    object.registerMethod(
        std::string(interfaceName), std::string(method.member), std::string(method.inSignature),
        method.inNames, std::string(method.outSignature), method.outNames,
        [target, handler](sdbus::MethodCall call) {
          try {
            ((*target).*handler)(call);
          } catch (const sdbus::Error& error) {
            call.createErrorReply(error).send();
          } catch (const std::exception& failure) {
            call.createErrorReply(sdbus::Error(std::string(ServiceError::kFailed), failure.what()))
                .send();
          }
        });
  }
}

}  // namespace larder
