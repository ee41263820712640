#pragma once

#include <cstdint>
#include <string>

#include "platform/value/PlistValue.h"

namespace larder {

// One account of the catalogue.
struct StoreAccount {
  std::uint64_t accountID = 0;
  std::string orvaneID;  // the name a user signs in with
  std::string password;
  std::string storeFrontID;
  PlistData signingKey;
  // How purchase records name the account ("opaqueAccountIDString").
  std::string opaqueID;

  // The answer to a successful sign-in.
  [[nodiscard]] PlistDictionary toAuthenticationDictionary() const;
};

}  // namespace larder
