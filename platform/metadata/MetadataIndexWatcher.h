#pragma once

#include <sys/inotify.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/system/FileDescriptor.h"

namespace larder {

// The inotify instance of one metadata query, with a way to wake its waiting thread.
//
// Watches are counted: two roles may watch one folder (the same inode reached by two paths, or
// the platform root being the home folder), and the kernel gives both the same descriptor.
// Masks are added to, never replaced, for the same reason. Only the waiting thread may add,
// remove and wait; `wake` and `injectQueueOverflowForTesting` may come from any thread.
class MetadataIndexWatcher {
 public:
  struct Event {
    int watch = -1;
    std::uint32_t mask = 0;
    std::uint32_t cookie = 0;
    std::string name;
  };

  struct Batch {
    std::vector<Event> events;
    // The kernel dropped events: what is watched can no longer be trusted.
    bool overflowed = false;
    // The instance itself failed (a read error, a damaged record).
    bool failed = false;
  };

  // Folders: what is created, deleted or moved in them, and their own end.
  static constexpr std::uint32_t kFolderMask = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO |
                                               IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
  // Bundles: also files rewritten in place and changes of permission.
  static constexpr std::uint32_t kBundleMask = kFolderMask | IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB;

  MetadataIndexWatcher();
  MetadataIndexWatcher(const MetadataIndexWatcher&) = delete;
  MetadataIndexWatcher& operator=(const MetadataIndexWatcher&) = delete;

  // 0, or the errno of the instance that could not be made.
  [[nodiscard]] int initializationError() const { return initializationError_; }

  // The watch descriptor, or minus the errno of the failure.
  int addWatch(const std::string& path, std::uint32_t mask);
  void removeWatch(int watch);
  [[nodiscard]] std::size_t watchCount() const { return references_.size(); }

  // Waits until events come, `wake` is called, or the timeout passes (no timeout: without end).
  Batch waitForEvents(std::optional<std::chrono::milliseconds> timeout);
  void wake();
  // Makes the next wait report an overflow, exactly as a full kernel queue would.
  void injectQueueOverflowForTesting();

  // Splits the bytes of inotify reads into events; a record that does not fit marks the batch
  // failed. An IN_Q_OVERFLOW record marks it overflowed.
  static void decode(std::span<const std::uint8_t> bytes, Batch& batch);

 private:
  void readAvailable(Batch& batch);
  void forgetRemovedWatches(const Batch& batch);

  int initializationError_ = 0;
  FileDescriptor inotify_;
  FileDescriptor wakeEvent_;
  std::atomic<bool> overflowInjected_{false};
  std::unordered_map<int, int> references_;
};

}  // namespace larder
