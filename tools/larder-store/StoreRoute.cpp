#include "larder-store/StoreRoute.h"

namespace larder {

std::string_view storeRouteName(StoreRoute route) {
  switch (route) {
    case StoreRoute::Bag:
      return "bag";
    case StoreRoute::Authenticate:
      return "authenticate";
    case StoreRoute::BuyProduct:
      return "buy-product";
    case StoreRoute::ItemLookup:
      return "item-lookup";
    case StoreRoute::Assets:
      return "assets";
    case StoreRoute::Preflight:
      return "preflight";
    case StoreRoute::UpdateCheck:
      return "available-software-updates";
    case StoreRoute::OrvaneIDLookup:
      return "orvane-id-lookup";
    case StoreRoute::DAAPLogin:
      return "daap-login";
    case StoreRoute::DAAPUpdate:
      return "daap-update";
    case StoreRoute::DAAPDatabases:
      return "daap-databases";
    case StoreRoute::DAAPItems:
      return "daap-items";
  }
  return "unknown";
}

std::optional<StoreRoute> storeRouteNamed(std::string_view name) {
  for (StoreRoute route : kAllStoreRoutes) {
    if (storeRouteName(route) == name) return route;
  }
  return std::nullopt;
}

}  // namespace larder
