#pragma once

#include <string_view>

namespace larder {

// The service's own preference domain. It also names the service's folder
// in the per-user caches, where the update queue keeps its file.
inline constexpr std::string_view kDaemonDefaultsID = "com.orvane.larderd";

}  // namespace larder
