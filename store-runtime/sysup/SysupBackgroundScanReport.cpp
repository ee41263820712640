#include "store-runtime/sysup/SysupBackgroundScanReport.h"

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "SysupBackgroundScanReport";

// Runs a scan as the agent does (no prerelease updates) and waits for its end.
OptionalError scanAndWait(SysupQuaymartUpdateController& controller) {
  auto finished = std::make_shared<DispatchSemaphore>();
  auto outcome = std::make_shared<OptionalError>();
  controller.startScanningForUpdatesIncludingPrerelease(
      false, false, false, nullptr, nullptr, [finished, outcome](const OptionalError& error) {
        *outcome = error;
        finished->signal();
      });
  finished->wait();
  return *outcome;
}

void addCriticalUpdates(SysupQuaymartUpdateController& controller, PlistDictionary& report) {
  SysupQuaymartUpdateController::UpdateList critical = controller.availableUpdates();
  std::erase_if(critical, [](const SysupQuaymartUpdate& update) { return !update.isCritical(); });
  report[std::string(SysupBackgroundScanReport::kCriticalUpdatesCountKey)] =
      static_cast<std::int64_t>(critical.size());
  report[std::string(SysupBackgroundScanReport::kCriticalUpdatesRequireRestartKey)] =
      !critical.empty() && controller.actionRequiredForUpdates(critical) != 0;
}

void addUpdatesToPerformLater(SysupQuaymartUpdateController& controller, PlistDictionary& report) {
  PlistArray keys;
  for (const SysupQuaymartUpdate& update : controller.updatesToBeInstalledLater()) {
    keys.emplace_back(update.productKey());
  }
  if (!keys.empty()) {
    report[std::string(SysupBackgroundScanReport::kUpdatesToPerformLaterKey)] = std::move(keys);
  }
}

}  // namespace

PlistDictionary SysupBackgroundScanReport::composeReport(
    SysupQuaymartUpdateController& controller) {
  PlistDictionary report;
  if (OptionalError error = scanAndWait(controller)) {
    // A count from a failed scan would be stale; the rest is still true.
    TILL_LOG(1, "%@: Background scan failed: %@", kSpeaker, error->descriptionText());
  } else {
    addCriticalUpdates(controller, report);
  }
  addUpdatesToPerformLater(controller, report);
  PlistDictionary installed = controller.takePostLogoutResults();
  if (!installed.empty()) {
    report[std::string(kPostLogoutUpdatesInstalledKey)] = std::move(installed);
  }
  TILL_LOG(2, "%@: Composed a report of %zu keys", kSpeaker, report.size());
  return report;
}

}  // namespace larder
