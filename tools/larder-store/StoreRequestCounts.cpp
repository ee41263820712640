#include "larder-store/StoreRequestCounts.h"

#include <string>

namespace larder {

PlistDictionary StoreRequestCounts::toDictionary() const {
  PlistDictionary counts;
  for (StoreRoute route : kAllStoreRoutes) {
    counts.emplace(std::string(storeRouteName(route)), countFor(route));
  }
  return counts;
}

}  // namespace larder
