#pragma once

#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

class SysupQuaymartUpdateController;

// What the software update agent tells the service after its background
// scan (the argument of SoftwareUpdateDidFinishBackgroundScanWithInfo). A
// key with nothing to say is left out:
//
//   criticalUpdatesCount           int64  available updates marked critical
//                                         (left out when the scan fails)
//   criticalUpdatesRequireRestart  bool   whether one of those needs a
//                                         restart (with the count only)
//   osUpdatesToPerformLater        array  product keys of the later list,
//                                         when it is not empty
//   postLogoutUpdatesInstalled     dict   what the last logout installed
//                                         (product key -> { State,
//                                         InstalledLater }), taken from the
//                                         state so that it is told once
class SysupBackgroundScanReport {
 public:
  static constexpr std::string_view kCriticalUpdatesCountKey = "criticalUpdatesCount";
  static constexpr std::string_view kCriticalUpdatesRequireRestartKey =
      "criticalUpdatesRequireRestart";
  static constexpr std::string_view kUpdatesToPerformLaterKey = "osUpdatesToPerformLater";
  static constexpr std::string_view kPostLogoutUpdatesInstalledKey = "postLogoutUpdatesInstalled";

  // Runs a scan, waits for it to finish and composes the report.
  static PlistDictionary composeReport(SysupQuaymartUpdateController& controller);
};

}  // namespace larder
