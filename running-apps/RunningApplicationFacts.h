#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace larder {

// The desktop facts that this platform simulates, for tests and for
// larderctl: "<root>/var/lib/larder-platform/running-applications.plist".
//   foremost           string: bundle identifier of the application in front
//   quittingLosesData  dictionary: bundle identifier -> reason
//   stopped, proxied   arrays of bundle identifiers: the two states in which
//                      an application is terminated by force
class RunningApplicationFacts {
 public:
  static constexpr std::string_view kFileName = "running-applications.plist";

  static std::optional<std::string> foremost();
  static bool setForemost(const std::optional<std::string>& bundleIdentifier);
  static std::optional<std::string> quittingLosesData(std::string_view bundleIdentifier);
  // nullopt removes the entry.
  static bool setQuittingLosesData(std::string_view bundleIdentifier,
                                   const std::optional<std::string>& reason);
  static bool isStopped(std::string_view bundleIdentifier);
  static bool setStopped(std::string_view bundleIdentifier, bool stopped);
  static bool isProxied(std::string_view bundleIdentifier);
  static bool setProxied(std::string_view bundleIdentifier, bool proxied);
};

}  // namespace larder
