#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "platform/error/Result.h"

namespace sdbus {
class IConnection;
}

namespace larder {

// polkit's authority (org.freedesktop.PolicyKit1) on the connection it is
// given: whether this process may perform an action. The subject is this
// process ("unix-process" with its pid and start time), so polkit judges
// the session the service runs for.
class PolkitAuthority {
 public:
  static constexpr const char* kServiceName = "org.freedesktop.PolicyKit1";
  static constexpr const char* kObjectPath = "/org/freedesktop/PolicyKit1/Authority";
  static constexpr const char* kInterface = "org.freedesktop.PolicyKit1.Authority";
  // CheckAuthorization's flag that lets polkit ask the user.
  static constexpr std::uint32_t kAllowUserInteraction = 1;

  struct Answer {
    bool authorized = false;
    // polkit would say yes once the user authenticates.
    bool challenge = false;
    // The user closed polkit's dialog.
    bool dismissed = false;
  };

  explicit PolkitAuthority(std::unique_ptr<sdbus::IConnection> connection);
  ~PolkitAuthority();
  PolkitAuthority(const PolkitAuthority&) = delete;
  PolkitAuthority& operator=(const PolkitAuthority&) = delete;

  // Whether someone owns polkit's name on the bus of `connection`.
  static bool isPresent(sdbus::IConnection& connection);

  // CheckAuthorization of `action` for this process; with `interactive`
  // polkit may ask the user, and the call waits for the answer. Not being
  // authorized is an answer; an error is a failed call.
  Result<Answer> checkAuthorization(const std::string& action, bool interactive);

 private:
  std::unique_ptr<sdbus::IConnection> connection_;
};

}  // namespace larder
