// The major OS update: an installer application that the platform
// announces with a notification bundle and that is fetched as an OS update.
// The controller waits a random time, then decides at each background scan
// report whether to download it, to tell the user, or to give up; and a
// managed install fetches it by tags and hands it to the install service.
//
// The whole state is one dictionary, stored by the install service, so it
// survives restarts and both modes of the process see it; only the running
// download's token is held in memory. Every change of the dictionary
// happens on the install queue, one at a time.
#include <unistd.h>

#include <future>
#include <random>

#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "platform/dispatch/RunLoop.h"
#include "platform/log/TillLogManager.h"
#include "running-apps/AuthorizationController.h"
#include "running-apps/RunningApplication.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/LedgerQuaymartLauncher.h"
#include "store-runtime/host/LedgerTraceMessage.h"
#include "store-runtime/host/PreferenceStore.h"
#include "store-runtime/host/VendDevice.h"
#include "store-runtime/services/VendDownloadService.h"
#include "update-controller/UpdateController.h"
#include "update-operation/UpdatePolicy.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateController";

// Keys of the state dictionary.
constexpr std::string_view kBundlePathKey = "BundlePath";
constexpr std::string_view kEvaluationDateKey = "EvaluationDate";
constexpr std::string_view kRemainingRemindersKey = "RemainingReminders";
constexpr std::string_view kDownloadStateKey = "DownloadState";
constexpr std::string_view kDownloadStartDateKey = "DownloadStartDate";
constexpr std::string_view kEvaluationRetryCountKey = "EvaluationRetryCount";
constexpr std::string_view kDaemonDownloadKey = "DaemonDownload";
constexpr std::string_view kScheduledAutomaticDownloadKey = "ScheduledAutomaticDownload";
constexpr std::string_view kCurrentAutomaticDownloadKey = "CurrentAutomaticDownload";
constexpr std::string_view kPastDownloadsKey = "PastDownloads";

// Keys of the notification bundle's information dictionary.
constexpr std::string_view kSHBundleIdentifierKey = "SHBundleIdentifier";
constexpr std::string_view kSysupTagsKey = "SysupTags";
constexpr std::string_view kFreeSpaceRequiredKey = "FreeSpaceRequired";
constexpr std::string_view kMaximumNotificationDelayKey = "MaximumNotificationDelay";
constexpr std::string_view kReminderIntervalsKey = "ReminderIntervals";
constexpr std::string_view kItemIDKey = "ItemID";

constexpr std::string_view kStarted = "Started";
constexpr std::string_view kFinished = "Finished";
constexpr std::string_view kFailed = "Failed";

constexpr std::string_view kReceivedTraceDomain = "com.orvane.Quaymart.received_SH_notification.v1";
constexpr std::string_view kActivatedTraceDomain =
    "com.orvane.Quaymart.activated_OS_notification.v1";

// A week: the longest wait when the bundle names none.
constexpr std::int64_t kDefaultNotificationDelaySeconds = 604800;
constexpr std::int64_t kMaximumEvaluationRetries = 5;
constexpr std::string_view kRootMountPoint = "/";
// The store's web host in the link of a store page: the store application
// reads only the path and the query, so any host does; this one names the
// store and nothing else.
constexpr std::string_view kStorePageHost = "apps.quaymart.larder";

using Trace = std::pair<std::string, std::string>;

double secondsNow() {
  using Seconds = std::chrono::duration<double>;
  return Seconds(std::chrono::system_clock::now().time_since_epoch()).count();
}

std::optional<std::string> stringOf(const PlistDictionary& dictionary, std::string_view key) {
  auto found = dictionary.find(key);
  if (found == dictionary.end() || !found->second.string()) return std::nullopt;
  return *found->second.string();
}

const PlistValue& valueOf(const PlistDictionary& dictionary, std::string_view key) {
  auto found = dictionary.find(key);
  return found == dictionary.end() ? PlistValue::null() : found->second;
}

const PlistDictionary* dictionaryOf(const PlistDictionary& dictionary, std::string_view key) {
  return valueOf(dictionary, key).dictionary();
}

std::vector<std::string> tagsOf(const PlistDictionary& info) {
  std::vector<std::string> tags;
  if (const PlistArray* list = valueOf(info, kSysupTagsKey).array()) {
    for (const PlistValue& tag : *list) {
      if (tag.string()) tags.push_back(*tag.string());
    }
  }
  return tags;
}

PlistValue tagsValue(const std::vector<std::string>& tags) {
  return PlistValue(PlistArray(tags.begin(), tags.end()));
}

PlistValue productKeysValue(const UpdateController::OSUpdateList& updates) {
  PlistArray keys;
  for (const SysupQuaymartUpdate& update : updates) keys.emplace_back(update.productKey());
  return PlistValue(std::move(keys));
}

std::string storePageURL(std::uint64_t itemIdentifier) {
  return "quaymart://" + std::string(kStorePageHost) + "/app/id" + std::to_string(itemIdentifier) +
         "?mt=12";
}

// The next reminder: the date moves on by the first interval left, or,
// with none left, goes away, which ends all evaluation.
void scheduleNextReminder(PlistDictionary& state) {
  auto reminders = state.find(kRemainingRemindersKey);
  PlistArray* intervals = reminders == state.end() ? nullptr : reminders->second.array();
  if (!intervals || intervals->empty()) {
    state.erase(std::string(kEvaluationDateKey));
    return;
  }
  const PlistDate date{secondsNow() + intervals->front().doubleValue()};
  state[std::string(kEvaluationDateKey)] = date;
  TILL_LOG(2, "%@: Major OS Update: Setting conditional renotify date of: %@", kSpeaker,
           PlistValue(date));
  intervals->erase(intervals->begin());
  if (intervals->empty()) state.erase(reminders);
}

bool hasRemainingReminders(const PlistDictionary& state) {
  const PlistArray* intervals = valueOf(state, kRemainingRemindersKey).array();
  return intervals && !intervals->empty();
}

void traceReceivedNotification(const PlistDictionary& info, const Trace& trace) {
  PlistDictionary message{{"action", trace.first}, {"reason", trace.second}};
  if (std::optional<std::string> item = stringOf(info, kSHBundleIdentifierKey)) {
    message.emplace("item_id", *item);
  }
  LedgerTraceMessage(kReceivedTraceDomain, message);
}

}  // namespace

// --- State ---

PlistDictionary UpdateController::readMajorOSUpdatePrefs() const {
  PlistValue stored = PreferenceStore::valueForKey(kDefaultsMajorOSUpdateKey, kDaemonDefaultsID,
                                                   PreferenceScope::System);
  const PlistDictionary* state = stored.dictionary();
  return state ? *state : PlistDictionary{};
}

// Only the install service writes the preference: as root it is the one
// that may write the machine's scope.
void UpdateController::writeMajorOSUpdatePrefs(const PlistDictionary& prefs) {
  Result<void> written = installDaemonConnection()->writeMajorOSUpdatePrefs(prefs);
  if (!written) {
    TILL_LOG(1, "%@: Error from Install Service: %@", kSpeaker, written.errorDescription());
  }
}

std::optional<Bundle> UpdateController::majorOSUpdateBundle() const {
  const std::string path = stringOf(readMajorOSUpdatePrefs(), kBundlePathKey).value_or("");
  std::optional<Bundle> bundle = path.empty() ? std::nullopt : Bundle::open(path);
  if (!bundle) {
    TILL_LOG(1, "%@: ERROR: Could not load the major OS update bundle. Path: %@", kSpeaker, path);
  }
  return bundle;
}

std::optional<PlistDictionary> UpdateController::majorOSUpdateBundleInfoDictionary() const {
  std::optional<Bundle> bundle = majorOSUpdateBundle();
  if (!bundle) return std::nullopt;
  if (bundle->infoDictionary().empty()) {
    TILL_LOG(1, "%@: ERROR: Could not get infoDictionary for the major OS update bundle", kSpeaker);
    return std::nullopt;
  }
  return bundle->infoDictionary();
}

void UpdateController::postMajorOSUpdateAvailableNotificationOfType(std::string_view type) {
  notificationCatalogue_->postMajorOSUpdateAvailableNotificationOfType(type, majorOSUpdateBundle());
}

std::optional<UpdateController::MajorOSInstallCancelToken>
UpdateController::majorOSInstallCancelToken() const {
  MutexLock lock(majorOSLock_);
  return majorOSInstallCancelToken_;
}

void UpdateController::setMajorOSInstallCancelToken(
    std::optional<MajorOSInstallCancelToken> token) {
  MutexLock lock(majorOSLock_);
  majorOSInstallCancelToken_ = std::move(token);
}

void UpdateController::setMajorOSUpdateWaitsForTesting(std::chrono::milliseconds tagLookupTimeout,
                                                       std::chrono::milliseconds discoveryPause) {
  MutexLock lock(majorOSLock_);
  majorOSTagLookupTimeout_ = tagLookupTimeout;
  setupHeraldDiscoveryPause_ = discoveryPause;
}

void UpdateController::setAvailableDiskSpaceForTesting(
    std::function<std::uint64_t()> availableDiskSpace) {
  MutexLock lock(majorOSLock_);
  availableDiskSpaceForTesting_ = std::move(availableDiskSpace);
}

std::uint64_t UpdateController::majorOSAvailableDiskSpace() const {
  std::function<std::uint64_t()> measure;
  {
    MutexLock lock(majorOSLock_);
    measure = availableDiskSpaceForTesting_;
  }
  return measure ? measure() : VendDevice::availableDiskSpace();
}

// --- The announcement ---

void UpdateController::majorOSUpdateAvailableWithInfoBundlePath(
    const std::optional<std::string>& path) {
  if (!path || path->empty()) {
    TILL_LOG(1, "%@: ERROR: BundlePath not specified for major OS update. Ignoring.", kSpeaker);
    return;
  }
  // Read from disk now: an earlier announcement may have named the same
  // path with other contents.
  std::optional<Bundle> bundle = Bundle::open(*path);
  if (!bundle) {
    TILL_LOG(1, "%@: ERROR: Bundle not found for major OS update at path: %@ . Ignoring.", kSpeaker,
             *path);
    return;
  }
  const PlistDictionary& info = bundle->infoDictionary();
  const PlistValue& identifier = valueOf(info, kSHBundleIdentifierKey);
  const PlistValue& tags = valueOf(info, kSysupTagsKey);
  const PlistValue& freeSpace = valueOf(info, kFreeSpaceRequiredKey);
  // Only a bundle that says nothing at all is refused: one that lacks some
  // of these goes on, and the steps below take what is missing as nothing.
  if (identifier.isNull() && tags.isNull() && freeSpace.isNull()) {
    TILL_LOG(1,
             "%@: ERROR: Bundle for major OS update is missing essential information. Ignoring. "
             "%@ | %@ | %@",
             kSpeaker, identifier, tags, freeSpace);
    return;
  }
  if (identifier.string() && softwareMap_->productForBundleIdentifier(*identifier.string())) {
    TILL_LOG(1,
             "%@: Major OS update notification bundle specified a bundleID that is already in "
             "SoftwareMap (%@). Ignoring this notification.",
             kSpeaker, *identifier.string());
    return;
  }

  PlistDictionary state{{std::string(kBundlePathKey), *path}};
  std::int64_t delay = kDefaultNotificationDelaySeconds;
  PlistValue configured = PreferenceStore::valueForKey(kDefaultsMajorOSUpdateNotificationDelayKey,
                                                       kDaemonDefaultsID, PreferenceScope::User);
  if (!configured.isNull()) {
    delay = configured.int64Value();
  } else if (const PlistValue& maximum = valueOf(info, kMaximumNotificationDelayKey);
             !maximum.isNull()) {
    delay = maximum.int64Value();
  }
  PlistDate evaluationDate = PlistDate::now();
  if (delay > 0) {
    std::random_device seed;
    std::mt19937_64 generator(seed());
    std::uniform_int_distribution<std::int64_t> wait(0, delay - 1);
    evaluationDate.secondsSince1970 += static_cast<double>(wait(generator));
    TILL_LOG(2, "%@: Setting date to evaluate major OS update to %@", kSpeaker,
             PlistValue(evaluationDate));
  } else {
    TILL_LOG(2, "%@: Major OS update: Delay was set to 0. Triggering evaluation now.", kSpeaker);
  }
  state[std::string(kEvaluationDateKey)] = evaluationDate;
  if (const PlistValue& reminders = valueOf(info, kReminderIntervalsKey); !reminders.isNull()) {
    state[std::string(kRemainingRemindersKey)] = reminders;
  }
  writeMajorOSUpdatePrefs(state);
  // Submitted after the write, so that the evaluation sees this state
  // whichever thread this runs on.
  if (delay <= 0) {
    majorOSInstallQueue_->async([weakSelf = weak_from_this()] {
      if (auto self = weakSelf.lock()) self->checkMajorOSUpdateStatus();
    });
  }
}

// --- The evaluation ---

void UpdateController::checkMajorOSUpdateStatus() {
  PlistDictionary state = readMajorOSUpdatePrefs();
  const PlistDate* evaluationDate = valueOf(state, kEvaluationDateKey).date();
  if (!evaluationDate || evaluationDate->secondsSince1970 >= secondsNow()) {
    state.erase(std::string(kEvaluationRetryCountKey));
    writeMajorOSUpdatePrefs(state);
    return;
  }

  auto postLater = [this](std::string_view type) {
    majorOSInstallQueue_->async([weakSelf = weak_from_this(), type = std::string(type)] {
      if (auto self = weakSelf.lock()) self->postMajorOSUpdateAvailableNotificationOfType(type);
    });
  };
  bool failed = false;
  std::optional<Trace> trace;
  std::optional<PlistDictionary> info = majorOSUpdateBundleInfoDictionary();
  if (!info) {
    state.clear();
    TILL_LOG(1,
             "%@: Major OS update evaluation date has been reached but the notification bundle no "
             "longer exists. Disabling.",
             kSpeaker);
  } else {
    const std::optional<std::string> downloadState = stringOf(state, kDownloadStateKey);
    const std::optional<std::string> identifier = stringOf(*info, kSHBundleIdentifierKey);
    const bool installed =
        identifier && softwareMap_->productForBundleIdentifier(*identifier) != nullptr;
    const bool downloading = majorOSInstallCancelToken().has_value();
    if (installed && downloadState == kFinished) {
      postLater(UpdateNotificationCatalogue::kMajorOSUpdateAutoDownloaded);
      scheduleNextReminder(state);
      TILL_LOG(2, "%@: Major OS Update: Re-issuing update downloaded notification.", kSpeaker);
      trace = Trace{"Notify", "Re-notify update is downloaded"};
    } else if (installed && downloadState == kStarted && !downloading) {
      postLater(UpdateNotificationCatalogue::kMajorOSUpdateAutoDownloaded);
      scheduleNextReminder(state);
      TILL_LOG(2, "%@: Major OS Update: Issuing update downloaded notification.", kSpeaker);
      trace = Trace{"Notify", "Notify update is downloaded"};
    } else if (installed) {
      state.clear();
      TILL_LOG(1,
               "%@: Major OS Update: The SH we were going to auto-download seems to have been "
               "downloaded by some other means. Disabling.",
               kSpeaker);
      trace = Trace{"None", "Manually downloaded"};
    } else if (downloadState == kFinished) {
      state.clear();
      TILL_LOG(1, "%@: Major OS Update: We downloaded the SH but the user deleted it. Disabling.",
               kSpeaker);
      trace = Trace{"None", "Automatically downloaded and moved"};
    } else if (downloadState == kStarted && downloading) {
      TILL_LOG(2,
               "%@: Major OS Update: We were checking status but the update is still downloading. "
               "Letting it continue.",
               kSpeaker);
    } else {
      // Also "Started" without a token (a run that a restart interrupted)
      // and "Failed": both start over.
      failed = !evaluateMajorOSUpdateDownload(state, *info, trace);
    }
  }

  if (failed) {
    const std::int64_t retries = valueOf(state, kEvaluationRetryCountKey).int64Value();
    if (retries < kMaximumEvaluationRetries) {
      // The date stays in the past: the next report evaluates again.
      state[std::string(kEvaluationRetryCountKey)] = retries + 1;
    } else {
      state.clear();
      TILL_LOG(1, "%@: Major OS Update: Too many evaluation retries. Disabling.", kSpeaker);
    }
  } else {
    state.erase(std::string(kEvaluationRetryCountKey));
  }
  writeMajorOSUpdatePrefs(state);
  if (trace) traceReceivedNotification(info.value_or(PlistDictionary{}), *trace);
}

// The decision to download by ourselves. False when the evaluation failed
// and is to be tried again at the next report.
bool UpdateController::evaluateMajorOSUpdateDownload(PlistDictionary& state,
                                                     const PlistDictionary& info,
                                                     std::optional<Trace>& trace) {
  auto notifyAvailable = [&] {
    majorOSInstallQueue_->async([weakSelf = weak_from_this()] {
      if (auto self = weakSelf.lock()) {
        self->postMajorOSUpdateAvailableNotificationOfType(
            UpdateNotificationCatalogue::kMajorOSUpdateAvailableForDownload);
      }
    });
    scheduleNextReminder(state);
  };
  if (!UpdatePolicy::isUpdateStagingEnabled()) {
    notifyAvailable();
    TILL_LOG(2, "%@: Major OS Update: Auto-download is disabled, notifying instead.", kSpeaker);
    trace = Trace{"Notify", "Opted out"};
    return true;
  }
  const std::uint64_t required = valueOf(info, kFreeSpaceRequiredKey).uint64Value();
  const std::uint64_t available = majorOSAvailableDiskSpace();
  if (required > available) {
    TILL_LOG(1,
             "%@: Insufficient disk space (%lld) to automatically download and install major OS "
             "update (%llu required; %llu more needed). Notifying instead.",
             kSpeaker, static_cast<long long>(available), static_cast<unsigned long long>(required),
             static_cast<unsigned long long>(required - available));
    notifyAvailable();
    trace = Trace{"Notify", "Low disk space"};
    return true;
  }
  const std::vector<std::string> tags = tagsOf(info);
  if (tags.empty()) return false;
  std::optional<OSUpdateList> updates = waitForUpdatesForTags(tags);
  if (!updates) {
    TILL_LOG(1,
             "%@: CheckMajorOSUpdateStatus: Tags supplied for Major OS Update were not evaluated "
             "by Sysup in time. Will retry later. Tags: %@",
             kSpeaker, tagsValue(tags));
    return false;
  }
  if (updates->empty()) {
    TILL_LOG(1,
             "%@: CheckMajorOSUpdateStatus: Sysup couldn't match an update for the tags supplied "
             "for a major OS update automatic download. Will retry later. Tags: %@",
             kSpeaker, tagsValue(tags));
    return false;
  }
  if (updates->size() > 1) {
    TILL_LOG(1,
             "%@: CheckMajorOSUpdateStatus: Sysup matched more than one update for the tags "
             "supplied for a major OS update automatic download. Will retry later. Updates: %@ "
             "Tags: %@",
             kSpeaker, productKeysValue(*updates), tagsValue(tags));
    return false;
  }
  majorOSInstallQueue_->async([weakSelf = weak_from_this(), update = updates->front(),
                               identifier = stringOf(info, kSHBundleIdentifierKey).value_or("")] {
    if (auto self = weakSelf.lock()) self->startMajorOSUpdateBackgroundDownload(update, identifier);
  });
  trace = Trace{"Download", "Automatically downloading"};
  return true;
}

// The framework answers on the global queue, never on this one, so the
// install queue can wait for it.
std::optional<UpdateController::OSUpdateList> UpdateController::waitForUpdatesForTags(
    const std::vector<std::string>& tags) const {
  std::chrono::milliseconds timeout;
  {
    MutexLock lock(majorOSLock_);
    timeout = majorOSTagLookupTimeout_;
  }
  auto answer = std::make_shared<std::promise<OSUpdateList>>();
  std::future<OSUpdateList> found = answer->get_future();
  updatesForTags(tags, [answer](const OSUpdateList& updates) { answer->set_value(updates); });
  if (found.wait_for(timeout) != std::future_status::ready) return std::nullopt;
  return found.get();
}

// --- The automatic download ---

void UpdateController::startMajorOSUpdateBackgroundDownload(
    const SysupQuaymartUpdate& update, [[maybe_unused]] const std::string& bundleIdentifier) {
  if (!AuthorizationController::sharedInstance().authorizeForSoftwareInstall()) {
    // The state stays: the next report decides again.
    TILL_LOG(1, "%@: ERROR: Unable to authorize to install proposed Major OS Update. Aborting.",
             kSpeaker);
    return;
  }
  std::weak_ptr<UpdateController> weakSelf = weak_from_this();
  std::optional<MajorOSInstallCancelToken> token =
      SysupQuaymartUpdateController::sharedUpdateController().startInstallingUpdates(
          {update}, majorOSInstallQueue_, false,
          [](const PlistDictionary& statusInfo, bool canCancel, double percent) {
            TILL_LOG(3, "%@: Automatic Major OS Update install progress: %@", kSpeaker,
                     LedgerSoftwareUpdateStatus::initWithProgress(percent, statusInfo, canCancel)
                         .description());
          },
          [weakSelf, update](const OptionalError& error) {
            if (auto self = weakSelf.lock())
              self->finishMajorOSUpdateBackgroundDownload(update, error);
          });
  setMajorOSInstallCancelToken(std::move(token));
  // The handlers come on this queue, so they see this write.
  PlistDictionary state = readMajorOSUpdatePrefs();
  state[std::string(kDownloadStateKey)] = std::string(kStarted);
  state[std::string(kDownloadStartDateKey)] = PlistDate::now();
  writeMajorOSUpdatePrefs(state);
}

void UpdateController::finishMajorOSUpdateBackgroundDownload(const SysupQuaymartUpdate& update,
                                                             const OptionalError& error) {
  PlistDictionary state = readMajorOSUpdatePrefs();
  if (error) {
    // The token stays, as it was: "Failed" starts over at the next report.
    TILL_LOG(1, "%@: Failed to install automatic Major OS Update %@ with error %@", kSpeaker,
             update.productKey(), error->descriptionText());
    state[std::string(kDownloadStateKey)] = std::string(kFailed);
  } else {
    TILL_LOG(1, "%@: Finished installing automatic Major OS Update %@", kSpeaker,
             update.productKey());
    state[std::string(kDownloadStateKey)] = std::string(kFinished);
    setMajorOSInstallCancelToken(std::nullopt);
    majorOSInstallQueue_->async([weakSelf = weak_from_this()] {
      if (auto self = weakSelf.lock()) {
        self->postMajorOSUpdateAvailableNotificationOfType(
            UpdateNotificationCatalogue::kMajorOSUpdateAutoDownloaded);
      }
    });
    // Without reminders the date stays in the past: the next report tells
    // the user once more, then the date goes.
    if (hasRemainingReminders(state)) scheduleNextReminder(state);
  }
  writeMajorOSUpdatePrefs(state);
}

// --- The user's answer ---

void UpdateController::didActivateMajorOSUpdateNotification(const UserNotification& notification) {
  TILL_LOG(2, "%@: didActivateMajorOSUpdateNotification: %@", kSpeaker,
           PlistValue(notification.toDictionary()));
  const std::string type =
      stringOf(notification.userInfo, UpdateNotificationCatalogue::kMajorOSUpdateTypeKey)
          .value_or("");
  if (type == UpdateNotificationCatalogue::kMajorOSUpdateAutoDownloaded) {
    TILL_LOG(2, "%@: User selected Details for UpdateAutoDownloadedNotification", kSpeaker);
    std::optional<PlistDictionary> info = majorOSUpdateBundleInfoDictionary();
    if (info) openMajorOSUpdateStorePage(*info);
    PlistDictionary message{{"action", "Details"}};
    if (info) message.emplace("item_id", std::to_string(valueOf(*info, kItemIDKey).uint64Value()));
    LedgerTraceMessage(kActivatedTraceDomain, message);
  } else if (type == UpdateNotificationCatalogue::kMajorOSUpdateAvailableForDownload) {
    TILL_LOG(2, "%@: User selected Dismiss for UpdateAvailableForDownloadNotification", kSpeaker);
  } else if (type == UpdateNotificationCatalogue::kMajorOSUpdatePending) {
    proceedWithMDMMajorOSInstall();
  }
}

// The buttons of these notifications stand the other way round: the
// second button of the "available" one is its Details, that of the
// "downloaded" one its Install.
void UpdateController::didDismissMajorOSUpdateNotification(const UserNotification& notification) {
  TILL_LOG(2, "%@: didDismissMajorOSUpdateNotification: %@", kSpeaker,
           PlistValue(notification.toDictionary()));
  const std::string type =
      stringOf(notification.userInfo, UpdateNotificationCatalogue::kMajorOSUpdateTypeKey)
          .value_or("");
  if (type == UpdateNotificationCatalogue::kMajorOSUpdateAvailableForDownload) {
    TILL_LOG(2,
             "%@: User dismissed UpdateAvailableForDownloadNotification which actually means the "
             "user clicked Details.",
             kSpeaker);
    if (std::optional<PlistDictionary> info = majorOSUpdateBundleInfoDictionary()) {
      openMajorOSUpdateStorePage(*info);
    }
  } else if (type == UpdateNotificationCatalogue::kMajorOSUpdateAutoDownloaded) {
    std::optional<PlistDictionary> info = majorOSUpdateBundleInfoDictionary();
    if (info) launchSetupHerald(*info);
    PlistDictionary message{{"action", "Install"}};
    if (info) {
      if (std::optional<std::string> identifier = stringOf(*info, kSHBundleIdentifierKey)) {
        message.emplace("item_id", *identifier);
      }
    }
    LedgerTraceMessage(kActivatedTraceDomain, message);
  } else if (type == UpdateNotificationCatalogue::kMajorOSUpdatePending) {
    proceedWithMDMMajorOSInstall();
  }
}

void UpdateController::openMajorOSUpdateStorePage(const PlistDictionary& info) const {
  const std::string url = storePageURL(valueOf(info, kItemIDKey).uint64Value());
  if (!LedgerQuaymartLauncher::sharedInstance().launchQuaymartWithURL(url)) {
    TILL_LOG(1, "%@: Could not open the store page %@", kSpeaker, url);
  }
}

void UpdateController::launchSetupHerald(const PlistDictionary& info) const {
  const std::string identifier = stringOf(info, kSHBundleIdentifierKey).value_or("");
  LedgerSoftwareProductRef product =
      identifier.empty() ? nullptr : softwareMap_->productForBundleIdentifier(identifier);
  if (!product) {
    TILL_LOG(1,
             "%@: Could not find an SH with BundleID: %@ in SoftwareMap. Thus unable to launch it.",
             kSpeaker, identifier);
    return;
  }
  const std::string path = product->bundlePath();
  Result<pid_t> launched = RunningApplication::launchBundle(path, {"--streamlined"});
  if (launched) {
    TILL_LOG(1, "%@: Launched SH with --streamlined at path: %@", kSpeaker, path);
  } else {
    TILL_LOG(1, "%@: Failed to launch SH at path: %@ (%@)", kSpeaker, path,
             launched.error().descriptionText());
  }
}

// --- Downloads made by the daemon ---

void UpdateController::majorOSUpdateWillBeDownloadedByDaemonWithItemIdentifier(
    std::uint64_t itemIdentifier, const PlistValue& versionIdentifier) {
  majorOSInstallQueue_->async([weakSelf = weak_from_this(), itemIdentifier, versionIdentifier] {
    auto self = weakSelf.lock();
    if (!self) return;
    PlistDictionary state = self->readMajorOSUpdatePrefs();
    state[std::string(kDaemonDownloadKey)] = PlistDictionary{{"StartDate", PlistDate::now()},
                                                             {"ItemID", itemIdentifier},
                                                             {"VersionID", versionIdentifier}};
    self->writeMajorOSUpdatePrefs(state);
  });
}

bool UpdateController::majorOSUpdateHasDownloadedToPath(const std::string& path) {
  if (::geteuid() == 0) {
    TILL_LOG(1, "%@: Received notification of SetupHerald being downloaded by the daemon to: %@",
             kSpeaker, path);
    majorOSInstallQueue_->sync([this] {
      PlistDictionary state = readMajorOSUpdatePrefs();
      state.erase(std::string(kDaemonDownloadKey));
      writeMajorOSUpdatePrefs(state);
    });
    Result<void> requested = installDaemonConnection()->requestInstallationWithSetupHerald(
        path, std::string(kRootMountPoint), std::nullopt);
    if (!requested) {
      TILL_LOG(1, "%@: Error from Install Service: %@", kSpeaker, requested.errorDescription());
    }
    return true;
  }
  bool automatic = false;
  majorOSInstallQueue_->sync(
      [&] { automatic = readMajorOSUpdatePrefs().contains(kCurrentAutomaticDownloadKey); });
  if (automatic) {
    TILL_LOG(1,
             "%@: Received notification of SetupHerald being downloaded with integrated "
             "auto-launch mode, but we will tell it not to auto-launch because we have a current "
             "automatic download in our state.",
             kSpeaker);
  }
  return automatic;
}

void UpdateController::daemonDownloadHeartbeat() {
  const PlistDictionary* download = dictionaryOf(readMajorOSUpdatePrefs(), kDaemonDownloadKey);
  const std::uint64_t item = download ? valueOf(*download, "ItemID").uint64Value() : 0;
  if (item == 0) return;
  TILL_LOG(2, "%@: Heartbeat for MDM-pushed download with itemID: %llu", kSpeaker,
           static_cast<unsigned long long>(item));
  serviceProxy_->downloadService()->resumeDownloadWithItemIdentifier(item);
}

// --- The managed path ---

void UpdateController::downloadSetupHeraldForTags(
    const std::optional<std::vector<std::string>>& tags,
    const std::optional<std::string>& bundleIdentifier) {
  if (!tags || !bundleIdentifier) {
    TILL_LOG(1, "%@: MDM Major OS Update Install: Parameters not specified: %@ : %@", kSpeaker,
             tags ? tagsValue(*tags) : PlistValue(), bundleIdentifier.value_or("(null)"));
    return;
  }
  {
    MutexLock lock(majorOSLock_);
    lastMDMInstallProgress_ = PlistDictionary{{"bundleIdentifier", *bundleIdentifier}};
  }
  if (LedgerSoftwareProductRef product =
          softwareMap_->productForBundleIdentifier(*bundleIdentifier)) {
    TILL_LOG(1,
             "%@: MDM Major OS Update Install: The specified bundleID (%@) is already available. "
             "Going straight to install.",
             kSpeaker, *bundleIdentifier);
    startAdminInstallAtPath(product->bundlePath());
    return;
  }
  majorOSInstallQueue_->async(
      [weakSelf = weak_from_this(), tags = *tags, bundleIdentifier = *bundleIdentifier] {
        if (auto self = weakSelf.lock()) self->startMDMSetupHeraldInstall(tags, bundleIdentifier);
      });
}

void UpdateController::startMDMSetupHeraldInstall(const std::vector<std::string>& tags,
                                                  const std::string& bundleIdentifier) {
  if (tags.empty()) return;
  // Each failure ends the request: the manager asks again if it wants.
  std::optional<OSUpdateList> updates = waitForUpdatesForTags(tags);
  if (!updates) {
    TILL_LOG(1,
             "%@: MDM Major OS Update Install: Tags supplied were not evaluated by Sysup in time. "
             "Tags: %@",
             kSpeaker, tagsValue(tags));
    return;
  }
  if (updates->empty()) {
    TILL_LOG(1,
             "%@: MDM Major OS Update Install: Sysup couldn't match an update for the tags "
             "supplied. Tags: %@",
             kSpeaker, tagsValue(tags));
    return;
  }
  if (updates->size() > 1) {
    TILL_LOG(1,
             "%@: MDM Major OS Update Install: Sysup matched more than one update for the tags "
             "supplied. Updates: %@ Tags: %@",
             kSpeaker, productKeysValue(*updates), tagsValue(tags));
    return;
  }
  if (!AuthorizationController::sharedInstance().authorizeForSoftwareInstall()) {
    TILL_LOG(1, "%@: ERROR: Unable to authorize to install proposed Major OS Update. Aborting.",
             kSpeaker);
    return;
  }
  std::weak_ptr<UpdateController> weakSelf = weak_from_this();
  const SysupQuaymartUpdate update = updates->front();
  std::optional<MajorOSInstallCancelToken> token =
      SysupQuaymartUpdateController::sharedUpdateController().startInstallingUpdates(
          {update}, majorOSInstallQueue_, true,
          [weakSelf](const PlistDictionary& statusInfo, bool canCancel, double percent) {
            auto self = weakSelf.lock();
            if (!self) return;
            const bool downloading =
                stringOf(statusInfo, LedgerSoftwareUpdateStatus::kStatusInfoCurrentStateKey) ==
                "downloading";
            {
              MutexLock lock(self->majorOSLock_);
              self->lastMDMInstallProgress_["progress"] = percent;
              self->lastMDMInstallProgress_["state"] =
                  std::string(downloading ? "downloading" : "installing");
            }
            TILL_LOG(3, "%@: Admin requested Major OS Update install progress: %@", kSpeaker,
                     LedgerSoftwareUpdateStatus::initWithProgress(percent, statusInfo, canCancel)
                         .description());
          },
          [weakSelf, update, bundleIdentifier](const OptionalError& error) {
            if (auto self = weakSelf.lock()) {
              self->finishMDMSetupHeraldInstall(update, error, bundleIdentifier);
            }
          });
  setMajorOSInstallCancelToken(std::move(token));
}

void UpdateController::finishMDMSetupHeraldInstall(const SysupQuaymartUpdate& update,
                                                   const OptionalError& error,
                                                   const std::string& bundleIdentifier) {
  std::chrono::milliseconds pause;
  {
    MutexLock lock(majorOSLock_);
    lastMDMInstallProgress_["progress"] = 100.0;
    lastMDMInstallProgress_["state"] = std::string(error ? "failed" : "installed");
    if (error) lastMDMInstallProgress_["error"] = error->description;
    pause = setupHeraldDiscoveryPause_;
  }
  if (error) {
    TILL_LOG(1,
             "%@: Failed to install SetupHerald for admin requested Major OS Update %@ with error "
             "%@",
             kSpeaker, update.productKey(), error->descriptionText());
    return;
  }
  TILL_LOG(1,
           "%@: Finished installing SetupHerald for admin requested Major OS Update %@. Pausing "
           "briefly to ensure the resulting SH has been discovered by Lantern.",
           kSpeaker, update.productKey());
  setMajorOSInstallCancelToken(std::nullopt);
  auto lookUp = [weakSelf = weak_from_this(), bundleIdentifier] {
    auto self = weakSelf.lock();
    if (!self) return;
    self->majorOSInstallQueue_->async([weakSelf, bundleIdentifier] {
      auto controller = weakSelf.lock();
      if (!controller) return;
      LedgerSoftwareProductRef product =
          controller->softwareMap_->productForBundleIdentifier(bundleIdentifier);
      if (!product) {
        TILL_LOG(1,
                 "%@: ERROR: Could not find path for SetupHerald that we should have just "
                 "installed",
                 kSpeaker);
        return;
      }
      TILL_LOG(1, "%@: Starting SetupHerald at path %@", kSpeaker, product->bundlePath());
      controller->startAdminInstallAtPath(product->bundlePath());
    });
  };
  // A timer of the main run loop, not a wait on this queue: the queue stays
  // free for what comes meanwhile.
  RunLoop::main().addTimer(pause, false, std::move(lookUp));
}

PlistDictionary UpdateController::statusForSetupHeraldDownload() {
  PlistDictionary status;
  majorOSInstallQueue_->sync([&] {
    MutexLock lock(majorOSLock_);
    status = lastMDMInstallProgress_;
  });
  return status;
}

void UpdateController::startAdminInstallAtPath(const std::string& path) {
  majorOSInstallQueue_->async([weakSelf = weak_from_this(), path] {
    auto self = weakSelf.lock();
    if (!self) return;
    Result<void> requested = self->installDaemonConnection()->requestInstallationWithSetupHerald(
        path, std::string(kRootMountPoint), std::nullopt);
    if (!requested) {
      TILL_LOG(1, "%@: Error from Install Service: %@", kSpeaker, requested.errorDescription());
    }
  });
}

void UpdateController::managedOSInstallWakeUpReceived() {
  TILL_LOG(1,
           "%@: Received notice that a MDM-initiated Major OS Install is about to take place. "
           "Checking in with install daemon.",
           kSpeaker);
  installDaemonConnection()->agentIsActiveWithReply([weakSelf = weak_from_this()](bool active) {
    auto self = weakSelf.lock();
    if (!self || !active) return;
    TILL_LOG(1, "%@: Showing user notification to warn of an impending MDM-based OS Install",
             kSpeaker);
    self->notificationCatalogue_->postMajorOSUpdateMDMInstallNotification();
  });
}

void UpdateController::proceedWithMDMMajorOSInstall() {
  TILL_LOG(1, "%@: User approved MDM Major OS Install. Notifying daemon.", kSpeaker);
  Result<void> allowed = installDaemonConnection()->userHasAllowedInstallToProceed();
  if (!allowed) {
    TILL_LOG(1, "%@: Error from Install Service: %@", kSpeaker, allowed.errorDescription());
  }
}

// The service lives in this process (LedgerMajorOSInstallService): nothing
// interrupts it, so the interruption handler is there for the day it lives
// elsewhere; an invalidation does happen when the connection is ended.
std::shared_ptr<MajorOSInstallDaemonInterface> UpdateController::installDaemonConnection() {
  MutexLock lock(majorOSLock_);
  if (!installDaemonConnection_) {
    auto connection = std::make_shared<LedgerMajorOSInstallService>(
        std::string(LedgerMajorOSInstallService::kServiceName),
        LedgerMajorOSInstallService::kPrivilegedOption);
    std::weak_ptr<UpdateController> weakSelf = weak_from_this();
    std::weak_ptr<LedgerMajorOSInstallService> weakConnection = connection;
    // Only the connection that ended is dropped, never a newer one.
    auto drop = [weakSelf, weakConnection](std::string_view what) {
      TILL_LOG(1, "%@: Connection to Install Service was %@", kSpeaker, what);
      auto self = weakSelf.lock();
      if (!self) return;
      MutexLock dropLock(self->majorOSLock_);
      if (self->installDaemonConnection_ == weakConnection.lock()) {
        self->installDaemonConnection_.reset();
      }
    };
    connection->setInterruptionHandler([drop] { drop("interrupted"); });
    connection->setInvalidationHandler([drop] { drop("invalidated"); });
    installDaemonConnection_ = std::move(connection);
  }
  return installDaemonConnection_;
}

// --- Purchases by hand ---

bool UpdateController::willInteractivelyPurchaseItemIdentifier(std::uint64_t itemIdentifier) {
  const PlistDictionary state = readMajorOSUpdatePrefs();
  auto isItem = [&](const PlistDictionary& download) {
    return valueOf(download, kItemIDKey).uint64Value() == itemIdentifier;
  };
  if (const PlistDictionary* scheduled = dictionaryOf(state, kScheduledAutomaticDownloadKey)) {
    if (!isItem(*scheduled)) return false;
    TILL_LOG(1,
             "%@: User is manually purchasing the Major OS Update we had scheduled to "
             "automatically download.",
             kSpeaker);
    return true;
  }
  if (const PlistDictionary* current = dictionaryOf(state, kCurrentAutomaticDownloadKey)) {
    if (!isItem(*current)) return false;
    TILL_LOG(1,
             "%@: User is manually purchasing the Major OS Update we are currently automatically "
             "downloading. Pausing it so that the user's purchase can continue the download in "
             "the foreground.",
             kSpeaker);
    serviceProxy_->downloadService()->pauseDownloadWithItemIdentifier(itemIdentifier);
    return true;
  }
  return false;
}

void UpdateController::didInteractivelyPurchaseItemIdentifier(std::uint64_t itemIdentifier,
                                                              bool success) {
  majorOSInstallQueue_->async([weakSelf = weak_from_this(), itemIdentifier, success] {
    auto self = weakSelf.lock();
    if (!self) return;
    PlistDictionary state = self->readMajorOSUpdatePrefs();
    auto isItem = [&](const PlistDictionary* download) {
      return download && valueOf(*download, kItemIDKey).uint64Value() == itemIdentifier;
    };
    const PlistDictionary* scheduled = dictionaryOf(state, kScheduledAutomaticDownloadKey);
    const PlistDictionary* current = dictionaryOf(state, kCurrentAutomaticDownloadKey);
    const PlistDictionary* past = dictionaryOf(state, kPastDownloadsKey);
    const std::string itemKey = std::to_string(itemIdentifier);
    if (scheduled) {
      if (!isItem(scheduled) || !success) return;
      TILL_LOG(1,
               "%@: Interactive purchase of SH succeeded. Removing the pending automatic Major OS "
               "Update we had scheduled.",
               kSpeaker);
      state.erase(std::string(kScheduledAutomaticDownloadKey));
    } else if (isItem(current)) {
      if (!success) {
        TILL_LOG(1,
                 "%@: Interactive purchase of SH did not succeed. Leaving previous automatic "
                 "download paused.",
                 kSpeaker);
        return;
      }
      TILL_LOG(1,
               "%@: Interactive purchase of SH succeeded. Removing our record of the automatic "
               "download.",
               kSpeaker);
      state.erase(std::string(kCurrentAutomaticDownloadKey));
    } else if (past && past->contains(itemKey)) {
      TILL_LOG(1,
               "%@: Interactive purchase of SH succeeded. Removing our record of the automatic "
               "download in PastDownloads.",
               kSpeaker);
      PlistDictionary remaining = *past;
      remaining.erase(itemKey);
      state[std::string(kPastDownloadsKey)] = std::move(remaining);
    } else {
      return;
    }
    self->writeMajorOSUpdatePrefs(state);
  });
}

}  // namespace larder
