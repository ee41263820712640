#include "update-queue/UpdateQueue.h"

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <stdexcept>
#include <unordered_map>
#include <unordered_set>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/services/VendOperationQueue.h"
#include "update-queue/LoadUpdateQueueOperation.h"
#include "update-queue/journal/UpdateJournal.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = "UpdateQueue";
constexpr std::string_view kUpdatesKey = "updates";
constexpr std::string_view kIncompatibleUpdatesKey = "incompatibleUpdates";
// Longer lists go to a side file instead of the log line.
constexpr std::size_t kUpdatesLoggedInline = 10;

std::string describeUpdates(const UpdateQueue::UpdateList& updates) {
  std::string text = "(";
  for (const LedgerUpdateRef& update : updates) {
    text += "\n    " + update->description() + ",";
  }
  if (!updates.empty()) text.back() = '\n';
  return text + ")";
}

PlistArray dictionariesOf(const UpdateQueue::UpdateList& updates) {
  PlistArray dictionaries;
  dictionaries.reserve(updates.size());
  for (const LedgerUpdateRef& update : updates) {
    PlistDictionary dictionary = update->dictionary();
    if (!dictionary.empty()) dictionaries.emplace_back(std::move(dictionary));
  }
  return dictionaries;
}

// The records of one list of the cache file. Anything that cannot make a
// record spoils the whole file.
UpdateQueue::UpdateList updatesFromCache(const PlistDictionary& cache, std::string_view key) {
  UpdateQueue::UpdateList updates;
  auto found = cache.find(key);
  if (found == cache.end()) return updates;
  const PlistArray* entries = found->second.array();
  if (!entries) throw std::runtime_error("\"" + std::string(key) + "\" is not an array");
  updates.reserve(entries->size());
  for (const PlistValue& entry : *entries) {
    const PlistDictionary* dictionary = entry.dictionary();
    auto update = dictionary ? LedgerUpdate::initWithDictionary(*dictionary) : nullptr;
    if (!update) {
      throw std::runtime_error("an element of \"" + std::string(key) +
                               "\" is not an update: " + describePlistValue(entry));
    }
    updates.push_back(std::move(update));
  }
  return updates;
}

}  // namespace

UpdateQueue::UpdateQueue(VendStoreClient storeClient, std::weak_ptr<UpdateQueueDelegate> delegate,
                         SoftwareMap& softwareMap)
    : delegate_(std::move(delegate)),
      storeClient_(std::move(storeClient)),
      softwareMap_(softwareMap),
      availableUpdates_(std::make_shared<const UpdateList>()),
      incompatibleUpdates_(std::make_shared<const UpdateList>()),
      dispatchQueue_(
          DispatchQueue::create("UpdateQueue event queue", DispatchQueue::Kind::Concurrent)) {
  try {
    readUpdatesFromPersistedStore();
  } catch (const std::exception& exception) {
    TILL_LOG(1, "%@: Exception loading updates from persisted store - %@", kSpeaker,
             exception.what());
  }
}

void UpdateQueue::finishPendingWrites() {
  // Every change, and the write that follows it, is a barrier.
  dispatchQueue_->barrierSync([] {});
}

// --- Cache ---

std::optional<std::string> UpdateQueue::cachePath() {
  std::string directory = VendFileManager::cacheDirectoryPathWithName(kDaemonDefaultsID);
  std::error_code error;
  if (!std::filesystem::is_directory(directory, error)) return std::nullopt;
  std::string path = directory + "/" + std::string(kCacheFileName);
  TILL_LOG(3, "%@: Using cache path %@", kSpeaker, path);
  return path;
}

void UpdateQueue::readUpdatesFromPersistedStore() {
  std::optional<std::string> path = cachePath();
  if (!path) return;
  std::optional<std::vector<std::uint8_t>> bytes = FileIO::read(*path).optional();
  if (!bytes) return;
  std::optional<PlistValue> cache = PropertyListSerialization::read(*bytes);
  const PlistDictionary* dictionary = cache ? cache->dictionary() : nullptr;
  if (!dictionary) return;
  UpdateList available = updatesFromCache(*dictionary, kUpdatesKey);
  UpdateList incompatible = updatesFromCache(*dictionary, kIncompatibleUpdatesKey);
  TILL_LOG(2, "%@: Loaded %lu available updates, %lu incompatible updates from cache at %@",
           kSpeaker, available.size(), incompatible.size(), *path);
  if (available.size() <= kUpdatesLoggedInline) {
    TILL_LOG(2, "%@: Updates - %@", kSpeaker, describeUpdates(available));
  } else {
    TILL_LOG_PLIST(2, PlistValue(dictionariesOf(available)), "updates");
  }
  publish(std::move(available));
  publishIncompatible(std::make_shared<const UpdateList>(std::move(incompatible)));
}

void UpdateQueue::writeUpdatesToPersistedStore(
    const UpdateList& available, const std::shared_ptr<const UpdateList>& incompatible) {
  std::optional<std::string> path = cachePath();
  if (!path) {
    TILL_LOG(1, "%@: Could not determine UpdateQueue cache path", kSpeaker);
    return;
  }
  const std::size_t incompatibleCount = incompatible ? incompatible->size() : 0;
  TILL_LOG(2, "%@: Writing %lu available updates, %lu incompatible updates to cache at %@",
           kSpeaker, available.size(), incompatibleCount, *path);
  PlistDictionary cache;
  cache.emplace(kUpdatesKey, dictionariesOf(available));
  cache.emplace(kIncompatibleUpdatesKey,
                incompatible ? dictionariesOf(*incompatible) : PlistArray{});
  // A failed write leaves memory as it is; the next save writes it all.
  if (auto written = FileIO::writeInPlace(*path, PropertyListSerialization::writeBinary(cache));
      !written) {
    TILL_LOG(3, "%@: %@", kSpeaker, written.error().description);
  }
}

void UpdateQueue::save() {
  writeUpdatesToPersistedStore(*availableUpdates(), incompatibleUpdates());
}

// --- Lists ---

std::shared_ptr<const UpdateQueue::UpdateList> UpdateQueue::availableUpdates() const {
  MutexLock lock(snapshotMutex_);
  return availableUpdates_;
}

std::shared_ptr<const UpdateQueue::UpdateList> UpdateQueue::incompatibleUpdates() const {
  MutexLock lock(snapshotMutex_);
  return incompatibleUpdates_;
}

void UpdateQueue::publish(UpdateList available) {
  auto snapshot = std::make_shared<const UpdateList>(std::move(available));
  MutexLock lock(snapshotMutex_);
  availableUpdates_ = std::move(snapshot);
}

void UpdateQueue::publishIncompatible(std::shared_ptr<const UpdateList> incompatible) {
  MutexLock lock(snapshotMutex_);
  incompatibleUpdates_ = std::move(incompatible);
}

LedgerUpdateRef UpdateQueue::availableUpdateWithItemIdentifierOnQueue(
    std::uint64_t itemIdentifier) const {
  for (const LedgerUpdateRef& update : *availableUpdates()) {
    if (update->itemIdentifierValue() == itemIdentifier) return update;
  }
  return nullptr;
}

LedgerUpdateRef UpdateQueue::updateWithItemIdentifier(std::uint64_t itemIdentifier) const {
  if (auto update = availableUpdateWithItemIdentifierOnQueue(itemIdentifier)) return update;
  if (!check_->updatesBeingDownloaded) return nullptr;
  auto found = check_->updatesBeingDownloaded->find(itemIdentifier);
  return found == check_->updatesBeingDownloaded->end() ? nullptr : found->second;
}

LedgerUpdateRef UpdateQueue::availableUpdateWithItemIdentifier(std::uint64_t itemIdentifier) {
  LedgerUpdateRef update;
  dispatchQueue_->sync([&] { update = availableUpdateWithItemIdentifierOnQueue(itemIdentifier); });
  return update;
}

LedgerUpdateRef UpdateQueue::availableUpdateWithBundleIdentifier(
    std::string_view bundleIdentifier) {
  LedgerUpdateRef match;
  dispatchQueue_->sync([&] {
    for (const LedgerUpdateRef& update : *availableUpdates()) {
      if (update->bundleID() == bundleIdentifier) match = update;
    }
  });
  return match;
}

bool UpdateQueue::hasStagedUpdates() {
  bool staged = false;
  dispatchQueue_->sync([&] {
    const auto list = availableUpdates();
    staged = std::any_of(list->begin(), list->end(),
                         [](const LedgerUpdateRef& update) { return update->isStaged(); });
  });
  return staged;
}

void UpdateQueue::availableUpdatesDidChange() {
  DispatchQueue::globalQueue().async([delegate = delegate_] {
    if (auto alive = delegate.lock()) alive->availableUpdatesDidChange();
  });
}

// --- Checks ---

void UpdateQueue::checkForUpdatesWithCompletionHandler(CompletionHandler handler) {
  dispatchQueue_->barrierSync([&] {
    if (handler) check_->clients.push_back(UpdateQueueClient{std::move(handler)});
    if (check_->loadInProgress) return;
    check_->loadInProgress = true;
    auto operation = std::make_shared<LoadUpdateQueueOperation>(storeClient_, softwareMap_);
    // The handler runs while the operation finishes, so the operation it
    // names is alive; holding it strongly would make a cycle.
    operation->setCompletionHandler(
        [self = shared_from_this(), load = operation.get()](
            VendOperation& /*finished*/, bool success, const OptionalError& error) {
          self->updateCheckDidFinish(*load, success, error);
        });
    VendOperationQueue::mainQueue().addOperation(std::move(operation));
  });
}

void UpdateQueue::updateCheckDidFinish(LoadUpdateQueueOperation& operation, bool success,
                                       const OptionalError& error) {
  dispatchQueue_->barrierSync([&] {
    if (success) reconcile(operation);
    answerClients(success, error);
    check_->clients.clear();
    check_->loadInProgress = false;
  });
}

// The store's answer replaces the list, but a record the store sends again
// keeps its place and the marks this machine keeps in it.
void UpdateQueue::reconcile(LoadUpdateQueueOperation& operation) {
  const std::shared_ptr<const UpdateList> cached = availableUpdates();
  UpdateList updated = *cached;
  // Lists are walked in order and the first match wins; an index of first
  // positions gives the same answers without walking the list per record.
  std::unordered_map<std::uint64_t, std::size_t> firstPosition;
  firstPosition.reserve(updated.size());
  for (std::size_t position = 0; position < updated.size(); ++position) {
    firstPosition.try_emplace(updated[position]->itemIdentifierValue(), position);
  }
  std::unordered_set<const LedgerUpdate*> seen;
  for (const LedgerUpdateRef& fresh : operation.availableUpdates().value_or(UpdateList{})) {
    auto [found, added] = firstPosition.try_emplace(fresh->itemIdentifierValue(), updated.size());
    if (added) {
      updated.push_back(fresh);
      continue;
    }
    LedgerUpdateRef& known = updated[found->second];
    seen.insert(known.get());
    PlistDictionary merged = known->dictionary();
    for (auto& [key, value] : fresh->dictionary()) merged.insert_or_assign(key, std::move(value));
    if (auto renewed = LedgerUpdate::initWithDictionary(std::move(merged))) known = renewed;
  }
  std::unordered_set<const LedgerUpdate*> obsolete;
  for (const LedgerUpdateRef& update : *cached) {
    if (seen.contains(update.get())) continue;
    TILL_LOG(2,
             "%@: Removing obsolete update %@ because was not seen in the available updates "
             "returned by the store",
             kSpeaker, update);
    obsolete.insert(update.get());
  }
  std::erase_if(updated,
                [&](const LedgerUpdateRef& update) { return obsolete.contains(update.get()); });

  std::shared_ptr<const UpdateList> incompatible;
  if (operation.incompatibleUpdates()) {
    incompatible = std::make_shared<const UpdateList>(*operation.incompatibleUpdates());
    TILL_LOG(3, "%@: Update queue check finished returning incompatible updates: %@", kSpeaker,
             describeUpdates(*incompatible));
  }
  writeUpdatesToPersistedStore(updated, incompatible);
  TILL_LOG(3, "%@: Update queue check finished returning available updates: %@", kSpeaker,
           describeUpdates(updated));
  publish(std::move(updated));
  publishIncompatible(std::move(incompatible));
  availableUpdatesDidChange();
}

void UpdateQueue::answerClients(bool success, const OptionalError& error) {
  const UpdateList available = *availableUpdates();
  std::optional<UpdateList> incompatible;
  if (auto list = incompatibleUpdates()) incompatible = *list;
  for (UpdateQueueClient& client : check_->clients) {
    if (!client.queueCheckCompletionHandler) continue;
    DispatchQueue::globalQueue().async(
        [handler = std::move(client.queueCheckCompletionHandler), success, available, incompatible,
         error] { handler(success, available, incompatible, error); });
  }
}

// --- Downloads and marks ---

void UpdateQueue::willStartDownloadForUpdateWithIdentifier(std::uint64_t itemIdentifier) {
  dispatchQueue_->barrierSync([&] {
    if (!check_->updatesBeingDownloaded) check_->updatesBeingDownloaded.emplace();
    if (auto update = updateWithItemIdentifier(itemIdentifier)) {
      (*check_->updatesBeingDownloaded)[itemIdentifier] = std::move(update);
    }
  });
}

void UpdateQueue::didFinishDownloadForUpdateWithItemIdentifier(std::uint64_t itemIdentifier,
                                                               bool didInstall) {
  dispatchQueue_->barrierSync([&] {
    if (didInstall) {
      if (auto update = updateWithItemIdentifier(itemIdentifier)) {
        appendInstalledUpdateToJournal(update);
        bool removed = removeAvailableUpdatesWithItemIdentifier(
            itemIdentifier, "%@: Removed obsolete update %@ because the update was installed");
        if (removed) {
          save();
          availableUpdatesDidChange();
        }
      } else {
        TILL_LOG(1,
                 "%@: Failed to find queued update for item identifier %llu - journal may be "
                 "incomplete",
                 kSpeaker, itemIdentifier);
      }
    }
    if (check_->updatesBeingDownloaded) check_->updatesBeingDownloaded->erase(itemIdentifier);
  });
}

void UpdateQueue::appendInstalledUpdateToJournal(const LedgerUpdateRef& update) {
  // Called inside the queue's barrier: the journal never calls back into
  // the queue, so this cannot wait for itself.
  UpdateJournal::sharedJournal().appendInstalledUpdates({update}, {});
}

bool UpdateQueue::removeAvailableUpdatesWithItemIdentifier(std::uint64_t itemIdentifier,
                                                           std::string_view logFormat) {
  UpdateList list = *availableUpdates();
  const std::size_t removed = std::erase_if(list, [&](const LedgerUpdateRef& update) {
    if (update->itemIdentifierValue() != itemIdentifier) return false;
    TILL_LOG(2, logFormat, kSpeaker, update);
    return true;
  });
  if (removed > 0) publish(std::move(list));
  return removed > 0;
}

template <typename Change>
bool UpdateQueue::forEachAvailableUpdateWithItemIdentifier(std::uint64_t itemIdentifier,
                                                           Change&& change) {
  bool matched = false;
  for (const LedgerUpdateRef& update : *availableUpdates()) {
    if (update->itemIdentifierValue() != itemIdentifier) continue;
    change(*update);
    matched = true;
  }
  return matched;
}

void UpdateQueue::didStageUpdateForItemIdentifier(std::uint64_t itemIdentifier) {
  dispatchQueue_->barrierSync([&] {
    bool matched =
        forEachAvailableUpdateWithItemIdentifier(itemIdentifier, [](LedgerUpdate& update) {
          update.setIsStaged(true);
          TILL_LOG(2, "%@: Set itStaged=YES for update %@", kSpeaker, update);
        });
    if (matched) save();
  });
}

void UpdateQueue::didRemoveApplicationWithIdentifier(std::uint64_t itemIdentifier) {
  dispatchQueue_->barrierSync([&] {
    bool removed = removeAvailableUpdatesWithItemIdentifier(
        itemIdentifier,
        "%@: Removed obsolete update %@ because the application was removed from SoftwareMap");
    if (!removed) return;
    save();
    availableUpdatesDidChange();
  });
}

void UpdateQueue::setAutoUpdateAbortCode(std::int64_t abortCode, std::uint64_t itemIdentifier) {
  dispatchQueue_->barrierSync([&] {
    bool matched =
        forEachAvailableUpdateWithItemIdentifier(itemIdentifier, [&](LedgerUpdate& update) {
          update.setAutoUpdateAbortCode(abortCode);
          if (!update.firstAutoUpdateAttemptDate())
            update.setFirstAutoUpdateAttemptDate(PlistDate::now());
        });
    if (!matched) return;
    save();
    availableUpdatesDidChange();
  });
}

void UpdateQueue::setDidFailToAutoInstall(std::uint64_t itemIdentifier) {
  dispatchQueue_->barrierSync([&] {
    bool matched = forEachAvailableUpdateWithItemIdentifier(
        itemIdentifier, [](LedgerUpdate& update) { update.setDidFailToAutoInstall(true); });
    if (!matched) return;
    save();
    availableUpdatesDidChange();
  });
}

void UpdateQueue::setUserHasSeenAllUpdates(const UpdateList& updates,
                                           const UpdateList& /*incompatibleUpdates*/) {
  dispatchQueue_->barrierSync([&] {
    TILL_LOG(2, "%@: Setting hasBeenSeenByUser for all updates", kSpeaker);
    for (const LedgerUpdateRef& update : updates) update->setHasBeenSeenByUser(true);
    save();
  });
}

}  // namespace larder
