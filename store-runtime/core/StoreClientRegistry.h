#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/system/Mutex.h"
#include "store-runtime/core/VendStoreClient.h"

namespace larder {

// The per-client registries of the process: one object per store client
// identifier, made on first use with the client that asked, kept until the
// process ends. Two connections that present the same identifier share the
// object. The lock guards the dictionary for the span of lookup and
// creation; creation runs under it.
template <typename Object>
class StoreClientRegistry {
 public:
  // nullptr for a client without identifier.
  std::shared_ptr<Object> objectForStoreClient(const VendStoreClient* storeClient) {
    return objectForStoreClient(storeClient, [](const VendStoreClient& client) {
      return std::make_shared<Object>(client);
    });
  }

  // The same, for objects that need more than the client to be made.
  template <typename Factory>
  std::shared_ptr<Object> objectForStoreClient(const VendStoreClient* storeClient, Factory&& make) {
    if (!storeClient || storeClient->identifier().empty()) return nullptr;
    MutexLock lock(mutex_);
    auto found = objects_.find(storeClient->identifier());
    if (found != objects_.end()) return found->second;
    std::shared_ptr<Object> object = make(*storeClient);
    objects_.emplace(storeClient->identifier(), object);
    return object;
  }

  // Calls `visit` with every object, outside the lock, so that it may use
  // the registry.
  template <typename Visitor>
  void forEach(Visitor&& visit) const {
    std::vector<std::shared_ptr<Object>> objects;
    {
      MutexLock lock(mutex_);
      for (const auto& entry : objects_) objects.push_back(entry.second);
    }
    for (const auto& object : objects) visit(*object);
  }

  [[nodiscard]] std::size_t size() const {
    MutexLock lock(mutex_);
    return objects_.size();
  }

 private:
  mutable Mutex mutex_;
  std::map<std::string, std::shared_ptr<Object>, std::less<>> objects_ GUARDED_BY(mutex_);
};

}  // namespace larder
