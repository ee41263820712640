#pragma once

#include <sys/types.h>

#include <chrono>
#include <compare>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/metadata/MetadataIndexWatcher.h"
#include "platform/metadata/MetadataItem.h"
#include "platform/metadata/MetadataQueryPredicate.h"
#include "platform/metadata/MetadataSearchScope.h"
#include "platform/value/PlistValue.h"

namespace larder {

// The bundles of the search scope as one metadata query sees them, kept current from inotify
// events, and which of them match the query.
//
// A bundle is known by its folder's device and inode, so a rename or a move between watched
// folders is a change of path of the same item, while a bundle replaced by a new folder at the
// same path is one item removed and another added. Inode numbers can be reused, so a bundle
// folder whose watch reports it deleted is forgotten at once, before anything found later can
// take its place. Two paths to one folder (a symbolic link beside the bundle) are one bundle,
// at the path found first.
//
// A replacement is also told as a change once it has settled: the new item, added, comes again
// as changed in the next application of work. An owner that keeps its record across the
// replacement (an update it was warned of) ignores the removal and the addition and takes the
// new bundle's attributes from that change, as from any other. A folder counts as the
// replacement when it turns up at the path within the settle limit of the old one's going.
//
// Events only mark work: a folder to list again, a bundle to read again, or the scope to
// recompute. `applyPendingWork` does the work in one go, which is what coalesces a burst of
// events into one change per bundle. Used from one thread only.
class MetadataBundleIndex {
 public:
  using Clock = std::chrono::steady_clock;

  struct ItemChange {
    std::shared_ptr<MetadataItem> item;
    std::shared_ptr<const PlistDictionary> attributes;
  };

  struct Changes {
    std::vector<ItemChange> added;
    std::vector<ItemChange> changed;
    std::vector<std::shared_ptr<MetadataItem>> removed;
    [[nodiscard]] bool empty() const { return added.empty() && changed.empty() && removed.empty(); }
  };

  struct Options {
    // A bundle found without a readable bundle.plist is probably still being copied in; it is
    // read again, not reported, until the plist is there or this long has passed.
    std::chrono::milliseconds settleLimit{1000};
    // Called before each bundle is read, so that tests can change the disk at that moment.
    std::function<void(const std::string& path)> beforeReadingBundle;
  };

  MetadataBundleIndex(MetadataQueryPredicate predicate, MetadataIndexWatcher& watcher,
                      Options options);

  // Watches the scope and reads every bundle in it; the matching ones come as added.
  Changes gather(Clock::time_point now);

  // Notes what an event means; true when it made work pending.
  bool noteEvent(const MetadataIndexWatcher::Event& event);
  [[nodiscard]] bool hasPendingWork() const;
  Changes applyPendingWork(Clock::time_point now);

  // True when a folder of the scope could not be watched for lack of kernel resources: the
  // index would miss changes from now on.
  [[nodiscard]] bool broken() const { return broken_; }

  [[nodiscard]] std::size_t bundleCount() const { return bundles_.size(); }

 private:
  struct BundleKey {
    dev_t device = 0;
    ino_t inode = 0;
    friend auto operator<=>(const BundleKey&, const BundleKey&) = default;
  };

  struct TrackedBundle {
    std::string path;
    int watch = -1;
    Clock::time_point foundAt;
    bool deleted = false;
    // Read for good: no longer possibly half copied in.
    bool settled = false;
    bool matches = false;
    // Took the path of a matching bundle that went just before.
    bool replacesAnother = false;
    std::shared_ptr<const PlistDictionary> attributes;
    std::shared_ptr<MetadataItem> item;
  };

  struct WatchedFolder {
    MetadataSearchScope::Folder folder;
    int watch = -1;
  };

  Changes applyWork(Clock::time_point now, bool allowSettling);
  static std::optional<BundleKey> keyOfFolder(const std::string& path);
  bool isStillAt(const std::string& path, const BundleKey& key) const;

  bool noteFolderEvent(const WatchedFolder& watched, const MetadataIndexWatcher::Event& event);
  bool noteBundleEvent(const BundleKey& key, const MetadataIndexWatcher::Event& event);
  void forgetFolderWatch(int watch);

  void refreshScope();
  void watchFolder(const MetadataSearchScope::Folder& folder);
  void unwatchFolder(std::size_t index);
  void reconcileDirtyFolders(Clock::time_point now, Changes& changes);
  std::map<BundleKey, std::string> listDirtyFolders() const;
  void reconcileTrackedBundles(std::map<BundleKey, std::string>& found, Clock::time_point now,
                               Changes& changes);
  void startTracking(const BundleKey& key, const std::string& path, Clock::time_point now);
  void dropDeletedBundles(Clock::time_point now, Changes& changes);
  void dropBundle(const BundleKey& key, Clock::time_point now, Changes& changes);
  void readDirtyBundles(Clock::time_point now, bool allowSettling, Changes& changes);
  void readBundle(const BundleKey& key, Clock::time_point now, bool allowSettling,
                  Changes& changes);
  // Whether the bundle's item was added by this reading.
  bool recordReading(TrackedBundle& bundle, std::shared_ptr<const PlistDictionary> attributes,
                     Changes& changes);
  void forgetOldVacatedPaths(Clock::time_point now);
  void reportReplacementsAsChanged(const std::map<BundleKey, std::shared_ptr<MetadataItem>>& owed,
                                   Changes& changes);

  MetadataQueryPredicate predicate_;
  MetadataIndexWatcher& watcher_;
  Options options_;

  MetadataSearchScope scope_;
  std::vector<WatchedFolder> watchedFolders_;
  std::map<BundleKey, TrackedBundle> bundles_;
  std::unordered_map<int, BundleKey> bundleByWatch_;

  bool scopeChanged_ = false;
  std::set<std::string> dirtyFolders_;
  std::set<BundleKey> dirtyBundles_;
  // Paths whose matching bundle went, with when: a folder arriving there soon replaces it.
  std::map<std::string, Clock::time_point> vacatedPaths_;
  // Replacements reported added, whose "changed" is due at the next application of work.
  std::map<BundleKey, std::shared_ptr<MetadataItem>> replacementsOwingChange_;
  bool broken_ = false;
};

}  // namespace larder
