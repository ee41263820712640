#pragma once

#include <functional>
#include <span>
#include <string>
#include <string_view>

#include "platform/plist/PlistValue.h"

namespace larder {

class AssetServiceInterface;

// The reply of one request: its out arguments in order. A request that was
// sent without wanting a reply gets an empty handler.
using ReplyHandler = std::function<void(PlistArray outArguments)>;

// What a request does when the object it needs is not there.
enum class WithoutTarget {
  kNothing,     // no reply arguments: nothing to do
  kEmptyReply,  // the request answers with the empty value of each argument
  // The reply belonged to the target: a caller that waits for one gets the
  // NotAvailable error instead of its timeout.
  kErrorReply,
};

// One row of the service's request table.
struct RequestDescriptor {
  std::string_view selector;      // keyword name of the request
  std::string_view member;        // its D-Bus method name
  std::string_view inSignature;   // D-Bus signature of the arguments
  std::string_view outSignature;  // D-Bus signature of the reply
  std::string_view inNames;       // argument names, comma separated
  std::string_view outNames;      // reply argument names, comma separated
  // Direct requests run on the delivering thread instead of the
  // connection's request queue.
  bool direct = false;
  // Null for requests whose target is not part of this build; they behave
  // as `withoutTarget` says. A handler that does only the part of a request
  // this build has may come with `kErrorReply` for the rest.
  void (*handler)(AssetServiceInterface&, const PlistArray&, const ReplyHandler&) = nullptr;
  WithoutTarget withoutTarget = WithoutTarget::kNothing;
};

class RequestTable {
 public:
  static constexpr std::string_view kInterfaceName = "com.orvane.larderd.AssetService";
  static constexpr std::string_view kObjectPath = "/com/orvane/larderd";
  static constexpr std::string_view kCallbackInterfacePrefix = "com.orvane.larderd.";

  static std::span<const RequestDescriptor> requests();
  static const RequestDescriptor* find(std::string_view member);

  // Runs `request` against `interface`: its handler, or the behaviour for
  // a missing target. Throws `ServiceError` for a request that wants a reply
  // it cannot have; one sent without wanting a reply never throws it.
  static void perform(const RequestDescriptor& request, AssetServiceInterface& interface,
                      const PlistArray& arguments, const ReplyHandler& reply);

  // Introspection XML of the service interface and the callback
  // interfaces, as committed in data/dbus.
  static std::string introspectionXml();
};

}  // namespace larder
