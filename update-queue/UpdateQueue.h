#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/QueueConfined.h"
#include "platform/error/VendError.h"
#include "platform/system/Mutex.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "update-queue/UpdateQueueClient.h"
#include "update-queue/UpdateQueueDelegate.h"

namespace larder {

class LoadUpdateQueueOperation;
class SoftwareMap;

// The service's memory of which store updates exist for one store client:
// the available and the incompatible updates, kept in `updates.plist` so
// that they survive a restart, refreshed by update checks against the
// store. Checks asked for while one is in flight join it.
//
// Every read enters the queue's concurrent dispatch queue; every change is
// a barrier on it. Handlers and the delegate run on the global queue,
// never inside a barrier, so they may call back in.
class UpdateQueue : public std::enable_shared_from_this<UpdateQueue> {
 public:
  using UpdateList = std::vector<LedgerUpdateRef>;
  using CompletionHandler = UpdateQueueClient::CompletionHandler;

  static constexpr std::string_view kCacheFileName = "updates.plist";

  // Reads the cache; the store is not asked. The software map gives the
  // bodies of the checks and must outlive the queue. The delegate is not
  // kept alive by the queue: it owns the queue.
  UpdateQueue(VendStoreClient storeClient, std::weak_ptr<UpdateQueueDelegate> delegate,
              SoftwareMap& softwareMap);
  UpdateQueue(const UpdateQueue&) = delete;
  UpdateQueue& operator=(const UpdateQueue&) = delete;

  // Waits until the change under way, and the cache write it makes, has
  // ended.
  void finishPendingWrites();

  // Starts a check unless one is in flight; the handler, if any, gets the
  // result of the check in flight. Returns at once.
  void checkForUpdatesWithCompletionHandler(CompletionHandler handler);

  // First match in list order.
  LedgerUpdateRef availableUpdateWithItemIdentifier(std::uint64_t itemIdentifier);
  // Last match in list order.
  LedgerUpdateRef availableUpdateWithBundleIdentifier(std::string_view bundleIdentifier);
  bool hasStagedUpdates();

  // A download keeps its record reachable until it ends, even when a
  // check drops the update in between.
  void willStartDownloadForUpdateWithIdentifier(std::uint64_t itemIdentifier);
  void didFinishDownloadForUpdateWithItemIdentifier(std::uint64_t itemIdentifier, bool didInstall);
  void didStageUpdateForItemIdentifier(std::uint64_t itemIdentifier);
  void didRemoveApplicationWithIdentifier(std::uint64_t itemIdentifier);
  // Keeps the date of the first attempt and the latest code.
  void setAutoUpdateAbortCode(std::int64_t abortCode, std::uint64_t itemIdentifier);
  // An automatic download or install of it failed: the badge counts it from
  // now on, so that the user hears of an update that cannot go in alone.
  void setDidFailToAutoInstall(std::uint64_t itemIdentifier);
  // Marks every record of `updates` as seen and saves. Incompatible
  // updates carry no such mark.
  void setUserHasSeenAllUpdates(const UpdateList& updates, const UpdateList& incompatibleUpdates);

  // Snapshots that stay valid while the queue changes; the records in them
  // are the queue's own. The incompatible list is null when the store's
  // last answer had none.
  [[nodiscard]] std::shared_ptr<const UpdateList> availableUpdates() const;
  [[nodiscard]] std::shared_ptr<const UpdateList> incompatibleUpdates() const;

  [[nodiscard]] bool disableQueueChecks() const { return disableQueueChecks_.load(); }
  void setDisableQueueChecks(bool disable) { disableQueueChecks_.store(disable); }

  // The end of a check: reconciles a successful answer, saves, and
  // answers the waiting callers. The check's own completion; public so
  // that a benchmark can feed it an answer without a store.
  void updateCheckDidFinish(LoadUpdateQueueOperation& operation, bool success,
                            const OptionalError& error);

  // "<per-user caches>/<kDaemonDefaultsID>/updates.plist".
  static std::optional<std::string> cachePath();

 private:
  // Inside a barrier or a read.
  LedgerUpdateRef updateWithItemIdentifier(std::uint64_t itemIdentifier) const;
  LedgerUpdateRef availableUpdateWithItemIdentifierOnQueue(std::uint64_t itemIdentifier) const;
  void availableUpdatesDidChange();
  void readUpdatesFromPersistedStore();
  void writeUpdatesToPersistedStore(const UpdateList& available,
                                    const std::shared_ptr<const UpdateList>& incompatible);
  void save();

  void reconcile(LoadUpdateQueueOperation& operation);
  void answerClients(bool success, const OptionalError& error);

  // Applies `change` to every available record of that identifier, over a
  // copy of the list; true when one matched.
  // Takes every available record of that identifier off the list, logging
  // each with `logFormat`; true when one was there.
  bool removeAvailableUpdatesWithItemIdentifier(std::uint64_t itemIdentifier,
                                                std::string_view logFormat);
  template <typename Change>
  bool forEachAvailableUpdateWithItemIdentifier(std::uint64_t itemIdentifier, Change&& change);
  void publish(UpdateList available);
  void publishIncompatible(std::shared_ptr<const UpdateList> incompatible);
  void appendInstalledUpdateToJournal(const LedgerUpdateRef& update);

  std::weak_ptr<UpdateQueueDelegate> delegate_;
  VendStoreClient storeClient_;
  SoftwareMap& softwareMap_;
  std::atomic<bool> disableQueueChecks_{false};

  // The two lists are published whole, so that a reader outside the queue
  // takes its snapshot with one pointer copy.
  mutable Mutex snapshotMutex_;
  std::shared_ptr<const UpdateList> availableUpdates_ GUARDED_BY(snapshotMutex_);
  std::shared_ptr<const UpdateList> incompatibleUpdates_ GUARDED_BY(snapshotMutex_);

  std::shared_ptr<DispatchQueue> dispatchQueue_;
  // The check in flight and who waits for it: changed in barriers of
  // dispatchQueue_ only.
  struct Check {
    std::vector<UpdateQueueClient> clients;
    std::optional<std::map<std::uint64_t, LedgerUpdateRef>> updatesBeingDownloaded;
    bool loadInProgress = false;
  };
  QueueConfined<Check> check_{dispatchQueue_};
};

}  // namespace larder
