#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/error/VendError.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"

namespace larder {

// The system update framework: which OS updates the vendor offers this
// machine, scans for them, installs, hiding, the later list and installs
// after logout. This platform has none the service can talk to, so it is
// simulated in one property list, "<root>/var/lib/larder-platform/
// system-updates.plist", that the service, larderctl, the demo and the tests
// share (every change is a locked read-modify-write with an atomic rename):
//
//   catalog           array of dictionaries: the updates the vendor offers,
//                     keyed by the field names of SysupQuaymartUpdate, plus
//                     restartRequired (bool), downloadSize (bytes),
//                     installSeconds (duration of an install, default 0),
//                     installFails (bool), isPrerelease (bool)
//   scanSeconds       duration of a scan (default 0)
//   available         array of product keys: what the last scan found
//   hidden            array of product keys the user hid
//   later             array of product keys to install later
//   installed         dictionary product key -> date of the install
//   postLogout        dictionary product key -> { date, restartingNow,
//                     nowIsLater }: installs asked for after the next logout
//   postLogoutResults dictionary product key -> { State, InstalledLater }:
//                     what the last logout installed, until an agent takes it
//   downloaded        array of product keys whose download is on disk
//
// Every method is safe from any thread. Handlers are called on the queue
// given, never inside a lock of the controller.
class SysupQuaymartUpdateController {
 public:
  using UpdateList = std::vector<SysupQuaymartUpdate>;
  using Predicate = std::function<bool(const SysupQuaymartUpdate&)>;
  // Percent done; a negative value carries no progress.
  using ScanProgressHandler = std::function<void(double percent)>;
  // Status information, whether the run can still be cancelled, percent.
  using InstallProgressHandler =
      std::function<void(const PlistDictionary& statusInfo, bool canCancel, double percent)>;
  using FinishHandler = std::function<void(const OptionalError& error)>;
  // Told the new list whenever the available updates change, whoever changed
  // them (this process or another one writing the file).
  using AvailableUpdatesObserver = std::function<void(const UpdateList& availableUpdates)>;
  using ObserverToken = std::uint64_t;
  // Handed out by the starts of installs and downloads; cancelOperation takes it.
  using CancelToken = std::string;

  static constexpr std::string_view kStateFileName = "system-updates.plist";
  // Codes of VendErrorDomain for what only the simulation can fail at: an
  // entry marked installFails or an update not in the catalogue, and a state
  // file that could not be written.
  static constexpr std::int64_t kInstallFailedErrorCode = 100;
  static constexpr std::int64_t kStateFileErrorCode = 101;

  // The one instance of the process.
  static SysupQuaymartUpdateController& sharedUpdateController();

  [[nodiscard]] std::string stateFilePath() const;

  // The catalogue entries that the last scan found, less hidden and installed
  // ones, in catalogue order.
  [[nodiscard]] UpdateList availableUpdates() const;
  ObserverToken addAvailableUpdatesObserver(AvailableUpdatesObserver observer);
  void removeAvailableUpdatesObserver(ObserverToken token);
  // Calls the handler with the available updates the predicate keeps, on the
  // global queue.
  void availableUpdatesMatchingPredicate(Predicate predicate,
                                         std::function<void(const UpdateList&)> handler) const;

  // Runs a scan: the available list becomes the catalogue less hidden and
  // installed updates (and prerelease ones unless asked for). Progress and
  // finish are called on `notifyOn` (the global queue when null).
  void startScanningForUpdatesIncludingPrerelease(bool includingPrerelease, bool rampedUnseen,
                                                  bool evenIfUnchanged,
                                                  std::shared_ptr<DispatchQueue> notifyOn,
                                                  ScanProgressHandler progress,
                                                  FinishHandler finish);

  // Installs the updates: progress, then finish with no error (the updates
  // are installed and leave the available and later lists), with the error of
  // an entry marked installFails, or with a cancellation. Nothing when the
  // list is empty.
  std::optional<CancelToken> startInstallingUpdates(const UpdateList& updates,
                                                    std::shared_ptr<DispatchQueue> notifyOn,
                                                    bool usingForeground,
                                                    InstallProgressHandler progress,
                                                    FinishHandler finish);
  // Downloads updates that will be installed after logout.
  std::optional<CancelToken> startDownloadingPostLogoutUpdates(
      const UpdateList& updates, std::shared_ptr<DispatchQueue> notifyOn,
      InstallProgressHandler progress, FinishHandler finish);
  // Ends the install or download of that token with a cancellation; an
  // unknown or spent token is ignored.
  void cancelOperation(const CancelToken& token);

  // 0 when none of the updates needs a restart, 1 otherwise.
  [[nodiscard]] std::int64_t actionRequiredForUpdates(const UpdateList& updates) const;
  // Sum of the updates' downloadSize.
  [[nodiscard]] std::uint64_t diskSpaceRequiredForUpdates(const UpdateList& updates) const;

  void ignoreUpdate(const SysupQuaymartUpdate& update);
  // Unhides every hidden update; those the last scan found are available again.
  void resetIgnoredUpdates();

  // The later list is replaced by `updates`.
  void installUpdatesLater(const UpdateList& updates);
  [[nodiscard]] UpdateList updatesToBeInstalledLater() const;
  void removeAllUpdatesFromInstallLater();

  [[nodiscard]] bool isDownloadRequiredForPostLogoutUpdates(const UpdateList& updates) const;
  // Records the request; false when an update is no longer available.
  // With `restartingNow`, the session is then ended (LedgerSessionRestart):
  // a restart when one of the updates needs it, a logout otherwise.
  bool installUpdatesAfterNextLogout(const UpdateList& updates, bool restartingNow,
                                     bool nowIsLater);

  // The results of the last post-logout install (product key -> { "State",
  // "InstalledLater" }), removed from the file: the background scan agent
  // reports them once.
  PlistDictionary takePostLogoutResults();

  // Whether the catalogue entry asks the simulation for a restart, for code
  // that has only a product key.
  [[nodiscard]] bool restartRequiredForProductKey(std::string_view productKey) const;

  // The authorization to install with: the rights the authorization
  // controller was granted. The process gets one, once; a second is
  // ignored with a log line.
  void setAuthorization(std::vector<std::string> authorization);
  [[nodiscard]] std::optional<std::vector<std::string>> authorization() const;

 private:
  void endSessionForPostLogoutInstall(const UpdateList& updates);
  SysupQuaymartUpdateController();
  ~SysupQuaymartUpdateController();
  class Implementation;
  std::unique_ptr<Implementation> implementation_;
};

}  // namespace larder
