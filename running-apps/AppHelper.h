#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "running-apps/RunningApplication.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"

namespace larder {

class DispatchSemaphore;
class PlugInHold;

// The display name of each application that uses a busy plug-in, to what
// the plug-in host knows of that plug-in (its containing bundle's path among
// it).
using PlugInHostApps = std::map<std::string, PlistDictionary>;

// What a take-down shows the user before it quits applications. A helper
// asks the quit dialog (QuitAppDialogPrompt) unless it was given another
// prompt; with no dialog agent to show it, the dialog comes back cancelled.
class AppHelperQuitPrompt {
 public:
  enum class Answer { kNone, kQuit, kSkip, kCancel };
  virtual ~AppHelperQuitPrompt() = default;
  // Blocks until the user answers or `forceFinish` is called (then kNone
  // with `didForceFinish` true).
  virtual Answer run(const std::vector<std::shared_ptr<RunningApplication>>& appsToQuit,
                     bool allowUserToSkip, const std::vector<SysupQuaymartUpdate>& osUpdates,
                     bool* didForceFinish) = 0;
  // Takes the dialog down without an answer: an application quit by itself.
  // Called on the thread that saw the application go; it may arrive just
  // after `run` returned with an answer, and is then to be ignored.
  virtual void forceFinish() = 0;
};

// Stands between the update machinery and the applications the user has
// open. The class operations answer questions about one bundle identifier;
// an instance takes a set of applications out of the way (asking the user
// first when told to), keeps them from coming back through their plug-ins,
// and starts them again afterwards.
class AppHelper : public std::enable_shared_from_this<AppHelper> {
 public:
  // What runs and which bundles hold busy plug-ins, looked at once: a pass
  // that asks about many bundle identifiers in a moment asks it, instead of
  // scanning the processes and reading the plug-in host for each.
  class Survey {
   public:
    static Survey take();
    [[nodiscard]] std::vector<std::shared_ptr<RunningApplication>> applicationsWithBundleIdentifier(
        std::string_view bundleIdentifier) const;
    [[nodiscard]] const std::vector<std::string>& busyPlugInContainers() const {
      return busyPlugInContainers_;
    }

   private:
    std::multimap<std::string, std::shared_ptr<RunningApplication>, std::less<>> running_;
    std::vector<std::string> busyPlugInContainers_;
  };

  // --- Questions about one bundle identifier; any thread ---
  static bool isAppRunningWithBundleID(std::string_view bundleIdentifier,
                                       std::optional<std::string>* appName,
                                       std::optional<PlugInHostApps>* plugInHostApps);
  // The same question answered from a survey taken a moment ago.
  static bool isAppRunningWithBundleID(std::string_view bundleIdentifier,
                                       std::optional<std::string>* appName,
                                       std::optional<PlugInHostApps>* plugInHostApps,
                                       const Survey& survey);
  static std::optional<PlugInHostApps> getPluginHostAppInfo(const PlistDictionary& holdErrorInfo,
                                                            std::string_view containerBundleID);
  static const std::vector<std::string>& immortalAppBundleIDWhiteList();
  static bool isRunningAppImmortalWhiteListed(const RunningApplication& application);
  static bool isAppImmortalWithBundleID(std::string_view bundleIdentifier,
                                        std::optional<std::string>* reason,
                                        std::optional<std::string>* appName);
  static bool isAppForemostWithBundleID(std::string_view bundleIdentifier,
                                        std::optional<std::string>* appName);
  // Start the application without bringing it forward; nothing for nullopt.
  static void relaunchAppWithBundleID(const std::optional<std::string>& bundleIdentifier);
  static void relaunchAppWithBundleURL(const std::optional<std::string>& bundleURL);

  // --- Making a take-down ---
  static std::shared_ptr<AppHelper> initWithBundleIdentifier(std::string bundleIdentifier,
                                                             VendStoreClient storeClient);
  static std::shared_ptr<AppHelper> initWithBundleIdentifiers(
      std::vector<std::string> bundleIdentifiers, VendStoreClient storeClient);
  static std::shared_ptr<AppHelper> initWithRunningApplications(
      std::vector<std::shared_ptr<RunningApplication>> applications, VendStoreClient storeClient);
  static std::shared_ptr<AppHelper> initWithAllRunningApplicationsIgnoringWhitelistedApps(
      bool ignoreWhitelisted, VendStoreClient storeClient);

  // True when nothing is left to terminate. Blocks for the prompt and for
  // each application's quit.
  bool ensureAppsAreNotRunningWithPromptToConfirm(bool promptToConfirm);
  void relaunchTerminatedApps();
  [[nodiscard]] bool needsRelaunch() const;

  // Replaces the quit dialog; for tests.
  void setQuitPrompt(std::shared_ptr<AppHelperQuitPrompt> prompt);
  [[nodiscard]] bool allowUserToSkipApps() const;
  void setAllowUserToSkipApps(bool allow);
  [[nodiscard]] std::vector<SysupQuaymartUpdate> osUpdates() const;
  void setOsUpdates(std::vector<SysupQuaymartUpdate> updates);
  [[nodiscard]] std::vector<std::string> skippedAppBundleIdentifiers() const;
  [[nodiscard]] std::vector<std::shared_ptr<RunningApplication>> immortalRunningApplications()
      const;
  [[nodiscard]] std::vector<std::string> terminatedAppBundleURLs() const;
  [[nodiscard]] const VendStoreClient& storeClient() const { return storeClient_; }

  // How long a take-down pauses and waits. Tests shorten them; the service
  // keeps the defaults.
  struct Timing {
    // The pause before a take-down looks at what runs.
    std::chrono::milliseconds settle{1000};
    // The wait for one application to obey a quit request.
    std::chrono::milliseconds quitTimeout{20000};
    // The same while the machine is in a dim wake, when applications are
    // slower to react.
    std::chrono::milliseconds dimWakeQuitTimeout{60000};
  };
  void setTiming(Timing timing);
  [[nodiscard]] Timing timing() const;
  // The wait for one application's quit as the machine stands now.
  [[nodiscard]] std::chrono::milliseconds terminationWaitTimeout() const;

 private:
  using Applications = std::vector<std::shared_ptr<RunningApplication>>;

  AppHelper(std::vector<std::string> bundleIdentifiers, VendStoreClient storeClient);

  bool terminateApplicationsWithPromptToConfirm(bool promptToConfirm);
  enum class PromptOutcome { kTerminate, kStop, kSkipped };
  PromptOutcome askToQuit(bool promptToConfirm);
  void terminateEach(bool alwaysForceTerminate);
  // False when the wait timed out and the pass must end.
  bool quitAndWait(const std::shared_ptr<RunningApplication>& application,
                   ApplicationSerialNumber serialNumber);
  void holdPlugInsAfterTermination(const std::shared_ptr<RunningApplication>& application);
  void handleHoldAfterTermination(const std::shared_ptr<RunningApplication>& application,
                                  std::shared_ptr<PlugInHold> hold,
                                  const std::optional<VendError>& error);
  void applicationDidTerminate(const std::shared_ptr<RunningApplication>& application);
  std::vector<std::uint64_t> observeTermination(const Applications& applications);
  static void stopObservingTermination(const Applications& applications,
                                       const std::vector<std::uint64_t>& tokens);
  static void messageTraceTermination(const std::optional<std::string>& bundleIdentifier,
                                      bool terminatedSuccessfully, bool didTimeout);

  // Guards everything below that a termination notification, arriving on
  // another thread, may touch while a pass runs.
  mutable Mutex mutex_;
  const std::vector<std::string> bundleIdentifiers_;
  Applications terminatedApps_ GUARDED_BY(mutex_);
  Applications appsToTerminate_ GUARDED_BY(mutex_);
  // The quit dialog of the store client unless a test set another.
  std::shared_ptr<AppHelperQuitPrompt> quitPrompt_ GUARDED_BY(mutex_);
  // The prompt is on screen and has not been answered.
  bool quitPromptShowing_ GUARDED_BY(mutex_) = false;
  const VendStoreClient storeClient_;
  bool allowUserToSkipApps_ GUARDED_BY(mutex_) = false;
  std::vector<std::string> skippedAppBundleIdentifiers_ GUARDED_BY(mutex_);
  // Made on first use: nothing to open until something was quit.
  std::optional<std::vector<std::string>> relaunchBundleURLs_ GUARDED_BY(mutex_);
  std::shared_ptr<RunningApplication> terminationWaitApp_ GUARDED_BY(mutex_);
  std::shared_ptr<DispatchSemaphore> terminationWaitSemaphore_ GUARDED_BY(mutex_);
  Applications immortalRunningApplications_ GUARDED_BY(mutex_);
  std::vector<std::shared_ptr<PlugInHold>> pluginHoldsToRelease_ GUARDED_BY(mutex_);
  std::vector<SysupQuaymartUpdate> osUpdates_ GUARDED_BY(mutex_);
  Timing timing_ GUARDED_BY(mutex_);
};

}  // namespace larder
