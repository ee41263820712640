#include "AssetService/PendingCall.h"

#include "client/DBusValueCodec.h"
#include "client/ServiceError.h"
#include "platform/log/TillLogManager.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "ServiceListener";

}  // namespace

PendingCall::PendingCall(sdbus::MethodCall call, std::string_view member)
    : expectsReply_(!call.doesntExpectReply()),
      member_(member),
      sender_(call.getSender()),
      call_(std::move(call)) {}

PlistArray PendingCall::readArguments(std::string_view signature) {
  return DBusValueCodec::readAll(call_, signature);
}

bool PendingCall::takeAnswer() {
  return expectsReply_ && !answered_.exchange(true, std::memory_order_acq_rel);
}

bool PendingCall::reply(std::string_view signature, const PlistArray& values) {
  if (!takeAnswer()) return false;
  try {
    DBusValueCodec::reply(call_, signature, values);
  } catch (const sdbus::Error& failure) {
    // A reply the codec cannot write still answers the caller.
    TILL_LOG(1, "%@: reply to %@ not sent: %@", kSpeaker, member_, failure.getMessage());
    sendError(ServiceError::failed(failure.getMessage()));
  }
  return true;
}

bool PendingCall::fail(const sdbus::Error& error) {
  if (!takeAnswer()) return false;
  sendError(error);
  return true;
}

void PendingCall::sendError(const sdbus::Error& error) {
  try {
    call_.createErrorReply(error).send();
  } catch (const sdbus::Error& failure) {
    TILL_LOG(2, "%@: Error answer to %@ not delivered: %@", kSpeaker, call_.getSender(),
             failure.getMessage());
  }
}

}  // namespace larder
