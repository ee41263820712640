#include "store-runtime/host/LedgerDistributedNotificationCenter.h"

#include "platform/log/TillLogManager.h"

namespace larder {

LedgerDistributedNotificationCenter& LedgerDistributedNotificationCenter::defaultCenter() {
  static LedgerDistributedNotificationCenter center;
  return center;
}

void LedgerDistributedNotificationCenter::postNotificationName(std::string_view name,
                                                               std::string_view object,
                                                               const PlistDictionary& userInfo) {
  Poster poster;
  {
    MutexLock lock(mutex_);
    poster = poster_;
  }
  if (!poster) {
    TILL_LOG(3, "%@: %@ %@ not delivered: no bus", "LedgerDistributedNotificationCenter", name,
             object);
    return;
  }
  poster(std::string(name), std::string(object), userInfo);
}

void LedgerDistributedNotificationCenter::setPoster(Poster poster) {
  MutexLock lock(mutex_);
  poster_ = std::move(poster);
}

}  // namespace larder
