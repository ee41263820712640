#pragma once

#include <string>
#include <string_view>

namespace larder {

// What a client tells a person when the service cannot be reached or did
// not answer: what failed, with what, and what to do next where there is
// something to do. One line, without a program name in front.
class BusFailureText {
 public:
  struct Call {
    std::string_view serviceName;  // "com.orvane.larderd"
    std::string_view busName;      // "session" or "system"
    std::string_view member;       // the method called
    double timeoutSeconds = 0;
  };

  // A D-Bus error answered to a call, by its error name and message.
  static std::string forCall(std::string_view errorName, std::string_view message,
                             const Call& call);
  // The bus itself could not be opened.
  static std::string forConnection(std::string_view message, std::string_view busName);
};

}  // namespace larder
