#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/error/VendError.h"
#include "platform/value/PlistValue.h"

namespace larder {

// A hold on the plug-ins of one application bundle: while it lasts, none of
// them may start. Released with PlugInHost::releaseHold.
class PlugInHold {
 public:
  PlugInHold(std::string identifier, std::string bundlePath)
      : identifier_(std::move(identifier)), bundlePath_(std::move(bundlePath)) {}
  [[nodiscard]] const std::string& identifier() const { return identifier_; }
  [[nodiscard]] const std::string& bundlePath() const { return bundlePath_; }

 private:
  std::string identifier_;
  std::string bundlePath_;
};

// The service that runs plug-ins (extensions that applications carry in
// their bundles) on behalf of host applications. This platform has none; its
// state is simulated in "<root>/var/lib/larder-platform/plugins.plist":
//   busy   array of dictionaries, one per plug-in process in use, with the
//          keys below and kServicePidKey
//   holds  dictionary hold identifier -> { bundlePath, date }
class PlugInHost {
 public:
  static constexpr std::string_view kFileName = "plugins.plist";

  static constexpr std::string_view kPlugInBundleIdentifierKey = "plugInIdentifier";
  static constexpr std::string_view kPlugInPathKey = "plugInPath";
  static constexpr std::string_view kContainingIdentifierKey = "containingIdentifier";
  static constexpr std::string_view kContainingPathKey = "containingPath";
  static constexpr std::string_view kHostBundleIdentifierKey = "hostIdentifier";
  static constexpr std::string_view kHostPathKey = "hostPath";
  static constexpr std::string_view kServicePidKey = "service-pid";
  // User info key of a hold error: the busy entries that refused it.
  static constexpr std::string_view kErrorKeyBusyPlugIns = "BusyPlugIns";
  static constexpr std::string_view kErrorDomain = "PlugInHostErrorDomain";
  static constexpr std::int64_t kBusyErrorCode = 1;

  // The extension point of file browser extensions, which never keep an
  // application from being replaced.
  static constexpr std::string_view kFileBrowserExtensionPoint = "com.orvane.FilewalkerSync";

  using HoldHandler =
      std::function<void(std::shared_ptr<PlugInHold> hold, std::optional<VendError> error)>;

  // Answers on another thread: with a hold, or, when a busy plug-in lives
  // in that bundle, with an error whose user info has those busy entries
  // under kErrorKeyBusyPlugIns.
  static void holdPlugInsInApplication(std::string bundlePath, HoldHandler handler);
  static void releaseHold(const std::shared_ptr<PlugInHold>& hold);
  // The busy entry of that plug-in process; empty when there is none.
  static PlistDictionary informationForPlugInWithPid(pid_t pid);
  // The bundles that hold a plug-in in use right now, each once.
  static std::vector<std::string> containingPathsOfBusyPlugIns();

  // The extension point of the plug-in bundle at `plugInPath`, from
  // "HostExtension" -> "HostExtensionPointIdentifier" of its bundle.plist.
  static std::optional<std::string> extensionPointOfPlugIn(const std::string& plugInPath);

  // The simulated state, for tests and larderctl.
  static bool addBusyPlugIn(PlistDictionary entry);
  static bool removeAllBusyPlugIns();
  static PlistDictionary holds();
};

}  // namespace larder
