#pragma once

#include <array>
#include <atomic>
#include <cstdint>

#include "larder-store/StoreRoute.h"
#include "platform/value/PlistValue.h"

namespace larder {

// How many requests reached each route since the server started, faulted
// ones included. Tests read them to tell whether a client asked at all.
class StoreRequestCounts {
 public:
  void count(StoreRoute route) { counts_[index(route)].fetch_add(1, std::memory_order_relaxed); }
  [[nodiscard]] std::uint64_t countFor(StoreRoute route) const {
    return counts_[index(route)].load(std::memory_order_relaxed);
  }
  // { <route name>: count } for every route, zeros included.
  [[nodiscard]] PlistDictionary toDictionary() const;

 private:
  static std::size_t index(StoreRoute route) { return static_cast<std::size_t>(route); }

  std::array<std::atomic<std::uint64_t>, kAllStoreRoutes.size()> counts_{};
};

}  // namespace larder
