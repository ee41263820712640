#pragma once

#include <httplib.h>

#include "larder-store/StoreAccount.h"
#include "larder-store/StoreAccounts.h"

namespace larder {

// Whether a request carries a good signature of a known account: the
// HMAC of docs/store.md, over the request target exactly as sent.
class StoreRequestSignature {
 public:
  enum class Outcome { Absent, Invalid, Valid };

  struct Check {
    Outcome outcome = Outcome::Absent;
    // The account that signed, when the outcome is Valid.
    const StoreAccount* signer = nullptr;
  };

  static Check check(const httplib::Request& request, const StoreAccounts& accounts);
};

}  // namespace larder
