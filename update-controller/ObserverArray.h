#pragma once

#include <algorithm>
#include <memory>
#include <vector>

#include "platform/system/Mutex.h"

namespace larder {

// A list of observers with a lock of its own. Adding twice lists an
// observer twice; removing takes off every entry that is the same observer
// (`isSameObserverAs`). Observers are called on a copy taken under the
// lock and outside it, so that one may add or remove observers from its
// callback, and a slow observer holds up nobody else's add or remove.
template <typename Observer>
class ObserverArray {
 public:
  using Reference = std::shared_ptr<Observer>;

  void add(Reference observer) {
    if (!observer) return;
    MutexLock lock(mutex_);
    observers_.push_back(std::move(observer));
  }

  void remove(const Reference& observer) {
    if (!observer) return;
    MutexLock lock(mutex_);
    std::erase_if(observers_, [&](const Reference& entry) {
      return entry == observer || entry->isSameObserverAs(*observer);
    });
  }

  [[nodiscard]] std::vector<Reference> snapshot() const {
    MutexLock lock(mutex_);
    return observers_;
  }

  template <typename Call>
  void forEach(Call&& call) const {
    for (const Reference& observer : snapshot()) call(*observer);
  }

 private:
  mutable Mutex mutex_;
  std::vector<Reference> observers_ GUARDED_BY(mutex_);
};

}  // namespace larder
