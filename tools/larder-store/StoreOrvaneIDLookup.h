#pragma once

#include <httplib.h>

#include "larder-store/StoreCatalogue.h"
#include "larder-store/StoreReply.h"

namespace larder {

// The account lookup route: `GET ...?ware-id=<id>&account=<opaque id>`
// names the account that a purchase record points at by its opaque id,
// and the answer gives that account's name and id:
// { orvaneID, accountID }. The answer is not signed: the lookup is made
// for software whose owner may not be signed in at all.
class StoreOrvaneIDLookup {
 public:
  explicit StoreOrvaneIDLookup(const StoreCatalogue& catalogue) : catalogue_(catalogue) {}

  [[nodiscard]] StoreReply answer(const httplib::Request& request) const;

 private:
  const StoreCatalogue& catalogue_;
};

}  // namespace larder
