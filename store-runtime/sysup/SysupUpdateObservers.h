#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/system/Mutex.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"
#include "store-runtime/sysup/SysupStateFileWatcher.h"

namespace larder {

// The observers of the available updates: who they are, the list they heard
// last, and the watch on the state file that lets them hear other writers.
// Whoever may have changed the list calls stateMayHaveChanged; observers
// hear the list only when it differs from the one they heard last, on the
// global queue, one delivery at a time so that lists arrive in order.
class SysupUpdateObservers {
 public:
  using UpdateList = std::vector<SysupQuaymartUpdate>;
  using Observer = std::function<void(const UpdateList&)>;
  using Token = std::uint64_t;

  // `readList` reads the available updates as they are stored right now.
  explicit SysupUpdateObservers(std::function<UpdateList()> readList);
  ~SysupUpdateObservers();
  SysupUpdateObservers(const SysupUpdateObservers&) = delete;
  SysupUpdateObservers& operator=(const SysupUpdateObservers&) = delete;

  // Watches `statePath` from the first observer on (again when the path
  // moved since).
  Token add(Observer observer, const std::string& statePath);
  void remove(Token token);
  void stateMayHaveChanged();

 private:
  using ObserverList = std::vector<std::pair<Token, std::shared_ptr<Observer>>>;

  void deliverChanges();
  // The observers to tell of `current`; empty when the list is the one last told.
  ObserverList observersToTell(const UpdateList& current);
  bool isObserving(Token token);

  std::function<UpdateList()> readList_;
  Mutex mutex_;
  std::map<Token, std::shared_ptr<Observer>> observers_ GUARDED_BY(mutex_);
  Token nextToken_ GUARDED_BY(mutex_) = 1;
  std::optional<UpdateList> lastTold_ GUARDED_BY(mutex_);
  bool changePending_ GUARDED_BY(mutex_) = false;
  bool delivering_ GUARDED_BY(mutex_) = false;
  std::unique_ptr<SysupStateFileWatcher> watcher_ GUARDED_BY(mutex_);
};

}  // namespace larder
