#include "client/ServiceClient.h"

#include <stdexcept>

#include "client/BusFailureText.h"
#include "client/DBusValueCodec.h"
#include "client/DialogAgentProtocol.h"
#include "client/NotificationsProtocol.h"
#include "client/ServiceError.h"
#include "client/ServiceRequests.h"
#include "client/StoreRuntimeProtocol.h"
#include "platform/system/Environment.h"
#include "store-runtime/core/VendStoreClient.h"

namespace larder {

namespace {

bool wantsSystemBus() {
  return Environment::variable("LARDER_BUS") == "system";
}

std::unique_ptr<sdbus::IConnection> openBus() {
  try {
    return wantsSystemBus() ? sdbus::createSystemBusConnection()
                            : sdbus::createSessionBusConnection();
  } catch (const sdbus::Error& error) {
    throw sdbus::Error(
        error.getName(),
        BusFailureText::forConnection(error.getMessage(), wantsSystemBus() ? "system" : "session"));
  }
}

}  // namespace

ServiceClient::ServiceClient(const std::string& serviceName, std::uint64_t timeoutMicroseconds)
    : ServiceClient(openBus(), serviceName, timeoutMicroseconds) {
  busName_ = wantsSystemBus() ? "system" : "session";
}

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
  return callMethod(ServiceRequests::kInterfaceName,
                    BusMethod{request->member, request->inSignature, {}, request->outSignature, {}},
                    arguments, timeoutMicroseconds);
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

PlistArray ServiceClient::callNotifications(const std::string& member, const PlistArray& arguments,
                                            std::uint64_t timeoutMicroseconds) {
  const BusMethod* method = NotificationsProtocol::findMethod(member);
  if (!method) throw ServiceError::unknownRequest(NotificationsProtocol::kInterfaceName, member);
  return callMethod(NotificationsProtocol::kInterfaceName, *method, arguments, timeoutMicroseconds);
}

PlistArray ServiceClient::callMethod(std::string_view interfaceName, const BusMethod& method,
                                     const PlistArray& arguments,
                                     std::uint64_t timeoutMicroseconds) {
  const std::uint64_t timeout = timeoutMicroseconds != 0 ? timeoutMicroseconds : timeout_;
  sdbus::MethodCall message =
      proxy_->createMethodCall(std::string(interfaceName), std::string(method.member));
  DBusValueCodec::writeAll(message, method.inSignature, arguments);
  try {
    sdbus::MethodReply reply = proxy_->callMethod(message, timeout);
    return DBusValueCodec::readAll(reply, method.outSignature);
  } catch (const sdbus::Error& error) {
    const BusFailureText::Call call{serviceName_, busName_, method.member,
                                    static_cast<double>(timeout) / 1e6};
    throw sdbus::Error(error.getName(),
                       BusFailureText::forCall(error.getName(), error.getMessage(), call));
  }
}

void ServiceClient::exportCallbackObject(const std::string& objectPath, std::string_view protocol,
                                         std::string_view member, std::string_view signature,
                                         std::function<void(const PlistArray&)> onCall) {
  auto object = sdbus::createObject(*connection_, objectPath);
  object->registerMethod(
      std::string(ServiceRequests::kCallbackInterfacePrefix) + std::string(protocol),
      std::string(member), std::string(signature), "",
      [signature = std::string(signature), onCall = std::move(onCall)](sdbus::MethodCall call) {
        PlistArray arguments = DBusValueCodec::readAll(call, signature);
        onCall(arguments);
        DBusValueCodec::reply(call, "", {});
      });
  object->finishRegistration();
  objects_.push_back(std::move(object));
}

void ServiceClient::exportSoftwareMapObserver(
    const std::string& objectPath, std::function<void(const PlistValue&, std::int64_t)> onChange) {
  exportCallbackObject(objectPath, "VendSoftwareMapObserver", "SoftwareProductUpdatedState",
                       "a{sv}x", [onChange = std::move(onChange)](const PlistArray& arguments) {
                         onChange(arguments.at(0), arguments.at(1).int64Value());
                       });
}

void ServiceClient::watchSignal(std::string_view interfaceName, std::string_view member,
                                std::string_view signature,
                                std::function<void(const PlistArray&)> onSignal) {
  const std::string rule = "type='signal',sender='" + serviceName_ + "',interface='" +
                           std::string(interfaceName) + "',member='" + std::string(member) + "'";
  matches_.push_back(connection_->addMatch(
      rule,
      [signature = std::string(signature), onSignal = std::move(onSignal)](sdbus::Message& signal) {
        PlistArray values;
        try {
          values = DBusValueCodec::readAll(signal, signature);
        } catch (const sdbus::Error&) {
          return;  // not what the service sends: nothing to tell
        }
        onSignal(values);
      }));
}

void ServiceClient::watchDownloadEndings(
    std::function<void(const PlistValue&, bool, const PlistValue&)> onEnded) {
  watchSignal(StoreRuntimeProtocol::kInterfaceName, StoreRuntimeProtocol::kDownloadEndedSignal,
              StoreRuntimeProtocol::kDownloadEndedSignature,
              [onEnded = std::move(onEnded)](const PlistArray& values) {
                onEnded(values.at(0), values.at(1).boolValue(), values.at(2));
              });
}

void ServiceClient::watchServiceOwner(std::function<void(bool)> onChange) {
  const std::string rule =
      "type='signal',sender='org.freedesktop.DBus',interface='org.freedesktop.DBus',"
      "member='NameOwnerChanged',path='/org/freedesktop/DBus',arg0='" +
      serviceName_ + "'";
  matches_.push_back(
      connection_->addMatch(rule, [onChange = std::move(onChange)](sdbus::Message& signal) {
        std::string name;
        std::string oldOwner;
        std::string newOwner;
        signal >> name >> oldOwner >> newOwner;
        onChange(!newOwner.empty());
      }));
}

}  // namespace larder
