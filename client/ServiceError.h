#pragma once

#include <stdexcept>
#include <string>
#include <string_view>

namespace larder {

// A request that the service cannot serve, answered at once with a named
// D-Bus error rather than left for the caller to time out. A request's
// work throws it; the listener turns it into the call's error reply. The
// names are listed in docs/dbus.md.
class ServiceError : public std::runtime_error {
 public:
  static constexpr std::string_view kNoStoreClient = "com.orvane.larderd.Error.NoStoreClient";
  static constexpr std::string_view kNotAvailable = "com.orvane.larderd.Error.NotAvailable";
  static constexpr std::string_view kFailed = "com.orvane.larderd.Error.Failed";

  // The request needs the store client that the connection has not set.
  static ServiceError noStoreClient(std::string_view request);
  // The object that would answer the request is not part of this build.
  static ServiceError notAvailable(std::string_view request);
  // The work failed in a way it could not answer itself.
  static ServiceError failed(std::string_view why);

  [[nodiscard]] const std::string& name() const { return name_; }

 private:
  ServiceError(std::string_view name, const std::string& message);

  std::string name_;
};

}  // namespace larder
