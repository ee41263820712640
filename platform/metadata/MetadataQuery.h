#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/metadata/MetadataBundleIndex.h"
#include "platform/metadata/MetadataIndexWatcher.h"
#include "platform/metadata/MetadataItem.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"

namespace larder {

// The items of one update event of a live query.
struct MetadataQueryUpdate {
  std::vector<std::shared_ptr<const MetadataItem>> added;
  std::vector<std::shared_ptr<const MetadataItem>> changed;
  std::vector<std::shared_ptr<const MetadataItem>> removed;
};

// A live query over the application bundles of the whole computer: every application folder of
// the registry on every volume, volumes that appear later included. The query string is in the
// language of MetadataQueryPredicate; the attributes of a bundle are those of
// MetadataAttributes.
//
// `start` gathers the matching bundles on a thread of the query's own, then keeps them current
// with inotify. Everything the owner hears comes on the queue set with `setQueue`, in order:
//  - finished, once, when the first gathering is complete and its results are in place;
//  - update, with the items added, changed (any attribute, the path included) and removed;
//  - server port invalid, when the query can no longer follow the disk: the kernel's event
//    queue overflowed, or a folder could not be watched for lack of kernel resources. The query
//    delivers nothing more after it; the owner makes a new query, whose gathering rescans.
// Results change only on that queue, right before the event that tells of it, so a handler
// reads them as of its event. After `stop` on that queue no handler is called any more.
//
// Events of the disk are coalesced: a change is read once the bundle has been quiet for the
// quiet period, and at the latest after the longest delay from its first event. A bundle that
// turns up without a readable bundle.plist is taken to be still copying and is held back, up to
// a limit, so that a bundle copied in arrives as one "added" with its final attributes.
//
// An item stays the same object while its bundle folder does: renamed or moved between watched
// folders of one file system it is "changed" with its new path; a folder deleted or replaced,
// or moved across file systems (a copy and a delete), is "removed" and its successor "added".
// A successor at the same path is then also "changed", in a later event, once it has settled.
//
// Each bundle costs one inotify watch (fs.inotify.max_user_watches). A bundle that cannot get
// one is still followed as it comes, goes and moves, but edits of its property lists wait for
// the owner's next full scan; a folder that cannot get one makes the query invalid (see above).
//
// All attributes can be read by index with `valueOfAttribute`; the value attributes given at
// creation are kept for the owner, which reads its records through them.
//
// Handlers are plain functions rather than notifications: there is one owner per query.
class MetadataQuery : public std::enable_shared_from_this<MetadataQuery> {
 public:
  enum class SearchScope { Computer };

  struct Handlers {
    std::function<void(MetadataQuery&)> finished;
    std::function<void(MetadataQuery&, const MetadataQueryUpdate&)> updated;
    std::function<void(MetadataQuery&)> serverPortInvalid;
  };

  struct Options {
    std::chrono::milliseconds quietPeriod{50};
    std::chrono::milliseconds longestDelay{150};
    // How long a bundle without a readable bundle.plist is held back after it turns up.
    std::chrono::milliseconds settleLimit{1000};
    // Called on the query's thread before a bundle is read (tests change the disk there).
    std::function<void(const std::string& path)> beforeReadingBundle;
  };

  static std::shared_ptr<MetadataQuery> create(std::string queryString,
                                               std::vector<std::string> valueAttributes,
                                               Options options);
  static std::shared_ptr<MetadataQuery> create(std::string queryString,
                                               std::vector<std::string> valueAttributes);
  ~MetadataQuery();

  MetadataQuery(const MetadataQuery&) = delete;
  MetadataQuery& operator=(const MetadataQuery&) = delete;

  // Before `start`. Without a queue, events come on a serial queue of the query's own.
  void setQueue(std::shared_ptr<DispatchQueue> queue);
  void setSearchScope(SearchScope scope);
  void setHandlers(Handlers handlers);

  // Starts gathering and returns at once. False, and nothing will be delivered, when the query
  // string does not parse (`startError` says why), the query was started before, or the system
  // has no inotify instance or thread left to give.
  bool start();
  // Ends the query's thread; results stay as they are. Safe to call more than once, from any
  // thread but from within a handler it has no effect on events other than those not yet begun.
  void stop();

  [[nodiscard]] bool isStarted() const;
  [[nodiscard]] bool isGathering() const;
  [[nodiscard]] bool isStopped() const;
  [[nodiscard]] std::string startError() const;

  [[nodiscard]] const std::string& queryString() const { return queryString_; }
  [[nodiscard]] const std::vector<std::string>& valueAttributes() const { return valueAttributes_; }

  [[nodiscard]] std::size_t resultCount() const;
  // Null when `index` is out of range.
  [[nodiscard]] std::shared_ptr<const MetadataItem> resultAtIndex(std::size_t index) const;
  // nullopt when the item is not among the results.
  [[nodiscard]] std::optional<std::size_t> indexOfResult(const MetadataItem* item) const;
  // An absent value when `index` is out of range or the item has no such attribute.
  [[nodiscard]] PlistValue valueOfAttribute(std::string_view name, std::size_t index) const;
  // An item's attribute, the path ("kHostItemPath") among them.
  [[nodiscard]] static PlistValue attributeOfItem(const MetadataItem& item, std::string_view name);

  // Makes the query behave as on an overflow of the kernel's event queue.
  void simulateQueueOverflowForTesting();

 private:
  MetadataQuery(std::string queryString, std::vector<std::string> valueAttributes, Options options);

  void runEngine();
  void followTheDisk(bool workPending);
  void post(std::function<void(MetadataQuery&)> delivery);
  void postChanges(MetadataBundleIndex::Changes changes, bool finished);
  void postServerPortInvalid();
  void deliverChanges(const MetadataBundleIndex::Changes& changes, bool finished);
  void deliverServerPortInvalid();
  void publish(const MetadataBundleIndex::Changes& changes);
  [[nodiscard]] Handlers handlers() const;

  const std::string queryString_;
  const std::vector<std::string> valueAttributes_;
  const Options options_;

  mutable Mutex mutex_;
  std::shared_ptr<DispatchQueue> queue_ GUARDED_BY(mutex_);
  Handlers handlers_ GUARDED_BY(mutex_);
  std::string startError_ GUARDED_BY(mutex_);
  bool started_ GUARDED_BY(mutex_) = false;
  bool gathering_ GUARDED_BY(mutex_) = false;
  std::vector<std::shared_ptr<MetadataItem>> results_ GUARDED_BY(mutex_);
  std::unordered_map<const MetadataItem*, std::size_t> indexOfItem_ GUARDED_BY(mutex_);

  std::atomic<bool> stopped_{false};
  Mutex engineMutex_;
  // Owned by the engine thread while it runs.
  std::unique_ptr<MetadataIndexWatcher> watcher_;
  std::unique_ptr<MetadataBundleIndex> index_;
  std::thread engine_;
};

}  // namespace larder
