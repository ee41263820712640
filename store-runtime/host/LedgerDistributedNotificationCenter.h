#pragma once

#include <functional>
#include <string>
#include <string_view>

#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"

namespace larder {

// Notifications that any process of the session may listen to (the store
// application's badge). The service carries them as a D-Bus signal of its
// object; it gives the center its way of sending once the bus is up. Before
// that, and in processes without a bus, a notification is logged and goes
// nowhere: there is nobody to tell.
class LedgerDistributedNotificationCenter {
 public:
  using Poster = std::function<void(const std::string& name, const std::string& object,
                                    const PlistDictionary& userInfo)>;

  static LedgerDistributedNotificationCenter& defaultCenter();

  // Delivered at once, on the calling thread.
  void postNotificationName(std::string_view name, std::string_view object,
                            const PlistDictionary& userInfo);
  void setPoster(Poster poster);

 private:
  LedgerDistributedNotificationCenter() = default;
  mutable Mutex mutex_;
  Poster poster_ GUARDED_BY(mutex_);
};

}  // namespace larder
