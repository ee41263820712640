#include "store-runtime/sysup/SysupQuaymartUpdateController.h"

#include <algorithm>
#include <chrono>
#include <map>
#include <set>

#include "platform/log/TillLogManager.h"
#include "platform/system/Mutex.h"
#include "platform/system/Uuid.h"
#include "store-runtime/host/LedgerSessionRestart.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/sysup/SysupOperationPacer.h"
#include "store-runtime/sysup/SysupStateReader.h"
#include "store-runtime/sysup/SysupUpdateObservers.h"
#include "store-runtime/sysup/SysupUpdateState.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "SysupQuaymartUpdateController";

using UpdateList = SysupQuaymartUpdateController::UpdateList;

// Read at every call: tests and tools move the platform root between calls.
PlatformStateFile stateFile() {
  return PlatformStateFile::named(SysupQuaymartUpdateController::kStateFileName);
}

SysupUpdateState readState(const PlatformStateFile& file) {
  return SysupUpdateState(file.readDictionary());
}

// A locked read-modify-write of the state through its typed view.
bool changeState(const PlatformStateFile& file,
                 const std::function<void(SysupUpdateState&)>& change) {
  return file.updateDictionary([&change](PlistDictionary& stored) {
    SysupUpdateState state(std::move(stored));
    change(state);
    stored = std::move(state.dictionary());
  });
}

std::set<std::string> productKeys(const UpdateList& updates) {
  std::set<std::string> keys;
  for (const SysupQuaymartUpdate& update : updates) keys.insert(update.productKey());
  return keys;
}

std::vector<std::string> without(std::vector<std::string> keys, const std::set<std::string>& gone) {
  std::erase_if(keys, [&gone](const std::string& key) { return gone.contains(key); });
  return keys;
}

DispatchQueue& handlerQueue(const std::shared_ptr<DispatchQueue>& notifyOn) {
  return notifyOn ? *notifyOn : DispatchQueue::globalQueue();
}

VendError stateWriteFailed(const PlatformStateFile& file) {
  return VendError::withDomain(std::string(VendErrorDomain),
                               SysupQuaymartUpdateController::kStateFileErrorCode,
                               "The system update state " + file.path() + " could not be written.");
}

VendError installFailed(const SysupQuaymartUpdate& update) {
  return VendError::withDomain(std::string(VendErrorDomain),
                               SysupQuaymartUpdateController::kInstallFailedErrorCode,
                               "The update \"" + update.title().value_or(update.productKey()) +
                                   "\" (" + update.productKey() + ") could not be installed.");
}

VendError notOffered(const std::set<std::string>& missing) {
  std::string names;
  for (const std::string& key : missing) names += (names.empty() ? "" : ", ") + key;
  return VendError::withDomain(std::string(VendErrorDomain),
                               SysupQuaymartUpdateController::kInstallFailedErrorCode,
                               "The updates " + names + " are not offered to this machine.");
}

}  // namespace

class SysupQuaymartUpdateController::Implementation {
 public:
  enum class Transfer { Install, PostLogoutDownload };

  // Each simulated run holds a worker while it waits out its seconds, so a
  // few may run side by side without one waiting behind another.
  Implementation()
      : workQueue_(DispatchQueue::create("SysupQuaymartUpdateController operations",
                                         DispatchQueue::Kind::Concurrent,
                                         DispatchQueue::Limits{.concurrentWorkers = 8})) {}

  void scan(bool includingPrerelease, std::shared_ptr<DispatchQueue> notifyOn,
            ScanProgressHandler progress, FinishHandler finish) {
    workQueue_->async([this, file = stateFile(), includingPrerelease,
                       notifyOn = std::move(notifyOn), progress = std::move(progress),
                       finish = std::move(finish)] {
      DispatchQueue& target = handlerQueue(notifyOn);
      SysupOperationPacer pacer;
      pacer.run(readState(file).scanSeconds(), [&](double percent) {
        if (progress) target.sync([&] { progress(percent); });
      });
      OptionalError error;
      if (!storeScanResult(file, includingPrerelease)) error = stateWriteFailed(file);
      stateMayHaveChanged();
      target.async([finish, error] {
        if (finish) finish(error);
      });
    });
  }

  CancelToken transfer(Transfer kind, const UpdateList& updates,
                       std::shared_ptr<DispatchQueue> notifyOn, InstallProgressHandler progress,
                       FinishHandler finish) {
    CancelToken token = Uuid::generateString();
    auto pacer = std::make_shared<SysupOperationPacer>();
    {
      MutexLock lock(mutex_);
      operations_.emplace(token, pacer);
    }
    workQueue_->async([this, kind, token, pacer, file = stateFile(), keys = productKeys(updates),
                       notifyOn = std::move(notifyOn), progress = std::move(progress),
                       finish = std::move(finish)] {
      OptionalError error = runTransfer(kind, file, keys, *pacer, handlerQueue(notifyOn), progress);
      {
        MutexLock lock(mutex_);
        operations_.erase(token);
      }
      stateMayHaveChanged();
      handlerQueue(notifyOn).async([finish, error] {
        if (finish) finish(error);
      });
    });
    return token;
  }

  void cancel(const CancelToken& token) {
    std::shared_ptr<SysupOperationPacer> pacer;
    {
      MutexLock lock(mutex_);
      auto found = operations_.find(token);
      if (found == operations_.end()) return;
      pacer = found->second;
    }
    TILL_LOG(2, "%@: Cancelling operation %@", kSpeaker, token);
    pacer->cancel();
  }

  ObserverToken addObserver(AvailableUpdatesObserver observer) {
    return observers_.add(std::move(observer), stateFile().path());
  }
  void removeObserver(ObserverToken token) { observers_.remove(token); }
  void stateMayHaveChanged() { observers_.stateMayHaveChanged(); }
  // The state of the current file, parsed once per version of it.
  std::shared_ptr<const SysupUpdateState> currentState() { return reader_.read(stateFile()); }

  // The first authorization stays: the process is given one at most.
  bool setAuthorization(std::vector<std::string> rights) {
    MutexLock lock(mutex_);
    if (authorization_) return false;
    authorization_ = std::move(rights);
    return true;
  }
  std::optional<std::vector<std::string>> authorization() {
    MutexLock lock(mutex_);
    return authorization_;
  }

 private:
  static bool storeScanResult(const PlatformStateFile& file, bool includingPrerelease) {
    std::size_t found = 0;
    const bool stored = changeState(file, [&](SysupUpdateState& state) {
      const std::set<std::string> hidden = state.keySet(SysupUpdateState::kHiddenKey);
      const std::set<std::string> installed = state.dictionaryKeys(SysupUpdateState::kInstalledKey);
      std::vector<std::string> available;
      for (const SysupCatalogEntry& entry : state.catalog()) {
        const std::string& key = entry.update.productKey();
        if (hidden.contains(key) || installed.contains(key)) continue;
        if (entry.isPrerelease && !includingPrerelease) continue;
        available.push_back(key);
      }
      found = available.size();
      state.setKeyList(SysupUpdateState::kAvailableKey, available);
    });
    TILL_LOG(2, "%@: Scan found %zu updates", kSpeaker, found);
    return stored;
  }

  static OptionalError runTransfer(Transfer kind, const PlatformStateFile& file,
                                   const std::set<std::string>& keys, SysupOperationPacer& pacer,
                                   DispatchQueue& target, const InstallProgressHandler& progress) {
    const std::vector<SysupCatalogEntry> entries = readState(file).catalogEntries(keys);
    std::set<std::string> missing = keys;
    double seconds = 0;
    for (const SysupCatalogEntry& entry : entries) {
      missing.erase(entry.update.productKey());
      seconds += entry.installSeconds;
    }
    if (!missing.empty()) return notOffered(missing);
    const PlistDictionary status{
        {"state", kind == Transfer::Install ? "installing" : "downloading"}};
    const bool ran = pacer.run(seconds, [&](double percent) {
      if (progress) target.sync([&] { progress(status, true, percent); });
    });
    if (!ran) return VendError::cancelledByUser();
    if (kind == Transfer::Install) {
      for (const SysupCatalogEntry& entry : entries) {
        if (entry.installFails) return installFailed(entry.update);
      }
    }
    if (!commitTransfer(kind, file, keys)) return stateWriteFailed(file);
    TILL_LOG(2, "%@: %@ %zu updates", kSpeaker,
             kind == Transfer::Install ? "Installed" : "Downloaded", keys.size());
    return std::nullopt;
  }

  static bool commitTransfer(Transfer kind, const PlatformStateFile& file,
                             const std::set<std::string>& keys) {
    return changeState(file, [&](SysupUpdateState& state) {
      if (kind == Transfer::PostLogoutDownload) {
        std::vector<std::string> downloaded = state.keyList(SysupUpdateState::kDownloadedKey);
        downloaded.insert(downloaded.end(), keys.begin(), keys.end());
        state.setKeyList(SysupUpdateState::kDownloadedKey, downloaded);
        return;
      }
      PlistDictionary& installed = state.dictionaryNamed(SysupUpdateState::kInstalledKey);
      for (const std::string& key : keys) installed[key] = PlistDate::now();
      for (std::string_view list : {SysupUpdateState::kAvailableKey, SysupUpdateState::kLaterKey}) {
        state.setKeyList(list, without(state.keyList(list), keys));
      }
    });
  }

  std::shared_ptr<DispatchQueue> workQueue_;
  Mutex mutex_;
  std::map<CancelToken, std::shared_ptr<SysupOperationPacer>> operations_ GUARDED_BY(mutex_);
  std::optional<std::vector<std::string>> authorization_ GUARDED_BY(mutex_);
  SysupStateReader reader_;
  SysupUpdateObservers observers_{[this] { return reader_.read(stateFile())->availableUpdates(); }};
};

SysupQuaymartUpdateController::SysupQuaymartUpdateController()
    : implementation_(std::make_unique<Implementation>()) {}

SysupQuaymartUpdateController::~SysupQuaymartUpdateController() = default;

SysupQuaymartUpdateController& SysupQuaymartUpdateController::sharedUpdateController() {
  static SysupQuaymartUpdateController controller;
  return controller;
}

std::string SysupQuaymartUpdateController::stateFilePath() const {
  return stateFile().path();
}

UpdateList SysupQuaymartUpdateController::availableUpdates() const {
  return implementation_->currentState()->availableUpdates();
}

SysupQuaymartUpdateController::ObserverToken
SysupQuaymartUpdateController::addAvailableUpdatesObserver(AvailableUpdatesObserver observer) {
  return implementation_->addObserver(std::move(observer));
}

void SysupQuaymartUpdateController::removeAvailableUpdatesObserver(ObserverToken token) {
  implementation_->removeObserver(token);
}

void SysupQuaymartUpdateController::availableUpdatesMatchingPredicate(
    Predicate predicate, std::function<void(const UpdateList&)> handler) const {
  UpdateList updates = availableUpdates();
  if (predicate)
    std::erase_if(updates, [&predicate](const auto& update) { return !predicate(update); });
  DispatchQueue::globalQueue().async([updates = std::move(updates), handler = std::move(handler)] {
    if (handler) handler(updates);
  });
}

void SysupQuaymartUpdateController::startScanningForUpdatesIncludingPrerelease(
    bool includingPrerelease, bool rampedUnseen, bool evenIfUnchanged,
    std::shared_ptr<DispatchQueue> notifyOn, ScanProgressHandler progress, FinishHandler finish) {
  // The simulation has no ramped releases and always rewrites the list.
  TILL_LOG(2, "%@: Scanning (prerelease %d, ramped unseen %d, even if unchanged %d)", kSpeaker,
           includingPrerelease, rampedUnseen, evenIfUnchanged);
  implementation_->scan(includingPrerelease, std::move(notifyOn), std::move(progress),
                        std::move(finish));
}

std::optional<SysupQuaymartUpdateController::CancelToken>
SysupQuaymartUpdateController::startInstallingUpdates(const UpdateList& updates,
                                                      std::shared_ptr<DispatchQueue> notifyOn,
                                                      bool usingForeground,
                                                      InstallProgressHandler progress,
                                                      FinishHandler finish) {
  if (updates.empty()) return std::nullopt;
  TILL_LOG(2, "%@: Installing %zu updates (foreground %d)", kSpeaker, updates.size(),
           usingForeground);
  return implementation_->transfer(Implementation::Transfer::Install, updates, std::move(notifyOn),
                                   std::move(progress), std::move(finish));
}

std::optional<SysupQuaymartUpdateController::CancelToken>
SysupQuaymartUpdateController::startDownloadingPostLogoutUpdates(
    const UpdateList& updates, std::shared_ptr<DispatchQueue> notifyOn,
    InstallProgressHandler progress, FinishHandler finish) {
  if (updates.empty()) return std::nullopt;
  TILL_LOG(2, "%@: Downloading %zu updates for after logout", kSpeaker, updates.size());
  return implementation_->transfer(Implementation::Transfer::PostLogoutDownload, updates,
                                   std::move(notifyOn), std::move(progress), std::move(finish));
}

void SysupQuaymartUpdateController::cancelOperation(const CancelToken& token) {
  implementation_->cancel(token);
}

std::int64_t SysupQuaymartUpdateController::actionRequiredForUpdates(
    const UpdateList& updates) const {
  for (const SysupCatalogEntry& entry :
       implementation_->currentState()->catalogEntries(productKeys(updates))) {
    if (entry.restartRequired) return 1;
  }
  return 0;
}

std::uint64_t SysupQuaymartUpdateController::diskSpaceRequiredForUpdates(
    const UpdateList& updates) const {
  std::uint64_t total = 0;
  for (const SysupCatalogEntry& entry :
       implementation_->currentState()->catalogEntries(productKeys(updates))) {
    total += entry.downloadSize;
  }
  return total;
}

void SysupQuaymartUpdateController::ignoreUpdate(const SysupQuaymartUpdate& update) {
  TILL_LOG(2, "%@: Hiding %@", kSpeaker, update.productKey());
  changeState(stateFile(), [&update](SysupUpdateState& state) {
    std::vector<std::string> hidden = state.keyList(SysupUpdateState::kHiddenKey);
    hidden.push_back(update.productKey());
    state.setKeyList(SysupUpdateState::kHiddenKey, hidden);
  });
  implementation_->stateMayHaveChanged();
}

void SysupQuaymartUpdateController::resetIgnoredUpdates() {
  TILL_LOG(2, "%@: Unhiding every update", kSpeaker);
  changeState(stateFile(),
              [](SysupUpdateState& state) { state.setKeyList(SysupUpdateState::kHiddenKey, {}); });
  implementation_->stateMayHaveChanged();
}

void SysupQuaymartUpdateController::installUpdatesLater(const UpdateList& updates) {
  std::vector<std::string> keys;
  for (const SysupQuaymartUpdate& update : updates) keys.push_back(update.productKey());
  changeState(stateFile(), [&keys](SysupUpdateState& state) {
    state.setKeyList(SysupUpdateState::kLaterKey, keys);
  });
}

UpdateList SysupQuaymartUpdateController::updatesToBeInstalledLater() const {
  const std::shared_ptr<const SysupUpdateState> current = implementation_->currentState();
  const SysupUpdateState& state = *current;
  UpdateList updates;
  for (SysupCatalogEntry& entry : state.catalogEntries(state.keySet(SysupUpdateState::kLaterKey))) {
    updates.push_back(std::move(entry.update));
  }
  return updates;
}

void SysupQuaymartUpdateController::removeAllUpdatesFromInstallLater() {
  changeState(stateFile(),
              [](SysupUpdateState& state) { state.setKeyList(SysupUpdateState::kLaterKey, {}); });
}

bool SysupQuaymartUpdateController::isDownloadRequiredForPostLogoutUpdates(
    const UpdateList& updates) const {
  const std::set<std::string> downloaded =
      implementation_->currentState()->keySet(SysupUpdateState::kDownloadedKey);
  return std::any_of(updates.begin(), updates.end(), [&downloaded](const auto& update) {
    return !downloaded.contains(update.productKey());
  });
}

bool SysupQuaymartUpdateController::installUpdatesAfterNextLogout(const UpdateList& updates,
                                                                  bool restartingNow,
                                                                  bool nowIsLater) {
  bool allAvailable = true;
  const bool stored = changeState(stateFile(), [&](SysupUpdateState& state) {
    const std::set<std::string> available = productKeys(state.availableUpdates());
    for (const SysupQuaymartUpdate& update : updates) {
      if (!available.contains(update.productKey())) allAvailable = false;
    }
    if (!allAvailable) return;
    PlistDictionary& requests = state.dictionaryNamed(SysupUpdateState::kPostLogoutKey);
    for (const SysupQuaymartUpdate& update : updates) {
      requests[update.productKey()] = PlistDictionary{
          {"date", PlistDate::now()}, {"restartingNow", restartingNow}, {"nowIsLater", nowIsLater}};
    }
  });
  TILL_LOG(2, "%@: Install after logout of %zu updates: %@", kSpeaker, updates.size(),
           allAvailable ? "recorded" : "refused, not all are available");
  if (!stored || !allAvailable) return false;
  if (restartingNow) endSessionForPostLogoutInstall(updates);
  return true;
}

// The install happens at the logout; an update that needs a restart takes
// the machine down with it.
void SysupQuaymartUpdateController::endSessionForPostLogoutInstall(const UpdateList& updates) {
  std::vector<std::string> keys;
  bool restart = false;
  for (const SysupQuaymartUpdate& update : updates) {
    keys.push_back(update.productKey());
    restart = restart || restartRequiredForProductKey(update.productKey());
  }
  LedgerSessionRestart::request(
      restart ? LedgerSessionRestart::Kind::kRestart : LedgerSessionRestart::Kind::kLogout, keys);
}

void SysupQuaymartUpdateController::setAuthorization(std::vector<std::string> authorization) {
  const std::size_t count = authorization.size();
  if (implementation_->setAuthorization(std::move(authorization))) {
    TILL_LOG(2, "%@: Authorized with %zu rights", kSpeaker, count);
  } else {
    TILL_LOG(1, "%@: An authorization is already set; the new one is ignored", kSpeaker);
  }
}

std::optional<std::vector<std::string>> SysupQuaymartUpdateController::authorization() const {
  return implementation_->authorization();
}

PlistDictionary SysupQuaymartUpdateController::takePostLogoutResults() {
  PlistDictionary results;
  changeState(stateFile(), [&results](SysupUpdateState& state) {
    auto found = state.dictionary().find(SysupUpdateState::kPostLogoutResultsKey);
    if (found == state.dictionary().end()) return;
    if (const PlistDictionary* stored = found->second.dictionary()) results = *stored;
    state.dictionary().erase(found);
  });
  return results;
}

bool SysupQuaymartUpdateController::restartRequiredForProductKey(
    std::string_view productKey) const {
  std::optional<SysupCatalogEntry> entry =
      implementation_->currentState()->catalogEntry(productKey);
  return entry && entry->restartRequired;
}

}  // namespace larder
