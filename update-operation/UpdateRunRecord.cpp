#include "update-operation/UpdateRunRecord.h"

#include <cstdio>

namespace larder {

namespace {

constexpr std::string_view kVendorPrefix = "com.orvane.";

const char* yesOrNo(bool value) {
  return value ? "yes" : "no";
}

void appendVendorIdentifier(std::string& text, std::string_view identifier) {
  if (!UpdateRunRecord::isVendorIdentifier(identifier)) return;
  if (!text.empty()) text += ", ";
  text += identifier;
}

}  // namespace

UpdateRunRecord::UpdateRunRecord(bool userInitiated, bool nowIsLater, bool isTimeToAutoUpdate,
                                 bool isTimeToStage)
    : record_{{"user_initiated", yesOrNo(userInitiated)},
              {"now_is_later", yesOrNo(nowIsLater)},
              {"is_time_to_autoupdate_and_notify", yesOrNo(isTimeToAutoUpdate)},
              {"is_time_to_stage", yesOrNo(isTimeToStage)}} {}

bool UpdateRunRecord::isVendorIdentifier(std::string_view identifier) {
  return identifier.starts_with(kVendorPrefix);
}

std::string UpdateRunRecord::bundleIDsString(const std::vector<LedgerUpdateRef>& updates) {
  std::string text;
  for (const LedgerUpdateRef& update : updates) {
    if (update && update->bundleID()) appendVendorIdentifier(text, *update->bundleID());
  }
  return text;
}

std::string UpdateRunRecord::bundleIDsString(const std::vector<std::string>& bundleIdentifiers) {
  std::string text;
  for (const std::string& identifier : bundleIdentifiers) appendVendorIdentifier(text, identifier);
  return text;
}

std::string UpdateRunRecord::productKeysString(const std::vector<SysupQuaymartUpdate>& updates) {
  std::string text;
  for (const SysupQuaymartUpdate& update : updates)
    appendVendorIdentifier(text, update.productKey());
  return text;
}

template <typename List>
void UpdateRunRecord::setList(std::string_view key, const std::string& text, const List& list) {
  record_[std::string(key)] = text;
  record_[std::string(key) + "_count"] = static_cast<std::int64_t>(list.size());
}

void UpdateRunRecord::setAvailable(const std::vector<LedgerUpdateRef>& appUpdates,
                                   const std::vector<SysupQuaymartUpdate>& osUpdates) {
  setList("app_updates_available", bundleIDsString(appUpdates), appUpdates);
  setList("os_updates_available", productKeysString(osUpdates), osUpdates);
}

void UpdateRunRecord::setToInstall(const std::vector<LedgerUpdateRef>& appUpdates,
                                   const std::vector<SysupQuaymartUpdate>& osUpdates,
                                   const std::vector<std::string>& appUpdatesLater,
                                   const std::vector<SysupQuaymartUpdate>& osUpdatesLater) {
  setList("app_updates_to_install", bundleIDsString(appUpdates), appUpdates);
  setList("os_updates_to_install", productKeysString(osUpdates), osUpdates);
  setList("app_updates_to_install_later", bundleIDsString(appUpdatesLater), appUpdatesLater);
  setList("os_updates_to_install_later", productKeysString(osUpdatesLater), osUpdatesLater);
}

void UpdateRunRecord::finish(bool willRestart,
                             const std::vector<SysupQuaymartUpdate>& osUpdatesOnRestart,
                             Clock::time_point startDate, bool cancelled,
                             std::int64_t thermalEmergencies) {
  record_["will_restart"] = yesOrNo(willRestart);
  record_["os_updates_to_install_on_restart"] = productKeysString(osUpdatesOnRestart);
  const double elapsed = std::chrono::duration<double>(Clock::now() - startDate).count();
  char seconds[32];
  std::snprintf(seconds, sizeof seconds, "%.0f", elapsed);
  record_["elapsed_time"] = std::string(seconds);
  record_["result"] = cancelled ? "fail" : "pass";
  record_["dimwake_thermal_emergency_count"] = thermalEmergencies;
}

}  // namespace larder
