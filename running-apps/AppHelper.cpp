#include "running-apps/AppHelper.h"

#include <algorithm>
#include <thread>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "platform/system/ApplicationRegistry.h"
#include "platform/system/Bundle.h"
#include "running-apps/PlugInHost.h"
#include "running-apps/QuitAppDialogPrompt.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/core/PreferenceKeys.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/host/LedgerTraceMessage.h"
#include "store-runtime/host/PreferenceStore.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "AppHelper";
constexpr std::string_view kTerminationTraceDomain = "com.orvane.Quaymart.autoupdate.terminate_app";
constexpr std::string_view kOwnIdentifierPrefix = "com.orvane.";
constexpr std::string_view kThirdPartyApp = "Third Party App";
// These three are one product as far as a take-down goes: quitting one of
// them while another keeps its files open would leave the update half done.
constexpr std::string_view kReelcutIdentifier = "com.orvane.ReelcutApp";
constexpr std::string_view kReelcutCompanions[] = {"com.orvane.Reelcut7", "com.orvane.Reelcut8"};
// The value the desktop would be asked to activate an application with.
constexpr unsigned kActivateIgnoringOtherApps = 2;

std::string describeApplications(const std::vector<std::shared_ptr<RunningApplication>>& apps) {
  std::string text = "(";
  for (const auto& application : apps) {
    if (text.size() > 1) text += ", ";
    text += application->description();
  }
  return text + ")";
}

std::string describeStrings(const std::vector<std::string>& strings) {
  std::string text = "(";
  for (const std::string& string : strings) {
    if (text.size() > 1) text += ", ";
    text += string;
  }
  return text + ")";
}

std::string describeHolds(const std::vector<std::shared_ptr<PlugInHold>>& holds) {
  std::string text = "(";
  for (const auto& hold : holds) {
    if (text.size() > 1) text += ", ";
    text += hold->bundlePath();
  }
  return text + ")";
}

// Every bundle in the application folders with that identifier, in the
// registry's order.
bool isInApplicationFolder(const std::string& path) {
  for (const std::string& folder : ApplicationRegistry::applicationFolders()) {
    if (path.size() > folder.size() && path.starts_with(folder) && path[folder.size()] == '/') {
      return true;
    }
  }
  return false;
}

// The installed bundles of the identifier whose plug-ins could refuse a
// hold. A hold on a bundle without a busy plug-in is granted and gives the
// question nothing, so only the bundles that hold a busy plug-in are looked
// at: one read of the plug-in host's state instead of opening every bundle
// of the application folders, and no hold written for the others.
std::vector<std::string> bundlePathsForIdentifier(std::string_view bundleIdentifier,
                                                  const std::vector<std::string>& busyContainers) {
  std::vector<std::string> paths;
  for (const std::string& path : busyContainers) {
    if (!isInApplicationFolder(path)) continue;
    std::optional<Bundle> bundle = Bundle::open(path);
    if (bundle && bundle->identifier() == bundleIdentifier) paths.push_back(path);
  }
  return paths;
}

struct HoldAnswer {
  std::shared_ptr<PlugInHold> hold;
  std::optional<VendError> error;
};

// The plug-in host answers on another thread; the callers here need the
// answer in line.
HoldAnswer holdPlugInsAndWait(const std::string& bundlePath) {
  auto done = std::make_shared<DispatchSemaphore>();
  auto answer = std::make_shared<HoldAnswer>();
  PlugInHost::holdPlugInsInApplication(
      bundlePath, [done, answer](std::shared_ptr<PlugInHold> hold, std::optional<VendError> error) {
        answer->hold = std::move(hold);
        answer->error = std::move(error);
        done->signal();
      });
  done->wait();
  return std::move(*answer);
}

bool isFileBrowserExtension(const std::string& plugInPath) {
  return PlugInHost::extensionPointOfPlugIn(plugInPath) == PlugInHost::kFileBrowserExtensionPoint;
}

// The quit request travels as the two halves of the serial number, the way
// the store's event helper takes it, and becomes SIGTERM here.
void sendQuitRequest(RunningApplication& application, ApplicationSerialNumber serialNumber) {
  const PlistDictionary message{
      {"highLongOfPSN", static_cast<std::uint64_t>(serialNumber.high)},
      {"lowLongOfPSN", static_cast<std::uint64_t>(serialNumber.low)},
  };
  TILL_LOG(3, "%@: Quit request %@", kSpeaker, PlistValue(message));
  if (!application.requestQuit()) {
    TILL_LOG(2, "%@: Error from StoreEventService - %@", kSpeaker,
             "the quit request could not be delivered to " + application.description());
  }
}

bool contains(const std::vector<std::shared_ptr<RunningApplication>>& applications,
              const std::shared_ptr<RunningApplication>& application) {
  return std::find(applications.begin(), applications.end(), application) != applications.end();
}

void erase(std::vector<std::shared_ptr<RunningApplication>>& applications,
           const std::shared_ptr<RunningApplication>& application) {
  std::erase(applications, application);
}

}  // namespace

// --- Questions about one bundle identifier ---

AppHelper::Survey AppHelper::Survey::take() {
  Survey survey;
  for (std::shared_ptr<RunningApplication>& application :
       RunningApplication::allRunningApplications()) {
    if (application->bundleIdentifier()) {
      survey.running_.emplace(*application->bundleIdentifier(), std::move(application));
    }
  }
  survey.busyPlugInContainers_ = PlugInHost::containingPathsOfBusyPlugIns();
  return survey;
}

std::vector<std::shared_ptr<RunningApplication>>
AppHelper::Survey::applicationsWithBundleIdentifier(std::string_view bundleIdentifier) const {
  std::vector<std::shared_ptr<RunningApplication>> applications;
  auto [first, last] = running_.equal_range(bundleIdentifier);
  for (auto it = first; it != last; ++it) applications.push_back(it->second);
  return applications;
}

bool AppHelper::isAppRunningWithBundleID(std::string_view bundleIdentifier,
                                         std::optional<std::string>* appName,
                                         std::optional<PlugInHostApps>* plugInHostApps) {
  if (bundleIdentifier.empty()) return false;
  return isAppRunningWithBundleID(bundleIdentifier, appName, plugInHostApps, Survey::take());
}

bool AppHelper::isAppRunningWithBundleID(std::string_view bundleIdentifier,
                                         std::optional<std::string>* appName,
                                         std::optional<PlugInHostApps>* plugInHostApps,
                                         const Survey& survey) {
  if (bundleIdentifier.empty()) return false;
  Applications running = survey.applicationsWithBundleIdentifier(bundleIdentifier);
  const bool isRunning = !running.empty();
  if (isRunning && appName) *appName = running.front()->localizedName();
  for (const std::string& bundlePath :
       bundlePathsForIdentifier(bundleIdentifier, survey.busyPlugInContainers())) {
    HoldAnswer answer = holdPlugInsAndWait(bundlePath);
    // Only a probe: a hold that was granted goes at once.
    if (answer.hold) PlugInHost::releaseHold(answer.hold);
    if (!answer.error) continue;
    TILL_LOG(3, "%@:holdPlugInsInApplication returned error %@", kSpeaker,
             answer.error->descriptionText());
    if (!isRunning) {
      TILL_LOG(2,
               "%@: Application with bundleID %@ is not running, but has an active plugin "
               "running in the bundle at %@",
               kSpeaker, bundleIdentifier, bundlePath);
    }
    if (plugInHostApps) {
      *plugInHostApps = getPluginHostAppInfo(answer.error->userInfo, bundleIdentifier);
    }
    return true;
  }
  return isRunning;
}

std::optional<PlugInHostApps> AppHelper::getPluginHostAppInfo(const PlistDictionary& holdErrorInfo,
                                                              std::string_view containerBundleID) {
  auto busy = holdErrorInfo.find(PlugInHost::kErrorKeyBusyPlugIns);
  if (busy == holdErrorInfo.end() || !busy->second.array()) return std::nullopt;
  PlugInHostApps hosts;
  for (const PlistValue& element : *busy->second.array()) {
    auto pid = static_cast<pid_t>(element[PlugInHost::kServicePidKey].int64Value());
    if (pid == 0) {
      const std::string* plugInIdentifier =
          element[PlugInHost::kPlugInBundleIdentifierKey].string();
      const std::string* plugInPath = element[PlugInHost::kPlugInPathKey].string();
      if (plugInIdentifier && plugInPath) {
        for (const auto& application :
             RunningApplication::runningApplicationsWithBundleIdentifier(*plugInIdentifier)) {
          if (application->bundleURL() == *plugInPath) {
            pid = application->pid();
            break;
          }
        }
      }
      if (pid == 0) {
        TILL_LOG(3, "%@:Skipping- no service-pid %@", kSpeaker, element);
        continue;
      }
    }
    const PlistValue info(PlugInHost::informationForPlugInWithPid(pid));
    const std::string* containing = info[PlugInHost::kContainingIdentifierKey].string();
    if (!containing || *containing != containerBundleID) continue;
    TILL_LOG(3, "%@:PluginInfo %@", kSpeaker, info);
    const std::string* host = info[PlugInHost::kHostBundleIdentifierKey].string();
    if (host && *host == containerBundleID) {
      TILL_LOG(3, "%@:Skipping because the container is also the host %@", kSpeaker, info);
      continue;
    }
    const std::string* hostPath = info[PlugInHost::kHostPathKey].string();
    if (!hostPath) {
      TILL_LOG(3, "%@:Skipping- no host path %@", kSpeaker, info);
      continue;
    }
    const std::string* plugInPath = info[PlugInHost::kPlugInPathKey].string();
    if (!plugInPath) {
      TILL_LOG(3, "%@:Skipping- no plugin path %@", kSpeaker, info);
      continue;
    }
    if (isFileBrowserExtension(*plugInPath)) {
      TILL_LOG(3, "%@:Skipping FilewalkerSync at %@", kSpeaker, *plugInPath);
      continue;
    }
    hosts[RunningApplication::displayNameOfBundle(*hostPath)] = *info.dictionary();
  }
  if (hosts.empty()) return std::nullopt;
  return hosts;
}

const std::vector<std::string>& AppHelper::immortalAppBundleIDWhiteList() {
  static const std::vector<std::string> whiteList = {
      "com.orvane.quaymart",      "com.orvane.signinscreen",  "com.orvane.statusbarserver",
      "com.orvane.twilightagent", "com.orvane.SonorelHelper", "com.orvane.OrvaneSpell",
  };
  return whiteList;
}

bool AppHelper::isRunningAppImmortalWhiteListed(const RunningApplication& application) {
  if (!application.bundleIdentifier() || !application.launchDate()) return true;
  if (application.bundleURL() && application.bundleURL()->starts_with("/System/")) return true;
  const auto& whiteList = immortalAppBundleIDWhiteList();
  return std::find(whiteList.begin(), whiteList.end(), *application.bundleIdentifier()) !=
         whiteList.end();
}

bool AppHelper::isAppImmortalWithBundleID(std::string_view bundleIdentifier,
                                          std::optional<std::string>* reason,
                                          std::optional<std::string>* appName) {
  if (bundleIdentifier.empty()) return false;
  for (const auto& application :
       RunningApplication::runningApplicationsWithBundleIdentifier(bundleIdentifier)) {
    if (isRunningAppImmortalWhiteListed(*application)) continue;
    std::optional<std::string> why = application->reasonThatQuittingWillBeNoisyOrLoseData();
    if (!why) continue;
    if (reason) *reason = std::move(why);
    if (appName) *appName = application->localizedName();
    return true;
  }
  if (reason) *reason = std::nullopt;
  if (appName) *appName = std::nullopt;
  return false;
}

bool AppHelper::isAppForemostWithBundleID(std::string_view bundleIdentifier,
                                          std::optional<std::string>* appName) {
  if (bundleIdentifier.empty()) return false;
  for (const auto& application :
       RunningApplication::runningApplicationsWithBundleIdentifier(bundleIdentifier)) {
    if (!application->isActive()) continue;
    if (appName) *appName = application->localizedName();
    return true;
  }
  return false;
}

void AppHelper::relaunchAppWithBundleID(const std::optional<std::string>& bundleIdentifier) {
  if (!bundleIdentifier) return;
  std::optional<std::string> path = ApplicationRegistry::pathForBundleIdentifier(*bundleIdentifier);
  if (!path) {
    TILL_LOG(1, "%@: No application with bundleID %@ to relaunch", kSpeaker, *bundleIdentifier);
    return;
  }
  relaunchAppWithBundleURL(path);
}

void AppHelper::relaunchAppWithBundleURL(const std::optional<std::string>& bundleURL) {
  if (!bundleURL) return;
  // Started in the background: nothing here brings an application forward.
  Result<pid_t> launched = RunningApplication::launchBundle(*bundleURL);
  if (!launched) {
    TILL_LOG(2, "%@: relaunchAppWithBundleURL:%@ failed with error %@", kSpeaker, *bundleURL,
             launched.error().descriptionText());
  }
}

// --- Making a take-down ---

AppHelper::AppHelper(std::vector<std::string> bundleIdentifiers, VendStoreClient storeClient)
    : bundleIdentifiers_(std::move(bundleIdentifiers)), storeClient_(std::move(storeClient)) {}

std::shared_ptr<AppHelper> AppHelper::initWithBundleIdentifier(std::string bundleIdentifier,
                                                               VendStoreClient storeClient) {
  return initWithBundleIdentifiers({std::move(bundleIdentifier)}, std::move(storeClient));
}

std::shared_ptr<AppHelper> AppHelper::initWithBundleIdentifiers(
    std::vector<std::string> bundleIdentifiers, VendStoreClient storeClient) {
  return std::shared_ptr<AppHelper>(
      new AppHelper(std::move(bundleIdentifiers), std::move(storeClient)));
}

std::shared_ptr<AppHelper> AppHelper::initWithRunningApplications(
    std::vector<std::shared_ptr<RunningApplication>> applications, VendStoreClient storeClient) {
  std::shared_ptr<AppHelper> helper(new AppHelper({}, std::move(storeClient)));
  MutexLock lock(helper->mutex_);
  helper->appsToTerminate_ = std::move(applications);
  return helper;
}

std::shared_ptr<AppHelper> AppHelper::initWithAllRunningApplicationsIgnoringWhitelistedApps(
    bool ignoreWhitelisted, VendStoreClient storeClient) {
  Applications applications = RunningApplication::allRunningApplications();
  if (ignoreWhitelisted) {
    std::erase_if(applications, [](const std::shared_ptr<RunningApplication>& application) {
      return isRunningAppImmortalWhiteListed(*application);
    });
  }
  TILL_LOG(2,
           "%@: initWithAllRunningApplicationsIgnoringWhitelistedApps:%i has the following "
           "apps to terminate: %@",
           kSpeaker, ignoreWhitelisted, describeApplications(applications));
  return initWithRunningApplications(std::move(applications), std::move(storeClient));
}

// --- The take-down ---

bool AppHelper::ensureAppsAreNotRunningWithPromptToConfirm(bool promptToConfirm) {
  // Nothing on this platform quits applications on its own behalf, but the
  // pause stays: applications that were just told to go get the time to.
  std::this_thread::sleep_for(timing().settle);
  if (!bundleIdentifiers_.empty()) {
    std::vector<std::string> identifiers = bundleIdentifiers_;
    if (std::find(identifiers.begin(), identifiers.end(), kReelcutIdentifier) !=
        identifiers.end()) {
      identifiers.insert(identifiers.end(), std::begin(kReelcutCompanions),
                         std::end(kReelcutCompanions));
    }
    Applications applications;
    for (const std::string& identifier : identifiers) {
      Applications found = RunningApplication::runningApplicationsWithBundleIdentifier(identifier);
      applications.insert(applications.end(), found.begin(), found.end());
    }
    MutexLock lock(mutex_);
    appsToTerminate_ = std::move(applications);
  }
  return terminateApplicationsWithPromptToConfirm(promptToConfirm);
}

bool AppHelper::terminateApplicationsWithPromptToConfirm(bool promptToConfirm) {
  {
    MutexLock lock(mutex_);
    terminatedApps_.clear();
    immortalRunningApplications_.clear();
    skippedAppBundleIdentifiers_.clear();
    if (appsToTerminate_.empty()) return true;
    // Those that would lose data are asked about first, while the user
    // still pays attention; those without a bundle last.
    std::stable_sort(appsToTerminate_.begin(), appsToTerminate_.end(),
                     [](const auto& left, const auto& right) {
                       bool leftNoisy = left->quittingWillBeNoisyOrLoseData();
                       bool rightNoisy = right->quittingWillBeNoisyOrLoseData();
                       if (leftNoisy != rightNoisy) return leftNoisy;
                       return left->bundleURL().has_value() && !right->bundleURL().has_value();
                     });
  }
  while (true) {
    Applications pass;
    {
      MutexLock lock(mutex_);
      if (appsToTerminate_.empty()) break;
      pass = appsToTerminate_;
    }
    std::vector<std::uint64_t> tokens = observeTermination(pass);
    PromptOutcome outcome = askToQuit(promptToConfirm);
    if (outcome == PromptOutcome::kTerminate) {
      const bool alwaysForceTerminate =
          PreferenceStore::booleanForKey(kDefaultsAlwaysForceTerminateAppsKey, kDaemonDefaultsID)
              .value_or(false);
      terminateEach(alwaysForceTerminate);
    }
    stopObservingTermination(pass, tokens);
    // Without a prompt there is one pass; with one, what would not go is
    // offered to the user again.
    if (outcome != PromptOutcome::kTerminate || !promptToConfirm) break;
  }
  MutexLock lock(mutex_);
  return appsToTerminate_.empty();
}

AppHelper::PromptOutcome AppHelper::askToQuit(bool promptToConfirm) {
  if (!promptToConfirm) return PromptOutcome::kTerminate;
  std::shared_ptr<AppHelperQuitPrompt> prompt;
  Applications appsToQuit;
  bool allowSkip = false;
  std::vector<SysupQuaymartUpdate> updates;
  {
    MutexLock lock(mutex_);
    // Made on first use: most take-downs never ask.
    if (!quitPrompt_) quitPrompt_ = std::make_shared<QuitAppDialogPrompt>(storeClient_);
    prompt = quitPrompt_;
    quitPromptShowing_ = true;
    appsToQuit = appsToTerminate_;
    allowSkip = allowUserToSkipApps_;
    updates = osUpdates_;
  }
  TILL_LOG(2, "%@: Asking the user to quit %@", kSpeaker, describeApplications(appsToQuit));
  bool didForceFinish = false;
  AppHelperQuitPrompt::Answer answer = prompt->run(appsToQuit, allowSkip, updates, &didForceFinish);
  MutexLock lock(mutex_);
  quitPromptShowing_ = false;
  switch (answer) {
    case AppHelperQuitPrompt::Answer::kNone:
      // Taken down because an application quit by itself: the user had
      // nothing against quitting, so the rest go too.
      return didForceFinish ? PromptOutcome::kTerminate : PromptOutcome::kStop;
    case AppHelperQuitPrompt::Answer::kCancel:
      return PromptOutcome::kStop;
    case AppHelperQuitPrompt::Answer::kSkip:
      if (!allowUserToSkipApps_) return PromptOutcome::kTerminate;
      for (const auto& application : appsToTerminate_) {
        if (application->bundleIdentifier()) {
          skippedAppBundleIdentifiers_.push_back(*application->bundleIdentifier());
        }
      }
      appsToTerminate_.clear();
      return PromptOutcome::kSkipped;
    case AppHelperQuitPrompt::Answer::kQuit:
      return PromptOutcome::kTerminate;
  }
  return PromptOutcome::kStop;
}

void AppHelper::terminateEach(bool alwaysForceTerminate) {
  Applications applications;
  {
    MutexLock lock(mutex_);
    applications = appsToTerminate_;
  }
  for (const auto& application : applications) {
    if (alwaysForceTerminate || application->isStoppedInApplicationRegistry() ||
        application->isProxied()) {
      TILL_LOG(2, "%@: Calling forceTerminate on app %@ because it's AR Stopped or TAL proxied",
               kSpeaker, application);
      // Out of the list before the kill, so that its termination is not
      // counted as a quit to undo.
      {
        MutexLock lock(mutex_);
        erase(appsToTerminate_, application);
      }
      if (!application->forceTerminate()) {
        TILL_LOG(2, "%@: forceTerminate returned NO for app %@", kSpeaker, application);
      }
      continue;
    }
    if (application->isTerminated()) continue;
    Result<ApplicationSerialNumber> serialNumber = application->applicationSerialNumber();
    if (!serialNumber) {
      TILL_LOG(2, "%@: Failed to get ProcessSerialNumber for %@", kSpeaker, application);
      continue;
    }
    if (!quitAndWait(application, *serialNumber)) break;
  }
}

bool AppHelper::quitAndWait(const std::shared_ptr<RunningApplication>& application,
                            ApplicationSerialNumber serialNumber) {
  auto semaphore = std::make_shared<DispatchSemaphore>();
  {
    MutexLock lock(mutex_);
    terminationWaitSemaphore_ = semaphore;
    terminationWaitApp_ = application;
    // It may have gone, and been reported, since the pass looked at it.
    if (!contains(appsToTerminate_, application)) semaphore->signal();
  }
  TILL_LOG(2, "%@: Attempting to terminate %@", kSpeaker, application);
  sendQuitRequest(*application, serialNumber);
  application->activateWithOptions(kActivateIgnoringOtherApps);
  const bool terminated = semaphore->waitFor(terminationWaitTimeout());
  if (!terminated) {
    TILL_LOG(2, "%@: Timeout waiting for %@ to terminate", kSpeaker, application);
    messageTraceTermination(application->bundleIdentifier(), false, true);
    MutexLock lock(mutex_);
    immortalRunningApplications_.push_back(application);
    terminationWaitApp_.reset();
    terminationWaitSemaphore_.reset();
    return false;
  }
  TILL_LOG(2, "%@: %@ did terminate", kSpeaker, application);
  messageTraceTermination(application->bundleIdentifier(), true, false);
  {
    MutexLock lock(mutex_);
    erase(immortalRunningApplications_, application);
    if (application->bundleURL()) {
      if (!relaunchBundleURLs_) relaunchBundleURLs_.emplace();
      relaunchBundleURLs_->push_back(*application->bundleURL());
    }
  }
  holdPlugInsAfterTermination(application);
  MutexLock lock(mutex_);
  terminationWaitApp_.reset();
  terminationWaitSemaphore_.reset();
  return true;
}

void AppHelper::holdPlugInsAfterTermination(
    const std::shared_ptr<RunningApplication>& application) {
  if (!application->bundleURL()) return;
  HoldAnswer answer = holdPlugInsAndWait(*application->bundleURL());
  handleHoldAfterTermination(application, std::move(answer.hold), answer.error);
}

void AppHelper::handleHoldAfterTermination(const std::shared_ptr<RunningApplication>& application,
                                           std::shared_ptr<PlugInHold> hold,
                                           const std::optional<VendError>& error) {
  if (hold) {
    // Kept until the applications come back, so that no plug-in of the
    // bundle starts while it is being replaced.
    MutexLock lock(mutex_);
    pluginHoldsToRelease_.push_back(std::move(hold));
    return;
  }
  if (!error) return;
  const PlistValue userInfo(error->userInfo);
  const PlistValue& busyValue = userInfo[PlugInHost::kErrorKeyBusyPlugIns];
  const PlistArray busy = busyValue.array() ? *busyValue.array() : PlistArray{};
  std::size_t ignored = 0;
  for (const PlistValue& element : busy) {
    const std::string* plugInPath = element[PlugInHost::kPlugInPathKey].string();
    if (plugInPath && isFileBrowserExtension(*plugInPath)) {
      TILL_LOG(2, "%@: Ignoring busy FilewalkerSync extension at %@", kSpeaker, *plugInPath);
      ++ignored;
    }
  }
  if (ignored >= busy.size()) return;
  // The application has gone, but something still runs from its bundle.
  TILL_LOG(2, "%@: At least one busy plugin is blocking the app at: %@", kSpeaker,
           application->bundleURL());
  MutexLock lock(mutex_);
  immortalRunningApplications_.push_back(application);
  if (!contains(appsToTerminate_, application)) appsToTerminate_.push_back(application);
}

std::vector<std::uint64_t> AppHelper::observeTermination(const Applications& applications) {
  std::vector<std::uint64_t> tokens;
  std::weak_ptr<AppHelper> weakSelf = weak_from_this();
  for (const auto& application : applications) {
    tokens.push_back(application->addTerminationObserver(
        [weakSelf](const std::shared_ptr<RunningApplication>& terminated) {
          if (std::shared_ptr<AppHelper> self = weakSelf.lock()) {
            self->applicationDidTerminate(terminated);
          }
        }));
  }
  return tokens;
}

void AppHelper::stopObservingTermination(const Applications& applications,
                                         const std::vector<std::uint64_t>& tokens) {
  for (std::size_t index = 0; index < applications.size() && index < tokens.size(); ++index) {
    applications[index]->removeTerminationObserver(tokens[index]);
  }
}

void AppHelper::applicationDidTerminate(const std::shared_ptr<RunningApplication>& application) {
  std::shared_ptr<AppHelperQuitPrompt> promptToFinish;
  std::shared_ptr<DispatchSemaphore> semaphoreToSignal;
  {
    MutexLock lock(mutex_);
    if (!contains(appsToTerminate_, application)) return;
    terminatedApps_.push_back(application);
    erase(appsToTerminate_, application);
    if (quitPromptShowing_) promptToFinish = quitPrompt_;
    if (terminationWaitApp_ == application) semaphoreToSignal = terminationWaitSemaphore_;
  }
  TILL_LOG(3, "%@: %@ has terminated", kSpeaker, application);
  // An application that quit by itself takes the question down: the user
  // is not asked about what is left.
  if (promptToFinish) promptToFinish->forceFinish();
  if (semaphoreToSignal) semaphoreToSignal->signal();
}

void AppHelper::messageTraceTermination(const std::optional<std::string>& bundleIdentifier,
                                        bool terminatedSuccessfully, bool didTimeout) {
  (void)didTimeout;  // the failure says as much; the trace keeps one flag
  PlistDictionary message{{"terminated_successfully", terminatedSuccessfully}};
  if (bundleIdentifier) {
    // Names of other developers' applications stay on the machine.
    const bool named =
        bundleIdentifier->starts_with(kOwnIdentifierPrefix) && !terminatedSuccessfully;
    message["bundle_id"] = named ? *bundleIdentifier : std::string(kThirdPartyApp);
  }
  LedgerTraceMessage(kTerminationTraceDomain, message);
  TILL_LOG(2, "%@: Message trace app termination %@", kSpeaker, PlistValue(message));
}

// --- After the take-down ---

void AppHelper::relaunchTerminatedApps() {
  std::vector<std::string> bundleURLs;
  std::vector<std::shared_ptr<PlugInHold>> holds;
  {
    MutexLock lock(mutex_);
    if (relaunchBundleURLs_) bundleURLs = *relaunchBundleURLs_;
    holds = pluginHoldsToRelease_;
  }
  if (bundleURLs.empty() && holds.empty()) return;
  TILL_LOG(2,
           "%@: Re-launching previously terminated applications %@ and releasing plugin kit "
           "holds %@",
           kSpeaker, describeStrings(bundleURLs), describeHolds(holds));
  for (const std::string& bundleURL : bundleURLs) {
    Result<pid_t> launched = RunningApplication::launchBundle(bundleURL);
    if (!launched) {
      TILL_LOG(3, "%@: Could not relaunch %@: %@", kSpeaker, bundleURL,
               launched.error().descriptionText());
    }
  }
  for (const auto& hold : holds) PlugInHost::releaseHold(hold);
}

bool AppHelper::needsRelaunch() const {
  MutexLock lock(mutex_);
  return !terminatedApps_.empty() || !pluginHoldsToRelease_.empty();
}

void AppHelper::setQuitPrompt(std::shared_ptr<AppHelperQuitPrompt> prompt) {
  MutexLock lock(mutex_);
  quitPrompt_ = std::move(prompt);
}

bool AppHelper::allowUserToSkipApps() const {
  MutexLock lock(mutex_);
  return allowUserToSkipApps_;
}

void AppHelper::setAllowUserToSkipApps(bool allow) {
  MutexLock lock(mutex_);
  allowUserToSkipApps_ = allow;
}

std::vector<SysupQuaymartUpdate> AppHelper::osUpdates() const {
  MutexLock lock(mutex_);
  return osUpdates_;
}

void AppHelper::setOsUpdates(std::vector<SysupQuaymartUpdate> updates) {
  MutexLock lock(mutex_);
  osUpdates_ = std::move(updates);
}

std::vector<std::string> AppHelper::skippedAppBundleIdentifiers() const {
  MutexLock lock(mutex_);
  return skippedAppBundleIdentifiers_;
}

std::vector<std::shared_ptr<RunningApplication>> AppHelper::immortalRunningApplications() const {
  MutexLock lock(mutex_);
  return immortalRunningApplications_;
}

std::vector<std::string> AppHelper::terminatedAppBundleURLs() const {
  MutexLock lock(mutex_);
  std::vector<std::string> bundleURLs;
  for (const auto& application : terminatedApps_) {
    if (application->bundleURL()) bundleURLs.push_back(*application->bundleURL());
  }
  return bundleURLs;
}

void AppHelper::setTiming(Timing timing) {
  MutexLock lock(mutex_);
  timing_ = timing;
}

AppHelper::Timing AppHelper::timing() const {
  MutexLock lock(mutex_);
  return timing_;
}

std::chrono::milliseconds AppHelper::terminationWaitTimeout() const {
  Timing current = timing();
  return LedgerIsDimWake() ? current.dimWakeQuitTimeout : current.quitTimeout;
}

}  // namespace larder
