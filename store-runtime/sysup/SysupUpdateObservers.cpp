#include "store-runtime/sysup/SysupUpdateObservers.h"

#include "platform/dispatch/DispatchQueue.h"

namespace larder {

SysupUpdateObservers::SysupUpdateObservers(std::function<UpdateList()> readList)
    : readList_(std::move(readList)) {}

SysupUpdateObservers::~SysupUpdateObservers() {
  // Destroyed after the lock is let go: its thread may be waiting for it.
  std::unique_ptr<SysupStateFileWatcher> retired;
  MutexLock lock(mutex_);
  retired = std::move(watcher_);
}

SysupUpdateObservers::Token SysupUpdateObservers::add(Observer observer,
                                                      const std::string& statePath) {
  UpdateList current = readList_();
  std::unique_ptr<SysupStateFileWatcher> retired;
  Token token = 0;
  {
    MutexLock lock(mutex_);
    token = nextToken_++;
    if (observers_.empty()) lastTold_ = std::move(current);
    observers_.emplace(token, std::make_shared<Observer>(std::move(observer)));
    if (!watcher_ || watcher_->filePath() != statePath) {
      retired = std::move(watcher_);
      watcher_ =
          std::make_unique<SysupStateFileWatcher>(statePath, [this] { stateMayHaveChanged(); });
    }
  }
  // A change between the read above and the watch would go unheard
  // otherwise; an unchanged list is not told.
  stateMayHaveChanged();
  return token;
}

void SysupUpdateObservers::remove(Token token) {
  std::unique_ptr<SysupStateFileWatcher> retired;
  MutexLock lock(mutex_);
  observers_.erase(token);
  if (observers_.empty()) {
    retired = std::move(watcher_);
    lastTold_.reset();
  }
}

void SysupUpdateObservers::stateMayHaveChanged() {
  {
    MutexLock lock(mutex_);
    changePending_ = true;
    if (delivering_ || observers_.empty()) return;
    delivering_ = true;
  }
  DispatchQueue::globalQueue().async([this] { deliverChanges(); });
}

void SysupUpdateObservers::deliverChanges() {
  while (true) {
    {
      MutexLock lock(mutex_);
      if (!changePending_ || observers_.empty()) {
        delivering_ = false;
        return;
      }
      changePending_ = false;
    }
    const UpdateList current = readList_();
    for (const auto& [token, observer] : observersToTell(current)) {
      // An earlier observer of this round may have removed this one.
      if (isObserving(token)) (*observer)(current);
    }
  }
}

SysupUpdateObservers::ObserverList SysupUpdateObservers::observersToTell(
    const UpdateList& current) {
  MutexLock lock(mutex_);
  if (lastTold_ == current) return {};
  lastTold_ = current;
  return {observers_.begin(), observers_.end()};
}

bool SysupUpdateObservers::isObserving(Token token) {
  MutexLock lock(mutex_);
  return observers_.contains(token);
}

}  // namespace larder
