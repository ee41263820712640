#include "client/ServiceClient.h"

#include <stdexcept>

#include "client/DBusValueCodec.h"
#include "client/DialogAgentProtocol.h"
#include "client/ServiceError.h"
#include "client/ServiceRequests.h"
#include "client/StoreRuntimeProtocol.h"
#include "platform/system/Environment.h"
#include "store-runtime/core/VendStoreClient.h"

namespace larder {

ServiceClient::ServiceClient(const std::string& serviceName, std::uint64_t timeoutMicroseconds)
    : ServiceClient(Environment::variable("LARDER_BUS") == "system"
                        ? sdbus::createSystemBusConnection()
                        : sdbus::createSessionBusConnection(),
                    serviceName, timeoutMicroseconds) {}

ServiceClient::ServiceClient(std::unique_ptr<sdbus::IConnection> connection,
                             const std::string& serviceName, std::uint64_t timeoutMicroseconds)
    : connection_(std::move(connection)),
      serviceName_(serviceName),
      proxy_(
          sdbus::createProxy(*connection_, serviceName, std::string(ServiceRequests::kObjectPath))),
      timeout_(timeoutMicroseconds) {
  connection_->enterEventLoopAsync();
}

void ServiceClient::presentStoreClient(std::int64_t clientType) {
  call("SetStoreClient", {VendStoreClient::initWithStoreClientType(clientType).toDictionary()});
  call("StartService", {});
}

PlistArray ServiceClient::call(const std::string& member, const PlistArray& arguments,
                               std::uint64_t timeoutMicroseconds) {
  const RequestSignature* request = ServiceRequests::find(member);
  if (!request) throw ServiceError::unknownRequest(ServiceRequests::kInterfaceName, member);
  sdbus::MethodCall message =
      proxy_->createMethodCall(std::string(ServiceRequests::kInterfaceName), member);
  DBusValueCodec::writeAll(message, request->inSignature, arguments);
  sdbus::MethodReply reply =
      proxy_->callMethod(message, timeoutMicroseconds != 0 ? timeoutMicroseconds : timeout_);
  return DBusValueCodec::readAll(reply, request->outSignature);
}

PlistArray ServiceClient::callDialogAgents(const std::string& member, const PlistArray& arguments,
                                           std::uint64_t timeoutMicroseconds) {
  const BusMethod* method = DialogAgentProtocol::findRegistryMethod(member);
  if (!method)
    throw ServiceError::unknownRequest(DialogAgentProtocol::kRegistryInterfaceName, member);
  return callMethod(DialogAgentProtocol::kRegistryInterfaceName, *method, arguments,
                    timeoutMicroseconds);
}

PlistArray ServiceClient::callStoreRuntime(const std::string& member, const PlistArray& arguments,
                                           std::uint64_t timeoutMicroseconds) {
  const BusMethod* method = StoreRuntimeProtocol::findMethod(member);
  if (!method) throw ServiceError::unknownRequest(StoreRuntimeProtocol::kInterfaceName, member);
  return callMethod(StoreRuntimeProtocol::kInterfaceName, *method, arguments, timeoutMicroseconds);
}

PlistArray ServiceClient::callMethod(std::string_view interfaceName, const BusMethod& method,
                                     const PlistArray& arguments,
                                     std::uint64_t timeoutMicroseconds) {
  sdbus::MethodCall message =
      proxy_->createMethodCall(std::string(interfaceName), std::string(method.member));
  DBusValueCodec::writeAll(message, method.inSignature, arguments);
  sdbus::MethodReply reply =
      proxy_->callMethod(message, timeoutMicroseconds != 0 ? timeoutMicroseconds : timeout_);
  return DBusValueCodec::readAll(reply, method.outSignature);
}

void ServiceClient::exportSoftwareMapObserver(
    const std::string& objectPath, std::function<void(const PlistValue&, std::int64_t)> onChange) {
  observer_ = sdbus::createObject(*connection_, objectPath);
  observer_->registerMethod(
      std::string(ServiceRequests::kCallbackInterfacePrefix) + "VendSoftwareMapObserver",
      "SoftwareProductUpdatedState", "a{sv}x", "",
      [onChange = std::move(onChange)](sdbus::MethodCall call) {
        PlistArray arguments = DBusValueCodec::readAll(call, "a{sv}x");
        onChange(arguments.at(0), arguments.at(1).int64Value());
        DBusValueCodec::reply(call, "", {});
      });
  observer_->finishRegistration();
}

}  // namespace larder
