#pragma once

#include <functional>
#include <span>
#include <string>
#include <string_view>

#include "client/ServiceRequests.h"
#include "platform/value/PlistValue.h"

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

using RequestHandler = void (*)(AssetServiceInterface&, const PlistArray&, const ReplyHandler&);

// What the service does with one request, keyed by its D-Bus member.
struct RequestHandling {
  std::string_view member;
  // Direct requests run on the delivering thread instead of the
  // connection's request queue.
  bool direct = false;
  // Null for requests whose target is not part of this build; they behave
  // as `withoutTarget` says. A handler that does only the part of a request
  // this build has may come with `kErrorReply` for the rest.
  RequestHandler handler = nullptr;
  WithoutTarget withoutTarget = WithoutTarget::kNothing;
};

// One row of the service's request table: the request as clients see it
// and what the service does with it.
struct RequestDescriptor : RequestSignature {
  bool direct = false;
  RequestHandler handler = nullptr;
  WithoutTarget withoutTarget = WithoutTarget::kNothing;
};

class RequestTable {
 public:
  // Every request of `ServiceRequests`, in its order, with its handling.
  static std::span<const RequestDescriptor> requests();
  static const RequestDescriptor* find(std::string_view member);

  // Runs `request` against `interface`: its handler, or the behaviour for
  // a missing target. Throws `ServiceError` for a request that wants a reply
  // it cannot have; one sent without wanting a reply never throws it.
  static void perform(const RequestDescriptor& request, AssetServiceInterface& interface,
                      const PlistArray& arguments, const ReplyHandler& reply);
};

}  // namespace larder
