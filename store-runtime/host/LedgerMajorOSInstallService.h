#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/error/Result.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"

namespace larder {

// What the update controller asks of the privileged install service of major
// OS updates: it keeps the state of the major OS update (so that both modes
// of the process see one dictionary), starts the installer of a downloaded
// update, and speaks for the agent that asks the user before a managed
// install.
class MajorOSInstallDaemonInterface {
 public:
  using BoolReply = std::function<void(bool)>;
  using PrefsReply = std::function<void(const PlistDictionary&)>;

  virtual ~MajorOSInstallDaemonInterface() = default;

  // Stores the whole state dictionary; the error says why it could not be.
  virtual Result<void> writeMajorOSUpdatePrefs(const PlistDictionary& prefs) = 0;
  virtual void readMajorOSUpdatePrefsWithReply(PrefsReply reply) = 0;
  // Asks for the installer at `setupHeraldPath` to be run against the
  // volume at `targetMountPoint`; no authorization means the service's own.
  virtual Result<void> requestInstallationWithSetupHerald(
      const std::string& setupHeraldPath, const std::string& targetMountPoint,
      const std::optional<std::vector<std::string>>& authorization) = 0;
  virtual void agentIsActiveWithReply(BoolReply reply) = 0;
  virtual Result<void> userHasAllowedInstallToProceed() = 0;
  virtual void checkInAgent(const std::string& agentIdentifier, BoolReply reply) = 0;
};

// The install service of this platform, in process. Nothing in a user's
// session could host a privileged service of its own, so the controller
// talks to this object, which keeps what such a service would keep in
// "<root>/var/lib/larder-platform/major-os-install.plist":
//
//   agentIsActive          boolean: whether the agent that asks the user
//                          before a managed install is running (default
//                          false); set by tests and by hand
//   installationRequests   array of { setupHerald, targetMountPoint,
//                          authorized (bool), date }, oldest first
//   installAllowedDates    array of dates: each time the user allowed a
//                          managed install to go on
//   agentCheckIns          array of { agent, date }
//
// The state dictionary itself is written where the controller reads it:
// the preference "MajorOSUpdate" of the service's domain, scope system.
//
// The connection-style handlers are kept for the controller's sake; an
// object in the same process is never interrupted, so only an explicit
// invalidate() calls one. Safe from any thread.
class LedgerMajorOSInstallService final : public MajorOSInstallDaemonInterface {
 public:
  static constexpr std::string_view kServiceName = "com.orvane.cellard";
  // Asks for the privileged instance of the service.
  static constexpr std::uint64_t kPrivilegedOption = 4096;
  static constexpr std::string_view kStateFileName = "major-os-install.plist";
  static constexpr std::size_t kRecordedEntries = 50;

  LedgerMajorOSInstallService(std::string serviceName, std::uint64_t options);

  [[nodiscard]] const std::string& serviceName() const { return serviceName_; }
  [[nodiscard]] std::uint64_t options() const { return options_; }
  static std::string stateFilePath();

  void setInterruptionHandler(std::function<void()> handler);
  void setInvalidationHandler(std::function<void()> handler);
  // Ends the connection: its invalidation handler is called once, and every
  // later request fails.
  void invalidate();

  Result<void> writeMajorOSUpdatePrefs(const PlistDictionary& prefs) override;
  void readMajorOSUpdatePrefsWithReply(PrefsReply reply) override;
  Result<void> requestInstallationWithSetupHerald(
      const std::string& setupHeraldPath, const std::string& targetMountPoint,
      const std::optional<std::vector<std::string>>& authorization) override;
  void agentIsActiveWithReply(BoolReply reply) override;
  Result<void> userHasAllowedInstallToProceed() override;
  void checkInAgent(const std::string& agentIdentifier, BoolReply reply) override;

 private:
  [[nodiscard]] Result<void> checkValid() const;
  Result<void> appendRecord(std::string_view listKey, PlistValue record) const;

  const std::string serviceName_;
  const std::uint64_t options_;
  mutable Mutex mutex_;
  bool invalidated_ GUARDED_BY(mutex_) = false;
  std::function<void()> interruptionHandler_ GUARDED_BY(mutex_);
  std::function<void()> invalidationHandler_ GUARDED_BY(mutex_);
};

}  // namespace larder
