#pragma once

#include <cstdint>
#include <functional>

#include <memory>
#include <string>
#include <string_view>
#include <vector>
#include "client/BusMethod.h"

#include <sdbus-c++/IConnection.h>
#include <sdbus-c++/IObject.h>
#include <sdbus-c++/IProxy.h>

#include "platform/value/PlistValue.h"

namespace larder {

// A client's side of the bus (larderctl, tests): calls requests of the service by their
// D-Bus name with property-list arguments, and exports callback objects.
class ServiceClient {
 public:
  ServiceClient(const std::string& serviceName, std::uint64_t timeoutMicroseconds);
  // On a given connection, for instance to a bus at a private address.
  ServiceClient(std::unique_ptr<sdbus::IConnection> connection, const std::string& serviceName,
                std::uint64_t timeoutMicroseconds);

  // Presents a store client of that type, as every client does first.
  void presentStoreClient(std::int64_t clientType);

  // Calls `member`; the reply's arguments in order. Throws sdbus::Error on
  // a D-Bus error, by its name, with a message for a person (what failed,
  // with what, what to do: see BusFailureText), and ServiceError
  // (UnknownRequest) for a member the client does not know, without
  // sending anything.
  // A timeout of 0 is the client's.
  PlistArray call(const std::string& member, const PlistArray& arguments,
                  std::uint64_t timeoutMicroseconds = 0);
  // The same for the dialog agent registry (RegisterDialogAgent,
  // UnregisterDialogAgent, DisplayDialog); a timeout of 0 is the client's.
  PlistArray callDialogAgents(const std::string& member, const PlistArray& arguments,
                              std::uint64_t timeoutMicroseconds = 0);
  // The same for the store runtime (SignIn, Purchase, Downloads, ...).
  PlistArray callStoreRuntime(const std::string& member, const PlistArray& arguments,
                              std::uint64_t timeoutMicroseconds = 0);
  // The same for the delivered notifications (DeliveredNotifications,
  // ActivateNotification).
  PlistArray callNotifications(const std::string& member, const PlistArray& arguments,
                               std::uint64_t timeoutMicroseconds = 0);

  // Exports an object at `objectPath` that answers the one method `member`
  // of a callback protocol (the interface kCallbackInterfacePrefix +
  // `protocol`) and hands the arguments of every call to `onCall`, on the
  // client's bus thread.
  void exportCallbackObject(const std::string& objectPath, std::string_view protocol,
                            std::string_view member, std::string_view signature,
                            std::function<void(const PlistArray&)> onCall);
  // Hands the values of every signal `member` of `interfaceName` that the
  // service sends to `onSignal`, on the client's bus thread.
  void watchSignal(std::string_view interfaceName, std::string_view member,
                   std::string_view signature, std::function<void(const PlistArray&)> onSignal);

  // Exports a software map observer at `objectPath` that hands every
  // callback to `onChange`.
  void exportSoftwareMapObserver(const std::string& objectPath,
                                 std::function<void(const PlistValue&, std::int64_t)> onChange);

  // Hands every download the service reports ended (see
  // StoreRuntimeProtocol::kDownloadEndedSignal) to `onEnded`, on the
  // client's bus thread: the download, success, the error dictionary.
  void watchDownloadEndings(
      std::function<void(const PlistValue& download, bool success, const PlistValue& error)>
          onEnded);
  // Tells `onChange` each time the service's name gains an owner (true: the
  // service started again) or loses it (false), on the client's bus thread.
  void watchServiceOwner(std::function<void(bool present)> onChange);

  sdbus::IConnection& connection() { return *connection_; }
  [[nodiscard]] const std::string& serviceName() const { return serviceName_; }

 private:
  PlistArray callMethod(std::string_view interfaceName, const BusMethod& method,
                        const PlistArray& arguments, std::uint64_t timeoutMicroseconds);

  std::unique_ptr<sdbus::IConnection> connection_;
  std::string serviceName_;
  std::string busName_ = "session";
  std::unique_ptr<sdbus::IProxy> proxy_;
  std::vector<std::unique_ptr<sdbus::IObject>> objects_;
  std::vector<sdbus::Slot> matches_;
  std::uint64_t timeout_;
};

}  // namespace larder
