#include "larder-store/StoreAccount.h"

namespace larder {

PlistDictionary StoreAccount::toAuthenticationDictionary() const {
  return {{"accountID", accountID},
          {"orvaneID", orvaneID},
          {"signingKey", signingKey},
          {"storeFrontID", storeFrontID}};
}

}  // namespace larder
