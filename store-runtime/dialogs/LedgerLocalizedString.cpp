#include "store-runtime/dialogs/LedgerLocalizedString.h"

#include "store-runtime/core/VendStoreClient.h"

namespace larder {

std::string LedgerLocalizedStringFromTableInBundle(std::string_view key,
                                                   std::optional<std::string_view> table,
                                                   const LocalizedStringBundle& bundle,
                                                   std::string_view defaultValue,
                                                   const VendStoreClient* storeClient) {
  std::optional<std::int64_t> clientType;
  if (storeClient) clientType = storeClient->clientType();
  if (std::optional<std::string> text = bundle.textForKey(key, table, clientType)) return *text;
  return std::string(defaultValue.empty() ? key : defaultValue);
}

std::string LedgerLocalizedString(std::string_view key, const VendStoreClient* storeClient) {
  return LedgerLocalizedStringFromTableInBundle(
      key, std::nullopt, LocalizedStringBundle::tradelineFramework(), "", storeClient);
}

}  // namespace larder
