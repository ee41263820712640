#pragma once

#include <array>
#include <optional>
#include <string_view>

namespace larder {

// The routes of the store that tests count and inject faults into. Their
// names are the ones docs/store.md uses.
enum class StoreRoute {
  Bag,
  Authenticate,
  BuyProduct,
  ItemLookup,
  Assets,
  Preflight,
  UpdateCheck,
  OrvaneIDLookup,
  DAAPLogin,
  DAAPUpdate,
  DAAPDatabases,
  DAAPItems,
};

inline constexpr std::array<StoreRoute, 12> kAllStoreRoutes{
    StoreRoute::Bag,         StoreRoute::Authenticate,   StoreRoute::BuyProduct,
    StoreRoute::ItemLookup,  StoreRoute::Assets,         StoreRoute::Preflight,
    StoreRoute::UpdateCheck, StoreRoute::OrvaneIDLookup, StoreRoute::DAAPLogin,
    StoreRoute::DAAPUpdate,  StoreRoute::DAAPDatabases,  StoreRoute::DAAPItems,
};

std::string_view storeRouteName(StoreRoute route);
std::optional<StoreRoute> storeRouteNamed(std::string_view name);

}  // namespace larder
