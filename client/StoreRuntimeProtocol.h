#pragma once

#include <span>
#include <string_view>

#include "client/BusMethod.h"

namespace larder {

// "com.orvane.larderd.StoreRuntime" on the service object: the store
// runtime's accounts, purchases and downloads for tools and scripts.
class StoreRuntimeProtocol {
 public:
  static constexpr std::string_view kInterfaceName = "com.orvane.larderd.StoreRuntime";
  // Sent when a download that `Purchase` started has ended either way: the
  // download (with "installedPath" after an install), success, the error.
  static constexpr std::string_view kDownloadEndedSignal = "DownloadEnded";
  static constexpr std::string_view kDownloadEndedSignature = "a{sv}ba{sv}";

  static std::span<const BusMethod> methods();
  static const BusMethod* findMethod(std::string_view member);
};

}  // namespace larder
