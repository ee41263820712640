#pragma once

namespace larder {

// How larderd is started and under which names it serves: read by main and
// by the writer of its manual page, so that the two cannot disagree.
struct ServiceEntry {
  // The one argument there is; any other means no argument.
  static constexpr const char* kDaemonArgument = "daemon";
  static constexpr const char* kServiceName = "com.orvane.larderd";
  static constexpr const char* kDaemonServiceName = "com.orvane.larderd.daemon";
  static constexpr const char* kProfileName = "com.orvane.larderd";
};

}  // namespace larder
