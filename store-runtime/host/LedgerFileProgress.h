#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/system/Mutex.h"

namespace larder {

// A progress item published for the desktop: a file being made at a path,
// with its progress, which a file manager shows and may cancel. This
// platform has no common protocol for that, so published items are kept in
// "<root>/var/lib/larder-platform/file-progress.plist":
//
//   items  dictionary file URL -> { kind, operation, totalUnitCount,
//          completedUnitCount, cancellable, pausable, date }
//
// Another process cancels an item by setting "cancelRequested" to true in
// its entry (under the file's lock, as PlatformStateFile does); the service
// acts on it at the item's next change, which comes with every progress
// step of the work it stands for. `cancel` does the same in-process.
class LedgerFileProgress : public std::enable_shared_from_this<LedgerFileProgress> {
 public:
  struct Description {
    std::string fileURL;
    std::string kind = "file";
    std::string operation;
    std::int64_t totalUnitCount = 100;
  };

  static std::shared_ptr<LedgerFileProgress> make(Description description,
                                                  std::function<void()> cancellationHandler);
  ~LedgerFileProgress();
  LedgerFileProgress(const LedgerFileProgress&) = delete;
  LedgerFileProgress& operator=(const LedgerFileProgress&) = delete;

  // Shows the item; it stays until `unpublish` or the item's end.
  void publish();
  void unpublish();

  void setPausable(bool pausable);
  void setCancellable(bool cancellable);
  void setCompletedUnitCount(std::int64_t completed);
  // Calls the cancellation handler once, when the item is cancellable.
  void cancel();

  [[nodiscard]] const Description& description() const { return description_; }
  [[nodiscard]] std::int64_t completedUnitCount() const;
  [[nodiscard]] bool isCancelled() const;

  static std::string stateFilePath();

 private:
  struct Key {
    explicit Key() = default;
  };

 public:
  LedgerFileProgress(Key, Description description, std::function<void()> cancellationHandler);

 private:
  // Writes the entry when published; true when the file asks for a cancel.
  bool writeEntry() EXCLUDES(mutex_);

  const Description description_;
  const std::function<void()> cancellationHandler_;
  mutable Mutex mutex_;
  bool published_ GUARDED_BY(mutex_) = false;
  bool pausable_ GUARDED_BY(mutex_) = true;
  bool cancellable_ GUARDED_BY(mutex_) = true;
  bool cancelled_ GUARDED_BY(mutex_) = false;
  std::int64_t completed_ GUARDED_BY(mutex_) = 0;
};

}  // namespace larder
