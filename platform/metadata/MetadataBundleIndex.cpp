#include "platform/metadata/MetadataBundleIndex.h"

#include <sys/inotify.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <utility>

#include "platform/metadata/MetadataAttributes.h"

namespace larder {

namespace {

namespace fs = std::filesystem;

constexpr std::uint32_t kEndOfWatchedFolder =
    IN_DELETE_SELF | IN_MOVE_SELF | IN_UNMOUNT | IN_IGNORED;
constexpr std::uint32_t kEndOfBundleFolder = IN_DELETE_SELF | IN_UNMOUNT | IN_IGNORED;

std::string parentPath(const std::string& path) {
  return fs::path(path).parent_path().string();
}

std::string joined(const std::string& folder, const std::string& name) {
  return folder == "/" ? "/" + name : folder + "/" + name;
}

std::vector<std::string> sortedBundlePaths(const std::string& folder) {
  std::vector<std::string> paths;
  std::error_code code;
  fs::directory_iterator iterator(folder, code);
  if (code) return paths;
  for (fs::directory_iterator end; iterator != end; iterator.increment(code)) {
    if (code) break;
    std::string name = iterator->path().filename().string();
    if (MetadataAttributes::isBundleName(name)) paths.push_back(joined(folder, name));
  }
  std::sort(paths.begin(), paths.end());
  return paths;
}

// Without room for another watch the index cannot promise to see changes any more; any other
// failure means the folder went or cannot be read, which the next scope change sorts out.
bool isLackOfResources(int error) {
  return error == ENOSPC || error == ENOMEM;
}

bool isGone(int error) {
  return error == ENOENT || error == ENOTDIR || error == ELOOP;
}

void sortByPath(std::vector<MetadataBundleIndex::ItemChange>& changes) {
  auto pathOf = [](const MetadataBundleIndex::ItemChange& change) -> const PlistValue& {
    return (*change.attributes).at(std::string(MetadataAttributes::kPath));
  };
  std::sort(changes.begin(), changes.end(), [&](const auto& left, const auto& right) {
    return *pathOf(left).string() < *pathOf(right).string();
  });
}

}  // namespace

MetadataBundleIndex::MetadataBundleIndex(MetadataQueryPredicate predicate,
                                         MetadataIndexWatcher& watcher, Options options)
    : predicate_(std::move(predicate)), watcher_(watcher), options_(std::move(options)) {}

MetadataBundleIndex::Changes MetadataBundleIndex::gather(Clock::time_point now) {
  scopeChanged_ = true;
  return applyWork(now, /*allowSettling=*/false);
}

bool MetadataBundleIndex::hasPendingWork() const {
  return scopeChanged_ || !dirtyFolders_.empty() || !dirtyBundles_.empty() ||
         !replacementsOwingChange_.empty();
}

MetadataBundleIndex::Changes MetadataBundleIndex::applyPendingWork(Clock::time_point now) {
  return applyWork(now, /*allowSettling=*/true);
}

MetadataBundleIndex::Changes MetadataBundleIndex::applyWork(Clock::time_point now,
                                                            bool allowSettling) {
  Changes changes;
  // Owed by earlier work only: a replacement found now is told changed next time, after its added.
  const auto owed = replacementsOwingChange_;
  forgetOldVacatedPaths(now);
  dropDeletedBundles(now, changes);
  if (scopeChanged_) {
    scopeChanged_ = false;
    refreshScope();
  }
  reconcileDirtyFolders(now, changes);
  readDirtyBundles(now, allowSettling, changes);
  reportReplacementsAsChanged(owed, changes);
  sortByPath(changes.added);
  sortByPath(changes.changed);
  return changes;
}

// MARK: events

bool MetadataBundleIndex::noteEvent(const MetadataIndexWatcher::Event& event) {
  bool pending = false;
  std::vector<WatchedFolder> roles;
  for (const WatchedFolder& watched : watchedFolders_) {
    if (watched.watch == event.watch) roles.push_back(watched);
  }
  for (const WatchedFolder& watched : roles) pending |= noteFolderEvent(watched, event);
  if (auto found = bundleByWatch_.find(event.watch); found != bundleByWatch_.end()) {
    // A copy: the event may end the watch, and with it the map's entry.
    const BundleKey key = found->second;
    pending |= noteBundleEvent(key, event);
  }
  return pending;
}

bool MetadataBundleIndex::noteFolderEvent(const WatchedFolder& watched,
                                          const MetadataIndexWatcher::Event& event) {
  if (event.mask & kEndOfWatchedFolder) {
    forgetFolderWatch(watched.watch);
    return true;
  }
  if (event.name.empty()) return false;
  const MetadataSearchScope::Role role = watched.folder.role;
  bool pending = false;
  if (MetadataSearchScope::holdsBundles(role) && MetadataAttributes::isBundleName(event.name)) {
    dirtyFolders_.insert(watched.folder.path);
    pending = true;
  }
  if (MetadataSearchScope::childChangesScope(role, event.name)) {
    scopeChanged_ = true;
    pending = true;
  }
  return pending;
}

bool MetadataBundleIndex::noteBundleEvent(const BundleKey& key,
                                          const MetadataIndexWatcher::Event& event) {
  auto found = bundles_.find(key);
  if (found == bundles_.end()) return false;
  TrackedBundle& bundle = found->second;
  if (event.mask & kEndOfBundleFolder) {
    // Forgotten before anything else is looked at: a folder made next may get the same inode.
    bundle.deleted = true;
    bundleByWatch_.erase(event.watch);
    bundle.watch = -1;
    dirtyBundles_.insert(key);
    return true;
  }
  if (event.mask & IN_MOVE_SELF) {
    dirtyFolders_.insert(parentPath(bundle.path));
    return true;
  }
  if (event.name.empty() || MetadataAttributes::isSourceFileName(event.name)) {
    dirtyBundles_.insert(key);
    return true;
  }
  return false;
}

void MetadataBundleIndex::forgetFolderWatch(int watch) {
  for (std::size_t index = watchedFolders_.size(); index-- > 0;) {
    if (watchedFolders_[index].watch == watch) unwatchFolder(index);
  }
  scopeChanged_ = true;
}

// MARK: scope

void MetadataBundleIndex::refreshScope() {
  MetadataSearchScope next = MetadataSearchScope::current();
  const auto& folders = next.folders();
  for (std::size_t index = watchedFolders_.size(); index-- > 0;) {
    const auto& folder = watchedFolders_[index].folder;
    if (std::find(folders.begin(), folders.end(), folder) == folders.end()) unwatchFolder(index);
  }
  scope_ = std::move(next);
  for (const MetadataSearchScope::Folder& folder : scope_.folders()) {
    const bool watched = std::any_of(watchedFolders_.begin(), watchedFolders_.end(),
                                     [&](const WatchedFolder& w) { return w.folder == folder; });
    if (!watched) watchFolder(folder);
  }
}

void MetadataBundleIndex::watchFolder(const MetadataSearchScope::Folder& folder) {
  // Watched before it is listed, so that nothing that happens in between goes unseen.
  const int watch = watcher_.addWatch(folder.path, MetadataIndexWatcher::kFolderMask);
  if (watch < 0 && isLackOfResources(-watch)) broken_ = true;
  if (watch >= 0) watchedFolders_.push_back({folder, watch});
  if (MetadataSearchScope::holdsBundles(folder.role)) dirtyFolders_.insert(folder.path);
}

void MetadataBundleIndex::unwatchFolder(std::size_t index) {
  const WatchedFolder watched = watchedFolders_[index];
  watchedFolders_.erase(watchedFolders_.begin() + static_cast<std::ptrdiff_t>(index));
  watcher_.removeWatch(watched.watch);
  if (MetadataSearchScope::holdsBundles(watched.folder.role)) {
    dirtyFolders_.insert(watched.folder.path);
  }
}

// MARK: folders

std::optional<MetadataBundleIndex::BundleKey> MetadataBundleIndex::keyOfFolder(
    const std::string& path) {
  struct stat info {};
  if (::stat(path.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) return std::nullopt;
  return BundleKey{info.st_dev, info.st_ino};
}

bool MetadataBundleIndex::isStillAt(const std::string& path, const BundleKey& key) const {
  return keyOfFolder(path) == key && scope_.holdsBundleFolder(parentPath(path));
}

void MetadataBundleIndex::reconcileDirtyFolders(Clock::time_point now, Changes& changes) {
  if (dirtyFolders_.empty()) return;
  std::map<BundleKey, std::string> found = listDirtyFolders();
  reconcileTrackedBundles(found, now, changes);
  for (const auto& [key, path] : found) startTracking(key, path, now);
  dirtyFolders_.clear();
}

std::map<MetadataBundleIndex::BundleKey, std::string> MetadataBundleIndex::listDirtyFolders()
    const {
  std::map<BundleKey, std::string> found;
  for (const MetadataSearchScope::Folder& folder : scope_.folders()) {
    if (!MetadataSearchScope::holdsBundles(folder.role)) continue;
    if (!dirtyFolders_.contains(folder.path)) continue;
    for (const std::string& path : sortedBundlePaths(folder.path)) {
      // A folder that went since it was listed, or a link that leads nowhere, is no bundle.
      if (std::optional<BundleKey> key = keyOfFolder(path)) found.emplace(*key, path);
    }
  }
  return found;
}

void MetadataBundleIndex::reconcileTrackedBundles(std::map<BundleKey, std::string>& found,
                                                  Clock::time_point now, Changes& changes) {
  for (auto next = bundles_.begin(); next != bundles_.end();) {
    const BundleKey key = next->first;
    TrackedBundle& bundle = next->second;
    ++next;
    auto seen = found.find(key);
    if (seen != found.end()) {
      // Found at another path while the old one no longer leads to it: moved or renamed. A second
      // path to a folder still at the first is only another way to the same bundle.
      if (seen->second != bundle.path && !isStillAt(bundle.path, key)) {
        bundle.path = seen->second;
        dirtyBundles_.insert(key);
      }
      found.erase(seen);
    } else if (dirtyFolders_.contains(parentPath(bundle.path)) && !isStillAt(bundle.path, key)) {
      dropBundle(key, now, changes);
    }
  }
}

void MetadataBundleIndex::startTracking(const BundleKey& key, const std::string& path,
                                        Clock::time_point now) {
  const int watch = watcher_.addWatch(path, MetadataIndexWatcher::kBundleMask);
  if (watch < 0 && isGone(-watch)) return;
  // Any other failure leaves the bundle unwatched inside: the folder's events still show it
  // coming, going and moving, and the owner's periodic full scan catches edits of its files.
  TrackedBundle bundle;
  bundle.path = path;
  bundle.foundAt = now;
  bundle.replacesAnother = vacatedPaths_.erase(path) > 0;
  if (watch >= 0) {
    bundle.watch = watch;
    bundleByWatch_[watch] = key;
  }
  bundles_.insert_or_assign(key, std::move(bundle));
  dirtyBundles_.insert(key);
}

// Before any folder is listed: a folder listed now may already have the inode of a deleted one.
void MetadataBundleIndex::dropDeletedBundles(Clock::time_point now, Changes& changes) {
  const std::set<BundleKey> keys = dirtyBundles_;
  for (const BundleKey& key : keys) {
    auto found = bundles_.find(key);
    if (found != bundles_.end() && found->second.deleted) dropBundle(key, now, changes);
  }
}

void MetadataBundleIndex::dropBundle(const BundleKey& key, Clock::time_point now,
                                     Changes& changes) {
  auto found = bundles_.find(key);
  if (found == bundles_.end()) return;
  TrackedBundle& bundle = found->second;
  if (bundle.matches) {
    changes.removed.push_back(bundle.item);
    vacatedPaths_.insert_or_assign(bundle.path, now);
  }
  replacementsOwingChange_.erase(key);
  if (bundle.watch >= 0) {
    bundleByWatch_.erase(bundle.watch);
    watcher_.removeWatch(bundle.watch);
  }
  dirtyBundles_.erase(key);
  bundles_.erase(found);
}

// MARK: bundles

void MetadataBundleIndex::readDirtyBundles(Clock::time_point now, bool allowSettling,
                                           Changes& changes) {
  const std::set<BundleKey> keys = std::exchange(dirtyBundles_, {});
  for (const BundleKey& key : keys) readBundle(key, now, allowSettling, changes);
}

void MetadataBundleIndex::readBundle(const BundleKey& key, Clock::time_point now,
                                     bool allowSettling, Changes& changes) {
  auto found = bundles_.find(key);
  if (found == bundles_.end()) return;
  TrackedBundle& bundle = found->second;
  if (options_.beforeReadingBundle) options_.beforeReadingBundle(bundle.path);
  std::optional<MetadataAttributes::Reading> reading = MetadataAttributes::readBundle(bundle.path);
  if (!reading || keyOfFolder(bundle.path) != key) {
    // Gone or replaced since its folder was listed; listing the folder again tells where.
    dirtyFolders_.insert(parentPath(bundle.path));
    return;
  }
  const bool stillArriving = !bundle.settled && !reading->hasInformationPropertyList;
  if (allowSettling && stillArriving && now - bundle.foundAt < options_.settleLimit) {
    dirtyBundles_.insert(key);
    return;
  }
  bundle.settled = true;
  const bool added = recordReading(
      bundle, std::make_shared<const PlistDictionary>(std::move(reading->attributes)), changes);
  if (added && std::exchange(bundle.replacesAnother, false)) {
    replacementsOwingChange_.insert_or_assign(key, bundle.item);
  }
}

bool MetadataBundleIndex::recordReading(TrackedBundle& bundle,
                                        std::shared_ptr<const PlistDictionary> attributes,
                                        Changes& changes) {
  const bool matches = predicate_.matches(*attributes);
  const bool added = matches && !bundle.matches;
  if (added) {
    if (!bundle.item) bundle.item = std::make_shared<MetadataItem>(MetadataItem::Access{});
    changes.added.push_back({bundle.item, attributes});
  } else if (!matches && bundle.matches) {
    changes.removed.push_back(bundle.item);
  } else if (matches && *attributes != *bundle.attributes) {
    changes.changed.push_back({bundle.item, attributes});
  }
  bundle.matches = matches;
  bundle.attributes = std::move(attributes);
  return added;
}

// MARK: replacements

void MetadataBundleIndex::forgetOldVacatedPaths(Clock::time_point now) {
  std::erase_if(vacatedPaths_,
                [&](const auto& entry) { return now - entry.second > options_.settleLimit; });
}

// A replacement's item is told changed even when a reading found nothing new since its added:
// the change is the replacement itself. One already told changed by this work is not told twice.
void MetadataBundleIndex::reportReplacementsAsChanged(
    const std::map<BundleKey, std::shared_ptr<MetadataItem>>& owed, Changes& changes) {
  for (const auto& entry : owed) {
    const BundleKey& key = entry.first;
    const std::shared_ptr<MetadataItem>& item = entry.second;
    auto due = replacementsOwingChange_.find(key);
    if (due == replacementsOwingChange_.end() || due->second != item) continue;
    replacementsOwingChange_.erase(due);
    auto found = bundles_.find(key);
    if (found == bundles_.end() || !found->second.matches || found->second.item != item) continue;
    const bool toldAlready =
        std::any_of(changes.changed.begin(), changes.changed.end(),
                    [&](const ItemChange& change) { return change.item == item; });
    if (!toldAlready) changes.changed.push_back({item, found->second.attributes});
  }
}

}  // namespace larder
