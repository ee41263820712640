// The audit of a run's decisions and the message traces of its outcomes.
// Traces name only the vendor's own software.
#include "platform/log/TillLogManager.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/host/LedgerTraceMessage.h"
#include "update-operation/UpdateOperation.h"
#include "update-operation/UpdateRunRecord.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateOperation";
constexpr std::string_view kAppTraceDomain = "com.orvane.Quaymart.autoupdate.app";
constexpr std::string_view kOSTraceDomain = "com.orvane.Quaymart.autoupdate.osupdate";

const char* powerState() {
  return LedgerIsDimWake() ? "wake" : "on";
}

void putAbortTexts(PlistDictionary& entry, const UpdateAbort& abort) {
  entry["abortCode"] = abort.code;
  if (abort.reason) entry["abortReason"] = *abort.reason;
}

// Codes whose bundle identifier the trace names, in the vendor's case.
bool namesBundle(std::int64_t code) {
  return code == UpdateOperation::kAbortImmortal || code == UpdateOperation::kAbortForemost ||
         code == UpdateOperation::kAbortPlugInsInUse;
}

std::string tracedBundleID(const std::optional<std::string>& identifier) {
  if (!identifier || identifier->empty()) return "No bundle ID";
  return UpdateRunRecord::isVendorIdentifier(*identifier) ? *identifier : "Third Party App";
}

}  // namespace

void UpdateOperation::auditAppUpdate(std::uint64_t itemIdentifier, bool shouldInstall,
                                     const UpdateAbort& abort) {
  if (itemIdentifier == 0) return;
  PlistDictionary entry{{"itemIdentifier", std::to_string(itemIdentifier)},
                        {"shouldInstall", shouldInstall}};
  putAbortTexts(entry, abort);
  if (abort.appName) entry["abortAppName"] = *abort.appName;
  MutexLock lock(settingsMutex_);
  PlistValue& updates = auditInfo_["appUpdates"];
  if (!updates.isDictionary()) updates = PlistDictionary();
  (*updates.dictionary())[std::to_string(itemIdentifier)] = std::move(entry);
}

void UpdateOperation::auditOSUpdate(const SysupQuaymartUpdate& update, bool shouldInstall,
                                    const UpdateAbort& abort) {
  if (update.productKey().empty()) return;
  PlistDictionary entry{{"productKey", update.productKey()}, {"shouldInstall", shouldInstall}};
  putAbortTexts(entry, abort);
  if (abort.bundleID) entry["abortBundleID"] = *abort.bundleID;
  if (abort.appNames) {
    PlistArray names;
    for (const std::string& name : *abort.appNames) names.emplace_back(name);
    entry["abortAppNames"] = std::move(names);
  }
  MutexLock lock(settingsMutex_);
  PlistValue& updates = auditInfo_["osUpdates"];
  if (!updates.isDictionary()) updates = PlistDictionary();
  (*updates.dictionary())[update.productKey()] = std::move(entry);
}

void UpdateOperation::logAppAutoUpdateAbort(const UpdateAbort& abort,
                                            const std::string& bundleIdentifier,
                                            std::uint64_t itemIdentifier) const {
  TILL_LOG(1, "%@: Aborting auto-update of %@ (%llu) because %@", kSpeaker, bundleIdentifier,
           itemIdentifier, abort.reason);
  messageTraceAppAutoUpdate(false, abort.code, std::nullopt, bundleIdentifier, itemIdentifier);
}

void UpdateOperation::messageTraceAppAutoUpdate(bool success, std::int64_t abortCode,
                                                const OptionalError& error,
                                                const std::string& bundleIdentifier,
                                                std::uint64_t itemIdentifier) const {
  const bool named = !success && UpdateRunRecord::isVendorIdentifier(bundleIdentifier);
  PlistDictionary trace{
      {"bundle_id", named ? bundleIdentifier : std::string("Third Party App")},
      {"ware_id", named ? itemIdentifier : std::uint64_t{0}},
      {"result", success ? "pass" : "fail"},
      {"abort_code", abortCode},
      {"error_domain", error ? error->domain : std::string()},
      {"error_description", error ? error->description : std::string()},
      {"error_code", error ? error->code : std::int64_t{0}},
      {"power_state", powerState()},
  };
  TILL_LOG(3, "%@: Message tracing %@ - %@", kSpeaker, kAppTraceDomain, PlistValue(trace));
  LedgerTraceMessage(kAppTraceDomain, trace);
}

void UpdateOperation::messageTraceOSUpdate(const SysupQuaymartUpdate& update,
                                           std::string_view result, const UpdateAbort* abort,
                                           const OptionalError& error) const {
  const std::string& key = update.productKey();
  PlistDictionary trace{{"result", std::string(result)}, {"power_state", powerState()}};
  if (abort && abort->code == kAbortDidNotTerminate && abort->bundleID) {
    // An application that would not quit for an install.
    trace["product_key"] = key;
    trace["abort_code"] = abort->code;
    trace["abort_reason"] = abort->reason.value_or("");
    trace["abort_bundle_id"] = UpdateRunRecord::isVendorIdentifier(*abort->bundleID)
                                   ? *abort->bundleID
                                   : std::string("Third Party App");
  } else {
    trace["product_key"] = key.empty() ? std::string("No Product Key") : key;
    if (abort) {
      trace["abort_code"] = abort->code;
      trace["abort_reason"] = abort->reason.value_or("");
      if (namesBundle(abort->code)) trace["abort_bundle_id"] = tracedBundleID(abort->bundleID);
    }
    if (error) {
      trace["error_code"] = error->code;
      trace["error_domain"] =
          error->domain.empty() ? std::string("No Error Domain") : error->domain;
      trace["error_description"] =
          error->description.empty() ? std::string("No error description") : error->description;
    }
  }
  TILL_LOG(3, "%@: Message tracing %@ - %@", kSpeaker, kOSTraceDomain, PlistValue(trace));
  LedgerTraceMessage(kOSTraceDomain, trace);
}

}  // namespace larder
