#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/error/VendError.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/core/VendRuntimeConfiguration.h"

namespace larder {

// Told after every fetch of the bag type it was added for.
class VendURLBagObserver {
 public:
  virtual ~VendURLBagObserver() = default;
  virtual void urlBagDidUpdateWithSuccess(bool success, const OptionalError& error) = 0;
};

// The store's URL bag: a dictionary of request URLs and settings, fetched
// from the bag URL and kept per bag type. A bag is fetched on first use
// and again when it has expired (after its "ttl" seconds, default one
// hour); one fetch per type runs at a time and callers that arrive during
// it share its result.
class VendURLBag {
 public:
  struct LoadResult {
    bool success = false;
    // A fetch took place (rather than the cached bag being used).
    bool loaded = false;
    OptionalError error;
  };

  explicit VendURLBag(VendRuntimeConfiguration configuration);

  LoadResult load(std::int64_t bagType, bool force = false);
  // Null when the bag cannot be had or lacks the key.
  PlistValue valueForKey(std::int64_t bagType, std::string_view key);
  // The absolute URL under the key, or an error (code 30 when the key is
  // missing).
  std::optional<std::string> urlForKey(std::int64_t bagType, std::string_view key,
                                       OptionalError* error);
  bool isValid(std::int64_t bagType);
  // The regular expression under the key matches the whole text.
  bool regexWithKeyMatchesString(std::int64_t bagType, std::string_view key, std::string_view text);

  // Fetches of other bag types are none of the observer's business: a
  // session kept against one bag must not restart whenever another is
  // refreshed.
  void addObserver(std::int64_t bagType, const std::shared_ptr<VendURLBagObserver>& observer);
  // Removes the observer from every bag type it was added for.
  void removeObserver(const std::shared_ptr<VendURLBagObserver>& observer);

  // The URL the bag of a type is fetched from.
  [[nodiscard]] std::string bagURLForType(std::int64_t bagType) const;

 private:
  struct Entry {
    Mutex fetchMutex;  // one fetch at a time for this type
    // Immutable once fetched, so a lookup shares it instead of copying.
    std::shared_ptr<const PlistDictionary> bag;
    std::chrono::steady_clock::time_point expiry;
  };

  Entry& entryForType(std::int64_t bagType);
  LoadResult fetch(std::int64_t bagType, Entry& entry);
  std::shared_ptr<const PlistDictionary> cachedBag(std::int64_t bagType, bool loadIfNeeded);
  void notifyObservers(std::int64_t bagType, const LoadResult& result);

  VendRuntimeConfiguration configuration_;
  Mutex mutex_;  // entries_ and the cached bags
  std::map<std::int64_t, std::unique_ptr<Entry>> entries_ GUARDED_BY(mutex_);
  Mutex observersMutex_;
  std::vector<std::pair<std::int64_t, std::shared_ptr<VendURLBagObserver>>> observers_
      GUARDED_BY(observersMutex_);
};

}  // namespace larder
