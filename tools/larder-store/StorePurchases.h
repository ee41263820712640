#pragma once

#include <httplib.h>

#include <cstdint>
#include <optional>
#include <string_view>

#include "larder-store/StoreCatalogue.h"
#include "larder-store/StoreReply.h"

namespace larder {

// The buy-product route: checks the request's signature, finds the item
// the purchase names and answers with its download.
//
// A request that carries a signature must carry a good one, whatever it
// buys; one without a signature may buy only an account-less item. The
// answer to a signed request is signed with the same account's key.
class StorePurchases {
 public:
  explicit StorePurchases(const StoreCatalogue& catalogue) : catalogue_(catalogue) {}

  [[nodiscard]] StoreReply buy(const httplib::Request& request, std::string_view baseURL) const;

  // The item a purchase's wire dictionary names: its "itemIdentifier", or
  // else the "itemId" (or "salableWareId") inside its "buyParams" query
  // text.
  static std::optional<std::uint64_t> itemIdentifierOf(const PlistValue& purchase);
  // The value of `key` in query text ("a=1&itemId=42"), if present.
  static std::optional<std::string_view> queryValue(std::string_view query, std::string_view key);

 private:
  const StoreCatalogue& catalogue_;
};

}  // namespace larder
