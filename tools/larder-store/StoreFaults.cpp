#include "larder-store/StoreFaults.h"

#include <array>
#include <utility>

namespace larder {
namespace {

constexpr std::array<std::pair<StoreFaults::Kind, std::string_view>, 11> kKindNames{{
    {StoreFaults::Kind::ServerError, "500"},
    {StoreFaults::Kind::Stall, "stall"},
    {StoreFaults::Kind::Slow, "slow"},
    {StoreFaults::Kind::NotPlist, "not-plist"},
    {StoreFaults::Kind::WrongShape, "wrong-shape"},
    {StoreFaults::Kind::Truncate, "truncate"},
    {StoreFaults::Kind::Corrupt, "corrupt"},
    {StoreFaults::Kind::Trickle, "trickle"},
    {StoreFaults::Kind::WithDownloads, "with-downloads"},
    {StoreFaults::Kind::OtherItem, "other-item"},
    {StoreFaults::Kind::RedirectHost, "redirect-host"},
}};

}  // namespace

std::string_view StoreFaults::kindName(Kind kind) {
  for (const auto& [candidate, name] : kKindNames) {
    if (candidate == kind) return name;
  }
  return "unknown";
}

std::optional<StoreFaults::Kind> StoreFaults::kindNamed(std::string_view name) {
  for (const auto& [kind, candidate] : kKindNames) {
    if (candidate == name) return kind;
  }
  return std::nullopt;
}

Result<StoreFaults> StoreFaults::parse(const std::vector<std::string>& faultTexts) {
  const auto refused = [](std::string why) {
    return VendError::withDomain(std::string(kErrorDomain), 1, std::move(why));
  };
  StoreFaults faults;
  for (const std::string& faultText : faultTexts) {
    const auto equals = faultText.find('=');
    const auto route = storeRouteNamed(std::string_view(faultText).substr(0, equals));
    const auto kind = equals == std::string::npos
                          ? std::nullopt
                          : kindNamed(std::string_view(faultText).substr(equals + 1));
    if (!route || !kind) {
      return refused("fault \"" + faultText + "\" is not ROUTE=KIND with a known route and kind");
    }
    if (const auto only = onlyRouteOf(*kind); only && *route != *only) {
      return refused("fault \"" + faultText + "\" applies only to the " +
                     std::string(storeRouteName(*only)) + " route");
    }
    faults.faults_[*route] = *kind;
  }
  return faults;
}

std::optional<StoreRoute> StoreFaults::onlyRouteOf(Kind kind) {
  switch (kind) {
    case Kind::Truncate:
    case Kind::Corrupt:
    case Kind::Trickle:
      return StoreRoute::Assets;
    case Kind::WithDownloads:
      return StoreRoute::Authenticate;
    case Kind::OtherItem:
      return StoreRoute::BuyProduct;
    default:
      return std::nullopt;
  }
}

std::optional<StoreFaults::Kind> StoreFaults::faultFor(StoreRoute route) const {
  const auto found = faults_.find(route);
  if (found == faults_.end()) return std::nullopt;
  return found->second;
}

}  // namespace larder
