#pragma once

#include <string>
#include <string_view>
#include <vector>

#include <sdbus-c++/Message.h>

#include "platform/value/PlistValue.h"

namespace larder {

// Moves property-list values in and out of D-Bus messages, driven by the
// D-Bus signature of each argument. Records and dictionaries travel as
// a{sv}; values inside variants take their natural signature (see
// `naturalSignature`), except that the uint64 fields of records
// (identifiers, tokens, sizes: see docs/dbus.md) go as `t`. An absent value is written as the empty
// value of the signature: "" for a string, 0, false, an empty container.
class DBusValueCodec {
 public:
  // Deepest nesting accepted from a peer; deeper input is refused.
  static constexpr std::size_t kMaxDepth = 32;

  // The complete types of a signature: "sa{sv}x" gives "s", "a{sv}", "x".
  static std::vector<std::string> splitSignature(std::string_view signature);

  // Reads one complete type. Throws sdbus::Error on a message that does
  // not hold what the signature says or nests too deeply.
  static PlistValue read(sdbus::Message& message, std::string_view signature);
  static PlistArray readAll(sdbus::Message& message, std::string_view signature);

  static void write(sdbus::Message& message, std::string_view signature, const PlistValue& value);
  // Writes `values` in the order of the signature's types; missing values
  // are written absent.
  static void writeAll(sdbus::Message& message, std::string_view signature,
                       const PlistArray& values);

  // Sends the reply of `call` with `values` written by `signature`; nothing
  // for a call sent without wanting one. Throws sdbus::Error as writing and
  // sending do.
  static void reply(sdbus::MethodCall& call, std::string_view signature, const PlistArray& values);

  // s, b, x, t, d, ay, d (dates), av, a{sv}, t (UIDs).
  static std::string naturalSignature(const PlistValue& value);
};

}  // namespace larder
