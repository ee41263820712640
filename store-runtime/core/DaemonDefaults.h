#pragma once

#include <string_view>

namespace larder {

// The preference domains. The service's own also names its folder in the
// per-user caches, where the update queue keeps its file.
inline constexpr std::string_view kDaemonDefaultsID = "com.orvane.larderd";
// The store application's domain.
inline constexpr std::string_view kQuaymartDefaultsID = "com.orvane.quaymart";
// The platform's software update domain.
inline constexpr std::string_view kSoftwareUpdateDefaultsID = "com.orvane.SoftwareUpdate";

}  // namespace larder
