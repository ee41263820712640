#pragma once

#include <map>
#include <memory>
#include <span>
#include <string>
#include <string_view>

#include <sdbus-c++/Error.h>
#include <sdbus-c++/IObject.h>
#include <sdbus-c++/Message.h>

#include "client/BusMethod.h"
#include "client/ServiceError.h"

namespace larder {

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
    object.registerMethod(std::string(interfaceName), std::string(method.member),
                          std::string(method.inSignature), method.inNames,
                          std::string(method.outSignature), method.outNames,
                          [target, handler](sdbus::MethodCall call) {
                            try {
                              ((*target).*handler)(call);
                            } catch (const sdbus::Error& error) {
                              call.createErrorReply(error).send();
                            } catch (const std::exception& failure) {
                              call.createErrorReply(ServiceError::failed(failure.what())).send();
                            }
                          });
  }
}

}  // namespace larder
