#pragma once

#include <atomic>
#include <string>
#include <string_view>

#include <sdbus-c++/Error.h>
#include <sdbus-c++/Message.h>

#include "platform/value/PlistValue.h"

namespace larder {

// A call the service has taken and not yet answered. It is answered at
// most once, whoever comes first: the request's reply, its failure, or a
// stop of the service that answers every call still open.
//
// No lock is held while an answer is sent: the bus library runs the
// service's method handlers under its own lock, so a handler waiting for a
// lock that a sending thread holds would close a cycle. Whoever wins
// `answered_` is the only thread that touches the call afterwards.
class PendingCall {
 public:
  PendingCall(sdbus::MethodCall call, std::string_view member);
  PendingCall(const PendingCall&) = delete;
  PendingCall& operator=(const PendingCall&) = delete;

  [[nodiscard]] bool expectsReply() const { return expectsReply_; }
  [[nodiscard]] std::string_view member() const { return member_; }
  [[nodiscard]] const std::string& sender() const { return sender_; }
  [[nodiscard]] bool isAnswered() const { return answered_.load(std::memory_order_acquire); }

  // The call's arguments read by `signature`; throws as DBusValueCodec.
  // Only before the call is shared with another thread.
  PlistArray readArguments(std::string_view signature);

  // The reply, its values written by `signature`. False if the call was
  // answered already or wants no answer.
  bool reply(std::string_view signature, const PlistArray& values);
  bool fail(const sdbus::Error& error);

 private:
  bool takeAnswer();
  void sendError(const sdbus::Error& error);

  const bool expectsReply_;
  const std::string_view member_;
  const std::string sender_;
  sdbus::MethodCall call_;
  std::atomic<bool> answered_{false};
};

}  // namespace larder
