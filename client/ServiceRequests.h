#pragma once

#include <span>
#include <string>
#include <string_view>

namespace larder {

// One request of the service as a client sees it on the bus.
struct RequestSignature {
  std::string_view selector;      // keyword name of the request
  std::string_view member;        // its D-Bus method name
  std::string_view inSignature;   // D-Bus signature of the arguments
  std::string_view outSignature;  // D-Bus signature of the reply
  std::string_view inNames;       // argument names, comma separated
  std::string_view outNames;      // reply argument names, comma separated
};

// One method of a callback interface that a client exports for the
// service to call (observers, update delegates). Callbacks never wait for
// an answer.
struct CallbackSignature {
  std::string_view interface;  // below kCallbackInterfacePrefix
  std::string_view member;
  std::string_view signature;
  std::string_view names;
};

// The requests of the service interface and the callbacks it makes: what
// both sides of the bus must agree on. The service adds what each request
// does; clients need only this.
class ServiceRequests {
 public:
  static constexpr std::string_view kInterfaceName = "com.orvane.larderd.AssetService";
  static constexpr std::string_view kObjectPath = "/com/orvane/larderd";
  static constexpr std::string_view kCallbackInterfacePrefix = "com.orvane.larderd.";

  static std::span<const RequestSignature> all();
  static const RequestSignature* find(std::string_view member);
  static std::span<const CallbackSignature> callbacks();

  // Introspection XML of the service interface and the callback
  // interfaces, as committed in data/dbus.
  static std::string introspectionXml();
};

}  // namespace larder
