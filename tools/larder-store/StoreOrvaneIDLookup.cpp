#include "larder-store/StoreOrvaneIDLookup.h"

#include "larder-store/StoreAnswers.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/core/VendStringHelpers.h"

namespace larder {

StoreReply StoreOrvaneIDLookup::answer(const httplib::Request& request) const {
  const std::string account = request.get_param_value("account");
  if (account.empty() || !unsignedDecimalNumber(request.get_param_value("ware-id"))) {
    return {400, StoreAnswers::failure("invalid-request", "The lookup names no item and account."),
            std::nullopt};
  }
  const StoreAccount* owner = catalogue_.accounts().accountWithOpaqueID(account);
  if (!owner) {
    TILL_LOG(2, "%@: no account has the opaque id %@", "StoreOrvaneIDLookup", account);
    return {404, StoreAnswers::failure("unknown-account", "No account owns this purchase."),
            std::nullopt};
  }
  return {200, PlistDictionary{{"orvaneID", owner->orvaneID}, {"accountID", owner->accountID}},
          std::nullopt};
}

}  // namespace larder
