// Which app and OS updates a run takes on, and why it holds the others
// back. The abort code of an app update is kept on its record in the update
// queue, so that a later run can tell that nothing has changed.
#include <algorithm>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/services/VendDownloadService.h"
#include "store-runtime/services/VendServiceProxy.h"
#include "update-operation/UpdateListDescription.h"
#include "update-operation/UpdateOperation.h"
#include "update-queue/UpdateQueue.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateOperation";

// The code every decision gives while the preference holds one.
std::optional<std::int64_t> alwaysAbortCodeByPreference() {
  PlistValue value =
      PreferenceStore::valueForKey(kDefaultsAlwaysAbortUpdatesCodeKey, kDaemonDefaultsID);
  if (value.isInteger() || value.isReal() || value.isBoolean()) return value.int64Value();
  if (const std::string* text = value.string()) {
    char* end = nullptr;
    const long long parsed = std::strtoll(text->c_str(), &end, 10);
    if (end != text->c_str()) return parsed;
  }
  return std::nullopt;
}

bool preferenceIsTrue(std::string_view key) {
  return PreferenceStore::booleanForKey(key, kDaemonDefaultsID).value_or(false);
}

bool abortWith(UpdateAbort* abort, std::int64_t code, std::optional<std::string> reason) {
  if (abort) {
    abort->code = code;
    abort->reason = std::move(reason);
  }
  return false;
}

// Nothing objects: code 0 and no reason.
bool proceed(UpdateAbort* abort) {
  if (abort) {
    abort->code = UpdateOperation::kAbortNone;
    abort->reason.reset();
  }
  return true;
}

bool abortByPreference(UpdateAbort* abort, std::int64_t code) {
  return abortWith(abort, code, "Aborted by preference for code " + std::to_string(code));
}

std::vector<std::string> hostNames(const PlugInHostApps& hosts) {
  std::vector<std::string> names;
  for (const auto& [name, information] : hosts) names.push_back(name);
  return names;
}

bool isEmptyText(const std::optional<std::string>& text) {
  return !text || text->empty();
}

bool containsProductKey(const std::vector<SysupQuaymartUpdate>& list,
                        const SysupQuaymartUpdate& update) {
  return std::ranges::any_of(list, [&](const SysupQuaymartUpdate& other) {
    return other.productKey() == update.productKey();
  });
}

}  // namespace

std::string UpdateOperation::joinedHostNames(const PlugInHostApps& hosts) {
  std::string names;
  for (const auto& [name, information] : hosts) {
    if (!names.empty()) names += ", ";
    names += name;
  }
  return names;
}

bool UpdateOperation::shouldDownloadAppUpdateAssets() const {
  const UpdateOperationSettings s = settings();
  return s.userInitiated || s.nowIsLater || s.shouldCheckForAndStageAppUpdates;
}

// --- App updates ---

std::vector<LedgerUpdateRef> UpdateOperation::appUpdatesToStageOrInstallNow() {
  const UpdateOperationSettings s = settings();
  if (s.appUpdatesToInstall) {
    TILL_LOG(2, "%@: Using specified App Updates to install - %@", kSpeaker,
             describeList(*s.appUpdatesToInstall));
    return *s.appUpdatesToInstall;
  }
  if (s.shouldInstallCriticalUpdatesOnly) return {};
  std::shared_ptr<UpdateOperationController> controller = updateController();
  if (!controller) return {};
  std::vector<LedgerUpdateRef> qualified;
  const bool downloadAssets = shouldDownloadAppUpdateAssets();
  const bool laterRun = s.nowIsLater && s.doItLaterMode != 0;
  // The preferences and the machine are read at the first update that asks
  // and then hold for the pass: a read per update cost over a second for
  // 2,000.
  const std::shared_ptr<const UpdateQueue::UpdateList> available =
      controller->updateQueue()->availableUpdates();
  std::optional<DecisionInputs> inputs;
  const auto decisionInputs = [&]() -> const DecisionInputs& {
    if (!inputs) {
      inputs = DecisionInputs::read();
      inputs->updatesByBundleID.emplace();
      for (const LedgerUpdateRef& update : *available) {
        if (update->bundleID()) (*inputs->updatesByBundleID)[*update->bundleID()] = update;
      }
    }
    return *inputs;
  };
  const auto isAutoUpdatedEnabled = [&] { return decisionInputs().autoUpdateEnabled; };
  for (const LedgerUpdateRef& update : *available) {
    if (!downloadAssets && !update->isStaged()) {
      TILL_LOG(2,
               "%@: Skipping purchase of update %@ because it is not staged and this operation is "
               "set to not download assets (userInitiated=%i, shouldCheckForAndStageAppUpdates=%i)",
               kSpeaker, update, s.userInitiated, s.shouldCheckForAndStageAppUpdates);
      continue;
    }
    if (downloadAssets && !s.userInitiated && !update->isStaged() && !laterRun &&
        !isAutoUpdatedEnabled()) {
      TILL_LOG(2,
               "%@: Skipping update %@ because isAutoUpdatedEnabled is false (userInitiated=%i, "
               "shouldCheckForAndStageAppUpdates=%i, isUpdateStagingEnabled=%i, nowIsLater=%i, "
               "doItLaterMode=%ld)",
               kSpeaker, update, s.userInitiated, s.shouldCheckForAndStageAppUpdates,
               UpdatePolicy::isUpdateStagingEnabled(), s.nowIsLater, s.doItLaterMode);
      continue;
    }
    if (!downloadAssets && update->isStaged() && update->autoUpdateAbortCode() != 0) {
      UpdateAbort abort;
      const bool shouldInstall =
          shouldAutoInstallAppUpdate(update->bundleID(), nullptr, &abort, decisionInputs());
      auditAppUpdate(update->itemIdentifierValue(), shouldInstall, abort);
      if (abort.code == update->autoUpdateAbortCode()) {
        TILL_LOG(2,
                 "%@: Skipping purchase of update %@ because it previously failed to auto-update "
                 "with the same reason as it would fail now (%i) (userInitiated=%i, "
                 "shouldCheckForAndStageAppUpdates=%i)",
                 kSpeaker, update, abort.code, s.userInitiated, s.shouldCheckForAndStageAppUpdates);
        continue;
      }
      if (abort.code == kAbortPreflight) {
        TILL_LOG(2,
                 "%@: Skipping purchase of update %@ because preflight returned warning or error "
                 "(userInitiated=%i, shouldCheckForAndStageAppUpdates=%i)",
                 kSpeaker, update, s.userInitiated, s.shouldCheckForAndStageAppUpdates);
        continue;
      }
    }
    qualified.push_back(update);
  }
  return qualified;
}

UpdateOperation::DecisionInputs UpdateOperation::DecisionInputs::read() {
  return DecisionInputs{
      .alwaysAbortCode = alwaysAbortCodeByPreference(),
      .autoUpdateEnabled = UpdatePolicy::isAutoUpdatedEnabled(),
      .minimumReleaseInterval = UpdatePolicy::autoInstallUpdateMinimumReleaseTimeInterval(),
      .updateImmortalApps = preferenceIsTrue(kDefaultsAutoUpdateImmortalAppsKey),
      .updateForegroundApps = preferenceIsTrue(kDefaultsAutoUpdateForegroundAppsKey),
      .survey = AppHelper::Survey::take()};
}

bool UpdateOperation::shouldAutoInstallAppUpdate(const std::optional<std::string>& bundleIdentifier,
                                                 const TillDownloadRef& download,
                                                 UpdateAbort* abort) {
  return shouldAutoInstallAppUpdate(bundleIdentifier, download, abort, DecisionInputs::read());
}

bool UpdateOperation::shouldAutoInstallAppUpdate(const std::optional<std::string>& bundleIdentifier,
                                                 const TillDownloadRef& download,
                                                 UpdateAbort* abort, const DecisionInputs& inputs) {
  if (inputs.alwaysAbortCode) return abortByPreference(abort, *inputs.alwaysAbortCode);
  const UpdateOperationSettings s = settings();
  if (s.userInitiated) return proceed(abort);
  if (!bundleIdentifier) return abortWith(abort, kAbortNoBundleID, "nil bundleID specified");
  std::shared_ptr<UpdateOperationController> controller = updateController();
  if (!controller) return abortWith(abort, kAbortTooRecent, "update is too recent");
  const bool putOffToNow =
      s.nowIsLater && controller->appUpdatesToInstallLaterIncludesBundleID(*bundleIdentifier);
  if (putOffToNow) {
    std::optional<std::string> appName;
    std::optional<PlugInHostApps> hosts;
    if (AppHelper::isAppRunningWithBundleID(*bundleIdentifier, &appName, &hosts, inputs.survey)) {
      if (hosts && !hosts->empty()) {
        if (abort) abort->appName = appName;
        return abortWith(
            abort, kAbortPlugInsInUse,
            *bundleIdentifier + " containing plugIns used by " + joinedHostNames(*hosts));
      }
      std::optional<std::string> reason;
      std::optional<std::string> name;
      if (AppHelper::isAppImmortalWithBundleID(*bundleIdentifier, &reason, &name) &&
          !inputs.updateImmortalApps) {
        if (abort) abort->appName = name;
        return abortWith(abort, kAbortImmortal,
                         "the app can not be quit safely (" + reason.value_or("(null)") + ")");
      }
      name.reset();
      if (AppHelper::isAppForemostWithBundleID(*bundleIdentifier, &name) &&
          !inputs.updateForegroundApps) {
        if (abort) abort->appName = name;
        return abortWith(abort, kAbortForemost, "the app is foremost (active)");
      }
    }
  } else {
    if (!inputs.autoUpdateEnabled) {
      return abortWith(abort, kAbortAutoUpdateDisabled, "auto-update is disabled by preference");
    }
    LedgerUpdateRef update;
    if (inputs.updatesByBundleID) {
      auto found = inputs.updatesByBundleID->find(*bundleIdentifier);
      if (found != inputs.updatesByBundleID->end()) update = found->second;
    } else {
      update = controller->updateQueue()->availableUpdateWithBundleIdentifier(*bundleIdentifier);
    }
    const auto oldEnough = UpdatePolicy::Clock::now() -
                           std::chrono::duration_cast<UpdatePolicy::Clock::duration>(
                               std::chrono::duration<double>(inputs.minimumReleaseInterval));
    const std::optional<PlistDate> releaseDate = update ? update->releaseDate() : std::nullopt;
    if (!releaseDate || UpdatePolicy::timePointOf(*releaseDate) >= oldEnough) {
      return abortWith(abort, kAbortTooRecent, "update is too recent");
    }
    if (!s.shouldStartAutoInstallOfUpdates && !update->firstAutoUpdateAttemptDate() &&
        !controller->appUpdatesToInstallLaterIncludesBundleID(*bundleIdentifier)) {
      return abortWith(abort, kAbortTooSoon, "too soon to start auto-update");
    }
    if (runningAppBlocksInstall(*bundleIdentifier, abort, inputs.survey)) return false;
  }
  if (download && !preflightAllows(download, abort)) return false;
  return proceed(abort);
}

bool UpdateOperation::runningAppBlocksInstall(const std::string& bundleIdentifier,
                                              UpdateAbort* abort, const AppHelper::Survey& survey) {
  std::optional<std::string> appName;
  std::optional<PlugInHostApps> hosts;
  if (!AppHelper::isAppRunningWithBundleID(bundleIdentifier, &appName, &hosts, survey)) {
    return false;
  }
  if (abort) abort->appName = appName;
  if (hosts && !hosts->empty()) {
    abortWith(abort, kAbortPlugInsInUse,
              bundleIdentifier + " containing plugIns used by " + joinedHostNames(*hosts));
  } else {
    abortWith(abort, kAbortAppRunning, "the app is running");
  }
  return true;
}

bool UpdateOperation::preflightAllows(const TillDownloadRef& download, UpdateAbort* abort) {
  const TillDownloadMetadata metadata = download->metadata();
  // A download without a preflight package has nothing to be checked
  // against; the download layer would refuse the empty URL as a failure.
  if (!metadata.preflightPackageURL()) return true;
  const auto [allowed, objection] = checkPreflight(metadata, PlistValue());
  if (!allowed) {
    TILL_LOG(1, "%@: Preflight returned ERROR during auto-update preflight check", kSpeaker);
    return abortWith(abort, kAbortPreflight, "preflight returned warning or error");
  }
  if (!objection.isNull()) {
    TILL_LOG(1, "%@: Preflight returned WARNING during auto-update preflight check", kSpeaker);
    return abortWith(abort, kAbortPreflight, "preflight returned warning or error");
  }
  return true;
}

std::pair<bool, PlistValue> UpdateOperation::checkPreflight(const TillDownloadMetadata& metadata,
                                                            const PlistValue& systemVersion) {
  std::pair<bool, PlistValue> answer{true, PlistValue()};
  serviceProxy()->downloadServiceSynchronousBlock([&](VendDownloadService& service,
                                                      DispatchSemaphore& semaphore) {
    service.checkPreflightWithItemIdentifier(metadata.itemIdentifier(),
                                             metadata.preflightPackageURL().value_or(""),
                                             systemVersion, [&](bool allowed, PlistValue object) {
                                               answer = {allowed, std::move(object)};
                                               semaphore.signal();
                                             });
  });
  return answer;
}

// --- OS updates ---

bool UpdateOperation::isInstallLaterUpdate(const SysupQuaymartUpdate& update) const {
  const std::optional<std::vector<SysupQuaymartUpdate>> later = settings().osUpdatesToInstallLater;
  return later && containsProductKey(*later, update);
}

std::vector<SysupQuaymartUpdate> UpdateOperation::osUpdatesToInstallNow() {
  const UpdateOperationSettings s = settings();
  if (s.osUpdatesToInstall) {
    TILL_LOG(2, "%@: Using specified OS Updates to install - %@", kSpeaker,
             describeList(*s.osUpdatesToInstall));
    return *s.osUpdatesToInstall;
  }
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  const DecisionInputs inputs = DecisionInputs::read();
  std::vector<SysupQuaymartUpdate> candidates;
  for (const SysupQuaymartUpdate& update : sysup.availableUpdates()) {
    const bool needsNoRestart = sysup.actionRequiredForUpdates({update}) == 0;
    bool candidate = false;
    if (s.shouldInstallCriticalUpdatesOnly) {
      candidate = update.isCritical();
    } else {
      candidate =
          (needsNoRestart && update.isRecommended() && inputs.autoUpdateEnabled) ||
          (s.userInitiated && update.isRecommended() && !containsProductKey(candidates, update));
    }
    if (candidate) candidates.push_back(update);
  }
  if (s.nowIsLater && s.osUpdatesToInstallLater && !s.shouldInstallCriticalUpdatesOnly) {
    for (const SysupQuaymartUpdate& update : *s.osUpdatesToInstallLater) {
      if (!containsProductKey(candidates, update)) candidates.push_back(update);
    }
  }
  std::vector<SysupQuaymartUpdate> qualified;
  for (const SysupQuaymartUpdate& update : candidates) {
    UpdateAbort abort;
    const bool shouldInstall = shouldInstallOSUpdate(update, &abort, inputs);
    if (shouldInstall) {
      qualified.push_back(update);
    } else {
      TILL_LOG(1, "%@: Skipping OS Update %@ - %@", kSpeaker, update, abort.reason);
      messageTraceOSUpdate(update, "fail", &abort, std::nullopt);
    }
    auditOSUpdate(update, shouldInstall, abort);
  }
  return qualified;
}

bool UpdateOperation::shouldInstallOSUpdate(const SysupQuaymartUpdate& update, UpdateAbort* abort) {
  return shouldInstallOSUpdate(update, abort, DecisionInputs::read());
}

bool UpdateOperation::shouldInstallOSUpdate(const SysupQuaymartUpdate& update, UpdateAbort* abort,
                                            const DecisionInputs& inputs) {
  if (inputs.alwaysAbortCode) return abortByPreference(abort, *inputs.alwaysAbortCode);
  const UpdateOperationSettings s = settings();
  if (s.userInitiated) return proceed(abort);
  const bool later = isInstallLaterUpdate(update);
  if (!isEmptyText(update.firmwareWarning()) && !later) {
    return abortWith(abort, kAbortFirmwareWarning, "the update specifies a firmware warning");
  }
  if (!isEmptyText(update.licenseAgreement()) && !later) {
    return abortWith(abort, kAbortLicenseAgreement, "the update requires a license agreement");
  }
  SysupQuaymartUpdateController& sysup = SysupQuaymartUpdateController::sharedUpdateController();
  if (sysup.actionRequiredForUpdates({update}) != 0) {
    if (UpdatePolicy::otherUsersAreLoggedIn()) {
      return abortWith(abort, kAbortOtherUsers,
                       "the update requires restart but other users are logged in");
    }
    const auto blockers = runState().restartIsBlockedByRunningApplications;
    if (!blockers.empty()) {
      std::string identifiers;
      std::vector<std::string> names;
      for (const std::shared_ptr<RunningApplication>& application : blockers) {
        if (!identifiers.empty()) identifiers += ", ";
        identifiers += application->bundleIdentifier().value_or("");
        if (application->localizedName()) names.push_back(*application->localizedName());
      }
      if (abort) {
        abort->bundleID = identifiers;
        abort->appNames = names;
      }
      return abortWith(abort, kAbortImmortal,
                       "the update requires restart but " + identifiers + " is immortal");
    }
    return proceed(abort);
  }
  if (!update.isRecommended()) {
    return abortWith(abort, kAbortNotRecommended, "the Update is not recommended");
  }
  for (const std::string& identifier : update.applicationIdentifiersToClose()) {
    if (appToCloseBlocksInstall(identifier, abort, inputs)) return false;
  }
  return proceed(abort);
}

bool UpdateOperation::appToCloseBlocksInstall(const std::string& bundleIdentifier,
                                              UpdateAbort* abort, const DecisionInputs& inputs) {
  std::optional<PlugInHostApps> hosts;
  if (!AppHelper::isAppRunningWithBundleID(bundleIdentifier, nullptr, &hosts, inputs.survey)) {
    return false;
  }
  auto blockedBy = [&](std::int64_t code, std::string reason,
                       std::optional<std::vector<std::string>> names) {
    if (abort) {
      abort->bundleID = bundleIdentifier;
      abort->appNames = std::move(names);
    }
    abortWith(abort, code, std::move(reason));
    return true;
  };
  auto oneName = [](const std::optional<std::string>& name) {
    return name ? std::optional(std::vector<std::string>{*name}) : std::nullopt;
  };
  if (hosts && !hosts->empty()) {
    return blockedBy(
        kAbortPlugInsInUse,
        bundleIdentifier + " containing plugIns used by " + joinedHostNames(*hosts) + " ",
        hostNames(*hosts));
  }
  std::optional<std::string> reason;
  std::optional<std::string> name;
  if (AppHelper::isAppImmortalWithBundleID(bundleIdentifier, &reason, &name) &&
      !inputs.updateImmortalApps) {
    return blockedBy(kAbortImmortal,
                     "the Update requires " + bundleIdentifier +
                         " to be quit but it is immortal (" + reason.value_or("(null)") + ")",
                     oneName(name));
  }
  name.reset();
  if (AppHelper::isAppForemostWithBundleID(bundleIdentifier, &name) &&
      !inputs.updateForegroundApps) {
    return blockedBy(kAbortForemost,
                     "the Update requires " + bundleIdentifier + " to be quit but it is foremost",
                     oneName(name));
  }
  return false;
}

}  // namespace larder
