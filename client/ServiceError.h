#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include <sdbus-c++/Error.h>

#include "platform/error/VendError.h"

namespace larder {

// A failure of the service that is not a reply of its request table,
// answered at once with a named D-Bus error rather than left for the
// caller to time out. It is an sdbus::Error, so whoever answers a call
// turns it into the call's error reply by its name. The names and what
// they mean are the table below; docs/dbus.md lists them for clients.
class ServiceError : public sdbus::Error {
 public:
  static constexpr std::string_view kDomain = "com.orvane.larderd.Error";
  static constexpr std::string_view kNoStoreClient = "com.orvane.larderd.Error.NoStoreClient";
  static constexpr std::string_view kNotAvailable = "com.orvane.larderd.Error.NotAvailable";
  static constexpr std::string_view kFailed = "com.orvane.larderd.Error.Failed";
  static constexpr std::string_view kInvalidArguments = "com.orvane.larderd.Error.InvalidArguments";
  static constexpr std::string_view kUnknownRequest = "com.orvane.larderd.Error.UnknownRequest";
  static constexpr std::string_view kStopping = "com.orvane.larderd.Error.Stopping";

  // One registered name: its code in `kDomain` when it travels as a
  // VendError, and what it tells a client.
  struct Name {
    std::string_view name;
    std::int64_t code;
    std::string_view meaning;
  };
  static std::span<const Name> names();

  // The request needs the store client that the connection has not set.
  static ServiceError noStoreClient(std::string_view request);
  // The object that would answer the request is not part of this build.
  static ServiceError notAvailable(std::string_view request);
  // The work failed in a way it could not answer itself.
  static ServiceError failed(std::string_view why);
  // The arguments have the request's signature but not a value it accepts.
  static ServiceError invalidArguments(std::string_view why);
  // No request of that name on that interface.
  static ServiceError unknownRequest(std::string_view interfaceName, std::string_view member);
  // The service is stopping: the request was not and will not be done.
  static ServiceError stopping(std::string_view request);

  // Any D-Bus error as the one error type of the code that receives it:
  // a registered name becomes its code in `kDomain`; any other name is the
  // domain itself, with code 0. The description is the error's message.
  static VendError toVendError(const sdbus::Error& error);

 private:
  ServiceError(std::string_view name, const std::string& message);
};

}  // namespace larder
