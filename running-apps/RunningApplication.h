#pragma once

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/error/Result.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"

namespace larder {

// The two 32-bit halves an application's serial number is sent as.
struct ApplicationSerialNumber {
  std::uint32_t high = 0;
  std::uint32_t low = 0;
  friend bool operator==(const ApplicationSerialNumber&, const ApplicationSerialNumber&) = default;
};

// A process of this user whose executable lies inside an application bundle
// (a folder "<Name>.app"). What a desktop would know about it but this
// platform has no source for (which application is in front, whether quitting
// loses data, the two forced-termination states) is read from the file
// "running-applications.plist" of the platform state, afresh at each call.
class RunningApplication : public std::enable_shared_from_this<RunningApplication> {
 public:
  // What is known of a process when it is found; public so that tests can
  // describe an application that the scan would never produce (one without
  // a launch date, say).
  struct Description {
    pid_t pid = 0;
    // Start time in clock ticks since boot, as /proc gives it; tells a
    // process apart from a later one that got the same pid.
    std::uint64_t startTicks = 0;
    std::optional<std::string> bundleIdentifier;
    std::optional<std::string> bundleURL;
    std::optional<PlistDate> launchDate;
    std::optional<std::string> localizedName;
  };

  using TerminationObserver = std::function<void(const std::shared_ptr<RunningApplication>&)>;
  using ObserverToken = std::uint64_t;

  static std::shared_ptr<RunningApplication> make(Description description);
  // The application of that process, or nullptr when it is none (gone,
  // another user's, not inside a bundle).
  static std::shared_ptr<RunningApplication> withPid(pid_t pid);
  static std::vector<std::shared_ptr<RunningApplication>> runningApplicationsWithBundleIdentifier(
      std::string_view bundleIdentifier);
  // This user's applications, in pid order; under a platform root other
  // than "/", only those whose bundle lies inside the root or the home.
  static std::vector<std::shared_ptr<RunningApplication>> allRunningApplications();

  // Starts "bin/<HostBundleExecutable>" of the bundle at `bundlePath` in a
  // session of its own, not as a child of this process (nobody waits for
  // it), with `arguments` after the program's name. The pid of the started
  // program.
  static Result<pid_t> launchBundle(const std::string& bundlePath,
                                    const std::vector<std::string>& arguments = {});

  ~RunningApplication();
  RunningApplication(const RunningApplication&) = delete;
  RunningApplication& operator=(const RunningApplication&) = delete;

  [[nodiscard]] pid_t pid() const { return description_.pid; }
  [[nodiscard]] const std::optional<std::string>& bundleIdentifier() const {
    return description_.bundleIdentifier;
  }
  [[nodiscard]] const std::optional<std::string>& bundleURL() const {
    return description_.bundleURL;
  }
  [[nodiscard]] const std::optional<PlistDate>& launchDate() const {
    return description_.launchDate;
  }
  [[nodiscard]] const std::optional<std::string>& localizedName() const {
    return description_.localizedName;
  }
  // "<name> (<bundle identifier>, pid <pid>)", for log lines.
  [[nodiscard]] std::string description() const;

  // The name a bundle shows: "HostBundleDisplayName", else "HostBundleName",
  // else its folder name without ".app".
  static std::string displayNameOfBundle(const std::string& bundlePath);

  // The simulated desktop facts.
  [[nodiscard]] bool isActive() const;
  [[nodiscard]] bool quittingWillBeNoisyOrLoseData() const;
  [[nodiscard]] std::optional<std::string> reasonThatQuittingWillBeNoisyOrLoseData() const;
  [[nodiscard]] bool isStoppedInApplicationRegistry() const;
  [[nodiscard]] bool isProxied() const;

  [[nodiscard]] bool isTerminated() const;
  // `observer` is called once, on a thread of this object's, when the
  // process goes. Only a change after registration counts: an application
  // already reported gone to earlier observers is not reported again.
  ObserverToken addTerminationObserver(TerminationObserver observer);
  void removeTerminationObserver(ObserverToken token);

  // SIGKILL; true when the signal was delivered.
  bool forceTerminate();
  // SIGTERM: how a polite quit request reaches an application here. True
  // when the signal was delivered.
  bool requestQuit();
  // Bringing an application forward is up to the desktop, which this
  // platform leaves alone: nothing happens.
  void activateWithOptions(unsigned options);
  // The pid as two 32-bit halves; an error for a process that has gone.
  [[nodiscard]] Result<ApplicationSerialNumber> applicationSerialNumber() const;

 private:
  explicit RunningApplication(Description description);

  bool sendSignal(int signal);
  [[nodiscard]] bool processHasGone() const;
  void watchTermination(const std::stop_token& stop);
  void notifyTerminated();

  const Description description_;
  // -1 when the kernel has no pidfd_open; the process is then watched by
  // polling /proc.
  int pidFd_ = -1;
  std::atomic<bool> terminated_{false};

  Mutex observersMutex_;
  std::map<ObserverToken, TerminationObserver> observers_ GUARDED_BY(observersMutex_);
  ObserverToken nextToken_ GUARDED_BY(observersMutex_) = 1;
  bool notified_ GUARDED_BY(observersMutex_) = false;
  std::jthread watcher_ GUARDED_BY(observersMutex_);
};

}  // namespace larder
